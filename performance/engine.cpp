/// Compares the engine's runner with plain reads of the same output, and the log with a plain write of the same bytes.
///
/// Both sides of a pair are measured in turn in each repetition; a counter named *_ratio is the plain side's cost
/// divided by the engine's: more is better, 1 means equal.

#include "Log.h"
#include "UpdateManager.h"

#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <stdexcept>
#include <string>
#include <sys/resource.h>
#include <unistd.h>
#include <vector>

namespace
{

const std::size_t mebibyte = 1U << 20U;

/// A file of `size` bytes in lines of `lineLength`, line end included; a length of 0 makes one line without an end. It
/// has no name and so disappears with the process, however that ends.
class TextFile
{
public:
    TextFile(std::size_t size, std::size_t lineLength)
    {
        std::string path = std::filesystem::temp_directory_path() / "harl-benchmark-XXXXXX";
        mFile = mkostemp(path.data(), O_CLOEXEC);
        if (mFile < 0) {
            throw std::runtime_error("no temporary file");
        }
        unlink(path.c_str());
        std::string block(8 * mebibyte / 200 * 200, 'x');
        for (std::size_t end = lineLength; lineLength != 0 && end <= block.size(); end += lineLength) {
            block[end - 1] = '\n';
        }
        for (std::size_t left = size; left > 0;) {
            const ssize_t written = write(mFile, block.data(), std::min(left, block.size()));
            if (written <= 0) {
                close(mFile);
                throw std::runtime_error("no room for a temporary file");
            }
            left -= static_cast<std::size_t>(written);
        }
    }
    ~TextFile() { close(mFile); }
    TextFile(const TextFile&) = delete;
    TextFile& operator=(const TextFile&) = delete;

    /// The command that prints the first `size` bytes.
    std::string command(std::size_t size) const
    {
        return "head -c " + std::to_string(size) + " /proc/" + std::to_string(getpid()) + "/fd/" +
               std::to_string(mFile);
    }

private:
    int mFile;
};

/// Sends standard output to /dev/null as long as the object lives.
class Muted
{
public:
    Muted() : mOutput(dup(STDOUT_FILENO))
    {
        const int null = open("/dev/null", O_WRONLY);
        dup2(null, STDOUT_FILENO);
        close(null);
    }
    ~Muted()
    {
        dup2(mOutput, STDOUT_FILENO);
        close(mOutput);
    }
    Muted(const Muted&) = delete;
    Muted& operator=(const Muted&) = delete;

private:
    const int mOutput;
};

struct Cost
{
    double wall = 0;   // s
    double cpu = 0;    // s, of this process and its children
    double memory = 0; // bytes, at the highest, on top of what was there before
};

/// The value of `key` (with its colon) in one of this process's files under /proc.
double fromProc(const char* path, const std::string& key)
{
    std::ifstream file(path);
    for (std::string word; file >> word;) {
        if (word == key) {
            double value = 0;
            file >> value;
            return value;
        }
    }
    throw std::runtime_error(std::string("nothing about ") + key + " in " + path);
}

double cpuTime()
{
    double sum = 0;
    for (const int who : {RUSAGE_SELF, RUSAGE_CHILDREN}) {
        rusage used = {};
        getrusage(who, &used);
        for (const timeval& time : {used.ru_utime, used.ru_stime}) {
            sum += static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
        }
    }
    return sum;
}

template <typename Function>
Cost costOf(Function function)
{
    std::ofstream("/proc/self/clear_refs") << 5; // resets the peak, proc(5)
    const double memory = fromProc("/proc/self/status", "VmRSS:");
    const double cpu = cpuTime();
    const auto begin = std::chrono::steady_clock::now();
    function();
    const std::chrono::duration<double> wall = std::chrono::steady_clock::now() - begin;
    return {wall.count(), cpuTime() - cpu, (fromProc("/proc/self/status", "VmHWM:") - memory) * 1024};
}

/// The plain alternative to the runner where only the output counts: 64 KiB reads into a string.
void readInBlocks(const std::string& command, std::string& output)
{
    static char block[64 * 1024];
    FILE* pipe = popen(command.c_str(), "r");
    ssize_t length = 0;
    while ((length = read(fileno(pipe), block, sizeof block)) > 0) {
        output.append(block, static_cast<std::size_t>(length));
    }
    pclose(pipe);
}

void setRatios(benchmark::State& state, const Cost& plain, const Cost& engine)
{
    state.counters["wall_ratio"] = plain.wall / engine.wall;
    state.counters["cpu_ratio"] = plain.cpu / engine.cpu;
}

void RunProcess(benchmark::State& state, std::size_t lineLength)
{
    const std::size_t size = 1024 * mebibyte;
    const TextFile text(size, lineLength);
    const std::string command = text.command(size);
    const Muted muted;
    bool engineFirst = false; // whichever comes first has no advantage
    for (auto _ : state) {
        Cost engine;
        Cost plain;
        for (const bool isEngine : {engineFirst, !engineFirst}) {
            std::string output;
            if (isEngine) {
                engine = costOf([&] { UpdateManager::runProcess(command, output); });
            } else {
                plain = costOf([&] { readInBlocks(command, output); });
            }
            if (output.size() != size) {
                throw std::runtime_error("the output is not whole");
            }
        }
        state.SetIterationTime(engine.wall);
        setRatios(state, plain, engine);
        state.counters["bytes_per_s"] = static_cast<double>(size) / engine.wall;
        state.counters["memory_per_text"] = engine.memory / static_cast<double>(size);
        engineFirst = !engineFirst;
    }
}

double lowest(const std::vector<double>& values)
{
    return *std::min_element(values.begin(), values.end());
}

double highest(const std::vector<double>& values)
{
    return *std::max_element(values.begin(), values.end());
}

void pairs(benchmark::internal::Benchmark* benchmark)
{
    benchmark->Repetitions(5)->ComputeStatistics("min", lowest)->ComputeStatistics("max", highest);
    benchmark->UseManualTime()->DisplayAggregatesOnly();
}

BENCHMARK_CAPTURE(RunProcess, LinesOf200, 200)->Apply(pairs)->Iterations(1)->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(RunProcess, LinesOf8, 8)->Apply(pairs)->Iterations(1)->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(RunProcess, OneLine, 0)->Apply(pairs)->Iterations(1)->Unit(benchmark::kMillisecond);

/// One record with a message of that length (bytes): the CPU time.
void LogOneRecord(benchmark::State& state)
{
    const int records = 10000;
    const std::string message(static_cast<std::size_t>(state.range(0)), 'm');
    const std::string line(message.size() + 90, 'r'); // what precedes a message takes about that much
    const Muted muted;
    for (auto _ : state) {
        const double before = fromProc("/proc/self/io", "syscw:");
        const Cost engine = costOf([&] {
            for (int i = 0; i < records; ++i) {
                LOG() << message;
            }
        });
        // One more write: the reset of the peak.
        const double writes = fromProc("/proc/self/io", "syscw:") - before - 1;
        const Cost plain = costOf([&] {
            for (int i = 0; i < records; ++i) {
                benchmark::DoNotOptimize(write(STDOUT_FILENO, line.data(), line.size()));
            }
        });
        state.SetIterationTime(engine.cpu / records);
        state.counters["writes_per_record"] = writes / records;
        state.counters["write_alone_ns"] = plain.cpu / records * 1e9;
    }
}
BENCHMARK(LogOneRecord)->Apply(pairs)->Arg(12)->Arg(1000)->Arg(10000)->Iterations(1)->Unit(benchmark::kNanosecond);

/// Growth with the size of the output (bytes): the fit is the time for each byte.
void RunProcessBySize(benchmark::State& state)
{
    const TextFile text(static_cast<std::size_t>(state.range(0)), 200);
    const Muted muted;
    for (auto _ : state) {
        std::string output;
        UpdateManager::runProcess(text.command(static_cast<std::size_t>(state.range(0))), output);
    }
    state.SetComplexityN(state.range(0));
}
BENCHMARK(RunProcessBySize)->RangeMultiplier(4)->Range(4 << 20, 1 << 30)->UseRealTime()->Complexity(benchmark::oN);

/// The same for the package check, which logs every line.
void CheckUpdateBySize(benchmark::State& state)
{
    const TextFile text(static_cast<std::size_t>(state.range(0)), 50);
    const Muted muted;
    for (auto _ : state) {
        std::string installed;
        std::string candidate;
        bool found = false;
        UpdateManager::checkUpdate(true, text.command(static_cast<std::size_t>(state.range(0))), installed, candidate,
                                   found);
    }
    state.SetComplexityN(state.range(0));
}
BENCHMARK(CheckUpdateBySize)->RangeMultiplier(4)->Range(1 << 18, 1 << 26)->UseRealTime()->Complexity(benchmark::oN);

} // namespace
