#include "log/json.h"

#include "log/explain.h"
#include "log/text.h"

namespace
{

using Json = nlohmann::ordered_json;

Json duration(std::int64_t start, const std::optional<std::int64_t>& end)
{
    return end ? Json(*end - start) : Json();
}

Json linesToJson(const OtherLines& lines)
{
    return {{"count", lines.count}, {"shown", lines.shown()}};
}

Json stepToJson(const Step& step)
{
    Json actions = Json::array();
    for (const Action& action : step.actions) {
        actions.push_back({{"text", action.text},
                           {"start", isoText(action.start)},
                           {"took_s", duration(action.start, action.end)},
                           {"status", action.status}});
    }
    return {{"name", stepName(step.kind)},
            {"title", stepTitle(step.kind)},
            {"line", step.line},
            {"start", isoText(step.start)},
            {"took_s", duration(step.start, step.end)},
            {"result", resultName(step.result)},
            {"detail", resultText(step)},
            {"status", step.code ? Json(*step.code) : Json()},
            {"word", step.word},
            {"failed_attempts", step.failedAttempts},
            {"actions", actions},
            {"tools_said", linesToJson(step.said)}};
}

Json problemToJson(const Run& run, const Problem& problem)
{
    const Step* step = run.stepOf(problem);
    return {{"name", problem.name},
            {"step", step == nullptr ? Json() : Json(stepName(step->kind))},
            {"line", step == nullptr ? Json() : Json(step->line)},
            {"why", problem.why},
            {"remedy", problem.remedy}};
}

Json versionsToJson(const Versions& versions, const std::string& text)
{
    return {{"read", versions.found},
            {"from", versions.found ? Json(versions.installed) : Json()},
            {"to", versions.found ? Json(versions.candidate) : Json()},
            {"differ", versions.differ},
            {"text", text}};
}

const char* endName(RunEnd end)
{
    switch (end) {
    case RunEnd::NOT_SEEN:
        return "not-seen";
    case RunEnd::BY_SERVICE_MANAGER:
        return "by-service-manager";
    case RunEnd::BY_ITSELF:
        return "by-itself";
    case RunEnd::EARLY:
        return "early";
    }
    return "";
}

} // namespace

const char* outcomeName(Outcome outcome)
{
    switch (outcome) {
    case Outcome::NONE:
        return "none";
    case Outcome::NO_UPDATE:
        return "no-update";
    case Outcome::UPDATED:
        return "updated";
    case Outcome::UPDATE_OFFERED:
        return "update-offered";
    case Outcome::CHECK_FAILED:
        return "check-failed";
    case Outcome::MIRRORS_FAILED:
        return "mirrors-failed";
    case Outcome::PACKAGE_FAILED:
        return "package-failed";
    case Outcome::BOARD_FAILED:
        return "board-failed";
    case Outcome::TEAMVIEWER_FAILED:
        return "teamviewer-failed";
    case Outcome::UNKNOWN_FAILURE:
        return "unknown-failure";
    }
    return "";
}

std::string isoText(std::int64_t time)
{
    const std::string date = dateText(time); // "DD-MM-YYYY HH:MM:SS"
    return date.substr(6, 4) + '-' + date.substr(3, 2) + '-' + date.substr(0, 2) + 'T' + date.substr(11);
}

nlohmann::ordered_json runToJson(const Run& run)
{
    const OperatorView view = operatorView(run);
    Json leds = Json::object();
    for (const auto& [name, color] : view.leds) {
        leds[name] = color;
    }
    Json steps = Json::array();
    for (const Step& step : run.steps) {
        steps.push_back(stepToJson(step));
    }
    Json besides = Json::array();
    for (const Problem& problem : run.besides) {
        besides.push_back(problemToJson(run, problem));
    }
    return {{"number", run.number},
            {"first_line", run.firstLine},
            {"last_line", run.lastLine},
            {"begin", isoText(run.begin)},
            {"took_s", run.end - run.begin},
            {"beginning_missing", run.beginningMissing},
            {"head", run.mainHead ? "main" : "remote"},
            {"updater", run.version},
            {"outcome", outcomeName(run.outcome)},
            {"meaning", view.meaning},
            {"went_well", wentWell(run)},
            {"panel", leds},
            {"sound", view.sound},
            {"operator", view.seen},
            {"ended", endName(run.ended)},
            {"package", versionsToJson(run.package, packageText(run))},
            {"board", versionsToJson(run.board, boardText(run))},
            {"steps", steps},
            {"failure", run.failure ? problemToJson(run, *run.failure) : Json()},
            {"besides", besides},
            {"service_manager_said", linesToJson(run.serviceManager)},
            {"torn_records", run.tornRecords},
            {"other_lines", run.otherLines},
            {"cannot_tell", run.untold}};
}
