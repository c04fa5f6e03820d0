#pragma once
// Byte-level decoder of the message frames that travel on an IPC connection.
// It never touches a socket: the caller hands it bytes (any split, one byte at
// a time if it likes) and takes complete messages out, so tests and fuzzers
// drive it directly.
//
// Wire format: a 4-byte little-endian unsigned length N, then N bytes of
// message text (UTF-8 JSON, no terminating zero). 0 <= N <= kMaxFrameBytes
// (524,288).
//
// Max-frame policy: a length prefix above kMaxFrameBytes puts the reader in
// the Oversize state for good. Nothing is allocated for that frame and no
// byte after the prefix is consumed; the owner logs it and closes the
// connection, because the stream can no longer be trusted to be in step.
// Memory for a valid frame (at most kMaxFrameBytes) is reserved once its
// length is known.
//
// Which thread calls this: one thread at a time (no internal locking).

#include <cstddef>
#include <cstdint>
#include <deque>
#include <string>

namespace pm {

class FrameReader {
 public:
  static constexpr std::uint32_t kMaxFrameBytes = 524288;
  static constexpr std::size_t kHeaderBytes = 4;

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

  unsigned char header_[kHeaderBytes] = {};
  std::size_t headerFill_ = 0;
  bool inBody_ = false;
  std::string body_;          // sized to the frame length while inBody_
  std::size_t bodyFill_ = 0;
  bool oversize_ = false;
  std::uint32_t oversizeLength_ = 0;
  std::deque<std::string> ready_;
};

}  // namespace pm
