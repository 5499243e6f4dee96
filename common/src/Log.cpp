#include "Log.h"

#include <cstring>
#include <ctime>
#include <iomanip>
#include <iostream>
#include <thread>

namespace
{

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
    mText << "Updater | " << std::put_time(&local, "%d-%m-%Y %H-%M-%S") << '\t' << std::this_thread::get_id() << '\t'
          << baseName(file) << ':' << line << '\t' << function << "\n\t\t\t";
}

LogRecord::~LogRecord()
{
    mText << '\n';
    std::cout << mText.str() << std::flush;
}
