#pragma once
// The host's end of one source's frame queue: connects to the port announced
// by "<id>::start_queue", reads 64-byte records, checks them, maps the
// segment they name, hands the frame to a FrameSink and writes the token back.
// A record that is malformed, names a segment that cannot be mapped, or
// describes more bytes than the segment has is logged and skipped; its token
// is returned all the same, so the task never waits for it.
//
// Threads: one reader thread per QueueReader ("pm-host queue"). Forget may be
// called from any thread (the dispatcher's, on "::delete_memory"). Stop
// before destroy (the destructor stops).

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <thread>

#include "pm-host/record.h"
#include "pm-host/segments.h"
#include "pm/ipc/connection.h"

namespace pmhost {

// A frame as it lies in its segment; valid only during the sink call.
struct VideoFrame {
  std::int64_t mediaTime = 0;
  std::uint32_t code = 0;
  int width = 0;
  int height = 0;
  std::uint32_t stride = 0;
  std::uint32_t token = 0;
  const std::uint8_t* data = nullptr;
  std::uint64_t bytes = 0;  // of the picture at `stride`
};

struct AudioFrame {
  std::int64_t mediaTime = 0;
  std::uint32_t code = 0;  // 'fl32' or 'sowt', interleaved
  int samples = 0;         // per channel
  int channels = 0;
  int rate = 0;
  std::uint32_t token = 0;
  const std::uint8_t* data = nullptr;
  std::uint64_t bytes = 0;
};

// Receives frames; called on the queue's reader thread, one call at a time
// per queue. Must outlive the readers that call it.
class FrameSink {
 public:
  virtual ~FrameSink() = default;
  virtual void OnVideo(const std::string& sourceId, const VideoFrame& frame) = 0;
  virtual void OnAudio(const std::string& sourceId, const AudioFrame& frame) = 0;
  // A record that was refused (already logged).
  virtual void OnBadRecord(const std::string& /*sourceId*/, const std::string& /*reason*/) {}
};

class QueueReader {
 public:
  QueueReader(std::string sourceId, std::string memoryBase, FrameSink* sink);
  ~QueueReader();
  QueueReader(const QueueReader&) = delete;
  QueueReader& operator=(const QueueReader&) = delete;

  // Connects to 127.0.0.1:port and starts the reader thread. False (logged)
  // when the connection cannot be opened.
  bool Start(int port);
  // Closes the connection and joins the thread; idempotent.
  void Stop();
  // "::delete_memory": the segment `id` goes away.
  void Forget(std::uint32_t id) { cache_.Forget(id); }
  // The host has asked the source to stop: the task removes the queue's
  // segments, so a record still on its way may name one that is gone. From
  // now on such a record is dropped quietly instead of counted as bad.
  void Stopping() { stopping_ = true; }

  // Reads one record of `length` bytes already taken off the wire: checks,
  // maps, delivers; returns the token to give back (also for a refused
  // record, when its token bytes were there). The reader thread's step,
  // public so that tests feed it any bytes.
  bool Handle(const std::uint8_t* wire, std::size_t length, std::uint32_t* token);

  const std::string& MemoryBase() const { return cache_.MemoryBase(); }
  const std::string& SourceId() const { return sourceId_; }
  std::uint64_t Records() const { return records_.load(); }
  std::uint64_t BadRecords() const { return badRecords_.load(); }
  std::size_t MappedSegments() const { return cache_.Count(); }
  bool Ended() const { return ended_.load(); }

 private:
  void ReadLoop();

  const std::string sourceId_;
  FrameSink* const sink_;
  SegmentCache cache_;
  std::shared_ptr<pm::ipc::Connection> connection_;  // set by Start before the thread starts
  std::thread thread_;  // touched by Start, Stop and the destructor (one owner thread)
  std::atomic<bool> running_{false};
  std::atomic<bool> ended_{false};
  std::atomic<bool> stopping_{false};
  std::atomic<std::uint64_t> records_{0};
  std::atomic<std::uint64_t> badRecords_{0};
};

}  // namespace pmhost
