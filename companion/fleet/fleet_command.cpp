#include "fleet/fleet_command.h"

#include "embedded.h"
#include "findings.h"
#include "fleet/fleet.h"
#include "fleet/reading.h"
#include "log/catalogue.h"
#include "log/html.h"
#include "log/text.h"
#include "page_file.h"

#include <algorithm>
#include <ctime>
#include <functional>
#include <iomanip>
#include <iterator>
#include <map>
#include <ostream>
#include <sstream>

#include <nlohmann/json.hpp>

namespace
{

using Json = nlohmann::ordered_json;

/// Units whose last run something holds for, and runs.
struct Count
{
    std::size_t units = 0;
    std::size_t runs = 0;
};

using Counts = std::map<std::string, Count>;

const std::size_t lengthOfDay = 10; // of "2026-11-21"

/// A fact that is a table, for people and for programs.
struct Table
{
    const char* title;
    const char* key;
    bool remedies = false; ///< Its names are those of failures.
};

const Table tables[] = {
    {"State after the last run", "states"}, {"Outcome", "outcomes"},   {"Package", "packages"}, {"Board", "boards"},
    {"What failed", "failures", true},      {"Also", "besides", true},
};

bool isDate(const std::string& text)
{
    std::tm parts = {};
    strptime(text.c_str(), "%Y-%m-%d", &parts);
    return isoText(timegm(&parts)).substr(0, lengthOfDay) == text;
}

/// A value of a unit for people: "a, b" for several.
std::string textOf(const Json& value)
{
    if (value.is_array()) {
        std::string all;
        for (const Json& name : value) {
            all += (all.empty() ? "" : ", ") + name.get<std::string>();
        }
        return all;
    }
    return value.is_null() ? "" : value.is_string() ? value.get<std::string>() : value.dump();
}

/// The units for programs, by name.
Json unitsOf(const Fleet& fleet)
{
    const auto orNull = [](const std::string& words) { return words.empty() ? Json() : Json(words); };
    Json units = Json::array();
    for (const auto& [machine, unit] : fleet.units()) {
        const FleetRun& last = unit.runs.back();
        units.push_back({{"unit", unit.name},
                         {"machine", orNull(unit.machine)},
                         {"state", last.state},
                         {"last_run", isoText(last.begin)},
                         {"outcome", last.outcome},
                         {"meaning", last.meaning},
                         {"failure", orNull(last.failure)},
                         {"besides", last.besides},
                         {"package", last.package},
                         {"board", last.board},
                         {"runs", unit.runs.size()}});
    }
    std::sort(units.begin(), units.end());
    return units;
}

/// The rows of a table, those of the most units first.
Json rowsOf(const Counts& counts, bool remedies)
{
    Json rows = Json::array();
    for (const auto& [name, count] : counts) {
        rows.push_back({{"name", name}, {"units", count.units}, {"runs", count.runs}});
        if (remedies) {
            rows.back()["remedy"] = filled(findFailure(name)->remedy, valuesOf(Run(), nullptr, {}));
        }
    }
    std::stable_sort(rows.begin(), rows.end(), [](const Json& first, const Json& second) {
        return std::pair(first["units"], first["runs"]) > std::pair(second["units"], second["runs"]);
    });
    return rows;
}

/// The fleet for programs.
Json factsOf(const Fleet& fleet, const Json& unread)
{
    std::size_t runs = 0;
    std::size_t needing = 0;
    std::map<std::string, Counts> counts;
    std::map<std::string, std::map<std::string, std::map<std::string, std::size_t>>, std::greater<>> days;
    for (const auto& [machine, unit] : fleet.units()) {
        for (const FleetRun& run : unit.runs) {
            const bool seen = run.state != "not-seen";
            const bool last = &run == &unit.runs.back();
            const auto add = [&](const char* table, const std::string& name) {
                Count& count = counts[table][name];
                count.units += last ? 1 : 0;
                count.runs += seen ? 1 : 0;
            };
            needing += last && run.state != "well" ? 1 : 0;
            add("states", run.state);
            add("packages", run.package);
            add("boards", run.board);
            if (!seen) {
                continue;
            }
            ++runs;
            add("outcomes", run.outcome);
            if (!run.failure.empty()) {
                add("failures", run.failure);
            }
            for (const std::string& failure : run.besides) {
                add("besides", failure);
            }
            auto& day = days[isoText(run.begin).substr(0, lengthOfDay)];
            ++day["outcomes"][run.outcome];
            ++day["packages"][run.package];
        }
    }
    Json facts = {{"command", "fleet"},
                  {"version", jsonVersion},
                  {"status", !unread.empty() ? Report::STATUS_UNCHECKED
                             : needing > 0   ? Report::STATUS_NOT_FIT
                                             : Report::STATUS_FIT},
                  {"units", fleet.units().size()},
                  {"needing", needing},
                  {"runs", runs},
                  {"repeated_lines", fleet.repeats()},
                  {"unread", unread},
                  {"days", days}};
    for (const auto& [title, key, remedies] : tables) {
        facts[key] = rowsOf(counts[key], remedies);
    }
    return facts;
}

void print(const Json& facts, const Json& units, std::ostream& out)
{
    const auto printRow = [&](const std::string& name, const std::string& number, const std::string& runs) {
        out << std::left << std::setw(60) << name << std::right << std::setw(8) << number << std::setw(8) << runs
            << '\n';
    };
    const std::size_t repeats = facts["repeated_lines"];
    out << counted(facts["units"], "unit") << ", " << counted(facts["runs"], "run")
        << (repeats > 0 ? "; dropped " + counted(repeats, "line") + " that came again\n" : "\n");
    for (const auto& [title, key, remedies] : tables) {
        out << '\n';
        printRow(title, "Units", "Runs");
        for (const Json& row : facts[key]) {
            printRow("  " + textOf(row["name"]), textOf(row["units"]), textOf(row["runs"]));
            if (row.contains("remedy")) {
                printText("    Do now: \t" + textOf(row["remedy"]) + '\n', out);
            }
        }
    }
    out << "\nNeeding somebody: " << counted(facts["needing"], "unit") << '\n';
    for (const Json& unit : units) {
        if (unit["state"] == "well") {
            continue;
        }
        Json failures = unit["besides"];
        if (!unit["failure"].is_null()) {
            failures.insert(failures.begin(), unit["failure"]);
        }
        out << textOf(unit["unit"]) << (unit["machine"].is_null() ? "" : " (" + textOf(unit["machine"]) + ')') << "  "
            << textOf(unit["last_run"]) << (unit["state"] == "not-seen" ? "  not-seen: " : "  ")
            << textOf(unit["meaning"]) << (failures.empty() ? "" : " [" + textOf(failures) + ']') << "; package "
            << textOf(unit["package"]) << ", board " << textOf(unit["board"]) << '\n';
    }
}

/// RFC 4180.
void printCsv(const Json& units, std::ostream& out)
{
    const auto printLine = [&](const Json& unit, bool heads) {
        const char* separator = "";
        for (const auto& [name, value] : unit.items()) {
            out << std::exchange(separator, ",") << std::quoted(heads ? name : textOf(value), '"', '"');
        }
        out << "\r\n";
    };
    if (!units.empty()) {
        printLine(units.front(), true);
    }
    for (const Json& unit : units) {
        printLine(unit, false);
    }
}

/// The runs of each day as a bar, with a legend.
Json chartOf(const char* title, const char* key, const Json& facts)
{
    std::size_t most = 1;
    Json bars = Json::array();
    for (const auto& [day, counts] : facts["days"].items()) {
        std::size_t runs = 0;
        Json pieces = facts[key];
        for (Json& piece : pieces) {
            piece["runs"] = counts[key].value(textOf(piece["name"]), std::size_t{0});
            runs += piece["runs"].get<std::size_t>();
        }
        most = std::max(most, runs);
        bars.push_back({{"day", day}, {"runs", runs}, {"pieces", pieces}});
    }
    return {{"title", title}, {"legend", facts[key]}, {"bars", bars}, {"most", most}};
}

void writePage(const Json& facts, const Json& units, std::ostream& out)
{
    Json page = facts;
    page["charts"] = {chartOf("Outcomes", "outcomes", facts), chartOf("Package after the run", "packages", facts)};
    for (const auto& [title, key, remedies] : tables) {
        page["tables"].push_back({{"title", title}, {"rows", facts[key]}});
    }
    renderPart(embeddedFleetPage, "begin", page, out);
    for (const Json& unit : units) {
        renderPart(embeddedFleetPage, "unit", unit, out);
    }
    renderPart(embeddedFleetPage, "end", true, out);
}

} // namespace

std::string conflictIn(const FleetOptions& options)
{
    if (options.json && options.csv) {
        return "--json and --csv are two formats: leave one of them out.";
    }
    if (!options.since.empty() && !isDate(options.since)) {
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
    const Json unread = readFleet(options.paths, fleet);
    fleet.finish(options.since, options.failed);
    const Json units = unitsOf(fleet);
    const Json facts = factsOf(fleet, unread);
    if (options.json) {
        out << facts << '\n';
        std::copy(units.begin(), units.end(), std::ostream_iterator<Json>(out, "\n"));
    } else if (options.csv) {
        printCsv(units, out);
    } else {
        print(facts, units, out);
    }
    out.flush();
    for (const Json& input : unread) {
        err << "harl-updater-tool: " << textOf(input["input"]) << ": " << textOf(input["why"]) << '\n';
    }
    if (options.htmlFile.empty()) {
        return facts["status"];
    }
    std::stringstream page;
    writePage(facts, units, page);
    if (const std::string wrong = writeFile(options.htmlFile, page); !wrong.empty()) {
        err << "harl-updater-tool: " << escaped(options.htmlFile) << ": " << wrong << '\n';
        return Report::STATUS_UNCHECKED;
    }
    return facts["status"];
}
