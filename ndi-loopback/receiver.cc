#include "ndi-loopback/receiver.h"

#include <chrono>
#include <cstdio>
#include <cstring>

#include "ndi-loopback/net.h"
#include "ndi-loopback/picture.h"
#include "ndi-loopback/registry.h"
#include "ndi-loopback/sender.h"
#include "pm/runtime/log.h"
#include "pm/runtime/thread_name.h"

namespace ndilb {
namespace {

constexpr int kSendTimeoutMs = 1000;
constexpr int kConnectTimeoutMs = 500;
constexpr std::size_t kBlockingReadBytes = 256 * 1024;

int Slot(std::int32_t type) {
  switch (type) {
    case kNdiFrameVideo: return 0;
    case kNdiFrameAudio: return 1;
    case kNdiFrameMetadata: return 2;
    default: return -1;
  }
}

int MaxOf(int slot) {
  return slot == 0 ? Receiver::kMaxVideo : slot == 1 ? Receiver::kMaxAudio : Receiver::kMaxMetadata;
}

}  // namespace

PtzValue PtzNumber(const char* key, double value) {
  char number[64];
  std::snprintf(number, sizeof number, "%f", value);
  return {key, number};
}

PtzValue PtzInteger(const char* key, int value) { return {key, std::to_string(value)}; }

std::string PtzXml(const char* element, std::initializer_list<PtzValue> values) {
  std::string xml = std::string("<ntk_ptz_") + element;
  for (const PtzValue& v : values) xml += std::string(" ") + v.key + "=\"" + v.text + "\"";
  return xml + "/>";
}

Receiver::Receiver(const ndi_recv_create& settings)
    : name_(settings.source_to_connect_to.ndi_name != nullptr ? settings.source_to_connect_to.ndi_name : ""),
      url_(settings.source_to_connect_to.url_address != nullptr ? settings.source_to_connect_to.url_address : ""),
      bandwidth_(settings.bandwidth),
      color_format_(settings.color_format),
      pool_(std::make_shared<BufferPool>(4)) {
  // As with the vendor runtime, the first capture reports a status change
  // at once, before any connection; a later one comes with each connection
  // whose sender takes PTZ.
  auto created = std::make_unique<Item>();
  created->type = kNdiFrameStatusChange;
  Enqueue(std::move(created));
  thread_ = std::thread([this] { Run(); });
}

Receiver::~Receiver() {
  stop_ = true;
  wake_.Wake();
  {
    // Serve publishes its socket before it looks at stop_, so either it sees
    // stop_ or this sees the socket.
    std::lock_guard<std::mutex> lock(write_mutex_);
    ShutdownSocket(fd_);
  }
  if (thread_.joinable()) thread_.join();
}

std::string Receiver::ListedUrl() const {
  if (name_.empty()) return {};
  for (const RegistryEntry& e : ListRegistry()) {
    if (e.name == name_) return e.url;
  }
  return {};
}

void Receiver::Run() {
  pm::SetThreadName("ndi-lb receiver");
  while (!stop_) {
    // As with the vendor runtime: the URL first, whoever listens there; when
    // nothing answers, the URL listed for the name (a sender that came back
    // may listen on a new port).
    SocketHandle fd = url_.empty() ? kNoSocket : ConnectTo(url_, kConnectTimeoutMs);
    if (fd == kNoSocket) {
      const std::string listed = ListedUrl();
      if (!listed.empty() && listed != url_) fd = ConnectTo(listed, kConnectTimeoutMs);
    }
    if (fd != kNoSocket) {
      Serve(fd);
      connected_ = false;
      ptz_ = false;
    }
    if (stop_) break;
    if (!wake_.ok()) {
      std::this_thread::sleep_for(std::chrono::milliseconds(kRetryMs));
    } else if (wake_.Wait(kRetryMs)) {
      wake_.Drain();
    }
  }
  pm::ClearThreadName();
}

void Receiver::Serve(SocketHandle fd) {
  namespace sys = pm::ip::sys;
  TuneConnection(fd, kSendTimeoutMs);
  {
    std::lock_guard<std::mutex> lock(write_mutex_);
    EncodedHead hello = EncodeHello(bandwidth_, tally_.on_program, tally_.on_preview);
    Piece piece{hello.bytes, hello.size};
    if (!WriteAll(fd, &piece, 1)) {
      CloseSocket(fd);
      return;
    }
    fd_ = fd;
    broken_ = false;
  }
  Decoder decoder(ReceiverSideLimits(), pool_);
  bool open = true;
  while (open && !stop_ && !broken_) {
    std::span<std::uint8_t> span = decoder.WritableSpan();
    // The rest of a large picture is read in one blocking call straight into
    // its buffer; the destructor shuts the socket down to end such a wait.
    const auto mode = span.size() >= kBlockingReadBytes ? sys::ReceiveMode::kWaitAll : sys::ReceiveMode::kDontWait;
    std::int64_t n = 0;
    pm::ip::LastSocketError error;
    do {
      n = sys::Receive(fd, span.data(), span.size(), mode);
      error = n < 0 ? pm::ip::LastSocketError::Read() : pm::ip::LastSocketError{};
    } while (n < 0 && error.Interrupted());
    if (n == 0) break;
    if (n < 0) {
      if (!error.WouldBlock()) break;
      sys::PollEntry p[2] = {{fd, false, false}, {wake_.handle(), false, false}};
      if (sys::Poll(p, wake_.ok() ? 2 : 1, 250) > 0 && wake_.ok() && p[1].ready) wake_.Drain();
      continue;
    }
    if (!decoder.Commit(static_cast<std::size_t>(n))) {
      pm::Log(pm::LogType::Normal, "", "ndi-loopback: receiver of %s dropped its connection: %s",
              name_.empty() ? url_.c_str() : name_.c_str(), decoder.error().c_str());
      break;
    }
    while (auto message = decoder.Pop()) {
      auto item = std::make_unique<Item>();
      switch (message->type) {
        case MessageType::Video:
          if (bandwidth_ == kNdiBandwidthAudioOnly || bandwidth_ == kNdiBandwidthMetadataOnly) continue;
          if (!Deliverable(*message)) continue;
          item->type = kNdiFrameVideo;
          break;
        case MessageType::Audio:
          if (bandwidth_ == kNdiBandwidthMetadataOnly) continue;
          item->type = kNdiFrameAudio;
          break;
        case MessageType::Metadata:
        case MessageType::ConnMetadata:
          item->type = kNdiFrameMetadata;
          break;
        case MessageType::Ready:
          ptz_ = message->ptz_supported;
          connected_ = true;
          if (!message->ptz_supported) continue;
          item->type = kNdiFrameStatusChange;
          break;
        default:
          continue;  // the decoder admits no other type
      }
      item->message = std::move(*message);
      Enqueue(std::move(item));
    }
  }
  {
    std::lock_guard<std::mutex> lock(write_mutex_);
    CloseSocket(fd);
    fd_ = kNoSocket;
  }
  // Frames of the connection that are still queued stay capturable.
}

bool Receiver::Deliverable(Message& m) {
  VideoInfo& v = m.video;
  const bool alpha = HasAlpha(v.fourcc, v.xres, v.yres, v.line_stride, m.payload.data());
  const std::uint32_t to = DeliveredFourCC(color_format_, alpha);
  const int stride = DeliveredStride(to, v.xres);
  if (to == v.fourcc && stride == v.line_stride) return true;  // as it came
  const std::uint64_t bytes = PictureBytes(to, v.xres, v.yres, stride);
  Buffer out = bytes > 0 ? pool_->Acquire(static_cast<std::size_t>(bytes)) : Buffer();
  if (!out || !ConvertPicture(v.fourcc, v.xres, v.yres, v.line_stride, m.payload.data(), to, stride, out.data())) {
    if (out) pool_->Release(std::move(out));
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: receiver of %s dropped a %dx%d picture it cannot deliver",
            name_.empty() ? url_.c_str() : name_.c_str(), v.xres, v.yres);
    return false;
  }
  pool_->Release(std::move(m.payload));
  m.payload = std::move(out);
  v.fourcc = to;
  v.line_stride = stride;
  return true;
}

void Receiver::Enqueue(std::unique_ptr<Item> item) {
  std::lock_guard<std::mutex> lock(mutex_);
  const int slot = Slot(item->type);
  if (slot >= 0) {
    if (queued_[slot] >= MaxOf(slot)) {
      for (auto it = queue_.begin(); it != queue_.end(); ++it) {
        if ((*it)->type != item->type) continue;
        pool_->Release(std::move((*it)->message.payload));
        queue_.erase(it);
        --queued_[slot];
        break;
      }
    }
    ++queued_[slot];
  }
  queue_.push_back(std::move(item));
  cv_.notify_all();
}

std::int32_t Receiver::Capture(ndi_video_frame_v2* video, ndi_audio_frame_v2* audio, ndi_metadata_frame* metadata,
                               std::uint32_t timeout_ms) {
  auto wanted = [&](const Item& item) {
    switch (item.type) {
      case kNdiFrameVideo: return video != nullptr;
      case kNdiFrameAudio: return audio != nullptr;
      case kNdiFrameMetadata: return metadata != nullptr;
      default: return true;
    }
  };
  std::unique_lock<std::mutex> lock(mutex_);
  std::deque<std::unique_ptr<Item>>::iterator found;
  auto find = [&] {
    for (found = queue_.begin(); found != queue_.end(); ++found) {
      if (wanted(**found)) return true;
    }
    return false;
  };
  if (!cv_.wait_for(lock, std::chrono::milliseconds(timeout_ms), find)) return kNdiFrameNone;
  std::unique_ptr<Item> item = std::move(*found);
  queue_.erase(found);
  const int slot = Slot(item->type);
  if (slot >= 0) --queued_[slot];
  const std::int32_t type = item->type;
  Message& m = item->message;
  const void* key = nullptr;
  switch (type) {
    case kNdiFrameVideo:
      *video = ndi_video_frame_v2{};
      video->xres = m.video.xres;
      video->yres = m.video.yres;
      video->FourCC = m.video.fourcc;
      video->frame_rate_N = m.video.frame_rate_N;
      video->frame_rate_D = m.video.frame_rate_D;
      video->picture_aspect_ratio = m.video.aspect;
      video->frame_format_type = m.video.frame_format;
      video->timecode = m.video.timecode;
      video->data = m.payload.data();
      video->line_stride_in_bytes = m.video.line_stride;
      video->metadata = m.text.empty() ? nullptr : m.text.c_str();
      video->timestamp = m.video.timestamp;
      key = video->data;
      break;
    case kNdiFrameAudio:
      *audio = ndi_audio_frame_v2{};
      audio->sample_rate = m.audio.sample_rate;
      audio->no_channels = m.audio.channels;
      audio->no_samples = m.audio.samples;
      audio->timecode = m.audio.timecode;
      audio->data = reinterpret_cast<float*>(m.payload.data());
      audio->channel_stride_in_bytes = m.audio.samples * 4;
      audio->metadata = m.text.empty() ? nullptr : m.text.c_str();
      audio->timestamp = m.audio.timestamp;
      key = audio->data;
      break;
    case kNdiFrameMetadata:
      *metadata = ndi_metadata_frame{};
      metadata->length = static_cast<int>(m.text.size() + 1);
      metadata->timecode = m.timecode;
      metadata->data = m.text.data();
      key = metadata->data;
      break;
    default:
      return type;  // status change: nothing to hold
  }
  held_.emplace(key, std::move(item));
  return type;
}

void Receiver::FreeVideo(const ndi_video_frame_v2& frame) {
  std::unique_ptr<Item> item;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    auto it = held_.find(frame.data);
    if (it == held_.end() || it->second->type != kNdiFrameVideo) return;
    item = std::move(it->second);
    held_.erase(it);
  }
  pool_->Release(std::move(item->message.payload));
}

void Receiver::FreeAudio(const ndi_audio_frame_v2& frame) {
  std::unique_ptr<Item> item;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    auto it = held_.find(frame.data);
    if (it == held_.end() || it->second->type != kNdiFrameAudio) return;
    item = std::move(it->second);
    held_.erase(it);
  }
  pool_->Release(std::move(item->message.payload));
}

void Receiver::FreeMetadata(const ndi_metadata_frame& frame) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = held_.find(frame.data);
  if (it == held_.end() || it->second->type != kNdiFrameMetadata) return;
  held_.erase(it);
}

bool Receiver::WriteMessage(const void* head, std::size_t head_size, const std::string& text) {
  // Called with write_mutex_ held.
  if (fd_ == kNoSocket) return false;
  Piece pieces[2] = {{head, head_size}, {text.data(), text.size()}};
  if (WriteAll(fd_, pieces, 2)) return true;
  // The network thread notices and reconnects.
  ShutdownSocket(fd_);
  broken_ = true;
  wake_.Wake();
  return false;
}

bool Receiver::SetTally(const ndi_tally& tally) {
  std::lock_guard<std::mutex> lock(write_mutex_);
  tally_ = tally;  // also sent with the hello of every later connection
  // Taken whether or not a sender is connected, as the vendor runtime does.
  // Once the hello is out (fd_ is set under this lock right after it), the
  // change must follow it on the wire even before the sender's Ready.
  if (fd_ == kNoSocket) return true;
  EncodedHead head = EncodeTally(tally.on_program, tally.on_preview);
  WriteMessage(head.bytes, head.size, std::string());
  return true;
}

bool Receiver::SendMetadata(const ndi_metadata_frame& frame) {
  if (frame.data == nullptr) return false;
  const std::string text = frame.length > 0
                               ? std::string(frame.data, ::strnlen(frame.data, static_cast<std::size_t>(frame.length)))
                               : std::string(frame.data);
  if (text.size() > (1u << 20)) return false;
  std::lock_guard<std::mutex> lock(write_mutex_);
  if (!connected_) return false;
  // The timecode goes as given: the vendor runtime does not make one up on
  // this side.
  EncodedHead head = EncodeMetadata(MessageType::Metadata, frame.timecode, static_cast<std::uint32_t>(text.size()));
  return WriteMessage(head.bytes, head.size, text);
}

bool Receiver::SendPtz(const std::string& xml) {
  std::lock_guard<std::mutex> lock(write_mutex_);
  if (!connected_) return false;
  EncodedHead head = EncodeMetadata(MessageType::Metadata, 0, static_cast<std::uint32_t>(xml.size()));
  return WriteMessage(head.bytes, head.size, xml);
}

}  // namespace ndilb
