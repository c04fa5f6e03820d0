#pragma once
// The loopback runtime's wire protocol between a sender and each receiver
// connection (TCP on 127.0.0.1), and its decoder.
//
// Every message is a 24-byte header, then `info_size` bytes of fixed fields,
// then `text_size` bytes of UTF-8 text (no terminating zero), then
// `payload_size` bytes of media. All integers are little-endian.
//
//   offset size  field
//   0      4     magic 0x314C444E ("NDL1")
//   4      2     type (MessageType)
//   6      2     info_size: must equal the fixed size of the type
//   8      4     text_size
//   12     4     reserved, 0
//   16     8     payload_size
//
// Types, direction, info fields (in order), text, payload:
//   1 Hello        R->S  i32 bandwidth, u8 on_program, u8 on_preview, u16 0   (8)
//                        first message of a receiver; nothing else before it
//   2 Tally        R->S  u8 on_program, u8 on_preview, u16 0                   (4)
//   3 Metadata     both  i64 timecode (8); text = the XML; no payload
//   4 ConnMetadata S->R  as Metadata: one of the sender's connection metadata
//   5 Ready        S->R  u8 ptz_supported, u8 0, u16 0 (4): the connection is
//                        up; the connection metadata follows (as with the
//                        vendor runtime, PTZ support is known before it)
//   6 Video        S->R  i32 xres, i32 yres, u32 fourcc, i32 frame_rate_N,
//                        i32 frame_rate_D, f32 aspect, i32 frame_format,
//                        i32 line_stride, i64 timecode, i64 timestamp      (48)
//                        text = per-frame metadata (may be empty);
//                        payload = the picture, PictureBytes(...) bytes exactly
//   7 Audio        S->R  i32 sample_rate, i32 channels, i32 samples, i32 0,
//                        i64 timecode, i64 timestamp                        (32)
//                        text = per-frame metadata; payload = planar float,
//                        channels x samples x 4 bytes, channels back to back
//
// Policy: each end gives its decoder the types it accepts and the largest text
// and payload; a header that breaks any rule (magic, type, info size, reserved
// field, a length over its limit, a payload that does not match the info)
// fails the decoder before anything is allocated for it, and the owner drops
// the connection. A failed decoder stays failed. A message is handed out only
// when every byte of it has arrived.
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace ndilb {

inline constexpr std::uint32_t kWireMagic = 0x314C444E;
inline constexpr std::size_t kHeaderSize = 24;

enum class MessageType : std::uint16_t {
  Hello = 1,
  Tally = 2,
  Metadata = 3,
  ConnMetadata = 4,
  Ready = 5,
  Video = 6,
  Audio = 7,
};

// Fixed info size of each type; 0 for an unknown type.
std::size_t InfoSize(MessageType type);
inline constexpr std::uint32_t TypeBit(MessageType t) { return 1u << static_cast<unsigned>(t); }

struct VideoInfo {
  std::int32_t xres = 0, yres = 0;
  std::uint32_t fourcc = 0;
  std::int32_t frame_rate_N = 0, frame_rate_D = 0;
  float aspect = 0;
  std::int32_t frame_format = 0;
  std::int32_t line_stride = 0;
  std::int64_t timecode = 0, timestamp = 0;
};

struct AudioInfo {
  std::int32_t sample_rate = 0, channels = 0, samples = 0;
  std::int64_t timecode = 0, timestamp = 0;
};

inline constexpr int kMaxAudioChannels = 1024;

// A byte buffer from a pool, handed back to the pool when released.
class BufferPool;
class Buffer {
 public:
  Buffer() = default;
  Buffer(std::unique_ptr<std::uint8_t[]> data, std::size_t capacity, std::size_t size)
      : data_(std::move(data)), capacity_(capacity), size_(size) {}
  std::uint8_t* data() const { return data_.get(); }
  std::size_t size() const { return size_; }
  std::size_t capacity() const { return capacity_; }
  explicit operator bool() const { return data_ != nullptr; }

 private:
  friend class BufferPool;
  std::unique_ptr<std::uint8_t[]> data_;
  std::size_t capacity_ = 0;
  std::size_t size_ = 0;
};

// Keeps up to `keep` released buffers for reuse, so a steady stream of frames
// allocates nothing. Any thread.
class BufferPool {
 public:
  explicit BufferPool(std::size_t keep) : keep_(keep) {}
  Buffer Acquire(std::size_t size);  // contents undefined
  void Release(Buffer buffer);

 private:
  const std::size_t keep_;
  std::mutex mutex_;           // guards free_
  std::vector<Buffer> free_;
};

struct Message {
  MessageType type = MessageType::Hello;
  std::int32_t bandwidth = 0;       // Hello
  bool on_program = false;          // Hello, Tally
  bool on_preview = false;          // Hello, Tally
  bool ptz_supported = false;       // Ready
  std::int64_t timecode = 0;        // Metadata, ConnMetadata
  VideoInfo video;                  // Video
  AudioInfo audio;                  // Audio
  std::string text;
  Buffer payload;                   // Video, Audio
};

struct DecoderLimits {
  std::uint32_t allowed_types = 0;  // TypeBit()s
  std::uint32_t max_text = 1u << 20;
  std::uint64_t max_payload = 0;
};

// Limits of each end: what a sender accepts from a receiver, and the reverse.
DecoderLimits SenderSideLimits();
DecoderLimits ReceiverSideLimits();

// Turns bytes into whole messages; never touches a socket. The owner asks
// for WritableSpan(), writes up to its size (a recv straight into it, or a
// copy), and calls Commit with the count. Payloads land directly in buffers
// of the pool. One thread at a time.
class Decoder {
 public:
  Decoder(DecoderLimits limits, std::shared_ptr<BufferPool> pool);

  // Where the next bytes go; empty only when failed.
  std::span<std::uint8_t> WritableSpan();
  // `n` bytes were written at the front of the last span. False on a
  // protocol error (see error()).
  bool Commit(std::size_t n);
  // Copies `size` bytes through the two calls above.
  bool Feed(const void* data, std::size_t size);

  // The oldest complete message, if any.
  std::optional<Message> Pop();

  bool failed() const { return !error_.empty(); }
  const std::string& error() const { return error_; }

 private:
  enum class Stage { Header, Body, Payload };
  bool Fail(std::string why);
  bool HeaderDone();
  bool BodyDone();
  void Finish();

  DecoderLimits limits_;
  std::shared_ptr<BufferPool> pool_;
  Stage stage_ = Stage::Header;
  std::uint8_t header_[kHeaderSize] = {};
  std::size_t have_ = 0;  // bytes of the current stage received
  MessageType type_ = MessageType::Hello;
  std::size_t info_size_ = 0;
  std::uint32_t text_size_ = 0;
  std::uint64_t payload_size_ = 0;
  std::vector<std::uint8_t> body_;  // info + text
  Message current_;
  std::deque<Message> ready_;
  std::string error_;
};

// Encoding: the header and info bytes of a message (text and payload are
// written by the caller from their own memory, so frames are never copied).
struct EncodedHead {
  std::uint8_t bytes[kHeaderSize + 64];
  std::size_t size = 0;
};
EncodedHead EncodeHello(std::int32_t bandwidth, bool program, bool preview);
EncodedHead EncodeTally(bool program, bool preview);
EncodedHead EncodeMetadata(MessageType type, std::int64_t timecode, std::uint32_t text_size);
EncodedHead EncodeReady(bool ptz_supported);
EncodedHead EncodeVideo(const VideoInfo& info, std::uint32_t text_size, std::uint64_t payload_size);
EncodedHead EncodeAudio(const AudioInfo& info, std::uint32_t text_size, std::uint64_t payload_size);

}  // namespace ndilb
