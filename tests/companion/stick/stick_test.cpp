#include "stick/stick_check.h"

#include "finding_lines.h"
#include "kept_reports.h"
#include "stick/zip_file.h"
#include "test_folder.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sstream>

#include <sys/stat.h>

namespace fs = std::filesystem;
using testing::HasSubstr;

namespace
{

const char board[] = "debs/QUORB/armhf/";
const char script[] = "#!/bin/sh\nunzip -o /root/OSUpgrade.zip -d /\n";

/// A stick with everything that an update needs; each test changes what it is about.
class Stick : public testing::Test
{
protected:
    Stick() { putVersion("quorb2.2.0"); }

    void putVersion(const std::string& folder) const
    {
        stick.put(board + folder + "/OSUpgrade.zip", zipArchive({{"App/AppExe/version.txt", "Brimvale\t2.2.0\r\n"}}));
        stick.put(board + folder + "/unzipUpgrade.sh", script, 0755);
    }

    void remove(const std::string& path) const { fs::remove_all(stick.path(path)); }

    void rename(const std::string& from, const std::string& to) const { fs::rename(stick.path(from), stick.path(to)); }

    Report check(bool onUnit = false) const
    {
        Report report("stick", "The stick");
        checkStick(StickFolder(stick.path()), onUnit, report);
        return report;
    }

    Lines findings() const { return findingsOf(check()); }

    TestFolder stick;
};

} // namespace

TEST_F(Stick, CompleteStickIsFit)
{
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines());
    EXPECT_EQ(report.status(), Report::STATUS_FIT);
    EXPECT_EQ(factOf(report, "version_folder"), "\"quorb2.2.0\"");
    EXPECT_EQ(factOf(report, "version"), "\"2.2.0\"");
    EXPECT_EQ(factOf(report, "archive_entries"), "1");
    EXPECT_EQ(factOf(report, "archive_declared_bytes"), "16");
    EXPECT_EQ(factOf(report, "board_bytes"),
              std::to_string(fs::file_size(stick.path(board + std::string("quorb2.2.0/OSUpgrade.zip"))) + 16));
    EXPECT_EQ(factOf(report, "script_interpreter"), "\"/bin/sh\"");
    EXPECT_EQ(factOf(report, "teamviewer_requested"), "false");
}

// The way to the board's folder

TEST_F(Stick, EmptyStickHasNoBoardFolder)
{
    remove("debs");
    EXPECT_EQ(findings(), Lines{"error no-board-folder"});
    EXPECT_EQ(check().status(), Report::STATUS_NOT_FIT);
}

TEST_F(Stick, FileInPlaceOfAFolderIsNoBoardFolder)
{
    remove("debs/QUORB");
    stick.put("debs/QUORB", "");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"error no-board-folder"});
    EXPECT_EQ(whatOf(report, "no-board-folder"), "\"debs/QUORB\" is no folder.");
}

TEST_F(Stick, CaseMistakeInAFolderIsNamed)
{
    rename("debs/QUORB", "debs/Quorb");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"error name-case"});
    EXPECT_THAT(whatOf(report, "name-case"), HasSubstr("\"Quorb\" in \"debs\" must be named \"QUORB\""));
}

TEST_F(Stick, UnreadableFolderIsUnchecked)
{
    chmod(stick.path("debs/QUORB").c_str(), 0700);
    const AsNobody nobody;
    if (access(stick.path("debs/QUORB/armhf").c_str(), F_OK) == 0) {
        chmod(stick.path("debs/QUORB").c_str(), 0); // the folder's owner runs the test
    }
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"unchecked stick-unreadable"});
    EXPECT_EQ(report.status(), Report::STATUS_UNCHECKED);
    chmod(stick.path("debs/QUORB").c_str(), 0755);
}

TEST_F(Stick, OnTheUnitAFolderThatIsNoMountPointIsNotMounted)
{
    EXPECT_EQ(findingsOf(check(true)), Lines{"warning stick-not-mounted"});
}

TEST_F(Stick, OnTheUnitAMountPointIsMounted)
{
    Report report("stick", "/proc");
    checkStick(StickFolder("/proc"), true, report);
    EXPECT_EQ(findingsOf(report), Lines{"error no-board-folder"});
}

// The version folder

TEST_F(Stick, BoardFolderWithoutNamesHasNoVersion)
{
    remove(std::string(board) + "quorb2.2.0");
    EXPECT_EQ(findings(), Lines{"error no-version-folder"});
}

TEST_F(Stick, HiddenVersionFolderIsNotSeen)
{
    rename(std::string(board) + "quorb2.2.0", std::string(board) + ".quorb2.2.0");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"error no-version-folder"});
    EXPECT_THAT(whatOf(report, "no-version-folder"), HasSubstr("hidden names: \".quorb2.2.0\""));
}

TEST_F(Stick, OnlyAFileIsNoVersionFolder)
{
    remove(std::string(board) + "quorb2.2.0");
    stick.put(std::string(board) + "quorb2.2.0", "");
    EXPECT_EQ(findings(), Lines{"error no-version-folder"});
}

TEST_F(Stick, SeveralVersionFoldersAreAnErrorThatNamesTheOneRead)
{
    putVersion("quorb2.10.0");
    putVersion("quorb2.3.0");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"error several-version-folders"});
    EXPECT_EQ(factOf(report, "version"), "\"2.10.0\"");
    EXPECT_THAT(report.findings().at(0).effect, HasSubstr("\"quorb2.10.0\", but its upload takes the files of every"));
}

TEST_F(Stick, FilesOfTheLastFolderAreTheOnesTested)
{
    putVersion("quorb2.3.0");
    stick.put(std::string(board) + "quorb2.3.0/OSUpgrade.zip", "no archive");
    EXPECT_EQ(findings(), (Lines{"error several-version-folders", "error archive-not-zip"}));
}

TEST_F(Stick, NameInFrontOfTheVersionFolderIsReadInItsPlace)
{
    stick.put(std::string(board) + "Readme 1.0", "");
    const Report report = check();
    EXPECT_EQ(findingsOf(report),
              (Lines{"error name-before-version-folder", "warning version-unusual", "warning version-start"}));
    EXPECT_EQ(factOf(report, "version"), "\"e 1.0\"");
}

TEST_F(Stick, NameThatSomeLocalesOrderInFrontIsAnErrorToo)
{
    for (const std::string name : {"~backup", "\xc3\xa4hnlich", "quorb_old"}) {
        stick.put(board + name, "");
        EXPECT_EQ(findings(), Lines{"error name-before-version-folder"}) << name;
        remove(board + name);
    }
    rename(std::string(board) + "quorb2.2.0", std::string(board) + "Quorb2.2.0");
    stick.put(std::string(board) + "license", "");
    EXPECT_EQ(findings(), Lines{"error name-before-version-folder"});
}

TEST_F(Stick, NameBehindTheVersionFolderIsANote)
{
    stick.put(std::string(board) + "readme", "");
    stick.put(std::string(board) + "quorb2.2.0.txt", "");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"note name-beside-version-folder"});
    EXPECT_EQ(report.status(), Report::STATUS_FIT);
}

TEST_F(Stick, HiddenNamesBesideTheVersionFolderDoNotMatter)
{
    stick.put(std::string(board) + ".directory", "");
    EXPECT_EQ(findings(), Lines());
}

TEST_F(Stick, MoreThanAThousandNamesAreNotLookedAt)
{
    for (int number = 0; number < 1'001; ++number) {
        stick.put(board + std::to_string(number), "");
    }
    EXPECT_EQ(findings(), Lines{"error too-many-names"});
}

TEST_F(Stick, FolderNameOfFiveBytesHasNoVersion)
{
    rename(std::string(board) + "quorb2.2.0", std::string(board) + "quorb");
    EXPECT_EQ(findings(), Lines{"error version-missing"});
    rename(board + std::string("quorb"), board + std::string("quo"));
    EXPECT_EQ(findings(), Lines{"error version-missing"});
}

TEST_F(Stick, VersionWithALineBreakIsCut)
{
    rename(std::string(board) + "quorb2.2.0", std::string(board) + "quorb2.2.0\n1");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"error version-line-break"});
    EXPECT_EQ(factOf(report, "version"), "\"2.2.0\"");
}

TEST_F(Stick, VersionWithACarriageReturnNeverEqualsTheBoards)
{
    rename(std::string(board) + "quorb2.2.0", std::string(board) + "quorb2.2.0\r");
    EXPECT_EQ(findings(), Lines{"error version-line-break"});
}

TEST_F(Stick, VersionWithABlankIsUnusual)
{
    rename(std::string(board) + "quorb2.2.0", std::string(board) + "quorb2.2.0 ");
    EXPECT_EQ(findings(), Lines{"warning version-unusual"});
}

TEST_F(Stick, PrefixOfAnotherLengthIsAWarning)
{
    for (const std::string name : {"quorb-2.2.0", "quo2.2.0", "boar22.2.0", "v2.2.0"}) {
        rename(std::string(board) + "quorb2.2.0", board + name);
        EXPECT_EQ(findings(), Lines{"warning version-start"}) << name;
        rename(board + name, std::string(board) + "quorb2.2.0");
    }
}

TEST(StickVersion, EveryCharacterHasItsPlace)
{
    const auto found = [](const std::string& name) {
        Report report("stick", "A name");
        checkVersionName(name, report);
        return report.findings().size();
    };
    for (const char digit : std::string("0123456789")) {
        EXPECT_EQ(found(std::string("quorb") + digit), 0U) << digit;
        EXPECT_EQ(found(std::string("quor") + digit + "2.2.0"), 1U) << digit; // a prefix that may be too short
    }
    EXPECT_EQ(found("quor.2.2.0"), 1U);
    EXPECT_EQ(found("quorb1abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789.+~_-"), 0U);
    for (const char other : std::string(" !\"#$%&'()*,/:;<=>?@[\\]^`{|}\x01\x7f\xe4")) {
        EXPECT_EQ(found(std::string("quorb2") + other), 1U) << other;
    }
}

// The files for the board

TEST_F(Stick, MissingFilesAreErrors)
{
    remove(std::string(board) + "quorb2.2.0/OSUpgrade.zip");
    remove(std::string(board) + "quorb2.2.0/unzipUpgrade.sh");
    EXPECT_EQ(findings(), (Lines{"error file-missing", "error file-missing"}));
}

TEST_F(Stick, SimilarNameIsOfferedForAMissingFile)
{
    rename(std::string(board) + "quorb2.2.0/OSUpgrade.zip", std::string(board) + "quorb2.2.0/OSUpgrade (1).zip");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"error file-missing"});
    EXPECT_THAT(whatOf(report, "file-missing"), HasSubstr("\"OSUpgrade (1).zip\""));
}

TEST_F(Stick, CaseMistakeInAFileIsNamed)
{
    rename(std::string(board) + "quorb2.2.0/OSUpgrade.zip", std::string(board) + "quorb2.2.0/OSUPGRADE.ZIP");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"error name-case"});
    EXPECT_THAT(whatOf(report, "name-case"), HasSubstr("must be named \"OSUpgrade.zip\""));
}

TEST_F(Stick, EmptyFileIsAnError)
{
    stick.put(std::string(board) + "quorb2.2.0/unzipUpgrade.sh", "", 0755);
    EXPECT_EQ(findings(), Lines{"error file-empty"});
}

TEST_F(Stick, FolderOrPipeInPlaceOfAFileIsNoPlainFile)
{
    remove(std::string(board) + "quorb2.2.0/OSUpgrade.zip");
    remove(std::string(board) + "quorb2.2.0/unzipUpgrade.sh");
    stick.makeFolder(std::string(board) + "quorb2.2.0/OSUpgrade.zip");
    ASSERT_EQ(mkfifo(stick.path(std::string(board) + "quorb2.2.0/unzipUpgrade.sh").c_str(), 0755), 0);
    EXPECT_EQ(findings(), (Lines{"error no-plain-file", "error no-plain-file"}));
}

TEST_F(Stick, ScriptWithoutRunBitIsAnError)
{
    chmod(stick.path(std::string(board) + "quorb2.2.0/unzipUpgrade.sh").c_str(), 0644);
    EXPECT_EQ(findings(), Lines{"error script-run-bit"});
    stick.put(board + std::string("quorb2.2.0/unzipUpgrade.sh"), "#!sh\n", 0644);
    EXPECT_EQ(findings(), (Lines{"error script-first-line", "error script-run-bit"}));
}

TEST_F(Stick, ScriptThatCannotBeReadIsUnchecked)
{
    chmod(stick.path(std::string(board) + "quorb2.2.0/unzipUpgrade.sh").c_str(), 0100);
    const AsNobody nobody;
    EXPECT_EQ(findings(), Lines{"unchecked stick-unreadable"});
}

TEST_F(Stick, FourGigabytesOfNothingAreRefusedAtOnce)
{
    const fs::path archive = stick.path(std::string(board) + "quorb2.2.0/OSUpgrade.zip");
    fs::resize_file(archive, 4ULL << 30U);
    EXPECT_EQ(findings(), Lines{"error archive-not-zip"});
    fs::resize_file(archive, (4ULL << 30U) + 1);
    EXPECT_EQ(findings(), Lines{"error archive-too-large"});
}

// The TeamViewer marker

TEST_F(Stick, MarkerFileRequestsTeamViewer)
{
    stick.put("debs/installTV", "");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines());
    EXPECT_EQ(factOf(report, "teamviewer_requested"), "true");
}

TEST_F(Stick, MarkerFolderRequestsNothing)
{
    stick.makeFolder("debs/installTV");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"warning marker-is-folder"});
    EXPECT_EQ(factOf(report, "teamviewer_requested"), "false");
}

TEST_F(Stick, MarkerLinkToNothingRequestsTeamViewer)
{
    stick.makeLink("debs/installTV", "nothing");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines());
    EXPECT_EQ(factOf(report, "teamviewer_requested"), "true");
}

TEST_F(Stick, MarkerLinkOutOfTheStickIsReported)
{
    stick.makeLink("debs/installTV", "/etc");
    EXPECT_EQ(findings(), Lines{"error link-leaves-stick"});
}

TEST_F(Stick, CaseMistakeInTheMarkerRequestsNothing)
{
    stick.put("debs/InstallTV", "");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), Lines{"warning name-case"});
    EXPECT_EQ(factOf(report, "teamviewer_requested"), "false");
}

TEST_F(Stick, MarkerWithAnExtensionRequestsNothing)
{
    stick.put("debs/installTV.txt", "");
    EXPECT_EQ(findings(), Lines{"warning marker-name"});
}

// Hostile sticks

TEST_F(Stick, LinksOutOfTheStickAreNotFollowed)
{
    const TestFolder outside;
    outside.put("unzipUpgrade.sh", script, 0755);
    remove(std::string(board) + "quorb2.2.0/unzipUpgrade.sh");
    for (const std::string& target : {outside.path("unzipUpgrade.sh").string(),
                                      std::string("../../../../../etc/passwd"), std::string("/proc/self/exe")}) {
        stick.makeLink(std::string(board) + "quorb2.2.0/unzipUpgrade.sh", target);
        const Report report = check();
        EXPECT_EQ(findingsOf(report), Lines{"error link-leaves-stick"}) << target;
        EXPECT_THAT(whatOf(report, "link-leaves-stick"), HasSubstr(target));
        EXPECT_EQ(factOf(report, "script_interpreter"), "") << "what is outside was read";
        remove(std::string(board) + "quorb2.2.0/unzipUpgrade.sh");
    }
}

TEST_F(Stick, FolderThatLeadsOutOfTheStickIsNotFollowed)
{
    const TestFolder outside;
    fs::rename(stick.path("debs/QUORB"), outside.path("QUORB"));
    stick.makeLink("debs/QUORB", outside.path("QUORB"));
    EXPECT_EQ(findings(), Lines{"error link-leaves-stick"});
}

TEST_F(Stick, VersionFolderThatLeadsOutOfTheStickIsNotFollowed)
{
    remove(std::string(board) + "quorb2.2.0");
    stick.makeLink(std::string(board) + "quorb2.2.0", "/etc");
    EXPECT_EQ(findings(), (Lines{"error link-leaves-stick", "error no-version-folder"}));
}

TEST_F(Stick, LinkWithinTheStickIsFollowed)
{
    rename("debs/QUORB", "debs/files");
    stick.makeLink("debs/QUORB", "files");
    EXPECT_EQ(findings(), Lines());
}

TEST_F(Stick, LinksToNothingAndToThemselvesAreBroken)
{
    for (const std::string target : {"nothing", "OSUpgrade.zip"}) {
        remove(std::string(board) + "quorb2.2.0/OSUpgrade.zip");
        stick.makeLink(std::string(board) + "quorb2.2.0/OSUpgrade.zip", target);
        EXPECT_EQ(findings(), Lines{"error link-broken"}) << target;
    }
}

TEST_F(Stick, LinksAreFollowedAsTheKernelFollowsThem)
{
    const StickFolder folder(stick.path());
    stick.put("a/b/file", "x");
    for (const auto& [target, kind] : std::vector<std::pair<std::string, Node::Kind>>{
             {"b/file", Node::FILE},
             {"./b/.././/b/file", Node::FILE},
             {"../a/b/file", Node::FILE},
             {"..", Node::FOLDER},
             {"b/", Node::FOLDER},
             {"b/.", Node::FOLDER},
             {"b/file/", Node::LEADS_NOWHERE},
             {"b/file/.", Node::LEADS_NOWHERE},
             {"b/file/../file", Node::LEADS_NOWHERE},
             {"c/../b/file", Node::LEADS_NOWHERE},
             {"../..", Node::LEADS_OUT},
             {"../../" + stick.path().filename().string() + "/a/b/file", Node::LEADS_OUT},
             {"/", Node::LEADS_OUT},
             {stick.path("a/b/file"), Node::LEADS_OUT},
         }) {
        stick.makeLink("a/link", target);
        EXPECT_EQ(folder.node("a/link").kind, kind) << target;
        EXPECT_EQ(folder.node("a/link").target, target);
        remove("a/link");
    }
    EXPECT_EQ(folder.node("a/b/file/x").kind, Node::MISSING);
}

TEST_F(Stick, FortyLinksInARowAreFollowed)
{
    const StickFolder folder(stick.path());
    stick.put("0", "x");
    for (int number = 1; number <= 41; ++number) {
        stick.makeLink(std::to_string(number), std::to_string(number - 1));
    }
    EXPECT_EQ(folder.node("40").kind, Node::FILE);
    EXPECT_EQ(folder.node("41").kind, Node::LEADS_NOWHERE);
}

TEST_F(Stick, HostileNamesBesideTheUpdatersOwnAreShownEscaped)
{
    const std::string hostile = " a\n\x1b[2J\xff";
    const std::string folder = std::string(board) + "quorb2.2.0/";
    rename(folder + "OSUpgrade.zip", folder + "OSUpgrade" + hostile);
    remove(folder + "unzipUpgrade.sh");
    stick.makeLink(folder + "unzipUpgrade.sh", "/nowhere" + hostile);
    stick.put(board + ("zz" + hostile), "");
    stick.put("debs/installTV" + hostile, "");
    const Report report = check();
    EXPECT_EQ(findingsOf(report), (Lines{"note name-beside-version-folder", "error file-missing",
                                         "error link-leaves-stick", "warning marker-name"}));
    for (const Finding& finding : report.findings()) {
        EXPECT_THAT(finding.what, HasSubstr(" a\\n\\x1b[2J\\xff\""));
    }
    std::ostringstream out;
    std::ostringstream errors;
    EXPECT_EQ(runStick(stick.path(hostile), false, out, errors), Report::STATUS_UNCHECKED);
    EXPECT_THAT(errors.str(), HasSubstr(" a\\n\\x1b[2J\\xff\""));
}

TEST_F(Stick, HostileNamesAreShownEscapedAndNeverRun)
{
    const std::string hostile = "quorb2.2.0;touch here;$(touch here)`touch here`\n\x1b[2J\x07 \xff\xfe\xe2\x80\xae|&";
    rename(std::string(board) + "quorb2.2.0", board + hostile);
    const fs::path before = fs::current_path();
    fs::current_path(stick.path());
    std::ostringstream text;
    std::ostringstream json;
    std::ostringstream errors;
    EXPECT_EQ(runStick(stick.path(), false, text, errors), Report::STATUS_NOT_FIT);
    EXPECT_EQ(runStick(stick.path(), true, json, errors), Report::STATUS_NOT_FIT);
    fs::current_path(before);

    EXPECT_THAT(text.str(), HasSubstr("\"quorb2.2.0;touch here;$(touch here)`touch here`\\n\\x1b[2J\\x07 "
                                      "\\xff\\xfe\\u{202e}|&\""));
    for (const std::string& output : {text.str(), json.str()}) {
        EXPECT_TRUE(std::all_of(output.begin(), output.end(),
                                [](char letter) { return letter == '\n' || (letter >= ' ' && letter <= '~'); }));
    }
    EXPECT_TRUE(nlohmann::json::accept(json.str()));
    EXPECT_EQ(errors.str(), "");
    EXPECT_FALSE(fs::exists(stick.path("here")));
}

// The program's results

TEST_F(Stick, JsonHoldsEveryFindingWithItsParts)
{
    stick.makeFolder("debs/installTV");
    std::ostringstream out;
    std::ostringstream errors;
    EXPECT_EQ(runStick(stick.path(), true, out, errors), 0);
    const nlohmann::json report = nlohmann::json::parse(out.str());
    EXPECT_EQ(report["command"], "stick");
    EXPECT_EQ(report["status"], 0);
    EXPECT_EQ(report["fit"], true);
    EXPECT_EQ(report["facts"]["version"], "2.2.0");
    ASSERT_EQ(report["findings"].size(), 1U);
    const nlohmann::json finding = report["findings"][0];
    EXPECT_EQ(finding["severity"], "warning");
    EXPECT_EQ(finding["check"], "marker-is-folder");
    for (const char* part : {"what", "effect", "remedy"}) {
        EXPECT_NE(finding[part], "") << part;
    }
}

TEST_F(Stick, TextNamesEffectRemedyAndVerdict)
{
    remove("debs");
    std::ostringstream out;
    std::ostringstream errors;
    EXPECT_EQ(runStick(stick.path(), false, out, errors), 1);
    EXPECT_THAT(out.str(), HasSubstr("error: \"debs\" is missing. [no-board-folder]\n  The updater: "));
    EXPECT_THAT(out.str(), HasSubstr("\n  Fix:         Put the board's version folder into"));
    EXPECT_THAT(out.str(), HasSubstr(" is NOT fit for an update.\n"));
}

TEST_F(Stick, MissingOrOrdinaryFileInPlaceOfAStickIsUnreadable)
{
    stick.put("file", "");
    for (const std::string name : {"nowhere", "file"}) {
        std::ostringstream out;
        std::ostringstream errors;
        EXPECT_EQ(runStick(stick.path(name), false, out, errors), 2);
        EXPECT_EQ(out.str(), "");
        EXPECT_THAT(errors.str(), HasSubstr(name));
        EXPECT_THAT(errors.str(), HasSubstr("Name the folder that the stick is mounted at"));
    }
}

TEST_F(Stick, FolderThatMayBeListedButNotEnteredIsUnreadable)
{
    chmod(stick.path("debs").c_str(), 0444);
    const AsNobody nobody;
    std::ostringstream out;
    std::ostringstream errors;
    EXPECT_EQ(runStick(stick.path("debs"), false, out, errors), 2);
    EXPECT_EQ(out.str(), "");
    EXPECT_THAT(errors.str(), testing::EndsWith("\" cannot be read: Permission denied. Run this check as root.\n"));
    chmod(stick.path("debs").c_str(), 0755);
}

TEST_F(Stick, NothingOnTheStickIsChanged)
{
    const auto times = [&] {
        Lines result;
        for (const auto& entry : fs::recursive_directory_iterator(stick.path())) {
            result.push_back(entry.path().string() + ' ' +
                             std::to_string(entry.last_write_time().time_since_epoch().count()));
        }
        std::sort(result.begin(), result.end());
        return result;
    };
    const Lines before = times();
    check();
    EXPECT_EQ(times(), before);
}

TEST_F(Stick, VersionFolderThatMayNotBeEnteredIsUnchecked)
{
    for (const char* folder : {"debs/QUORB/armhf/quorb2.2.0", "debs/QUORB/armhf"}) {
        chmod(stick.path(folder).c_str(), 0444);
        {
            const AsNobody nobody;
            EXPECT_EQ(findings(), Lines{"unchecked stick-unreadable"}) << folder;
        }
        chmod(stick.path(folder).c_str(), 0755);
    }
}

TEST_F(Stick, CommandPrintsTheWholeReport)
{
    stick.put("harl-updater.manifest", "Format: 1\n");
    const fs::path before = fs::current_path();
    fs::current_path(stick.path()); // its name would change where the lines break
    std::ostringstream out;
    std::ostringstream errors;
    EXPECT_EQ(runStick(".", false, out, errors, ""), Report::STATUS_FIT);
    EXPECT_EQ(runStick("nowhere", true, out, errors, ""), Report::STATUS_UNCHECKED);
    fs::current_path(before);
    compareWithKept(out.str() + errors.str());
}

TEST_F(Stick, BoardFolderThatMayNotBeListedIsUnchecked)
{
    chmod(stick.path("debs/QUORB/armhf").c_str(), 0111);
    {
        const AsNobody nobody;
        EXPECT_EQ(findings(), Lines{"unchecked stick-unreadable"});
    }
    chmod(stick.path("debs/QUORB/armhf").c_str(), 0755);
}

TEST_F(Stick, LinkToTheUnitsMountPointIsFollowedOnTheStick)
{
    rename("debs/QUORB/armhf/quorb2.2.0", "files");
    stick.makeLink("debs/QUORB/armhf/quorb2.2.0", "/root/USB_MOUNT/files");
    EXPECT_EQ(findings(), Lines());
    remove("debs/QUORB/armhf/quorb2.2.0");
    stick.makeLink("debs/QUORB/armhf/quorb2.2.0", "/root/USB_MOUNT_2/files");
    EXPECT_EQ(findings()[0], "error link-leaves-stick");
}

TEST_F(Stick, MarkerLinkToItselfRequestsNothing)
{
    stick.makeLink("debs/installTV", "installTV");
    const Report report = check();
    EXPECT_EQ(factOf(report, "teamviewer_requested"), "false");
    EXPECT_EQ(findingsOf(report), Lines{"error link-broken"});
}

TEST_F(Stick, MarkerInTheSticksOwnFolderIsNamed)
{
    stick.put("installTV", "");
    EXPECT_EQ(findings(), Lines{"warning marker-name"});
    EXPECT_THAT(whatOf(check(), "marker-name"), HasSubstr("in the stick's own folder"));
}

TEST_F(Stick, FolderOneLevelTooDeepIsNamed)
{
    fs::create_directory(stick.path("update"));
    rename("debs", "update/debs");
    EXPECT_THAT(whatOf(check(), "no-board-folder"), HasSubstr("\"update/debs\" is one level too deep"));
}

TEST_F(Stick, VerdictCountsTheWarnings)
{
    rename("debs/QUORB/armhf/quorb2.2.0", "debs/QUORB/armhf/quorb_2.2.0");
    std::ostringstream out;
    check().write(false, out);
    EXPECT_THAT(out.str(), HasSubstr("The stick is fit for an update, with 1 warning.\n"));
}
