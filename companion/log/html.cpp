#include "log/html.h"

#include "embedded.h"
#include "log/json.h"
#include "log/text.h"

#include <algorithm>
#include <cmath>
#include <ostream>

#include <kainjow/mustache.hpp>

namespace
{

using Json = nlohmann::ordered_json;
using kainjow::mustache::data;

bool isWait(const Action& action)
{
    return *action.command == '\0';
}

std::string resultClass(const Step& step)
{
    const bool ends = step.kind == StepKind::STOP_UPDATER && step.result == StepResult::UNFINISHED;
    return ends ? "done" : resultName(step.result);
}

/// What the template takes, of what runs are made of for programs.
data toData(const Json& value)
{
    if (value.is_object()) {
        data result;
        for (const auto& [name, item] : value.items()) {
            result.set(name, toData(item));
        }
        return result;
    }
    if (value.is_array()) {
        data result(data::type::list);
        for (const Json& item : value) {
            result.push_back(toData(item));
        }
        return result;
    }
    if (value.is_null() || value.is_boolean()) {
        return data(value == true);
    }
    return data(value.is_string() ? value.get<std::string>() : value.dump());
}

/// Writes the part of the page's template that shows the data of this name.
void render(const char* part, const Json& content, std::ostream& out)
{
    static kainjow::mustache::mustache page(embeddedPage);
    page.render(data(part, toData(content)), out);
}

/// The timeline of one run: a grid with a column for each step and a row for each lane. Of the remote head's program
/// its threads and feedback are shown too.
class Timeline
{
public:
    explicit Timeline(const Run& run)
        : mRun(run), mEnd(run.steps.size()), mBegin(run.steps.front().kind == StepKind::START ? 1 : 0)
    {
        const auto shown = std::find_if(run.steps.begin(), run.steps.end(),
                                        [](const Step& step) { return step.kind == StepKind::SHOW_OUTCOME; });
        mShown = static_cast<std::size_t>(shown - run.steps.begin());
    }

    Json content()
    {
        Json scale = Json::array();
        std::string columns;
        for (const Step& step : mRun.steps) {
            const bool waits =
                std::any_of(step.actions.begin(), step.actions.end(), isWait) && step.result == StepResult::DONE;
            const std::int64_t length = step.took.value_or(mRun.elapsed - step.began);
            scale.push_back({{"style", waits ? "wait" : resultClass(step)},
                             {"length", length},
                             {"title", factsOf(step.kind).title}});
            // 13 minutes and a second can both be read.
            const double width = 100 + 40 * std::log10(1.0 + static_cast<double>(length));
            columns += " minmax(0," + std::to_string(static_cast<int>(width)) + "fr)";
        }
        addLanes();
        return {{"scale", scale}, {"columns", columns}, {"lanes", mLanes}};
    }

private:
    /// Begins a lane; its cells follow.
    void addLane(const char* name)
    {
        mLanes.push_back({{"name", name}, {"row", mLanes.size() + 1}, {"cells", Json::array()}});
    }

    /// Adds a cell from column `begin` to before column `end`, counted in steps, unless it has no width.
    void addCell(std::size_t begin, std::size_t end, const std::string& style, const std::string& text,
                 const Json& more = {})
    {
        if (begin < std::min(end, mEnd)) {
            Json cell = {{"style", style},
                         {"begin", begin + 2}, // the lanes' names are in front
                         {"end", end + 2},
                         {"text", text},
                         {"row", mLanes.size()}};
            cell.update(more.is_null() ? Json::object() : more);
            mLanes.back()["cells"].push_back(cell);
        }
    }

    void addLanes()
    {
        const OperatorView view = operatorView(mRun);
        addLane("Time");
        forEachStep([&](const Step& step, std::size_t at) { addCell(at, at + 1, "time", clockText(step.start)); });
        if (!mRun.mainHead) {
            addLane("Main thread");
            addCell(0, mBegin, "done", "starts, darkens the panel");
            addCell(mBegin, mEnd, "", "waits for the update's thread");
        }
        addLane("Update thread");
        forEachStep([&](const Step& step, std::size_t at) {
            const std::string took = step.took ? durationText(*step.took) + ": " : "";
            if (step.kind != StepKind::START) {
                addCell(at, at + 1, resultClass(step), took + resultText(mRun, step),
                        {{"title", factsOf(step.kind).title}});
            }
        });
        addLane("Commands");
        forEachStep([&](const Step& step, std::size_t at) {
            if (!std::all_of(step.actions.begin(), step.actions.end(), isWait)) {
                addCell(at, at + 1, "", "", {{"commands", commandsOf(step)}});
            }
        });
        addLane("Waits");
        forEachStep([&](const Step& step, std::size_t at) {
            for (const Action& action : step.actions) {
                addCell(at, isWait(action) ? at + 1 : at, "wait", actionText(action));
            }
        });
        if (mRun.mainHead) {
            return;
        }
        if (mBegin < mShown) {
            addLane("Flashing thread");
            addCell(mBegin, mShown, "flash", "lights REMOTE and MAIN in blue in turn, a second each");
        }
        addLane("LED pattern");
        addCell(0, mBegin, "", "", ledsOf({}));
        addCell(mBegin, mShown, "flash",
                mRun.ledFailures > 0 ? "flashing as far as the panel works" : "flashing in turn",
                ledsOf({{"REMOTE", "half"}, {"MAIN", "half"}}));
        addCell(mShown, mShown + 1, "", "dark, then the outcome");
        addCell(mShown + 1, mEnd, "", view.seen, ledsOf(view.leds));
        if (mShown < mEnd) {
            addLane("Sound");
            addCell(mShown, mShown + 1, "", view.sound.empty() ? "none" : view.sound + " sound");
        }
    }

    template <typename Visit>
    void forEachStep(Visit visit)
    {
        for (std::size_t index = 0; index < mEnd; ++index) {
            visit(mRun.steps[index], index);
        }
    }

    /// A step's commands; attempts that came out alike are one line.
    static Json commandsOf(const Step& step)
    {
        Json commands = Json::array();
        for (auto action = step.actions.begin(); action != step.actions.end();) {
            const auto next = std::find_if(action, step.actions.end(), [&](const Action& other) {
                return actionText(other) != actionText(*action) || actionStatusText(other) != actionStatusText(*action);
            });
            if (!isWait(*action)) {
                const std::string times = next - action > 1 ? " (" + std::to_string(next - action) + " times)" : "";
                commands.push_back({{"command", actionText(*action)}, {"status", actionStatusText(*action) + times}});
            }
            action = next;
        }
        return commands;
    }

    /// All LEDs that the updater uses; those that `lit` does not name are dark.
    static Json ledsOf(const std::vector<std::pair<std::string, std::string>>& lit)
    {
        Json leds = Json::array();
        for (const char* name : {"REMOTE", "MAIN", "PASS", "FAIL"}) {
            const auto found = std::find_if(lit.begin(), lit.end(), [&](const auto& led) { return led.first == name; });
            leds.push_back({{"name", name}, {"color", found == lit.end() ? "" : found->second}});
        }
        return {{"leds", leds}};
    }

    const Run& mRun;
    std::size_t mEnd;   // of the steps
    std::size_t mBegin; // the first step that flashes
    std::size_t mShown; // the first one that no longer does
    Json mLanes = Json::array();
};

Json problemData(const Run& run, const Problem& problem, const char* style)
{
    const Step* step = run.stepOf(problem);
    Json said;
    for (const std::string& line : step == nullptr ? std::vector<std::string>() : shownLines(step->said)) {
        said["lines"].push_back(line);
    }
    return {{"style", style},
            {"heading", headingOf(run, problem)},
            {"cause", causeOf(run, problem)},
            {"remedy", remedyOf(run, problem)},
            {"said", said}};
}

} // namespace

HtmlPage::HtmlPage(std::ostream& out) : mOut(out)
{
    render("begin", true, mOut);
}

void HtmlPage::writeRun(const Run& run, const std::string& source)
{
    Json content = runToJson(run, source);
    content["date"] = dateText(run.begin);
    content["took"] = durationText(run.elapsed);
    content["problems"] = Json::array();
    if (run.failure) {
        content["problems"].push_back(problemData(run, *run.failure, ""));
    }
    for (const Problem& problem : run.besides) {
        content["problems"].push_back(problemData(run, problem, "besides"));
    }
    content["timeline"] = run.steps.empty() ? Json() : Timeline(run).content();
    content["open"] = !run.gaps.empty();
    render("run", content, mOut);
}

void HtmlPage::finish()
{
    render("end", true, mOut);
    mOut.flush();
}
