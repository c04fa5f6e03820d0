#include "pm/task/media_clock.h"

#include <algorithm>

namespace pm {

MediaClock::MediaClock(std::shared_ptr<Clock> clock)
    : clock_(clock ? std::move(clock) : MakeSteadyClock()), epoch_(clock_->NowNs()) {}

std::int64_t MediaClock::CurrentTimeLocked() const {
  // 441/625 = 705,600,000 / 1,000,000,000, truncating toward zero.
  return (clock_->NowNs() - epoch_) * 441 / 625;
}

std::int64_t MediaClock::CurrentTime() {
  std::lock_guard<std::mutex> guard(mutex_);
  return CurrentTimeLocked();
}

std::int64_t MediaClock::AudioTime(std::int32_t rate) {
  std::lock_guard<std::mutex> guard(mutex_);
  if (rate <= 0) return CurrentTimeLocked();
  const double micros = static_cast<double>(audioSamplesSent_) * (1000000.0 / rate);
  const std::int64_t ticks = static_cast<std::int64_t>(micros) * 3528 / 5;
  lastAudioTime_ = ticks;
  audioRate_ = rate;
  return ticks;
}

std::pair<std::int64_t, bool> MediaClock::NextVideoTime(std::uint32_t frameRate) {
  const std::uint32_t frames = frameRate & 0xFFFF;
  const std::uint32_t seconds = frameRate >> 16;
  std::lock_guard<std::mutex> guard(mutex_);

  if (audioSamplesSent_ <= 0 || audioBuffersSent_ <= 0 || audioRate_ <= 0) {
    // No audio since the last reset: count 1..10 as discontinuities, then
    // follow the steady clock.
    ++fallbackCount_;
    if (fallbackCount_ > 10) return {CurrentTimeLocked(), false};
    return {fallbackCount_, true};
  }

  std::int64_t time = lastAudioTime_;
  bool discontinuity = false;
  if (frames == 0 || seconds == 0) return {time, false};

  const std::uint64_t frameDuration = std::uint64_t{seconds} * 705600000u / frames;
  if (lastVideoTime_ < 0) {
    lastVideoTime_ = time;
    return {time, false};
  }
  const std::int64_t expected = lastVideoTime_ + static_cast<std::int64_t>(frameDuration);
  const double audioBuffersPerSecond =
      static_cast<double>(audioRate_) * static_cast<double>(audioBuffersSent_) /
      static_cast<double>(audioSamplesSent_);
  const double factor = std::clamp(
      (static_cast<double>(frames) / seconds) / audioBuffersPerSecond * 1.5, 1.0, 15.0);
  const auto window = static_cast<std::int64_t>(factor * static_cast<double>(frameDuration));
  if (expected - window <= time && time <= expected + window) time = expected;
  if (time <= lastVideoTime_) {
    time = lastVideoTime_ + 1;
    discontinuity = true;
  }
  lastVideoTime_ = time;
  return {time, discontinuity};
}

void MediaClock::AudioSent(std::int32_t samples) {
  std::lock_guard<std::mutex> guard(mutex_);
  audioSamplesSent_ += samples;
  audioBuffersSent_ += 1;
}

void MediaClock::Reset() {
  std::lock_guard<std::mutex> guard(mutex_);
  epoch_ = clock_->NowNs();
  audioSamplesSent_ = 0;
  audioBuffersSent_ = 0;
  lastAudioTime_ = -1;
  lastVideoTime_ = -1;
  fallbackCount_ = 0;
  audioRate_ = 0;
}

}  // namespace pm
