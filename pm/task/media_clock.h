#pragma once
// The media clock of a source: turns steady time and delivered audio into
// media times of 705,600,000 ticks per second. Video times follow the audio
// clock in exact frame steps while they stay near it, and never go backwards.
//
// Which thread calls this: any; every operation is serialised on one mutex.
// A source normally calls all of them from its frame thread.

#include <cstdint>
#include <memory>
#include <mutex>
#include <utility>

#include "pm/runtime/clock.h"

namespace pm {

inline constexpr std::int64_t kTicksPerSecond = 705600000;

class MediaClock {
 public:
  // Reads the time of `clock` (a steady clock of its own when none is given;
  // tests pass one they move by hand).
  explicit MediaClock(std::shared_ptr<Clock> clock = nullptr);

  // Ticks since the epoch (construction or the last Reset).
  std::int64_t CurrentTime();
  // Ticks of the audio delivered so far at `sampleRate`; CurrentTime when the
  // rate is not positive.
  std::int64_t AudioTime(std::int32_t sampleRate);
  // The time of the next video frame at the frame rate frames/seconds (frames
  // in the low 16 bits, seconds in the high 16 bits) and whether it is a
  // discontinuity.
  std::pair<std::int64_t, bool> NextVideoTime(std::uint32_t frameRate);
  // Records an audio buffer of `samples` samples as sent.
  void AudioSent(std::int32_t samples);
  // Starts again: new epoch, no audio sent, no video time.
  void Reset();

 private:
  std::int64_t CurrentTimeLocked() const;

  const std::shared_ptr<Clock> clock_;
  std::mutex mutex_;  // guards every field below
  std::int64_t epoch_;
  std::int64_t audioSamplesSent_ = 0;
  std::int64_t audioBuffersSent_ = 0;
  std::int64_t lastAudioTime_ = -1;
  std::int64_t lastVideoTime_ = -1;
  std::int64_t fallbackCount_ = 0;
  std::int32_t audioRate_ = 0;
};

}  // namespace pm
