#include "unit/unit_check.h"

#include "finding_lines.h"
#include "kept_reports.h"
#include "unit/standin.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <csignal>
#include <fstream>
#include <functional>
#include <sstream>

#include <sys/stat.h>
#include <sys/statvfs.h>

namespace fs = std::filesystem;
using testing::Contains;
using testing::ElementsAreArray;
using testing::HasSubstr;
using testing::Not;

namespace
{

/// What a run of the check gave.
struct CheckResult
{
    int status;
    nlohmann::json report;
    Lines findings;
    std::string errors;
};

/// For a stand-in of apt-get: its sources name one mirror.
const std::string oneMirror = "case $* in *print-uris) echo \"'http://mirror.invalid/1' 1 0 \"; exit;; esac\n";

class UnitCheck : public testing::Test
{
protected:
    static CheckResult check(const UnitSite& site)
    {
        std::ostringstream out;
        std::ostringstream errors;
        CheckResult result = {
            runUnit({true, false, false}, site, out, errors), nlohmann::json::parse(out.str()), {}, ""};
        result.errors = errors.str();
        nlohmann::json facts = result.report["facts"];
        facts.erase("free_bytes"); // of this machine
        compareWithKept(facts.dump() + '\n' + result.errors);
        for (const auto& finding : result.report["findings"]) {
            compareWithKept(finding.dump() + '\n');
            result.findings.push_back(finding["severity"].get<std::string>() + ' ' +
                                      finding["check"].get<std::string>());
        }
        return result;
    }

    CheckResult check() const { return check(unit.site()); }
    Lines findings() const { return check().findings; }

    /// The text of the one finding.
    std::string what() const
    {
        const nlohmann::json found = check().report["findings"];
        return found.size() == 1 ? found[0]["what"].get<std::string>() : found.dump();
    }

    nlohmann::json fact(const std::string& name) const { return check().report["facts"][name]; }

    StandInUnit unit;
};

struct statvfs diskWith(std::uint64_t freeBytes)
{
    struct statvfs system = {};
    system.f_frsize = 1;
    system.f_bavail = freeBytes;
    system.f_files = 10;
    system.f_favail = 5;
    return system;
}

Lines checkDisk(const struct statvfs& system, std::uint64_t needed)
{
    Report report("unit", "The unit");
    checkFreeSpace(system, needed, report);
    return findingsOf(report);
}

} // namespace

struct Fault
{
    const char* name;
    std::function<void(StandInUnit& unit)> make;
    Lines findings;
};

void PrintTo(const Fault& fault, std::ostream* out)
{
    *out << fault.name;
}

/// What one change of a unit that is fit makes of the check's findings.
class UnitCheckOfFault : public UnitCheck, public testing::WithParamInterface<Fault>
{
};

TEST_P(UnitCheckOfFault, IsFound)
{
    GetParam().make(unit);
    EXPECT_THAT(findings(), ElementsAreArray(GetParam().findings));
}

INSTANTIATE_TEST_SUITE_P(
    Each, UnitCheckOfFault,
    testing::Values(
        Fault{"ServiceManagerThatCannotBeAskedIsUnchecked",
              [](StandInUnit& unit) {
                  unit.replaceTool("systemctl",
                                   "echo 'System has not been booted with systemd as init system' >&2; exit 1");
              },
              Lines{"unchecked services-unknown"}},
        Fault{"ToolWithAnotherAnswerToThePanelsAddressIsUnchecked",
              [](StandInUnit& unit) { unit.replaceTool("i2cset", "echo 'BusyBox' >&2; exit 1"); },
              Lines{"unchecked panel-address-unknown"}},
        Fault{"MissingBusIsAnError", [](StandInUnit& unit) { unit.remove("dev/i2c-0"); },
              Lines{"error panel-bus-missing"}},
        Fault{"PanelThatDoesNotAnswerIsAnError", [](StandInUnit& unit) { unit.set("HEAD_PANEL", "absent"); },
              Lines{"error panel-silent"}},
        Fault{"PanelTakenByADriverIsAnError",
              [](StandInUnit& unit) { unit.replaceTool("i2cdetect", "echo '00:                      UU'"); },
              Lines{"error panel-busy"}},
        Fault{"BusThatCannotBeAskedIsUnchecked",
              [](StandInUnit& unit) { unit.replaceTool("i2cdetect", "echo 'Error: Could not open file' >&2; exit 1"); },
              Lines{"unchecked panel-unknown"}},
        Fault{"MissingSoundDeviceIsAWarning",
              [](StandInUnit& unit) { unit.put("proc/asound/pcm", "00-00: Microphone : Microphone : capture 1\n"); },
              Lines{"warning sound-device"}},
        Fault{"PanelIsToldBeforeTheSound",
              [](StandInUnit& unit) {
                  unit.removeTool("i2cset");
                  unit.removeTool("aplay");
              },
              Lines{"error tool-missing", "warning tool-missing"}},
        Fault{"BoardThatDoesNotAnswerIsUnreachable", [](StandInUnit& unit) { unit.set("BOARD_LINK", "down"); },
              Lines{"error board-unreachable"}},
        Fault{"RefusedKeyIsALoginError", [](StandInUnit& unit) { unit.set("BOARD_LOGIN", "key-refused"); },
              Lines{"error board-login"}},
        Fault{"MissingVersionFileIsAnError", [](StandInUnit& unit) { unit.set("BOARD_VERSION_FILE", ""); },
              Lines{"error board-version"}},
        Fault{"VersionFileThatCannotBeReadIsNoRefusedLogin",
              [](StandInUnit& unit) {
                  unit.replaceTool("ssh", "echo 'cat: /root/App/AppExe/version.txt: Permission denied' >&2; exit 1");
              },
              Lines{"error board-version"}},
        Fault{"VersionOfACommandThatFailedIsAnError",
              [](StandInUnit& unit) { unit.replaceTool("ssh", "printf 'Brimvale\\t2.1.0\\n'; exit 1"); },
              Lines{"error board-version"}},
        Fault{"LockFileThatCannotBeReadIsUnchecked",
              [](StandInUnit& unit) {
                  unit.remove("var/lib/dpkg/lock");
                  unit.folder.makeLink("root/var/lib/dpkg/lock", "lock");
              },
              Lines{"unchecked package-lock"}},
        Fault{"FindingsComeInTheOrderOfTheSteps",
              [](StandInUnit& unit) {
                  unit.remove("var/lib/dpkg/lock");
                  unit.folder.makeLink("root/var/lib/dpkg/lock", "lock");
                  unit.set("UNIT_PACKAGE", "iF");
                  unit.set("PACKAGE_OFFERED", "(none)");
                  unit.replaceTool("apt-config", R"(echo 'APT::Update::Error-Mode "any";')");
                  unit.replaceTool("apt-get", "");
              },
              Lines{"unchecked package-lock", "error package-half-configured", "warning package-not-offered",
                    "warning apt-settings", "error mirrors-none"}},
        Fault{"MissingLockFileIsFree", [](StandInUnit& unit) { unit.remove("var/lib/dpkg/lock"); }, Lines()},
        Fault{"PackageDatabaseThatCannotBeReadIsUnchecked", [](StandInUnit& unit) { unit.removeTool("dpkg-query"); },
              Lines{"unchecked packages-unknown"}},
        Fault{"UnknownPackageIsAWarning", [](StandInUnit& unit) { unit.set("PACKAGE_KNOWN", "false"); },
              Lines{"warning package-unknown"}},
        Fault{"PackageToolWithoutAnswerLeavesThePackageUnchecked",
              [](StandInUnit& unit) { unit.replaceTool("apt-cache", ""); }, Lines{"unchecked package-unknown"}},
        Fault{"PackageWithoutASourceIsAWarning", [](StandInUnit& unit) { unit.set("PACKAGE_OFFERED", "(none)"); },
              Lines{"warning package-not-offered"}},
        Fault{"UnitWithoutSourcesIsAnError", [](StandInUnit& unit) { unit.replaceTool("apt-get", ""); },
              Lines{"error mirrors-none"}},
        Fault{"MirrorWithoutTheIndexIsNamed",
              [](StandInUnit& unit) {
                  unit.replaceTool("apt-get",
                                   "echo \"'http://mirror.invalid/1' 1 0 \"; case $* in *print-uris) exit;; esac\n"
                                   "for failure in '1  404  Gone' '2  File not found' '3  Not Found'; do"
                                   " echo \"E: Failed to fetch http://mirror.invalid/$failure\" >&2; done; exit 100");
              },
              Lines{"warning mirror-index", "warning mirror-index", "warning mirror-index", "error refresh-fails"}},
        Fault{"VolatileJournalIsAWarning", [](StandInUnit& unit) { unit.remove("var/log/journal"); },
              Lines{"warning journal-volatile"}},
        Fault{"ClockBehindTheUpdaterIsAnError",
              [](StandInUnit& unit) {
                  fs::last_write_time(unit.folder.path("root/usr/sbin/harl-updater"),
                                      fs::file_time_type::clock::now() + std::chrono::hours(24));
              },
              Lines{"error clock-behind"}},
        Fault{"ServiceThatWasNotReloadedIsAWarning",
              [](StandInUnit& unit) {
                  unit.replaceTool("systemctl",
                                   "printf 'Id=harl.service\\nLoadState=loaded\\n\\n"
                                   "Id=harl-updater.service\\nLoadState=loaded\\nNeedDaemonReload=yes\\n'");
              },
              Lines{"warning service-not-reloaded"}},
        Fault{"AptSettingsAgainstTheServicesAreAWarning",
              [](StandInUnit& unit) {
                  unit.replaceTool("apt-config", R"(printf '%s\n' 'DPkg::Options:: "--force-confnew";' 'APT "";' \
                      'DPkg::Options:: "--force-confask";' 'DPkg::Options:: "--force-confold";' \
                      'APT::Update::Error-Mode "any";' 'Binary::apt::APT::Update::Error-Mode "any";')");
              },
              Lines{"warning apt-settings"}},
        Fault{"NineSilentAddressesOfOneMirrorAreOneError",
              [](StandInUnit& unit) {
                  unit.replaceTool("apt-get",
                                   "for n in 1 2 3 4 5 6 7 8 9; do echo \"'http://mirror.invalid/$n' $n 0 \"; "
                                   "echo \"W: Failed to fetch http://mirror.invalid/$n  Timeout\" >&2; done");
              },
              Lines{"error mirror-silent"}},
        Fault{"WithoutServiceManagerItsToolIsMissing", [](StandInUnit& unit) { unit.removeTool("systemctl"); },
              Lines{"unchecked services-unknown", "error tool-missing"}}),
    [](const auto& test) { return test.param.name; });

TEST_F(UnitCheck, CompleteUnitIsFit)
{
    const CheckResult result = check();
    EXPECT_EQ(result.findings, Lines());
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.errors, "");
    EXPECT_EQ(result.report["command"], "unit");
    EXPECT_EQ(result.report["fit"], true);
    const nlohmann::json facts = result.report["facts"];
    EXPECT_EQ(facts["head"], "remote");
    EXPECT_EQ(facts["service_harl"], "active");
    EXPECT_EQ(facts["service_harl_updater"], "inactive");
    EXPECT_EQ(facts["board_version"], "2.1.0");
    EXPECT_EQ(facts["package_installed"], "1.2.0");
    EXPECT_EQ(facts["package_candidate"], "1.3.0");
    EXPECT_EQ(facts["needed_bytes"], 1'000'000 + 2048 * 1024);
    EXPECT_EQ(facts["mirrors"], 1);
    for (const std::string& call : unit.calls()) {
        compareWithKept(call + '\n');
    }
}

TEST_F(UnitCheck, ChangesNothing)
{
    check();
    for (const std::string& call : unit.calls()) {
        EXPECT_THAT(call,
                    testing::AnyOf("systemctl show-environment", testing::StartsWith("systemctl show "),
                                   "i2cset -y 0 0x07 0x100 c", testing::StartsWith("i2cdetect "),
                                   testing::StartsWith("ssh "), testing::StartsWith("dpkg-query --show "),
                                   testing::StartsWith("apt-cache "), "apt-config dump", "apt-get update --print-uris",
                                   testing::StartsWith("apt-get -c " + unit.folder.path("root/tmp").string())));
    }
    EXPECT_TRUE(fs::is_empty(unit.folder.path("root/tmp")));
}

TEST_F(UnitCheck, TextNamesTheVerdict)
{
    std::ostringstream out;
    std::ostringstream errors;
    EXPECT_EQ(runUnit({}, unit.site(), out, errors), 0);
    EXPECT_THAT(out.str(), HasSubstr("\nBoard's version:       \"2.1.0\"\n"));
    EXPECT_THAT(out.str(), HasSubstr("\nThe unit is fit for an update.\n"));
}

TEST_F(UnitCheck, WithoutRootsRightsTheAnswerIsOpen)
{
    UnitSite site = unit.site();
    site.isRoot = false;
    const CheckResult result = check(site);
    EXPECT_EQ(result.findings, Lines{"unchecked not-root"});
    EXPECT_EQ(result.status, 2);
}

TEST_F(UnitCheck, BoardThatRefusesAnotherUserThanRootIsUnchecked)
{
    UnitSite site = unit.site();
    site.isRoot = false;
    unit.set("BOARD_LOGIN", "key-refused");
    EXPECT_EQ(check(site).findings, (Lines{"unchecked not-root", "unchecked board-login"}));
    unit.set("BOARD_LOGIN", "host-key-changed");
    EXPECT_EQ(check(site).findings, (Lines{"unchecked not-root", "unchecked board-login"}));
    unit.set("BOARD_LINK", "down");
    EXPECT_EQ(check(site).findings, (Lines{"unchecked not-root", "error board-unreachable"}));
}

TEST_F(UnitCheck, NothingIsLeftWhenASignalEndsIt)
{
    const std::string processFile = unit.folder.path("process");
    for (const int number : {SIGHUP, SIGINT, SIGTERM}) {
        std::string script = oneMirror;
        script.append("echo $$ >").append(processFile).append("\nkill -").append(std::to_string(number));
        unit.replaceTool("apt-get", script.append(" $PPID\nPATH=/bin exec sleep 60"));
        EXPECT_EXIT((std::signal(number, SIG_DFL), check()), testing::KilledBySignal(number), "");
        EXPECT_TRUE(fs::is_empty(unit.folder.path("root/tmp"))) << number;
        pid_t process = 0;
        std::ifstream(processFile) >> process;
        EXPECT_GT(process, 0);
        EXPECT_EQ(kill(process, 0), -1) << "The refresh lives on.";
    }
}

// Heads

TEST_F(UnitCheck, MainHeadIsJudgedByItsOwnPackage)
{
    unit.set("UPDATER_PROGRAM", "main");
    const CheckResult result = check();
    EXPECT_EQ(result.findings, Lines());
    EXPECT_EQ(result.status, 0);
    const nlohmann::json facts = result.report["facts"];
    EXPECT_EQ(facts["head"], "main");
    EXPECT_EQ(facts["package_installed"], "1.2.0");
    EXPECT_EQ(facts["package_candidate"], "1.3.0");
    EXPECT_EQ(facts["needed_bytes"], 1'000'000 + 2048 * 1024);
    unit.set("PACKAGE_OFFERED", "(none)");
    EXPECT_EQ(what(), "No source offers the package \"solvik4-dh\".");
}

TEST_F(UnitCheck, MainHeadNeedsNeitherPanelNorSound)
{
    unit.set("UPDATER_PROGRAM", "main");
    unit.removeTool("i2cset");
    unit.removeTool("aplay");
    unit.remove("dev/i2c-0");
    unit.remove("root/RESOURCES");
    unit.remove("proc/asound");
    EXPECT_EQ(findings(), Lines());
}

TEST_F(UnitCheck, MainHeadInstallsNothingWithoutItsBoard)
{
    unit.set("UPDATER_PROGRAM", "main");
    unit.set("BOARD_LINK", "down");
    const nlohmann::json findings = check().report["findings"];
    ASSERT_EQ(findings.size(), 1U);
    EXPECT_EQ(findings[0]["check"], "board-unreachable");
    EXPECT_EQ(findings[0]["effect"],
              "logs \"Failed to checkUpdate\", installs nothing and reports a failure to the main head's program.");
}

TEST_F(UnitCheck, NoFindingOfAMainHeadSpeaksOfThePanel)
{
    unit.set("UPDATER_PROGRAM", "main");
    for (const char* tool : {"ls", "apt", "apt-cache", "ssh", "scp"}) {
        unit.removeTool(tool);
    }
    unit.replaceTool("apt-get", "exit 100");
    const LockHolder lists(unit.folder.path("root/var/lib/apt/lists/lock"));
    const LockHolder archives(unit.folder.path("root/var/cache/apt/archives/lock"));
    const nlohmann::json findings = check().report["findings"];
    EXPECT_EQ(findings.size(), 8U);
    for (const auto& finding : findings) {
        EXPECT_THAT(finding["effect"].get<std::string>(), Not(testing::ContainsRegex("pattern|panel"))) << finding;
    }
}

TEST_F(UnitCheck, HeadWithBothPackagesOrWithConfigurationFilesOnlyIsARemoteHead)
{
    unit.replaceTool("dpkg-query", "printf installed");
    EXPECT_EQ(fact("head"), "remote");
    unit.replaceTool("dpkg-query", "[ \"$3\" = solvik4-dh ] && printf config-files");
    EXPECT_EQ(fact("head"), "remote");
    unit.replaceTool("dpkg-query", "[ \"$3\" = solvik4-dh ] && printf half-configured");
    EXPECT_EQ(fact("head"), "main");
}

// Services

TEST_F(UnitCheck, UnknownServicesAreErrors)
{
    unit.set("HEAD_HARL", "unknown");
    unit.set("UNIT_UPDATER_LOADED", "masked");
    const CheckResult result = check();
    EXPECT_EQ(result.findings, (Lines{"error service-not-loaded", "error service-not-loaded"}));
    EXPECT_EQ(result.status, 1);
    EXPECT_EQ(result.report["findings"][1]["what"], "The service \"harl-updater\" cannot be used: \"masked\".");
}

TEST_F(UnitCheck, RunningServiceOfTheUpdaterIsAWarningAndItsPanelIsLeftAlone)
{
    unit.set("UNIT_UPDATER", "activating");
    EXPECT_EQ(findings(), Lines{"warning updater-runs"});
    EXPECT_THAT(unit.calls(), Not(Contains(testing::StartsWith("i2cdetect"))));
}

TEST_F(UnitCheck, UpdaterStartedByHandIsFoundToo)
{
    unit.put("proc/17/comm", "harl-updater\n");
    EXPECT_EQ(findings(), Lines{"warning updater-runs"});
    unit.put("proc/17/comm", "harl-updater-to\n"); // this tool
    EXPECT_EQ(findings(), Lines());
}

// Tools and the service's environment

TEST_F(UnitCheck, EveryMissingToolIsNamed)
{
    for (const std::string tool : {"umount", "rm", "ls", "apt", "apt-cache", "ssh", "scp", "i2cset"}) {
        StandInUnit other;
        other.removeTool(tool);
        const CheckResult result = check(other.site());
        EXPECT_EQ(result.findings, Lines{"error tool-missing"}) << tool;
        EXPECT_THAT(result.report["findings"][0]["what"].get<std::string>(),
                    HasSubstr("The command \"" + tool + "\" is not on the service's search path"));
    }
    unit.removeTool("aplay");
    EXPECT_EQ(findings(), Lines{"warning tool-missing"});
}

TEST_F(UnitCheck, FileThatCannotBeRunIsNoTool)
{
    unit.removeTool("scp");
    unit.folder.put("bin/scp", "#!/bin/sh\n", 0644);
    unit.removeTool("rm");
    unit.folder.makeFolder("bin/rm");
    EXPECT_EQ(findings(), (Lines{"error tool-missing", "error tool-missing"}));
}

TEST_F(UnitCheck, SearchPathOfTheServiceCounts)
{
    unit.set("UNIT_ENVIRONMENT", "PATH=/nowhere\nLANG=C.UTF-8");
    unit.set("UNIT_SERVICE_ENVIRONMENT", "LANGUAGE=de PATH=" + unit.folder.path("bin").string());
    EXPECT_EQ(findings(), Lines());
    EXPECT_EQ(fact("search_path"), unit.folder.path("bin").string());
    EXPECT_EQ(fact("locale"), "LANG=C.UTF-8 LANGUAGE=de");
    std::ostringstream out;
    runUnit({}, unit.site(), out, out);
    EXPECT_THAT(out.str(), HasSubstr("\nLocale:                LANG=C.UTF-8 LANGUAGE=de\n"));
}

// Panel and sound

TEST_F(UnitCheck, ToolThatRefusesThePanelsAddressIsAnError)
{
    unit.replaceTool("i2cset", "echo 'Error: Chip address out of range (0x08-0x77)!' >&2; echo Usage: >&2; exit 1");
    EXPECT_EQ(findings(), Lines{"error panel-address-refused"});
    EXPECT_EQ(what(), '"' + unit.folder.path("bin/i2cset").string() +
                          "\" refuses the panel's address 0x07: \"Error: Chip address out of range (0x08-0x77)!\".");
}

TEST_F(UnitCheck, MissingSoundFileIsAWarning)
{
    unit.remove("root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav");
    const CheckResult result = check();
    EXPECT_EQ(result.findings, Lines{"warning sound-file"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(what(), "The sound \"/root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav\" cannot be played: it is not there.");
}

TEST_F(UnitCheck, FileThatIsNoWholeSoundIsAWarning)
{
    const std::string whole = waveFile(1000);
    const std::pair<std::string, const char*> faults[] = {
        {"", "it is empty"},
        {"R", "it is no WAV file"},
        {"RIFF....AVI " + whole.substr(12), "it is no WAV file"},
        {"FORM" + whole.substr(4), "it is no WAV file"},
        {whole.substr(0, 12), "it is cut off: 12 of 1044 bytes are there"},
        {whole.substr(0, 1043), "it is cut off: 1043 of 1044 bytes are there"},
        {waveFile(100'000).substr(0, 100'000), "it is cut off: 100000 of 100044 bytes are there"},
    };
    for (const auto& [content, fault] : faults) {
        unit.put("root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav", content);
        EXPECT_EQ(what(), std::string("The sound \"/root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav\" cannot be played: ") +
                              fault + '.');
    }
}

TEST_F(UnitCheck, SoundFileThatCannotBeReadIsUnchecked)
{
    unit.remove("root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav");
    unit.folder.makeLink("root/root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav", "SND_RESULT_PASS.wav"); // a loop
    const CheckResult result = check();
    EXPECT_EQ(result.findings, Lines{"unchecked sound-file"});
    EXPECT_EQ(result.report["findings"][0]["remedy"], "Run this check as root.");
}

// The board

TEST_F(UnitCheck, BoardIsAskedAsTheUpdaterDoesButNobodyIsAskedForAnything)
{
    check();
    EXPECT_THAT(unit.calls(),
                Contains("ssh -o BatchMode=yes -o StrictHostKeyChecking=yes -o UpdateHostKeys=no -o "
                         "ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes "
                         "192.168.9.2  cat /root/App/AppExe/version.txt | grep 'Brimvale'"));
}

TEST_F(UnitCheck, LoginEndedByASignalIsUnreachable)
{
    unit.set("TOOLS_KILLED", "ssh");
    EXPECT_EQ(findings(), Lines{"error board-unreachable"});
    EXPECT_EQ(what(), "The board at 192.168.9.2 cannot be asked: a signal ended the command.");
}

TEST_F(UnitCheck, ChangedAndUnknownHostKeysAreToldApart)
{
    unit.set("BOARD_LOGIN", "host-key-changed");
    EXPECT_EQ(findings(), Lines{"error board-host-key"});
    EXPECT_EQ(what(), "The board's host key is not the one that is known.");
    unit.replaceTool("ssh", "echo 'Host key verification failed.' >&2; exit 255");
    EXPECT_EQ(what(), "The board's host key is not known.");
}

TEST_F(UnitCheck, VersionLineIsReadAsTheUpdaterReadsIt)
{
    unit.set("BOARD_VERSION_FILE", "Brimvale 2.0\r\n");
    EXPECT_EQ(findings(), Lines{"error board-version"});
    unit.set("BOARD_VERSION_FILE", "Brimvale\t\r\n");
    EXPECT_EQ(findings(), Lines{"error board-version"});
    unit.set("BOARD_VERSION_FILE", "Brimvale\t1.0\r\nold Brimvale\t{version}\rrest\n");
    EXPECT_EQ(findings(), Lines());
    EXPECT_EQ(fact("board_version"), "2.1.0");
}

TEST_F(UnitCheck, HostileAnswerOfTheBoardIsShownEscaped)
{
    unit.set("BOARD_INSTALLED", "2.1\x1b[2J\xff");
    EXPECT_EQ(fact("board_version"), "2.1\\x1b[2J\\xff");
}

// The package manager

TEST_F(UnitCheck, LockOfAnotherPackageToolIsAnErrorThatNamesTheProcess)
{
    for (const std::string lock :
         {"var/lib/apt/lists/lock", "var/lib/dpkg/lock-frontend", "var/lib/dpkg/lock", "var/cache/apt/archives/lock"}) {
        const LockHolder holder(unit.folder.path("root/" + lock));
        EXPECT_EQ(findings(), Lines{"error package-lock"}) << lock;
        EXPECT_THAT(what(), HasSubstr("Process " + std::to_string(holder.process()) +
                                      " holds the package manager's "
                                      "lock \"/" +
                                      lock + '"'));
    }
    EXPECT_EQ(findings(), Lines());
}

TEST_F(UnitCheck, UnfinishedPackagesAreErrors)
{
    unit.replaceTool("dpkg-query", R"(printf 'ii \tapt\nrc \told\nun \tnone\niF \tsolvik4-rh\niU \tlib\nitR\tbad\n')");
    EXPECT_EQ(findings(), Lines{"error package-half-configured"});
    EXPECT_EQ(what(), "The package manager has unfinished work: \"solvik4-rh\", \"lib\", \"bad\".");
}

TEST_F(UnitCheck, InterruptedRunOfThePackageManagerIsAnError)
{
    unit.put("var/lib/dpkg/updates/tmp.i", "");
    EXPECT_EQ(findings(), Lines());
    unit.put("var/lib/dpkg/updates/0123456789", "");
    EXPECT_EQ(what(), "The package manager has unfinished work: an interrupted run.");
    unit.replaceTool("dpkg-query", R"(printf 'iF \tsolvik4-rh\n')");
    EXPECT_EQ(what(), "The package manager has unfinished work: \"solvik4-rh\" and an interrupted run.");
}

TEST_F(UnitCheck, LocaleThatTranslatesThePackageToolIsAnError)
{
    unit.set("UNIT_ENVIRONMENT", "LANG=de_DE.UTF-8");
    unit.replaceTool("apt-cache", "[ \"$LANG\" = de_DE.UTF-8 ] || exit 1\n"
                                  "printf 'apt:\\n  Installiert:           2.6.1\\n  Installationskandidat: 2.6.1\\n'");
    EXPECT_EQ(findings(), Lines{"error policy-words"});
    EXPECT_THAT(what(), HasSubstr("locale \"LANG=de_DE.UTF-8\""));
    for (const char* oneWord : {"Installed: 2.6.1\n  Installationskandidat", "Installiert: 2.6.1\n  Candidate"}) {
        unit.replaceTool("apt-cache", "printf 'apt:\n  " + std::string(oneWord) + ": 2.6.1\n'");
        EXPECT_EQ(findings(), Lines{"error policy-words"}) << oneWord;
    }
}

TEST_F(UnitCheck, FreeSpaceThatCannotBeReadIsUnchecked)
{
    UnitSite site = unit.site();
    site.root = unit.folder.path("nowhere");
    unit.replaceTool("apt-config", R"(echo 'APT::Update::Error-Mode "any";')"); // told before
    EXPECT_THAT(check(site).findings, Contains("unchecked space-unknown"));
}

TEST(UnitDisk, SpaceForThePackageIsEnough)
{
    EXPECT_EQ(checkDisk(diskWith(200'000'000), 200'000'000), Lines());
    EXPECT_EQ(checkDisk(diskWith(200'000'000), 1), Lines());
}

TEST(UnitDisk, LessSpaceThanThePackageNeedsIsFull)
{
    EXPECT_EQ(checkDisk(diskWith(200'000'000), 200'000'001), Lines{"error disk-full"});
}

TEST(UnitDisk, NoRoomForAFileIsFull)
{
    struct statvfs system = diskWith(200'000'000);
    system.f_favail = 0;
    EXPECT_EQ(checkDisk(system, 0), Lines{"error disk-full"});
    system.f_files = 1;
    EXPECT_EQ(checkDisk(system, 0), Lines{"error disk-full"});
    system.f_files = 0; // files are not counted
    EXPECT_EQ(checkDisk(system, 0), Lines());
}

TEST(UnitDisk, LittleSpaceIsAWarning)
{
    EXPECT_EQ(checkDisk(diskWith(99'999'999), 0), Lines{"warning disk-almost-full"});
    EXPECT_EQ(checkDisk(diskWith(100'000'000), 0), Lines());
}

TEST(UnitDisk, DiskThatIsReadOnlyIsAnError)
{
    struct statvfs system = diskWith(200'000'000);
    system.f_flag = ST_RDONLY;
    EXPECT_EQ(checkDisk(system, 0), Lines{"error disk-read-only"});
}

// Mirrors

TEST_F(UnitCheck, MirrorsAreRefreshedPrivatelyAndWithoutTheUnitsHooks)
{
    // The real apt-get, with settings and a source that lie on the stand-in unit.
    const std::string root = unit.folder.path("root");
    unit.put("repository/Packages", "Package: solvik4-rh\nVersion: 1.4.0\nArchitecture: all\nFilename: ./none.deb\n"
                                    "Size: 1\nMaintainer: none\nDescription: none\n");
    unit.put("sources.list", "deb [trusted=yes] file:" + root + "/repository ./\n");
    unit.put("var/lib/apt/lists/old", "kept");
    const std::string hook = " { \"touch " + root + "/hook\"; }; ";
    unit.put("apt.conf", "Dir::Etc { sourcelist \"" + root +
                             "/sources.list\"; sourceparts \"-\"; main \"-\"; "
                             "parts \"-\"; };\nDir::State::status \"/dev/null\";\nDir::Cache \"" +
                             root +
                             "/cache\";\n"
                             "APT::Update { Pre-Invoke" +
                             hook + "Post-Invoke" + hook + "Post-Invoke-Success" + hook + "};\n");
    for (const std::string tool : {"apt-get", "apt-cache"}) {
        std::string script = "export PATH=/usr/bin:/bin APT_CONFIG=";
        unit.replaceTool(tool, script.append(root).append("/apt.conf\nexec ").append(tool).append(" \"$@\""));
    }
    EXPECT_EQ(check().report["facts"]["package_now"], "1.4.0");
    EXPECT_FALSE(fs::exists(root + "/hook"));
    EXPECT_EQ(std::distance(fs::directory_iterator(root + "/var/lib/apt/lists"), {}), 2); // with its lock
    EXPECT_TRUE(fs::is_empty(root + "/tmp"));

    // The updater's own refresh runs them.
    fs::create_directories(root + "/lists/partial");
    runCommand({"apt-get", "-o", "Dir::State::lists=" + root + "/lists", "update"},
               {"PATH=" + unit.folder.path("bin").string()}, 60s);
    EXPECT_TRUE(fs::exists(root + "/hook"));
}

TEST_F(UnitCheck, RefreshHasSettingsOfItsOwnAndTheUnitsLists)
{
    unit.put("var/lib/apt/lists/old", "kept\n");
    unit.replaceTool("apt-get",
                     oneMirror +
                         "PATH=/bin; cd \"${2%/*}/lists\" && cat ../apt.conf old >../../refresh && ls >>../../refresh");
    EXPECT_EQ(findings(), Lines());
    std::ostringstream refresh;
    refresh << std::ifstream(unit.folder.path("root/tmp/refresh")).rdbuf();
    compareWithKept(refresh.str());
    EXPECT_THAT(refresh.str(), HasSubstr("\nkept\nold\npartial\n"));
}

TEST_F(UnitCheck, RefreshThatFailsIsAnError)
{
    unit.replaceTool("apt-get", oneMirror + "echo 'E: Release file is not valid yet' >&2; exit 100");
    EXPECT_EQ(findings(), Lines{"error refresh-fails"});
}

TEST_F(UnitCheck, SilentMirrorIsAnErrorThatExplainsTheExitStatus)
{
    unit.set("MIRRORS_REFRESH", "unreachable");
    const CheckResult result = check();
    EXPECT_EQ(result.findings, Lines{"error mirror-silent"});
    EXPECT_THAT(result.report["findings"][0]["what"].get<std::string>(),
                HasSubstr("does not answer: \"Could not resolve 'mirror.invalid'\""));
    EXPECT_THAT(result.report["findings"][0]["effect"].get<std::string>(), HasSubstr("\"apt update\" ends with 0"));
}

TEST_F(UnitCheck, MirrorThatGivesNothingIsNotWaitedForToTheEnd)
{
    unit.replaceTool("apt-get", "case $* in *print-uris) echo \"'http://mirror.invalid/1' 1 0 \"; "
                                "echo \"'file:/lists/2' 2 0 \"; exit;; esac\nPATH=/bin exec sleep 60");
    UnitSite site = unit.site();
    site.silence = 100ms;
    const CheckResult result = check(site);
    EXPECT_EQ(result.findings, Lines{"unchecked mirrors-unknown"});
    EXPECT_THAT(result.report["findings"][0]["what"].get<std::string>(),
                HasSubstr("\"file:/lists/2\", \"mirror.invalid\""));
}

TEST_F(UnitCheck, MirrorThatGoesOnIsWaitedFor)
{
    const std::string settings = "while [ $# -gt 0 ]; do [ \"$1\" != -c ] || lists=${2%/*}/lists; shift; done\n";
    unit.replaceTool("apt-get", oneMirror + settings +
                                    "for n in 1 2 3 4 5 6 7 8 9 10; do echo $n >>$lists/partial/list; "
                                    "PATH=/bin sleep 0.3; done");
    UnitSite site = unit.site();
    site.silence = 2s;
    EXPECT_EQ(check(site).findings, Lines());
    site.refresh = 1s;
    EXPECT_EQ(check(site).findings, Lines{"unchecked mirrors-unknown"});
}

TEST_F(UnitCheck, TerminalIsToldWhatIsWaitedFor)
{
    unit.replaceTool("apt-cache", "[ \"$1\" != policy ] || PATH=/bin sleep 2.2");
    UnitSite site = unit.site();
    std::ostringstream terminal;
    site.waits = &terminal;
    check(site);
    EXPECT_THAT(terminal.str(), HasSubstr("harl-updater-tool: waiting for apt-cache, 10 s at most\n"));
}

TEST_F(UnitCheck, SourcesThatCannotBeReadAreAnError)
{
    unit.replaceTool("apt-get", "echo 'E: Malformed entry 1 in list file' >&2; exit 100");
    EXPECT_EQ(findings(), Lines{"error mirrors-unreadable"});
    unit.removeTool("apt-get");
    EXPECT_EQ(findings(), Lines{"unchecked mirrors-unreadable"});
}

TEST_F(UnitCheck, WithoutTemporaryFolderTheMirrorsAreUnchecked)
{
    unit.remove("tmp");
    EXPECT_EQ(findings(), Lines{"unchecked mirrors-unknown"});
}
