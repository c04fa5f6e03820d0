#pragma once
// Message frames, the unit in which requests, notifications and replies travel
// on an IPC connection: the wire format, its one size limit, the encoder, and
// the byte-level decoder.
//
// Wire format: a 4-byte little-endian unsigned length N, then N bytes of
// message text (UTF-8 JSON, no terminating zero). 0 <= N <= kMaxFrameBytes
// (524,288). A longer message is never sent (Connection::SendMessage refuses
// it), and a receiver closes a connection that announces one.
//
// FrameReader never touches a socket: the caller hands it bytes (any split,
// one byte at a time if it likes) and takes complete messages out, so tests
// and fuzzers drive it directly.
//
// Max-frame policy: a length prefix above kMaxFrameBytes puts the reader in
// the Oversize state for good. Nothing is allocated for that frame and no
// byte after the prefix is consumed; the owner logs it and closes the
// connection, because the stream can no longer be trusted to be in step.
// Memory for a valid frame (at most kMaxFrameBytes) is reserved once its
// length is known.
//
// Which thread calls this: a FrameReader on one thread at a time (no internal
// locking); the encoders from any thread.

#include <array>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <string>
#include <string_view>

namespace pm::ipc {

inline constexpr std::uint32_t kMaxFrameBytes = 524288;
inline constexpr std::size_t kFrameHeaderBytes = 4;

// The length prefix of a frame whose message text is `length` bytes.
std::array<std::uint8_t, kFrameHeaderBytes> FramePrefix(std::uint32_t length);
// A whole frame: the prefix of message.size() (as a 32-bit number), then the
// text. It encodes texts over kMaxFrameBytes too; senders check the limit.
std::string EncodeFrame(std::string_view message);

class FrameReader {
 public:
  FrameReader() = default;
  FrameReader(const FrameReader&) = delete;
  FrameReader& operator=(const FrameReader&) = delete;

  // Consumes up to `length` bytes and returns how many it took: all of them,
  // unless the reader is or becomes Oversize (then it stops right after the
  // offending prefix). Completed messages queue up for Next.
  std::size_t Feed(const void* data, std::size_t length);

  // Zero-copy reading for a socket loop that reads exact block sizes: the
  // number of bytes that complete the current header or body (never 0 while
  // not Oversize), where to put them, and Commit(n) once n of them (n <=
  // Wanted()) have been written there.
  std::size_t Wanted() const;
  void* WritePointer();
  void Commit(std::size_t n);

  // Takes the oldest completed message; false when none is waiting.
  bool Next(std::string* message);
  std::size_t Ready() const { return ready_.size(); }

  bool Oversize() const { return oversize_; }
  // The length prefix that made the reader Oversize.
  std::uint32_t OversizeLength() const { return oversizeLength_; }
  // True while part of a frame (header or body) has been consumed but the
  // frame is not complete: an end of stream now truncates a frame.
  bool MidFrame() const { return inBody_ || headerFill_ > 0; }

 private:
  void HeaderComplete();

  unsigned char header_[kFrameHeaderBytes] = {};
  std::size_t headerFill_ = 0;
  bool inBody_ = false;
  std::string body_;          // sized to the frame length while inBody_
  std::size_t bodyFill_ = 0;
  bool oversize_ = false;
  std::uint32_t oversizeLength_ = 0;
  std::deque<std::string> ready_;
};

}  // namespace pm::ipc
