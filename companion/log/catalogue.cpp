#include "log/catalogue.h"

#include "findings.h"
#include "log/run.h"
#include "log/text.h"

#include <algorithm>
#include <iterator>
#include <ostream>

namespace
{

using S = StepKind;

const char unitCheck[] = "Run harl-updater-tool unit and follow its remedies, then run the update again.";
const char configure[] = "On the unit run: dpkg --configure -a, and correct what it names. Only then run the update "
                         "again: it would take the package for installed.";
const char powerAndLink[] = "Check the board's power and the internal link, then run the update again.";
const char network[] = "Connect the network or correct the mirror: apt update must end without an error or a warning. "
                       "Then run the update again.";
const char boardVersionFile[] = "On the board look at /root/App/AppExe/version.txt: it must hold a line of "
                                "\"Brimvale\", a tab and the version. If it does, run the update again.";

const Failure failures[] = {
    // Refreshing the mirrors
    {"mirrors-unreachable", "ERROR_UPDATE_MIRRORS",
     "The package tool could not refresh its lists (exit 100: any error of its own). Most often the network is not "
     "connected or a mirror is not there.",
     network},
    {"mirrors-name-unresolved", "ERROR_UPDATE_MIRRORS",
     "The name of a mirror could not be resolved: there is no network or no name server.", network},
    {"mirrors-not-answering", "ERROR_UPDATE_MIRRORS", "A mirror does not accept connections, or none gets through.",
     network},
    {"mirrors-not-read", "ERROR_UPDATE_MIRRORS", "A mirror could not be read; the lines below name it.", network},
    {"mirrors-clock-behind", "ERROR_UPDATE_MIRRORS",
     "A mirror's list is not valid yet: this unit's clock is behind. The network is not the reason.",
     "Set the unit's clock (timedatectl), then run the update again."},
    {"mirrors-expired", "ERROR_UPDATE_MIRRORS",
     "A mirror's list has expired: the mirror is no longer maintained, or this unit's clock is ahead.",
     "Check the unit's clock (timedatectl), then the mirror. Then run the update again."},
    {"mirrors-not-signed", "ERROR_UPDATE_MIRRORS", "A mirror's content is not signed with a known key.",
     "Correct the mirror or install its key, then run the update again."},
    {"mirrors-certificate", "ERROR_UPDATE_MIRRORS",
     "A mirror's certificate was refused: it is not known or not valid at the time of this unit's clock.",
     "Check the unit's clock (timedatectl) and the package ca-certificates, then run the update again."},
    {"mirrors-no-release", "ERROR_UPDATE_MIRRORS", "A mirror answers, but does not hold what the source asks for.",
     "Correct the source's address and release name, then run the update again."},
    {"mirrors-sources-malformed", "ERROR_UPDATE_MIRRORS", "The list of package sources cannot be read.",
     "Correct the line that the tool names in /etc/apt, then run the update again."},
    {"mirrors-locked", "ERROR_UPDATE_MIRRORS", "Another package tool held the lock of the package lists.",
     "Wait until it has ended, then run the update again."},
    {"mirrors-disk-full", "ERROR_UPDATE_MIRRORS", "The unit's file system is full: the lists could not be stored.",
     "Make room (apt-get clean), then run the update again."},
    {"mirrors-tool-missing", "ERROR_UPDATE_MIRRORS", "The package tool apt is not on the service's search path.",
     unitCheck},
    {"mirrors-failed", "ERROR_UPDATE_MIRRORS",
     "The package tool ended with a code that is not one of its own: it was killed, or could not run.",
     "On the unit run: apt update, correct what it names, then run the update again."},

    // The package
    {"package-unknown", "ERROR_CHECK_UPDATE",
     "The package tool named no installed or no candidate version: no package source of this unit holds the package, "
     "its words are in another language than English, or the tool was killed.",
     "On the unit run: apt-cache policy {package}. It must show \"Installed:\" and \"Candidate:\"; if not, correct the "
     "package sources or the service's language, then run the update again."},
    {"package-query-failed", "ERROR_CHECK_UPDATE", "The package tool could not be asked for the versions of {package}.",
     "On the unit run: apt-cache policy {package}, correct what it names, then run the update again."},
    {"package-not-read", "ERROR_CHECK_UPDATE",
     "The package's versions could not be read; the record that tells why is missing.",
     "On the unit run: apt-cache policy {package}, correct what it names, then run the update again."},
    {"package-install-failed", "ERROR_INSTALL_PACKAGE",
     "The package tool could not install the package: it could not be fetched, a script of it failed, or it had a "
     "question that nobody could answer. It may be left half-configured, and the next update would then take it for "
     "installed.",
     "On the unit run: dpkg --configure -a, then apt install {package}, and correct what they name. Only then run the "
     "update again."},
    {"package-tool-missing", "ERROR_INSTALL_PACKAGE", "The package tool apt is not on the service's search path.",
     unitCheck},
    {"package-interrupted", "ERROR_INSTALL_PACKAGE", "An earlier installation was interrupted.",
     "On the unit run: dpkg --configure -a, then run the update again."},
    {"package-question", "ERROR_INSTALL_PACKAGE",
     "The package has a question about a changed configuration file and nobody can answer it.",
     "On the unit run: dpkg --configure -a, answer the question, then run the update again."},
    {"package-disk-full", "ERROR_INSTALL_PACKAGE",
     "The unit's file system is full. The package may be left half-installed.",
     "Make room (apt-get clean), run: dpkg --configure -a, then run the update again."},
    {"package-script-failed", "ERROR_INSTALL_PACKAGE",
     "A script of the package failed; the package may be left half-configured.", configure},
    {"package-locked", "ERROR_INSTALL_PACKAGE", "Another package tool held the package database.",
     "Wait until it has ended, then run the update again."},
    {"package-not-located", "ERROR_INSTALL_PACKAGE", "Neither the mirrors nor this unit know the package.",
     "Check the unit's package sources, then run the update again."},
    {"package-dependencies", "ERROR_INSTALL_PACKAGE", "The package needs others that the mirrors do not offer.",
     "On the unit run: apt install {package}, and correct the sources or the package that it names. Then run the "
     "update again."},
    {"package-damaged", "ERROR_INSTALL_PACKAGE", "The package arrived damaged: its checksum is not that of the list.",
     "Correct the mirror, then run the update again."},
    {"package-not-fetched", "ERROR_INSTALL_PACKAGE",
     "The package could not be fetched; the lines below name the mirror. Nothing was installed.", network},

    // The board
    {"board-unreachable", "ERROR_CHECK_UPDATE",
     "The board could not be reached or did not accept the login (exit 255: ssh's own failure).",
     "Check the board's power and the internal link, run: ssh 192.168.9.2, correct what it names, then run the update "
     "again."},
    {"board-not-read", "ERROR_CHECK_UPDATE",
     "The board's or the stick's version could not be read; the records that tell which are missing.",
     "Get the whole log (harl-updater-tool log --journal), or run harl-updater-tool unit and harl-updater-tool stick."},
    {"board-tool-missing", "ERROR_CHECK_UPDATE", "The program ssh is not on the service's search path.", unitCheck},
    {"board-version-missing", "ERROR_CHECK_UPDATE",
     "The board answered, but has no version file, or no line with the version in it.", boardVersionFile},
    {"board-version-not-read", "ERROR_CHECK_UPDATE",
     "The board's version could not be read although the command ended without an error code: its line has no tab "
     "after \"Brimvale\", or the command was killed.",
     boardVersionFile},
    {"board-upload-failed", "ERROR_INSTALL_QUORB",
     "The files could not be copied to the board in 20 attempts: the board or the link went away, its file system is "
     "full, the stick was pulled out or lacks one of the two files.",
     "Check that the stick is in and that harl-updater-tool stick finds it fit, that the board has power and room, "
     "then run the update again."},
    {"board-host-key", "ERROR_CHECK_UPDATE, ERROR_INSTALL_QUORB",
     "The board showed another host key than the one this head knows: it was replaced or set up anew.",
     "Make sure that it is the right board, then renew its key: ssh-keygen -R 192.168.9.2, log in once, run the update "
     "again."},
    {"board-login-refused", "ERROR_CHECK_UPDATE, ERROR_INSTALL_QUORB",
     "The board refused the login without a password: this head's key is not installed there.",
     "Install this head's public key on the board (ssh-copy-id 192.168.9.2), then run the update again."},
    {"board-login-silent", "ERROR_CHECK_UPDATE, ERROR_INSTALL_QUORB",
     "The board accepted the connection, but its login service did not answer: the board is overloaded or hangs.",
     "Restart the board, wait a minute, then run the update again."},
    {"board-login-service", "ERROR_CHECK_UPDATE, ERROR_INSTALL_QUORB",
     "The board answers, but its login service does not run.",
     "Restart the board, wait a minute, then run the update again."},
    {"board-silent", "ERROR_CHECK_UPDATE, ERROR_INSTALL_QUORB", "Nothing answered at the board's address 192.168.9.2.",
     powerAndLink},
    {"board-link-down", "ERROR_CHECK_UPDATE, ERROR_INSTALL_QUORB", "The internal link to the board is down.",
     powerAndLink},
    {"board-connection-lost", "ERROR_CHECK_UPDATE, ERROR_INSTALL_QUORB", "The connection to the board broke off.",
     powerAndLink},
    {"board-full", "ERROR_INSTALL_QUORB", "The board could not write the file: most often its file system is full.",
     "Make room on the board (harl-updater-tool stick shows how much the archive needs), then run the update again."},
    {"board-read-only", "ERROR_INSTALL_QUORB", "The board's file system is read-only.",
     "Check the board's file system and restart it, then run the update again."},
    {"board-script-failed", "",
     "The board's install script did not end well ({status}). The update counts as done all the same; a board that "
     "restarts itself drops the connection like this too.",
     "Run the update again: if it finds the same board version as before, the script failed. Then look at "
     "unzipUpgrade.sh and at the room on the board."},

    // The stick
    {"stick-not-read", "ERROR_CHECK_UPDATE",
     "The stick's folder debs/QUORB/armhf could not be listed: no stick is mounted, or it has no such folder.",
     "Plug in a stick that harl-updater-tool stick finds fit, then run the update again."},
    {"stick-version-missing", "ERROR_CHECK_UPDATE",
     "The stick names no version for the board: debs/QUORB/armhf is empty, or its first entry's name has no more than "
     "the five characters in front of a version.",
     "Prepare the stick again; harl-updater-tool stick must find it fit. Then run the update again."},
    {"stick-file-missing", "ERROR_INSTALL_QUORB",
     "A file to upload is not on the stick, or the stick was pulled out; the lines below name it.",
     "Plug in a stick that harl-updater-tool stick finds fit, then run the update again."},
    {"stick-damaged", "ERROR_INSTALL_QUORB", "A file on the stick cannot be read: the stick is damaged.",
     "Prepare another stick, then run the update again."},
    {"stick-not-released", "", "The stick was not released ({status}): it was not mounted, or something still uses it.",
     "If it is still mounted: umount /root/USB_MOUNT, before you pull it out."},

    // TeamViewer, on the main head
    {"teamviewer-marker-not-read", "ERROR_CHECK_UPDATE",
     "Whether the stick requests TeamViewer could not be found out: the command ls failed.", unitCheck},
    {"teamviewer-script-failed", "",
     "TeamViewer's install script did not end well ({status}). The update counts as done all the same.",
     "Run /root/RESOURCES/teamviewer_updatescript.sh by hand and correct what it names."},

    // The instrument
    {"application-not-stopped", "", "The application was not stopped ({status}): the update ran beside it.",
     "Check the service: systemctl status harl."},
    {"application-not-started", "", "The instrument's application was not started again ({status}).",
     "Start it: systemctl start harl, and see systemctl status harl."},
    {"updater-not-stopped", "", "The updater could not stop its own service ({status}).",
     "Check the service: systemctl status harl-updater."},
    {"panel-failed", "", "{panelFailures} to the panel failed{outcomeDark}",
     "Run harl-updater-tool unit: it checks whether i2cset is there and the bus answers."},
    {"sound-failed", "", "The sound could not be played: the operator heard nothing.",
     "Run harl-updater-tool unit: it checks whether aplay, the sound files and a sound device are there."},

    // The run and its log
    {"ended-early", "", "The updater ended in this step: it crashed, was stopped, or was killed.{service}",
     "Read below what the service manager said; {afterwards}"},
    {"cut-short", "",
     "The run's records end in this step. {silence}The updater ended early: the power went, or it was stopped or "
     "killed.",
     "If the next run did not go well either: {afterwards}"},
    {"unfinished", "",
     "The run's records end in this step. {silence}Either it still goes on, or the updater ended early (power, "
     "stopped, killed), or the log was cut off.",
     "{panel}{afterwards}"},
    {"end-missing", "",
     "The run's records end in this step, after its outcome was decided. Whether the instrument was given back is not "
     "in this log.",
     "If the instrument is not back: {afterwards}"},
    {"outcome-missing", "", "The run came to its end, but the records of its outcome are not in this log.",
     "Get the whole log (harl-updater-tool log --journal)."},
    {"start-missing", "", "The run came to its end, but whether the application was started again is not in this log.",
     "Check the application: systemctl status harl."},
    {"run-not-allowed", "",
     "A package's earlier installation was broken off and could not be finished, and no other version of it is "
     "offered. The updater would have taken it for up to date: the service did not run it.",
     "On the unit run: dpkg --configure -a, and correct what it names; or offer another version. Then run the update "
     "again."},
    {"installation-repaired", "", "An earlier installation was broken off; the service finished it before this run.",
     "Nothing is to be done; the lines of the service show what it did."},
    {"repair-failed", "",
     "An earlier installation was broken off, and the service could not finish it before this run.",
     "On the unit run: dpkg --configure -a, and correct what it names."},
    {"time-used-up", "", "A command of this step did not end in its time; the service ended it.",
     "Read what the service said below; run harl-updater-tool unit and follow its remedies."},
    {"outcome-shown-again", "",
     "The panel had not taken the outcome, or not all of it; the service showed it after the run.",
     "Run harl-updater-tool unit --panel if it happens again."},
    {"outcome-not-shown", "", "The panel did not take the outcome, neither from the updater nor from the service.",
     "Run harl-updater-tool unit: it checks whether i2cset is there and the bus answers."},
    {"stick-in-use", "", "Something still used the stick after the run; the service detached it.",
     "Pull it out only when nothing uses it: fuser -m /root/USB_MOUNT."},
    {"tool-still-at-work", "", "A tool was still at work after all waits; the instrument came back beside it.",
     "Wait until it has ended: ps ax. Then run harl-updater-tool verify."},
    {"unit-not-well", "", "After the run {unit}.", "Run harl-updater-tool verify and follow its remedies."},
    {"unit-not-verified", "", "After the run not everything could be checked: {unit}.",
     "Run harl-updater-tool verify on the unit."},
    {"statuses-lost", "",
     "The updater was started so that no command's status was available (SIGCHLD ignored): the failures and the exit "
     "codes of 0 in this log mean nothing, and no upload counts as done.",
     "Start the update as the service harl-updater, as intended."},
    {"unknown", "", "An error was reported, but the records that tell which are missing.",
     "Get the whole log (harl-updater-tool log --journal), or run the update again."},
};

const int anyCode = -1;

/// Which entry explains a step that failed.
struct Rule
{
    StepKind step;
    int code; ///< exit code of its command, or anyCode; 0 also of one that was killed
    const char* failure;
    bool general = false; ///< A tool's phrase makes it more specific.
};

// The first one that fits counts.
const Rule rules[] = {
    {S::STOP_APPLICATION, anyCode, "application-not-stopped"},
    {S::REFRESH_MIRRORS, 100, "mirrors-unreachable", true},
    {S::REFRESH_MIRRORS, 127, "mirrors-tool-missing"},
    {S::REFRESH_MIRRORS, anyCode, "mirrors-failed"},
    {S::CHECK_PACKAGE, 0, "package-unknown"},
    {S::CHECK_PACKAGE, anyCode, "package-query-failed"},
    {S::INSTALL_PACKAGE, 127, "package-tool-missing"},
    {S::INSTALL_PACKAGE, anyCode, "package-install-failed", true},
    {S::CHECK_BOARD, 0, "board-version-not-read"},
    {S::CHECK_BOARD, 127, "board-tool-missing"},
    {S::CHECK_BOARD, 255, "board-unreachable", true},
    {S::CHECK_BOARD, anyCode, "board-version-missing"},
    {S::UPLOAD_BOARD, anyCode, "board-upload-failed", true},
    {S::RUN_BOARD_SCRIPT, anyCode, "board-script-failed"},
    {S::CHECK_TEAMVIEWER, anyCode, "teamviewer-marker-not-read"},
    {S::INSTALL_TEAMVIEWER, anyCode, "teamviewer-script-failed"},
    {S::STOP_UPDATER, anyCode, "updater-not-stopped"},
};

/// What a tool says, on standard error most often, and the entry that it points to in the steps that run the tool.
struct Phrase
{
    const char* tool;
    const char* words;
    StepKind step;
    StepKind alsoStep;
    const char* failure;
};

// As the tools of Debian 11 to 13 spell it. Of several in a step the first one counts.
const Phrase phrases[] = {
    {"ssh", "HOST IDENTIFICATION HAS CHANGED", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-host-key"},
    {"ssh", "Host key verification failed", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-host-key"},
    {"ssh", "Permission denied (", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-login-refused"},
    {"ssh", "timed out during banner exchange", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-login-silent"},
    {"ssh", "Connection refused", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-login-service"},
    {"ssh", "No route to host", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-link-down"},
    {"ssh", "Network is unreachable", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-link-down"},
    {"ssh", "Connection timed out", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-silent"},
    {"scp", "Read-only file system", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "board-read-only"},
    {"scp", "No space left on device", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "board-full"},
    {"scp", "\": Failure", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "board-full"},
    {"scp", "OSUpgrade.zip: No such file", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "stick-file-missing"},
    {"scp", "OSUpgrade.zip\": No such file", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "stick-file-missing"},
    {"scp", "unzipUpgrade.sh: No such file", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "stick-file-missing"},
    {"scp", "unzipUpgrade.sh\": No such file", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "stick-file-missing"},
    {"scp", "Input/output error", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "stick-damaged"},
    {"ssh", "not responding", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-connection-lost"},
    {"ssh", "Broken pipe", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-connection-lost"},
    {"ssh", "Connection reset by", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-connection-lost"},
    {"ssh", "Connection closed", S::CHECK_BOARD, S::UPLOAD_BOARD, "board-connection-lost"},
    {"scp", "ost connection", S::UPLOAD_BOARD, S::UPLOAD_BOARD, "board-connection-lost"},
    {"apt", "not valid yet", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-clock-behind"},
    {"apt", "is expired", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-expired"},
    {"apt", "Certificate verification failed", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-certificate"},
    {"apt", "is not signed", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-not-signed"},
    {"apt", "signatures couldn't be verified", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-not-signed"},
    {"apt", "list of sources could not be read", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-sources-malformed"},
    {"apt", "Malformed", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-sources-malformed"},
    {"apt", "Could not get lock", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-locked"},
    {"apt", "No space left on device", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-disk-full"},
    {"apt", "Temporary failure resolving", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-name-unresolved"},
    {"apt", "Could not resolve", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-name-unresolved"},
    {"apt", "Could not connect", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-not-answering"},
    {"apt", "Cannot initiate the connection", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-not-answering"},
    {"apt", "Unable to connect", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-not-answering"},
    {"apt", "does not have a Release file", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-no-release"},
    {"apt", "404  Not Found", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-no-release"},
    {"apt", "Failed to fetch", S::REFRESH_MIRRORS, S::REFRESH_MIRRORS, "mirrors-not-read"},
    {"dpkg", "you must manually run", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-interrupted"},
    {"dpkg", "conffile prompt", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-question"},
    {"dpkg", "No space left on device", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-disk-full"},
    {"apt", "have enough free space", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-disk-full"},
    {"apt", "returned an error code", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-script-failed"},
    {"apt", "Could not get lock", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-locked"},
    {"apt", "Unable to locate package", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-not-located"},
    {"apt", "has no installation candidate", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-not-located"},
    {"apt", "unmet dependencies", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-dependencies"},
    {"apt", "Hash Sum mismatch", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-damaged"},
    {"apt", "Failed to fetch", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-not-fetched"},
    {"apt", "Temporary failure resolving", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-not-fetched"},
    {"apt", "Unable to fetch", S::INSTALL_PACKAGE, S::INSTALL_PACKAGE, "package-not-fetched"},
};
static_assert(std::size(phrases) <= PhraseSet().size());

const Failure* entry(const char* name)
{
    return findFailure(name);
}

/// The entry for a step that failed, as specific as the log allows.
const Failure* failureOf(const Run& run, const Step& step)
{
    if (step.kind == S::UPLOAD_BOARD && run.statusesLost) {
        return entry("statuses-lost");
    }
    if (step.kind == S::CHECK_BOARD) {
        const bool listed = step.actions.size() > 1 && step.status && step.status->number != 0;
        if (step.event == Event::STICK_NOT_READ || listed) {
            return entry("stick-not-read");
        }
        if (!step.status || run.board.unclear) {
            return entry("board-not-read");
        }
        if (step.status->number == 0 && run.board.candidate.empty() && !run.board.installed.empty()) {
            return entry("stick-version-missing");
        }
    }
    if (step.kind == S::CHECK_PACKAGE && !step.status) {
        return entry("package-not-read");
    }
    const long code = step.status ? step.status->number : step.word == "NO_INTERNET_ERROR_CODE" ? 100 : 0;
    const auto* const rule = std::find_if(std::begin(rules), std::end(rules), [&](const Rule& candidate) {
        return candidate.step == step.kind && (candidate.code == anyCode || candidate.code == code);
    });
    if (rule == std::end(rules)) {
        return entry("unknown");
    }
    for (std::size_t index = 0; rule->general && index < std::size(phrases); ++index) {
        if (step.phrases.test(index)) {
            return entry(phrases[index].failure);
        }
    }
    return entry(rule->failure);
}

bool decides(const Step& step, Outcome outcome)
{
    const bool oneCommand = step.status && step.status->number != 0;
    switch (outcome) {
    case Outcome::MIRRORS_FAILED:
        return step.kind == S::REFRESH_MIRRORS && (step.result == StepResult::FAILED || oneCommand);
    case Outcome::PACKAGE_FAILED:
        return step.kind == S::INSTALL_PACKAGE && (step.result == StepResult::FAILED || oneCommand);
    case Outcome::BOARD_FAILED:
        return step.kind == S::UPLOAD_BOARD && step.result == StepResult::FAILED;
    default:
        return step.result == StepResult::FAILED &&
               (step.kind == S::CHECK_PACKAGE || step.kind == S::CHECK_BOARD || step.kind == S::CHECK_TEAMVIEWER);
    }
}

/// What the service's words point to.
const std::pair<ServiceEvent, const char*> serviceProblems[] = {
    {ServiceEvent::REPAIRED, "installation-repaired"},      {ServiceEvent::REPAIR_FAILED, "repair-failed"},
    {ServiceEvent::SHOWN_AGAIN, "outcome-shown-again"},     {ServiceEvent::PANEL_REFUSED, "outcome-not-shown"},
    {ServiceEvent::STICK_IN_USE, "stick-in-use"},           {ServiceEvent::WENT_ON, "tool-still-at-work"},
    {ServiceEvent::NOT_STARTED, "application-not-started"}, {ServiceEvent::UNIT_NOT_WELL, "unit-not-well"},
    {ServiceEvent::UNIT_OPEN, "unit-not-verified"},
};

void addFailure(Run& run)
{
    if (run.service.has(ServiceEvent::NOT_ALLOWED)) {
        run.failure = {entry("run-not-allowed"), 0};
        return;
    }
    if (run.steps.empty()) {
        return;
    }
    const std::size_t last = run.steps.size() - 1;
    const bool shown = run.steps.back().kind >= S::SHOW_OUTCOME ||
                       (run.mainHead && run.outcome != Outcome::NONE && run.outcome != Outcome::UPDATE_OFFERED);
    if (isFailure(run.outcome)) {
        for (std::size_t index = run.steps.size(); index-- > 0;) {
            if (decides(run.steps[index], run.outcome)) {
                run.failure = {failureOf(run, run.steps[index]), index};
                return;
            }
        }
        run.failure = {entry("unknown"), last};
    } else if (run.ended == RunEnd::EARLY) {
        run.failure = {entry("ended-early"), last};
    } else if (run.ended == RunEnd::NOT_SEEN) {
        run.failure = {entry(shown ? "end-missing" : run.followedByAnother ? "cut-short" : "unfinished"), last};
    } else if (run.outcome == Outcome::NONE) {
        run.failure = {entry("outcome-missing"), last};
    }
}

/// What went wrong without deciding the outcome.
void addBesides(Run& run)
{
    const bool named = run.failure && run.failure->failure == entry("statuses-lost");
    for (std::size_t index = 0; index < run.steps.size(); ++index) {
        if (run.steps[index].timeUsedUp) {
            run.besides.push_back({entry("time-used-up"), index});
        }
    }
    for (const auto& [event, name] : serviceProblems) {
        if (run.service.has(event)) {
            run.besides.push_back({entry(name), run.steps.size()});
        }
    }
    if (run.statusesLost) {
        // Every command seems to have failed then, also those that did their work.
        if (!named) {
            run.besides.push_back({entry("statuses-lost"), 0});
        }
        return;
    }
    for (std::size_t index = 0; index < run.steps.size(); ++index) {
        const Step& step = run.steps[index];
        if (step.result != StepResult::FAILED || (run.failure && run.failure->step == index)) {
            continue;
        }
        if (step.kind == S::GIVE_BACK) {
            const char* const names[] = {"stick-not-released", "application-not-started"};
            for (std::size_t command = 0; command < std::min<std::size_t>(2, step.actions.size()); ++command) {
                if (const auto& status = step.actions[command].status; status && status->number != 0) {
                    run.besides.push_back({entry(names[command]), index});
                }
            }
            continue;
        }
        run.besides.push_back({failureOf(run, step), index, step.kind == S::CHECK_BOARD && !run.mainHead});
    }
    if (run.ledFailures > 0) {
        run.besides.push_back({entry("panel-failed"), 0});
    }
    const auto index = [&](const Step* step) {
        return step == nullptr ? run.steps.size() : static_cast<std::size_t>(step - run.steps.data());
    };
    if (run.soundFailed) {
        run.besides.push_back({entry("sound-failed"), index(run.find(S::SHOW_OUTCOME))});
    }
    if (!run.applicationStarted && !run.failure && !run.steps.empty()) {
        run.besides.push_back({entry("start-missing"), index(run.find(S::GIVE_BACK))});
    }
}

void addGaps(Run& run)
{
    const auto add = [&](bool open, Gap gap) {
        if (open) {
            run.gaps.push_back(gap);
        }
    };
    const bool ended = run.ended != RunEnd::NOT_SEEN;
    const Step* install = run.find(S::INSTALL_PACKAGE);
    const Step* upload = run.find(S::UPLOAD_BOARD);
    add(run.beginningMissing, Gap::BEGINNING);
    add(!ended, Gap::END);
    add(run.outcome == Outcome::PASSED, Gap::OUTCOME);
    add(run.tornRecords > 0, Gap::TORN_RECORDS);
    add(run.stepsLeftOut > 0, Gap::STEPS_LEFT_OUT);
    add(run.clockJumps > 0, Gap::CLOCK);
    add(run.statusesLost, Gap::STATUSES);
    add(install != nullptr && install->result == StepResult::DONE && !run.statusesLost, Gap::PACKAGE_INSTALLED);
    add(upload != nullptr && upload->failedAttempts > 0, Gap::UPLOAD_ATTEMPTS);
    add(run.find(S::RUN_BOARD_SCRIPT) != nullptr, Gap::BOARD_RUNS);
    add(run.markerRemoved, Gap::MARKER);
    add(run.failure && isFailure(run.outcome) && run.otherLines == 0, Gap::TOOLS_WORDS);
    add(run.outcome != Outcome::NONE && !run.mainHead && !run.statusesLost, Gap::FEEDBACK);
}

/// The steps in which an entry can occur, as their names.
std::vector<std::string> stepsOf(const Failure& failure)
{
    std::vector<std::string> names;
    const auto add = [&](StepKind kind) {
        const std::string name = factsOf(kind).name;
        if (std::find(names.begin(), names.end(), name) == names.end()) {
            names.push_back(name);
        }
    };
    for (const Rule& rule : rules) {
        if (std::string_view(rule.failure) == failure.name) {
            add(rule.step);
        }
    }
    for (const Phrase& phrase : phrases) {
        if (std::string_view(phrase.failure) == failure.name) {
            add(phrase.step);
            add(phrase.alsoStep);
        }
    }
    return names;
}

nlohmann::ordered_json phrasesOf(const Failure& failure)
{
    nlohmann::ordered_json list = nlohmann::ordered_json::array();
    for (const Phrase& phrase : phrases) {
        if (std::string_view(phrase.failure) == failure.name) {
            nlohmann::ordered_json steps = {factsOf(phrase.step).name};
            if (phrase.alsoStep != phrase.step) {
                steps.push_back(factsOf(phrase.alsoStep).name);
            }
            list.push_back({{"tool", phrase.tool}, {"words", phrase.words}, {"steps", steps}});
        }
    }
    return list;
}

} // namespace

const Failure* findFailure(std::string_view name)
{
    const auto* const found = std::find_if(std::begin(failures), std::end(failures),
                                           [&](const Failure& failure) { return failure.name == name; });
    return found == std::end(failures) ? nullptr : found;
}

PhraseSet phrasesIn(std::string_view line, StepKind kind)
{
    PhraseSet found;
    for (std::size_t index = 0; index < std::size(phrases); ++index) {
        const Phrase& phrase = phrases[index];
        if ((phrase.step == kind || phrase.alsoStep == kind) && line.find(phrase.words) != std::string_view::npos) {
            found.set(index);
        }
    }
    return found;
}

void explain(Run& run)
{
    addFailure(run);
    addBesides(run);
    addGaps(run);
}

bool wentWell(const Run& run)
{
    const bool bad = run.service.has(ServiceEvent::UNIT_NOT_WELL) || run.service.has(ServiceEvent::NOT_STARTED) ||
                     run.service.has(ServiceEvent::FAILURE_SHOWN) || run.service.has(ServiceEvent::NOT_ALLOWED);
    return !bad && run.outcome != Outcome::NONE && !isFailure(run.outcome) && run.applicationStarted.value_or(false) &&
           (run.ended == RunEnd::BY_SERVICE_MANAGER || run.ended == RunEnd::BY_ITSELF);
}

bool printCatalogue(const std::string& name, bool json, std::ostream& out)
{
    nlohmann::ordered_json entries = nlohmann::ordered_json::array();
    const Run remoteHead;
    for (const Failure& failure : failures) {
        if (!name.empty() && name != failure.name) {
            continue;
        }
        const std::string cause = filled(failure.cause, remoteHead, nullptr, {});
        const std::string remedy = filled(failure.remedy, remoteHead, nullptr, {});
        if (json) {
            entries.push_back({{"name", failure.name},
                               {"reported", failure.reported},
                               {"steps", stepsOf(failure)},
                               {"cause", cause},
                               {"remedy", remedy},
                               {"phrases", phrasesOf(failure)}});
            continue;
        }
        out << (&failure == failures || !name.empty() ? "" : "\n") << failure.name << '\n';
        if (*failure.reported != '\0') {
            printWrapped("  Reported: ", failure.reported, out);
        }
        std::string steps;
        for (const std::string& step : stepsOf(failure)) {
            steps += (steps.empty() ? "" : ", ") + step;
        }
        if (!steps.empty()) {
            printWrapped("  In step:  ", steps, out);
        }
        printWrapped("  Cause:    ", cause, out);
        printWrapped("  Do now:   ", remedy, out);
        for (const Phrase& phrase : phrases) {
            if (std::string_view(phrase.failure) == failure.name) {
                out << "  Says so:  " << phrase.tool << ": " << phrase.words << '\n';
            }
        }
        entries.push_back(nullptr);
    }
    if (json && !entries.empty()) {
        out << nlohmann::ordered_json{{"command", "explain"}, {"version", 1}, {"failures", entries}}.dump(2) << '\n';
    }
    return !entries.empty();
}
