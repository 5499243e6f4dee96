/// What the service around the updater says, in logs of runs.

#include "golden_logs.h"
#include "log/catalogue.h"
#include "log/run.h"
#include "log/text.h"

#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

using testing::Contains;
using testing::ElementsAre;

namespace
{

struct Said
{
    std::string meaning;
    std::string failure;
    Lines besides;
    bool wentWell = false;
};

std::vector<Said> saidOf(const std::string& log)
{
    std::vector<Said> list;
    readRuns(log, [&](const Run& run) {
        Said said = {operatorView(run).meaning, run.failure ? run.failure->failure->name : "", {}, wentWell(run)};
        for (const Problem& problem : run.besides) {
            said.besides.emplace_back(problem.failure->name);
        }
        list.push_back(said);
    });
    return list;
}

const std::string updated = content("package-and-board.log");

} // namespace

TEST(LogOfService, UnitThatIsNotWellAfterAPassIsNoSuccess)
{
    const Said said = saidOf(updated + "verify: the unit is not well: board-version-old\n").at(0);
    EXPECT_EQ(said.meaning, "PASSED: updated, but the unit is not well: board-version-old");
    EXPECT_FALSE(said.wentWell);
    EXPECT_THAT(said.besides, ElementsAre("unit-not-well"));
    EXPECT_TRUE(saidOf(updated + "verify: the unit is well\n").at(0).wentWell);
    const Said open = saidOf(updated + "verify: not everything could be checked: last-run\n").at(0);
    EXPECT_TRUE(open.wentWell);
    EXPECT_THAT(open.besides, ElementsAre("unit-not-verified"));
}

TEST(LogOfService, RunThatWasNotAllowedToBeginIsARun)
{
    const std::vector<Said> said =
        saidOf(updated +
               "prepare: an installation was broken off: solvik4-rh \n"
               "prepare: solvik4-rh cannot be finished and no other version of it is offered: the updater is not run\n"
               "give-back: the updater ended (Result=exit-code) before it had an outcome: showing the failure\n");
    ASSERT_EQ(said.size(), 2U);
    EXPECT_TRUE(said[0].wentWell);
    EXPECT_EQ(said[1].meaning, "NOT RUN: the service did not let the updater begin");
    EXPECT_EQ(said[1].failure, "run-not-allowed");
    EXPECT_FALSE(said[1].wentWell);
}

TEST(LogOfService, RepairBeforeTheRunBelongsToIt)
{
    const std::vector<Said> said = saidOf(
        updated + "prepare: an installation was broken off: solvik4-rh \nprepare: the installation is finished\n" +
        updated);
    ASSERT_EQ(said.size(), 2U);
    EXPECT_THAT(said[0].besides, ElementsAre());
    EXPECT_THAT(said[1].besides, ElementsAre("installation-repaired"));
}

TEST(LogOfService, CommandThatWasEndedIsNamedAtItsStep)
{
    std::string log = content("mirrors-fail.log");
    log.insert(log.find("Updater |", log.find("Running command: apt update")),
               "hand-over: apt update: no end within 600 s; ended\n");
    EXPECT_THAT(saidOf(log).at(0).besides, Contains("time-used-up"));
}

TEST(LogOfService, OutcomeThatWasShownAgainIsNamed)
{
    EXPECT_THAT(saidOf(updated + "give-back: the outcome was not shown, or not all of it: showing it\n").at(0).besides,
                ElementsAre("outcome-shown-again"));
    EXPECT_FALSE(saidOf(updated + "give-back: harl cannot be started\n").at(0).wentWell);
}
