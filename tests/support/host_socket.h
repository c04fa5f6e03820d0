#pragma once
// The host's end of a message-frame connection, for tests: a listening
// socket on 127.0.0.1 and an accepted peer that writes raw bytes and frames
// and reads frames with a time limit, and the host's requests over it. The
// system's socket calls one by one (pm/ip/socket_system.h, so that it runs on
// Windows too), independent of the connection code under test. Header-only;
// shared by the dispatcher, task and runner tests.
#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "pm/ip/socket_system.h"
#include "pm/runtime/little_endian.h"

namespace pmtest {

namespace hostsys = pm::ip::sys;

// Calls f() again while it fails with an interruption.
template <class F>
auto RetryInterrupted(F&& f) -> decltype(f()) {
  for (;;) {
    auto r = f();
    if (!(r < 0 && pm::ip::LastSocketError::Read().Interrupted())) return r;
  }
}

class HostPeer {
 public:
  HostPeer() = default;
  explicit HostPeer(pm::ip::SocketHandle fd) : fd_(fd) {}
  HostPeer(HostPeer&& other) noexcept : fd_(std::exchange(other.fd_, pm::ip::kNoSocket)) {}
  HostPeer& operator=(HostPeer&& other) noexcept {
    if (this != &other) {
      Close();
      fd_ = std::exchange(other.fd_, pm::ip::kNoSocket);
    }
    return *this;
  }
  ~HostPeer() { Close(); }

  bool Valid() const { return fd_ != pm::ip::kNoSocket; }
  void Close() {
    if (Valid()) hostsys::CloseHandle(fd_);
    fd_ = pm::ip::kNoSocket;
  }

  bool WriteRaw(const std::string& bytes) {
    std::size_t at = 0;
    while (at < bytes.size()) {
      const std::int64_t n = RetryInterrupted([&] { return hostsys::Send(fd_, bytes.data() + at, bytes.size() - at); });
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
    const auto deadline = std::chrono::steady_clock::now() + limit;
    for (std::size_t at = 0; at < n;) {
      const auto got = ReceiveBy(deadline, static_cast<char*>(out) + at, n - at);
      if (!got || *got <= 0) return false;
      at += static_cast<std::size_t>(*got);
    }
    return true;
  }
  // The next frame parsed; a discarded value when none came.
  nlohmann::json ReadJson(std::chrono::milliseconds limit = std::chrono::seconds(5)) {
    unsigned char header[4];
    std::string text;
    if (ReadExact(header, 4, limit)) text.resize(pm::LoadLe32(header));
    if (text.empty() || !ReadExact(text.data(), text.size(), limit)) return nlohmann::json::value_t::discarded;
    return nlohmann::json::parse(text, nullptr, false);
  }
  // True when the peer ends the stream (or resets it) within the limit; data
  // before the end is skipped.
  bool SeesEndOfStream(std::chrono::milliseconds limit = std::chrono::seconds(5)) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    char byte;
    for (;;) {
      const auto got = ReceiveBy(deadline, &byte, 1);
      if (!got) return false;
      if (*got <= 0) return true;
    }
  }

 private:
  // What Receive returns once the socket is readable (0 at the end of the
  // stream, negative on an error); nullopt when it is not readable by the
  // deadline.
  std::optional<std::int64_t> ReceiveBy(std::chrono::steady_clock::time_point deadline, char* p, std::size_t n) {
    using std::chrono::steady_clock;
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - steady_clock::now());
    if (left.count() < 0) return std::nullopt;
    hostsys::PollEntry entry{fd_, false, false};
    if (RetryInterrupted([&] { return hostsys::Poll(&entry, 1, static_cast<int>(left.count()) + 1); }) <= 0) {
      return std::nullopt;
    }
    return RetryInterrupted([&] { return hostsys::Receive(fd_, p, n, hostsys::ReceiveMode::kNormal); });
  }

  pm::ip::SocketHandle fd_ = pm::ip::kNoSocket;
};

class HostListener {
 public:
  HostListener() {
    fd_ = hostsys::StartOnce() ? hostsys::OpenTcp(false) : pm::ip::kNoSocket;
    if (fd_ != pm::ip::kNoSocket && hostsys::BindLoopback(fd_, 0) && hostsys::Listen(fd_, 16)) {
      const int port = hostsys::LocalPort(fd_);
      port_ = port > 0 ? port : 0;
    }
  }
  ~HostListener() {
    if (fd_ != pm::ip::kNoSocket) hostsys::CloseHandle(fd_);
  }
  HostListener(const HostListener&) = delete;
  HostListener& operator=(const HostListener&) = delete;

  int Port() const { return port_; }
  // The next connection within the limit; an invalid peer when none came.
  HostPeer Accept(std::chrono::milliseconds limit = std::chrono::seconds(10)) {
    hostsys::PollEntry entry{fd_, false, false};
    if (RetryInterrupted([&] { return hostsys::Poll(&entry, 1, static_cast<int>(limit.count())); }) <= 0) {
      return HostPeer();
    }
    const pm::ip::SocketHandle fd = hostsys::Accept(fd_, nullptr);
    if (fd != pm::ip::kNoSocket) hostsys::SetNoDelay(fd);
    return HostPeer(fd);
  }

 private:
  pm::ip::SocketHandle fd_ = pm::ip::kNoSocket;
  int port_ = 0;
};

inline nlohmann::json Request(const std::string& command, std::uint64_t id, nlohmann::json body = nlohmann::json::object()) {
  body["pm::command"] = command;
  body["pm::unique_id"] = id;
  body["pm::request"] = true;
  return body;
}

// Sends a request and returns its reply (discarded when none comes), passing
// over the task's own requests and notifications met on the way.
inline nlohmann::json Ask(HostPeer& host, const std::string& command, std::uint64_t id,
                          nlohmann::json body = nlohmann::json::object()) {
  EXPECT_TRUE(host.WriteJson(Request(command, id, std::move(body))));
  for (;;) {
    const nlohmann::json frame = host.ReadJson(std::chrono::seconds(10));
    if (!frame.is_object()) return nlohmann::json(nlohmann::json::value_t::discarded);
    if (frame.value("pm::response", false) && frame.value("pm::unique_id", std::uint64_t{0}) == id) return frame;
  }
}

}  // namespace pmtest
