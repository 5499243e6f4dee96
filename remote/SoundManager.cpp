#include "SoundManager.h"

#include "Log.h"

#include <cstdlib>
#include <string>

void SoundManager::play(Sound sound)
{
    static const std::string command = "aplay ";
    std::string path;

    switch (sound) {
    case SOUND_PASS:
        path = "/root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav";
        break;
    case SOUND_FAIL:
        path = "/root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav";
        break;
    default:
        LOG() << "Unknown sound " << sound;
        return;
    }
    if (std::system((command + path).c_str()) != 0) {
        LOG() << "Failed to play a sound";
    }
}
