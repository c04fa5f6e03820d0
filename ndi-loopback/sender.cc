#include "ndi-loopback/sender.h"

#include <chrono>
#include <cstring>

#include "ndi-loopback/net.h"
#include "ndi-loopback/picture.h"
#include "ndi-loopback/registry.h"
#include "pm/runtime/clock.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"
#include "pm/runtime/thread_name.h"

namespace ndilb {
namespace {

constexpr int kSendTimeoutMs = 2000;
constexpr std::size_t kMaxInbox = 256;
constexpr std::size_t kMaxConnectionMetadata = 64;
// A connection that has not said hello by then is dropped.
constexpr std::int64_t kHelloTimeoutNs = 2'000'000'000;

std::string TextOf(const ndi_metadata_frame& frame) {
  if (frame.data == nullptr) return {};
  // length counts the terminating zero; stop at the first zero either way.
  if (frame.length > 0) return std::string(frame.data, ::strnlen(frame.data, static_cast<std::size_t>(frame.length)));
  return std::string(frame.data);
}

Piece Iov(const void* p, std::size_t n) { return Piece{p, n}; }

}  // namespace

std::int64_t NowTimestamp() {
  const auto since_1970 = std::chrono::system_clock::now().time_since_epoch();
  return std::chrono::duration_cast<std::chrono::nanoseconds>(since_1970).count() / 100;
}

bool AnnouncesPtz(const std::string& xml) {
  const std::size_t at = xml.find("<ndi_capabilities");
  if (at == std::string::npos) return false;
  const std::size_t end = xml.find('>', at);
  const std::string element = xml.substr(at, end == std::string::npos ? std::string::npos : end - at);
  return element.find("ntk_ptz=\"true\"") != std::string::npos || element.find("ntk_ptz='true'") != std::string::npos;
}

std::unique_ptr<Sender> Sender::Create(const ndi_send_create& settings) {
  std::unique_ptr<Sender> s(new Sender());
  const std::string short_name = settings.ndi_name != nullptr && settings.ndi_name[0] != '\0'
                                     ? settings.ndi_name
                                     : "sender " + std::to_string(pm::CurrentProcessId());
  s->name_ = FullSourceName(short_name);
  s->clock_video_ = settings.clock_video;
  int port = 0;
  s->listen_fd_ = ListenLoopback(&port);
  if (s->listen_fd_ == kNoSocket || !s->wake_.ok()) return nullptr;  // logged
  s->url_ = "127.0.0.1:" + std::to_string(port);
  s->thread_ = std::thread([p = s.get()] { p->Run(); });
  s->registry_path_ = WriteRegistryEntry(RegistryEntry{s->name_, s->url_, pm::CurrentProcessId()});
  if (s->registry_path_.empty()) return nullptr;  // the destructor stops the thread
  return s;
}

Sender::~Sender() {
  RetireRegistryEntry(registry_path_);
  stop_ = true;
  wake_.Wake();
  if (thread_.joinable()) thread_.join();
  std::vector<std::shared_ptr<Conn>> conns;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    conns.swap(conns_);
  }
  for (auto& c : conns) {
    std::lock_guard<std::mutex> lock(c->write_mutex);
    CloseSocket(c->fd);
    c->fd = kNoSocket;
    c->dead = true;
  }
  CloseSocket(listen_fd_);
}

void Sender::Run() {
  pm::SetThreadName("ndi-lb sender");
  std::vector<pm::ip::sys::PollEntry> fds;
  std::vector<std::shared_ptr<Conn>> polled;
  while (!stop_) {
    fds.clear();
    polled.clear();
    fds.push_back({wake_.handle(), false, false});
    fds.push_back({listen_fd_, false, false});
    {
      std::lock_guard<std::mutex> lock(mutex_);
      polled = conns_;
    }
    bool waiting_for_hello = false;
    for (auto& c : polled) {
      fds.push_back({c->fd, false, false});
      waiting_for_hello = waiting_for_hello || !c->hello;
    }
    int n = 0;
    do {
      n = pm::ip::sys::Poll(fds.data(), fds.size(), waiting_for_hello ? 250 : -1);
    } while (n < 0 && pm::ip::LastSocketError::Read().Interrupted());
    if (n < 0) {
      pm::Log(pm::LogType::Normal, "", "ndi-loopback: sender poll failed: %s",
              pm::ip::ErrorText(pm::ip::LastSocketError::Read()).c_str());
      break;
    }
    if (fds[0].ready) wake_.Drain();
    if (stop_) break;
    if (fds[1].ready) Accept();
    const std::int64_t now = pm::SteadyNowNs();
    for (std::size_t i = 0; i < polled.size(); ++i) {
      Conn& c = *polled[i];
      if (c.broken.load() || (fds[i + 2].ready && !ReadFrom(c))) {
        Drop(polled[i]);
      } else if (!c.hello && now - c.accepted_ns > kHelloTimeoutNs) {
        pm::Log(pm::LogType::Normal, "", "ndi-loopback: %s dropped a connection that never said hello", name_.c_str());
        Drop(polled[i]);
      }
    }
  }
  pm::ClearThreadName();
}

void Sender::Accept() {
  const SocketHandle fd = AcceptFrom(listen_fd_);
  if (fd == kNoSocket) return;
  TuneConnection(fd, kSendTimeoutMs);
  std::lock_guard<std::mutex> lock(mutex_);
  conns_.push_back(std::make_shared<Conn>(fd, pm::SteadyNowNs()));
}

bool Sender::ReadFrom(Conn& conn) {
  for (;;) {
    std::span<std::uint8_t> span = conn.decoder.WritableSpan();
    if (span.empty()) return false;
    std::int64_t n = 0;
    pm::ip::LastSocketError error;
    do {
      n = pm::ip::sys::Receive(conn.fd, span.data(), span.size(), pm::ip::sys::ReceiveMode::kDontWait);
      error = n < 0 ? pm::ip::LastSocketError::Read() : pm::ip::LastSocketError{};
    } while (n < 0 && error.Interrupted());
    if (n == 0) return false;
    if (n < 0) return error.WouldBlock();
    if (!conn.decoder.Commit(static_cast<std::size_t>(n))) {
      pm::Log(pm::LogType::Normal, "", "ndi-loopback: %s dropped a receiver connection: %s", name_.c_str(),
              conn.decoder.error().c_str());
      return false;
    }
    while (auto message = conn.decoder.Pop()) {
      if (!Handle(conn, *message)) return false;
    }
  }
}

bool Sender::Handle(Conn& conn, Message& m) {
  if (!conn.hello) {
    if (m.type != MessageType::Hello) {
      pm::Log(pm::LogType::Normal, "", "ndi-loopback: %s dropped a receiver that did not say hello", name_.c_str());
      return false;
    }
    conn.hello = true;
    conn.bandwidth = m.bandwidth;
    std::vector<std::string> metadata;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      metadata = conn_metadata_;
      conn.on_program = m.on_program;
      conn.on_preview = m.on_preview;
    }
    bool ptz = false;
    for (const std::string& xml : metadata) ptz = ptz || AnnouncesPtz(xml);
    {
      // As with the vendor runtime, the receiver learns PTZ support (Ready,
      // a status change) before it captures the connection metadata.
      std::lock_guard<std::mutex> lock(conn.write_mutex);
      EncodedHead ready = EncodeReady(ptz);
      Piece iov[1] = {Iov(ready.bytes, ready.size)};
      if (conn.dead || !WriteAll(conn.fd, iov, 1)) return false;
      for (const std::string& xml : metadata) {
        if (AnnouncesPtz(xml)) continue;
        EncodedHead head = EncodeMetadata(MessageType::ConnMetadata, 0, static_cast<std::uint32_t>(xml.size()));
        Piece parts[2] = {Iov(head.bytes, head.size), Iov(xml.data(), xml.size())};
        if (conn.dead || !WriteAll(conn.fd, parts, 2)) return false;
      }
      if (!WriteTallyEcho(conn, m.on_program, m.on_preview)) return false;
    }
    std::lock_guard<std::mutex> lock(mutex_);
    conn.active = true;
    ++active_count_;
    UpdateTallyLocked();
    ++tally_version_;  // reported again on every connection change
    cv_.notify_all();
    return true;
  }
  switch (m.type) {
    case MessageType::Tally: {
      bool changed = false;
      {
        std::lock_guard<std::mutex> lock(mutex_);
        changed = conn.on_program != m.on_program || conn.on_preview != m.on_preview;
        conn.on_program = m.on_program;
        conn.on_preview = m.on_preview;
        UpdateTallyLocked();
      }
      if (!changed) return true;
      std::lock_guard<std::mutex> lock(conn.write_mutex);
      return WriteTallyEcho(conn, m.on_program, m.on_preview);
    }
    case MessageType::Metadata: {
      std::lock_guard<std::mutex> lock(mutex_);
      if (inbox_.size() >= kMaxInbox) {
        inbox_.pop_front();
        pm::Log(pm::LogType::Normal, "", "ndi-loopback: %s dropped metadata nobody captured", name_.c_str());
      }
      inbox_.emplace_back(std::move(m.text), m.timecode);
      cv_.notify_all();
      return true;
    }
    default:
      pm::Log(pm::LogType::Normal, "", "ndi-loopback: %s dropped a receiver that said hello twice", name_.c_str());
      return false;
  }
}

bool Sender::WriteTallyEcho(Conn& conn, bool on_program, bool on_preview) {
  // Called with conn.write_mutex held.
  const std::string xml = std::string("<ndi_tally_echo on_program=\"") + (on_program ? "true" : "false") +
                          "\" on_preview=\"" + (on_preview ? "true" : "false") + "\"/>";
  EncodedHead head = EncodeMetadata(MessageType::Metadata, 0, static_cast<std::uint32_t>(xml.size()));
  Piece iov[2] = {Iov(head.bytes, head.size), Iov(xml.data(), xml.size())};
  return !conn.dead && WriteAll(conn.fd, iov, 2);
}

void Sender::UpdateTallyLocked() {
  ndi_tally combined{false, false};
  for (const auto& c : conns_) {
    if (!c->active) continue;
    combined.on_program = combined.on_program || c->on_program;
    combined.on_preview = combined.on_preview || c->on_preview;
  }
  if (combined.on_program != tally_.on_program || combined.on_preview != tally_.on_preview) {
    tally_ = combined;
    ++tally_version_;
    cv_.notify_all();
  }
}

void Sender::Drop(const std::shared_ptr<Conn>& conn) {
  {
    std::lock_guard<std::mutex> lock(conn->write_mutex);
    CloseSocket(conn->fd);
    conn->fd = kNoSocket;
    conn->dead = true;
  }
  std::lock_guard<std::mutex> lock(mutex_);
  for (auto it = conns_.begin(); it != conns_.end(); ++it) {
    if (*it != conn) continue;
    conns_.erase(it);
    if (conn->active) {
      --active_count_;
      ++tally_version_;  // reported again on every connection change
    }
    conn->active = false;
    UpdateTallyLocked();
    cv_.notify_all();
    break;
  }
}

bool Sender::WriteTo(Conn& conn, Piece* pieces, int count) {
  {
    std::lock_guard<std::mutex> lock(conn.write_mutex);
    if (conn.dead) return false;
    if (WriteAll(conn.fd, pieces, count)) return true;
    conn.dead = true;
    ShutdownSocket(conn.fd);
  }
  // The I/O thread drops the connection at its next pass.
  conn.broken = true;
  wake_.Wake();
  return false;
}

std::vector<std::shared_ptr<Sender::Conn>> Sender::ActiveConns() {
  std::vector<std::shared_ptr<Conn>> out;
  std::lock_guard<std::mutex> lock(mutex_);
  for (const auto& c : conns_) {
    if (c->active) out.push_back(c);
  }
  return out;
}

void Sender::PaceVideo(const ndi_video_frame_v2& frame) {
  if (!clock_video_ || frame.frame_rate_N <= 0 || frame.frame_rate_D <= 0) return;
  const std::int64_t period =
      static_cast<std::int64_t>(1'000'000'000.0 * frame.frame_rate_D / frame.frame_rate_N);
  std::int64_t wake = 0;
  {
    std::lock_guard<std::mutex> lock(pace_mutex_);
    const std::int64_t now = pm::SteadyNowNs();
    // A frame or two late: the next ones go at once until the cadence is
    // back. Further behind (a stall, or the first frame): start over.
    if (next_video_ns_ == 0 || now > next_video_ns_ + 4 * period || next_video_ns_ > now + 2 * period) {
      next_video_ns_ = now;
    }
    wake = next_video_ns_;
    next_video_ns_ += period;
  }
  const std::int64_t now = pm::SteadyNowNs();
  if (wake > now) std::this_thread::sleep_for(std::chrono::nanoseconds(wake - now));
}

void Sender::SendVideo(const ndi_video_frame_v2& frame) {
  if (frame.data == nullptr) return;
  const int stride = frame.line_stride_in_bytes > 0 ? frame.line_stride_in_bytes
                                                    : DefaultStride(frame.FourCC, frame.xres);
  const std::uint64_t bytes = PictureBytes(frame.FourCC, frame.xres, frame.yres, stride);
  if (bytes == 0) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: %s dropped a video frame it cannot describe (%dx%d, stride %d)",
            name_.c_str(), frame.xres, frame.yres, stride);
    return;
  }
  PaceVideo(frame);
  VideoInfo info;
  info.xres = frame.xres;
  info.yres = frame.yres;
  info.fourcc = frame.FourCC;
  info.frame_rate_N = frame.frame_rate_N;
  info.frame_rate_D = frame.frame_rate_D;
  info.aspect = frame.picture_aspect_ratio;
  info.frame_format = frame.frame_format_type;
  info.line_stride = stride;
  info.timestamp = NowTimestamp();
  info.timecode = frame.timecode == kNdiSendTimecodeSynthesize ? info.timestamp : frame.timecode;
  const std::string text = frame.metadata != nullptr ? std::string(frame.metadata) : std::string();
  if (text.size() > (1u << 20)) return;

  const auto conns = ActiveConns();
  // "lowest": the vendor runtime's proxy size, made once per frame when a
  // receiver asks for it (a picture that fits goes as it is).
  int proxy_width = 0, proxy_height = 0;
  ProxySize(frame.xres, frame.yres, &proxy_width, &proxy_height);
  const bool proxy_same = proxy_width == frame.xres && proxy_height == frame.yres;
  ScaledPicture proxy;
  bool proxy_done = false, proxy_ok = false;
  for (const auto& c : conns) {
    const bool full = c->bandwidth == kNdiBandwidthHighest || c->bandwidth > kNdiBandwidthAudioOnly;
    if (full || (c->bandwidth == kNdiBandwidthLowest && proxy_same)) {
      EncodedHead head = EncodeVideo(info, static_cast<std::uint32_t>(text.size()), bytes);
      Piece iov[3] = {Iov(head.bytes, head.size), Iov(text.data(), text.size()), Iov(frame.data, bytes)};
      WriteTo(*c, iov, 3);
    } else if (c->bandwidth == kNdiBandwidthLowest) {
      if (!proxy_done) {
        proxy_done = true;
        proxy_ok = ScalePicture(frame.FourCC, frame.xres, frame.yres, stride, frame.data, proxy_width, proxy_height,
                                &proxy);
      }
      if (!proxy_ok) continue;
      VideoInfo small = info;
      small.xres = proxy.xres;
      small.yres = proxy.yres;
      small.line_stride = proxy.stride;
      EncodedHead head = EncodeVideo(small, static_cast<std::uint32_t>(text.size()), proxy.bytes.size());
      Piece iov[3] = {Iov(head.bytes, head.size), Iov(text.data(), text.size()),
                      Iov(proxy.bytes.data(), proxy.bytes.size())};
      WriteTo(*c, iov, 3);
    }
    // audio only and metadata only: no video
  }
}

void Sender::SendAudio(const ndi_audio_frame_v2& frame) {
  if (frame.data == nullptr || frame.sample_rate <= 0 || frame.no_channels <= 0 ||
      frame.no_channels > kMaxAudioChannels || frame.no_samples <= 0) {
    return;
  }
  const std::size_t plane = static_cast<std::size_t>(frame.no_samples) * 4;
  const std::size_t stride = frame.channel_stride_in_bytes > 0 ? static_cast<std::size_t>(frame.channel_stride_in_bytes) : plane;
  if (stride < plane) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: %s dropped an audio frame whose channel stride is too short",
            name_.c_str());
    return;
  }
  const std::uint64_t bytes = plane * static_cast<std::size_t>(frame.no_channels);
  AudioInfo info;
  info.sample_rate = frame.sample_rate;
  info.channels = frame.no_channels;
  info.samples = frame.no_samples;
  info.timestamp = NowTimestamp();
  info.timecode = frame.timecode == kNdiSendTimecodeSynthesize ? info.timestamp : frame.timecode;
  const std::string text = frame.metadata != nullptr ? std::string(frame.metadata) : std::string();
  if (text.size() > (1u << 20)) return;
  const auto conns = ActiveConns();
  if (conns.empty()) return;
  // Channels padded apart are packed once; packed ones go out as they are.
  std::vector<std::uint8_t> packed;
  const std::uint8_t* data = reinterpret_cast<const std::uint8_t*>(frame.data);
  if (stride != plane) {
    packed.resize(bytes);
    for (int c = 0; c < frame.no_channels; ++c) {
      std::memcpy(packed.data() + plane * static_cast<std::size_t>(c), data + stride * static_cast<std::size_t>(c), plane);
    }
    data = packed.data();
  }
  for (const auto& c : conns) {
    if (c->bandwidth == kNdiBandwidthMetadataOnly) continue;
    EncodedHead head = EncodeAudio(info, static_cast<std::uint32_t>(text.size()), bytes);
    Piece iov[3] = {Iov(head.bytes, head.size), Iov(text.data(), text.size()), Iov(data, bytes)};
    WriteTo(*c, iov, 3);
  }
}

void Sender::SendMetadata(const ndi_metadata_frame& frame) {
  const std::string text = TextOf(frame);
  if (text.size() > (1u << 20)) return;
  const std::int64_t timecode = frame.timecode == kNdiSendTimecodeSynthesize ? NowTimestamp() : frame.timecode;
  for (const auto& c : ActiveConns()) {
    EncodedHead head = EncodeMetadata(MessageType::Metadata, timecode, static_cast<std::uint32_t>(text.size()));
    Piece iov[2] = {Iov(head.bytes, head.size), Iov(text.data(), text.size())};
    WriteTo(*c, iov, 2);
  }
}

std::int32_t Sender::Capture(ndi_metadata_frame* frame, std::uint32_t timeout_ms) {
  std::unique_lock<std::mutex> lock(mutex_);
  if (!cv_.wait_for(lock, std::chrono::milliseconds(timeout_ms), [&] { return !inbox_.empty(); })) {
    return kNdiFrameNone;
  }
  if (frame == nullptr) return kNdiFrameNone;
  auto [text, timecode] = std::move(inbox_.front());
  inbox_.pop_front();
  Held held;
  held.data = std::make_unique<char[]>(text.size() + 1);
  std::memcpy(held.data.get(), text.data(), text.size());
  held.data[text.size()] = '\0';
  frame->data = held.data.get();
  frame->length = static_cast<int>(text.size() + 1);
  frame->timecode = timecode;
  held_.emplace(frame->data, std::move(held));
  return kNdiFrameMetadata;
}

void Sender::FreeMetadata(const ndi_metadata_frame& frame) {
  std::lock_guard<std::mutex> lock(mutex_);
  held_.erase(frame.data);
}

bool Sender::GetTally(ndi_tally* tally, std::uint32_t timeout_ms) {
  std::unique_lock<std::mutex> lock(mutex_);
  const bool changed = cv_.wait_for(lock, std::chrono::milliseconds(timeout_ms),
                                    [&] { return tally_version_ != tally_reported_; });
  tally_reported_ = tally_version_;
  if (tally != nullptr) *tally = tally_;
  return changed;
}

int Sender::GetConnections(std::uint32_t timeout_ms) {
  std::unique_lock<std::mutex> lock(mutex_);
  cv_.wait_for(lock, std::chrono::milliseconds(timeout_ms), [&] { return active_count_ > 0; });
  return active_count_;
}

void Sender::AddConnectionMetadata(const ndi_metadata_frame& frame) {
  std::string text = TextOf(frame);
  if (text.empty() || text.size() > (1u << 20)) return;
  std::lock_guard<std::mutex> lock(mutex_);
  if (conn_metadata_.size() >= kMaxConnectionMetadata) return;
  conn_metadata_.push_back(std::move(text));
}

void Sender::ClearConnectionMetadata() {
  std::lock_guard<std::mutex> lock(mutex_);
  conn_metadata_.clear();
}

}  // namespace ndilb
