#include "pm-host/stats.h"

#include <algorithm>
#include <chrono>
#include <cmath>

#include "pm-host/record.h"

namespace pmhost {

namespace {
constexpr std::size_t kMaxSamples = 1u << 20;
constexpr std::size_t kIntervalWindow = 64;
constexpr std::int64_t kWarmUpNs = 1'000'000'000;

// Media ticks (1/705,600,000 s) to nanoseconds.
double TicksToNs(std::int64_t ticks) { return static_cast<double>(ticks) * 625.0 / 441.0; }
}  // namespace

std::int64_t WallNs() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::system_clock::now().time_since_epoch())
      .count();
}

std::int64_t SteadyNs() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

nlohmann::json StatsSnapshot::ToJson() const {
  nlohmann::json video = nullptr;
  if (frames > 0) {
    video = {{"code", CodeText(videoCode)}, {"width", width}, {"height", height}, {"stride", stride}};
  }
  nlohmann::json audio = nullptr;
  if (audioBuffers > 0) audio = {{"rate", audioRate}, {"channels", audioChannels}};
  return {{"state", state},
          {"states", states},
          {"produces", produces},
          {"frames", frames},
          {"fps", std::round(fps * 100) / 100},
          {"video", video},
          {"audio", audio},
          {"audio_buffers", audioBuffers},
          {"audio_seconds", std::round(audioSeconds() * 1000) / 1000},
          {"drops", drops},
          {"bad_records", badRecords},
          {"latency_ms", {{"p50", std::round(p50Ms * 1000) / 1000}, {"p99", std::round(p99Ms * 1000) / 1000}}}};
}

void ReceiveStats::Latency(std::int64_t mediaTime, std::int64_t wallNs, std::int64_t steadyNs,
                           std::vector<Offset>& offsets) {
  if (offsets.size() < kMaxSamples) offsets.push_back({steadyNs, static_cast<double>(wallNs) - TicksToNs(mediaTime)});
}

void ReceiveStats::Video(std::int64_t mediaTime, std::uint32_t code, int width, int height, std::uint32_t stride,
                         std::int64_t wallNs, std::int64_t steadyNs) {
  std::lock_guard<std::mutex> guard(lock_);
  if (totals_.frames == 0) {
    firstRead_ = steadyNs;
    firstMedia_ = mediaTime;
  }
  lastRead_ = steadyNs;
  lastMedia_ = mediaTime;
  ++totals_.frames;
  totals_.videoCode = code;
  totals_.width = width;
  totals_.height = height;
  totals_.stride = stride;
  Latency(mediaTime, wallNs, steadyNs, videoOffsets_);
  recentReads_.push_back(steadyNs);
  while (!recentReads_.empty() && recentReads_.front() < steadyNs - 1'000'000'000) recentReads_.pop_front();
  // Drops: the pictures a run of the connection should have held (its media
  // span over the median interval) minus those that arrived. A picture sent
  // late and the next one early cancel out, as they should.
  if (lastVideoTime_ == INT64_MIN) {
    closedDrops_ = totals_.drops;
    runFirstTime_ = mediaTime;
    runFrames_ = 0;
  } else if (mediaTime > lastVideoTime_) {
    intervals_.push_back(mediaTime - lastVideoTime_);
    if (intervals_.size() > kIntervalWindow) intervals_.pop_front();
  }
  ++runFrames_;
  if (intervals_.size() >= 8 && mediaTime > runFirstTime_) {
    std::vector<std::int64_t> sorted(intervals_.begin(), intervals_.end());
    std::nth_element(sorted.begin(), sorted.begin() + static_cast<long>(sorted.size() / 2), sorted.end());
    const std::int64_t median = sorted[sorted.size() / 2];
    if (median > 0) {
      const long long expected =
          std::llround(static_cast<double>(mediaTime - runFirstTime_) / static_cast<double>(median)) + 1;
      const long long missing = std::max<long long>(0, expected - static_cast<long long>(runFrames_));
      totals_.drops = std::max(totals_.drops, closedDrops_ + static_cast<std::uint64_t>(missing));
    }
  }
  lastVideoTime_ = mediaTime;
}

void ReceiveStats::Audio(std::int64_t mediaTime, int samples, int rate, int channels, std::int64_t wallNs,
                         std::int64_t steadyNs) {
  std::lock_guard<std::mutex> guard(lock_);
  if (totals_.frames == 0 && totals_.audioBuffers == 0) firstRead_ = steadyNs;
  if (totals_.frames == 0) lastRead_ = steadyNs;
  ++totals_.audioBuffers;
  totals_.audioSamples += static_cast<std::uint64_t>(std::max(0, samples));
  totals_.audioRate = rate;
  totals_.audioChannels = channels;
  Latency(mediaTime, wallNs, steadyNs, audioOffsets_);
}

void ReceiveStats::State(int state) {
  std::lock_guard<std::mutex> guard(lock_);
  totals_.state = state;
  totals_.states.push_back(state);
  // A gap across a lost connection is not a drop.
  if (state != 2) lastVideoTime_ = INT64_MIN;
}

void ReceiveStats::Produces(int mask) {
  std::lock_guard<std::mutex> guard(lock_);
  totals_.produces = mask;
}

void ReceiveStats::BadRecord() {
  std::lock_guard<std::mutex> guard(lock_);
  ++totals_.badRecords;
}

double ReceiveStats::Percentile(std::vector<double> values, double fraction) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  const auto rank = static_cast<std::size_t>(std::ceil(fraction * static_cast<double>(values.size())));
  return values[std::min(values.size() - 1, rank == 0 ? 0 : rank - 1)];
}

StatsSnapshot ReceiveStats::Snapshot(std::int64_t steadyNs, bool latency) const {
  std::vector<Offset> offsets;
  StatsSnapshot snapshot;
  {
    std::lock_guard<std::mutex> guard(lock_);
    snapshot = totals_;
    if (latency) offsets = !videoOffsets_.empty() ? videoOffsets_ : audioOffsets_;
    std::size_t recent = 0;
    for (std::int64_t t : recentReads_) recent += t >= steadyNs - 1'000'000'000 ? 1 : 0;
    snapshot.recentFps = static_cast<double>(recent);
    // On the sender's clock: pictures that queued while the connection was
    // set up and then arrived in a burst do not raise the rate.
    if (totals_.frames > 1 && lastMedia_ > firstMedia_) {
      snapshot.fps = static_cast<double>(totals_.frames - 1) * 705'600'000.0 / static_cast<double>(lastMedia_ - firstMedia_);
    } else if (totals_.frames > 1 && lastRead_ > firstRead_) {
      snapshot.fps = static_cast<double>(totals_.frames - 1) * 1e9 / static_cast<double>(lastRead_ - firstRead_);
    }
  }
  if (!offsets.empty()) {
    double quickest = offsets[0].ns;
    for (const Offset& o : offsets) quickest = std::min(quickest, o.ns);
    const std::int64_t warm = offsets[0].steadyNs + kWarmUpNs;
    std::vector<double> settled, all;
    for (const Offset& o : offsets) {
      all.push_back((o.ns - quickest) / 1e6);
      if (o.steadyNs >= warm) settled.push_back(all.back());
    }
    const std::vector<double>& chosen = settled.empty() ? all : settled;
    snapshot.p50Ms = Percentile(chosen, 0.50);
    snapshot.p99Ms = Percentile(chosen, 0.99);
  }
  return snapshot;
}

}  // namespace pmhost
