#include "bench/soak/soak_core.h"

#include <gtest/gtest.h>

#include <vector>

namespace soak {
namespace {

// The sender's sound at 30 fps: 1600 samples a buffer.
constexpr std::int64_t kBuffer = 1600;
std::int64_t Residue(std::int64_t sample) { return sample % kRampPeriod; }

TEST(SoakLineFit, SlopeStaysExactOverHoursOfPointsFarFromZero) {
  LineFit fit;
  // Two hours of 60 fps points around a large offset, with +-1 ms jitter.
  for (int i = 0; i < 432'000; ++i) {
    const double hours = 1000.0 + i / 216'000.0;
    fit.Add(hours, 5.0 + 0.25 * (hours - 1000.0) + (i % 2 == 0 ? 1.0 : -1.0));
  }
  EXPECT_NEAR(fit.Slope(), 0.25, 1e-4);
  EXPECT_NEAR(fit.At(1001.0), 5.25, 1e-3);
}

TEST(SoakLineFit, NoSlopeFromOnePointOrOneX) {
  LineFit one;
  one.Add(3, 7);
  EXPECT_EQ(one.Slope(), 0.0);
  EXPECT_EQ(one.At(10), 7.0);
  LineFit sameX;
  sameX.Add(2, 1);
  sameX.Add(2, 5);
  EXPECT_EQ(sameX.Slope(), 0.0);
}

TEST(SoakFrameNumbers, GapsCountTheSkippedNumbersAndRepeatsLoseNothing) {
  FrameNumbers f;
  for (std::int64_t n : {500, 501, 502, 505, 506, 504, 506, 510}) f.Add(n);
  EXPECT_EQ(f.first, 500);
  EXPECT_EQ(f.last, 510);
  EXPECT_EQ(f.gaps, 2);   // 503..504 and 507..509
  EXPECT_EQ(f.lost, 5);   // 503, 504, 507, 508, 509 (504 came late: a repeat)
  EXPECT_EQ(f.repeats, 2);
  EXPECT_EQ(f.received, 6);
}

// Feeds buffers of the sender's sound starting at `starts`, each with an
// estimate that is `estimateError` samples off where the buffer really is
// (on the unwrapped scale of the first buffer).
SoundPositions Feed(const std::vector<std::int64_t>& starts, std::int64_t estimateError = 0) {
  SoundPositions p;
  const std::int64_t base = starts.front() - Residue(starts.front());
  for (std::int64_t s : starts) {
    const std::int64_t at = p.Add(Residue(s), kBuffer, static_cast<double>(s - base + estimateError));
    EXPECT_EQ(at, s - base) << "buffer at " << s;
  }
  return p;
}

TEST(SoakSoundPositions, ContinuousSoundAcrossManyWrapsHasNoGap) {
  std::vector<std::int64_t> starts;
  for (std::int64_t m = 40; m < 4000; ++m) starts.push_back(m * kBuffer);
  const SoundPositions p = Feed(starts);
  EXPECT_EQ(p.gaps, 0);
  EXPECT_EQ(p.lostSamples, 0);
  EXPECT_EQ(p.samples, 3960 * kBuffer);
}

TEST(SoakSoundPositions, OneLostBufferIsOneGapOfItsSamples) {
  const SoundPositions p = Feed({10 * kBuffer, 11 * kBuffer, 13 * kBuffer, 14 * kBuffer});
  EXPECT_EQ(p.gaps, 1);
  EXPECT_EQ(p.lostSamples, kBuffer);
}

TEST(SoakSoundPositions, AGapLongerThanTheRampTakesWholePeriodsFromTheClock) {
  // 7 buffers lost: 11200 samples, ten periods and more.
  const SoundPositions p = Feed({10 * kBuffer, 11 * kBuffer, 19 * kBuffer}, 300);
  EXPECT_EQ(p.gaps, 1);
  EXPECT_EQ(p.lostSamples, 7 * kBuffer);
}

TEST(SoakSoundPositions, ALateClockNeverMakesContinuousSoundAGap) {
  // A sender that stalled stamps the next buffer late: the clock puts it
  // 300 ms (14400 samples) on, the ramp says it continues.
  SoundPositions p;
  p.Add(Residue(0), kBuffer, 0);
  EXPECT_EQ(p.Add(Residue(kBuffer), kBuffer, kBuffer + 14'400.0), kBuffer);
  EXPECT_EQ(p.gaps, 0);
}

TEST(SoakSoundPositions, AnEarlyClockNeverShrinksTheGapTheRampShows) {
  SoundPositions p;
  p.Add(Residue(0), kBuffer, 0);
  // One buffer lost (1600 samples, 576 past a whole period), but the clock
  // says the next one is right on time: the ramp's 576 samples stand.
  EXPECT_EQ(p.Add(Residue(2 * kBuffer), kBuffer, kBuffer), kBuffer + 576);
  EXPECT_EQ(p.gaps, 1);
  EXPECT_EQ(p.lostSamples, 576);
}

TEST(SoakResolveShift, PlacesAPositionOnTheSendersBufferGrid) {
  // The first buffer seen starts at sample 37 x 1600; only its residue is
  // known. The pictures put it two buffers off either way.
  const std::int64_t truth = 37 * kBuffer;
  for (std::int64_t off : {-2, -1, 0, 1, 2}) {
    const auto shift = ResolveShift(Residue(truth), kBuffer, static_cast<double>(truth + off * kBuffer));
    ASSERT_TRUE(shift.has_value()) << off;
    EXPECT_EQ(Residue(truth) + *shift, truth) << off;
  }
}

TEST(SoakResolveShift, NoShiftForAResidueOffTheGrid) {
  // Buffer starts are multiples of 1600, so their residues are multiples of 64.
  EXPECT_FALSE(ResolveShift(1, kBuffer, 50'000).has_value());
  EXPECT_FALSE(ResolveShift(0, 0, 50'000).has_value());
}

TEST(SoakClockDrift, ARunningFastClockShowsAsDriftPerHour) {
  ClockDrift d;
  // Media time 10 ppm fast (36 ms an hour), from an arbitrary start, for
  // half an hour of 30 fps pictures.
  for (int n = 0; n <= 54'000; ++n) {
    const double content = 123.0 + n / 30.0;
    d.Add(content, 7.0 + (content - 123.0) * (1.0 + 10e-6));
  }
  EXPECT_NEAR(d.PerHourMs(), 36.0, 1e-6);
  EXPECT_NEAR(d.EndMs(), 18.0, 1e-6);
  EXPECT_NEAR(d.MaxAbsMs(), 18.0, 1e-6);
}

TEST(SoakContentPairs, PairsInEitherOrderAndNeverWithAStaleSlot) {
  ContentPairs pairs;
  EXPECT_FALSE(pairs.Video(5, 1.000).has_value());
  EXPECT_NEAR(*pairs.Audio(5, 0.967), -0.033, 1e-12);
  EXPECT_FALSE(pairs.Audio(6, 1.000).has_value());
  EXPECT_NEAR(*pairs.Video(6, 1.033), -0.033, 1e-12);
  // The same slot one lap later holds another position.
  EXPECT_FALSE(pairs.Audio(6 + ContentPairs::kSlots, 20.0).has_value());
  EXPECT_FALSE(pairs.Video(-1, 1.0).has_value());
}

struct FakeTime {
  double t = 1000;
  double lateBy = 0;  // every wake-up comes this late
  int interruptAfter = -1;
  int waits = 0;
  std::vector<double> samples;
  int progress = 0;
  Schedule For(double seconds) {
    Schedule s;
    s.seconds = seconds;
    s.sampleSeconds = 10;
    s.progressSeconds = 60;
    s.now = [this] { return t; };
    s.waitUntil = [this](double until) {
      if (interruptAfter >= 0 && waits++ >= interruptAfter) return false;
      t = std::max(t, until + lateBy);
      return true;
    };
    s.sample = [this](double elapsed) { samples.push_back(elapsed); };
    s.progress = [this](double) { ++progress; };
    s.keepGoing = [] { return true; };
    return s;
  }
};

TEST(SoakSchedule, SamplesEveryStepAndOnceAtTheEnd) {
  FakeTime time;
  EXPECT_DOUBLE_EQ(RunSchedule(time.For(600)), 600);
  ASSERT_EQ(time.samples.size(), 61u);  // 0, 10, ..., 590, then 600
  EXPECT_DOUBLE_EQ(time.samples[1], 10);
  EXPECT_DOUBLE_EQ(time.samples.back(), 600);
  EXPECT_EQ(time.progress, 9);  // 60 .. 540; the summary follows at 600
}

TEST(SoakSchedule, LateWakeUpsNeitherBunchSamplesNorOverrunTheEnd) {
  FakeTime time;
  time.lateBy = 25;  // each wait overshoots by two and a half steps
  const double ran = RunSchedule(time.For(100));
  EXPECT_LE(ran, 125);
  for (std::size_t i = 1; i < time.samples.size(); ++i) EXPECT_GE(time.samples[i] - time.samples[i - 1], 10);
}

TEST(SoakSchedule, AnInterruptEndsTheRunWithAFinalSample) {
  FakeTime time;
  time.interruptAfter = 3;
  const double ran = RunSchedule(time.For(7200));
  EXPECT_DOUBLE_EQ(ran, 30);
  EXPECT_EQ(time.samples.size(), 5u);  // 0, 10, 20, 30 and the last at 30
}

TEST(SoakSchedule, AChainThatStopsEndsTheRun) {
  FakeTime time;
  Schedule s = time.For(7200);
  int checks = 0;
  s.keepGoing = [&] { return ++checks < 4; };
  EXPECT_LT(RunSchedule(s), 60);
}

}  // namespace
}  // namespace soak
