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
    SoundManager::play(static_cast<SoundManager::Sound>(2));
    SoundManager::play(static_cast<SoundManager::Sound>(-1));
    EXPECT_EQ(journal(), (Lines{"log:Unknown sound 2", "log:Unknown sound -1"}));
}

using PlaybackStatus = With<SoundManagerTest>;
INSTANTIATE_TEST_SUITE_P(Statuses, PlaybackStatus, testing::ValuesIn(failedStatuses), nameOf<Named<int>>);

TEST_P(PlaybackStatus, IsAFailureThatIsLogged)
{
    script("aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav", {raw(value())});
    SoundManager::play(SoundManager::SOUND_FAIL);
    EXPECT_EQ(journal(),
              (Lines{"system:aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav", "log:Failed to play a sound"}));
}

} // namespace
