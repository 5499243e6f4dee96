#include "stick/stick_check.h"

#include "finding_lines.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

using testing::HasSubstr;

namespace
{

Report check(const std::string& script)
{
    Report report("stick", "A script");
    checkScript(script, script.size(), "\"unzipUpgrade.sh\"", report);
    return report;
}

Lines checkBit(mode_t mode, bool keepsPermissions, bool onUnit)
{
    Report report("stick", "A script");
    checkRunBit(mode, keepsPermissions, onUnit, "\"unzipUpgrade.sh\"", report);
    return findingsOf(report);
}

} // namespace

TEST(StickScript, InterpreterAndUnixLineEndsAreFit)
{
    for (const std::string script : {"#!/bin/sh\nexit 0\n", "#! /bin/bash -e\nexit 0\n", "#!/bin/sh"}) {
        EXPECT_EQ(findingsOf(check(script)), Lines()) << script;
    }
    EXPECT_EQ(factOf(check("#! /bin/bash -e\n"), "script_interpreter"), "\"/bin/bash\"");
}

TEST(StickScript, CompiledProgramIsFit)
{
    const Report report = check("\x7f"
                                "ELF\x01\r\n");
    EXPECT_EQ(findingsOf(report), Lines());
    EXPECT_EQ(factOf(report, "script_interpreter"), "null");
}

TEST(StickScript, FirstLineThatTheKernelCannotRunIsAnError)
{
    const std::string lines[] = {"#!\n",
                                 "#!sh\n",
                                 "#!/bin/sh\r\n",
                                 "#!/bin/sh\rexit 0\r",
                                 std::string("#!/bin/\0sh\n", 11),
                                 "#!/" + std::string(253, 'x') + '\n'};
    for (const std::string& script : lines) {
        EXPECT_EQ(findingsOf(check(script)), Lines{"error script-first-line"}) << script;
    }
}

TEST(StickScript, FirstLineWithoutAnInterpreterIsAWarningBecauseAShellRunsIt)
{
    const std::string lines[] = {"echo\n", "\n#!/bin/sh\n", " #!/bin/sh\n",
                                 "\xef\xbb\xbf#!/bin/sh\n" /* byte order mark */};
    for (const std::string& script : lines) {
        EXPECT_EQ(findingsOf(check(script)), Lines{"warning script-first-line"}) << script;
    }
    EXPECT_EQ(findingsOf(check("echo\r\n")), (Lines{"warning script-first-line", "error script-line-ends"}));
}

TEST(StickScript, FirstLineIsShownEscaped)
{
    EXPECT_THAT(whatOf(check("\xef\xbb\xbf#!/bin/sh\n"), "script-first-line"), HasSubstr("\\u{feff}#!/bin/sh"));
    EXPECT_THAT(whatOf(check("#!/bin/sh\r\n"), "script-first-line"), HasSubstr("an interpreter \"/bin/sh\\r\""));
}

TEST(StickScript, LongestFirstLineOfTheKernelIsFit)
{
    EXPECT_EQ(findingsOf(check("#!/" + std::string(252, 'x') + '\n')), Lines());
}

TEST(StickScript, WindowsLineEndBehindTheFirstLineIsNamedByItsLine)
{
    const Report report = check("#!/bin/sh\ncd /\nexit 0\r\n");
    EXPECT_EQ(findingsOf(report), Lines{"error script-line-ends"});
    EXPECT_THAT(whatOf(report, "script-line-ends"), HasSubstr("line 3"));
    EXPECT_THAT(whatOf(check("\nexit 0\r\n"), "script-line-ends"), HasSubstr("line 2"));
}

TEST(StickScript, LineEndsInDataBehindTheScriptDoNotMatter)
{
    EXPECT_EQ(findingsOf(check(std::string("#!/bin/sh\nexit 0\n\0\r\n", 20))), Lines());
}

TEST(StickScript, AnyRunBitIsEnough)
{
    EXPECT_EQ(checkBit(0744, true, false), Lines());
    EXPECT_EQ(checkBit(0654, true, false), Lines());
    EXPECT_EQ(checkBit(0645, true, false), Lines());
    EXPECT_EQ(checkBit(0755, false, true), Lines());
}

TEST(StickScript, MissingRunBitIsAnErrorWhereTheFileSystemHasOne)
{
    EXPECT_EQ(checkBit(0644, true, false), Lines{"error script-run-bit"});
}

TEST(StickScript, MissingRunBitIsAnErrorWithTheUnitsOwnMount)
{
    EXPECT_EQ(checkBit(0644, false, true), Lines{"error script-run-bit"});
}

TEST(StickScript, MissingRunBitOfAnotherMountIsAWarning)
{
    EXPECT_EQ(checkBit(0644, false, false), Lines{"warning script-run-bit"});
}
