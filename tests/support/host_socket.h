#pragma once
// The host's end of a message-frame connection, for tests: a listening
// socket on 127.0.0.1 and an accepted peer that writes raw bytes and frames
// and reads frames with a time limit. Plain POSIX calls, independent of the
// code under test. Header-only; shared by the dispatcher and runner tests.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include <nlohmann/json.hpp>

#include "pm/runtime/little_endian.h"

namespace pmtest {

class HostPeer {
 public:
  HostPeer() = default;
  explicit HostPeer(int fd) : fd_(fd) {}
  HostPeer(HostPeer&& other) noexcept : fd_(other.fd_) { other.fd_ = -1; }
  HostPeer& operator=(HostPeer&& other) noexcept {
    if (this != &other) {
      Close();
      fd_ = other.fd_;
      other.fd_ = -1;
    }
    return *this;
  }
  ~HostPeer() { Close(); }

  bool Valid() const { return fd_ >= 0; }
  int Fd() const { return fd_; }
  void Close() {
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
  }

  bool WriteRaw(const std::string& bytes) {
    std::size_t at = 0;
    while (at < bytes.size()) {
      const ssize_t n = ::send(fd_, bytes.data() + at, bytes.size() - at, MSG_NOSIGNAL);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return false;
      at += static_cast<std::size_t>(n);
    }
    return true;
  }
  static std::string Prefix(std::uint32_t n) {
    std::string out(4, '\0');
    pm::StoreLe32(out.data(), n);
    return out;
  }
  bool WriteFrame(const std::string& text) {
    return WriteRaw(Prefix(static_cast<std::uint32_t>(text.size())) + text);
  }
  bool WriteJson(const nlohmann::json& message) { return WriteFrame(message.dump()); }

  // Exactly n bytes within the time limit; false on timeout or end of stream.
  bool ReadExact(void* out, std::size_t n, std::chrono::milliseconds limit) {
    auto* p = static_cast<char*>(out);
    const auto deadline = std::chrono::steady_clock::now() + limit;
    std::size_t at = 0;
    while (at < n) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      if (left.count() < 0) return false;
      pollfd pfd{fd_, POLLIN, 0};
      const int ready = ::poll(&pfd, 1, static_cast<int>(left.count()) + 1);
      if (ready < 0 && errno == EINTR) continue;
      if (ready <= 0) return false;
      const ssize_t got = ::recv(fd_, p + at, n - at, 0);
      if (got < 0 && errno == EINTR) continue;
      if (got <= 0) return false;
      at += static_cast<std::size_t>(got);
    }
    return true;
  }
  std::optional<std::string> ReadFrame(std::chrono::milliseconds limit = std::chrono::seconds(5)) {
    unsigned char header[4];
    if (!ReadExact(header, 4, limit)) return std::nullopt;
    const std::uint32_t n = pm::LoadLe32(header);
    std::string text(n, '\0');
    if (n > 0 && !ReadExact(text.data(), n, limit)) return std::nullopt;
    return text;
  }
  // The next frame parsed; a discarded value when none came.
  nlohmann::json ReadJson(std::chrono::milliseconds limit = std::chrono::seconds(5)) {
    auto text = ReadFrame(limit);
    if (!text) return nlohmann::json(nlohmann::json::value_t::discarded);
    return nlohmann::json::parse(*text, nullptr, false);
  }
  // True when the peer ends the stream (or resets it) within the limit.
  bool SeesEndOfStream(std::chrono::milliseconds limit = std::chrono::seconds(5)) {
    char byte;
    pollfd pfd{fd_, POLLIN, 0};
    const auto deadline = std::chrono::steady_clock::now() + limit;
    for (;;) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      if (left.count() < 0) return false;
      const int ready = ::poll(&pfd, 1, static_cast<int>(left.count()) + 1);
      if (ready < 0 && errno == EINTR) continue;
      if (ready <= 0) return false;
      const ssize_t got = ::recv(fd_, &byte, 1, 0);
      if (got < 0 && errno == EINTR) continue;
      if (got <= 0) return true;
      // Data before the end: keep reading.
    }
  }

 private:
  int fd_ = -1;
};

class HostListener {
 public:
  HostListener() {
    fd_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = 0;
    if (fd_ < 0 || ::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(fd_, 16) != 0) {
      return;
    }
    socklen_t length = sizeof address;
    if (::getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &length) == 0) {
      port_ = ntohs(address.sin_port);
    }
  }
  ~HostListener() {
    if (fd_ >= 0) ::close(fd_);
  }
  HostListener(const HostListener&) = delete;
  HostListener& operator=(const HostListener&) = delete;

  int Port() const { return port_; }
  // The next connection within the limit; an invalid peer when none came.
  HostPeer Accept(std::chrono::milliseconds limit = std::chrono::seconds(10)) {
    pollfd pfd{fd_, POLLIN, 0};
    int ready = 0;
    do {
      ready = ::poll(&pfd, 1, static_cast<int>(limit.count()));
    } while (ready < 0 && errno == EINTR);
    if (ready <= 0) return HostPeer();
    const int fd = ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd >= 0) {
      const int one = 1;
      ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    }
    return HostPeer(fd);
  }

 private:
  int fd_ = -1;
  int port_ = 0;
};

}  // namespace pmtest
