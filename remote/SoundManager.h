#pragma once

#include <cstdint>

/// Plays the sound that tells the operator the outcome of an update.
class SoundManager
{
public:
    enum Sound : std::int32_t {
        SOUND_PASS = 0,
        SOUND_FAIL = 1,
    };

    /// Plays `sound` and returns when it has ended. A failure, or a value without a sound, is only logged.
    static void play(Sound sound);
};
