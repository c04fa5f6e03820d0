#pragma once
// What a receive run measures: frames, frame rate, sound, drops, latency,
// connection states. Fed from the queue reader thread (frames) and the
// dispatcher thread (states); read by the main thread for the progress line
// and the summary. Lock: lock_ guards everything (taken alone).
//
// Latency: the task hands the host media times relative to the sender's
// first timestamp, so the sender's own clock is not visible here. For each
// picture the host takes (host wall clock at read − media time); the
// smallest such offset seen stands for the quickest trip, and a picture's
// latency is its offset minus that smallest one. With the loopback sender
// (which stamps its wall clock) that is the time each picture spent beyond
// the quickest one: transit jitter plus any queueing, not the absolute trip.
// The percentiles leave out the first second after the first frame (the
// frames queued while the connection was being set up), unless the run had
// nothing after it.

#include <cstdint>
#include <deque>
#include <mutex>
#include <vector>

#include <nlohmann/json.hpp>

namespace pmhost {

struct StatsSnapshot {
  int state = 0;
  std::vector<int> states;  // every state reported, in order
  int produces = 0;
  std::uint64_t frames = 0;
  std::uint64_t audioBuffers = 0;
  std::uint64_t audioSamples = 0;  // per channel
  int audioRate = 0;
  int audioChannels = 0;
  std::uint32_t videoCode = 0;
  int width = 0;
  int height = 0;
  std::uint32_t stride = 0;
  std::uint64_t drops = 0;
  std::uint64_t badRecords = 0;
  double fps = 0;          // pictures per second of the sender's media time
  double recentFps = 0;    // over the last second
  double p50Ms = 0;
  double p99Ms = 0;
  double audioSeconds() const { return audioRate > 0 ? static_cast<double>(audioSamples) / audioRate : 0.0; }
  nlohmann::json ToJson() const;
};

class ReceiveStats {
 public:
  // Host clocks in nanoseconds: `wallNs` for latency (CLOCK_REALTIME),
  // `steadyNs` for rates.
  void Video(std::int64_t mediaTime, std::uint32_t code, int width, int height, std::uint32_t stride,
             std::int64_t wallNs, std::int64_t steadyNs);
  void Audio(std::int64_t mediaTime, int samples, int rate, int channels, std::int64_t wallNs, std::int64_t steadyNs);
  void State(int state);
  void Produces(int mask);
  void BadRecord();
  // With `latency` false the percentiles are left at 0: computing them sorts
  // every sample kept so far, too much for a caller that polls often.
  StatsSnapshot Snapshot(std::int64_t steadyNs, bool latency = true) const;

  // Nearest-rank percentile of `values` (0 for none).
  static double Percentile(std::vector<double> values, double fraction);

 private:
  struct Offset {
    std::int64_t steadyNs;  // when read
    double ns;              // host wall clock - media time
  };
  void Latency(std::int64_t mediaTime, std::int64_t wallNs, std::int64_t steadyNs, std::vector<Offset>& offsets);

  mutable std::mutex lock_;  // guards everything below
  StatsSnapshot totals_;
  std::vector<Offset> videoOffsets_;
  std::vector<Offset> audioOffsets_;
  std::int64_t lastVideoTime_ = INT64_MIN;
  std::deque<std::int64_t> intervals_;   // recent media intervals between pictures
  std::uint64_t closedDrops_ = 0;        // drops of earlier runs of the connection
  std::int64_t runFirstTime_ = 0;        // media time of this run's first picture
  std::uint64_t runFrames_ = 0;          // pictures of this run
  std::deque<std::int64_t> recentReads_; // steady times of the pictures of the last second
  std::int64_t firstMedia_ = 0;
  std::int64_t lastMedia_ = 0;
  std::int64_t firstRead_ = 0;
  std::int64_t lastRead_ = 0;
};

// The clocks in nanoseconds.
std::int64_t WallNs();
std::int64_t SteadyNs();

}  // namespace pmhost
