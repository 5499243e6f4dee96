#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <thread>

/// Drives the LEDs of the front panel through the I2C LED controller at address 0x07 on bus 0.
///
/// Every change is a shell command that sends the controller two bytes with i2cset(8): a LED code and what that LED is
/// to do, or the step time register and a duration. A command that fails is logged and otherwise ignored. Commands of
/// different threads are not serialised.
class LedManager
{
public:
    /// A LED's code, the first byte of a command. Codes without a name are LEDs without a use of their own.
    enum Led : std::int32_t {
        LED_FIRST = 16,
        LED_REMOTE = 18,
        LED_PASS = 19,
        LED_FAIL = 20,
        LED_MAIN = 21,
        LED_LAST = 29,
    };

    /// A colour's code, the low bits of the second byte. Its top two bits select what the controller does with it.
    enum Color : std::int32_t {
        COLOR_OFF = 0,
        COLOR_BLUE = 1,
        COLOR_PASS = 2,
        COLOR_FAIL = 8,
    };

    /// The one panel of the process, created by the first call and never destroyed.
    static LedManager* instance();

    /// @name Steady colours
    /// @{

    /// Lights `led` in `color`.
    static void turnOn(Led led, Color color);

    /// turnOn() with COLOR_OFF.
    static void turnOff(Led led);

    /// Turns off every LED from LED_FIRST to LED_LAST, in this order.
    static void turnOffAll();

    /// Turns on every LED from LED_FIRST to LED_LAST, in this order. Part of the panel's interface for both heads'
    /// programs; the remote head's update only turns them off.
    static void turnOnAll(Color color);

    /// @}
    /// @name Flashing while an update runs
    /// @{

    /// Starts a thread that lights LED_REMOTE and LED_MAIN in blue in turn, a second each.
    ///
    /// Call stopFlashRemoteAndMainInBlue() before starting again: a thread that still flashes is waited for, for good,
    /// and a stop then waits as well.
    void startFlashRemoteAndMainInBlue();

    /// Asks the flashing thread to end. It may still finish its cycle and then turns both LEDs off.
    void stopFlashRemoteAndMainInBlue();

    /// After a stop, waits until the flashing thread has sent its last command; returns at once without a thread.
    void waitForFlashingEnd();

    /// Body of the flashing thread.
    static void flashingThreadFunction();

    /// @}
    /// @name Sequences that the controller plays by itself
    /// Part of the panel's interface for both heads' programs; the remote head's update does without them.
    /// @{

    /// Clears the sequence of `led`.
    static void resetFlashingSequence(Led led);

    /// Appends two steps of `duration` (ms, in units of 20, at most 5119) to the sequence of `led`: `color`, then dark.
    ///
    /// Ends at the first command that fails, which may leave the sequence without its last steps: a longer duration
    /// fails after the colour's step.
    static void setFlashingSequence(Led led, Color color, int duration);

    /// Lets the controller play the sequence of `led`.
    static void startFlashingSequence(Led led);

    /// Ends the sequence of `led`, which goes dark.
    static void stopFlashingSequence(Led led);

    /// @}

private:
    LedManager() = default;

    std::unique_ptr<std::thread> mFlashingThread;

    static std::atomic<bool> mFlashingEnabled;
    static std::mutex mFlashingMutex;
};
