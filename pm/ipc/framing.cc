#include "pm/ipc/framing.h"

#include <algorithm>
#include <cstring>
#include <utility>

#include "pm/runtime/little_endian.h"

namespace pm::ipc {

std::array<std::uint8_t, kFrameHeaderBytes> FramePrefix(std::uint32_t length) {
  std::array<std::uint8_t, kFrameHeaderBytes> prefix{};
  StoreLe32(prefix.data(), length);
  return prefix;
}

std::string EncodeFrame(std::string_view message) {
  const auto prefix = FramePrefix(static_cast<std::uint32_t>(message.size()));
  std::string frame(prefix.begin(), prefix.end());
  frame.append(message);
  return frame;
}

std::size_t FrameReader::Wanted() const {
  if (oversize_) return 0;
  if (inBody_) return body_.size() - bodyFill_;
  return kFrameHeaderBytes - headerFill_;
}

void* FrameReader::WritePointer() {
  if (inBody_) return body_.data() + bodyFill_;
  return header_ + headerFill_;
}

void FrameReader::Commit(std::size_t n) {
  if (oversize_) return;
  n = std::min(n, Wanted());
  if (inBody_) {
    bodyFill_ += n;
    if (bodyFill_ == body_.size()) {
      ready_.push_back(std::move(body_));
      body_ = std::string();
      bodyFill_ = 0;
      inBody_ = false;
    }
    return;
  }
  headerFill_ += n;
  if (headerFill_ == kFrameHeaderBytes) HeaderComplete();
}

void FrameReader::HeaderComplete() {
  headerFill_ = 0;
  const std::uint32_t length = LoadLe32(header_);
  if (length > kMaxFrameBytes) {
    oversize_ = true;
    oversizeLength_ = length;
    return;
  }
  if (length == 0) {
    ready_.emplace_back();
    return;
  }
  body_.resize(length);
  bodyFill_ = 0;
  inBody_ = true;
}

std::size_t FrameReader::Feed(const void* data, std::size_t length) {
  const auto* in = static_cast<const unsigned char*>(data);
  std::size_t taken = 0;
  while (taken < length && !oversize_) {
    const std::size_t n = std::min(Wanted(), length - taken);
    std::memcpy(WritePointer(), in + taken, n);
    Commit(n);
    taken += n;
  }
  return taken;
}

bool FrameReader::Next(std::string* message) {
  if (ready_.empty()) return false;
  *message = std::move(ready_.front());
  ready_.pop_front();
  return true;
}

}  // namespace pm::ipc
