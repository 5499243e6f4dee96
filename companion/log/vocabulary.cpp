#include "log/vocabulary.h"

#include "procedure.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <unordered_map>
#include <utility>

namespace
{

// In the order of StepKind. The longest times: the service manager gives up on harl after 90 s; apt has its own time
// limits, each name and mirror several; a connection to the board that dies is noticed after 40 s.
const char again[] = "run the update again.";
const char boardPower[] = "leave the board 13 minutes of power, then run the update again.";
const char overAlready[] = "the update itself was over: check that the application runs (systemctl status harl).";
const std::array<StepFacts, stepKinds> stepTable = {{
    {"start", "Start, darken the panel", 0, 60, again},
    {"stop-application", "Stop the application harl", 0, 120, again},
    {"refresh-mirrors", "Refresh the package mirrors", 0, 900, again},
    {"check-package", "Compare the package's versions", 0, 120, again},
    {"install-package", "Install the package", 0, 3600,
     "run on the unit: dpkg --configure -a, then run the update again."},
    {"check-board", "Compare the board's versions", 0, 120, again},
    {"upload-board", "Upload the files to the board", 0, 3600, again},
    {"run-board-script", "Run the board's install script", 0, 1800, boardPower},
    {"wait-for-board", "Leave the board 13 minutes", boardWait, boardWait + 60, boardPower},
    {"check-teamviewer", "Look for the TeamViewer marker", 0, 60, again},
    {"install-teamviewer", "Install TeamViewer", 0, 1800, again},
    {"remove-marker", "Remove the first-boot marker", 0, 60, again},
    {"show-outcome", "Play and light the outcome", 0, 120, overAlready},
    {"show-to-operator", "Leave 30 s to read the panel", outcomeWait, outcomeWait + 60, overAlready},
    {"give-back", "Release the stick, start harl", giveBackWait, giveBackWait + 120, overAlready},
    {"stop-updater", "Stop the updater", 0, 120, overAlready},
}};

/// One of the updater's messages. At its end "*" stands for any text, "#" for a decimal number and nothing more, "#*"
/// for a number and any text.
struct Word
{
    const char* operation;
    const char* message;
    Event event;
    std::optional<StepKind> step = std::nullopt;
    const char* command = "";
};

using S = StepKind;
using E = Event;

const std::size_t ranLength = sizeof "Running command: " - 1; // what follows is the command

// The first one that fits counts. See common/src/UpdateManager.cpp and remote/.
const Word words[] = {
    {"main", "TavrenUpdater version: *", E::VERSION, S::START},
    {"main", "BEFORE UPDATE", E::RUN_BEGINS},
    {"main", "AFTER UPDATE", E::ENDED_BY_ITSELF},
    {"setCallbacks", "", E::RUN_BEGINS},
    {"init", "", E::RUN_BEGINS},
    {"stopHARL", "", E::NOTED, S::STOP_APPLICATION, "systemctl stop harl"},
    {"stopHARL", "#", E::RAW_STATUS, S::STOP_APPLICATION},
    {"updateMirrors", "", E::NOTED, S::REFRESH_MIRRORS},
    {"updateMirrors", "OK", E::SUCCEEDED, S::REFRESH_MIRRORS},
    {"updateMirrors", "NO_INTERNET_ERROR_CODE", E::FAILED, S::REFRESH_MIRRORS},
    {"updateMirrors", "NOT OK #", E::FAILED, S::REFRESH_MIRRORS},
    {"updateMirrors", "NOT OK*", E::FAILED, S::REFRESH_MIRRORS},
    {"checkUpdate", "apt-cache policy *", E::NOTED, S::CHECK_PACKAGE},
    {"checkUpdate", "NWM_UM_UPDATE_FOUND: *", E::VERSIONS_DIFFER, S::CHECK_PACKAGE},
    {"checkUpdate", "NWM_UM_NO_UPDATES *", E::VERSIONS_SAME, S::CHECK_PACKAGE},
    {"checkUpdate", "NWM_UM_CHECK_UPDATE_FAILED", E::FAILED, S::CHECK_PACKAGE},
    {"checkUpdate", "NO_INTERNET_ERROR_CODE", E::FAILED, S::CHECK_PACKAGE},
    {"installUpdate", "", E::NOTED, S::INSTALL_PACKAGE},
    {"installUpdate", "#*", E::FAILED, S::INSTALL_PACKAGE},
    {"checkQuorbUpdate", "Update found: *", E::VERSIONS_DIFFER, S::CHECK_BOARD},
    {"checkQuorbUpdate", "QUORB up to date", E::VERSIONS_SAME, S::CHECK_BOARD},
    {"checkQuorbUpdate", "Failed to checkUpdate", E::BOARD_NOT_READ, S::CHECK_BOARD},
    {"checkQuorbUpdate", "Failed to check candidate QUORB version", E::STICK_NOT_READ, S::CHECK_BOARD},
    {"checkQuorbUpdate", "*", E::BOARD_VERSIONS},
    {"uploadQuorbFiles", "scp *", E::ATTEMPT, S::UPLOAD_BOARD, "scp: OSUpgrade.zip and unzipUpgrade.sh"},
    {"uploadQuorbFiles", "Uploading failed*", E::ATTEMPT_FAILED, S::UPLOAD_BOARD},
    {"uploadQuorbFiles", "Failed to upload QUORB*", E::FAILED, S::UPLOAD_BOARD},
    {"installQuorbUpdate", "Failed inside uploadQuorbFiles", E::FAILED, S::UPLOAD_BOARD},
    {"installQuorbUpdate", "ssh *", E::NOTED, S::RUN_BOARD_SCRIPT, "ssh: /unzipUpgrade.sh"},
    {"installQuorbUpdate", "Install script ended with code: #", E::RAW_STATUS, S::RUN_BOARD_SCRIPT},
    {"installQuorbUpdate", "Starts sleeping*", E::NOTED, S::WAIT_FOR_BOARD},
    {"installQuorbUpdate", "Sleeping for 13mins ended*", E::SUCCEEDED, S::WAIT_FOR_BOARD},
    {"checkTVUpdate", "Teamviewer path*", E::NOTED, S::CHECK_TEAMVIEWER},
    {"checkTVUpdate", "Teamviewer install is required", E::TEAMVIEWER_REQUESTED, S::CHECK_TEAMVIEWER},
    {"checkTVUpdate", "No need to install Teamviewer", E::TEAMVIEWER_NOT_REQUESTED, S::CHECK_TEAMVIEWER},
    {"checkTVUpdate", "install Teamviewer flag doesnot exist", E::TEAMVIEWER_NOT_REQUESTED, S::CHECK_TEAMVIEWER},
    {"checkTVUpdate", "Failed to check if TV install is needed", E::FAILED, S::CHECK_TEAMVIEWER},
    {"installTVUpdate", "", E::NOTED, S::INSTALL_TEAMVIEWER},
    {"installTVUpdate", "Install script ended with code: #", E::RAW_STATUS, S::INSTALL_TEAMVIEWER},
    {"installTVUpdate", "*", E::ATTEMPT, S::INSTALL_TEAMVIEWER, "/root/RESOURCES/teamviewer_updatescript.sh"},
    {"runProcess", "Running command: apt update", E::COMMAND, S::REFRESH_MIRRORS},
    {"runProcess", "Running command: apt-cache policy solvik4-rh", E::COMMAND, S::CHECK_PACKAGE},
    {"runProcess", "Running command: apt-cache policy solvik4-dh", E::COMMAND, S::CHECK_PACKAGE},
    {"runProcess", "Running command: apt --assume-yes install solvik4-rh", E::COMMAND, S::INSTALL_PACKAGE},
    {"runProcess", "Running command: apt --assume-yes install solvik4-dh", E::COMMAND, S::INSTALL_PACKAGE},
    {"runProcess", "Running command: ssh *", E::COMMAND, S::CHECK_BOARD,
     "ssh  192.168.9.2 \" cat /root/App/AppExe/version.txt | grep 'Brimvale'\""},
    {"runProcess", "Running command: ls /root/USB_MOUNT/debs/QUORB/armhf/", E::COMMAND, S::CHECK_BOARD},
    {"runProcess", "Running command: ls /root/USB_MOUNT/debs/installTV", E::COMMAND, S::CHECK_TEAMVIEWER},
    {"runProcess", "Exit code:#", E::EXIT_CODE},
    {"initMainHead", "", E::MAIN_CHECKS},
    {"initMainHead", "Update mirrors failed:", E::MIRRORS_REPORTED},
    {"initMainHead", "Failed to checkUpdate", E::CHECK_REPORTED},
    {"initMainHead", "removed*", E::MARKER_REMOVED, S::REMOVE_MARKER, "rm /root/RESOURCES/tavren1stboot"},
    {"initMainHead", "going to install TV", E::TEAMVIEWER_REQUESTED, S::CHECK_TEAMVIEWER},
    {"updateMainHead", "update maainhead finished", E::MAIN_FINISHED},
    {"updateMainHead", "*", E::MAIN_INSTALLS},
    {"updateRemoteHead", "Update mirrors failed:", E::MIRRORS_REPORTED},
    {"updateRemoteHead", "Failed to checkUpdate", E::CHECK_REPORTED},
    {"updateRemoteHead", "update failed", E::PACKAGE_REPORTED},
    {"updateRemoteHead", "update QUORB failed", E::BOARD_REPORTED},
    {"updateRemoteHead", "removed*", E::MARKER_REMOVED, S::REMOVE_MARKER, "rm /root/RESOURCES/tavren1stboot"},
    {"resultCallback", "", E::RESULT, S::SHOW_OUTCOME},
    {"errorCallback", "", E::ERROR, S::SHOW_OUTCOME},
    {"deinit", "", E::OUTCOME_SHOWN},
    {"deinitRemoteHead", "Giving users 30 Secs*", E::NOTED, S::SHOW_TO_OPERATOR},
    {"startHARL", "", E::NOTED, S::GIVE_BACK, "umount /root/USB_MOUNT/"},
    {"startHARL", "#", E::RAW_STATUS, S::GIVE_BACK, "systemctl start harl"},
    {"stopUpdater", "", E::STOPS_UPDATER, S::STOP_UPDATER, "systemctl stop harl-updater"},
    {"stopUpdater", "#", E::RAW_STATUS, S::STOP_UPDATER},
    {"play", "Failed to play a sound*", E::SOUND_FAILED},
    {"turnOn", "system returned false: *", E::PANEL_FAILED},
};

/// What a part of the service says.
struct ServiceWord
{
    const char* part;
    const char* words; ///< anywhere in the line
    ServiceEvent event;
};

// The first one that fits counts. Each part's name alone: some other line of it.
const ServiceWord serviceTable[] = {
    {"prepare: ", "an installation was broken off", ServiceEvent::REPAIR},
    {"prepare: ", "the updater is not run", ServiceEvent::NOT_ALLOWED},
    {"prepare: ", "the installation is finished", ServiceEvent::REPAIRED},
    {"prepare: ", "still unfinished", ServiceEvent::REPAIR_FAILED},
    {"prepare: ", "", ServiceEvent::NONE},
    {"hand-over: ", "no end within", ServiceEvent::TIME_USED_UP},
    {"hand-over: ", "are used up", ServiceEvent::TIME_USED_UP},
    {"hand-over: ", "", ServiceEvent::NONE},
    {"give-back: ", "before it had an outcome", ServiceEvent::FAILURE_SHOWN},
    {"give-back: ", "before it showed an outcome", ServiceEvent::FAILURE_SHOWN},
    {"give-back: ", "the outcome was not shown", ServiceEvent::SHOWN_AGAIN},
    {"give-back: ", "the panel does not take", ServiceEvent::PANEL_REFUSED},
    {"give-back: ", "the stick is in use", ServiceEvent::STICK_IN_USE},
    {"give-back: ", "the stick stays mounted", ServiceEvent::STICK_IN_USE},
    {"give-back: ", "going on beside it", ServiceEvent::WENT_ON},
    {"give-back: ", "harl cannot be started", ServiceEvent::NOT_STARTED},
    {"give-back: ", "", ServiceEvent::NONE},
    {"verify: ", "the unit is well", ServiceEvent::UNIT_WELL},
    {"verify: ", "the unit is not well", ServiceEvent::UNIT_NOT_WELL},
    {"verify: ", "", ServiceEvent::UNIT_OPEN},
};

using WordRange = std::pair<const Word*, const Word*>;

/// The words of an operation; they come one after the other.
WordRange wordsOf(std::string_view operation)
{
    static const std::unordered_map<std::string_view, WordRange> index = [] {
        std::unordered_map<std::string_view, WordRange> ranges;
        for (const Word& word : words) {
            ranges.emplace(word.operation, WordRange(&word, &word)).first->second.second = &word + 1;
        }
        return ranges;
    }();
    const auto found = index.find(operation);
    return found == index.end() ? WordRange(nullptr, nullptr) : found->second;
}

/// True, with what it holds in `meaning`, when `message` has the form of `pattern`.
bool fits(std::string_view pattern, std::string_view message, Meaning& meaning)
{
    const auto takeEnd = [&](char sign) {
        const bool there = !pattern.empty() && pattern.back() == sign;
        pattern.remove_suffix(there ? 1 : 0);
        return there;
    };
    const bool anyText = takeEnd('*');
    const bool number = takeEnd('#');
    if (message.substr(0, pattern.size()) != pattern) {
        return false;
    }
    meaning.rest = message.substr(pattern.size());
    meaning.number.reset();
    if (number) {
        long value = 0;
        const auto [end, error] = std::from_chars(meaning.rest.begin(), meaning.rest.end(), value);
        if (error != std::errc()) {
            return false;
        }
        meaning.number = value;
        meaning.rest.remove_prefix(static_cast<std::size_t>(end - meaning.rest.begin()));
    }
    return anyText || meaning.rest.empty();
}

/// What a record means whatever its message is.
Meaning meaningOfAny(const WordRange& range)
{
    Meaning meaning;
    const auto& [begin, end] = range;
    const bool oneStep =
        std::all_of(begin, end, [front = begin](const Word& word) { return word.step == front->step; });
    if (begin != end && oneStep) {
        const bool first = end - begin == 1 || (*begin->message == '\0' && begin->step);
        meaning.event = first ? begin->event : begin->step ? E::NOTED : E::NONE;
        meaning.step = begin->step;
        meaning.command = first ? begin->command : "";
    }
    return meaning;
}

} // namespace

const StepFacts& factsOf(StepKind kind)
{
    return stepTable.at(static_cast<std::size_t>(kind));
}

std::optional<ServiceEvent> serviceEventOf(std::string_view line)
{
    for (const ServiceWord& word : serviceTable) {
        if (startsWith(line, word.part) && contains(line, word.words)) {
            return word.event;
        }
    }
    return std::nullopt;
}

Meaning meaningOf(std::string_view operation, std::optional<std::string_view> message)
{
    const auto [begin, end] = wordsOf(operation);
    if (!message) {
        return meaningOfAny({begin, end});
    }
    Meaning meaning;
    for (const Word* word = begin; word != end; ++word) {
        if (fits(word->message, *message, meaning)) {
            meaning.event = word->event;
            meaning.step = word->step;
            meaning.command =
                word->event == E::COMMAND && *word->command == '\0' ? word->message + ranLength : word->command;
            return meaning;
        }
    }
    meaning.rest = *message;
    meaning.number.reset();
    return meaning;
}

bool isMessageOf(std::string_view operation, std::string_view message, bool output)
{
    if (output && (operation == "checkUpdate" || operation == "checkQuorbUpdate")) {
        return true;
    }
    const Event event = meaningOf(operation, message).event;
    if (event == Event::BOARD_VERSIONS) { // "2.1.0  2.2.0"
        const std::size_t blank = message.find(' ');
        return blank != std::string_view::npos && message.substr(blank, 2) == "  " && message.rfind(' ') == blank + 1;
    }
    return event != Event::NONE && event != Event::MAIN_INSTALLS &&
           !(event == Event::ATTEMPT && message.substr(0, 1) != "/" && message.substr(0, 4) != "scp ");
}
