#include "Platform.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <ctime>
#include <iostream>
#include <map>
#include <mutex>
#include <streambuf>

namespace platform
{
namespace
{

struct Entry
{
    std::thread::id thread;
    std::string text;
};

struct Script
{
    std::vector<Answer> answers;
    std::size_t next = 0;
};

/// The buffer of std::cout. Keeps each piece that is written at once as one text.
class LogBuffer : public std::streambuf
{
public:
    struct Text
    {
        std::string text;
        bool flushed;
    };

    std::vector<Text> mTexts;

protected:
    std::streamsize xsputn(const char* text, std::streamsize size) override;
    int_type overflow(int_type character) override;
    int sync() override;
};

std::mutex mutex;
std::atomic<const void*> lastCommandText{nullptr};
std::vector<Entry> entryList;
std::map<std::string, Script> scripts;
std::map<FILE*, int> pipes;
std::function<int(const timespec*, timespec*)> sleepScript;
std::function<void()> recordHook;
LogBuffer& logBuffer = *new LogBuffer; // lives on: std::cout is flushed once more at exit

std::string messageOf(const std::string& text)
{
    const std::optional<Record> record = parseRecord(text);
    return record ? record->message : "not a record: " + text;
}

void enter(const std::string& text)
{
    const std::lock_guard<std::mutex> lock(mutex);
    entryList.push_back({std::this_thread::get_id(), text});
}

std::streamsize LogBuffer::xsputn(const char* text, std::streamsize size)
{
    const std::string record(text, static_cast<std::size_t>(size));
    enter("log:" + messageOf(record));
    std::function<void()> hook;
    {
        const std::lock_guard<std::mutex> lock(mutex);
        mTexts.push_back({record, false});
        hook = recordHook;
    }
    if (hook) {
        hook();
    }
    return size;
}

LogBuffer::int_type LogBuffer::overflow(int_type character)
{
    const char text = traits_type::to_char_type(character);
    xsputn(&text, 1);
    return character;
}

int LogBuffer::sync()
{
    const std::lock_guard<std::mutex> lock(mutex);
    for (Text& text : mTexts) {
        text.flushed = true;
    }
    return 0;
}

Answer answerOf(const std::string& command)
{
    Answer answer;
    {
        const std::lock_guard<std::mutex> lock(mutex);
        const auto found = scripts.find(command);
        if (found != scripts.end()) {
            Script& script = found->second;
            answer = script.answers[std::min(script.next, script.answers.size() - 1)];
            ++script.next;
        }
    }
    if (answer.before) {
        answer.before();
    }
    return answer;
}

} // namespace

Answer exits(int code, const std::string& output)
{
    return {code * 256, output, true, {}};
}

void reset()
{
    const std::lock_guard<std::mutex> lock(mutex);
    entryList.clear();
    scripts.clear();
    sleepScript = {};
    recordHook = {};
    logBuffer.mTexts.clear();
    std::cout.clear();
    std::cout.rdbuf(&logBuffer);
}

void script(const std::string& command, const std::vector<Answer>& answers)
{
    const std::lock_guard<std::mutex> lock(mutex);
    scripts[command] = {answers, 0};
}

void scriptSleep(const std::function<int(const timespec*, timespec*)>& pause)
{
    const std::lock_guard<std::mutex> lock(mutex);
    sleepScript = pause;
}

void afterRecord(const std::function<void()>& hook)
{
    const std::lock_guard<std::mutex> lock(mutex);
    recordHook = hook;
}

void note(const std::string& text)
{
    enter(text);
}

Lines journal()
{
    const std::lock_guard<std::mutex> lock(mutex);
    Lines lines;
    for (const Entry& entry : entryList) {
        lines.push_back(entry.text);
    }
    return lines;
}

Lines journal(std::thread::id thread)
{
    const std::lock_guard<std::mutex> lock(mutex);
    Lines lines;
    for (const Entry& entry : entryList) {
        if (entry.thread == thread) {
            lines.push_back(entry.text);
        }
    }
    return lines;
}

Lines entries(const std::string& prefix)
{
    Lines lines;
    for (const std::string& line : journal()) {
        if (line.compare(0, prefix.size(), prefix) == 0) {
            lines.push_back(line.substr(prefix.size()));
        }
    }
    return lines;
}

std::vector<Record> records()
{
    const std::lock_guard<std::mutex> lock(mutex);
    std::vector<Record> result;
    for (const LogBuffer::Text& text : logBuffer.mTexts) {
        std::optional<Record> record = parseRecord(text.text);
        if (!record) {
            ADD_FAILURE() << "not one well-formed record: " << text.text;
            continue;
        }
        record->flushed = text.flushed;
        result.push_back(*std::move(record));
    }
    return result;
}

const void* lastCommand()
{
    return lastCommandText;
}

void waitFor(const std::function<bool()>& condition)
{
    for (int i = 0; i < 10000; ++i) {
        if (condition()) {
            return;
        }
        delay(1);
    }
    FAIL() << "waited in vain";
}

void delay(int milliseconds)
{
    timespec remaining = {milliseconds / 1000, (milliseconds % 1000) * 1000000L};
    while (clock_nanosleep(CLOCK_MONOTONIC, 0, &remaining, &remaining) == EINTR) {
    }
}

} // namespace platform

extern "C" {

int system(const char* command)
{
    platform::lastCommandText = command;
    platform::enter(std::string("system:") + command);
    return platform::answerOf(command).status;
}

FILE* popen(const char* command, const char* mode)
{
    EXPECT_STREQ(mode, "r");
    platform::lastCommandText = command;
    platform::enter(std::string("popen:") + command);
    const platform::Answer answer = platform::answerOf(command);
    if (!answer.starts) {
        return nullptr;
    }
    FILE* pipe = std::tmpfile();
    std::fwrite(answer.output.data(), 1, answer.output.size(), pipe);
    std::rewind(pipe);
    const std::lock_guard<std::mutex> lock(platform::mutex);
    platform::pipes[pipe] = answer.status;
    return pipe;
}

int pclose(FILE* pipe)
{
    const std::lock_guard<std::mutex> lock(platform::mutex);
    const int status = platform::pipes.at(pipe);
    platform::pipes.erase(pipe);
    std::fclose(pipe);
    return status;
}

int nanosleep(const timespec* duration, timespec* remaining)
{
    std::string text = "sleep:" + std::to_string(duration->tv_sec);
    if (duration->tv_nsec != 0) {
        text += "." + std::to_string(duration->tv_nsec);
    }
    platform::enter(text);
    std::function<int(const timespec*, timespec*)> pause;
    {
        const std::lock_guard<std::mutex> lock(platform::mutex);
        pause = platform::sleepScript;
    }
    if (pause) {
        return pause(duration, remaining);
    }
    platform::delay(10);
    return 0;
}

} // extern "C"
