/// The TeamViewer check against an oracle. Input: a digit for the status of the marker's listing, then its output.

#include "Input.h"
#include "UpdateManager.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    const std::string marker = "/root/USB_MOUNT/debs/installTV";
    const std::vector<Answer> answers = answersOf(data, size, 1);
    give(answers);
    bool ok = false;
    const bool required = UpdateManager::checkTVUpdate(ok);
    takeLog();

    const int code = codeOf(answers[0].status);
    const std::string text = asRead(answers[0].output);
    const bool named = text == marker || text.compare(0, marker.size() + 1, marker + "\n") == 0;

    expect(taken() == 1, "one listing");
    expect(ok == (code == 0 || code == 2), "answer to be trusted");
    expect(required == (code == 0 && named), "installation required");
    return 0;
}
