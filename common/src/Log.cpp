#include "Log.h"

#include <cstdio>
#include <cstring>
#include <ctime>
#include <iomanip>
#include <iostream>
#include <locale>
#include <string>
#include <thread>

namespace
{

// std::cout writes through stdout: without a buffer there, even a long record leaves in one write(2).
[[maybe_unused]] const int unbuffered = std::setvbuf(stdout, nullptr, _IONBF, 0);

const char* baseName(const char* path)
{
    const char* slash = std::strrchr(path, '/');
    return slash == nullptr ? path : slash + 1;
}

} // namespace

LogRecord::LogRecord(const char* file, int line, const char* function)
{
    const std::time_t now = std::time(nullptr);
    std::tm local = {};
    localtime_r(&now, &local);
    mText.imbue(std::locale::classic()); // a program's global locale may group the digits of numbers
    mText << "Updater | " << std::put_time(&local, "%d-%m-%Y %H-%M-%S") << '\t' << std::this_thread::get_id() << '\t'
          << baseName(file) << ':' << line << '\t' << function << "\n\t\t\t";
}

LogRecord::~LogRecord()
{
    mText << '\n';
    const std::string text = mText.str();
    // A stream of its own on std::cout's buffer: std::cout would keep the error of one failed write, and drop every
    // later record.
    std::ostream(std::cout.rdbuf()).write(text.data(), static_cast<std::streamsize>(text.size())).flush();
}
