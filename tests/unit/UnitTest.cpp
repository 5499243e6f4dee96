#include "UnitTest.h"

#include <cstdio>
#include <iostream>
#include <unistd.h>

void UnitTest::SetUp()
{
    platform::reset();
}

void UnitTest::registerCallbacks()
{
    UpdateManager::instance()->setCallbacks(noteResult, noteError, noteUpdateFound);
    platform::reset();
}

int resultsSoFar()
{
    return testing::UnitTest::GetInstance()->current_test_info()->result()->total_part_count();
}

void endCase(int before)
{
    const int count = resultsSoFar();
    for (int part = before; part < count; ++part) {
        std::cerr << testing::UnitTest::GetInstance()->current_test_info()->result()->GetTestPartResult(part).message()
                  << '\n';
    }
    std::fflush(nullptr);
    _exit(count > before ? 1 : 0);
}

void noteResult(UpdateManager::Result result)
{
    platform::note("result:" + std::to_string(result));
}

void noteError(UpdateManager::Error error)
{
    platform::note("error:" + std::to_string(error));
}

void noteUpdateFound(std::vector<UpdateManager::UpdateComponent> components)
{
    std::string text = "found:";
    for (const UpdateManager::UpdateComponent& component : components) {
        text += "{" + std::to_string(component.kind) + "," + component.name + "," + component.installedVersion + "," +
                component.candidateVersion + "}";
    }
    platform::note(text);
}

std::string ledCommand(const std::string& first, const std::string& second)
{
    return "i2cset -y 0 0x07 " + first + " c ; i2cset -y 0 0x07 " + second + " c";
}

Lines allLeds(const std::string& second)
{
    Lines lines;
    for (const char* led : {"0x10", "0x11", "0x12", "0x13", "0x14", "0x15", "0x16", "0x17", "0x18", "0x19", "0x1a",
                            "0x1b", "0x1c", "0x1d"}) {
        lines.push_back(ledCommand(led, second));
    }
    return lines;
}

std::string logged(const std::string& message)
{
    return "log:" + message;
}

std::string ran(const std::string& command)
{
    return "system:" + command;
}

std::string opened(const std::string& command)
{
    return "popen:" + command;
}

std::string running(const std::string& command)
{
    return logged("Running command: " + command);
}

Lines ran(const Lines& commands)
{
    Lines lines;
    for (const std::string& command : commands) {
        lines.push_back(ran(command));
    }
    return lines;
}

platform::Answer raw(int status)
{
    return {status};
}

platform::Answer doesNotStart()
{
    return {0, "", false};
}

std::string policy(const std::string& installed, const std::string& candidate)
{
    return "solvik4:\n  Installed: " + installed + "\n  Candidate: " + candidate + "\n  Version table:\n";
}

Lines joined(const std::vector<Lines>& parts)
{
    Lines all;
    for (const Lines& part : parts) {
        all.insert(all.end(), part.begin(), part.end());
    }
    return all;
}

Lines mirrorsOk()
{
    return {"log:", "log:Running command: apt update", "popen:apt update", "log:Exit code:0", "log:OK"};
}

Lines packageChecked(const std::string& query, const std::string& installed, const std::string& candidate)
{
    return {"log:" + query,
            "log:Running command: " + query,
            "popen:" + query,
            "log:Exit code:0",
            "log:solvik4:",
            "log:" + installed,
            "log:" + candidate,
            "log:  Version table:",
            "log:" + installed + "  " + candidate,
            installed == candidate ? "log:NWM_UM_NO_UPDATES " + installed + " == " + candidate
                                   : "log:NWM_UM_UPDATE_FOUND: " + installed + " -> " + candidate};
}

Lines packageInstalled(const std::string& command)
{
    return {"log:", "log:Running command: " + command, "popen:" + command, "log:Exit code:0"};
}

Lines boardChecked(const std::string& installed, const std::string& candidate)
{
    return {running(boardVersionCommand),
            opened(boardVersionCommand),
            "log:Exit code:0",
            "log:" + installed + "\r",
            running(stickVersionCommand),
            opened(stickVersionCommand),
            "log:Exit code:0",
            "log:" + installed + "  " + candidate,
            installed == candidate ? "log:QUORB up to date" : "log:Update found: " + installed + " -> " + candidate};
}

Lines boardNotReadable()
{
    return {running(boardVersionCommand), opened(boardVersionCommand), "log:Exit code:255",
            "log:Failed to checkUpdate"};
}

Lines boardInstalled(const std::string& scriptStatus)
{
    return {"log:",
            logged(uploadCommand),
            ran(uploadCommand),
            logged(boardScriptCommand),
            ran(boardScriptCommand),
            "log:Install script ended with code: " + scriptStatus,
            "log:Starts sleeping for 13mins",
            "sleep:780",
            "log:Sleeping for 13mins ended up"};
}

Lines boardUploadFailed()
{
    Lines lines = {"log:", logged(uploadCommand)};
    for (int attempt = 0; attempt < 20; ++attempt) {
        lines.push_back(ran(uploadCommand));
        lines.push_back("log:Uploading failed. Trying again. ");
    }
    lines.push_back("log:Failed to upload QUORB with 20 tries. Closing");
    lines.push_back("log:Failed inside uploadQuorbFiles");
    return lines;
}

Lines harlStopped()
{
    return {"log:", ran(stopHarlCommand), "log:0"};
}

Lines harlStarted()
{
    return {"log:", ran(unmountCommand),     "log:0", ran(startHarlCommand), "log:0", "sleep:10",
            "log:", ran(stopUpdaterCommand), "log:0"};
}

void scriptPackage(const std::string& query, const std::string& installed, const std::string& candidate)
{
    script(query, {exits(0, policy(installed, candidate))});
}

void scriptBoard(const std::string& installed, const std::string& candidate)
{
    script(boardVersionCommand, {exits(0, "Brimvale\t" + installed + "\r\n")});
    script(stickVersionCommand, {exits(0, "quorb" + candidate + "\n")});
}
