/// The check of the stick's archive against the zip library's own reading. Input: a byte for the readable part of the
/// medium, in 256ths (255: all of it), then the archive.

#include "stick/archive.h"
#include "Input.h"
#include "Printable.h"
#include "descriptor.h"

#include <algorithm>
#include <string>

#include <minizip/unzip.h>
#include <sys/mman.h>

namespace
{

/// True when the zip library reads every entry to its end and finds its checksum right.
bool libraryReadsAll(int descriptor)
{
    unzFile archive = unzOpen64(("/proc/self/fd/" + std::to_string(descriptor)).c_str());
    bool good = archive != nullptr;
    int status = good ? unzGoToFirstFile(archive) : UNZ_OK;
    for (; good && status == UNZ_OK; status = unzGoToNextFile(archive)) {
        char buffer[4096];
        int count = 0;
        good = unzOpenCurrentFile(archive) == UNZ_OK;
        while (good && (count = unzReadCurrentFile(archive, buffer, sizeof buffer)) > 0) {
        }
        good = good && count == 0 && unzCloseCurrentFile(archive) == UNZ_OK;
    }
    if (archive != nullptr) {
        unzClose(archive);
    }
    return good && status == UNZ_END_OF_LIST_OF_FILE;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    if (size < 2) {
        return 0;
    }
    const std::string archive(reinterpret_cast<const char*>(data) + 1, size - 1);
    const std::size_t readable = data[0] == 255 ? archive.size() : archive.size() * data[0] / 256;
    const Descriptor file(memfd_create("archive", MFD_CLOEXEC));
    expect(write(file.number(), archive.data(), readable) == static_cast<ssize_t>(readable), "room for the archive");
    Report report("stick", "An archive");
    checkArchive(file.number(), archive.size(), "\"OSUpgrade.zip\"", report);
    expectPrintable(report);
    if (report.status() == Report::STATUS_FIT) {
        expect(readable == archive.size(), "a damaged medium is not fit");
        expect(libraryReadsAll(file.number()), "what is fit can be unpacked");
    }
    return 0;
}
