#pragma once

#include <sstream>

/// One record of the log, written to standard output when the object goes out of scope.
///
/// A record spans two lines: time, thread, source position and function on the first, the message on the second.
/// It is assembled first and handed over in one flushed write, so that neither another thread's record nor a child
/// process's output can tear it; into a pipe up to 4096 bytes, pipe(7). Numbers are written in the classic locale. A
/// record that cannot be written is lost; later ones are written again.
class LogRecord
{
public:
    /// Begins a record for the statement at `file`:`line` in `function` (the compiler's pretty-function text).
    LogRecord(const char* file, int line, const char* function);
    ~LogRecord();
    LogRecord(const LogRecord&) = delete;
    LogRecord& operator=(const LogRecord&) = delete;

    /// Takes the pieces of the message; none of them leaves the message empty.
    std::ostream& stream() { return mText; }

private:
    std::ostringstream mText;
};

/// Logs the pieces streamed into it, if any, in the name of the enclosing function: `LOG() << "Exit code:" << code;`
///
/// Run a command before the statement that logs its status, never inside it.
#define LOG() LogRecord(__FILE__, __LINE__, __PRETTY_FUNCTION__).stream()
