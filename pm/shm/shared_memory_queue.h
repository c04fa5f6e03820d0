#pragma once
// A source's pool of shared-memory segments and the record channel that tells
// the host which segment holds a new frame.
//
// Segments are named memoryBase + decimal id ("/" prepended for the system)
// and sized in multiples of 4096 bytes. The pool is announced to the host with
// the request "<commandPrefix>::start_queue" {"port", "memoryBase"}; the host
// connects to that port once (the server stops listening after the first
// connection) and then receives, for every sent buffer, the segment id as a
// 4-byte token followed by the 60-byte queue record (pm/shm/queue_record.h:
// the segment's descriptor, the payload the frame buffers fill, check bytes),
// and returns the token when it has read the segment. Segments that go away
// are announced with "<commandPrefix>::delete_memory" {"unique_id": id}.
//
// Holds (SharedMemory::inUse): a segment handed out by AllocateVideoBuffer,
// AllocateCpuBuffer or FindFreeBuffer carries one hold; SendBuffer passes it to
// the record, and it is dropped when every host connection has returned the
// token (at once when no host is connected); ReturnBuffer drops it for a
// segment that was not sent. Only segments without holds are reused or
// deleted.
//
// Threads: sources allocate, send and return on their frame threads; token
// releases arrive on the producer's thread; the host connection is accepted
// on the server's listener thread. Lock order: the producer's lock, then
// lock_; lock_ is never held while the producer, the dispatcher, the GPU
// manager or the log is called.

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "pm/ipc/queue_producer.h"
#include "pm/shm/formats.h"
#include "pm/shm/queue_record.h"
#include "pm/shm/shared_memory.h"

namespace pm {

class RpcDispatcher;
class SharedGpuMemoryManager;
namespace ipc {
class Server;
}  // namespace ipc

class SharedMemoryQueue : public std::enable_shared_from_this<SharedMemoryQueue> {
 public:
  SharedMemoryQueue() = default;
  SharedMemoryQueue(const SharedMemoryQueue&) = delete;
  SharedMemoryQueue& operator=(const SharedMemoryQueue&) = delete;
  virtual ~SharedMemoryQueue();

  // Segments in the pool (diagnostics and tests).
  std::size_t BufferCount() const;
  const std::string& MemoryBase() const { return memoryBase_; }

 protected:
  mutable std::mutex lock_;  // guards buffers_ and the inUse changes made here
  std::map<std::uint32_t, std::shared_ptr<SharedMemory>> buffers_;  // guarded by lock_
  std::shared_ptr<RpcDispatcher> dispatcher_;  // set by StartQueue before any use
  std::string memoryBase_;
  std::string commandPrefix_;
};

class SharedMemoryQueueProducer : public SharedMemoryQueue {
 public:
  static constexpr std::uint64_t kSegmentAlignment = 4096;
  static constexpr std::int64_t kControlTimeoutMs = 100;

  SharedMemoryQueueProducer();
  // Stops listening, then stops the producer; tokens still pending are dropped.
  ~SharedMemoryQueueProducer() override;

  // Announces the pool (see the file comment). `onHostConnected` runs on the
  // listener thread when the host's connection arrives; may be empty. A
  // second call keeps the server (and its port) and restarts the producer.
  void StartQueue(std::shared_ptr<RpcDispatcher> dispatcher, std::string commandPrefix, std::string memoryBase,
                  std::function<void()> onHostConnected);

  // Sends the record of `segment` with `payload` (kQueuePayloadBytes bytes).
  // On true the segment's hold travels with the record; on false (queue not
  // started, segment no longer in the pool, record refused) nothing was sent
  // and the hold stays with the caller.
  bool SendBuffer(const std::shared_ptr<SharedMemory>& segment, const std::uint8_t* payload);
  bool SendBuffer(const std::shared_ptr<SharedMemory>& segment, const VideoPayload& payload) {
    return SendBuffer(segment, reinterpret_cast<const std::uint8_t*>(&payload));
  }
  bool SendBuffer(const std::shared_ptr<SharedMemory>& segment, const AudioPayload& payload) {
    return SendBuffer(segment, reinterpret_cast<const std::uint8_t*>(&payload));
  }

  // A free segment of the pool that fits `format` (at least the format's frame
  // size at the larger of its default stride and `minimumStride`), with one
  // hold; else, unless reuseOnly, a new one (from the GPU manager when the
  // process has one). 'JPEG' and formats without a size get none.
  std::shared_ptr<SharedMemory> AllocateVideoBuffer(const VideoFormat& format, std::uint32_t minimumStride,
                                                    bool reuseOnly);
  // A new CPU segment of at least `bytes` (rounded up to 4096), with one hold.
  std::shared_ptr<SharedMemory> AllocateCpuBuffer(std::uint64_t bytes);
  // The smallest free CPU segment of at least `minimumSize` bytes, with one
  // hold, or none.
  std::shared_ptr<SharedMemory> FindFreeBuffer(std::uint64_t minimumSize);
  // Tells the host the segment goes away and removes it from the pool.
  void DeleteBuffer(const std::shared_ptr<SharedMemory>& segment);
  // Deletes the smallest free segment; false when none is free.
  bool DeleteSmallestFreeBuffer();
  // Drops one hold of a segment that was not sent.
  void ReturnBuffer(const std::shared_ptr<SharedMemory>& segment);
  // The host has returned `token` on every connection.
  void OnTokenReleased(std::uint32_t token);

  // Where the next id search starts (diagnostics and tests of the wrap-around).
  void SeedNextId(std::uint32_t id);

  // True once the host's queue connection has been accepted.
  bool HostConnected() const { return hostConnected_.load(); }

  // The port the host connects to; 0 before StartQueue.
  int Port() const;

 private:
  std::uint32_t NextBufferId();  // lock_ held

  std::atomic<std::uint32_t> payloadSize_{0};
  std::uint32_t recordSize_ = 0;
  ipc::queue::Producer producer_;
  std::mutex serverLock_;  // guards server_ (taken alone)
  std::shared_ptr<ipc::Server> server_;
  std::uint32_t nextId_ = 1;  // guarded by lock_
  std::shared_ptr<SharedGpuMemoryManager> gpuManager_;
  std::atomic<bool> hostConnected_{false};
};

}  // namespace pm
