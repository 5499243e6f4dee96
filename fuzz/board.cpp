/// The board check against an oracle. Input: a digit for the status of reading the version and one for that of listing
/// the stick, then the two outputs with the byte 0x1E between them.

#include "Input.h"
#include "UpdateManager.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    const std::vector<Answer> answers = answersOf(data, size, 2);
    give(answers);
    std::string installed = "before";
    std::string candidate = "before";
    bool versionsFound = true;
    const bool update = UpdateManager::checkQuorbUpdate(installed, candidate, versionsFound);
    takeLog();

    std::string expectedInstalled;
    std::string expectedCandidate;
    const bool boardRead = codeOf(answers[0].status) == 0;
    const bool stickRead = boardRead && codeOf(answers[1].status) == 0;
    if (boardRead) {
        expectedInstalled = lastBehind(linesRead(answers[0].output), "Brimvale\t");
        expectedInstalled = expectedInstalled.substr(0, expectedInstalled.find('\r'));
    }
    if (stickRead) {
        const std::string listing = asRead(answers[1].output);
        const std::string entry = listing.substr(0, listing.find('\n'));
        expectedCandidate = entry.size() > 5 ? entry.substr(5) : "";
    }
    const bool found = !expectedInstalled.empty() && !expectedCandidate.empty();

    expect(taken() == (boardRead ? 2U : 1U), "no listing without a board");
    expect(installed == expectedInstalled, "installed version");
    expect(candidate == expectedCandidate, "candidate version");
    expect(versionsFound == found, "versions found");
    expect(update == (found && expectedInstalled != expectedCandidate), "update found");
    return 0;
}
