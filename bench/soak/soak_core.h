#pragma once
// The arithmetic of the soak run, apart from processes and sockets so that a
// few tests can check it:
//   LineFit / Series   least-squares slope of values added one at a time
//                      (drift per hour, memory growth per hour);
//   FrameNumbers       gaps in the ramp pictures' numbers;
//   SoundPositions     gaps in the ramp sound, whose samples tell their
//                      position only modulo 1024;
//   ClockDrift         a stream's media clock against its content clock;
//   ContentPairs       audio and video of the same content position, for the
//                      audio clock against the video clock;
//   RunSchedule        the sampling loop, on an injected clock and wait.
// Nothing here takes a lock: each object belongs to one thread at a time (the
// caller says which).

#include <array>
#include <cstdint>
#include <functional>
#include <optional>

namespace soak {

// Media times count this many ticks per second.
inline constexpr double kTicksPerSecond = 705'600'000.0;
// The ramp sound repeats every 1024 samples.
inline constexpr std::int64_t kRampPeriod = 1024;

// Least-squares line through (x, y) points added one at a time. Running means
// and co-moments (Welford) keep the precision over hours of points.
class LineFit {
 public:
  void Add(double x, double y);
  std::int64_t Count() const { return n_; }
  // dy/dx; 0 with fewer than two points or all points at one x.
  double Slope() const;
  // The line's y at x (the mean y when there is no slope).
  double At(double x) const;

 private:
  std::int64_t n_ = 0;
  double meanX_ = 0;
  double meanY_ = 0;
  double cxx_ = 0;  // sum of (x - meanX)^2
  double cxy_ = 0;  // sum of (x - meanX)(y - meanY)
};

// A value followed over time: first, last, extremes and the fitted slope.
struct Series {
  void Add(double x, double y);
  bool Empty() const { return fit.Count() == 0; }
  LineFit fit;
  double firstX = 0, firstY = 0;
  double lastX = 0, lastY = 0;
  double minY = 0, maxY = 0;
};

// Picture numbers in arrival order. A number above the next expected one is
// a gap: the pictures in between are lost. A number at or below the highest
// one seen is a repeat (or late); it is counted and changes nothing else.
struct FrameNumbers {
  void Add(std::int64_t n);
  std::int64_t received = 0;  // pictures counted in sequence
  std::int64_t lost = 0;      // numbers skipped
  std::int64_t gaps = 0;      // places where numbers were skipped
  std::int64_t repeats = 0;
  std::int64_t first = -1;
  std::int64_t last = -1;
};

// Positions of sound buffers in arrival order. A ramp buffer tells its first
// sample only modulo kRampPeriod (the residue), so positions are unwrapped
// from the first buffer's residue on:
//  - a residue equal to where the previous buffer ended continues it;
//  - any other residue is a gap. The nearest position with that residue past
//    the expected one is the fewest samples that can be missing; whole
//    periods more are added when `estimate` (where the media clock puts the
//    buffer, on the same unwrapped scale) says so. The gap count is exact;
//    the lost samples are an estimate when a gap spans a period or more.
// Losses of exactly whole periods with no other trace are not seen here;
// the picture numbers, exact, are the cross-check.
class SoundPositions {
 public:
  // Returns the buffer's unwrapped first sample.
  std::int64_t Add(std::int64_t residue, std::int64_t samples, double estimate);
  bool Started() const { return started_; }
  std::int64_t Next() const { return next_; }  // where the next buffer should start
  std::int64_t buffers = 0;
  std::int64_t samples = 0;  // per channel
  std::int64_t gaps = 0;
  std::int64_t lostSamples = 0;

 private:
  bool started_ = false;
  std::int64_t next_ = 0;
};

// The whole periods to add to an unwrapped position (`position`, with the
// residue of the sender's true position) so that it lands on the sender's
// buffer grid (multiples of `bufferSamples` counted from sample 0) nearest
// to `estimate`. nullopt when no grid point has that residue within one
// full cycle of the grid and the period around the estimate.
std::optional<std::int64_t> ResolveShift(std::int64_t position, std::int64_t bufferSamples, double estimate,
                                         std::int64_t period = kRampPeriod);

// A stream's media clock against its content clock: drift at a point =
// (media - media at the reference) - (content - content at the reference),
// the reference being the first point added. Milliseconds against hours of
// content since the reference.
class ClockDrift {
 public:
  void Add(double contentSeconds, double mediaSeconds);
  bool Empty() const { return drift.Empty(); }
  double EndMs() const { return drift.lastY; }
  double PerHourMs() const { return drift.fit.Slope(); }
  double MaxAbsMs() const;
  Series drift;

 private:
  double content0_ = 0;
  double media0_ = 0;
};

// Matches video pictures and audio buffers of the same content position (a
// picture number; the buffer that starts at that picture's first sample).
// Whichever of the two arrives second completes the pair and gets the audio
// media time minus the video media time. Remembers the last kSlots of each.
class ContentPairs {
 public:
  static constexpr std::size_t kSlots = 512;
  std::optional<double> Video(std::int64_t position, double mediaSeconds);
  std::optional<double> Audio(std::int64_t position, double mediaSeconds);

 private:
  struct Slot {
    std::int64_t position = -1;
    double media = 0;
  };
  std::array<Slot, kSlots> video_{};
  std::array<Slot, kSlots> audio_{};
};

// The soak's main loop: samples at start and every `sampleSeconds`, prints
// progress every `progressSeconds`, ends at `seconds` after the start or as
// soon as `keepGoing` says no (checked at each step) and takes a last sample.
// The clock gives seconds; `waitUntil` waits until that time or returns
// false when the run is to end early (interrupted).
struct Schedule {
  double seconds = 0;
  double sampleSeconds = 10;
  double progressSeconds = 60;
  std::function<double()> now;
  std::function<bool(double until)> waitUntil;
  std::function<void(double elapsed)> sample;
  std::function<void(double elapsed)> progress;
  std::function<bool()> keepGoing;
};
// Returns the seconds the loop ran.
double RunSchedule(const Schedule& schedule);

}  // namespace soak
