#include "bench/soak/soak_core.h"

#include <algorithm>
#include <cmath>
#include <numeric>

namespace soak {

void LineFit::Add(double x, double y) {
  ++n_;
  const double dx = x - meanX_;
  meanX_ += dx / static_cast<double>(n_);
  meanY_ += (y - meanY_) / static_cast<double>(n_);
  // With the new mean of x and the old deviation: the running co-moments.
  cxx_ += dx * (x - meanX_);
  cxy_ += dx * (y - meanY_);
}

double LineFit::Slope() const { return n_ >= 2 && cxx_ > 0 ? cxy_ / cxx_ : 0.0; }

double LineFit::At(double x) const { return meanY_ + Slope() * (x - meanX_); }

void Series::Add(double x, double y) {
  if (fit.Count() == 0) {
    firstX = x;
    firstY = y;
    minY = y;
    maxY = y;
  }
  fit.Add(x, y);
  lastX = x;
  lastY = y;
  minY = std::min(minY, y);
  maxY = std::max(maxY, y);
}

void FrameNumbers::Add(std::int64_t n) {
  if (first < 0) {
    first = n;
    last = n;
    received = 1;
    return;
  }
  if (n <= last) {
    ++repeats;
    return;
  }
  if (n > last + 1) {
    ++gaps;
    lost += n - last - 1;
  }
  ++received;
  last = n;
}

namespace {
std::int64_t Mod(std::int64_t a, std::int64_t m) {
  const std::int64_t r = a % m;
  return r < 0 ? r + m : r;
}
}  // namespace

std::int64_t SoundPositions::Add(std::int64_t residue, std::int64_t samples, double estimate) {
  residue = Mod(residue, kRampPeriod);
  std::int64_t position = residue;
  if (started_) {
    const std::int64_t skipped = Mod(residue - next_, kRampPeriod);
    if (skipped == 0) {
      position = next_;
    } else {
      // The nearest candidate past the expected start, then whole periods
      // more as far as the media clock says (never fewer than none).
      const std::int64_t nearest = next_ + skipped;
      const double periods = std::round((estimate - static_cast<double>(nearest)) / static_cast<double>(kRampPeriod));
      position = nearest + kRampPeriod * std::max<std::int64_t>(0, static_cast<std::int64_t>(periods));
      ++gaps;
      lostSamples += position - next_;
    }
  }
  started_ = true;
  next_ = position + samples;
  ++buffers;
  this->samples += samples;
  return position;
}

std::optional<std::int64_t> ResolveShift(std::int64_t position, std::int64_t bufferSamples, double estimate,
                                         std::int64_t period) {
  if (bufferSamples <= 0 || period <= 0) return std::nullopt;
  // The grid points with the right residue repeat every lcm(period, buffer).
  const std::int64_t cycle = std::lcm(period, bufferSamples) / period;
  if (cycle > 1'000'000) return std::nullopt;
  const auto center = static_cast<std::int64_t>(std::llround((estimate - static_cast<double>(position)) /
                                                             static_cast<double>(period)));
  std::optional<std::int64_t> best;
  double bestDistance = 0;
  for (std::int64_t j = center - cycle - 1; j <= center + cycle + 1; ++j) {
    const std::int64_t at = position + j * period;
    if (at < 0 || at % bufferSamples != 0) continue;
    const double distance = std::fabs(static_cast<double>(at) - estimate);
    if (!best || distance < bestDistance) {
      best = j * period;
      bestDistance = distance;
    }
  }
  return best;
}

void ClockDrift::Add(double contentSeconds, double mediaSeconds) {
  if (drift.Empty()) {
    content0_ = contentSeconds;
    media0_ = mediaSeconds;
  }
  const double content = contentSeconds - content0_;
  drift.Add(content / 3600.0, ((mediaSeconds - media0_) - content) * 1000.0);
}

double ClockDrift::MaxAbsMs() const { return Empty() ? 0.0 : std::max(std::fabs(drift.minY), std::fabs(drift.maxY)); }

std::optional<double> ContentPairs::Video(std::int64_t position, double mediaSeconds) {
  if (position < 0) return std::nullopt;
  const std::size_t i = static_cast<std::size_t>(position) % kSlots;
  video_[i] = {position, mediaSeconds};
  if (audio_[i].position == position) return audio_[i].media - mediaSeconds;
  return std::nullopt;
}

std::optional<double> ContentPairs::Audio(std::int64_t position, double mediaSeconds) {
  if (position < 0) return std::nullopt;
  const std::size_t i = static_cast<std::size_t>(position) % kSlots;
  audio_[i] = {position, mediaSeconds};
  if (video_[i].position == position) return mediaSeconds - video_[i].media;
  return std::nullopt;
}

double RunSchedule(const Schedule& s) {
  // A step of no length would never move on.
  const double sampleEvery = std::max(s.sampleSeconds, 0.01);
  const double progressEvery = std::max(s.progressSeconds, 0.01);
  const double start = s.now();
  const double end = start + s.seconds;
  double nextSample = start;
  double nextProgress = start + progressEvery;
  for (;;) {
    const double t = s.now();
    if (t >= end || !s.keepGoing()) break;
    if (t >= nextSample) {
      s.sample(t - start);
      // After a late wake-up the samples keep their grid.
      while (nextSample <= t) nextSample += sampleEvery;
    }
    if (t >= nextProgress) {
      s.progress(t - start);
      while (nextProgress <= t) nextProgress += progressEvery;
    }
    if (!s.waitUntil(std::min({nextSample, nextProgress, end}))) break;
  }
  const double ran = s.now() - start;
  s.sample(ran);
  return ran;
}

}  // namespace soak
