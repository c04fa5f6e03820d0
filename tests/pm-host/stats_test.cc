// What the progress line and the summary report: drops from gaps in media
// time, latency above the quickest picture, rates on the host's clock.
#include <gtest/gtest.h>

#include "pm-host/stats.h"

namespace {

constexpr std::int64_t kTicksPerFrame = 705'600'000 / 50;  // 50 fps
constexpr std::int64_t kNsPerFrame = 20'000'000;

TEST(ReceiveStats, CountsMissingPicturesFromGapsInMediaTimeAndSoundSecondsFromSamples) {
  pmhost::ReceiveStats stats;
  std::int64_t n = 0;
  auto send = [&](std::int64_t frame) {
    stats.Video(frame * kTicksPerFrame, 0, 64, 16, 128, frame * kNsPerFrame, n++ * kNsPerFrame);
  };
  for (int i = 0; i < 20; ++i) send(i);
  EXPECT_EQ(stats.Snapshot(0).drops, 0u);
  send(23);  // 20, 21, 22 missing
  EXPECT_EQ(stats.Snapshot(0).drops, 3u);
  // A lost connection is not a drop: the sender was away.
  for (int state : {3, 1, 2}) stats.State(state);
  for (int frame : {500, 501}) send(frame);
  EXPECT_EQ(stats.Snapshot(0).drops, 3u);
  EXPECT_EQ(stats.Snapshot(0).states, (std::vector<int>{3, 1, 2}));
  // Sound seconds follow the sample count and rate.
  for (int i = 0; i < 100; ++i) stats.Audio(0, 480, 48000, 2, 0, 0);
  EXPECT_DOUBLE_EQ(stats.Snapshot(0).audioSeconds(), 1.0);
}

TEST(ReceiveStats, LatencyIsMeasuredAboveTheQuickestPictureAfterTheFirstSecond) {
  pmhost::ReceiveStats stats;
  // 100 pictures read 5 ms after their media time, one of them 40 ms late;
  // the wall clock starts far from the media clock (a different origin).
  const std::int64_t origin = 1'700'000'000'000'000'000;
  for (int i = 0; i < 200; ++i) {
    const std::int64_t extra = i == 150 ? 40'000'000 : 5'000'000;
    stats.Video(i * kTicksPerFrame, 0, 64, 16, 128, origin + i * kNsPerFrame + extra, i * kNsPerFrame);
  }
  const pmhost::StatsSnapshot s = stats.Snapshot(200 * kNsPerFrame);
  EXPECT_NEAR(s.p50Ms, 0.0, 0.01);
  EXPECT_NEAR(s.p99Ms, 0.0, 0.01);  // one late picture in 150 is beyond the 99th percentile
  EXPECT_NEAR(pmhost::ReceiveStats::Percentile({0, 0, 35}, 1.0), 35, 1e-9);
  EXPECT_NEAR(s.fps, 50.0, 0.01);
  EXPECT_EQ(s.frames, 200u);
}

TEST(ReceiveStats, AWarmUpBurstDoesNotCountButLaterQueueingDoes) {
  pmhost::ReceiveStats stats;
  for (int i = 0; i < 300; ++i) {
    // The first 10 pictures arrive together 200 ms late; from picture 200 on
    // every picture is 10 ms late.
    const std::int64_t extra = i < 10 ? 200'000'000 : (i >= 200 ? 10'000'000 : 0);
    stats.Video(i * kTicksPerFrame, 0, 64, 16, 128, i * kNsPerFrame + extra, i * kNsPerFrame + extra);
  }
  const pmhost::StatsSnapshot s = stats.Snapshot(300 * kNsPerFrame);
  EXPECT_NEAR(s.p50Ms, 0.0, 0.01);
  EXPECT_NEAR(s.p99Ms, 10.0, 0.01);
}

}  // namespace
