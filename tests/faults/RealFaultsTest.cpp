/// Usage: real-faults [GOOGLETEST OPTION...] N
/// Every Nth case of the fault matrix with the updater's executable, or with the example of a main head's program: its
/// commands run in real shells, on a search path that holds nothing but a tool for each of them, made for the case.

#include "Cases.h"
#include "Procedure.h"
#include "UnitTest.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <sstream>
#include <sys/wait.h>
#include <unistd.h>

namespace
{

namespace fs = std::filesystem;

const int atOnce = 8;      // runs; they mostly wait
const int longestRun = 60; // s

std::size_t every = 1; // cases

std::string toolOf(const std::string& command)
{
    return command.substr(0, command.find(' '));
}

/// The arguments of the first tool of a command line, quoted for the shell.
std::string argumentsOf(const std::string& command)
{
    const std::string first = command.substr(0, command.find(" && "));
    return first.substr(toolOf(first).size());
}

void write(const fs::path& path, const std::string& text)
{
    std::ofstream(path, std::ios::binary) << text;
}

std::string read(const fs::path& path)
{
    std::ostringstream text;
    text << std::ifstream(path, std::ios::binary).rdbuf();
    return text.str();
}

/// One run of a program in a folder of its own.
class RealRun
{
public:
    explicit RealRun(const Case& what);
    ~RealRun();
    RealRun(const RealRun&) = delete;
    RealRun& operator=(const RealRun&) = delete;

    /// Waits for the program's end and compares everything observed.
    void expectHolds();

private:
    /// The shell line with which a tool answers once it knows its step.
    std::string answer(const std::string& step, const std::string& healthy, const Injection* injection);
    const Injection* injectionOf(const std::string& step) const;
    void makeTools();
    void start();
    void endMainHead() const;
    void expectCalls(const Expected& expected);
    void expectLog(const Expected& expected);

    const Case mCase;
    fs::path mFolder;
    pid_t mUpdater = -1;
};

RealRun::RealRun(const Case& what) : mCase(what)
{
    std::string name = testing::TempDir() + "faults-XXXXXX";
    mFolder = mkdtemp(name.data());
    fs::create_directory(mFolder / "bin");
    makeTools();
    start();
}

RealRun::~RealRun()
{
    kill(-mUpdater, SIGKILL);
    fs::remove_all(mFolder);
}

const Injection* RealRun::injectionOf(const std::string& step) const
{
    for (const Injection& injection : mCase.injections) {
        if (injection.step == step) {
            return &injection;
        }
    }
    return nullptr;
}

std::string RealRun::answer(const std::string& step, const std::string& healthy, const Injection* injection)
{
    std::string file = step;
    std::replace(file.begin(), file.end(), ' ', '-');
    const fs::path output = mFolder / file;
    const Fault* fault = injection == nullptr ? nullptr : injection->fault;
    write(output, fault == nullptr ? healthy : fault->output(healthy));

    std::ostringstream line;
    if (step == "stop harl") {
        line << "/bin/sleep 0.3; "; // the application lock relies on it
    }
    if (fault != nullptr && injection->times != 0) {
        line << "echo >>" << output.string() << ".tries; [ \"$(/bin/grep -c '' " << output.string() << ".tries)\" -le "
             << injection->times << " ] || exit 0; ";
    }
    if (fault != nullptr && fault->delay != 0) {
        line << (step == panelStep ? "/bin/sleep 0.1; " : "/bin/sleep 2; "); // the panel takes dozens of commands
    }
    if (fs::file_size(output) != 0) {
        line << "/bin/cat " << output.string() << "; ";
    }
    if (fault != nullptr && fault->status > 0 && fault->status < 256) {
        // The shell that ran the tool, unless it became the tool, dies with it: this is what the updater sees.
        line << "read -r parent </proc/$PPID/comm; [ \"$parent\" != sh ] || kill -" << fault->status << " $PPID; kill -"
             << fault->status << " $$; ";
    }
    line << "exit " << (fault == nullptr ? healthyCode(mCase.unit, step) : fault->code());
    return line.str();
}

void RealRun::makeTools()
{
    std::map<std::string, std::string> tools;
    std::map<std::string, int> served;
    const std::vector<Step> steps = stepsOf(mCase.unit);
    for (const Step& step : steps) {
        ++served[toolOf(step.command)];
    }
    for (const Step& step : steps) {
        const Injection* injection = injectionOf(step.name);
        const std::string tool = toolOf(step.command);
        if (injection != nullptr && injection->fault->name == "toolMissing" && served[tool] == 1 &&
            injection->times == 0) {
            continue;
        }
        tools[tool] += "set --" + argumentsOf(step.command) + "\n[ \"$called\" != \"$*\" ] || { " +
                       answer(step.name, healthyOutput(mCase.unit, step.name), injection) + "; }\n";
    }
    write(mFolder / "answer", "all\n"); // of the main head's operator
    for (const auto& [step, tool] : {std::pair{panelStep, "i2cset"}, std::pair{soundStep, "aplay"}}) {
        const Injection* injection = injectionOf(step);
        if (injection == nullptr) {
            fs::create_symlink("/bin/true", mFolder / "bin" / tool);
        } else if (injection->fault->name != "toolMissing") {
            tools[tool] = answer(step, "", injection) + "\n";
        }
    }
    tools.erase(toolOf(teamViewerScriptCommand)); // its path is absolute
    for (const auto& [tool, answers] : tools) {
        write(mFolder / "bin" / tool, "#!/bin/sh\ncalled=$*\n" + answers);
        fs::permissions(mFolder / "bin" / tool, fs::perms::owner_all);
    }
}

void RealRun::start()
{
    mUpdater = fork();
    ASSERT_NE(mUpdater, -1);
    if (mUpdater != 0) {
        return;
    }
    setpgid(0, 0);
    const std::string path = "PATH=" + (mFolder / "bin").string();
    const std::string calls = "BENCH_CALLS=" + (mFolder / "calls").string();
    const std::string recorder = std::string("LD_PRELOAD=") + CALL_RECORDER;
    const char* environment[] = {path.c_str(), calls.c_str(), "BENCH_SPEED=2000", recorder.c_str(), nullptr};
    const int log = open((mFolder / "log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    dup2(open((mFolder / "answer").c_str(), O_RDONLY | O_CLOEXEC), STDIN_FILENO);
    dup2(open("/dev/null", O_WRONLY | O_CLOEXEC), STDERR_FILENO);
    dup2(log, STDOUT_FILENO);
    alarm(longestRun);
    const char* program = mCase.unit.mainHead ? MAIN_HEAD : UPDATER;
    execle(program, program, nullptr, environment);
    _exit(126);
}

/// Ends the main head's program as the service manager does, once it has logged the status of its last command.
void RealRun::endMainHead() const
{
    for (int tries = 0; tries < longestRun * 100; ++tries) {
        const std::string log = read(mFolder / "log");
        const std::string text = platform::splitLog(log).back();
        const std::optional<platform::Record> last = platform::parseRecord(text);
        if (last && last->function.find("stopUpdater") != std::string::npos && !last->message.empty()) {
            kill(mUpdater, SIGTERM);
            return;
        }
        usleep(10000);
    }
}

void RealRun::expectHolds()
{
    SCOPED_TRACE(mCase.name());
    const bool mainHead = mCase.unit.mainHead;
    if (mainHead) {
        endMainHead();
    }
    int status = -1;
    ASSERT_EQ(waitpid(mUpdater, &status, 0), mUpdater);
    EXPECT_EQ(status, mainHead ? SIGTERM : 0);
    const Expected expected = follow(mCase.unit, mCase.injections);
    expectCalls(expected);
    expectLog(expected);
}

void RealRun::expectCalls(const Expected& expected)
{
    struct Call
    {
        std::string thread;
        std::string text; // as the stand-in platform's journal spells it
    };
    std::vector<Call> calls;
    std::ifstream file(mFolder / "calls");
    for (std::string line; std::getline(file, line);) {
        std::istringstream columns(line);
        std::array<std::string, 5> column;
        for (std::string& text : column) {
            std::getline(columns, text, '\t');
        }
        const auto& [time, thread, call, phase, value] = column;
        std::string text;
        std::getline(columns, text);
        if (phase == "start") {
            text.insert(0, call + ":");
            calls.push_back({thread, call == "nanosleep" ? "sleep:" + value : text});
        }
    }
    const auto first =
        std::find_if(calls.begin(), calls.end(), [](const Call& call) { return call.text == ran(stopHarlCommand); });
    ASSERT_NE(first, calls.end());
    platform::Lines update;
    platform::Lines lit;
    bool sounded = false;
    for (const Call& call : calls) {
        if (mCase.unit.mainHead || call.thread == first->thread) {
            update.push_back(call.text);
        }
        if (sounded && call.text.find("i2cset") != std::string::npos) {
            lit.push_back(call.text.substr(call.text.find(':') + 1));
        }
        sounded = sounded || call.text == "system:" + outcomeSound(expected.report);
    }
    platform::Lines wanted;
    std::copy_if(expected.calls.begin(), expected.calls.end(), std::back_inserter(wanted), [](const std::string& call) {
        return call.find("result:") != 0 && call.find("error:") != 0 && call.find("found:") != 0;
    });
    EXPECT_EQ(update, wanted);
    EXPECT_EQ(lit, mCase.unit.mainHead ? platform::Lines() : outcomePanel(expected.report));
}

/// Every record begins at a line's start and is whole, and there is one report.
void RealRun::expectLog(const Expected& expected)
{
    const bool mainHead = mCase.unit.mainHead;
    const std::string kind = expected.report.substr(0, expected.report.find(' ')); // "result" or "error"
    const std::string number = expected.report.substr(kind.size() + 1);
    int reports = 0;
    std::vector<platform::Record> records;
    for (const std::string& text : platform::splitLog(read(mFolder / "log"))) {
        const std::optional<platform::Record> record = platform::parseRecord(text);
        ASSERT_TRUE(record) << text;
        EXPECT_THAT(record->message, testing::Not(testing::HasSubstr("Updater | "))) << "torn: " << text;
        for (const char* callback : {"Callback(UpdateManager::Result)", "Callback(UpdateManager::Error)"}) {
            if (record->function.find(callback) != std::string::npos) {
                ++reports;
                EXPECT_THAT(record->function, testing::HasSubstr(kind + callback));
                EXPECT_EQ(record->message, mainHead ? number : "");
            }
        }
        records.push_back(*record);
    }
    ASSERT_GT(records.size(), 15U);
    EXPECT_EQ(reports, 1);
    EXPECT_TRUE(mainHead || records.back().message == "AFTER UPDATE") << records.back().message;
}

/// Every Nth case that a real shell can show, without those that run TeamViewer's script: its path is absolute.
std::vector<Case> sample()
{
    std::vector<Case> all;
    for (const Case& what : faultsOfTheProcedure()) {
        const std::string& fault = what.injections.at(0).fault->name;
        if (!what.unit.teamViewer && fault != "noShell" && fault != "statusLost") {
            all.push_back(what);
        }
    }
    std::vector<Case> chosen;
    for (std::size_t i = 0; i < all.size(); i += every) {
        chosen.push_back(all[i]);
    }
    return chosen;
}

TEST(RealFaults, EndAsTheProcedureSays)
{
    const std::vector<Case> cases = sample();
    std::vector<std::unique_ptr<RealRun>> runs;
    for (const Case& what : cases) {
        if (runs.size() == atOnce) {
            runs.front()->expectHolds();
            runs.erase(runs.begin());
        }
        runs.push_back(std::make_unique<RealRun>(what));
    }
    for (const std::unique_ptr<RealRun>& run : runs) {
        run->expectHolds();
    }
    std::printf("%zu cases\n", cases.size());
    EXPECT_GE(cases.size(), 600U / every);
}

} // namespace

int main(int argc, char** argv)
{
    testing::InitGoogleTest(&argc, argv);
    every = argc == 2 ? std::strtoul(argv[1], nullptr, 10) : 0;
    if (every == 0) {
        std::fprintf(stderr, "Usage: %s [GOOGLETEST OPTION...] N\n", argv[0]);
        return 2;
    }
    return RUN_ALL_TESTS();
}
