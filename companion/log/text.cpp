#include "log/text.h"

#include "findings.h"
#include "log/explain.h"

#include <array>
#include <cstdio>
#include <ctime>
#include <ostream>
#include <sstream>

namespace
{

const std::size_t width = 100; // columns

std::string formattedTime(std::int64_t time, const char* format)
{
    const auto seconds = static_cast<std::time_t>(time);
    std::tm parts = {};
    gmtime_r(&seconds, &parts); // the log's local time is kept as if it were UTC
    std::array<char, 64> buffer{};
    return {buffer.data(), std::strftime(buffer.data(), buffer.size(), format, &parts)};
}

/// Prints `text` behind `label`, its further lines indented as deep.
void printWrapped(const std::string& label, const std::string& text, std::ostream& out)
{
    std::istringstream words(text);
    std::string word;
    std::size_t column = label.size();
    out << label;
    for (bool first = true; words >> word; first = false) {
        if (!first && column + 1 + word.size() > width) {
            out << '\n' << std::string(label.size(), ' ');
            column = label.size();
        } else if (!first) {
            out << ' ';
            ++column;
        }
        out << word;
        column += word.size();
    }
    out << '\n';
}

void printSteps(const Run& run, std::ostream& out)
{
    out << "\nStart     Took          Step                              Result\n";
    for (const Step& step : run.steps) {
        const std::string took = step.end ? durationText(*step.end - step.start) : "";
        std::array<char, 256> line{};
        std::snprintf(line.data(), line.size(), "%s  %-12s  %-32s  ", clockText(step.start).c_str(), took.c_str(),
                      stepTitle(step.kind));
        out << line.data() << resultText(step) << '\n';
    }
}

void printLines(const OtherLines& lines, std::ostream& out)
{
    for (const std::string& line : lines.shown()) {
        out << "    | " << line << '\n';
    }
}

void printProblem(const Run& run, const Problem& problem, const std::string& heading, std::ostream& out)
{
    const Step* step = run.stepOf(problem);
    out << '\n' << heading;
    if (step == nullptr) {
        out << "a step that is not in this log";
    } else {
        out << stepTitle(step->kind) << " (line " << step->line << ')';
    }
    out << " [" << problem.name << "]\n";
    printWrapped("  Why:     ", problem.why, out);
    printWrapped("  Do now:  ", problem.remedy, out);
    if (step != nullptr && step->said.count > 0) {
        out << "  The tools said:\n";
        printLines(step->said, out);
    }
}

} // namespace

std::string clockText(std::int64_t time)
{
    return formattedTime(time, "%H:%M:%S");
}

std::string dateText(std::int64_t time)
{
    return formattedTime(time, "%d-%m-%Y %H:%M:%S");
}

std::string durationText(std::int64_t seconds)
{
    if (seconds < 0) {
        return "?"; // the clock was set back
    }
    if (seconds < 60) {
        return std::to_string(seconds) + " s";
    }
    if (seconds < 3600) {
        return std::to_string(seconds / 60) + " min " + std::to_string(seconds % 60) + " s";
    }
    return std::to_string(seconds / 3600) + " h " + std::to_string(seconds % 3600 / 60) + " min";
}

std::string resultText(const Step& step)
{
    switch (step.result) {
    case StepResult::UNFINISHED:
        return step.kind == StepKind::STOP_UPDATER ? "the service ends here" : "NOT FINISHED in this log";
    case StepResult::DONE:
        return step.detail.empty() ? "done" : step.detail;
    case StepResult::FAILED:
        return step.detail.empty() ? "FAILED" : "FAILED: " + step.detail;
    case StepResult::UNTOLD:
        return step.detail;
    }
    return "";
}

std::string packageText(const Run& run)
{
    const Step* check = run.find(StepKind::CHECK_PACKAGE);
    if (check == nullptr && run.beginningMissing) {
        return "not in this log";
    }
    if (check == nullptr || !check->end) {
        return "not checked";
    }
    if (!run.package.found) {
        return "versions not read";
    }
    if (!run.package.differ) {
        return run.package.installed + ", up to date";
    }
    const std::string versions = run.package.installed + " -> " + run.package.candidate + ", ";
    const Step* install = run.find(StepKind::INSTALL_PACKAGE);
    if (install == nullptr) {
        return versions + "not installed";
    }
    if (install->result == StepResult::FAILED) {
        return versions + "installation FAILED";
    }
    return versions + (install->result == StepResult::DONE ? "installed" : "its installation's end is not told");
}

std::string boardText(const Run& run)
{
    const Step* check = run.find(StepKind::CHECK_BOARD);
    if (check == nullptr && run.beginningMissing) {
        return "not in this log";
    }
    if (check == nullptr || !check->end) {
        return "not checked";
    }
    if (!run.board.found) {
        return "versions not read";
    }
    if (!run.board.differ) {
        return run.board.installed + ", up to date";
    }
    const std::string versions = run.board.installed + " -> " + run.board.candidate + ", ";
    const Step* upload = run.find(StepKind::UPLOAD_BOARD);
    const Step* script = run.find(StepKind::RUN_BOARD_SCRIPT);
    if (upload == nullptr) {
        return versions + "not installed";
    }
    if (script == nullptr) {
        return versions + (upload->result == StepResult::FAILED ? "upload FAILED" : "its upload's end is not told");
    }
    if (script->result == StepResult::DONE) {
        return versions + "uploaded and its install script run";
    }
    return versions + (script->result == StepResult::FAILED ? "uploaded, but its install script FAILED"
                                                            : "uploaded; its install script's end is not told");
}

void printRun(const Run& run, const std::string& source, std::ostream& out)
{
    const OperatorView view = operatorView(run);
    out << "Run " << run.number << " of " << source << ", lines " << run.firstLine << " to " << run.lastLine << "\n\n";
    out << "Began:    " << dateText(run.begin);
    if (!run.version.empty()) {
        out << ", updater " << run.version;
    }
    out << ", took " << durationText(run.end - run.begin) << '\n';
    out << "Outcome:  " << view.meaning << '\n';
    out << "Operator: " << view.seen << '\n';
    out << "Package:  " << packageText(run) << '\n';
    out << "Board:    " << boardText(run) << '\n';
    printSteps(run, out);
    if (run.failure) {
        printProblem(run, *run.failure, run.failure->name == "unfinished" ? "Ended in: " : "Failed: ", out);
    }
    for (const Problem& problem : run.besides) {
        printProblem(run, problem, "Besides: ", out);
    }
    if (run.serviceManager.count > 0) {
        out << "\nThe service manager said:\n";
        printLines(run.serviceManager, out);
    }
    if (!run.untold.empty()) {
        out << "\nThis log cannot tell:\n";
        for (const std::string& text : run.untold) {
            printWrapped("  - ", text, out);
        }
    }
}
