#include "fleet/fleet_command.h"

#include "embedded.h"
#include "findings.h"
#include "fleet/fleet.h"
#include "fleet/reading.h"
#include "log/catalogue.h"
#include "log/html.h"
#include "log/text.h"
#include "page_file.h"
#include "procedure.h"

#include <algorithm>
#include <ctime>
#include <iomanip>
#include <map>
#include <ostream>
#include <sstream>

#include <nlohmann/json.hpp>

namespace
{

using Json = nlohmann::ordered_json;
using Units = std::vector<const FleetUnit*>;
using Counts = std::map<std::string, std::size_t>;
using RunCounts = std::map<std::string, Counts>; // "runs", and "units" whose last one they were

const std::int64_t day = 86400;         // s
const std::int64_t mostPeriods = 31;    // in the page's bars
const std::int64_t oldest = 1577836800; // 2020-01-01: a clock that shows less was never set
const std::int64_t noTime = INT64_MIN;  // before any run
const std::size_t colors = 6;           // of versions in the page
const char unknown[] = "not known";

/// "2026-11-21" as ParsedRecord::time; noTime when it is no date.
std::int64_t timeOf(const std::string& date)
{
    std::tm parts = {};
    const char* end = strptime(date.c_str(), "%Y-%m-%d", &parts);
    const std::time_t time = timegm(&parts);
    return end != nullptr && *end == '\0' && isoText(time).substr(0, 10) == date ? time : noTime;
}

bool hasMet(const FleetRun& run, const std::string& name)
{
    const auto is = [&](const Failure* failure) { return failure != nullptr && failure->name == name; };
    return is(run.failure) || std::any_of(run.besides.begin(), run.besides.end(), is);
}

/// By name; only those that met the failure, if one is named.
Units unitsOf(const Fleet& fleet, const std::string& failed)
{
    Units units;
    for (const auto& [machine, unit] : fleet.units()) {
        if (failed.empty() || hasMet(unit.last(), failed)) {
            units.push_back(&unit);
        }
    }
    std::sort(units.begin(), units.end(), [](const FleetUnit* first, const FleetUnit* second) {
        return std::tie(first->name, first->machine) < std::tie(second->name, second->machine);
    });
    return units;
}

std::string text(const Json& value)
{
    return value.is_null() ? unknown : value.is_string() ? value.get<std::string>() : value.dump();
}

/// "a, b"
std::string joined(const Json& names)
{
    std::string all;
    for (const Json& name : names) {
        all += (all.empty() ? "" : ", ") + name.get<std::string>();
    }
    return all;
}

Json unitToJson(const FleetUnit& unit)
{
    const FleetRun& run = unit.last();
    const auto orNull = [](const std::string& words) { return words.empty() ? Json() : Json(words); };
    Json besides = Json::array();
    for (const Failure* failure : run.besides) {
        besides.push_back(failure->name);
    }
    return {{"unit", unit.name},
            {"machine", orNull(unit.machine)},
            {"state", nameOf(unit.state).name},
            {"last_run", isoText(run.begin)},
            {"outcome", outcomeName(run.outcome)},
            {"meaning", *run.meaning},
            {"failure", run.failure == nullptr ? Json() : Json(run.failure->name)},
            {"besides", besides},
            {"head", run.mainHead ? "main" : "remote"},
            {"package", orNull(*unit.package)},
            {"board", orNull(*unit.board)},
            {"runs", unit.runs.size()}};
}

/// Failures with their remedies, those of the most units first.
Json failuresOf(RunCounts& counts)
{
    static const Values values = valuesOf(Run(), nullptr, {});
    Json failures = Json::array();
    for (auto& [name, count] : counts) {
        failures.push_back({{"name", name},
                            {"units", count["units"]},
                            {"runs", count["runs"]},
                            {"remedy", filled(findFailure(name)->remedy, values)}});
    }
    std::stable_sort(failures.begin(), failures.end(), [](const Json& first, const Json& second) {
        return std::pair(second["units"], second["runs"]) < std::pair(first["units"], first["runs"]);
    });
    return failures;
}

/// The runs in periods of whole days, from the first one to the last.
Json periodsOf(const std::vector<const FleetRun*>& runs)
{
    std::int64_t first = INT64_MAX;
    std::int64_t last = 0;
    for (const FleetRun* run : runs) {
        first = run->begin < oldest ? first : std::min(first, run->begin / day * day);
        last = std::max(last, run->begin);
    }
    Json periods = Json::array();
    const std::int64_t length = ((last - first) / day / mostPeriods + 1) * day;
    for (std::int64_t from = first; from <= last; from += length) {
        std::size_t count = 0;
        Counts outcomes;
        Counts packages;
        for (const FleetRun* run : runs) {
            if (run->begin >= from && run->begin < from + length) {
                ++count;
                ++outcomes[outcomeName(run->outcome)];
                ++packages[run->package->empty() ? unknown : *run->package];
            }
        }
        periods.push_back({{"from", isoText(from).substr(0, 10)},
                           {"days", length / day},
                           {"runs", count},
                           {"outcomes", outcomes},
                           {"packages", packages}});
    }
    return periods;
}

/// What the fleet's runs come to, for programs.
Json factsOf(const Fleet& fleet, const Units& units, const std::vector<Unread>& unread)
{
    Json states;
    for (const StateName& state : stateNames) {
        states[state.name] = std::count_if(units.begin(), units.end(),
                                           [&](const FleetUnit* unit) { return &nameOf(unit->state) == &state; });
    }
    Counts packages;
    Counts boards;
    RunCounts outcomes;
    RunCounts failures;
    RunCounts besides;
    std::vector<const FleetRun*> runs;
    for (const FleetUnit* unit : units) {
        ++packages[unit->package->empty() ? unknown : packageOf(unit->last().mainHead) + ' ' + *unit->package];
        ++boards[unit->board->empty() ? unknown : *unit->board];
        if (unit->state == UnitState::NOT_SEEN) {
            continue;
        }
        for (const FleetRun& run : unit->runs) {
            const auto add = [last = &run == &unit->last()](RunCounts& counts, const std::string& name) {
                counts[name]["units"] += last ? 1 : 0;
                ++counts[name]["runs"];
            };
            runs.push_back(&run);
            add(outcomes, outcomeName(run.outcome));
            if (run.failure != nullptr) {
                add(failures, run.failure->name);
            }
            for (const Failure* failure : run.besides) {
                add(besides, failure->name);
            }
        }
    }
    const bool well = states["well"] == units.size();
    Json facts = {{"command", "fleet"},
                  {"version", jsonVersion},
                  {"status", !unread.empty() ? Report::STATUS_UNCHECKED
                             : well          ? Report::STATUS_FIT
                                             : Report::STATUS_NOT_FIT},
                  {"units", units.size()},
                  {"runs", runs.size()},
                  {"states", states},
                  {"outcomes", outcomes},
                  {"packages", packages},
                  {"boards", boards},
                  {"failures", failuresOf(failures)},
                  {"besides", failuresOf(besides)},
                  {"periods", periodsOf(runs)},
                  {"repeated_lines", fleet.repeatedLines()},
                  {"repeated_runs", fleet.repeatedRuns()},
                  {"unread", Json::array()}};
    for (const Unread& input : unread) {
        facts["unread"].push_back({{"input", input.source}, {"why", input.why}});
    }
    return facts;
}

// For people

/// The facts as tables: names with their counts, and with what to do.
Json tablesOf(const Json& facts, const std::string& since)
{
    Json states = Json::array();
    for (const auto& [name, title] : stateNames) {
        states.push_back({{"name", title}, {"style", name}, {"counts", {text(facts["states"][name])}}});
    }
    if (since.empty()) {
        states.erase(states.size() - 1);
    } else {
        states.back()["name"] = "Not seen since " + since;
    }
    Json tables = {{{"title", "State after the last run"}, {"heads", {"Units"}}, {"rows", states}}};
    for (const auto& [title, key] : {std::pair("Outcome", "outcomes"),
                                     {"Package", "packages"},
                                     {"Board", "boards"},
                                     {"What failed", "failures"},
                                     {"Also", "besides"}}) {
        Json table = {{"title", title}, {"heads", {"Units"}}, {"rows", Json::array()}};
        for (const auto& [name, count] : facts[key].items()) {
            Json row = {{"name", name}, {"counts", {text(count)}}};
            if (count.is_object()) {
                table["heads"] = {"Units", "Runs"};
                row = {{"name", count.value("name", name)},
                       {"counts", {text(count["units"]), text(count["runs"])}},
                       {"remedy", count.value("remedy", "")}};
            }
            table["rows"].push_back(row);
        }
        if (!table["rows"].empty()) {
            tables.push_back(table);
        }
    }
    return tables;
}

/// A line of a table.
void printRow(const std::string& name, const Json& counts, std::ostream& out)
{
    out << std::left << std::setw(60) << name << std::right;
    for (const Json& count : counts) {
        out << std::setw(8) << text(count);
    }
    out << '\n';
}

void printFacts(const Json& facts, const std::string& since, std::ostream& out)
{
    out << counted(facts["units"], "unit") << ", " << counted(facts["runs"], "run") << '\n';
    if (facts["repeated_lines"] > 0 || facts["repeated_runs"] > 0) {
        out << "Dropped because they came twice: " << counted(facts["repeated_lines"], "line") << ", "
            << counted(facts["repeated_runs"], "run") << '\n';
    }
    for (const Json& table : tablesOf(facts, since)) {
        out << '\n';
        printRow(table["title"], table["heads"], out);
        for (const Json& row : table["rows"]) {
            printRow("  " + text(row["name"]), row["counts"], out);
            if (const std::string remedy = row.value("remedy", ""); !remedy.empty()) {
                printText("    Do now: \t" + remedy + '\n', out);
            }
        }
    }
}

void printUnits(const Units& units, const Json& facts, std::ostream& out)
{
    const std::size_t well = facts["states"]["well"];
    out << (well == units.size() ? "\nNo unit needs anybody.\n"
                                 : "\nNeeding somebody: " + counted(units.size() - well, "unit") + '\n');
    for (const FleetUnit* unit : units) {
        if (unit->state == UnitState::WELL) {
            continue;
        }
        const Json row = unitToJson(*unit);
        Json names = row["besides"];
        if (!row["failure"].is_null()) {
            names.insert(names.begin(), row["failure"]);
        }
        out << unit->name << (unit->machine.empty() ? "" : " (" + unit->machine + ')') << "  "
            << dateText(unit->last().begin) << "  " << (unit->state == UnitState::NOT_SEEN ? "no run since then; " : "")
            << text(row["meaning"]) << (names.empty() ? "" : " [" + joined(names) + ']') << "; package "
            << text(row["package"]) << ", board " << text(row["board"]) << '\n';
    }
}

/// RFC 4180.
void printCsv(const Units& units, std::ostream& out)
{
    bool first = true;
    for (const FleetUnit* unit : units) {
        const Json row = unitToJson(*unit);
        std::string head;
        std::string line;
        for (const auto& [name, value] : row.items()) {
            std::string cell = value.is_array() ? joined(value) : value.is_null() ? "" : text(value);
            for (std::size_t quote = 0; (quote = cell.find('"', quote)) != std::string::npos; quote += 2) {
                cell.insert(quote, 1, '"');
            }
            head += (head.empty() ? "" : ",") + name;
            line += (line.empty() ? "\"" : ",\"") + cell + '"';
        }
        out << (std::exchange(first, false) ? head + "\r\n" : "") << line << "\r\n";
    }
}

// The page

/// The runs of each period as a bar, with a legend.
Json chartOf(const char* title, const Json& periods, const char* kind)
{
    Counts all;
    int most = 1;
    for (const Json& period : periods) {
        most = std::max(most, period["runs"].get<int>());
        all.merge(period[kind].get<Counts>());
    }
    Json legend = Json::array(); // outcomes in their own order, versions in that of the alphabet
    for (int outcome = 0; outcome <= static_cast<int>(Outcome::BOARD_FAILED); ++outcome) {
        const char* name = outcomeName(static_cast<Outcome>(outcome));
        if (all.erase(name) > 0) {
            legend.push_back({{"name", name}, {"style", name}});
        }
    }
    for (const auto& [name, count] : all) {
        legend.push_back({{"name", name}, {"style", "version" + std::to_string(legend.size() % colors)}});
    }
    Json bars = Json::array();
    for (const Json& period : periods) {
        Json pieces = Json::array();
        for (Json piece : legend) {
            piece["count"] = period[kind].value(piece["name"].get<std::string>(), 0);
            if (piece["count"] > 0) {
                pieces.push_back(piece);
            }
        }
        bars.push_back({{"from", period["from"]},
                        {"runs", period["runs"]},
                        {"width", 100 * period["runs"].get<int>() / most},
                        {"pieces", pieces}});
    }
    return {{"title", title}, {"legend", legend}, {"bars", bars}};
}

void writePage(const Json& facts, const Units& units, const std::string& since, std::ostream& out)
{
    renderPart(embeddedFleetPage, "begin",
               {{"title", counted(facts["units"], "unit") + ", " + counted(facts["runs"], "run")},
                {"tables", tablesOf(facts, since)},
                {"charts",
                 {chartOf("Outcomes", facts["periods"], "outcomes"),
                  chartOf("Package after the run", facts["periods"], "packages")}},
                {"unread", facts["unread"]}},
               out);
    for (const FleetUnit* unit : units) {
        Json row = unitToJson(*unit);
        row["title"] = nameOf(unit->state).title;
        row["also"] = joined(row["besides"]);
        renderPart(embeddedFleetPage, "unit", row, out);
    }
    renderPart(embeddedFleetPage, "end", true, out);
}

} // namespace

std::string conflictIn(const FleetOptions& options)
{
    if (options.json && options.csv) {
        return "--json and --csv are two formats: leave one of them out.";
    }
    if (!options.since.empty() && timeOf(options.since) == noTime) {
        return escaped(options.since) + " is not a date. Give it as 2026-11-21.";
    }
    if (!options.failed.empty() && findFailure(options.failed) == nullptr) {
        return escaped(options.failed) + " is not a name of the catalogue: harl-updater-tool explain lists all.";
    }
    return "";
}

int runFleet(const FleetOptions& options, std::ostream& out, std::ostream& err)
{
    if (const std::string objection = objectionTo(options.htmlFile, options.paths); !objection.empty()) {
        return refuse("fleet", options.json, escaped(options.htmlFile) + ": " + objection, out, err);
    }
    Fleet fleet;
    const std::vector<Unread> unread = readFleet(options.paths, fleet);
    fleet.finish(options.since.empty() ? noTime : timeOf(options.since));
    const Units units = unitsOf(fleet, options.failed);
    const Json facts = factsOf(fleet, units, unread);
    if (options.json) {
        out << facts.dump() << '\n';
        for (const FleetUnit* unit : units) {
            out << unitToJson(*unit).dump() << '\n';
        }
    } else if (options.csv) {
        printCsv(units, out);
    } else {
        printFacts(facts, options.since, out);
        printUnits(units, facts, out);
    }
    out.flush();
    for (const Unread& input : unread) {
        err << "harl-updater-tool: " << input.source << ": " << input.why << '\n';
    }
    std::stringstream page;
    std::string wrong;
    if (!options.htmlFile.empty()) {
        writePage(facts, units, options.since, page);
        wrong = writeFile(options.htmlFile, page);
    }
    if (!wrong.empty()) {
        err << "harl-updater-tool: " << escaped(options.htmlFile) << ": " << wrong << '\n';
    }
    return wrong.empty() ? facts["status"].get<int>() : Report::STATUS_UNCHECKED;
}
