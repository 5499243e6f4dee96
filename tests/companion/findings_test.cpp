#include "finding_lines.h"

#include <gtest/gtest.h>

#include <sstream>

namespace
{

Report reportOf(const std::vector<Severity>& severities)
{
    Report report("check", "The thing");
    for (const Severity severity : severities) {
        report.add({severity, "a-check", "Something.", "does something.", ""});
    }
    return report;
}

} // namespace

TEST(Report, ErrorsOutweighWhatIsOpenAndThatOutweighsWarnings)
{
    EXPECT_EQ(reportOf({}).status(), 0);
    EXPECT_EQ(reportOf({Severity::NOTE, Severity::WARNING}).status(), 0);
    EXPECT_EQ(reportOf({Severity::WARNING, Severity::UNCHECKED}).status(), 2);
    EXPECT_EQ(reportOf({Severity::ERROR, Severity::UNCHECKED}).status(), 1);
}

TEST(Report, TextBeginsWithTheMostSeriousAndEndsWithTheVerdict)
{
    Report report = reportOf({});
    report.add({Severity::NOTE, "a", "A.", "is fine.", ""});
    report.add({Severity::ERROR, "b", "B.", "fails.", "Mend it."});
    report.addFact("some_fact", "Fact", "3 things", 3);
    report.addFact("other", "Longer", "text");
    std::ostringstream out;
    report.write(false, out);
    EXPECT_EQ(out.str(), "Fact:    3 things\n"
                         "Longer:  text\n"
                         "\nerror: B. [b]\n"
                         "  The updater: fails.\n"
                         "  Fix:         Mend it.\n"
                         "\nnote: A. [a]\n"
                         "  The updater: is fine.\n"
                         "\nThe thing is NOT fit for an update.\n");
}

TEST(Report, JsonKeepsTheOrderOfTheChecks)
{
    Report report = reportOf({Severity::NOTE, Severity::UNCHECKED});
    report.addFact("some_fact", "Fact", "3 things", 3);
    std::ostringstream out;
    report.write(true, out);
    const nlohmann::json json = nlohmann::json::parse(out.str());
    EXPECT_EQ(json, nlohmann::json::parse(R"({
        "command": "check", "version": 1, "subject": "The thing", "status": 2, "fit": false, "facts": {"some_fact": 3},
        "findings": [
            {"severity": "note", "check": "a-check", "what": "Something.", "effect": "does something.", "remedy": ""},
            {"severity": "unchecked", "check": "a-check", "what": "Something.", "effect": "does something.",
             "remedy": ""}
        ]})"));
}

TEST(Escaped, PrintableTextStaysAsItIs)
{
    EXPECT_EQ(escaped("quorb2.2.0 (1)~"), "quorb2.2.0 (1)~");
    EXPECT_EQ(escaped("\xc3\xa4\xe2\x82\xac\xf0\x9f\x94\x8c"), "\xc3\xa4\xe2\x82\xac\xf0\x9f\x94\x8c");
}

TEST(Escaped, ControlCharactersAndQuotesAreEscaped)
{
    EXPECT_EQ(escaped(std::string("\n\r\t\x1b[2J\x07\x7f\0", 10)), "\\n\\r\\t\\x1b[2J\\x07\\x7f\\x00");
    EXPECT_EQ(escaped("a\"b\\c"), "a\\\"b\\\\c");
}

TEST(Escaped, InvalidUtf8IsShownByteByByte)
{
    EXPECT_EQ(escaped("a\xff"
                      "b"),
              "a\\xffb");
    EXPECT_EQ(escaped("\xc3"), "\\xc3");                            // cut off
    EXPECT_EQ(escaped("\xc0\xaf"), "\\xc0\\xaf");                   // too long for its character
    EXPECT_EQ(escaped("\xe0\x80\xaf"), "\\xe0\\x80\\xaf");          // likewise
    EXPECT_EQ(escaped("\xed\xa0\x80"), "\\xed\\xa0\\x80");          // half of a pair
    EXPECT_EQ(escaped("\xf4\x90\x80\x80"), "\\xf4\\x90\\x80\\x80"); // beyond the last character
}

TEST(Escaped, InvisibleCharactersAreNamed)
{
    EXPECT_EQ(escaped("a\xe2\x80\xae"
                      "b"),
              "a\\u{202e}b"); // writes from right to left
    EXPECT_EQ(escaped("\xef\xbb\xbf"), "\\u{feff}");
    EXPECT_EQ(escaped("\xc2\xa0"), "\\u{a0}");
}

TEST(Shown, LongTextIsCut)
{
    EXPECT_EQ(shown(std::string(300, 'a')), '"' + std::string(300, 'a') + '"');
    EXPECT_EQ(shown(std::string(301, 'a')), '"' + std::string(300, 'a') + "\"...");
}

TEST(Listed, FiveAreShownAndTheRestCounted)
{
    EXPECT_EQ(listed({}), "");
    EXPECT_EQ(listed({"a", "b"}), "\"a\", \"b\"");
    EXPECT_EQ(listed({"a", "b", "c", "d", "e", "f", "g"}), "\"a\", \"b\", \"c\", \"d\", \"e\" and 2 more");
}

TEST(ByteCount, HasAUnitAndAllDigits)
{
    EXPECT_EQ(byteCount(0), "0 bytes");
    EXPECT_EQ(byteCount(1), "1 byte");
    EXPECT_EQ(byteCount(999), "999 bytes");
    EXPECT_EQ(byteCount(1000), "1.0 kB (1,000 bytes)");
    EXPECT_EQ(byteCount(999'950), "1.0 MB (999,950 bytes)");
    EXPECT_EQ(byteCount(3'145'728), "3.1 MB (3,145,728 bytes)");
    EXPECT_EQ(byteCount(UINT64_MAX), "18.4 EB (18,446,744,073,709,551,615 bytes)");
}

TEST(Counted, NounFollowsTheNumber)
{
    EXPECT_EQ(counted(1, "entry", "entries"), "1 entry");
    EXPECT_EQ(counted(2, "entry", "entries"), "2 entries");
    EXPECT_EQ(counted(1'234, "byte"), "1,234 bytes");
}

TEST(PrintText, LinesBreakAtBlanksBelowTheirTab)
{
    const auto printed = [](const std::string& text) {
        std::ostringstream out;
        printText(text, out);
        return out.str();
    };
    const std::string words(45, 'a');
    const std::string path = '/' + std::string(150, 'p');
    EXPECT_EQ(printed("Fix:  \tone  two\n\nthree"), "Fix:  one  two\n\nthree");
    EXPECT_EQ(printed("Fix: \t" + words + ' ' + words + "  b\n"), "Fix: " + words + ' ' + words + "  b\n");
    EXPECT_EQ(printed("Fix: \t" + words + ' ' + words + "  bcde\n"), "Fix: " + words + ' ' + words + "\n     bcde\n");
    EXPECT_EQ(printed(words + ' ' + path + " c\n"), words + '\n' + path + "\nc\n");
    const std::string wide = "\xe6\x9d\xbf";  // two columns
    const std::string combined = "e\xcc\x81"; // one
    EXPECT_EQ(printed(words + ' ' + words + ' ' + wide + wide + wide + wide + " b"),
              words + ' ' + words + ' ' + wide + wide + wide + wide + "\nb");
    EXPECT_EQ(printed(words + ' ' + words + ' ' + combined + combined + combined + combined + " bcd"),
              words + ' ' + words + ' ' + combined + combined + combined + combined + " bcd");
}
