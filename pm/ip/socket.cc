#include "pm/ip/socket.h"

#include <algorithm>
#include <chrono>
#include <climits>
#include <thread>

#include "pm/ip/socket_system.h"
#include "pm/runtime/clock.h"
#include "pm/runtime/log.h"

namespace pm::ip {

namespace {

constexpr int kListenBacklog = 5;
constexpr int kConnectAttempts = 1024;
constexpr std::int64_t kDefaultAcceptTimeoutMs = 60000;
constexpr std::int64_t kAcceptFailurePauseMs = 100;
constexpr int kConnectSettleMs = 1000;

// Keeps the socket error across a log call, so that callers can still
// classify the failure that was logged.
class KeepSocketError {
 public:
  KeepSocketError() : saved_(LastSocketError::Read()) {}
  ~KeepSocketError() { saved_.Restore(); }

 private:
  LastSocketError saved_;
};

}  // namespace

std::string ErrorText(const LastSocketError& error) {
  return "[errno=" + std::to_string(error.err) + ",wsa=" + std::to_string(error.wsa) + "]";
}

// ---------------------------------------------------------------------------
// Socket

Socket::Socket() { sys::StartOnce(); }

Socket::~Socket() { Socket::Close(); }

void Socket::Close() {
  // Not retried on EINTR: on Linux the descriptor is released whatever
  // close() reports.
  if (handle_ != kNoSocket) sys::CloseHandle(handle_);
  handle_ = kNoSocket;
}

bool Socket::Init(int port) {
  port_ = port;
  shutDown_.store(false);
  handle_ = sys::OpenTcp(false);
  return handle_ != kNoSocket;
}

bool Socket::Bind() {
  if (handle_ == kNoSocket) return false;
  if (!sys::BindLoopback(handle_, port_)) {
    const auto error = LastSocketError::Read();
    KeepSocketError keep;
    Log(LogType::Normal, "", "ipc::Socket : Bind failed : err : %d, was : %d\n", error.err, error.wsa);
    return false;
  }
  port_ = GetPort();
  return true;
}

int Socket::GetPort() {
  if (port_ > 0) return port_;
  const int bound = handle_ == kNoSocket ? -1 : sys::LocalPort(handle_);
  if (bound < 0) {
    const auto error = LastSocketError::Read();
    KeepSocketError keep;
    Log(LogType::Normal, "", "ipc::Socket : Fetching assigned port failed : err : %d, was : %d\n", error.err,
        error.wsa);
    return 0;
  }
  return bound;
}

bool Socket::Listen() {
  if (handle_ == kNoSocket) return false;
  sys::Listen(handle_, kListenBacklog);
  SetBlocking(false);
  return true;
}

bool Socket::Connect() {
  if (handle_ == kNoSocket) return false;
  LastSocketError error;
  for (int attempt = 0; attempt < kConnectAttempts; ++attempt) {
    if (sys::ConnectLoopback(handle_, port_) == 0) {
      SetNoDelay();
      return true;
    }
    error = LastSocketError::Read();
    if (error.AlreadyConnected()) {
      SetNoDelay();
      return true;
    }
    if (error.InProgress()) {
      // An interrupted connect goes on in the background; wait for it to
      // settle, then the next attempt reports its outcome.
      sys::PollEntry entry{handle_, true, false};
      sys::Poll(&entry, 1, kConnectSettleMs);
      continue;
    }
    if (!error.Interrupted()) break;
  }
  error.Restore();
  KeepSocketError keep;
  Log(LogType::Normal, "", "Socket::Connect Failed : %s\n", ErrorText(error).c_str());
  return false;
}

void Socket::Shutdown() {
  shutDown_.store(true);
  if (handle_ != kNoSocket) sys::Shutdown(handle_);
}

std::int64_t Socket::Send(const void* data, std::size_t length) {
  if (handle_ == kNoSocket) return 0;
  for (;;) {
    const std::int64_t sent = sys::Send(handle_, data, length);
    if (sent >= 0 || !LastSocketError::Read().Interrupted()) return sent;
  }
}

std::int64_t Socket::SendAll(BufferList buffers) {
  if (handle_ == kNoSocket) return 0;
  // One gather send for the whole list (one system call, and the list leaves
  // as one piece when the socket buffer has room); a partial write is
  // continued from where it stopped.
  std::vector<sys::Chunk> chunks;
  chunks.reserve(buffers.size());
  std::int64_t total = 0;
  for (const auto& [pointer, length] : buffers) {
    if (length == 0) continue;
    if (pointer == nullptr) return 0;
    chunks.push_back(sys::Chunk{pointer, length});
    total += length;
  }
  std::size_t first = 0;
  while (first < chunks.size()) {
    const std::size_t count = std::min(chunks.size() - first, sys::kMaxChunks);
    const std::int64_t sent = sys::SendGather(handle_, chunks.data() + first, count);
    if (sent < 0 && LastSocketError::Read().Interrupted()) continue;
    if (sent <= 0) return 0;
    auto left = static_cast<std::size_t>(sent);
    while (first < chunks.size() && left >= chunks[first].length) {
      left -= chunks[first].length;
      ++first;
    }
    if (left > 0) {
      chunks[first].data = static_cast<const char*>(chunks[first].data) + left;
      chunks[first].length -= left;
    }
  }
  return total;
}

std::int64_t Socket::Receive(void* data, std::size_t length) {
  if (handle_ == kNoSocket) return 0;
  return sys::Receive(handle_, data, length, sys::ReceiveMode::kNormal);
}

std::int64_t Socket::ReceiveExact(void* data, std::size_t length) {
  if (handle_ == kNoSocket) return -1;
  if (length < 1) return 0;
  std::size_t have = 0;
  while (have < length) {
    const std::int64_t got = Receive(static_cast<char*>(data) + have, length - have);
    if (got < 0 && LastSocketError::Read().Interrupted()) continue;
    if (got < 1) return got;
    have += static_cast<std::size_t>(got);
  }
  return static_cast<std::int64_t>(length);
}

bool Socket::SetNoDelay() {
  if (handle_ == kNoSocket) return false;
  sys::SetNoDelay(handle_);
  return true;
}

bool Socket::SetBlocking(bool blocking) {
  if (handle_ == kNoSocket) return false;
  return sys::SetNonBlocking(handle_, !blocking);
}

bool Socket::SetReceiveTimeout(std::int64_t timeoutMs) {
  if (handle_ == kNoSocket) return false;
  // The low 32 bits as an unsigned count; 0 waits for ever.
  const auto ms = timeoutMs == kNoTimeout ? 0u : static_cast<std::uint32_t>(timeoutMs);
  return sys::SetReceiveTimeout(handle_, ms);
}

std::vector<Socket*> Socket::WaitReadable(const std::vector<Socket*>& sockets, std::int64_t timeoutMs) {
  const std::int64_t start = SteadyNowNs();
  // A timeout too large to count in nanoseconds waits for ever.
  const bool forever = timeoutMs > INT64_MAX / 1000000;
  const std::int64_t deadline = forever ? 0 : timeoutMs * 1000000;
  if (!forever && SteadyNowNs() - start >= deadline) return {};

  std::vector<sys::PollEntry> entries;
  std::vector<Socket*> owners;
  entries.reserve(sockets.size());
  owners.reserve(sockets.size());
  for (Socket* socket : sockets) {
    if (socket == nullptr || socket->handle_ == kNoSocket) continue;
    entries.push_back(sys::PollEntry{socket->handle_, false, false});
    owners.push_back(socket);
  }
  for (;;) {
    // A socket we shut down ends the wait like one that hung up; checked
    // before each slice, as Windows' poll may not report it.
    std::vector<Socket*> result;
    for (Socket* owner : owners) {
      if (owner->shutDown_.load()) result.push_back(owner);
    }
    if (!result.empty()) return result;
    int waitMs = sys::kPollSliceMs;
    if (!forever) {
      const std::int64_t remaining = deadline - (SteadyNowNs() - start);
      if (remaining <= 0) return {};
      waitMs = static_cast<int>(std::min<std::int64_t>(remaining / 1000000, sys::kPollSliceMs));
    }
    const int ready = sys::Poll(entries.data(), entries.size(), waitMs);
    if (ready < 0) {
      // On Windows our own Shutdown wakes the poll by cancelling it, which
      // fails it: the flag checked above reports the socket.
      const bool interrupted = LastSocketError::Read().Interrupted();
      const bool shutDown =
          std::any_of(owners.begin(), owners.end(), [](const Socket* owner) { return owner->shutDown_.load(); });
      if (interrupted || shutDown) continue;
      return {};
    }
    if (ready == 0) {
      // Only a slice of the time passed: the deadline decides.
      if (forever || deadline - (SteadyNowNs() - start) > 0) continue;
      return {};
    }
    for (std::size_t i = 0; i < entries.size(); ++i) {
      if (entries[i].ready || owners[i]->shutDown_.load()) result.push_back(owners[i]);
    }
    if (!result.empty()) return result;
  }
}

// ---------------------------------------------------------------------------
// Acceptor

Acceptor::~Acceptor() {
  Close();
  ReleaseDescriptor();
}

bool Acceptor::Accept(Socket& target, std::int64_t timeoutMs) {
  target.Close();
  if (handle_ == kNoSocket) return false;
  if (stopRequested_.load()) return false;
  const std::int64_t waitMs = (timeoutMs == 0 || timeoutMs == kNoTimeout) ? kDefaultAcceptTimeoutMs : timeoutMs;
  WaitReadable({this}, waitMs);  // passes whatever it found; accept() decides
  if (stopRequested_.load()) return false;
  int peerPort = 0;
  SocketHandle accepted = kNoSocket;
  LastSocketError error;
  do {
    accepted = sys::Accept(handle_, &peerPort);
    if (accepted != kNoSocket) break;
    error = LastSocketError::Read();
  } while (error.Interrupted());
  if (accepted == kNoSocket) {
    target.Close();
    // Nothing pending, or the connection went before it was taken, or Close
    // came between the wait and accept(): no fault of ours.
    if (!error.WouldBlock() && !error.TimedOut() && !stopRequested_.load()) {
      // Out of descriptors or memory: the pending connection stays queued
      // and the socket keeps reporting readable, so a caller that loops on
      // Accept would spin. Pause before reporting the failure.
      Log(LogType::Normal, "", "Acceptor::Accept failed : %s\n", ErrorText(error).c_str());
      if (!stopRequested_.load()) std::this_thread::sleep_for(std::chrono::milliseconds(kAcceptFailurePauseMs));
    }
    return false;
  }
  target.handle_ = accepted;
  target.port_ = peerPort;
  target.shutDown_.store(false);
  target.SetNoDelay();
  target.SetBlocking(true);
  return true;
}

void Acceptor::Close() {
  stopRequested_.store(true);
  // Shutting the listening socket down wakes an Accept waiting on another
  // thread: on Linux it ends the listening state (poll reports a hang-up and
  // accept fails); on Windows the wait sees the shut-down flag within a poll
  // slice, or at once through the cancelled poll. Either way the handle stays
  // reserved until no Accept can be using it; no wake-up connection to our
  // own port is needed.
  Shutdown();
}

}  // namespace pm::ip
