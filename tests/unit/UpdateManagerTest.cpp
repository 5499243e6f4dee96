#include "UnitTest.h"

#include <algorithm>
#include <atomic>
#include <csignal>
#include <cstddef>
#include <cstdlib>
#include <iostream>
#include <tuple>

namespace
{

/// True once an entry of the journal is `text`.
bool noted(const std::string& text)
{
    const Lines lines = journal();
    return std::find(lines.begin(), lines.end(), text) != lines.end();
}

class Manager : public UnitTest
{
protected:
    void SetUp() override { registerCallbacks(); }

    /// The thread whose record is the first of the function `function`.
    static std::string threadOf(const std::string& function)
    {
        for (const platform::Record& record : platform::records()) {
            if (record.function == function) {
                return record.thread;
            }
        }
        ADD_FAILURE() << "no record of " << function;
        return "";
    }

    UpdateManager* const manager = UpdateManager::instance();
};

const Lines entry = {"log:"};

/// An answer of a command that does not end, with `code`, before `goOn` is true.
platform::Answer heldUntil(const std::atomic<bool>& goOn, int code = 0)
{
    return {code * 256, "", true, [&goOn] { platform::waitFor([&goOn] { return goOn.load(); }); }};
}

TEST_F(Manager, IsOneObject)
{
    EXPECT_EQ(UpdateManager::instance(), manager);
    EXPECT_NE(manager, nullptr);
}

TEST_F(Manager, ReportsHaveTheirNumbers)
{
    EXPECT_EQ((Lines{std::to_string(UpdateManager::RESULT_NO_UPDATE), std::to_string(UpdateManager::RESULT_UPDATED)}),
              (Lines{"0", "1"}));
    EXPECT_EQ(
        (Lines{std::to_string(UpdateManager::ERROR_CHECK_UPDATE), std::to_string(UpdateManager::ERROR_UPDATE_MIRRORS),
               std::to_string(UpdateManager::ERROR_INSTALL_PACKAGE), std::to_string(UpdateManager::ERROR_INSTALL_QUORB),
               std::to_string(UpdateManager::ERROR_INSTALL_TEAMVIEWER)}),
        (Lines{"0", "1", "2", "3", "4"}));
    EXPECT_EQ((Lines{std::to_string(UpdateManager::COMPONENT_PACKAGE), std::to_string(UpdateManager::COMPONENT_QUORB),
                     std::to_string(UpdateManager::COMPONENT_TEAMVIEWER)}),
              (Lines{"0", "1", "2"}));
}

TEST_F(Manager, RemoteHeadRunsOnTheCallersThread)
{
    scriptPackage(policyCommand, "1.2.0", "1.2.0");
    scriptBoard("2.1.0", "2.1.0");
    // Synchronous: the journal of this thread is the whole journal as soon as each call has returned.
    manager->init(true);
    EXPECT_EQ(journal(), joined({entry, harlStopped()}));

    platform::reset();
    scriptPackage(policyCommand, "1.2.0", "1.2.0");
    scriptBoard("2.1.0", "2.1.0");
    manager->update({{UpdateManager::COMPONENT_TEAMVIEWER, "TV", "1", "2"}}, true); // the list is ignored
    EXPECT_EQ(journal(), joined({entry,
                                 entry,
                                 mirrorsOk(),
                                 packageChecked(policyCommand, "1.2.0", "1.2.0"),
                                 boardChecked("2.1.0", "2.1.0"),
                                 {"result:0"}}));

    platform::reset();
    manager->deinit(true);
    EXPECT_EQ(
        journal(),
        joined({entry,
                {"log:", "log:Giving users 30 Secs to view Pass/Fail LED status before completing update", "sleep:30"},
                harlStarted()}));
    EXPECT_EQ(journal(std::this_thread::get_id()), journal());
}

std::vector<UpdateManager::UpdateComponent> offered;

void keepOffer(std::vector<UpdateManager::UpdateComponent> components)
{
    offered = components;
    noteUpdateFound(components); // what the test waits for
}

TEST_F(Manager, MainHeadChecksInstallsWhatItOfferedAndClosesOnWorkerThreads)
{
    manager->setCallbacks(noteResult, noteError, keepOffer);
    platform::reset();
    scriptPackage("apt-cache policy solvik4-dh", "1.2.0", "1.3.0");
    scriptBoard("2.1.0", "2.1.0");
    script(teamViewerCheckCommand, {exits(0, std::string(teamViewerMarker) + "\n")});
    std::atomic<bool> goOn{false};
    script(stopHarlCommand, {heldUntil(goOn)});

    manager->init(false);
    EXPECT_EQ(entries("found:"), Lines{}) << "init() waited for its worker";
    goOn = true;
    platform::waitFor([] { return noted("found:{0,Solvik IV,1.2.0,1.3.0}{2,TV,1,2}"); });
    manager->update(offered, false);
    offered.clear(); // the worker has a list of its own
    platform::waitFor([] { return noted("result:1"); });
    const std::size_t before = journal().size();
    manager->deinit(false);
    platform::waitFor([] { return noted(ran(stopUpdaterCommand)) && journal().back() == "log:0"; });

    const Lines all = journal();
    EXPECT_EQ(Lines(all.begin(), all.begin() + static_cast<std::ptrdiff_t>(before)),
              joined({entry,
                      entry,
                      harlStopped(),
                      mirrorsOk(),
                      packageChecked("apt-cache policy solvik4-dh", "1.2.0", "1.3.0"),
                      boardChecked("2.1.0", "2.1.0"),
                      {running(teamViewerCheckCommand), opened(teamViewerCheckCommand), "log:Exit code:0",
                       logged(std::string("Teamviewer path") + teamViewerMarker), "log:Teamviewer install is required",
                       "log:going to install TV", "system:rm /root/RESOURCES/tavren1stboot",
                       "log:removedrm /root/RESOURCES/tavren1stboot", "found:{0,Solvik IV,1.2.0,1.3.0}{2,TV,1,2}"},
                      entry,
                      entry,
                      {"log:now call install MAIN udate0", "log:now call install DH udate"},
                      packageInstalled("apt --assume-yes install solvik4-dh"),
                      {"log:now call install MAIN udate2", "log:now call install TV udate",
                       "log:", logged(teamViewerScriptCommand), ran(teamViewerScriptCommand),
                       "log:Install script ended with code: 0", "log:update maainhead finished", "result:1"}}));
    EXPECT_EQ(Lines(all.begin() + static_cast<std::ptrdiff_t>(before), all.end()), joined({entry, harlStarted()}));

    const std::string caller = threadOf("void UpdateManager::init(bool)");
    const std::string checker = threadOf("static void UpdateManager::initMainHead()");
    const std::string installer =
        threadOf("static void UpdateManager::updateMainHead(std::vector<UpdateManager::UpdateComponent>)");
    const std::string closer = threadOf("static void UpdateManager::startHARL()");
    EXPECT_NE(checker, caller);
    EXPECT_NE(installer, caller);
    EXPECT_NE(closer, caller);
    EXPECT_NE(closer, installer);
}

TEST_F(Manager, UpdateOfTheMainHeadWaitsForTheCheckAndReturnsBeforeTheInstallation)
{
    script(stopHarlCommand, {{0, "", true, [] { platform::delay(100); }}});
    script(mirrorsCommand, {exits(100)});
    std::atomic<bool> goOn{false};
    script(teamViewerScriptCommand, {heldUntil(goOn)});
    manager->init(false);
    const int before = platform::released(sizeof(std::thread));
    manager->update({{UpdateManager::COMPONENT_TEAMVIEWER, "TV", "1", "2"}}, false);
    EXPECT_EQ(platform::released(sizeof(std::thread)) - before, 1) << "the check's thread object";
    EXPECT_TRUE(noted("error:1")) << "update() did not wait for the check";
    EXPECT_FALSE(noted("result:1")) << "update() waited for the installation";
    goOn = true;
    platform::waitFor([] { return noted("result:1"); });
}

TEST_F(Manager, SecondInstallationOfTheMainHeadWaitsForTheFirst)
{
    script(teamViewerScriptCommand, {{0, "", true, [] { platform::delay(100); }}});
    manager->update({{UpdateManager::COMPONENT_TEAMVIEWER, "TV", "1", "2"}}, false);
    const int before = platform::released(sizeof(std::thread));
    manager->update({}, false);
    EXPECT_EQ(platform::released(sizeof(std::thread)) - before, 1) << "the first one's thread object";
    EXPECT_TRUE(noted("result:1")) << "update() did not wait for the first installation";
    platform::waitFor([] { return entries("result:").size() == 2; });
}

TEST_F(Manager, ClosingStepOfTheMainHeadDoesNotWaitForTheInstallation)
{
    script(mirrorsCommand, {exits(100)});
    script(teamViewerScriptCommand,
           {{0, "", true, [] { platform::waitFor([] { return noted(ran(stopUpdaterCommand)); }); }}});
    manager->init(false);
    manager->update({{UpdateManager::COMPONENT_TEAMVIEWER, "TV", "1", "2"}}, false);
    manager->deinit(false);
    // The statuses of the check and of the closing step, so that none is left for the next test.
    platform::waitFor([] { return noted("result:1") && entries("log:0").size() == 4; });
}

TEST_F(Manager, InitAndDeinitOverwriteTheWorkerWithoutWaiting)
{
    std::atomic<bool> goOn{false};
    script(mirrorsCommand, {heldUntil(goOn, 100)});
    manager->init(false);
    manager->init(false);
    manager->deinit(false);
    EXPECT_EQ(entries("error:"), Lines{});
    goOn = true;
    // Two checks with a status each, and a closing step with three.
    platform::waitFor([] { return entries("error:").size() == 2 && entries("log:0").size() == 5; });
}

TEST_F(Manager, UpdateOfTheMainHeadWithoutACheckInstallsAtOnce)
{
    // In a process of its own, where no worker was ever started.
    NEEDS_A_FRESH_PROCESS();
    EXPECT_EXIT(
        {
            manager->update({{5, "", "", ""}}, false);
            platform::waitFor([] { return noted("result:1"); });
            std::_Exit(noted("log:now call install MAIN udate5") ? 0 : 1);
        },
        testing::ExitedWithCode(0), "");
}

using Callbacks =
    std::tuple<UpdateManager::ResultCallback, UpdateManager::ErrorCallback, UpdateManager::UpdateFoundCallback>;

TEST_F(Manager, CallbacksAreValidWhenNoneIsMissing)
{
    manager->setCallbacks(noteResult, noteError, noteUpdateFound);
    EXPECT_TRUE(manager->validateCallbacks());
    EXPECT_EQ(journal(), entry);
}

/// Calls an operation with one of the three callbacks missing, or more.
class MissingCallback : public With<UnitTest, Callbacks>
{
protected:
    void SetUp() override
    {
        platform::reset();
        std::apply([](auto... callbacks) { UpdateManager::instance()->setCallbacks(callbacks...); }, value());
        platform::afterRecord([] { std::cerr << "entered"; });
    }

    /// After the record of the entry glibc's diagnostic, assert(3), with the function as the compiler spells it, as a
    /// regular expression.
    static std::string diagnostic(const std::string& function)
    {
        std::string text = "entered.*: " + function + ": Assertion `validateCallbacks()' failed\\.";
        for (const char special : {'(', ')', '<', '>'}) {
            std::replace(text.begin(), text.end(), special, '.');
        }
        return text;
    }
};

TEST_P(MissingCallback, MakesThemInvalid)
{
    EXPECT_FALSE(UpdateManager::instance()->validateCallbacks());
}

TEST_P(MissingCallback, AbortsInit)
{
    for (const bool head : {false, true}) {
        EXPECT_EXIT(UpdateManager::instance()->init(head), testing::KilledBySignal(SIGABRT),
                    diagnostic("void UpdateManager::init(bool)"));
    }
}

TEST_P(MissingCallback, AbortsUpdate)
{
    for (const bool head : {false, true}) {
        EXPECT_EXIT(UpdateManager::instance()->update({}, head), testing::KilledBySignal(SIGABRT),
                    diagnostic("void UpdateManager::update(std::vector<UpdateManager::UpdateComponent>, bool)"));
    }
}

TEST_P(MissingCallback, AbortsDeinit)
{
    for (const bool head : {false, true}) {
        EXPECT_EXIT(UpdateManager::instance()->deinit(head), testing::KilledBySignal(SIGABRT),
                    diagnostic("void UpdateManager::deinit(bool)"));
    }
}

const Named<Callbacks> missing[] = {
    {"Result", {nullptr, noteError, noteUpdateFound}},
    {"Error", {noteResult, nullptr, noteUpdateFound}},
    {"UpdateFound", {noteResult, noteError, nullptr}},
    {"OnlyResult", {noteResult, nullptr, nullptr}},
    {"OnlyError", {nullptr, noteError, nullptr}},
    {"OnlyUpdateFound", {nullptr, nullptr, noteUpdateFound}},
    {"All", {nullptr, nullptr, nullptr}},
};
INSTANTIATE_TEST_SUITE_P(Callbacks, MissingCallback, testing::ValuesIn(missing), nameOf<Named<Callbacks>>);

} // namespace
