#include "ndi-loopback/net.h"

#include <cstdlib>

#include "pm/runtime/clock.h"
#include "pm/runtime/log.h"

namespace ndilb {

namespace sys = pm::ip::sys;
using pm::ip::LastSocketError;

namespace {

constexpr const char* kLoopbackHost = "127.0.0.1";

// Calls f() again while it fails with an interruption; returns its result.
template <class F>
auto Retry(F&& f) -> decltype(f()) {
  for (;;) {
    auto r = f();
    if (!(r < 0 && LastSocketError::Read().Interrupted())) return r;
  }
}

}  // namespace

SocketHandle ListenLoopback(int* port) {
  if (!sys::StartOnce()) return kNoSocket;
  const SocketHandle fd = sys::OpenTcp(false);
  if (fd == kNoSocket) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: socket failed: %s",
            pm::ip::ErrorText(LastSocketError::Read()).c_str());
    return kNoSocket;
  }
  // The lowest free port from NDI_LOOPBACK_FIRST_PORT on, as the vendor
  // runtime's senders take the lowest free one from 5961 (a port that a
  // dead sender left is taken again at once); else any port.
  const char* first = std::getenv("NDI_LOOPBACK_FIRST_PORT");
  const long from = first != nullptr ? std::strtol(first, nullptr, 10) : 0;
  bool taken = false;
  for (long p = from; !taken && p > 0 && p < from + kFirstPortTries && p <= 65535; ++p) {
    taken = sys::BindLoopback(fd, static_cast<int>(p));
  }
  const int bound = (taken || sys::BindLoopback(fd, 0)) && sys::Listen(fd, 32) ? sys::LocalPort(fd) : -1;
  if (bound <= 0) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot listen on 127.0.0.1: %s",
            pm::ip::ErrorText(LastSocketError::Read()).c_str());
    sys::CloseHandle(fd);
    return kNoSocket;
  }
  *port = bound;
  return fd;
}

SocketHandle AcceptFrom(SocketHandle listener) {
  for (;;) {
    const SocketHandle fd = sys::Accept(listener, nullptr);
    if (fd != kNoSocket || !LastSocketError::Read().Interrupted()) return fd;
  }
}

SocketHandle ConnectTo(const std::string& url, int timeout_ms) {
  const std::size_t colon = url.rfind(':');
  if (colon == std::string::npos || url.compare(0, colon, kLoopbackHost) != 0 ||
      colon != std::char_traits<char>::length(kLoopbackHost)) {
    return kNoSocket;
  }
  char* end = nullptr;
  const long port = std::strtol(url.c_str() + colon + 1, &end, 10);
  if (end == url.c_str() + colon + 1 || *end != '\0' || port <= 0 || port > 65535) return kNoSocket;
  if (!sys::StartOnce()) return kNoSocket;
  const SocketHandle fd = sys::OpenTcp(true);
  if (fd == kNoSocket) return kNoSocket;
  bool connected = sys::ConnectLoopback(fd, static_cast<int>(port)) == 0;
  if (!connected && LastSocketError::Read().InProgress()) {
    const std::int64_t deadline = pm::SteadyNowNs() + std::int64_t{timeout_ms} * 1'000'000;
    sys::PollEntry entry{fd, true, false};
    int ready = 0;
    for (;;) {
      const std::int64_t left_ms = (deadline - pm::SteadyNowNs()) / 1'000'000;
      ready = sys::Poll(&entry, 1, static_cast<int>(left_ms > 0 ? left_ms : 0));
      if (!(ready < 0 && LastSocketError::Read().Interrupted())) break;
    }
    connected = ready == 1 && sys::PendingError(fd) == 0;
  }
  if (!connected || !sys::SetNonBlocking(fd, false)) {
    sys::CloseHandle(fd);
    return kNoSocket;
  }
  return fd;
}

void TuneConnection(SocketHandle fd, int send_timeout_ms) {
  sys::SetNoDelay(fd);
  sys::SetSendTimeout(fd, static_cast<std::uint32_t>(send_timeout_ms));
}

bool WriteAll(SocketHandle fd, Piece* pieces, int count) {
  while (count > 0) {
    if (pieces->length == 0) {
      ++pieces;
      --count;
      continue;
    }
    const std::size_t batch = static_cast<std::size_t>(count) < sys::kMaxChunks ? static_cast<std::size_t>(count)
                                                                                 : sys::kMaxChunks;
    const std::int64_t n = Retry([&] { return sys::SendGather(fd, pieces, batch); });
    if (n <= 0) return false;
    std::size_t left = static_cast<std::size_t>(n);
    while (left > 0 && count > 0) {
      if (left >= pieces->length) {
        left -= pieces->length;
        ++pieces;
        --count;
      } else {
        pieces->data = static_cast<const char*>(pieces->data) + left;
        pieces->length -= left;
        left = 0;
      }
    }
  }
  return true;
}

void ShutdownSocket(SocketHandle fd) {
  if (fd != kNoSocket) sys::Shutdown(fd);
}

void CloseSocket(SocketHandle fd) {
  if (fd != kNoSocket) sys::CloseHandle(fd);
}

Waker::Waker() {
  if (!sys::StartOnce() || !sys::MakeWakePair(&pair_)) {
    pair_ = sys::WakePair{};
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot make a wake-up pair: %s",
            pm::ip::ErrorText(LastSocketError::Read()).c_str());
  }
}

Waker::~Waker() {
  CloseSocket(pair_.read);
  CloseSocket(pair_.write);
}

void Waker::Wake() {
  // A full pair already wakes the reader; the byte may then be dropped.
  const std::uint8_t one = 1;
  if (pair_.write != kNoSocket) sys::Send(pair_.write, &one, 1);
}

void Waker::Drain() {
  std::uint8_t buffer[64];
  if (pair_.read == kNoSocket) return;
  while (sys::Receive(pair_.read, buffer, sizeof buffer, sys::ReceiveMode::kDontWait) > 0) {
  }
}

bool Waker::Wait(int ms) {
  if (pair_.read == kNoSocket) return false;
  sys::PollEntry entry{pair_.read, false, false};
  return Retry([&] { return sys::Poll(&entry, 1, ms); }) == 1;
}

}  // namespace ndilb
