#pragma once
// Shared by the fuzz targets: silences the process log (PM_FUZZ_LOG=1 keeps
// it on stderr), checks invariants, and splits an input into chunk sizes and
// a byte stream.

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "pm/runtime/context.h"

namespace pmfuzz {

inline void QuietLog() {
  if (std::getenv("PM_FUZZ_LOG") != nullptr) return;
  pm::GetContext()->logSink = [](pm::LogType, const char*) {};
}

// An invariant of the code under test; a broken one is a finding.
inline void Check(bool condition, const char* what) {
  if (!condition) {
    std::fprintf(stderr, "invariant broken: %s\n", what);
    std::abort();
  }
}

// The first kChunkTableBytes bytes of an input give the sizes of the pieces
// in which the rest is handed to a decoder (1..64 bytes each, cycling; a byte
// of 0 means "all that is left").
inline constexpr std::size_t kChunkTableBytes = 8;

class Chunker {
 public:
  Chunker(const std::uint8_t* data, std::size_t size) {
    const std::size_t table = size < kChunkTableBytes ? size : kChunkTableBytes;
    for (std::size_t i = 0; i < table; ++i) sizes_[i] = data[i];
    tableSize_ = table;
    data_ = data + table;
    left_ = size - table;
  }
  // The next piece; false when the stream is used up. `selector` is the
  // table byte the piece's size came from (lets the caller vary how it feeds).
  bool Next(const std::uint8_t** piece, std::size_t* length, std::uint8_t* selector) {
    if (left_ == 0) return false;
    std::size_t n = left_;
    std::uint8_t s = 0;
    if (tableSize_ > 0) {
      s = sizes_[index_++ % tableSize_];
      if (s != 0) n = (s & 63u) + 1u;
    }
    if (n > left_) n = left_;
    *piece = data_;
    *length = n;
    *selector = s;
    data_ += n;
    left_ -= n;
    return true;
  }

 private:
  std::uint8_t sizes_[kChunkTableBytes] = {};
  std::size_t tableSize_ = 0;
  std::size_t index_ = 0;
  const std::uint8_t* data_ = nullptr;
  std::size_t left_ = 0;
};

}  // namespace pmfuzz
