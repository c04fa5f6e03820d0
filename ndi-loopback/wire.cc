#include "ndi-loopback/wire.h"

#include <cstring>

#include "ndi-loopback/picture.h"
#include "pm/runtime/little_endian.h"

namespace ndilb {
namespace {

using pm::LoadLe16;
using pm::LoadLe32;
using pm::LoadLe64;
using pm::StoreLe16;
using pm::StoreLe32;
using pm::StoreLe64;

std::int32_t LoadLeI32(const std::uint8_t* p) { return static_cast<std::int32_t>(LoadLe32(p)); }
std::int64_t LoadLeI64(const std::uint8_t* p) { return static_cast<std::int64_t>(LoadLe64(p)); }

EncodedHead Head(MessageType type, std::uint32_t text_size, std::uint64_t payload_size) {
  EncodedHead h;
  const std::size_t info = InfoSize(type);
  StoreLe32(h.bytes, kWireMagic);
  StoreLe16(h.bytes + 4, static_cast<std::uint16_t>(type));
  StoreLe16(h.bytes + 6, static_cast<std::uint16_t>(info));
  StoreLe32(h.bytes + 8, text_size);
  StoreLe32(h.bytes + 12, 0);
  StoreLe64(h.bytes + 16, payload_size);
  std::memset(h.bytes + kHeaderSize, 0, info);
  h.size = kHeaderSize + info;
  return h;
}

}  // namespace

std::size_t InfoSize(MessageType type) {
  switch (type) {
    case MessageType::Hello: return 8;
    case MessageType::Tally: return 4;
    case MessageType::Metadata:
    case MessageType::ConnMetadata: return 8;
    case MessageType::Ready: return 4;
    case MessageType::Video: return 48;
    case MessageType::Audio: return 32;
  }
  return 0;
}

DecoderLimits SenderSideLimits() {
  DecoderLimits l;
  l.allowed_types = TypeBit(MessageType::Hello) | TypeBit(MessageType::Tally) | TypeBit(MessageType::Metadata);
  l.max_text = 1u << 20;
  l.max_payload = 0;
  return l;
}

DecoderLimits ReceiverSideLimits() {
  DecoderLimits l;
  l.allowed_types = TypeBit(MessageType::Metadata) | TypeBit(MessageType::ConnMetadata) |
                    TypeBit(MessageType::Ready) | TypeBit(MessageType::Video) | TypeBit(MessageType::Audio);
  l.max_text = 1u << 20;
  l.max_payload = std::uint64_t{1} << 30;  // a 16384 x 16384 BGRA picture
  return l;
}

Buffer BufferPool::Acquire(std::size_t size) {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    for (std::size_t i = 0; i < free_.size(); ++i) {
      if (free_[i].capacity_ >= size && free_[i].capacity_ <= size + size / 4 + 4096) {
        Buffer b = std::move(free_[i]);
        free_.erase(free_.begin() + static_cast<std::ptrdiff_t>(i));
        b.size_ = size;
        return b;
      }
    }
  }
  return Buffer(std::make_unique_for_overwrite<std::uint8_t[]>(size == 0 ? 1 : size), size, size);
}

void BufferPool::Release(Buffer buffer) {
  if (!buffer) return;
  std::lock_guard<std::mutex> lock(mutex_);
  if (free_.size() >= keep_) free_.erase(free_.begin());  // the oldest goes
  free_.push_back(std::move(buffer));
}

Decoder::Decoder(DecoderLimits limits, std::shared_ptr<BufferPool> pool)
    : limits_(limits), pool_(std::move(pool)) {
  if (!pool_) pool_ = std::make_shared<BufferPool>(2);
}

bool Decoder::Fail(std::string why) {
  if (error_.empty()) error_ = std::move(why);
  current_ = Message{};
  body_.clear();
  body_.shrink_to_fit();
  return false;
}

std::span<std::uint8_t> Decoder::WritableSpan() {
  if (failed()) return {};
  switch (stage_) {
    case Stage::Header: return {header_ + have_, kHeaderSize - have_};
    case Stage::Body: return {body_.data() + have_, body_.size() - have_};
    case Stage::Payload: return {current_.payload.data() + have_, current_.payload.size() - have_};
  }
  return {};
}

bool Decoder::Commit(std::size_t n) {
  if (failed()) return false;
  have_ += n;
  switch (stage_) {
    case Stage::Header:
      if (have_ < kHeaderSize) return true;
      return HeaderDone();
    case Stage::Body:
      if (have_ < body_.size()) return true;
      return BodyDone();
    case Stage::Payload:
      if (have_ < current_.payload.size()) return true;
      Finish();
      return true;
  }
  return true;
}

bool Decoder::Feed(const void* data, std::size_t size) {
  const auto* p = static_cast<const std::uint8_t*>(data);
  while (size > 0) {
    std::span<std::uint8_t> span = WritableSpan();
    if (span.empty()) return false;
    const std::size_t n = std::min(size, span.size());
    std::memcpy(span.data(), p, n);
    if (!Commit(n)) return false;
    p += n;
    size -= n;
  }
  return !failed();
}

bool Decoder::HeaderDone() {
  if (LoadLe32(header_) != kWireMagic) return Fail("bad magic");
  const std::uint16_t type = LoadLe16(header_ + 4);
  if (type >= 32 || (limits_.allowed_types & (1u << type)) == 0) {
    return Fail("unexpected message type " + std::to_string(type));
  }
  type_ = static_cast<MessageType>(type);
  info_size_ = LoadLe16(header_ + 6);
  if (info_size_ != InfoSize(type_)) return Fail("bad info size " + std::to_string(info_size_));
  if (LoadLe32(header_ + 12) != 0) return Fail("reserved field not zero");
  text_size_ = LoadLe32(header_ + 8);
  if (text_size_ > limits_.max_text) return Fail("text of " + std::to_string(text_size_) + " bytes is too long");
  payload_size_ = LoadLe64(header_ + 16);
  const bool has_payload = type_ == MessageType::Video || type_ == MessageType::Audio;
  if (!has_payload && payload_size_ != 0) return Fail("payload on a message that has none");
  if (payload_size_ > limits_.max_payload) {
    return Fail("payload of " + std::to_string(payload_size_) + " bytes is too long");
  }
  current_ = Message{};
  current_.type = type_;
  body_.resize(info_size_ + text_size_);
  have_ = 0;
  stage_ = Stage::Body;
  if (body_.empty()) return BodyDone();
  return true;
}

bool Decoder::BodyDone() {
  const std::uint8_t* b = body_.data();
  Message& m = current_;
  switch (type_) {
    case MessageType::Hello:
      m.bandwidth = LoadLeI32(b);
      m.on_program = b[4] != 0;
      m.on_preview = b[5] != 0;
      break;
    case MessageType::Tally:
      m.on_program = b[0] != 0;
      m.on_preview = b[1] != 0;
      break;
    case MessageType::Metadata:
    case MessageType::ConnMetadata:
      m.timecode = LoadLeI64(b);
      break;
    case MessageType::Ready:
      m.ptz_supported = b[0] != 0;
      break;
    case MessageType::Video: {
      VideoInfo& v = m.video;
      v.xres = LoadLeI32(b);
      v.yres = LoadLeI32(b + 4);
      v.fourcc = LoadLe32(b + 8);
      v.frame_rate_N = LoadLeI32(b + 12);
      v.frame_rate_D = LoadLeI32(b + 16);
      const std::uint32_t aspect_bits = LoadLe32(b + 20);
      std::memcpy(&v.aspect, &aspect_bits, 4);
      v.frame_format = LoadLeI32(b + 24);
      v.line_stride = LoadLeI32(b + 28);
      v.timecode = LoadLeI64(b + 32);
      v.timestamp = LoadLeI64(b + 40);
      const std::uint64_t expected = PictureBytes(v.fourcc, v.xres, v.yres, v.line_stride);
      if (expected == 0) return Fail("video frame with an impossible picture");
      if (expected != payload_size_) return Fail("video payload does not match its picture");
      break;
    }
    case MessageType::Audio: {
      AudioInfo& a = m.audio;
      a.sample_rate = LoadLeI32(b);
      a.channels = LoadLeI32(b + 4);
      a.samples = LoadLeI32(b + 8);
      if (LoadLeI32(b + 12) != 0) return Fail("reserved field not zero");
      a.timecode = LoadLeI64(b + 16);
      a.timestamp = LoadLeI64(b + 24);
      if (a.sample_rate <= 0 || a.channels <= 0 || a.channels > kMaxAudioChannels || a.samples <= 0) {
        return Fail("audio frame with impossible values");
      }
      if (static_cast<std::uint64_t>(a.channels) * static_cast<std::uint64_t>(a.samples) * 4 != payload_size_) {
        return Fail("audio payload does not match its samples");
      }
      break;
    }
  }
  m.text.assign(reinterpret_cast<const char*>(b) + info_size_, text_size_);
  body_.clear();
  have_ = 0;
  if (payload_size_ == 0) {
    Finish();
    return true;
  }
  m.payload = pool_->Acquire(payload_size_);
  stage_ = Stage::Payload;
  return true;
}

void Decoder::Finish() {
  ready_.push_back(std::move(current_));
  current_ = Message{};
  stage_ = Stage::Header;
  have_ = 0;
}

std::optional<Message> Decoder::Pop() {
  if (ready_.empty()) return std::nullopt;
  Message m = std::move(ready_.front());
  ready_.pop_front();
  return m;
}

EncodedHead EncodeHello(std::int32_t bandwidth, bool program, bool preview) {
  EncodedHead h = Head(MessageType::Hello, 0, 0);
  StoreLe32(h.bytes + kHeaderSize, static_cast<std::uint32_t>(bandwidth));
  h.bytes[kHeaderSize + 4] = program ? 1 : 0;
  h.bytes[kHeaderSize + 5] = preview ? 1 : 0;
  return h;
}

EncodedHead EncodeTally(bool program, bool preview) {
  EncodedHead h = Head(MessageType::Tally, 0, 0);
  h.bytes[kHeaderSize] = program ? 1 : 0;
  h.bytes[kHeaderSize + 1] = preview ? 1 : 0;
  return h;
}

EncodedHead EncodeMetadata(MessageType type, std::int64_t timecode, std::uint32_t text_size) {
  EncodedHead h = Head(type, text_size, 0);
  StoreLe64(h.bytes + kHeaderSize, static_cast<std::uint64_t>(timecode));
  return h;
}

EncodedHead EncodeReady(bool ptz_supported) {
  EncodedHead h = Head(MessageType::Ready, 0, 0);
  h.bytes[kHeaderSize] = ptz_supported ? 1 : 0;
  return h;
}

EncodedHead EncodeVideo(const VideoInfo& v, std::uint32_t text_size, std::uint64_t payload_size) {
  EncodedHead h = Head(MessageType::Video, text_size, payload_size);
  std::uint8_t* b = h.bytes + kHeaderSize;
  StoreLe32(b, static_cast<std::uint32_t>(v.xres));
  StoreLe32(b + 4, static_cast<std::uint32_t>(v.yres));
  StoreLe32(b + 8, v.fourcc);
  StoreLe32(b + 12, static_cast<std::uint32_t>(v.frame_rate_N));
  StoreLe32(b + 16, static_cast<std::uint32_t>(v.frame_rate_D));
  std::uint32_t aspect_bits = 0;
  std::memcpy(&aspect_bits, &v.aspect, 4);
  StoreLe32(b + 20, aspect_bits);
  StoreLe32(b + 24, static_cast<std::uint32_t>(v.frame_format));
  StoreLe32(b + 28, static_cast<std::uint32_t>(v.line_stride));
  StoreLe64(b + 32, static_cast<std::uint64_t>(v.timecode));
  StoreLe64(b + 40, static_cast<std::uint64_t>(v.timestamp));
  return h;
}

EncodedHead EncodeAudio(const AudioInfo& a, std::uint32_t text_size, std::uint64_t payload_size) {
  EncodedHead h = Head(MessageType::Audio, text_size, payload_size);
  std::uint8_t* b = h.bytes + kHeaderSize;
  StoreLe32(b, static_cast<std::uint32_t>(a.sample_rate));
  StoreLe32(b + 4, static_cast<std::uint32_t>(a.channels));
  StoreLe32(b + 8, static_cast<std::uint32_t>(a.samples));
  StoreLe32(b + 12, 0);
  StoreLe64(b + 16, static_cast<std::uint64_t>(a.timecode));
  StoreLe64(b + 24, static_cast<std::uint64_t>(a.timestamp));
  return h;
}

}  // namespace ndilb
