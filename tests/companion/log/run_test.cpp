/// What is told of runs whose logs are cut, pasted or not those of one whole run: what such a log proves, and no more.

#include "golden_logs.h"
#include "log/catalogue.h"
#include "log/json.h"
#include "log/run.h"
#include "log/text.h"
#include "texts.h"

#include <algorithm>
#include <cctype>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

namespace
{

using Json = nlohmann::ordered_json;

/// The log that `script` describes. A line "5 updateMirrors OK" is the record of that message 5 s after the log's
/// beginning, "5 updateMirrors" one of an empty message, "5 updateMirrors ?" one whose message is missing; a record
/// that ends with "<" is where the log is cut. All other lines are those of other programs.
std::string logOf(const std::string& script)
{
    std::string log;
    for (const std::string& line : linesOf(script)) {
        if (line.empty() || std::isdigit(static_cast<unsigned char>(line.front())) == 0) {
            log += line + '\n';
            continue;
        }
        std::istringstream words(line);
        std::int64_t seconds = 0;
        std::string operation;
        std::string message;
        words >> seconds >> operation;
        words.ignore(1);
        std::getline(words, message);
        std::string time = dateText(seconds);
        std::replace(time.begin(), time.end(), ':', '-');
        log.append("Updater | ").append(time).append("\t1\ta.cpp:1\tvoid ").append(operation).append("()\n");
        log += message == "?" ? "" : "\t\t\t" + message + '\n';
    }
    return log.substr(0, log.find('<'));
}

std::string times(int count, const std::string& text)
{
    std::string all;
    for (int index = 0; index < count; ++index) {
        all += text;
    }
    return all;
}

/// Lines of one letter each, from the `first` one of the alphabet on.
std::string letters(int first, int count)
{
    std::string lines;
    for (int index = first; index < first + count; ++index) {
        lines.append(1, static_cast<char>('a' + index)).append(1, '\n');
    }
    return lines;
}

/// What --json tells of each of the log's runs.
Json toldOf(const std::string& log)
{
    Json told = Json::array();
    readRuns(log, [&](const Run& run) { told.push_back(runToJson(run, "a.log")); });
    return told;
}

/// A value in what --json tells, null where it is not there.
struct Fact
{
    std::string path; ///< in the log's only run; one that begins with a number: in that run, from 0
    Json value;
};

struct Row
{
    std::string name;
    std::string script;
    std::vector<Fact> facts;
};

void PrintTo(const Row& row, std::ostream* out)
{
    *out << row.name;
}

class LogOfRun : public testing::TestWithParam<Row>
{
};

/// What the catalogue says of a gap.
std::string missing(const char* gap)
{
    return sharedText(gap, {}, "gaps");
}

// Pieces of a run
const std::string command = "0 runProcess Running command: apt update\n";
const std::string packageSame = "0 checkUpdate NWM_UM_NO_UPDATES 1 == 1\n";
const std::string packageDiffers = "0 checkUpdate NWM_UM_UPDATE_FOUND: 1 -> 2\n";
const std::string installBegins = "0 installUpdate\n"
                                  "0 runProcess Running command: apt --assume-yes install solvik4-rh\n";
const std::string installed = installBegins + "0 runProcess Exit code:0\n";
const std::string askBoard = "0 runProcess Running command: ssh board\n0 runProcess Exit code:0\n";
const std::string listStick = "0 runProcess Running command: ls /root/USB_MOUNT/debs/QUORB/armhf/\n"
                              "0 runProcess Exit code:0\n";
const std::string boardSame = "0 checkQuorbUpdate QUORB up to date\n";
const std::string boardDiffers = "0 checkQuorbUpdate Update found: 3 -> 4\n";
const std::string boardUnread = "0 checkQuorbUpdate Failed to checkUpdate\n";
const std::string upload = "0 uploadQuorbFiles scp files\n";
const std::string uploadFails = "0 uploadQuorbFiles Uploading failed. Trying again. \n";
const std::string script = "0 installQuorbUpdate ssh script\n";
const std::string wait = "0 installQuorbUpdate Starts sleeping for 13mins\n";
const std::string waited = " installQuorbUpdate Sleeping for 13mins ended up\n";
const std::string marker = "0 updateRemoteHead removedrm marker\n";
const std::string result = "0 resultCallback\n";
const std::string error = "0 errorCallback\n";
const std::string shown = "0 deinitRemoteHead Giving users 30 Secs\n";
const std::string mainHead = "0 initMainHead\n";
const std::string mainMarker = "0 initMainHead removedrm marker\n";
const std::string version = "0 main TavrenUpdater version: 1\n";
const std::string panelFails = "0 turnOn system returned false: i2cset -y 0 0x07 0x12 c ; i2cset -y 0 0x07 ";
const std::string notAllowed = "prepare: it cannot be finished: the updater is not run\n";
const std::string exited = "harl-updater.service: Main process exited, code=killed, status=9/KILL\n";

std::vector<Fact> outcome(const char* name)
{
    return {{"outcome", name}};
}

const Row outcomes[] = {
    {"ErrorAlone", error, outcome("failed")},
    {"ErrorAfterUnreadBoard", boardUnread + error, outcome("check-failed")},
    {"ResultAlone", result, outcome("passed")},
    {"ResultAfterPackageSame", packageSame + result, outcome("passed")},
    {"ResultAfterBoardSame", boardSame + result, outcome("passed")},
    {"ResultAfterBothSame", packageSame + boardSame + result, outcome("no-update")},
    {"ResultAfterPackageSameAndUnreadBoard", packageSame + boardUnread + result, outcome("no-update")},
    {"ResultAfterPackageDiffers", packageDiffers + result, outcome("updated")},
    {"ResultAfterBoardDiffers", boardDiffers + result, outcome("updated")},
    {"ResultAfterMarker", marker + result, outcome("updated")},
    {"ResultAfterInstallation", installBegins + result, outcome("updated")},
    {"ResultAfterUpload", upload + result, outcome("updated")},
    {"ResultAfterWait", wait + result, outcome("updated")},
    {"ShownAlone", shown, outcome("none")},
    {"ShownAfterPackageSame", packageSame + shown, outcome("none")},
    {"ShownAfterBoardSame", boardSame + shown, outcome("none")},
    {"ShownAfterUnreadBoard", boardUnread + shown, outcome("none")},
    {"ShownAfterBothSame", packageSame + boardSame + shown, outcome("no-update")},
    {"ShownAfterPackageSameAndUnreadBoard", packageSame + boardUnread + shown, outcome("no-update")},
    {"ShownAfterPackageSameAndBoardDiffers", packageSame + boardDiffers + shown, outcome("none")},
    {"ShownAfterMarker", marker + shown, outcome("updated")},
    {"ShownAfterScript", script + shown, outcome("updated")},
    {"ShownAfterInstallation", installed + shown, outcome("none")},
    {"ShownAfterInstallationAndBoardSame", installed + boardSame + shown, outcome("updated")},
    {"ShownAfterInstallationAndUnreadBoard", installed + boardUnread + shown, outcome("check-failed")},
    {"EndedByItselfAfterBothSame",
     packageSame + boardSame + "0 main AFTER UPDATE\n",
     {{"outcome", "no-update"}, {"ended", "by-itself"}}},
    {"NothingShownAfterBothSame", packageSame + boardSame, outcome("none")},
    {"RefusedMirrors",
     "0 updateMirrors\n" + command + "0 runProcess Exit code:7\n",
     {{"outcome", "mirrors-failed"}, {"failure/name", "mirrors-failed"}}},
    {"RefusedInstallation",
     installBegins + "0 runProcess Exit code:1\n",
     {{"outcome", "package-failed"}, {"steps/0/result", "unfinished"}}},
    {"UnclearBoardVersions",
     askBoard + listStick + "0 checkQuorbUpdate 2.1.0 2.2.0\n" + boardUnread + error + "0 stopUpdater\n",
     {{"outcome", "check-failed"}, {"failure/name", "board-not-read"}}},
    {"NoBoardVersions",
     askBoard + listStick + "0 checkQuorbUpdate\n" + boardUnread + error,
     {{"outcome", "check-failed"}, {"failure/name", "board-version-not-read"}}},
    {"MainHeadUnreadBoard", mainHead + boardUnread, outcome("check-failed")},
    {"MainHeadNothingRemoved", mainHead + packageDiffers, outcome("none")},
    {"MainHeadPackageDiffers", mainHead + packageDiffers + mainMarker, outcome("update-offered")},
    {"MainHeadBoardDiffers", mainHead + boardDiffers + mainMarker, outcome("update-offered")},
    {"MainHeadTeamViewerRequested", mainHead + "0 checkTVUpdate Teamviewer install is required\n" + mainMarker,
     outcome("update-offered")},
    {"MainHeadPackageSame", mainHead + packageSame + mainMarker, outcome("passed")},
    {"MainHeadBothSame", mainHead + packageSame + boardSame + mainMarker, outcome("passed")},
    {"MainHeadNoTeamViewer", mainHead + "0 checkTVUpdate No need to install Teamviewer\n" + mainMarker,
     outcome("passed")},
    {"MainHeadInstalls",
     mainHead + packageDiffers + mainMarker + "0 updateMainHead now call install DH udate\n",
     {{"outcome", "none"}, {"head", "main"}}},
    {"MainHeadOfItsInstallationAlone", "0 updateMainHead now call install QUORB udate\n", {{"head", "main"}}},
    {"MainHeadOfTeamViewerAlone", "0 checkTVUpdate No need to install Teamviewer\n", {{"head", "main"}}},
    {"MainHeadOfItsPackageAlone", "0 checkUpdate apt-cache policy solvik4-dh\n", {{"head", "main"}}},
    {"MainHeadOfItsCommandAlone",
     "0 runProcess Running command: apt --assume-yes install solvik4-dh\n",
     {{"head", "main"}}},
    {"RemoteHeadWhoseToolNamesTheOtherPackage",
     installBegins + "0 runProcess Exit code:100\n0 installUpdate 100solvik4-rh breaks solvik4-dh\n",
     {{"head", "remote"}}},
};

const Row steps[] = {
    {"WithoutItsEnd",
     "0 checkUpdate apt-cache policy solvik4-rh\n1 checkQuorbUpdate QUORB up to date\n",
     {{"steps/0/result", "untold"}, {"steps/0/took_s", 1}}},
    {"CommandWithItsCodeAlone",
     "0 updateMirrors\n" + command + "0 runProcess Exit code:0\n" + packageSame,
     {{"steps/0/result", "done"}, {"steps/0/status", 0}}},
    {"UploadBeforeScript", upload + script, {{"steps/0/result", "done"}, {"steps/0/actions/0/status", "exit 0"}}},
    {"UploadBeforeWait", upload + wait, {{"steps/0/result", "done"}}},
    {"UploadBeforeError", upload + error, {{"steps/0/result", "untold"}, {"steps/0/actions/0/status", ""}}},
    {"NineteenFailedAttempts",
     upload + times(19, uploadFails) + error,
     {{"outcome", "failed"},
      {"steps/0/result", "untold"},
      {"steps/0/actions/18/took_s", 0},
      {"steps/0/actions/19/status", ""}}},
    {"TwentyFailedAttempts",
     upload + times(20, uploadFails) + error,
     {{"outcome", "board-failed"},
      {"steps/0/result", "failed"},
      {"steps/0/failed_attempts", 20},
      {"steps/0/actions/19/status", "failed"},
      {"steps/0/actions/20", nullptr}}},
    {"StepWithoutACommand", "0 updateMirrors\n", {{"steps/0/actions/0", nullptr}}},
    {"RepeatedRecord", "0 stopHARL\n0 stopHARL\n", {{"steps/0/actions/1", nullptr}}},
    {"CodeOfACommand", installed, {{"steps/0/result", "done"}, {"steps/0/actions/0/status", "exit 0"}}},
    {"CodeWithoutItsCommand", "0 updateMirrors\n0 runProcess Exit code:5\n", {{"steps/0/status", nullptr}}},
    {"CodeAfterACode",
     "0 updateMirrors\n" + command + "0 runProcess Exit code:0\n0 runProcess Exit code:5\n",
     {{"steps/0/status", 0}}},
    {"CodeAfterTheEnd",
     "0 updateMirrors OK\n" + command + "0 runProcess Exit code:5\n",
     {{"steps/0/status", nullptr}, {"steps/0/result", "done"}}},
    {"CodeInAWord",
     "0 updateMirrors NOT OK 7\n",
     {{"steps/0/status", 7}, {"steps/0/word", "NOT OK 7"}, {"steps/0/detail", "FAILED: exit 7"}}},
    {"WordWithoutACode", "0 updateMirrors NO_INTERNET_ERROR_CODE\n", {{"steps/0/status", nullptr}}},
    {"CodeBeforeAnOutput",
     installBegins + "0 runProcess Exit code:1\n0 installUpdate 123 packages\n0 installUpdate 123 packages\n",
     {{"steps/0/status", 1}, {"steps/0/tools_said/count", 1}, {"steps/0/tools_said/shown/0", "23 packages"}}},
    {"OutputWithoutACode",
     installBegins + "0 installUpdate 100E: gone\n",
     {{"steps/0/status", nullptr}, {"steps/0/tools_said/shown/0", "100E: gone"}}},
    {"CodeWithoutAnOutput", installBegins + "0 installUpdate 100\n", {{"steps/0/tools_said/count", 0}}},
    {"FirstOfTwoWords",
     "0 uploadQuorbFiles Failed to upload QUORB with 20 tries. Closing\n"
     "1 installQuorbUpdate Failed inside uploadQuorbFiles\n",
     {{"steps/0/word", "Failed to upload QUORB with 20 tries. Closing"}, {"steps/0/took_s", 0}}},
    {"Marker",
     version + "7 updateRemoteHead removedrm marker\n",
     {{"steps/1/name", "remove-marker"},
      {"steps/1/line", 3},
      {"steps/1/start", "1970-01-01T00:00:07"},
      {"steps/1/result", "done"},
      {"steps/1/actions/0/text", "rm /root/RESOURCES/tavren1stboot"},
      {"steps/1/actions/0/start", "1970-01-01T00:00:07"},
      {"steps/1/actions/0/took_s", 0}}},
    {"WaitWithoutItsEnd", wait + marker, {{"steps/0/result", "done"}, {"steps/0/actions/0/status", ""}}},
    {"OutcomeShown", "0 resultCallback\n5 deinit\n7" + shown.substr(1), {{"steps/0/took_s", 5}}},
    {"MainHeadsInstallationGoesOn",
     "0 updateMainHead\n0 installTVUpdate\n1 deinit\n",
     {{"steps/0/result", "unfinished"}}},
    {"LowestOfTwoPhrases",
     "0 checkQuorbUpdate ?\n" + askBoard.substr(0, askBoard.find("0 runProcess Exit")) +
         "Permission denied (publickey).\nHost key verification failed.\nPermission denied (publickey).\n"
         "0 runProcess Exit code:255\n" +
         boardUnread + error,
     {{"failure/name", "board-host-key"}}},
    {"FailedAttemptAlone",
     uploadFails,
     {{"steps/0/failed_attempts", 1},
      {"steps/0/actions/0", nullptr},
      {"cannot_tell/2", "Why 1 upload attempt failed."}}},
    {"OneOfTwoStatuses",
     "0 startHARL\n1 startHARL 256\n2 stopUpdater\n",
     {{"steps/0/result", "untold"}, {"steps/0/actions/0/status", ""}, {"application_started", nullptr}}},
    {"StickStaysMounted",
     "0 startHARL\n1 startHARL 8192\n2 startHARL 0\n2 startHARL 256\n12 stopUpdater\n",
     {{"steps/0/result", "failed"},
      {"steps/0/actions/0/status", "exit 32"},
      {"steps/0/actions/1/text", "systemctl start harl"},
      {"steps/0/actions/1/status", "exit 0"},
      {"steps/0/actions/2/text", "wait 10 s"},
      {"steps/0/actions/2/took_s", 10},
      {"steps/0/actions/3", nullptr},
      {"application_started", true}}},
    {"CodeOfAnotherStepInGiveBack",
     "0 startHARL\n0 runProcess Exit code:1\n1 startHARL 8192\n2 startHARL 0\n3 runProcess Exit code:2\n12 stopUpdater\n",
     {{"steps/0/actions/0/status", "exit 32"},
      {"steps/0/actions/2/status", ""},
      {"besides/0/name", "stick-not-released"},
      {"besides/1", nullptr}}},
    {"ApplicationNotStarted",
     "0 startHARL 0\n2 startHARL 256\n12 stopUpdater\n",
     {{"steps/0/result", "failed"},
      {"steps/0/actions/0/text", "umount /root/USB_MOUNT/"},
      {"application_started", false}}},
    {"StatusesLost",
     "0 startHARL\n1 startHARL -1\n2 startHARL -1\n12 stopUpdater\n",
     {{"steps/0/result", "untold"}, {"application_started", nullptr}}},
    {"UpdaterStoppedByItself",
     "0 stopUpdater\n1 stopUpdater 0\n",
     {{"ended", "by-itself"}, {"steps/0/result", "done"}, {"steps/0/took_s", 1}}},
    {"SecondStatus", "0 stopHARL\n1 stopHARL 0\n2 stopHARL 256\n", {{"steps/0/status", 0}, {"steps/0/took_s", 1}}},
    {"CutInANumber", "0 stopHARL\n1 stopHARL 0<", {{"steps/0/result", "unfinished"}, {"steps/0/status", nullptr}}},
    {"CutBehindAWord", "0 updateMirrors\n1 updateMirrors OK<", {{"steps/0/result", "done"}, {"steps/0/word", ""}}},
    {"CutBeforeAMessage", "0 stopHARL <", {{"steps/0", nullptr}}},
};

const Row ofTime[] = {
    {"OneDay", "0 stopHARL\n86400 stopHARL 0\n", {{"took_s", 86400}, {"clock_jumps", 0}}},
    {"MoreThanOneDay", "0 stopHARL\n86401 stopHARL 0\n", {{"took_s", 0}, {"clock_jumps", 1}}},
    {"Backwards",
     "5 stopHARL\n4 stopHARL 0\n",
     {{"took_s", 0},
      {"clock_jumps", 1},
      {"cannot_tell/2",
       "How long this run took: the clock was set 1 time while it went on. Times do not include that."}}},
    {"WaitLate", wait + "840" + waited, {{"took_s", 840}, {"clock_jumps", 0}}},
    {"WaitTooLate", wait + "841" + waited, {{"took_s", 780}, {"clock_jumps", 1}}},
    {"WaitEarly", wait + "779" + waited, {{"took_s", 779}, {"clock_jumps", 0}}},
    {"WaitTooEarly", wait + "778" + waited, {{"took_s", 780}, {"clock_jumps", 1}}},
    {"WaitWithoutItsBeginning", script + "781" + waited, {{"took_s", 781}, {"clock_jumps", 0}}},
    {"EndOfAWaitAfterTheStart", version + "5" + waited, {{"took_s", 5}, {"clock_jumps", 0}}},
    {"EndOfAWaitAlone", "5" + waited, {{"took_s", 0}, {"clock_jumps", 0}}},
    {"RecordInTheWait",
     wait + "1" + panelFails.substr(1) + "0x1 c\n5000" + waited,
     {{"took_s", 780}, {"clock_jumps", 1}}},
    {"RecordAfterTheWaitsTime",
     wait + "80" + panelFails + "0x1 c\n900" + waited,
     {{"took_s", 800}, {"clock_jumps", 1}}},
    {"RepeatedBeginningOfAWait", wait + "5" + wait.substr(1), {{"took_s", 5}, {"clock_jumps", 0}}},
};

const Row runs[] = {
    {"Version", version + version, {{"0/failure/name", "cut-short"}, {"1/first_line", 3}}},
    {"BeginningWithoutVersion",
     "0 stopHARL\n0 main BEFORE UPDATE\n",
     {{"1/first_line", 3}, {"1/beginning_missing", true}}},
    {"MainHeadsChecks",
     mainHead + "0 stopHARL\n0 startHARL\n" + mainHead,
     {{"0/beginning_missing", false}, {"1/first_line", 7}, {"1/beginning_missing", false}}},
    {"StepBefore", "0 updateMirrors\n0 stopHARL\n", {{"1/first_line", 3}}},
    {"MainHeadsStepBefore", mainHead + "0 updateMirrors\n0 stopHARL\n", {{"1/first_line", 5}}},
    {"InstallationAfterBoard", wait + installBegins, {{"1/first_line", 3}}},
    {"MainHeadsInstallationAfterBoard",
     "0 updateMainHead\n" + wait + "0 installTVUpdate\n" + installBegins,
     {{"steps/2/name", "install-package"}}},
    {"MainHeadsInstallationAfterGiveBack", "0 updateMainHead\n0 startHARL\n" + installBegins, {{"1/first_line", 5}}},
    {"StepAfterTheServicesWord",
     "0 stopHARL\n" + exited + "1 processUpdate\n2 updateMirrors\n",
     {{"0/ended", "early"},
      {"0/service_manager_said/count", 1},
      {"0/last_line", 5},
      {"1/first_line", 6},
      {"1/ended", "not-seen"}}},
    {"NotAllowed",
     notAllowed,
     {{"begin", "1970-01-01T00:00:00"},
      {"first_line", 1},
      {"last_line", 1},
      {"ended", "early"},
      {"failure/name", "run-not-allowed"},
      {"failure/step", nullptr},
      {"service_manager_said/count", 1}}},
    {"NotAllowedAfterARun",
     "5 stopHARL\n" + notAllowed + "6 stopHARL\n",
     {{"1/begin", "1970-01-01T00:00:05"}, {"1/first_line", 3}, {"1/last_line", 3}, {"2/first_line", 4}}},
    {"LinesOfOthers",
     "0 updateMirrors\nStarting it\nNov 21 07:35:33 unit systemd[1]: Started it\n",
     {{"other_lines", 1}, {"last_line", 3}, {"service_manager_said/count", 0}, {"ended", "not-seen"}}},
    {"UnitNotWell", "0 stopHARL\nverify: the unit is not well: a\n", {{"unit_after_run", "the unit is not well: a"}}},
    {"UnitOpen",
     "0 stopHARL\nverify: not everything could be checked: a\n",
     {{"unit_after_run", "not everything could be checked: a"}, {"besides/0/step", nullptr}}},
    {"ServicesWordOnTheStick",
     "0 stopHARL\ngive-back: the stick is in use\n",
     {{"unit_after_run", nullptr}, {"ended", "not-seen"}}},
    {"ServicesWordAfterTheEnd", "0 stopUpdater\n" + exited, {{"ended", "by-service-manager"}}},
    {"OneTorn", "\t\t\tOK\n0 stopHARL\n", {{"cannot_tell/2", "What 1 torn record said (the first at line 1)."}}},
    {"TornBefore",
     "a tool's\n\t\t\tOK\n\t\t\tOK\n0 stopHARL\n",
     {{"torn_records", 2}, {"cannot_tell/2", "What 2 torn records said (the first at line 2)."}}},
    {"TornIn",
     "0 stopHARL\n0 stopHARL ?\n0 stopHARL ?\n" + version,
     {{"0/torn_records", 2},
      {"0/cannot_tell/2", "What 2 torn records said (the first at line 3)."},
      {"1/torn_records", 0}}},
};

const Row panel[] = {
    {"Flashing", panelFails + "0x1 c\n" + packageSame + boardSame + result, {{"panel/MAIN", "pass"}}},
    {"Passed", packageSame + boardSame + result + panelFails + "0x2 c\n", {{"panel/MAIN", nullptr}}},
    {"Failed", boardUnread + error + panelFails + "0x8 c\n", {{"panel/MAIN", nullptr}}},
};

const Row problems[] = {
    {"Unknown", error, {{"failure/name", "unknown"}, {"failure/step", "show-outcome"}}},
    {"EndedEarly", result + exited, {{"outcome", "passed"}, {"failure/name", "ended-early"}}},
    {"EndedEarlyAtALaterStep", version + "0 stopHARL\n" + exited, {{"failure/step", "stop-application"}}},
    {"OutcomeMissing", "0 stopHARL\n0 stopUpdater\n", {{"failure/name", "outcome-missing"}}},
    {"EndMissing", result, {{"failure/name", "end-missing"}, {"cannot_tell/2", missing("outcome")}}},
    {"MainHeadsEndMissing",
     mainHead + packageSame + mainMarker,
     {{"failure/name", "end-missing"}, {"cannot_tell/1", missing("offer")}}},
    {"MainHeadsOffer", mainHead + packageDiffers + mainMarker, {{"failure/name", "unfinished"}}},
    {"MainHeadUnfinished", mainHead + packageSame, {{"failure/name", "unfinished"}}},
    {"MirrorsOfNoInternet",
     "0 updateMirrors NO_INTERNET_ERROR_CODE\n",
     {{"failure/name", "mirrors-unreachable"}, {"failure/step", "refresh-mirrors"}}},
    {"PackageWithoutACode", "0 checkUpdate NWM_UM_CHECK_UPDATE_FAILED\n", {{"failure/name", "package-not-read"}}},
    {"ExactCodeBeforeAPhrase",
     installBegins + "dpkg: you must manually run it\n0 runProcess Exit code:127\n",
     {{"failure/name", "package-tool-missing"}}},
    {"PhraseBeforeAGeneralCode",
     installBegins + "dpkg: you must manually run it\n0 runProcess Exit code:100\n",
     {{"failure/name", "package-interrupted"}, {"besides/0", nullptr}}},
    {"StatusesLostInUpload",
     "0 stopHARL -1\n" + upload + "0 uploadQuorbFiles Failed to upload QUORB\n",
     {{"failure/name", "statuses-lost"}, {"besides/0", nullptr}}},
    {"StatusesLost",
     "0 stopHARL -1\n0 updateMirrors NOT OK 7\n",
     {{"failure/name", "mirrors-failed"},
      {"besides/0/name", "statuses-lost"},
      {"besides/0/step", "stop-application"},
      {"besides/1", nullptr}}},
    {"FirstStep",
     "0 stopHARL\nhand-over: systemctl: no end within 90 s\n0 stopHARL 256\n0 updateMirrors\n",
     {{"besides/0/name", "time-used-up"},
      {"besides/0/step", "stop-application"},
      {"besides/1/name", "application-not-stopped"},
      {"besides/1/step", "stop-application"}}},
    {"GiveBack",
     result + "0 startHARL\n0 startHARL 256\n0 startHARL 256\n0 stopUpdater\n",
     {{"failure", nullptr},
      {"besides/0/name", "stick-not-released"},
      {"besides/1/name", "application-not-started"},
      {"besides/2", nullptr}}},
    {"OnePanelCommand",
     version + panelFails + "0x1 c\n",
     {{"besides/0/name", "panel-failed"}, {"besides/0/step", "start"}}},
    {"SoundOfAStep",
     version + result + "0 play Failed to play a sound\n",
     {{"besides/0/name", "sound-failed"}, {"besides/0/step", "show-outcome"}}},
    {"SoundAlone",
     "0 stopHARL\n0 play Failed to play a sound\n",
     {{"besides/0/name", "sound-failed"}, {"besides/0/step", nullptr}}},
    {"StartMissing",
     result + "0 stopUpdater\n",
     {{"failure", nullptr}, {"besides/0/name", "start-missing"}, {"besides/0/step", nullptr}}},
    {"StartNotTold",
     result + "0 startHARL\n0 startHARL 0\n0 stopUpdater\n",
     {{"besides/0/name", "start-missing"}, {"besides/0/step", "give-back"}}},
    {"NoStep", "0 main BEFORE UPDATE\n", {{"failure", nullptr}, {"besides/0", nullptr}}},
    {"Repaired", "prepare: the installation is finished\n" + version, {{"besides/0/name", "installation-repaired"}}},
    {"RepairFailed", "prepare: a is still unfinished\n" + version, {{"besides/0/name", "repair-failed"}}},
    {"ShownAgain", version + "give-back: the outcome was not shown\n", {{"besides/0/name", "outcome-shown-again"}}},
    {"PanelRefused", version + "give-back: the panel does not take it\n", {{"besides/0/name", "outcome-not-shown"}}},
    {"StickInUse", version + "give-back: the stick is in use\n", {{"besides/0/name", "stick-in-use"}}},
    {"WentOn", version + "give-back: going on beside it\n", {{"besides/0/name", "tool-still-at-work"}}},
    {"NotStarted", version + "give-back: harl cannot be started\n", {{"besides/0/name", "application-not-started"}}},
    {"GapsAfterAnUpdate",
     installed + upload + uploadFails + script + marker + error,
     {{"cannot_tell/2", "Whether the package is really installed: exit code 0 also means a command that was killed or "
                        "could not be started. On the unit: dpkg -s solvik4-rh."},
      {"cannot_tell/3", "Why 1 upload attempt failed."},
      {"cannot_tell/4", missing("board-runs")},
      {"cannot_tell/5", missing("marker")},
      {"cannot_tell/6", missing("tools-words")},
      {"cannot_tell/7", missing("feedback")}}},
    {"GapsBeforeAResult",
     "\t\t\tOK\n" + result,
     {{"cannot_tell/2", missing("outcome")}, {"cannot_tell/3", "What 1 torn record said (the first at line 1)."}}},
    {"WordsOfTools", "0 updateMirrors\na tool's\n0 updateMirrors NOT OK 7\n", {{"cannot_tell/2", missing("feedback")}}},
};

const std::string passed = packageSame + boardSame + result;
const std::string started = "0 startHARL\n0 startHARL 0\n0 startHARL 0\n";
const std::string ended = "0 stopUpdater\n";
const Row ends[] = {
    {"Well", passed + started + ended, {{"went_well", true}}},
    {"WellByItself", passed + started + ended + "0 stopUpdater 0\n", {{"went_well", true}}},
    {"NotSeen", passed + started, {{"went_well", false}}},
    {"Early", passed + started + exited, {{"went_well", false}}},
    {"NotStarted", passed + "0 startHARL\n0 startHARL 0\n0 startHARL 256\n" + ended, {{"went_well", false}}},
    {"StartNotTold", passed + ended, {{"went_well", false}}},
    {"NoOutcome", started + ended, {{"went_well", false}}},
    {"Failed", error + started + ended, {{"went_well", false}}},
    {"FailureShown",
     passed + started + ended + "give-back: the updater ended before it had an outcome\n",
     {{"went_well", false}}},
};

const std::string twoSteps = "0 installUpdate\n" + upload;
const Row limits[] = {
    {"Steps",
     "0 updateMainHead\n" + times(32, twoSteps),
     {{"steps/63/name", "upload-board"}, {"cannot_tell/2", nullptr}}},
    {"MoreSteps",
     "0 updateMainHead\n" + times(32, twoSteps) + "0 installUpdate\n",
     {{"steps/63/name", "install-package"},
      {"steps/64", nullptr},
      {"cannot_tell/2", "1 step more than a run has: left out here."}}},
    {"MoreStepsInATornLog",
     "0 updateMainHead\n0 stopHARL -1\n" + times(32, twoSteps) + "9 installUpdate ?\n8 uploadQuorbFiles scp files\n",
     {{"cannot_tell/0", missing("beginning")},
      {"cannot_tell/1", missing("end")},
      {"cannot_tell/2", "What 1 torn record said (the first at line 133)."},
      {"cannot_tell/3", "3 steps more than a run has: left out here."},
      {"cannot_tell/4",
       "How long this run took: the clock was set 1 time while it went on. Times do not include that."},
      {"cannot_tell/5", missing("statuses")},
      {"cannot_tell/6", nullptr}}},
    {"Actions",
     "0 updateMirrors\n" + times(33, command),
     {{"steps/0/actions/31/text", "apt update"}, {"steps/0/actions/32", nullptr}}},
    {"Lines",
     "0 updateMirrors\n" + letters(0, 10) + "again\nagain\n" + letters(10, 10),
     {{"steps/0/tools_said/count", 22},
      {"steps/0/tools_said/shown/9", "j"},
      {"steps/0/tools_said/shown/10", "... (2 lines left out)"},
      {"steps/0/tools_said/shown/11", "k"}}},
    {"Text", "0 main TavrenUpdater version: " + times(400, "x") + '\n', {{"updater", times(400, "x")}}},
    {"LongerText", "0 main TavrenUpdater version: " + times(401, "x") + '\n', {{"updater", times(400, "x") + "..."}}},
};

} // namespace

TEST_P(LogOfRun, TellsWhatItProves)
{
    const Json told = toldOf(logOf(GetParam().script));
    for (const auto& [path, value] : GetParam().facts) {
        const bool one = std::isdigit(static_cast<unsigned char>(path.front())) == 0;
        EXPECT_TRUE(!one || told.size() == 1);
        const Json::json_pointer place((one ? "/0/" : "/") + path);
        EXPECT_EQ(told.contains(place) ? told.at(place) : Json(), value) << path << " of " << told.dump(2);
    }
}

const auto nameOf = [](const testing::TestParamInfo<Row>& test) { return test.param.name; };
INSTANTIATE_TEST_SUITE_P(Outcome, LogOfRun, testing::ValuesIn(outcomes), nameOf);
INSTANTIATE_TEST_SUITE_P(Step, LogOfRun, testing::ValuesIn(steps), nameOf);
INSTANTIATE_TEST_SUITE_P(Time, LogOfRun, testing::ValuesIn(ofTime), nameOf);
INSTANTIATE_TEST_SUITE_P(Run, LogOfRun, testing::ValuesIn(runs), nameOf);
INSTANTIATE_TEST_SUITE_P(Panel, LogOfRun, testing::ValuesIn(panel), nameOf);
INSTANTIATE_TEST_SUITE_P(Problem, LogOfRun, testing::ValuesIn(problems), nameOf);
INSTANTIATE_TEST_SUITE_P(End, LogOfRun, testing::ValuesIn(ends), nameOf);
INSTANTIATE_TEST_SUITE_P(Limit, LogOfRun, testing::ValuesIn(limits), nameOf);

TEST(LogCatalogue, EntryIsPrintedWhole)
{
    std::ostringstream text;
    EXPECT_TRUE(printCatalogue("board-host-key", false, text));
    EXPECT_EQ(text.str(), "board-host-key\n"
                          "  Reported: ERROR_CHECK_UPDATE, ERROR_INSTALL_QUORB\n"
                          "  In step:  check-board, upload-board\n"
                          "  Cause:    The board showed a different host key from the one this head knows: it was "
                          "replaced or\n            set up anew.\n"
                          "  Do now:   Make sure that it is the right board, then renew its key: ssh-keygen -R "
                          "192.168.9.2, log\n            in once, run the update again.\n"
                          "  Says so:  ssh: HOST IDENTIFICATION HAS CHANGED\n"
                          "  Says so:  ssh: Host key verification failed\n");
    std::ostringstream json;
    EXPECT_TRUE(printCatalogue("board-read-only", true, json));
    EXPECT_EQ(json.str().rfind("{\n  \"command\": \"explain\",\n", 0), 0U) << json.str();
    const Json told = Json::parse(json.str());
    EXPECT_EQ(told.at("version"), 1);
    const Json& entry = told.at("failures").at(0);
    EXPECT_EQ(told.at("failures").size(), 1U);
    EXPECT_EQ(entry.at("name"), "board-read-only");
    EXPECT_EQ(entry.at("reported"), "ERROR_INSTALL_QUORB");
    EXPECT_EQ(entry.at("steps"), Json({"upload-board"}));
    EXPECT_EQ(entry.at("phrases"),
              Json({{{"tool", "scp"}, {"words", "Read-only file system"}, {"steps", {"upload-board"}}}}));
    EXPECT_TRUE(entry.contains("cause") && entry.contains("remedy"));
    std::ostringstream plain;
    EXPECT_TRUE(printCatalogue("panel-failed", true, plain));
    EXPECT_EQ(Json::parse(plain.str()).at("failures").at(0).at("phrases"), Json::array());
}

TEST(LogCatalogue, UnknownEntryPrintsNothing)
{
    for (const bool json : {false, true}) {
        std::ostringstream out;
        EXPECT_FALSE(printCatalogue("nonsense", json, out));
        EXPECT_EQ(out.str(), "");
    }
}

TEST(LogCatalogue, EmptyLineStandsBetweenEntries)
{
    std::ostringstream text;
    EXPECT_TRUE(printCatalogue("", false, text));
    EXPECT_EQ(text.str().rfind("mirrors-unreachable\n", 0), 0U);
    EXPECT_NE(text.str().find("\n\nmirrors-clock-behind\n  Reported:"), std::string::npos);
    EXPECT_NE(text.str().find("\n\npanel-failed\n  Cause:"), std::string::npos);
}
