#include "log/html.h"

#include "findings.h"
#include "log/text.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <ostream>

namespace
{

const char pageHead[] = R"(<!DOCTYPE html>
<html lang="en">
<head>
<meta charset="utf-8">
<meta name="viewport" content="width=device-width">
<meta http-equiv="Content-Security-Policy" content="default-src 'none'; style-src 'unsafe-inline'">
<title>Update log</title>
<style>
body { font: 14px/1.4 sans-serif; margin: 1.5em; color: #222; background: #fff; }
h1 { font-size: 1.3em; } h2 { font-size: 1.15em; margin-top: 2em; border-top: 2px solid #888; padding-top: .6em; }
table { border-collapse: collapse; } th { text-align: left; padding: .1em 1em .1em 0; font-weight: normal; color: #555; }
.good { color: #176b2c; font-weight: bold; } .bad { color: #a31515; font-weight: bold; }
.scale { display: flex; height: 14px; margin: 1em 0 .3em; border: 1px solid #888; }
.scale div { min-width: 3px; box-sizing: border-box; border-right: 1px solid #fff; }
.scroll { overflow-x: auto; }
.lanes { display: grid; gap: 2px; margin: .4em 0 1em; font-size: 12px; }
.lanes > * { padding: 3px 5px; background: #f1f1f1; overflow-wrap: anywhere; }
.lanes > .lane { background: none; color: #555; }
.lanes > .time { background: none; border-left: 1px solid #888; font-variant-numeric: tabular-nums; }
.lanes > .done { background: #d4ead8; } .lanes > .failed { background: #f3c9c9; }
.lanes > .unfinished { background: #fbe6bf; } .lanes > .untold { background: #e2e2e2; }
.lanes > .wait { background: #dfe6f5; } .lanes > .flash { background: #bcd0fa; }
.scale .done { background: #8cc79a; } .scale .failed { background: #d96a6a; }
.scale .unfinished { background: #efb84c; } .scale .untold { background: #aaa; } .scale .wait { background: #9db4e4; }
code { font-size: 11px; } .status { color: #555; }
.led { display: inline-block; width: 11px; height: 11px; border-radius: 50%; border: 1px solid #555; background: #333;
  vertical-align: -1px; margin-right: 3px; }
.led.blue { background: #3b6ff5; } .led.pass { background: #2fb34f; } .led.fail { background: #e03131; }
.led.half { background: linear-gradient(90deg, #3b6ff5 50%, #333 50%); }
.problem { border-left: 4px solid #d96a6a; padding: .2em 0 .2em .8em; margin: .8em 0; } .besides { border-color: #efb84c; }
pre { background: #f6f6f6; padding: .4em; margin: .3em 0; white-space: pre-wrap; overflow-wrap: anywhere; }
@media print { .scroll { overflow: visible; } .lanes { zoom: .6; } }
</style>
</head>
<body>
)";

std::string html(const std::string& text)
{
    std::string result;
    for (const char character : text) {
        switch (character) {
        case '&':
            result += "&amp;";
            break;
        case '<':
            result += "&lt;";
            break;
        case '>':
            result += "&gt;";
            break;
        case '"':
            result += "&quot;";
            break;
        default:
            result += character;
        }
    }
    return result;
}

bool isWait(const Action& action)
{
    return *action.command == '\0';
}

const char* resultClass(const Step& step)
{
    if (step.kind == StepKind::STOP_UPDATER && step.result == StepResult::UNFINISHED) {
        return "done";
    }
    return resultName(step.result);
}

std::int64_t length(const Run& run, const Step& step)
{
    return step.took.value_or(run.elapsed - step.began);
}

/// The timeline of one run: a grid with a column for each step and a row for each lane.
class Lanes
{
public:
    Lanes(const Run& run, std::ostream& out) : mRun(run), mOut(out) {}

    void write()
    {
        writeGrid();
        writeTimes();
        writeMainThread();
        writeUpdateThread();
        writeCommands();
        writeWaits();
        writeFlashing();
        writePanel();
        writeSound();
        mOut << "</div></div>\n";
    }

private:
    /// Columns grow with the logarithm of a step's length, so that 13 minutes and a second can both be read.
    void writeGrid()
    {
        mOut << "<div class=\"scroll\"><div class=\"lanes\" style=\"grid-template-columns:80px";
        for (const Step& step : mRun.steps) {
            mOut << ' ' << "minmax(0,"
                 << static_cast<int>(100 + 40 * std::log10(1.0 + static_cast<double>(length(mRun, step)))) << "fr)";
        }
        mOut << "\">\n";
    }

    void beginLane(const char* name)
    {
        ++mRow;
        mOut << "<div class=\"lane\" style=\"grid-row:" << mRow << ";grid-column:1\">" << name << "</div>\n";
    }

    /// Opens a cell of the lane from column `first` to before column `end`, counted in steps.
    std::ostream& cell(std::size_t first, std::size_t end, const std::string& style)
    {
        return mOut << "<div class=\"" << style << "\" style=\"grid-row:" << mRow << ";grid-column:" << first + 2 << '/'
                    << end + 2 << "\">";
    }

    void writeTimes()
    {
        beginLane("Time");
        for (std::size_t index = 0; index < mRun.steps.size(); ++index) {
            cell(index, index + 1, "time") << clockText(mRun.steps[index].start) << "</div>\n";
        }
    }

    void writeMainThread()
    {
        if (mRun.mainHead) {
            return;
        }
        beginLane("Main thread");
        const std::size_t started = mRun.steps.front().kind == StepKind::START ? 1 : 0;
        if (started == 1) {
            cell(0, 1, "done") << "starts, darkens the panel</div>\n";
        }
        if (started < mRun.steps.size()) {
            cell(started, mRun.steps.size(), "") << "waits for the update's thread</div>\n";
        }
    }

    void writeUpdateThread()
    {
        beginLane("Update thread");
        for (std::size_t index = 0; index < mRun.steps.size(); ++index) {
            const Step& step = mRun.steps[index];
            if (step.kind == StepKind::START) {
                continue;
            }
            cell(index, index + 1, resultClass(step)) << "<b>" << html(factsOf(step.kind).title) << "</b><br>";
            if (step.took) {
                mOut << durationText(*step.took) << ": ";
            }
            mOut << html(resultText(mRun, step)) << "</div>\n";
        }
    }

    void writeCommands()
    {
        beginLane("Commands");
        for (std::size_t index = 0; index < mRun.steps.size(); ++index) {
            const Step& step = mRun.steps[index];
            if (std::all_of(step.actions.begin(), step.actions.end(), isWait)) {
                continue;
            }
            cell(index, index + 1, "");
            for (auto action = step.actions.begin(); action != step.actions.end();) {
                // Attempts that came out alike are one line.
                const auto next = std::find_if(action, step.actions.end(), [&](const Action& other) {
                    return actionText(other) != actionText(*action) ||
                           actionStatusText(other) != actionStatusText(*action);
                });
                if (!isWait(*action)) {
                    mOut << "<div><code>" << html(actionText(*action)) << "</code> <span class=\"status\">"
                         << html(actionStatusText(*action));
                    mOut << (next - action > 1 ? " (" + std::to_string(next - action) + " times)" : "")
                         << "</span></div>";
                }
                action = next;
            }
            mOut << "</div>\n";
        }
    }

    void writeWaits()
    {
        beginLane("Waits");
        for (std::size_t index = 0; index < mRun.steps.size(); ++index) {
            for (const Action& action : mRun.steps[index].actions) {
                if (isWait(action)) {
                    cell(index, index + 1, "wait") << html(actionText(action)) << "</div>\n";
                }
            }
        }
    }

    /// The first step that no longer flashes.
    std::size_t flashingEnd() const
    {
        const auto shown = std::find_if(mRun.steps.begin(), mRun.steps.end(),
                                        [](const Step& step) { return step.kind == StepKind::SHOW_OUTCOME; });
        return static_cast<std::size_t>(shown - mRun.steps.begin());
    }

    std::size_t flashingBegin() const { return mRun.steps.front().kind == StepKind::START ? 1 : 0; }

    void writeFlashing()
    {
        if (mRun.mainHead || flashingBegin() >= flashingEnd()) {
            return;
        }
        beginLane("Flashing thread");
        cell(flashingBegin(), flashingEnd(), "flash")
            << "lights REMOTE and MAIN in blue in turn, a second each</div>\n";
    }

    void led(const char* name, const std::string& color)
    {
        mOut << "<span class=\"led " << color << "\"></span>" << name << ' ';
    }

    void leds(const OperatorView& view)
    {
        for (const char* name : {"REMOTE", "MAIN", "PASS", "FAIL"}) {
            const auto found =
                std::find_if(view.leds.begin(), view.leds.end(), [&](const auto& lit) { return lit.first == name; });
            led(name, found == view.leds.end() ? "" : found->second);
        }
    }

    void writePanel()
    {
        if (mRun.mainHead) {
            return;
        }
        beginLane("LED pattern");
        if (flashingBegin() == 1) {
            cell(0, 1, "");
            leds(OperatorView());
            mOut << "</div>\n";
        }
        if (flashingBegin() < flashingEnd()) {
            cell(flashingBegin(), flashingEnd(), "flash");
            led("REMOTE", "half");
            led("MAIN", "half");
            mOut << (mRun.ledFailures > 0 ? "flashing as far as the panel works" : "flashing in turn") << "</div>\n";
        }
        if (flashingEnd() < mRun.steps.size()) {
            cell(flashingEnd(), flashingEnd() + 1, "") << "dark, then the outcome</div>\n";
        }
        if (flashingEnd() + 1 < mRun.steps.size()) {
            const OperatorView view = operatorView(mRun);
            cell(flashingEnd() + 1, mRun.steps.size(), "");
            leds(view);
            mOut << "<br>" << html(view.seen) << "</div>\n";
        }
    }

    void writeSound()
    {
        if (mRun.mainHead || flashingEnd() >= mRun.steps.size()) {
            return;
        }
        beginLane("Sound");
        const std::string sound = operatorView(mRun).sound;
        cell(flashingEnd(), flashingEnd() + 1, "") << (sound.empty() ? "none" : sound + " sound") << "</div>\n";
    }

    const Run& mRun;
    std::ostream& mOut;
    int mRow = 0;
};

void writeScale(const Run& run, std::ostream& out)
{
    out << "<div class=\"scale\">";
    for (const Step& step : run.steps) {
        const bool waits =
            std::any_of(step.actions.begin(), step.actions.end(), isWait) && step.result == StepResult::DONE;
        out << "<div class=\"" << (waits ? "wait" : resultClass(step)) << "\" style=\"flex:" << length(run, step)
            << " 0 0\" title=\"" << html(factsOf(step.kind).title) << "\"></div>";
    }
    out << "</div>\n<p>True to scale above; below, a column's width grows with the logarithm of its time.</p>\n";
}

void writeProblem(const Run& run, const Problem& problem, const char* style, std::ostream& out)
{
    const Step* step = run.stepOf(problem);
    out << "<div class=\"problem " << style << "\"><b>" << html(headingOf(run, problem)) << "</b><br>\n"
        << html(causeOf(run, problem)) << "<br>\n<b>Do now:</b> " << html(remedyOf(run, problem)) << '\n';
    if (step != nullptr && step->said.count > 0) {
        out << "<pre>";
        for (const std::string& line : shownLines(step->said)) {
            out << html(line) << '\n';
        }
        out << "</pre>\n";
    }
    out << "</div>\n";
}

void writeSummary(const Run& run, std::ostream& out)
{
    const OperatorView view = operatorView(run);
    const std::array<std::pair<const char*, std::string>, 5> rows = {{
        {"Outcome",
         "<span class=\"" + std::string(wentWell(run) ? "good" : "bad") + "\">" + html(view.meaning) + "</span>"},
        {"Operator", html(view.seen)},
        {"Package", html(packageText(run))},
        {"Board", html(boardText(run))},
        {"Took", durationText(run.elapsed)},
    }};
    out << "<table>\n";
    for (const auto& [label, text] : rows) {
        out << "<tr><th>" << label << "</th><td>" << text << "</td></tr>\n";
    }
    out << "</table>\n";
}

} // namespace

HtmlPage::HtmlPage(std::ostream& out) : mOut(out)
{
    mOut << pageHead << "<h1>Updates</h1>\n";
}

void HtmlPage::writeRun(const Run& run, const std::string& source)
{
    mOut << "<h2>Run " << run.number << " of " << html(source) << ", " << dateText(run.begin) << "</h2>\n";
    writeSummary(run, mOut);
    if (run.failure) {
        writeProblem(run, *run.failure, "", mOut);
    }
    for (const Problem& problem : run.besides) {
        writeProblem(run, problem, "besides", mOut);
    }
    if (!run.steps.empty()) {
        writeScale(run, mOut);
        Lanes(run, mOut).write();
    }
    if (!run.gaps.empty()) {
        mOut << "<p>This log cannot show:</p>\n<ul>\n";
        for (const Gap gap : run.gaps) {
            mOut << "<li>" << html(gapText(run, gap)) << "</li>\n";
        }
        mOut << "</ul>\n";
    }
}

void HtmlPage::finish()
{
    mOut << "</body>\n</html>\n" << std::flush;
}
