#include "pm-host/queue_reader.h"

#include <cstring>

#include "pm/runtime/log.h"
#include "pm/runtime/thread_name.h"

namespace pmhost {

namespace {
// A read wakes this often to look at the stop flag; Stop closes the
// connection, which ends a read at once anyway.
constexpr std::int64_t kReadTimeoutMs = 250;
}  // namespace

QueueReader::QueueReader(std::string sourceId, std::string memoryBase, FrameSink* sink)
    : sourceId_(std::move(sourceId)), sink_(sink), cache_(std::move(memoryBase)) {}

QueueReader::~QueueReader() { Stop(); }

bool QueueReader::Start(int port) {
  if (thread_.joinable()) return false;
  if (port <= 0 || port > 65535) {
    pm::Log(pm::LogType::Normal, "", "QueueReader: bad port %d for '%s'\n", port, sourceId_.c_str());
    return false;
  }
  connection_ = pm::ipc::Connection::Open(port);
  if (!connection_) {
    pm::Log(pm::LogType::Normal, "", "QueueReader: cannot connect to port %d for '%s'\n", port, sourceId_.c_str());
    return false;
  }
  running_ = true;
  thread_ = std::thread([this] { ReadLoop(); });
  return true;
}

void QueueReader::Stop() {
  running_ = false;
  if (connection_) connection_->Close();
  if (thread_.joinable()) thread_.join();
  cache_.Clear();
}

bool QueueReader::Handle(const std::uint8_t* wire, std::size_t length, std::uint32_t* token) {
  QueueRecord record;
  std::string reason;
  const bool parsed = ParseRecord(wire, length, &record, &reason);
  *token = record.token;
  const bool hasToken = wire != nullptr && length >= 4;
  ++records_;
  std::shared_ptr<const SegmentMapping> mapping;
  if (parsed) {
    mapping = cache_.Map(record.token, record.descriptor.size);
    if (!mapping && stopping_) return hasToken;  // the segment went with the stopped source
    if (!mapping) reason = "segment " + std::to_string(record.token) + " cannot be mapped";
  }
  if (!mapping) {
    ++badRecords_;
    pm::Log(pm::LogType::Normal, "", "QueueReader: '%s': record skipped: %s\n", sourceId_.c_str(), reason.c_str());
    if (sink_ != nullptr) sink_->OnBadRecord(sourceId_, reason);
    return hasToken;
  }
  if (sink_ != nullptr) {
    if (record.kind == RecordKind::Video) {
      VideoFrame frame;
      frame.mediaTime = record.mediaTime;
      frame.code = record.video.code;
      frame.width = record.video.width;
      frame.height = record.video.height;
      frame.stride = record.stride;
      frame.token = record.token;
      frame.data = mapping->Data();
      frame.bytes = record.frameBytes;
      sink_->OnVideo(sourceId_, frame);
    } else {
      AudioFrame frame;
      frame.mediaTime = record.mediaTime;
      frame.code = record.audio.code;
      frame.samples = record.samples;
      frame.channels = static_cast<std::int8_t>(record.audio.channels);
      frame.rate = static_cast<int>(record.audio.sampleRate);
      frame.token = record.token;
      frame.data = mapping->Data();
      frame.bytes = record.frameBytes;
      sink_->OnAudio(sourceId_, frame);
    }
  }
  return true;
}

void QueueReader::ReadLoop() {
  pm::SetThreadName("pm-host queue");
  std::uint8_t wire[pm::kQueueWireRecordBytes];
  while (running_) {
    if (!connection_->ReadFromSocket(wire, sizeof wire, kReadTimeoutMs)) {
      if (!connection_->IsConnected()) break;
      continue;  // timed out: look at the stop flag
    }
    std::uint32_t token = 0;
    if (Handle(wire, sizeof wire, &token)) {
      pm::BufferList list;
      list.emplace_back(&token, 4u);
      if (!connection_->Send(std::move(list)) && !connection_->IsConnected()) break;
    }
  }
  ended_ = true;
  pm::ClearThreadName();
}

}  // namespace pmhost
