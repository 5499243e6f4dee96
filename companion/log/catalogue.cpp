#include "log/catalogue.h"

#include "findings.h"
#include "log/run.h"
#include "log/text.h"

#include <algorithm>
#include <ostream>

#include <nlohmann/json.hpp>

namespace
{

using S = StepKind;
using Json = nlohmann::ordered_json;

StepSet stepsNamed(const Json& names)
{
    StepSet steps;
    for (std::size_t kind = 0; kind < stepKinds; ++kind) {
        steps.set(kind,
                  std::find(names.begin(), names.end(), factsOf(static_cast<StepKind>(kind)).name) != names.end());
    }
    return steps;
}

Json namesOf(const StepSet& steps)
{
    Json names = Json::array();
    for (std::size_t kind = 0; kind < stepKinds; ++kind) {
        if (steps.test(kind)) {
            names.push_back(factsOf(static_cast<StepKind>(kind)).name);
        }
    }
    return names;
}

bool has(const StepSet& steps, StepKind kind)
{
    return steps.test(static_cast<std::size_t>(kind));
}

std::vector<Failure> readFailures()
{
    std::vector<Failure> failures;
    for (const auto& [name, entry] : catalogue("failures").items()) {
        const Json code = entry.value("code", Json(""));
        failures.push_back({name,
                            entry.value("reported", ""),
                            stepsNamed(entry.value("steps", Json::array())),
                            code.is_string() ? code.get<std::string>() : code.dump(),
                            entry.value("general", false),
                            unfilled(entry.at("cause")),
                            unfilled(entry.at("remedy")),
                            {}});
        Failure& failure = failures.back();
        const Json phrases = entry.value("phrases", Json::object());
        for (const auto& [tool, texts] : phrases.items()) {
            const StepSet steps = failure.steps & stepsNamed(catalogue("tools").at(tool)); // that the tool runs in
            for (const Json& words : texts) {
                failure.phrases.push_back({tool, words.get<std::string>(), steps});
            }
        }
    }
    return failures;
}

const std::vector<Failure>& failures()
{
    static const std::vector<Failure> all = readFailures();
    return all;
}

/// The entry for a step that failed, as specific as the log allows.
const Failure* entryFor(const Run& run, const Step& step)
{
    if (step.kind == S::UPLOAD_BOARD && run.statusesLost) {
        return findFailure("statuses-lost");
    }
    if (step.kind == S::CHECK_BOARD) {
        if (step.event == Event::STICK_NOT_READ) {
            return findFailure("stick-not-read");
        }
        if (!step.status || run.board.unclear) {
            return findFailure("board-not-read");
        }
        if (step.status->number == 0 && run.board.candidate.empty() && !run.board.installed.empty()) {
            return findFailure("stick-version-missing");
        }
    }
    if (step.kind == S::CHECK_PACKAGE && !step.status) {
        return findFailure("package-not-read");
    }
    const long code = step.status ? step.status->number : step.word == "NO_INTERNET_ERROR_CODE" ? 100 : 0;
    const Failure* found = findFailure("unknown");
    for (const Failure& failure : failures()) {
        const bool exact = failure.code == std::to_string(code);
        if (has(failure.steps, step.kind) && (exact || failure.code == "any")) {
            found = &failure;
            if (exact) {
                break;
            }
        }
    }
    return found->general && step.pointsTo != nullptr ? step.pointsTo : found;
}

/// True for a step whose end decides the run's outcome.
bool decides(const Step& step, Outcome outcome)
{
    return failureOf(step) == outcome ||
           (outcome == Outcome::CHECK_FAILED && step.kind == S::CHECK_BOARD && step.result == StepResult::FAILED);
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
        run.failure = {findFailure("run-not-allowed"), run.steps.size()};
        return;
    }
    if (run.steps.empty()) {
        return;
    }
    const bool failed = isFailure(run.outcome);
    const auto decisive = std::find_if(run.steps.rbegin(), run.steps.rend(),
                                       [&](const Step& step) { return failed && decides(step, run.outcome); });
    if (decisive != run.steps.rend()) {
        run.failure = {entryFor(run, *decisive), static_cast<std::size_t>(run.steps.rend() - decisive) - 1};
        return;
    }
    const bool shown = run.steps.back().kind >= S::SHOW_OUTCOME ||
                       (run.mainHead && run.outcome != Outcome::NONE && run.outcome != Outcome::UPDATE_OFFERED);
    const char* const name = failed                          ? "unknown"
                             : run.ended == RunEnd::EARLY    ? "ended-early"
                             : run.ended != RunEnd::NOT_SEEN ? "outcome-missing"
                             : shown                         ? "end-missing"
                             : run.followedByAnother         ? "cut-short"
                                                             : "unfinished";
    if (failed || run.outcome == Outcome::NONE || run.ended == RunEnd::EARLY || run.ended == RunEnd::NOT_SEEN) {
        run.failure = {findFailure(name), run.steps.size() - 1};
    }
}

/// What went wrong without deciding the outcome.
void addBesides(Run& run)
{
    const bool named = run.failure && run.failure->failure == findFailure("statuses-lost");
    for (std::size_t index = 0; index < run.steps.size(); ++index) {
        if (run.steps[index].timeUsedUp) {
            run.besides.push_back({findFailure("time-used-up"), index});
        }
    }
    for (const auto& [event, name] : serviceProblems) {
        if (run.service.has(event)) {
            run.besides.push_back({findFailure(name), run.steps.size()});
        }
    }
    if (run.statusesLost) {
        // Every command seems to have failed then, also those that did their work.
        if (!named) {
            run.besides.push_back({findFailure("statuses-lost"), 0});
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
            for (const std::size_t command : failedCommands(step)) {
                run.besides.push_back({findFailure(names[command]), index});
            }
            continue;
        }
        run.besides.push_back({entryFor(run, step), index, step.kind == S::CHECK_BOARD && !run.mainHead});
    }
    if (run.ledFailures > 0) {
        run.besides.push_back({findFailure("panel-failed"), 0});
    }
    const auto index = [&](const Step* step) {
        return step == nullptr ? run.steps.size() : static_cast<std::size_t>(step - run.steps.data());
    };
    if (run.soundFailed) {
        run.besides.push_back({findFailure("sound-failed"), index(run.find(S::SHOW_OUTCOME))});
    }
    if (!run.applicationStarted && !run.failure && !run.steps.empty()) {
        run.besides.push_back({findFailure("start-missing"), index(run.find(S::GIVE_BACK))});
    }
}

void addGaps(Run& run)
{
    const auto add = [&](bool open, const char* gap) {
        if (open) {
            run.gaps.emplace_back(gap);
        }
    };
    const Step* install = run.find(S::INSTALL_PACKAGE);
    const Step* upload = run.find(S::UPLOAD_BOARD);
    add(run.beginningMissing, "beginning");
    add(run.ended == RunEnd::NOT_SEEN, "end");
    add(run.outcome == Outcome::PASSED, run.mainHead ? "offer" : "outcome");
    add(run.torn.records > 0, "torn-records");
    add(run.stepsLeftOut > 0, "steps-left-out");
    add(run.clockJumps > 0, "clock");
    add(run.statusesLost, "statuses");
    add(install != nullptr && install->result == StepResult::DONE && !run.statusesLost, "package-installed");
    add(upload != nullptr && upload->failedAttempts > 0, "upload-attempts");
    add(run.find(S::RUN_BOARD_SCRIPT) != nullptr, "board-runs");
    add(run.markerRemoved, "marker");
    add(run.failure && isFailure(run.outcome) && run.otherLines == 0, "tools-words");
    add(run.outcome != Outcome::NONE && !run.mainHead && !run.statusesLost, "feedback");
}

} // namespace

const Failure* findFailure(std::string_view name)
{
    const auto found = std::find_if(failures().begin(), failures().end(),
                                    [&](const Failure& failure) { return failure.name == name; });
    return found == failures().end() ? nullptr : &*found;
}

const Failure* failureSaid(std::string_view line, StepKind kind)
{
    for (const Failure& failure : failures()) {
        for (const Phrase& phrase : failure.phrases) {
            if (has(phrase.steps, kind) && contains(line, phrase.words)) {
                return &failure;
            }
        }
    }
    return nullptr;
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
                     run.service.has(ServiceEvent::FAILURE_SHOWN);
    return !bad && run.outcome != Outcome::NONE && !isFailure(run.outcome) && run.applicationStarted.value_or(false) &&
           (run.ended == RunEnd::BY_SERVICE_MANAGER || run.ended == RunEnd::BY_ITSELF);
}

bool printCatalogue(const std::string& name, bool json, std::ostream& out)
{
    const Values values = valuesOf(Run(), nullptr, {});
    Json entries = Json::array();
    std::string text;
    const auto add = [&](const char* label, const std::string& words) {
        text += words.empty() ? "" : label + words + '\n';
    };
    for (const Failure& failure : failures()) {
        if (!name.empty() && name != failure.name) {
            continue;
        }
        Json entry = {{"name", failure.name},
                      {"reported", failure.reported},
                      {"steps", namesOf(failure.steps)},
                      {"cause", filled(failure.cause, values)},
                      {"remedy", filled(failure.remedy, values)},
                      {"phrases", Json::array()}};
        std::string steps;
        for (const Json& step : entry["steps"]) {
            steps += (steps.empty() ? "" : ", ") + step.get<std::string>();
        }
        text += (text.empty() ? "" : "\n") + failure.name + '\n';
        add("  Reported: \t", failure.reported);
        add("  In step:  \t", steps);
        add("  Cause:    \t", entry["cause"]);
        add("  Do now:   \t", entry["remedy"]);
        for (const Phrase& phrase : failure.phrases) {
            entry["phrases"].push_back(
                {{"tool", phrase.tool}, {"words", phrase.words}, {"steps", namesOf(phrase.steps)}});
            add("  Says so:  \t", phrase.tool + ": " + phrase.words);
        }
        entries.push_back(std::move(entry));
    }
    if (json && !entries.empty()) {
        out << Json{{"command", "explain"}, {"version", jsonVersion}, {"failures", entries}}.dump(2) << '\n';
    } else {
        printText(text, out);
    }
    return !entries.empty();
}
