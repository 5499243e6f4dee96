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
#include <ostream>
#include <set>
#include <sstream>

#include <nlohmann/json.hpp>

namespace
{

using Json = nlohmann::ordered_json;
using Units = std::vector<const FleetUnit*>;

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
            {"state", stateName(unit.state)},
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

void addOne(Json& count)
{
    count = count.is_null() ? 1 : count.get<int>() + 1;
}

/// Counts a run, and its unit if it is the unit's last one.
void addRun(Json& counts, const std::string& name, bool last)
{
    Json& count = counts[name];
    count = count.is_null() ? Json{{"units", 0}, {"runs", 0}} : count;
    count["units"] = count["units"].get<int>() + (last ? 1 : 0);
    addOne(count["runs"]);
}

/// Failures with their remedies, those of the most units first.
Json failuresOf(const Json& counts)
{
    static const Values values = valuesOf(Run(), nullptr, {});
    Json failures = Json::array();
    for (const auto& [name, count] : counts.items()) {
        failures.push_back({{"name", name},
                            {"units", count["units"]},
                            {"runs", count["runs"]},
                            {"remedy", filled(findFailure(name)->remedy, values)}});
    }
    std::sort(failures.begin(), failures.end(), [](const Json& first, const Json& second) {
        return std::tuple(second["units"], second["runs"], first["name"]) <
               std::tuple(first["units"], first["runs"], second["name"]);
    });
    return failures;
}

Json sorted(const Json& counts)
{
    return nlohmann::json(counts);
}

/// Periods of whole days from the first run to the last one, without runs yet.
Json periodsOf(const Units& units)
{
    std::int64_t first = INT64_MAX;
    std::int64_t last = 0;
    for (const FleetUnit* unit : units) {
        for (const FleetRun& run : unit->runs) {
            first = run.begin < oldest || unit->state == UnitState::NOT_SEEN ? first : std::min(first, run.begin);
            last = std::max(last, run.begin);
        }
    }
    Json periods = Json::array();
    const std::int64_t length = ((last - first / day * day) / day / mostPeriods + 1) * day;
    for (std::int64_t from = first / day * day; from <= last; from += length) {
        periods.push_back({{"from", isoText(from).substr(0, 10)},
                           {"days", length / day},
                           {"runs", 0},
                           {"outcomes", Json::object()},
                           {"packages", Json::object()}});
    }
    return periods;
}

/// What the fleet's runs come to, for programs.
Json factsOf(const Fleet& fleet, const Units& units, const std::vector<Unread>& unread)
{
    Json facts = {{"command", "fleet"}, {"version", jsonVersion}, {"status", 0}, {"units", units.size()}, {"runs", 0}};
    for (std::size_t state = 0; state < unitStates; ++state) {
        facts["states"][stateName(static_cast<UnitState>(state))] = 0;
    }
    Json outcomes = Json::object();
    Json packages = Json::object();
    Json boards = Json::object();
    Json failures = Json::object();
    Json besides = Json::object();
    Json periods = periodsOf(units);
    const std::int64_t first = periods.empty() ? noTime : timeOf(periods[0]["from"]);
    for (const FleetUnit* unit : units) {
        const std::string package = packageOf(unit->last().mainHead) + ' ' + *unit->package;
        addOne(facts["states"][stateName(unit->state)]);
        addOne(packages[unit->package->empty() ? unknown : package]);
        addOne(boards[unit->board->empty() ? unknown : *unit->board]);
        for (const FleetRun& run : unit->runs) {
            const bool last = &run == &unit->last();
            if (unit->state == UnitState::NOT_SEEN) {
                continue;
            }
            addOne(facts["runs"]);
            addRun(outcomes, outcomeName(run.outcome), last);
            if (run.failure != nullptr) {
                addRun(failures, run.failure->name, last);
            }
            for (const Failure* failure : run.besides) {
                addRun(besides, failure->name, last);
            }
            if (run.begin >= oldest) {
                const std::int64_t length = periods[0]["days"].get<std::int64_t>() * day;
                Json& period = periods[static_cast<std::size_t>((run.begin - first) / length)];
                addOne(period["runs"]);
                addOne(period["outcomes"][outcomeName(run.outcome)]);
                addOne(period["packages"][run.package->empty() ? unknown : *run.package]);
            }
        }
    }
    facts.update({{"outcomes", sorted(outcomes)},
                  {"packages", sorted(packages)},
                  {"boards", sorted(boards)},
                  {"failures", failuresOf(failures)},
                  {"besides", failuresOf(besides)},
                  {"periods", periods},
                  {"repeated_lines", fleet.repeatedLines()},
                  {"repeated_runs", fleet.repeatedRuns()},
                  {"unread", Json::array()}});
    for (const Unread& input : unread) {
        facts["unread"].push_back({{"input", input.source}, {"why", input.why}});
    }
    const bool well = facts["states"]["well"] == units.size();
    facts["status"] = !unread.empty() ? Report::STATUS_UNCHECKED : well ? Report::STATUS_FIT : Report::STATUS_NOT_FIT;
    return facts;
}

// For people

/// A line of a table with one or two counts.
void printRow(const std::string& name, const std::vector<std::string>& counts, std::ostream& out)
{
    out << name << std::string(60 - std::min<std::size_t>(60, name.size()), ' ');
    for (const std::string& count : counts) {
        out << std::string(8 - std::min<std::size_t>(8, count.size()), ' ') << count;
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
    out << '\n';
    printRow("State after the last run", {"Units"}, out);
    for (std::size_t state = 0; state < unitStates; ++state) {
        const bool notSeen = static_cast<UnitState>(state) == UnitState::NOT_SEEN;
        if (!notSeen || !since.empty()) {
            printRow("  " + std::string(stateTitle(static_cast<UnitState>(state))) + (notSeen ? " since " + since : ""),
                     {text(facts["states"][stateName(static_cast<UnitState>(state))])}, out);
        }
    }
    for (const auto& [title, key] : {std::pair("Outcome", "outcomes"), {"Package", "packages"}, {"Board", "boards"}}) {
        out << '\n';
        const bool runs = facts[key] == facts["outcomes"];
        printRow(title, runs ? std::vector<std::string>{"Units", "Runs"} : std::vector<std::string>{"Units"}, out);
        for (const auto& [name, count] : facts[key].items()) {
            printRow("  " + name,
                     runs ? std::vector{text(count["units"]), text(count["runs"])} : std::vector{text(count)}, out);
        }
    }
    for (const auto& [title, key] : {std::pair("What failed", "failures"), {"Also", "besides"}}) {
        if (!facts[key].empty()) {
            out << '\n';
            printRow(title, {"Units", "Runs"}, out);
        }
        for (const Json& failure : facts[key]) {
            printRow("  " + text(failure["name"]), {text(failure["units"]), text(failure["runs"])}, out);
            printText("    Do now: \t" + text(failure["remedy"]) + '\n', out);
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

/// The pieces of a bar, or of its legend.
///
/// @param style  of a piece, before its number; empty: its name
Json piecesOf(const Json& counts, const std::vector<std::string>& names, const std::string& style)
{
    Json pieces = Json::array();
    for (std::size_t index = 0; index < names.size(); ++index) {
        if (const auto count = counts.find(names[index]); count != counts.end()) {
            const std::string color = style.empty() ? names[index] : style + std::to_string(index % colors);
            pieces.push_back({{"name", names[index]}, {"style", color}, {"count", *count}});
        }
    }
    return pieces;
}

/// The runs of each period as a bar.
Json chartOf(const char* title, const Json& periods, const char* kind, const std::string& style)
{
    int most = 1;
    Json all = Json::object();
    for (const Json& period : periods) {
        most = std::max(most, period["runs"].get<int>());
        all.update(period[kind]);
    }
    std::vector<std::string> names; // in their order in a bar
    for (std::size_t outcome = 0; style.empty() && outcome <= static_cast<std::size_t>(Outcome::BOARD_FAILED);
         ++outcome) {
        names.emplace_back(outcomeName(static_cast<Outcome>(outcome)));
    }
    const Json versions = sorted(style.empty() ? Json::object() : all);
    for (const auto& [name, count] : versions.items()) {
        names.push_back(name);
    }
    Json bars = Json::array();
    for (const Json& period : periods) {
        bars.push_back({{"from", period["from"]},
                        {"runs", period["runs"]},
                        {"width", 100 * period["runs"].get<int>() / most},
                        {"pieces", piecesOf(period[kind], names, style)}});
    }
    return {{"title", title}, {"legend", piecesOf(all, names, style)}, {"bars", bars}};
}

void writePage(const Json& facts, const Units& units, std::ostream& out)
{
    Json head = {{"title", counted(facts["units"], "unit") + ", " + counted(facts["runs"], "run")},
                 {"unread", facts["unread"]}};
    for (std::size_t state = 0; state < unitStates; ++state) {
        const char* name = stateName(static_cast<UnitState>(state));
        head["states"].push_back(
            {{"name", stateTitle(static_cast<UnitState>(state))}, {"style", name}, {"count", facts["states"][name]}});
    }
    for (const auto& [title, key] : {std::pair("Package", "packages"), {"Board", "boards"}}) {
        Json rows = Json::array();
        for (const auto& [name, count] : facts[key].items()) {
            rows.push_back({{"name", name}, {"count", count}});
        }
        head["versions"].push_back({{"title", title}, {"rows", rows}});
    }
    for (const auto& [title, key] : {std::pair("What failed", "failures"), {"Also", "besides"}}) {
        head["problems"].push_back({{"title", title}, {"rows", facts[key]}});
    }
    head["charts"] = {chartOf("Outcomes", facts["periods"], "outcomes", ""),
                      chartOf("Package after the run", facts["periods"], "packages", "version")};
    renderPart(embeddedFleetPage, "begin", head, out);
    for (const FleetUnit* unit : units) {
        Json row = unitToJson(*unit);
        row["title"] = stateTitle(unit->state);
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
        writePage(facts, units, page);
        wrong = writeFile(options.htmlFile, page);
    }
    if (!wrong.empty()) {
        err << "harl-updater-tool: " << escaped(options.htmlFile) << ": " << wrong << '\n';
    }
    return wrong.empty() ? facts["status"].get<int>() : Report::STATUS_UNCHECKED;
}
