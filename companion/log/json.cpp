#include "log/json.h"

#include "log/text.h"

#include <array>

#include <nlohmann/json.hpp>

namespace
{

using Json = nlohmann::ordered_json;

Json orNull(const std::optional<std::int64_t>& value)
{
    return value ? Json(*value) : Json();
}

Json linesToJson(const OtherLines& lines)
{
    return {{"count", lines.count}, {"shown", shownLines(lines)}};
}

Json stepToJson(const Run& run, const Step& step)
{
    Json actions = Json::array();
    for (const Action& action : step.actions) {
        actions.push_back({{"text", actionText(action)},
                           {"start", isoText(action.start)},
                           {"took_s", orNull(action.took)},
                           {"status", actionStatusText(action)}});
    }
    return {{"name", factsOf(step.kind).name},
            {"title", factsOf(step.kind).title},
            {"line", step.line},
            {"start", isoText(step.start)},
            {"took_s", orNull(step.took)},
            {"result", resultName(step.result)},
            {"detail", resultText(run, step)},
            {"status", step.status ? Json(step.status->number) : Json()},
            {"word", step.word},
            {"failed_attempts", step.failedAttempts},
            {"actions", actions},
            {"tools_said", linesToJson(step.said)}};
}

Json versionsToJson(const Versions& versions, const std::string& text)
{
    return {{"read", versions.found()},
            {"from", versions.found() ? Json(versions.installed) : Json()},
            {"to", versions.found() ? Json(versions.candidate) : Json()},
            {"differ", versions.differ()},
            {"text", text}};
}

const std::array<const char*, 4> endNames = {"not-seen", "by-service-manager", "by-itself", "early"}; // of RunEnd

} // namespace

nlohmann::ordered_json problemToJson(const Run& run, const Problem& problem)
{
    const Step* step = run.stepOf(problem);
    return {{"name", problem.failure->name},
            {"step", step == nullptr ? Json() : Json(factsOf(step->kind).name)},
            {"line", step == nullptr ? Json() : Json(step->line)},
            {"why", causeOf(run, problem)},
            {"remedy", remedyOf(run, problem)}};
}

nlohmann::ordered_json runToJson(const Run& run, const std::string& source)
{
    const OperatorView view = operatorView(run);
    Json leds = Json::object();
    for (const auto& [name, color] : view.leds) {
        leds[name] = color;
    }
    Json steps = Json::array();
    for (const Step& step : run.steps) {
        steps.push_back(stepToJson(run, step));
    }
    Json besides = Json::array();
    for (const Problem& problem : run.besides) {
        besides.push_back(problemToJson(run, problem));
    }
    return {{"number", run.number},
            {"source", source},
            {"first_line", run.firstLine},
            {"last_line", run.lastLine},
            {"begin", isoText(run.begin)},
            {"took_s", run.elapsed},
            {"clock_jumps", run.clockJumps},
            {"beginning_missing", run.beginningMissing},
            {"head", run.mainHead ? "main" : "remote"},
            {"updater", run.version},
            {"outcome", outcomeName(run.outcome)},
            {"meaning", view.meaning},
            {"went_well", wentWell(run)},
            {"application_started", run.applicationStarted ? Json(*run.applicationStarted) : Json()},
            {"panel", leds},
            {"sound", view.sound},
            {"operator", view.seen},
            {"ended", endNames.at(static_cast<std::size_t>(run.ended))},
            {"package", versionsToJson(run.package, packageText(run))},
            {"board", versionsToJson(run.board, boardText(run))},
            {"steps", steps},
            {"failure", run.failure ? problemToJson(run, *run.failure) : Json()},
            {"besides", besides},
            {"unit_after_run", run.service.unit.empty() ? Json() : Json(run.service.unit)},
            {"service_manager_said", linesToJson(run.service.lines)},
            {"torn_records", run.torn.records},
            {"other_lines", run.otherLines},
            {"cannot_tell", gapTexts(run)}};
}
