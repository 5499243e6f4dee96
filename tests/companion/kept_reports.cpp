#include "kept_reports.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <map>
#include <regex>
#include <sstream>
#include <utility>

namespace
{

/// Compares the different reports of each test with those that golden/reports keeps of it: a file for each suite, and
/// in it a line "# TEST" for each test. With KEEP_REPORTS in the environment it keeps them.
class KeptReports : public testing::EmptyTestEventListener
{
public:
    void add(const std::string& text)
    {
        static const std::pair<std::regex, const char*> changing[] = {
            {std::regex("([\"=:' ])[^\"=:' ]*/harl-updater-test-\\w+"), "$1(folder)"},
            {std::regex("/harl-updater-tool-\\w+"), "/(folder)"},
            {std::regex("(Process|ps) \\d+"), "$1 (number)"},
        };
        std::string shown = text;
        for (const auto& [pattern, replacement] : changing) {
            shown = std::regex_replace(shown, pattern, replacement);
        }
        mSaid += mSaid.find(shown) == std::string::npos ? shown : "";
    }

private:
    void OnTestEnd(const testing::TestInfo& test) override
    {
        const std::string said = std::exchange(mSaid, "");
        if (std::getenv("KEEP_REPORTS") != nullptr) {
            mKept[test.test_suite_name()] += said.empty() ? "" : title(test) + said;
        } else {
            EXPECT_EQ(said, kept(test)) << "if it is meant: tests/companion/make-golden-checks";
        }
    }

    void OnTestProgramEnd(const testing::UnitTest&) override
    {
        for (const auto& [suite, text] : mKept) {
            if (!text.empty()) {
                std::ofstream(file(suite)) << text;
            }
        }
    }

    static std::string title(const testing::TestInfo& test) { return std::string("# ") + test.name() + '\n'; }

    static std::string file(const std::string& suite)
    {
        return KEPT_REPORTS "/" + suite.substr(suite.find('/') + 1) + ".txt";
    }

    static std::string kept(const testing::TestInfo& test)
    {
        std::ostringstream all;
        all << '\n' << std::ifstream(file(test.test_suite_name())).rdbuf();
        const std::string text = all.str() + "# ";
        const std::size_t found = text.find('\n' + title(test));
        const std::size_t begin = found + 1 + title(test).size();
        return found == std::string::npos ? "" : text.substr(begin, text.find("\n# ", begin - 1) + 1 - begin);
    }

    std::string mSaid; // by the reports of the running test
    std::map<std::string, std::string> mKept;
};

KeptReports& keptReports()
{
    static KeptReports* reports = [] {
        auto* made = new KeptReports; // GoogleTest's own from here on
        testing::UnitTest::GetInstance()->listeners().Append(made);
        return made;
    }();
    return *reports;
}

} // namespace

void compareWithKept(const std::string& text)
{
    keptReports().add(text);
}
