// The media clock, driven by a test clock: audio time, video steps that follow
// the audio clock, the fallback before any audio, and resets.
#include <gtest/gtest.h>

#include "pm/task/media_clock.h"
#include "support/manual_clock.h"

namespace {

constexpr std::int64_t kSecondNs = 1000000000;

constexpr std::uint32_t Rate(std::uint32_t frames, std::uint32_t seconds) { return frames | seconds << 16; }

class MediaClock : public ::testing::Test {
 protected:
  std::shared_ptr<pmtest::ManualClock> t = std::make_shared<pmtest::ManualClock>(5 * kSecondNs);
  pm::MediaClock clock{t};
};

TEST_F(MediaClock, AudioTimeOfOneSecondOfSamples) {
  EXPECT_EQ(clock.AudioTime(48000), 0);
  for (int i = 0; i < 30; ++i) clock.AudioSent(1600);
  EXPECT_EQ(clock.AudioTime(48000), 705600000);
  clock.AudioSent(44100);  // 92,100 samples in all: 2,088,435 whole microseconds at 44.1 kHz
  EXPECT_EQ(clock.AudioTime(44100), 1473599736);
}

// The current time, and audio time without a rate, count ticks of the
// steady clock from the epoch.
TEST_F(MediaClock, CurrentTimeAndAudioTimeWithoutARateFollowTheSteadyClock) {
  EXPECT_EQ(clock.CurrentTime(), 0);
  clock.AudioSent(48000);
  t->Advance(kSecondNs / 2);
  EXPECT_EQ(clock.AudioTime(0), pm::kTicksPerSecond / 2);
  EXPECT_EQ(clock.AudioTime(-1), pm::kTicksPerSecond / 2);
  t->Advance(kSecondNs / 2 + 1);  // 1 ns is 0.7056 ticks: truncated
  EXPECT_EQ(clock.CurrentTime(), pm::kTicksPerSecond);
}

TEST_F(MediaClock, VideoBeforeAnyAudioCountsTenDiscontinuitiesThenFollowsTheClock) {
  for (std::int64_t i = 1; i <= 10; ++i) EXPECT_EQ(clock.NextVideoTime(Rate(30, 1)), std::make_pair(i, true));
  t->Advance(2 * kSecondNs);
  EXPECT_EQ(clock.NextVideoTime(Rate(30, 1)), std::make_pair(2 * pm::kTicksPerSecond, false));
}

TEST_F(MediaClock, VideoAdvancesInExactFrameStepsNearTheAudioClock) {
  // 48 kHz audio in 1601/1602-sample buffers, video at 30000/1001.
  std::int64_t previous = 0;
  for (int frame = 0; frame < 300; ++frame) {
    clock.AudioSent(frame % 5 == 0 ? 1602 : 1601);
    clock.AudioTime(48000);
    const auto next = clock.NextVideoTime(Rate(30000, 1001));
    EXPECT_EQ(next, std::make_pair(frame == 0 ? next.first : previous + 23543520, false)) << frame;
    previous = next.first;
  }
}

// Without a frame rate video takes the audio time without storing it; far
// from the audio clock it jumps there rather than one frame step on; a time
// that would not advance is bumped as a discontinuity.
TEST_F(MediaClock, VideoTakesTheAudioTimeWithoutARateOrFarFromItAndIsBumpedWhenItWouldNotAdvance) {
  clock.AudioSent(4800);
  const std::int64_t audio = clock.AudioTime(48000);
  EXPECT_EQ(clock.NextVideoTime(Rate(0, 1)), std::make_pair(audio, false));
  EXPECT_EQ(clock.NextVideoTime(Rate(30, 0)), std::make_pair(audio, false));
  EXPECT_EQ(clock.NextVideoTime(Rate(30, 1)), std::make_pair(audio, false));  // the first real one
  for (int i = 0; i < 300; ++i) clock.AudioSent(1600);  // ten seconds of audio at once
  const std::int64_t later = clock.AudioTime(48000);
  EXPECT_EQ(clock.NextVideoTime(Rate(30, 1)), std::make_pair(later, false));
  // The audio clock goes back (a shorter count after a rate change): far
  // outside the window and behind the last video time.
  clock.AudioTime(96000);
  EXPECT_EQ(clock.NextVideoTime(Rate(30, 1)), std::make_pair(later + 1, true));
}

TEST_F(MediaClock, ResetStartsTheEpochAgainAndReturnsToTheFallback) {
  clock.AudioSent(48000);
  clock.AudioTime(48000);
  clock.NextVideoTime(Rate(25, 1));
  t->Advance(10 * kSecondNs);
  clock.Reset();
  EXPECT_EQ(clock.CurrentTime(), 0);
  EXPECT_EQ(clock.NextVideoTime(Rate(25, 1)), std::make_pair(std::int64_t{1}, true));
  EXPECT_EQ(clock.AudioTime(48000), 0);
}

}  // namespace
