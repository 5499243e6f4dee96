#include "SoundManager.h"

#include "UnitTest.h"

namespace
{

class SoundManagerTest : public UnitTest
{
};

TEST_F(SoundManagerTest, PassSoundIsPlayedWithoutARecord)
{
    SoundManager::play(SoundManager::SOUND_PASS);
    EXPECT_EQ(journal(), (Lines{"system:aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav"}));
}

TEST_F(SoundManagerTest, FailSoundIsPlayedWithoutARecord)
{
    SoundManager::play(SoundManager::SOUND_FAIL);
    EXPECT_EQ(journal(), (Lines{"system:aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav"}));
}

TEST_F(SoundManagerTest, CommandStaysTheSameFromCallToCall)
{
    SoundManager::play(SoundManager::SOUND_PASS);
    SoundManager::play(SoundManager::SOUND_FAIL);
    EXPECT_EQ(entries("system:"), (Lines{"aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav",
                                         "aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav"}));
}

TEST_F(SoundManagerTest, UnknownSoundIsLoggedAndNotPlayed)
{
    SoundManager::play(static_cast<SoundManager::Sound>(7));
    SoundManager::play(static_cast<SoundManager::Sound>(-1));
    EXPECT_EQ(journal(), (Lines{"log:Unknown sound 7", "log:Unknown sound -1"}));
    EXPECT_EQ(platform::records().at(0).function, "static void SoundManager::play(SoundManager::Sound)");
}

TEST_F(SoundManagerTest, FailedPlaybackIsLogged)
{
    for (const int status : {256, 9, -1}) {
        platform::reset();
        script("aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav", {raw(status)});
        SoundManager::play(SoundManager::SOUND_FAIL);
        EXPECT_EQ(journal(),
                  (Lines{"system:aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav", "log:Failed to play a sound"}));
    }
}

} // namespace
