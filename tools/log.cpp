#include "log.h"

#include "descriptor.h"
#include "findings.h"
#include "log_explain.h"
#include "log_parser.h"
#include "log_report.h"
#include "log_run.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <ostream>
#include <unistd.h>
#include <vector>

namespace
{

const std::size_t blockSize = 256 * 1024; // bytes

/// What a file that holds no text begins with, and what to do about it.
struct Magic
{
    std::string_view bytes;
    const char* advice;
};

const Magic magics[] = {
    {"LPKSHHRH", "a journal's own file: journalctl --file FILE -u harl-updater | harl-updater-tool log"},
    {"\x1f\x8b", "compressed: zcat FILE | harl-updater-tool log"},
    {"\xfd"
     "7zXZ",
     "compressed: xzcat FILE | harl-updater-tool log"},
    {"\x28\xb5\x2f\xfd", "compressed: zstdcat FILE | harl-updater-tool log"},
    {"PK\x03\x04", "an archive: unpack it first"},
    {"\xff\xfe", "text in UTF-16: save it as UTF-8 first"},
    {"\xfe\xff", "text in UTF-16: save it as UTF-8 first"},
};

/// What to do about an input that begins like this, or null when it may be a log.
const char* adviceFor(std::string_view start)
{
    for (const Magic& magic : magics) {
        if (start.substr(0, magic.bytes.size()) == magic.bytes) {
            return magic.advice;
        }
    }
    return nullptr;
}

} // namespace

int runLog(const LogOptions& options, std::ostream& out, std::ostream& err)
{
    const bool standardInput = options.file == "-";
    const std::string source = standardInput ? "standard input" : escaped(options.file);
    const auto refuse = [&](const std::string& why) {
        err << "harl-updater-tool: " << source << ": " << why << '\n';
        return LOG_UNREADABLE;
    };

    const Descriptor file(standardInput ? dup(STDIN_FILENO) : open(options.file.c_str(), O_RDONLY | O_CLOEXEC));
    if (!file) {
        return refuse(std::strerror(errno));
    }

    LogStatus status = LOG_UNREADABLE;
    RunBuilder builder([&](Run& run) {
        explain(run);
        out << (run.number > 1 ? "\n" : "");
        printRun(run, source, out);
        status = wentWell(run) ? LOG_WENT_WELL : LOG_WENT_WRONG;
    });
    LogParser parser(builder);
    std::vector<char> block(blockSize);
    int readError = 0;
    while (true) {
        const ssize_t length = read(file.number(), block.data(), block.size());
        if (length < 0 && errno == EINTR) {
            continue;
        }
        if (length <= 0) {
            readError = length < 0 ? errno : 0;
            break;
        }
        const std::string_view text(block.data(), static_cast<std::size_t>(length));
        if (const char* advice = parser.bytes() == 0 ? adviceFor(text) : nullptr; advice != nullptr) {
            return refuse(std::string("byte 0: no text but ") + advice);
        }
        parser.feed(text);
    }
    parser.finish();
    builder.finish();
    if (readError != 0) {
        return refuse("byte " + std::to_string(parser.bytes()) + ", line " + std::to_string(parser.lines() + 1) + ": " +
                      std::strerror(readError));
    }
    if (parser.records() == 0) {
        return refuse("no record of the updater in " + counted(parser.lines(), "line") + ", " +
                      byteCount(parser.bytes()) + ". A record begins with \"Updater | DD-MM-YYYY HH-MM-SS\".");
    }
    return status;
}
