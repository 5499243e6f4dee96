#include "Calls.h"

#include "Scheduler.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <dlfcn.h>
#include <map>
#include <pthread.h>

namespace
{

Observer observer;
std::map<const pthread_mutex_t*, int> owners; // those that are locked
std::map<const pthread_cond_t*, std::vector<int>> waiting;
std::vector<int> woken;
std::map<FILE*, int> pipes;

/// The function that this program has replaced.
template <typename Function>
Function* replaced(const char* name)
{
    return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, name));
}

// A thread's id is its number plus one: 0 means no thread.
pthread_t idOf(int thread)
{
    return static_cast<pthread_t>(thread) + 1;
}

void take(Scheduler* scheduler, const pthread_mutex_t* mutex)
{
    scheduler->block([mutex] { return owners.count(mutex) == 0; });
    owners[mutex] = scheduler->current();
}

/// A command that sends two bytes, "i2cset -y 0 0x07 BYTE c ; i2cset -y 0 0x07 BYTE c", runs in two halves.
int sendBytes(Scheduler* scheduler, const std::string& command)
{
    const std::string address = "0x07 ";
    for (std::size_t found = command.find(address); found != std::string::npos; found = command.find(address, found)) {
        found += address.size();
        scheduler->point();
        observer.byte(scheduler->current(), std::stoi(command.substr(found), nullptr, 16));
    }
    return 0;
}

} // namespace

void observe(const Observer& next)
{
    observer = next;
    owners.clear();
    waiting.clear();
    woken.clear();
}

extern "C" {

int pthread_create(pthread_t* id, const pthread_attr_t* attributes, void* (*body)(void*), void* argument)
{
    Scheduler* scheduler = Scheduler::active();
    if (scheduler == nullptr) {
        return replaced<decltype(pthread_create)>("pthread_create")(id, attributes, body, argument);
    }
    scheduler->point();
    const int thread = scheduler->create([body, argument] { body(argument); });
    *id = idOf(thread);
    observer.created(thread);
    return 0;
}

int pthread_join(pthread_t id, void** result)
{
    Scheduler* scheduler = Scheduler::active();
    if (scheduler == nullptr) { // one that a schedule left, or a real one
        return id < 1000 ? 0 : replaced<decltype(pthread_join)>("pthread_join")(id, result);
    }
    scheduler->point();
    scheduler->block([scheduler, id] { return scheduler->hasEnded(static_cast<int>(id) - 1); });
    return 0;
}

int pthread_detach(pthread_t id)
{
    Scheduler* scheduler = Scheduler::active();
    if (scheduler == nullptr) {
        return replaced<decltype(pthread_detach)>("pthread_detach")(id);
    }
    scheduler->point();
    return 0;
}

int pthread_mutex_lock(pthread_mutex_t* mutex)
{
    Scheduler* scheduler = Scheduler::active();
    if (scheduler == nullptr) {
        static auto* const lock = replaced<decltype(pthread_mutex_lock)>("pthread_mutex_lock");
        return lock(mutex);
    }
    scheduler->point();
    take(scheduler, mutex);
    observer.locked(scheduler->current());
    scheduler->point();
    return 0;
}

int pthread_mutex_unlock(pthread_mutex_t* mutex)
{
    Scheduler* scheduler = Scheduler::active();
    if (scheduler == nullptr) {
        static auto* const unlock = replaced<decltype(pthread_mutex_unlock)>("pthread_mutex_unlock");
        return unlock(mutex);
    }
    scheduler->point();
    owners.erase(mutex);
    return 0;
}

int pthread_cond_wait(pthread_cond_t* condition, pthread_mutex_t* mutex)
{
    Scheduler* scheduler = Scheduler::active();
    if (scheduler == nullptr) {
        return replaced<decltype(pthread_cond_wait)>("pthread_cond_wait")(condition, mutex);
    }
    scheduler->point();
    const int self = scheduler->current();
    waiting[condition].push_back(self);
    owners.erase(mutex);
    scheduler->block([self] { return std::count(woken.begin(), woken.end(), self) != 0; });
    woken.erase(std::find(woken.begin(), woken.end(), self));
    take(scheduler, mutex);
    return 0;
}

int pthread_cond_signal(pthread_cond_t* condition)
{
    Scheduler* scheduler = Scheduler::active();
    if (scheduler == nullptr) {
        return replaced<decltype(pthread_cond_signal)>("pthread_cond_signal")(condition);
    }
    scheduler->point();
    std::vector<int>& threads = waiting[condition];
    const int self = scheduler->current();
    const bool underLock =
        std::any_of(owners.begin(), owners.end(), [self](const auto& owner) { return owner.second == self; });
    observer.notified(!threads.empty(), underLock);
    if (!threads.empty()) {
        woken.push_back(threads.front());
        threads.erase(threads.begin());
    }
    return 0;
}

int pthread_cond_broadcast(pthread_cond_t* condition)
{
    return pthread_cond_signal(condition); // never more than one thread waits
}

int system(const char* command)
{
    Scheduler* scheduler = Scheduler::active();
    if (std::string(command).compare(0, 7, "i2cset ") == 0) {
        return sendBytes(scheduler, command);
    }
    scheduler->point();
    std::string output;
    return observer.command(scheduler->current(), command, output);
}

FILE* popen(const char* command, const char*)
{
    Scheduler* scheduler = Scheduler::active();
    scheduler->point();
    std::string output;
    const int status = observer.command(scheduler->current(), command, output);
    FILE* pipe = fmemopen(nullptr, output.size() + 1, "w+");
    std::fwrite(output.data(), 1, output.size(), pipe);
    std::rewind(pipe);
    pipes[pipe] = status;
    return pipe;
}

int pclose(FILE* pipe)
{
    Scheduler::active()->point();
    const int status = pipes.at(pipe);
    pipes.erase(pipe);
    std::fclose(pipe);
    return status;
}

int nanosleep(const timespec*, timespec*)
{
    Scheduler* scheduler = Scheduler::active();
    scheduler->point();
    observer.pause(scheduler->current());
    scheduler->sleep();
    return 0;
}

} // extern "C"
