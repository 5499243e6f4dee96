/// Knowledge only grows: what is said of a part of a log never contradicts what is said of the whole. The parts of each
/// golden log: every beginning and every end of it, without each 1 to 4 lines, with each kind of foreign line put in
/// anywhere, and cut at a sample of bytes.

#include "golden_logs.h"
#include "log/catalogue.h"
#include "log/run.h"
#include "texts.h"

#include <iostream>
#include <set>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace
{

/// What is said of a run.
struct Verdict
{
    Outcome outcome = Outcome::NONE;
    bool wentWell = false;
    std::string failure;

    bool isDefinite() const
    {
        return outcome != Outcome::NONE && outcome != Outcome::PASSED && outcome != Outcome::FAILED;
    }
};

void PrintTo(const Verdict& verdict, std::ostream* out)
{
    *out << "outcome " << static_cast<int>(verdict.outcome) << (verdict.wentWell ? ", went well" : "") << ", failure \""
         << verdict.failure << '"';
}

using Verdicts = std::vector<Verdict>;

Verdicts verdictsOf(std::string_view log)
{
    Verdicts verdicts;
    readRuns(log, [&](const Run& run) {
        verdicts.push_back({run.outcome, wentWell(run), run.failure ? run.failure->failure->name : ""});
    });
    return verdicts;
}

/// True when `part` says the same as `whole`, or less.
bool isWeakerOutcome(Outcome part, Outcome whole)
{
    switch (part) {
    case Outcome::NONE:
        return true;
    case Outcome::PASSED:
        return whole == Outcome::PASSED || whole == Outcome::NO_UPDATE || whole == Outcome::UPDATED ||
               whole == Outcome::UPDATE_OFFERED;
    case Outcome::UPDATE_OFFERED: // what was offered may be installed, or fail, later
        return whole == Outcome::UPDATE_OFFERED || whole == Outcome::UPDATED || whole == Outcome::PACKAGE_FAILED ||
               whole == Outcome::BOARD_FAILED || whole == Outcome::NONE;
    case Outcome::FAILED:
        return isFailure(whole);
    default:
        return part == whole;
    }
}

/// Likewise of the names of failures.
bool isWeakerFailure(const std::string& part, const std::string& whole)
{
    // These say that records are missing.
    static const std::set<std::string> open = {"",
                                               "unknown",
                                               "unfinished",
                                               "cut-short",
                                               "end-missing",
                                               "outcome-missing",
                                               "board-not-read",
                                               "package-not-read"};
    static const std::multimap<std::string, std::string> specific = {
        {"mirrors-unreachable", "mirrors-"}, {"package-install-failed", "package-"},
        {"board-unreachable", "board-"},     {"board-upload-failed", "board-"},
        {"board-upload-failed", "stick-"},   {"board-version-not-read", "stick-version-missing"},
    };
    const auto [begin, end] = specific.equal_range(part);
    return open.count(part) != 0 || part == whole ||
           std::any_of(begin, end, [&](const auto& pair) { return whole.rfind(pair.second, 0) == 0; });
}

MATCHER_P(DoesNotContradict, whole, "")
{
    return isWeakerOutcome(arg.outcome, whole.outcome) && (whole.wentWell || !arg.wentWell) &&
           isWeakerFailure(arg.failure, whole.failure);
}

std::string joined(const Lines& lines, std::size_t begin, std::size_t end)
{
    std::string text;
    for (std::size_t index = begin; index < end; ++index) {
        text += lines[index] + '\n';
    }
    return text;
}

/// The share of parts whose verdict is definite, of all tests.
struct Share
{
    ~Share()
    {
        std::cout << parts << " parts of logs, " << definite * 100 / std::max<std::uint64_t>(parts, 1)
                  << " % of them with a definite verdict\n";
    }

    std::uint64_t parts = 0;
    std::uint64_t definite = 0;
};

/// One golden log.
class Knowledge : public testing::TestWithParam<std::string>
{
protected:
    /// @param fromEnd  the part may lack runs at its beginning, else at its end
    void expectNoContradiction(const std::string& part, const std::string& what, bool fromEnd)
    {
        const Verdicts verdicts = verdictsOf(part);
        ASSERT_LE(verdicts.size(), mWhole.size()) << what;
        for (std::size_t run = 0; run < verdicts.size(); ++run) {
            const Verdict& whole = mWhole[fromEnd ? mWhole.size() - verdicts.size() + run : run];
            EXPECT_THAT(verdicts[run], DoesNotContradict(whole))
                << what << "; whole: " << testing::PrintToString(whole);
        }
        count(verdicts);
    }

    void expectTheSame(const std::string& log, const std::string& what)
    {
        const Verdicts verdicts = verdictsOf(log);
        ASSERT_EQ(verdicts.size(), mWhole.size()) << what;
        for (std::size_t run = 0; run < verdicts.size(); ++run) {
            EXPECT_EQ(verdicts[run].outcome, mWhole[run].outcome) << what;
            EXPECT_EQ(verdicts[run].wentWell, mWhole[run].wentWell) << what;
        }
        count(verdicts);
    }

    static void count(const Verdicts& verdicts)
    {
        ++share.parts;
        share.definite += !verdicts.empty() && verdicts.back().isDefinite() ? 1 : 0;
    }

    const std::string mText = content(GetParam() + ".log");
    const Lines mLines = linesOf(mText);
    const Verdicts mWhole = verdictsOf(mText);
    static Share share;
};
Share Knowledge::share;

const char* const foreignLines[] = {
    "",
    "Reading package lists...",
    "\tstart-stop-daemon: no process",
    "ssh: connect to host 192.168.9.2 port 22: Connection timed out",
    "E: Failed to fetch http://m/x.deb  Could not connect to m:80 (10.1.2.3). - connect (111: Connection refused)",
    "dpkg: error processing package solvik4-rh (--configure):",
    "Failed to connect to bus: No such file or directory",
    "Nov 21 07:35:33 unit kernel: usb 1-1: USB disconnect, device number 2",
    "Nov 21 07:35:33 unit systemd[1]: Starting Daily apt download activities...",
};

} // namespace

TEST_P(Knowledge, OfABeginningOrAnEnd)
{
    for (std::size_t cut = 0; cut <= mLines.size(); ++cut) {
        expectNoContradiction(joined(mLines, 0, cut), "the first " + std::to_string(cut) + " lines", false);
        expectNoContradiction(joined(mLines, cut, mLines.size()), "from line " + std::to_string(cut + 1), true);
    }
}

TEST_P(Knowledge, WithoutSomeLines)
{
    for (std::size_t begin = 0; begin < mLines.size(); ++begin) {
        for (std::size_t end = begin + 1; end <= std::min(begin + 4, mLines.size()); ++end) {
            expectNoContradiction(joined(mLines, 0, begin) + joined(mLines, end, mLines.size()),
                                  "without lines " + std::to_string(begin + 1) + " to " + std::to_string(end), true);
        }
    }
}

TEST_P(Knowledge, WithForeignLines)
{
    for (std::size_t before = 0; before <= mLines.size(); ++before) {
        for (const char* foreign : foreignLines) {
            const std::string log = joined(mLines, 0, before) + foreign + '\n' + joined(mLines, before, mLines.size());
            expectTheSame(log, std::string("\"") + foreign + "\" before line " + std::to_string(before + 1));
        }
    }
}

TEST_P(Knowledge, CutAtBytes)
{
    for (std::size_t cut = 0; cut < mText.size(); cut += 7) {
        expectNoContradiction(mText.substr(0, cut), "the first " + std::to_string(cut) + " bytes", false);
        expectNoContradiction(mText.substr(cut), "from byte " + std::to_string(cut), true);
    }
}

INSTANTIATE_TEST_SUITE_P(Each, Knowledge, testing::ValuesIn(goldenLogs()), goldenLogName);
