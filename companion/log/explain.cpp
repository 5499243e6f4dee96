#include "log/explain.h"

#include "findings.h"
#include "procedure.h"

#include <algorithm>

namespace
{

bool contains(const std::string& text, const std::string& part)
{
    return text.find(part) != std::string::npos;
}

/// What a tool says, on standard error as a rule, and what it means. The first one that a step's lines hold counts.
struct Hint
{
    const char* said;
    const char* why;
    const char* remedy;
};

const Hint hints[] = {
    {"Host key verification failed",
     "The board showed another host key than the one this head knows: it was replaced or "
     "set up anew.",
     "Make sure that it is the right board, then renew its key: ssh-keygen -R 192.168.9.2, log in once, run the update "
     "again."},
    {"Permission denied (", "The board refused the login without a password: this head's key is not installed there.",
     "Install this head's public key on the board (ssh-copy-id 192.168.9.2), then run the update again."},
    {"Connection timed out", "Nothing answered at the board's address 192.168.9.2.",
     "Check the board's power and the internal link, then run the update again."},
    {"Connection refused", "The board answers, but its login service does not run.",
     "Restart the board, wait a minute, then run the update again."},
    {"No route to host", "The internal link to the board is down.",
     "Check the board's power and the internal link, then run the update again."},
    {"Lost connection", "The connection to the board broke off.",
     "Check the board's power and the internal link, then run the update again."},
    {"No such file or directory", "A file that the command needs is not there; the lines below name it.",
     "Put the file in its place (for the stick: harl-updater-tool stick tells what is missing), then run the update "
     "again."},
    {"No space left on device", "A file system is full; the lines below tell where.",
     "Make room there, then run the update again."},
    {"\\\": Failure", "The board could not write the file: its file system is full, as a rule.",
     "Make room on the board (harl-updater-tool stick tells how much the archive needs), then run the update again."},
    {"Could not get lock", "Another package tool held the package database.",
     "Wait until it has ended, then run the update again."},
    {"Unable to locate package", "Neither the mirrors nor this unit know the package.",
     "Check the unit's package sources, then run the update again."},
    {"Temporary failure resolving",
     "The name of a mirror could not be resolved: there is no network or no name server.",
     "Connect the network, then run the update again."},
    {"Could not resolve", "The name of a mirror could not be resolved: there is no network or no name server.",
     "Connect the network, then run the update again."},
    {"is not signed", "A mirror's content is not signed with a known key.",
     "Correct the mirror or install its key, then run the update again."},
    {"conffile prompt", "The package has a question about a changed configuration file and nobody can answer it.",
     "On the unit run: dpkg --configure -a, answer the question, then run the update again."},
    {"returned an error code (1)", "A script of the package failed; the package may be left half-configured.",
     "On the unit run: dpkg --configure -a, and mend what it names. The next update would take the package for "
     "installed."},
    {"you must manually run", "An earlier installation was interrupted.",
     "On the unit run: dpkg --configure -a, then run the update again."},
    {"Failed to fetch", "A mirror could not be read; the lines below name it.",
     "Connect the network or correct the mirror, then run the update again."},
};

/// The hint that fits what the tools of `step` said, or null.
const Hint* hintFor(const Step& step)
{
    const auto fits = [&](const Hint& hint) { return step.said.contain(hint.said); };
    const Hint* const found = std::find_if(std::begin(hints), std::end(hints), fits);
    return found == std::end(hints) ? nullptr : found;
}

Problem problem(const Run& run, const Step& step, const char* name, std::string why, std::string remedy)
{
    return {name, static_cast<std::size_t>(&step - run.steps.data()), std::move(why), std::move(remedy)};
}

Problem explainMirrors(const Run& run, const Step& step)
{
    if (step.code == 100) {
        return problem(run, step, "mirrors-unreachable",
                       "The package tool could not refresh its lists (exit 100: any error of its own). As a rule the "
                       "network is not connected or a mirror is not there.",
                       "Connect the network and run: apt update. When it ends without an error, run the update again.");
    }
    if (step.code == 127) {
        return problem(run, step, "mirrors-tool-missing", "The package tool apt is not on the service's search path.",
                       "Run harl-updater-tool unit and mend what it names.");
    }
    return problem(run, step, "mirrors-failed",
                   "The package tool ended with a code that is not one of its own: it was killed, or could not run.",
                   "On the unit run: apt update, mend what it names, then run the update again.");
}

Problem explainPackageCheck(const Run& run, const Step& step)
{
    if (step.code && *step.code != 0) {
        return problem(run, step, "package-query-failed",
                       "The package tool could not be asked for the versions of " + packageOf(run.mainHead) + ".",
                       "On the unit run: apt-cache policy " + packageOf(run.mainHead) +
                           ", mend what it names, then run the update again.");
    }
    return problem(run, step, "package-unknown",
                   "The package tool named no installed or no candidate version: no package source of this unit holds "
                   "the package, its words are in another language than English, or the tool was killed.",
                   "On the unit run: apt-cache policy " + packageOf(run.mainHead) +
                       ". It must show \"Installed:\" and \"Candidate:\"; if not, "
                       "correct the package sources or the service's language, then run the update again.");
}

Problem explainPackageInstall(const Run& run, const Step& step)
{
    if (step.code == 127) {
        return problem(run, step, "package-tool-missing", "The package tool apt is not on the service's search path.",
                       "Run harl-updater-tool unit and mend what it names.");
    }
    return problem(run, step, "package-install-failed",
                   "The package tool could not install the package: it could not be fetched, a script of it failed, or "
                   "it had a question that nobody could answer. It may be left half-configured, and the next update "
                   "would then take it for installed.",
                   "On the unit run: dpkg --configure -a, then apt install " + packageOf(run.mainHead) +
                       ", and mend what they name. Only then "
                       "run the update again.");
}

Problem explainBoardCheck(const Run& run, const Step& step)
{
    const long code = step.code.value_or(0);
    if (step.actions.size() > 1 && code != 0) {
        return problem(
            run, step, "stick-not-read",
            "The stick's folder debs/QUORB/armhf could not be listed: no stick is mounted, or it has no such "
            "folder.",
            "Plug in a stick that harl-updater-tool stick finds fit, then run the update again.");
    }
    if (code == 255) {
        return problem(
            run, step, "board-unreachable",
            "The board could not be reached or did not accept the login (exit 255: ssh's own failure).",
            "Check the board's power and the internal link, run: ssh 192.168.9.2, mend what it names, then run "
            "the update again.");
    }
    if (code == 127) {
        return problem(run, step, "board-tool-missing", "The program ssh is not on the service's search path.",
                       "Run harl-updater-tool unit and mend what it names.");
    }
    if (code != 0) {
        return problem(
            run, step, "board-version-missing",
            "The board answered, but has no version file, or no line with the version in it.",
            "On the board look at /root/App/AppExe/version.txt: it must hold a line of \"Brimvale\", a tab and "
            "the version.");
    }
    if (step.actions.size() > 1 && run.board.candidate.empty() && !run.board.installed.empty()) {
        return problem(run, step, "stick-version-missing",
                       "The stick names no version for the board: debs/QUORB/armhf is empty, or its first entry's name "
                       "has no more than the five characters in front of a version.",
                       "Prepare the stick again; harl-updater-tool stick must find it fit. Then run the update again.");
    }
    return problem(
        run, step, "board-version-not-read",
        "The board's version could not be read although the command ended without an error code: its line "
        "has no tab behind \"Brimvale\", or the command was killed.",
        "On the board look at /root/App/AppExe/version.txt: it must hold a line of \"Brimvale\", a tab and the "
        "version. If it does, run the update again.");
}

Problem explainUpload(const Run& run, const Step& step)
{
    if (run.statusesLost) {
        return problem(run, step, "statuses-lost",
                       "The updater was started so that no command's status could be had (SIGCHLD ignored): no upload "
                       "counts as done, whether or not the files arrived.",
                       "Start the update as the service harl-updater, as it is meant.");
    }
    return problem(
        run, step, "board-upload-failed",
        "The files could not be copied to the board in 20 attempts: the board or the link went away, its file "
        "system is full, the stick was pulled out or lacks one of the two files.",
        "Check that the stick is in and that harl-updater-tool stick finds it fit, that the board has power "
        "and room, then run the update again.");
}

/// What decided the outcome, from the step that failed.
Problem explainFailedStep(const Run& run, const Step& step)
{
    Problem found;
    switch (step.kind) {
    case StepKind::REFRESH_MIRRORS:
        found = explainMirrors(run, step);
        break;
    case StepKind::CHECK_PACKAGE:
        found = explainPackageCheck(run, step);
        break;
    case StepKind::INSTALL_PACKAGE:
        found = explainPackageInstall(run, step);
        break;
    case StepKind::CHECK_BOARD:
        found = explainBoardCheck(run, step);
        break;
    case StepKind::UPLOAD_BOARD:
        found = explainUpload(run, step);
        break;
    case StepKind::CHECK_TEAMVIEWER:
        found = problem(run, step, "teamviewer-marker-not-read",
                        "Whether the stick requests TeamViewer could not be found out: the command ls failed.",
                        "Run harl-updater-tool unit and mend what it names, then run the update again.");
        break;
    default:
        found = problem(run, step, "unknown", "The log does not tell.", "Read the log around this step.");
        break;
    }
    if (const Hint* hint = hintFor(step); hint != nullptr && found.name != "statuses-lost") {
        found.why = hint->why;
        found.remedy = hint->remedy;
    }
    return found;
}

bool isFailure(Outcome outcome)
{
    return outcome == Outcome::CHECK_FAILED || outcome == Outcome::MIRRORS_FAILED ||
           outcome == Outcome::PACKAGE_FAILED || outcome == Outcome::BOARD_FAILED ||
           outcome == Outcome::TEAMVIEWER_FAILED || outcome == Outcome::UNKNOWN_FAILURE;
}

/// True for the steps whose failure decides the outcome.
bool decides(StepKind kind)
{
    return kind >= StepKind::REFRESH_MIRRORS && kind <= StepKind::CHECK_TEAMVIEWER &&
           kind != StepKind::RUN_BOARD_SCRIPT && kind != StepKind::WAIT_FOR_BOARD;
}

/// The last step that failed and that can decide an outcome, or null.
const Step* decidingStep(const Run& run)
{
    const auto failed = [](const Step& step) { return step.result == StepResult::FAILED && decides(step.kind); };
    const auto found = std::find_if(run.steps.rbegin(), run.steps.rend(), failed);
    return found == run.steps.rend() ? nullptr : &*found;
}

/// What to do about a run that ended, or may have ended, in `step`.
std::string remedyFor(const Step& step)
{
    switch (step.kind) {
    case StepKind::INSTALL_PACKAGE:
        return "run on the unit: dpkg --configure -a, then run the update again.";
    case StepKind::RUN_BOARD_SCRIPT:
    case StepKind::WAIT_FOR_BOARD:
        return "leave the board 13 minutes of power, then run the update again.";
    case StepKind::SHOW_TO_OPERATOR:
    case StepKind::GIVE_BACK:
        return "the update itself was over: see that the application runs (systemctl status harl).";
    default:
        return "run the update again.";
    }
}

/// A run without its last record.
Problem explainUnfinished(const Run& run)
{
    const Step& last = run.steps.back();
    if (run.ended == RunEnd::EARLY) {
        std::string why = "The updater ended in this step: it crashed, was stopped, or was killed.";
        if (run.failureShownByService) {
            why += " The service then lit FAIL, without a sound, released the stick and started the application.";
        }
        return problem(run, last, "ended-early", why, "Read below what the service manager said; " + remedyFor(last));
    }
    std::string why = "The run's records end in this step. ";
    if (last.kind == StepKind::WAIT_FOR_BOARD) {
        why += "The wait lasts 13 minutes and is silent: it may still be going on. ";
    }
    if (run.followedByAnother) {
        why += "The updater ended early: the power went, or it was stopped or killed.";
        return problem(run, last, "unfinished", why, "If the next run did not go well either: " + remedyFor(last));
    }
    why += "Either it still goes on, or the updater ended early (power, stopped, killed), or the log was cut off.";
    return problem(run, last, "unfinished", why,
                   "See whether the panel still flashes blue in turn. If it does, wait. If not: " + remedyFor(last));
}

void addFailure(Run& run)
{
    if (run.steps.empty()) {
        return;
    }
    if (isFailure(run.outcome)) {
        const Step* step = decidingStep(run);
        run.failure = step == nullptr
                          ? problem(run, run.steps.back(), "unknown",
                                    "An error was shown, but the records that tell which are missing.",
                                    "Get the whole log (harl-updater-tool log --journal), or run the update again.")
                          : explainFailedStep(run, *step);
    } else if ((run.ended == RunEnd::NOT_SEEN || run.ended == RunEnd::EARLY) &&
               !(run.mainHead && run.outcome != Outcome::NONE)) {
        run.failure = explainUnfinished(run);
    }
}

/// What went wrong without deciding the outcome.
void addBesides(Run& run)
{
    if (run.statusesLost) {
        // Every command seems to have failed then, also those that did their work.
        if (!run.failure || run.failure->name != "statuses-lost") {
            run.besides.push_back(
                {"statuses-lost", 0,
                 "The updater was started so that no command's status could be had (SIGCHLD ignored): "
                 "the failures and the exit codes of 0 in this log say nothing.",
                 "Start the update as the service harl-updater, as it is meant."});
        }
        return;
    }
    for (const Step& step : run.steps) {
        if (step.result != StepResult::FAILED || (run.failure && &run.steps[run.failure->step] == &step)) {
            continue;
        }
        const std::string status = step.detail;
        switch (step.kind) {
        case StepKind::STOP_APPLICATION:
            run.besides.push_back(problem(run, step, "application-not-stopped",
                                          "The application was not stopped (" + status + "): the update ran beside it.",
                                          "Check the service: systemctl status harl."));
            break;
        case StepKind::CHECK_BOARD: {
            Problem tolerated = explainFailedStep(run, step);
            tolerated.why += " With an up-to-date package the run counts as nothing to update all the same. The board "
                             "was neither checked nor updated.";
            run.besides.push_back(tolerated);
            break;
        }
        case StepKind::RUN_BOARD_SCRIPT:
            run.besides.push_back(problem(
                run, step, "board-script-failed",
                "The board's install script did not end well (" + status +
                    "). The update counts as done all the same; a board that restarts itself drops the connection like "
                    "this too.",
                "Run the update again: if it finds the same board version as before, the script failed. Then look at "
                "unzipUpgrade.sh and at the room on the board."));
            break;
        case StepKind::INSTALL_TEAMVIEWER:
            run.besides.push_back(problem(run, step, "teamviewer-script-failed",
                                          "TeamViewer's install script did not end well (" + status +
                                              "). The update counts as done all the same.",
                                          "Run /root/RESOURCES/teamviewer_updatescript.sh by hand and mend what it "
                                          "names."));
            break;
        case StepKind::GIVE_BACK:
            run.besides.push_back(problem(
                run, step, contains(status, "harl: ") ? "application-not-started" : "stick-not-released",
                (contains(status, "harl: ")
                     ? "The instrument's application was not started again (" + status + ")."
                     : "The stick was not released (" + status + "): it was not mounted, or something still uses it."),
                contains(status, "harl: ")
                    ? "Start it: systemctl start harl, and see systemctl status harl."
                    : "If it is still mounted: umount /root/USB_MOUNT, before you pull it out."));
            break;
        case StepKind::STOP_UPDATER:
            run.besides.push_back(problem(run, step, "updater-not-stopped",
                                          "The updater could not stop its own service (" + status + ").",
                                          "Check the service: systemctl status harl-updater."));
            break;
        default:
            break;
        }
    }
    if (run.ledFailures > 0) {
        run.besides.push_back({"panel-failed", 0,
                               counted(run.ledFailures, "command") + " to the panel failed" +
                                   (run.outcomeLedFailures > 0 ? ": the outcome was not, or not wholly, lit." : "."),
                               "Run harl-updater-tool unit: it tells whether i2cset is there and the bus answers."});
    }
    if (run.soundFailed) {
        run.besides.push_back({"sound-failed", run.steps.empty() ? 0 : run.steps.size() - 1,
                               "The sound could not be played: the operator heard nothing.",
                               "Run harl-updater-tool unit: it tells whether aplay, the sound files and a sound device "
                               "are there."});
        if (const Step* step = run.find(StepKind::SHOW_OUTCOME); step != nullptr) {
            run.besides.back().step = static_cast<std::size_t>(step - run.steps.data());
        }
    }
}

void addUntold(Run& run)
{
    const auto untold = [&](std::string text) { run.untold.push_back(std::move(text)); };
    if (run.beginningMissing) {
        untold("What came before: the log begins in the middle of this run.");
    }
    if (run.failure && run.failure->name == "unfinished") {
        untold("How this run ended: its last record is missing. What the operator saw is told up to that point only.");
    }
    if (run.tornRecords > 0) {
        untold("What " + counted(run.tornRecords, "torn record") + " said (the first at line " +
               std::to_string(run.firstTornLine) + ").");
    }
    if (run.stepsLeftOut > 0) {
        untold(counted(run.stepsLeftOut, "step") + " more than a run has: left out here.");
    }
    if (run.clockSetBack) {
        untold("How long steps took while the clock was set back.");
    }
    if (run.statusesLost) {
        untold("Whether commands succeeded, the LEDs lit and the sound was heard: no status could be had.");
    }
    const Step* install = run.find(StepKind::INSTALL_PACKAGE);
    if (install != nullptr && install->result == StepResult::DONE && !run.statusesLost) {
        untold(
            "Whether the package is really installed: exit code 0 also stands for a command that was killed or could "
            "not be started. On the unit: dpkg -s " +
            packageOf(run.mainHead) + ".");
    }
    const Step* upload = run.find(StepKind::UPLOAD_BOARD);
    if (upload != nullptr && upload->failedAttempts > 0) {
        untold("Why " + counted(static_cast<std::uint64_t>(upload->failedAttempts), "upload attempt") + " failed" +
               (upload->said.count > 0 ? ", beyond what scp said." : "."));
    }
    if (run.find(StepKind::RUN_BOARD_SCRIPT) != nullptr) {
        untold("Whether the board runs the new version: it is not asked again. The next update's check tells.");
    }
    if (run.markerReported) {
        untold("Whether the first-boot marker was there: its removal is logged either way.");
    }
    if (run.failure && run.failure->name != "unfinished" && run.otherLines == 0) {
        untold("What the tools themselves said: this log has none of their lines. The service's journal has "
               "(harl-updater-tool log --journal).");
    }
    if (run.outcome != Outcome::NONE && !run.mainHead && !run.statusesLost) {
        untold("Whether the LEDs lit and the sound was heard: only commands that fail are logged.");
    }
}

} // namespace

OperatorView operatorView(const Run& run)
{
    OperatorView view;
    const bool bothLeds = run.outcome == Outcome::NO_UPDATE || run.outcome == Outcome::CHECK_FAILED ||
                          run.outcome == Outcome::MIRRORS_FAILED;
    const std::string color = isFailure(run.outcome) ? "fail" : "pass";
    switch (run.outcome) {
    case Outcome::NONE:
        view.meaning = "NOT FINISHED, as far as this log goes";
        break;
    case Outcome::NO_UPDATE:
        view.meaning = "PASSED: nothing to update";
        break;
    case Outcome::UPDATED:
        view.meaning = "PASSED: updated";
        break;
    case Outcome::UPDATE_OFFERED:
        view.meaning = "an update is offered";
        break;
    case Outcome::CHECK_FAILED:
        view.meaning = "FAILED: a version could not be read";
        break;
    case Outcome::MIRRORS_FAILED:
        view.meaning = "FAILED: the package mirrors could not be read";
        break;
    case Outcome::PACKAGE_FAILED:
        view.meaning = "FAILED: the package could not be installed";
        break;
    case Outcome::BOARD_FAILED:
        view.meaning = "FAILED: the board could not be updated";
        break;
    case Outcome::TEAMVIEWER_FAILED:
        view.meaning = "FAILED: TeamViewer could not be installed";
        break;
    case Outcome::UNKNOWN_FAILURE:
        view.meaning = "FAILED: the log does not tell at what";
        break;
    }
    if (run.mainHead) {
        view.seen = "told by the main head's own program";
        return view;
    }
    if (run.outcome == Outcome::NONE) {
        if (run.failureShownByService) {
            view.meaning = "FAILED: the updater ended before its outcome was known";
            view.leds = {{"FAIL", "fail"}};
            view.seen = "FAIL lit in fail colour; no sound";
        } else if (run.ledFailures > 0) {
            view.seen = "a panel that fails; no sound";
        } else {
            view.leds = {{"any", "blue"}};
            view.seen = "REMOTE and MAIN flashing blue in turn while it went on; no sound";
        }
        return view;
    }
    if (run.outcome == Outcome::UNKNOWN_FAILURE) {
        view.seen = "REMOTE and MAIN, or FAIL, in fail colour";
    } else {
        if (bothLeds) {
            view.leds = {{"REMOTE", color}, {"MAIN", color}};
        } else {
            view.leds = {{color == "pass" ? "PASS" : "FAIL", color}};
        }
        view.seen = (bothLeds ? "REMOTE and MAIN" : view.leds.front().first) + " lit in " + color + " colour";
    }
    if (run.outcomeLedFailures > 0 && !run.statusesLost) {
        view.leds.clear();
        view.seen = "a dark or incomplete panel (meant: " + view.seen + ")";
    }
    const bool silent = run.soundFailed && !run.statusesLost;
    view.sound = silent ? "" : color;
    view.seen += silent ? "; no sound (meant: " + color + " sound)" : "; " + color + " sound";
    return view;
}

bool wentWell(const Run& run)
{
    const auto decisive = [](const Problem& found) { return found.name == "application-not-started"; };
    return !run.failure && run.outcome != Outcome::NONE &&
           std::none_of(run.besides.begin(), run.besides.end(), decisive);
}

void explain(Run& run)
{
    addFailure(run);
    addBesides(run);
    addUntold(run);
}
