/// The package check against an oracle that searches for the last values from the end. Input: a digit for the query's
/// status, whose parity also decides whether exit code 100 is accepted, then the query's output.

#include "Input.h"
#include "UpdateManager.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    const std::vector<Answer> answers = answersOf(data, size, 1);
    const bool ignoreNoInternet = size % 2 == 0;
    give(answers);
    std::string installed = "before";
    std::string candidate = "before";
    bool versionsFound = true;
    const bool update = UpdateManager::checkUpdate(ignoreNoInternet, "query", installed, candidate, versionsFound);
    const std::string log = takeLog();

    std::string expectedInstalled;
    std::string expectedCandidate;
    std::string lastMessage = "NO_INTERNET_ERROR_CODE";
    if (codeOf(answers[0].status) != 100 || ignoreNoInternet) {
        const std::vector<std::string> lines = linesRead(answers[0].output);
        expectedInstalled = lastBehind(lines, "Installed: ");
        expectedCandidate = lastBehind(lines, "Candidate: ", "Installed: ");
        lastMessage = "NWM_UM_CHECK_UPDATE_FAILED";
    }
    const bool found = !expectedInstalled.empty() && !expectedCandidate.empty();
    const bool differ = found && expectedInstalled != expectedCandidate;
    if (found) {
        lastMessage = differ ? "NWM_UM_UPDATE_FOUND: " + expectedInstalled + " -> " + expectedCandidate
                             : "NWM_UM_NO_UPDATES " + expectedInstalled + " == " + expectedCandidate;
    }
    lastMessage = "\n\t\t\t" + lastMessage + "\n";

    expect(taken() == 1, "one query");
    expect(installed == expectedInstalled, "installed version");
    expect(candidate == expectedCandidate, "candidate version");
    expect(versionsFound == found, "versions found");
    expect(update == differ, "update found");
    expect(log.size() >= lastMessage.size() &&
               log.compare(log.size() - lastMessage.size(), std::string::npos, lastMessage) == 0,
           "last message");
    return 0;
}
