#include "pm/shm/shared_memory_queue.h"

#include <algorithm>
#include <cstring>
#include <limits>
#include <utility>

#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"
#include "pm/ipc/server.h"
#include "pm/runtime/log.h"
#include "pm/shm/shared_gpu_memory.h"

namespace pm {
namespace {

// A GPU segment matches a format field by field; byteSize is not compared and
// a 0 in extra width/height stands for the width/height.
bool SameGpuFormat(const VideoFormat& a, const VideoFormat& b) {
  const auto extraWidth = [](const VideoFormat& f) { return f.extraWidth == 0 ? f.width : f.extraWidth; };
  const auto extraHeight = [](const VideoFormat& f) { return f.extraHeight == 0 ? f.height : f.extraHeight; };
  return a.code == b.code && a.width == b.width && a.height == b.height && a.field == b.field &&
         a.scan == b.scan && a.extra1 == b.extra1 && a.extra2 == b.extra2 && extraWidth(a) == extraWidth(b) &&
         extraHeight(a) == extraHeight(b);
}

// Segments larger than this are never made (a frame never needs them, and the
// rounding below must not overflow).
constexpr std::uint64_t kMaxSegmentBytes = std::uint64_t{1} << 40;

}  // namespace

SharedMemoryQueue::~SharedMemoryQueue() = default;

std::size_t SharedMemoryQueue::BufferCount() const {
  std::lock_guard<std::mutex> guard(lock_);
  return buffers_.size();
}

SharedMemoryQueueProducer::SharedMemoryQueueProducer() = default;

SharedMemoryQueueProducer::~SharedMemoryQueueProducer() {
  // The listener thread calls into the producer: end it first.
  std::shared_ptr<ipc::Server> server;
  {
    std::lock_guard<std::mutex> guard(serverLock_);
    server = std::move(server_);
  }
  if (server) server->Stop();
  server.reset();
  gpuManager_.reset();
}

int SharedMemoryQueueProducer::Port() const {
  std::lock_guard<std::mutex> guard(const_cast<std::mutex&>(serverLock_));
  return server_ ? server_->GetPort() : 0;
}

void SharedMemoryQueueProducer::StartQueue(std::shared_ptr<RpcDispatcher> dispatcher, std::string commandPrefix,
                                           std::string memoryBase, std::function<void()> onHostConnected) {
  gpuManager_ = GetSharedGpuMemoryManager();
  memoryBase_ = std::move(memoryBase);
  dispatcher_ = std::move(dispatcher);
  commandPrefix_ = std::move(commandPrefix);
  payloadSize_ = kQueuePayloadBytes;
  recordSize_ = kQueueRecordBytes;

  int port = 0;
  {
    std::lock_guard<std::mutex> guard(serverLock_);
    if (!server_) {
      std::shared_ptr<ipc::Server> server = ipc::Server::CreateListening();
      if (server) {
        // The server's listener thread is joined before this queue goes away
        // (see the destructor), so it may use `this`; and the server outlives
        // its own listener thread, so the thread uses it by plain pointer. It
        // must never hold an owner of it: a queue destroyed while the host's
        // connection is being accepted would then leave the last owner on
        // the listener thread, whose server destructor would join that very
        // thread and end the process.
        ipc::Server* listening = server.get();
        server->StartWaitingForConnections(
            [this, listening, onHostConnected](std::unique_ptr<ipc::Connection> connection) {
              producer_.AddConnection(std::shared_ptr<ipc::Connection>(std::move(connection)));
              hostConnected_ = true;
              if (onHostConnected) onHostConnected();
              // One host connection per queue.
              listening->Stop();
            });
        server_ = std::move(server);
      }
    }
    if (server_) port = server_->GetPort();
  }
  if (port == 0) {
    LogText("", "SharedMemoryQueueProducer: could not listen for the host's queue connection\n");
  }

  producer_.Start(recordSize_, [this](std::uint32_t token) { OnTokenReleased(token); });

  nlohmann::json payload = {{"port", port}, {"memoryBase", memoryBase_}};
  if (dispatcher_) dispatcher_->RpcRequest(commandPrefix_ + "::start_queue", payload, kControlTimeoutMs, {});
}

bool SharedMemoryQueueProducer::SendBuffer(const std::shared_ptr<SharedMemory>& segment,
                                           const std::uint8_t* payload) {
  if (!segment || payload == nullptr) return false;
  bool inPool;
  {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = buffers_.find(segment->id);
    inPool = it != buffers_.end() && it->second == segment;
    if (inPool && payloadSize_ != kQueuePayloadBytes) return false;  // not started
  }
  if (!inPool) {
    LogText("", "SharedMemoryQueueProducer: Attempt to use deleted buffer\n");
    return false;
  }
  PackedQueueRecord record;
  record.descriptor = segment->descriptor;
  std::memcpy(record.payload, payload, kQueuePayloadBytes);
  SealQueueRecord(record);
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(&record);
  BufferList list;
  list.emplace_back(bytes + offsetof(PackedQueueRecord, descriptor), std::uint32_t{sizeof record.descriptor});
  list.emplace_back(bytes + offsetof(PackedQueueRecord, payload), std::uint32_t{sizeof record.payload});
  list.emplace_back(bytes + offsetof(PackedQueueRecord, check), std::uint32_t{sizeof record.check});
  return producer_.Send(segment->id, std::move(list));
}

std::uint32_t SharedMemoryQueueProducer::NextBufferId() {
  std::uint32_t candidate = nextId_ == 0 ? 1 : nextId_;
  // Skip ids still in the pool; 0 is never handed out.
  while (buffers_.count(candidate) != 0) {
    ++candidate;
    if (candidate == 0) candidate = 1;
  }
  nextId_ = candidate + 1;
  return candidate;
}

void SharedMemoryQueueProducer::SeedNextId(std::uint32_t id) {
  std::lock_guard<std::mutex> guard(lock_);
  nextId_ = id;
}

std::shared_ptr<SharedMemory> SharedMemoryQueueProducer::AllocateCpuBuffer(std::uint64_t bytes) {
  if (bytes == 0 || bytes > kMaxSegmentBytes) return nullptr;
  const std::uint64_t size = (bytes + kSegmentAlignment - 1) / kSegmentAlignment * kSegmentAlignment;
  std::shared_ptr<SharedCpuMemory> segment = NewCpuSegment();
  {
    std::lock_guard<std::mutex> guard(lock_);
    segment->id = NextBufferId();
  }
  if (!segment->Create(memoryBase_ + std::to_string(segment->id), size)) return nullptr;
  std::lock_guard<std::mutex> guard(lock_);
  segment->inUse += 1;
  buffers_[segment->id] = segment;
  return segment;
}

std::shared_ptr<SharedMemory> SharedMemoryQueueProducer::AllocateVideoBuffer(const VideoFormat& format,
                                                                             std::uint32_t minimumStride,
                                                                             bool reuseOnly) {
  if (format.code == kCodeJpeg) return nullptr;
  std::int64_t requiredStride;
  std::int64_t byteCount;
  {
    std::lock_guard<std::mutex> guard(lock_);
    requiredStride = std::max<std::int64_t>(DefaultStride(format), minimumStride);
    byteCount = requiredStride > std::numeric_limits<std::int32_t>::max()
                    ? 0
                    : FrameSize(format, static_cast<std::int32_t>(requiredStride));
    std::shared_ptr<SharedMemory> chosen;
    for (const auto& [id, segment] : buffers_) {
      if (!segment || segment->id != id || segment->inUse.load() >= 1) continue;
      if (segment->descriptor.type == kGpuMemoryType) {
        auto* gpu = dynamic_cast<SharedGpuMemory*>(segment.get());
        if (gpu != nullptr && SameGpuFormat(gpu->Format(), format)) {
          chosen = segment;
          break;
        }
      } else if (segment->descriptor.type == kCpuMemoryType) {
        const std::int64_t stride = segment->descriptor.stride;
        if (stride > std::numeric_limits<std::int32_t>::max()) continue;
        const std::int64_t needed = FrameSize(format, static_cast<std::int32_t>(stride));
        if (needed <= 0 || segment->Size() < static_cast<std::uint64_t>(needed) || stride < requiredStride) continue;
        if (!chosen || segment->Size() < chosen->Size()) chosen = segment;
      }
    }
    if (chosen) {
      chosen->inUse += 1;
      return chosen;
    }
  }
  if (reuseOnly) return nullptr;
  if (gpuManager_) {
    std::shared_ptr<SharedMemory> segment = gpuManager_->Allocate(format);
    if (!segment) return nullptr;
    std::lock_guard<std::mutex> guard(lock_);
    segment->id = NextBufferId();
    segment->inUse += 1;
    buffers_[segment->id] = segment;
    return segment;
  }
  if (byteCount < 1 || requiredStride < 1) return nullptr;
  std::shared_ptr<SharedMemory> segment = AllocateCpuBuffer(static_cast<std::uint64_t>(byteCount));
  if (segment) segment->descriptor.stride = static_cast<std::uint32_t>(requiredStride);
  return segment;
}

std::shared_ptr<SharedMemory> SharedMemoryQueueProducer::FindFreeBuffer(std::uint64_t minimumSize) {
  std::lock_guard<std::mutex> guard(lock_);
  std::shared_ptr<SharedMemory> best;
  for (const auto& [id, segment] : buffers_) {
    if (!segment || segment->id != id || segment->inUse.load() >= 1 || segment->Size() < minimumSize) continue;
    if (!best || segment->Size() < best->Size()) best = segment;
  }
  if (!best || best->descriptor.type != kCpuMemoryType) return nullptr;
  // The finder takes the hold under the same lock, so no other request can
  // pick the segment while the caller writes it.
  best->inUse += 1;
  return best;
}

void SharedMemoryQueueProducer::DeleteBuffer(const std::shared_ptr<SharedMemory>& segment) {
  if (!segment) return;
  nlohmann::json payload = {{"unique_id", segment->id}};
  if (dispatcher_) dispatcher_->RpcRequest(commandPrefix_ + "::delete_memory", payload, kControlTimeoutMs, {});
  std::lock_guard<std::mutex> guard(lock_);
  auto it = buffers_.find(segment->id);
  if (it != buffers_.end() && it->second == segment) buffers_.erase(it);
}

bool SharedMemoryQueueProducer::DeleteSmallestFreeBuffer() {
  std::shared_ptr<SharedMemory> smallest;
  {
    std::lock_guard<std::mutex> guard(lock_);
    for (const auto& [id, segment] : buffers_) {
      if (!segment || segment->inUse.load() >= 1) continue;
      if (!smallest || segment->Size() < smallest->Size()) smallest = segment;
    }
  }
  if (!smallest) return false;
  DeleteBuffer(smallest);
  return true;
}

void SharedMemoryQueueProducer::ReturnBuffer(const std::shared_ptr<SharedMemory>& segment) {
  if (!segment) return;
  std::lock_guard<std::mutex> guard(lock_);
  segment->inUse -= 1;
}

void SharedMemoryQueueProducer::OnTokenReleased(std::uint32_t token) {
  std::lock_guard<std::mutex> guard(lock_);
  auto it = buffers_.find(token);
  if (it != buffers_.end() && it->second) it->second->inUse -= 1;
}

}  // namespace pm
