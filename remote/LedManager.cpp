#include "LedManager.h"

#include "Log.h"
#include "Sleep.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <string>

std::atomic<bool> LedManager::mFlashingEnabled{false};
std::mutex LedManager::mFlashingMutex;

namespace
{

__attribute__((format(printf, 1, 2))) std::string formatCommand(const char* format, ...)
{
    char buffer[200] = {};
    va_list arguments;
    va_start(arguments, format);
    std::vsnprintf(buffer, sizeof buffer, format, arguments); // NOLINT(clang-analyzer-valist.Uninitialized): false
    va_end(arguments);
    return buffer;
}

} // namespace

LedManager* LedManager::instance()
{
    static LedManager* mInstance = new LedManager;
    return mInstance;
}

// Steady colours

void LedManager::turnOn(Led led, Color color)
{
    const std::string command = formatCommand("i2cset -y 0 0x07 0x%02x c ; i2cset -y 0 0x07 0x%01x c", led, color);
    if (std::system(command.c_str()) != 0) {
        LOG() << "system returned false: " << command;
    }
}

void LedManager::turnOff(Led led)
{
    turnOn(led, COLOR_OFF);
}

void LedManager::turnOffAll()
{
    turnOnAll(COLOR_OFF);
}

void LedManager::turnOnAll(Color color)
{
    for (std::int32_t led = LED_FIRST; led <= LED_LAST; ++led) {
        turnOn(static_cast<Led>(led), color);
    }
}

// Flashing while an update runs

void LedManager::startFlashRemoteAndMainInBlue()
{
    const std::lock_guard<std::mutex> lock(mFlashingMutex);
    mFlashingEnabled = true; // before the old thread is waited for
    if (mFlashingThread && mFlashingThread->joinable()) {
        mFlashingThread->join();
    }
    mFlashingThread = std::make_unique<std::thread>(flashingThreadFunction);
}

void LedManager::stopFlashRemoteAndMainInBlue()
{
    const std::lock_guard<std::mutex> lock(mFlashingMutex);
    mFlashingEnabled = false;
}

void LedManager::waitForFlashingEnd()
{
    const std::lock_guard<std::mutex> lock(mFlashingMutex);
    if (mFlashingThread && mFlashingThread->joinable()) {
        mFlashingThread->join();
    }
}

void LedManager::flashingThreadFunction()
{
    instance();                       // the panel exists from here on, also where this body is called directly
    bool flashing = mFlashingEnabled; // false when a stop came before this thread's first look
    bool remotePhase = true;
    while (flashing) {
        turnOffAll();
        turnOn(remotePhase ? LED_REMOTE : LED_MAIN, COLOR_BLUE);
        turnOff(remotePhase ? LED_MAIN : LED_REMOTE);
        remotePhase = !remotePhase;
        sleepSeconds(1);
        flashing = mFlashingEnabled;
    }
    turnOff(LED_MAIN);
    turnOff(LED_REMOTE);
}

// Sequences that the controller plays by itself

void LedManager::resetFlashingSequence(Led led)
{
    const std::string command = formatCommand("i2cset -y 0 0x07 0x%02x c ; i2cset -y 0 0x07 0x80 c", led);
    if (std::system(command.c_str()) != 0) {
        LOG() << "system returned false: " << command;
    }
}

void LedManager::setFlashingSequence(Led led, Color color, int duration)
{
    const int stepLength = duration / 20; // the controller counts in units of 20 ms
    const std::string colorStep =
        formatCommand("i2cset -y 0 0x07 0x%02x c ; i2cset -y 0 0x07 0x%02x c", led, color | 0xC0);
    const std::string stepDuration = formatCommand("i2cset -y 0 0x07 0x1f c ; i2cset -y 0 0x07 0x%02x c", stepLength);
    const std::string darkStep = formatCommand("i2cset -y 0 0x07 0x%02x c ; i2cset -y 0 0x07 0xC0 c", led);

    for (const std::string& command : {colorStep, stepDuration, darkStep, stepDuration}) {
        if (std::system(command.c_str()) != 0) {
            LOG() << "system returned false: " << command;
            return;
        }
    }
}

void LedManager::startFlashingSequence(Led led)
{
    const std::string command = formatCommand("i2cset -y 0 0x07 0x%02x c ; i2cset -y 0 0x07 0x40 c", led);
    if (std::system(command.c_str()) != 0) {
        LOG() << "system returned false: " << command;
    }
}

void LedManager::stopFlashingSequence(Led led)
{
    const std::string command = formatCommand("i2cset -y 0 0x07 0x%02x c ; i2cset -y 0 0x07 0x0 c", led);
    if (std::system(command.c_str()) != 0) {
        LOG() << "system returned false: " << command;
    }
}
