#include "log/html.h"

#include "embedded.h"
#include "log/json.h"
#include "log/text.h"

#include <algorithm>
#include <ostream>

#include <kainjow/mustache.hpp>
#include <nlohmann/json.hpp>

namespace
{

using Json = nlohmann::ordered_json;
using kainjow::mustache::data;

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

/// A step's commands and waits; attempts that came out alike are one line.
Json actionsOf(const Step& step)
{
    Json actions = Json::array();
    for (auto action = step.actions.begin(); action != step.actions.end();) {
        const auto next = std::find_if(action, step.actions.end(), [&](const Action& other) {
            return actionText(other) != actionText(*action) || actionStatusText(other) != actionStatusText(*action);
        });
        const std::string times = next - action > 1 ? " (" + std::to_string(next - action) + " times)" : "";
        actions.push_back({{"text", actionText(*action)}, {"status", actionStatusText(*action) + times}});
        action = next;
    }
    return actions;
}

/// A row of the timeline. Of the remote head's program, its threads and its feedback are shown too.
Json rowOf(const Run& run, const Step& step)
{
    const bool ends = step.kind == StepKind::STOP_UPDATER && step.result == StepResult::UNFINISHED;
    const std::int64_t length = step.took.value_or(run.elapsed - step.began);
    return {{"style", ends ? "done" : resultName(step.result)},
            {"clock", clockText(step.start)},
            {"length", length},
            {"took", step.took ? durationText(length) : ""},
            {"title", factsOf(step.kind).title},
            {"result", resultText(run, step)},
            {"actions", actionsOf(step)},
            {"starts", step.kind == StepKind::START},
            {"flashes", step.kind > StepKind::START && step.kind < StepKind::SHOW_OUTCOME},
            {"shows", step.kind == StepKind::SHOW_OUTCOME},
            {"shown", step.kind > StepKind::SHOW_OUTCOME}};
}

Json problemData(const Run& run, const Problem& problem, const char* style)
{
    const Step* step = run.stepOf(problem);
    Json shown = problemToJson(run, problem);
    shown["style"] = style;
    shown["heading"] = headingOf(run, problem);
    if (step != nullptr && step->said.count > 0) {
        shown["said"]["lines"] = shownLines(step->said);
    }
    return shown;
}

} // namespace

void renderPart(const char* page, const char* part, const nlohmann::ordered_json& content, std::ostream& out)
{
    static kainjow::mustache::mustache log(embeddedPage);
    static kainjow::mustache::mustache fleet(embeddedFleetPage);
    (page == embeddedPage ? log : fleet).render(data(part, toData(content)), out);
}

void beginPage(std::ostream& out)
{
    renderPart(embeddedPage, "begin", true, out);
}

void endPage(std::ostream& out)
{
    renderPart(embeddedPage, "end", true, out);
}

void writeRunToPage(const Run& run, const std::string& source, std::ostream& out)
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
    const OperatorView view = operatorView(run);
    content["remote"] = !run.mainHead;
    content["dark"] = run.ledFailures > 0;
    content["silent"] = view.sound.empty();
    content["lit"] = Json::array();
    for (const auto& [name, color] : view.leds) {
        content["lit"].push_back({{"name", name}, {"color", color}});
    }
    content["rows"] = Json::array();
    for (const Step& step : run.steps) {
        content["rows"].push_back(rowOf(run, step));
    }
    content["timeline"] = !run.steps.empty();
    content["open"] = !run.gaps.empty();
    renderPart(embeddedPage, "run", content, out);
}
