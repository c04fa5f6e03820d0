#pragma once
// What the host is handed, checked on the queues' reader threads as it
// arrives: ramp pictures and sound intact (when the senders send the ramp
// pattern), picture numbers rising and sound without gaps for each source,
// the picture sizes and channel counts seen.
//
// It is also a gate: while shut, a reader thread waits inside OnVideo with
// the picture it brought, so neither that token nor any record queued behind
// it goes back to the task. Open it before the host stops (stopping joins
// those threads).
//
// Lock: lock_ guards every field below it; nothing is called under it.
#include <cstdint>
#include <condition_variable>
#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "pm-host/checks.h"
#include "pm-host/queue_reader.h"

namespace pmtest {

class RampSink : public pmhost::FrameSink {
 public:
  struct Size {
    int width = 0;
    int height = 0;
    bool operator==(const Size&) const = default;
  };

  explicit RampSink(bool ramp = true) : ramp_(ramp) {}

  void OnVideo(const std::string& id, const pmhost::VideoFrame& frame) override {
    std::int64_t n = -1;
    const std::string check = ramp_ ? pmhost::CheckRampPicture(frame, &n) : std::string();
    std::unique_lock<std::mutex> hold(lock_);
    Stream& s = streams_[id];
    if (!check.empty()) Problem("picture " + std::to_string(n) + ": " + check);
    if (ramp_ && s.pictures > 0 && n <= s.lastFrame) {
      Problem("frame " + std::to_string(n) + " after " + std::to_string(s.lastFrame));
    }
    ++s.pictures;
    s.lastFrame = n;
    const Size size{frame.width, frame.height};
    if (sizes_.empty() || !(sizes_.back().first == size)) sizes_.push_back({size, 0});
    ++sizes_.back().second;
    ++holding_;
    changed_.notify_all();
    changed_.wait(hold, [this] { return open_; });
    --holding_;
  }

  void OnAudio(const std::string& id, const pmhost::AudioFrame& frame) override {
    if (!ramp_) return;
    std::int64_t first = -1;
    const std::string check = pmhost::CheckRampSound(frame, &first);
    std::lock_guard<std::mutex> guard(lock_);
    Stream& s = streams_[id];
    ++s.sounds;
    if (!check.empty()) Problem("sound: " + check);
    if (s.nextSample >= 0 && first != s.nextSample % 1024) {
      Problem("sound continues at " + std::to_string(first) + " instead of " + std::to_string(s.nextSample % 1024));
    }
    s.nextSample = first + frame.samples;
    channels_.push_back(frame.channels);
  }

  void OnBadRecord(const std::string&, const std::string& reason) override {
    std::lock_guard<std::mutex> guard(lock_);
    Problem("bad record: " + reason);
  }

  void Shut() {
    std::lock_guard<std::mutex> guard(lock_);
    open_ = false;
  }
  void Open() {
    {
      std::lock_guard<std::mutex> guard(lock_);
      open_ = true;
    }
    changed_.notify_all();
  }
  // A reader thread is waiting in the shut gate.
  bool Holding() const {
    std::lock_guard<std::mutex> guard(lock_);
    return holding_ > 0 && !open_;
  }
  // Pictures of one source, or of all.
  int Videos(const std::string& id) const { return Count(id, &Stream::pictures); }
  int Pictures() const { return Count({}, &Stream::pictures); }
  int Sounds() const { return Count({}, &Stream::sounds); }
  // Every fault seen, in order (empty when everything arrived intact).
  std::vector<std::string> Problems() const {
    std::lock_guard<std::mutex> guard(lock_);
    return problems_;
  }
  // The runs of equal picture sizes, in order, with their picture counts.
  std::vector<std::pair<Size, int>> SizeRuns() const {
    std::lock_guard<std::mutex> guard(lock_);
    return sizes_;
  }
  std::vector<int> Channels() const {
    std::lock_guard<std::mutex> guard(lock_);
    return channels_;
  }

 private:
  struct Stream {
    int pictures = 0;
    int sounds = 0;
    std::int64_t lastFrame = -1;
    std::int64_t nextSample = -1;
  };

  int Count(const std::string& id, int Stream::*field) const {
    std::lock_guard<std::mutex> guard(lock_);
    int n = 0;
    for (const auto& [key, stream] : streams_) n += id.empty() || key == id ? stream.*field : 0;
    return n;
  }
  void Problem(std::string text) {  // lock_ held
    if (problems_.size() < 20) problems_.push_back(std::move(text));
  }

  const bool ramp_;
  mutable std::mutex lock_;  // guards everything below
  std::condition_variable changed_;
  bool open_ = true;
  int holding_ = 0;
  std::map<std::string, Stream> streams_;
  std::vector<std::pair<Size, int>> sizes_;
  std::vector<int> channels_;
  std::vector<std::string> problems_;
};

inline void PrintTo(const RampSink::Size& s, std::ostream* os) { *os << s.width << "x" << s.height; }

}  // namespace pmtest
