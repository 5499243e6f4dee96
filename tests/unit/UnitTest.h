#pragma once

#include "Platform.h"
#include "UpdateManager.h"

#include <gtest/gtest.h>

#include <string>

/// A test with a fresh journal, whose engine reports into it as notes.
class UnitTest : public testing::Test
{
protected:
    void SetUp() override;

    /// Registers the callbacks that note what is reported, and forgets the record of that.
    static void registerCallbacks();
};

/// For a test whose EXPECT_EXIT must run in a process in which nothing was started yet.
#ifdef EMULATED // QEMU's user emulation cannot start the program once more
#define NEEDS_A_FRESH_PROCESS() GTEST_SKIP()
#else
#define NEEDS_A_FRESH_PROCESS() GTEST_FLAG_SET(death_test_style, "threadsafe")
#endif

/// How many results, failures among them, the running test has so far.
int resultsSoFar();

/// Ends the process of a death test, whose failures nobody prints: with 0 when there are none behind the first `before`
/// results, which the test had already when it made the process; else with 1 and what failed on standard error.
[[noreturn]] void endCase(int before);

void noteResult(UpdateManager::Result result);
void noteError(UpdateManager::Error error);
void noteUpdateFound(std::vector<UpdateManager::UpdateComponent> components);

using platform::entries;
using platform::exits;
using platform::journal;
using platform::Lines;
using platform::script;

const char mirrorsCommand[] = "apt update";
const char policyCommand[] = "apt-cache policy solvik4-rh";
const char installCommand[] = "apt --assume-yes install solvik4-rh";
const char boardVersionCommand[] =
    "ssh  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes 192.168.9.2 "
    "\" cat /root/App/AppExe/version.txt | grep 'Brimvale'\"";
const char stickVersionCommand[] = "ls /root/USB_MOUNT/debs/QUORB/armhf/";
const char uploadCommand[] =
    "scp  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes "
    "/root/USB_MOUNT/debs/QUORB/armhf/*/OSUpgrade.zip 192.168.9.2:/root/ && "
    "scp  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes "
    "/root/USB_MOUNT/debs/QUORB/armhf/*/unzipUpgrade.sh 192.168.9.2:/";
const char boardScriptCommand[] =
    "ssh  -o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes 192.168.9.2 "
    "\"/unzipUpgrade.sh\"";
const char markerCommand[] = "rm /root/RESOURCES/tavren1stboot";
const char teamViewerCheckCommand[] = "ls /root/USB_MOUNT/debs/installTV";
const char teamViewerMarker[] = "/root/USB_MOUNT/debs/installTV";
const char teamViewerScriptCommand[] = "/root/RESOURCES/teamviewer_updatescript.sh";

const char stopHarlCommand[] = "systemctl stop harl";
const char startHarlCommand[] = "systemctl start harl";
const char stopUpdaterCommand[] = "systemctl stop harl-updater";
const char unmountCommand[] = "umount /root/USB_MOUNT/";
const char passSoundCommand[] = "aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav";
const char failSoundCommand[] = "aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav";

/// LED codes and second bytes, as the command lines spell them.
const char ledRemote[] = "0x12";
const char ledPass[] = "0x13";
const char ledFail[] = "0x14";
const char ledMain[] = "0x15";
const char dark[] = "0x0";
const char blue[] = "0x1";
const char passColor[] = "0x2";
const char failColor[] = "0x8";

/// The command line that sends the panel's controller two bytes, and those that send every LED the same `second` byte.
std::string ledCommand(const std::string& first, const std::string& second);
Lines allLeds(const std::string& second);

/// As the journal spells them: a record's message, a command run by system(3), and one opened by popen(3).
std::string logged(const std::string& message);
std::string ran(const std::string& command);
std::string opened(const std::string& command);
std::string running(const std::string& command); // the runner's record in front of opened()
Lines ran(const Lines& commands);

/// Answers: a raw wait status without output, and no shell at all.
platform::Answer raw(int status);
platform::Answer doesNotStart();

/// What `apt-cache policy` prints for a package with these two versions.
std::string policy(const std::string& installed, const std::string& candidate);

/// The one journal of all `parts`, in order.
Lines joined(const std::vector<Lines>& parts);

/// What the runner and the successful check of the mirrors leave in the journal, and so on for the other steps.
Lines mirrorsOk();
Lines packageChecked(const std::string& query, const std::string& installed, const std::string& candidate);
Lines packageInstalled(const std::string& command);
Lines boardChecked(const std::string& installed, const std::string& candidate);
Lines boardNotReadable();
Lines boardInstalled(const std::string& scriptStatus = "0");
Lines boardUploadFailed();
Lines harlStopped();
Lines harlStarted();

/// Scripts the unit: versions of the package and of the board, installed and offered.
void scriptPackage(const std::string& query, const std::string& installed, const std::string& candidate);
void scriptBoard(const std::string& installed, const std::string& candidate);
