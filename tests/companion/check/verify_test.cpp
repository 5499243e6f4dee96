#include "check/check.h"
#include "findings.h"
#include "unit/standin.h"

#include <sstream>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

using testing::HasSubstr;

namespace
{

/// A unit after an update that installed package 1.3.0 and board 2.2.0.
class Verify : public testing::Test
{
protected:
    Verify()
    {
        unit.replaceTool("dpkg", "exit 0");
        unit.replaceTool("journalctl", "exec /bin/cat '" GOLDEN_LOG_FOLDER "/package-and-board.log'");
        unit.set("BOARD_INSTALLED", "2.2.0");
        installed("1.3.0");
    }

    void installed(const std::string& version) const
    {
        unit.replaceTool("dpkg-query",
                         "case $2 in *Version*) printf " + version + R"(;; *Conffiles*) echo; echo ' /etc/a.conf 0';;
            *Status-Abbrev*) printf 'ii \tsolvik4-rh\n';; *) [ "$3" = solvik4-rh ] && printf installed;; esac)");
    }

    std::string record() const
    {
        std::ostringstream out;
        runVerify({false, true}, unit.site(), out);
        return out.str();
    }

    StandInUnit unit;
};

} // namespace

TEST_F(Verify, UnitAsTheRunLeftItIsWell)
{
    EXPECT_EQ(record(), "verify: the unit is well\n");
    std::ostringstream out;
    EXPECT_EQ(runVerify({}, unit.site(), out), Report::STATUS_FIT);
    EXPECT_THAT(out.str(), HasSubstr("The unit is well.\n"));
}

TEST_F(Verify, BoardThatKeptItsOldVersionIsFound)
{
    unit.set("BOARD_INSTALLED", "2.1.0");
    EXPECT_EQ(record(), "verify: the unit is not well: board-version-old\n");
}

TEST_F(Verify, PackageThatKeptItsOldVersionIsFound)
{
    installed("1.2.0");
    EXPECT_EQ(record(), "verify: the unit is not well: package-version\n");
}

TEST_F(Verify, DamagedFilesAreFoundButChangedConfigurationIsNot)
{
    unit.replaceTool("dpkg", "echo '??5?????? c /etc/a.conf'; exit 1");
    EXPECT_EQ(record(), "verify: the unit is well\n");
    unit.replaceTool("dpkg", "echo '??5??????   /usr/bin/harl'; echo 'missing     /usr/lib/x'; exit 1");
    EXPECT_EQ(record(), "verify: the unit is not well: package-files\n");
}

TEST_F(Verify, UnfinishedInstallationIsFound)
{
    unit.put("var/lib/dpkg/updates/0001", "");
    EXPECT_EQ(record(), "verify: the unit is not well: package-half-configured\n");
}

TEST_F(Verify, KeptConfigurationIsAWarning)
{
    unit.put("etc/a.conf.dpkg-dist", "");
    std::ostringstream out;
    EXPECT_EQ(runVerify({true, false}, unit.site(), out), Report::STATUS_FIT);
    EXPECT_EQ(nlohmann::json::parse(out.str())["findings"][0]["check"], "configuration-kept");
}

TEST_F(Verify, ApplicationThatDoesNotRunIsFound)
{
    unit.replaceTool("systemctl", R"(printf 'Id=harl.service\nLoadState=loaded\nActiveState=failed\n\n')");
    EXPECT_EQ(record(), "verify: the unit is not well: application\n");
}

TEST_F(Verify, WithoutAJournalWhatWasToBeInstalledIsOpen)
{
    unit.replaceTool("journalctl", "exit 0");
    EXPECT_EQ(record(), "verify: not everything could be checked: last-run\n");
}

TEST(Check, TellsWhatWouldHappen)
{
    const StandInUnit unit;
    const TestFolder stick;
    stick.makeFolder("debs/QUORB/armhf/quorb2.2.0");
    std::ostringstream out;
    std::ostringstream errors;
    EXPECT_EQ(runCheck(stick.path(), true, unit.site(), out, errors), Report::STATUS_NOT_FIT); // no files to upload
    const nlohmann::json facts = nlohmann::json::parse(out.str())["facts"];
    EXPECT_EQ(facts["package_plan"], "1.2.0 -> 1.3.0, would be installed as of the last refresh");
    EXPECT_EQ(facts["board_plan"], "2.1.0 -> 2.2.0, would be installed");
    EXPECT_EQ(facts["shortest_s"], 780 + 30 + 10);
}

TEST(Check, OnAnotherMachineTheUnitIsOpen)
{
    const StandInUnit unit;
    unit.replaceTool("systemctl", "exit 1");
    const TestFolder stick;
    stick.makeFolder("debs/QUORB/armhf");
    std::ostringstream out;
    std::ostringstream errors;
    runCheck(stick.path(), true, unit.site(), out, errors);
    EXPECT_THAT(out.str(), HasSubstr("\"not-a-unit\""));
    EXPECT_THAT(unit.calls(), testing::Not(testing::Contains(testing::StartsWith("ssh"))));
    EXPECT_EQ(runCheck(stick.path("nowhere"), false, unit.site(), out, errors), Report::STATUS_UNCHECKED);
}
