#include "pm/ip/socket.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>

#include "pm/runtime/clock.h"
#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"

namespace pm::ip {

namespace {

constexpr int kListenBacklog = 5;
constexpr int kConnectAttempts = 1024;
constexpr std::int64_t kDefaultAcceptTimeoutMs = 60000;
constexpr std::int64_t kAcceptFailurePauseMs = 100;
constexpr short kPollAsk = POLLIN | POLLRDNORM | POLLRDBAND;
constexpr short kPollReady = POLLIN | POLLRDNORM | POLLRDBAND | POLLPRI | POLLERR | POLLHUP | POLLNVAL;

sockaddr_in LoopbackAddress(int port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(static_cast<std::uint16_t>(port));
  inet_pton(AF_INET, "127.0.0.1", &address.sin_addr);
  return address;
}

// Keeps errno across a log call, so that callers can still classify the
// failure that was logged.
class KeepErrno {
 public:
  KeepErrno() : saved_(errno) {}
  ~KeepErrno() { errno = saved_; }

 private:
  int saved_;
};

}  // namespace

// ---------------------------------------------------------------------------
// LastSocketError

LastSocketError LastSocketError::Read() {
  const int e = errno;
  return LastSocketError{e, e};
}

bool LastSocketError::AlreadyConnected() const { return err == EISCONN; }

bool LastSocketError::Interrupted() const { return err == EINTR || wsa == EINTR; }

bool LastSocketError::Gone() const {
  return wsa == ENOTSOCK || wsa == EBADF || wsa == ECONNRESET || wsa == EPIPE;
}

bool LastSocketError::TimedOut() const {
  return wsa == ECONNABORTED || wsa == ETIMEDOUT || wsa == EAGAIN || wsa == EWOULDBLOCK;
}

std::string ErrorText(const LastSocketError& error) {
  return "[errno=" + std::to_string(error.err) + ",wsa=" + std::to_string(error.wsa) + "]";
}

// ---------------------------------------------------------------------------
// Socket

Socket::Socket() = default;

Socket::~Socket() { Socket::Close(); }

void Socket::Close() {
  if (handle_ >= 0) {
    // close() is not retried on EINTR: on Linux the descriptor is released
    // whatever close() reports.
    ::close(handle_);
  }
  address_ = sockaddr_in{};
  handle_ = -1;
}

bool Socket::Init(int port) {
  port_ = port;
  address_ = LoopbackAddress(port);
  handle_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, IPPROTO_TCP);
  return handle_ >= 0;
}

bool Socket::Bind() {
  if (handle_ < 0) return false;
  if (::bind(handle_, reinterpret_cast<const sockaddr*>(&address_), sizeof(address_)) != 0) {
    const auto error = LastSocketError::Read();
    KeepErrno keep;
    Log(LogType::Normal, "", "ipc::Socket : Bind failed : err : %d, was : %d\n", error.err, error.wsa);
    return false;
  }
  port_ = GetPort();
  return true;
}

int Socket::GetPort() {
  if (port_ > 0) return port_;
  sockaddr_in bound{};
  socklen_t length = sizeof(bound);
  if (handle_ < 0 || ::getsockname(handle_, reinterpret_cast<sockaddr*>(&bound), &length) != 0) {
    const auto error = LastSocketError::Read();
    KeepErrno keep;
    Log(LogType::Normal, "", "ipc::Socket : Fetching assigned port failed : err : %d, was : %d\n", error.err,
        error.wsa);
    return 0;
  }
  return ntohs(bound.sin_port);
}

bool Socket::Listen() {
  if (handle_ < 0) return false;
  ::listen(handle_, kListenBacklog);
  SetBlocking(false);
  return true;
}

bool Socket::Connect() {
  if (handle_ < 0) return false;
  LastSocketError error;
  for (int attempt = 0; attempt < kConnectAttempts; ++attempt) {
    if (::connect(handle_, reinterpret_cast<const sockaddr*>(&address_), sizeof(address_)) == 0) {
      SetNoDelay();
      return true;
    }
    error = LastSocketError::Read();
    if (error.AlreadyConnected()) {
      SetNoDelay();
      return true;
    }
    if (error.err == EALREADY) {
      // An interrupted connect goes on in the background; wait for it to
      // settle, then the next attempt reports its outcome.
      pollfd entry{handle_, POLLOUT, 0};
      RetryEintr([&] { return ::poll(&entry, 1, 1000); });
      continue;
    }
    if (!error.Interrupted()) break;
  }
  errno = error.err;
  KeepErrno keep;
  Log(LogType::Normal, "", "Socket::Connect Failed : %s\n", ErrorText(error).c_str());
  return false;
}

void Socket::Shutdown() {
  if (handle_ >= 0) ::shutdown(handle_, SHUT_RDWR);
}

std::int64_t Socket::Send(const void* data, std::size_t length) {
  if (handle_ < 0) return 0;
  return RetryEintr([&] { return ::send(handle_, data, length, MSG_NOSIGNAL); });
}

std::int64_t Socket::SendAll(BufferList buffers) {
  if (handle_ < 0) return 0;
  // One sendmsg for the whole list (one system call, and the list leaves as
  // one piece when the socket buffer has room); a partial write is continued
  // from where it stopped.
  std::vector<iovec> vectors;
  vectors.reserve(buffers.size());
  std::int64_t total = 0;
  for (const auto& [pointer, length] : buffers) {
    if (length == 0) continue;
    if (pointer == nullptr) return 0;
    vectors.push_back(iovec{const_cast<void*>(pointer), length});
    total += length;
  }
  std::size_t first = 0;
  while (first < vectors.size()) {
    msghdr message{};
    message.msg_iov = vectors.data() + first;
    message.msg_iovlen = std::min<std::size_t>(vectors.size() - first, IOV_MAX);
    const ssize_t sent = RetryEintr([&] { return ::sendmsg(handle_, &message, MSG_NOSIGNAL); });
    if (sent <= 0) return 0;
    auto left = static_cast<std::size_t>(sent);
    while (first < vectors.size() && left >= vectors[first].iov_len) {
      left -= vectors[first].iov_len;
      ++first;
    }
    if (left > 0) {
      vectors[first].iov_base = static_cast<char*>(vectors[first].iov_base) + left;
      vectors[first].iov_len -= left;
    }
  }
  return total;
}

std::int64_t Socket::Receive(void* data, std::size_t length) {
  if (handle_ < 0) return 0;
  return ::recv(handle_, data, length, 0);
}

std::int64_t Socket::ReceiveExact(void* data, std::size_t length) {
  if (handle_ < 0) return -1;
  if (length < 1) return 0;
  std::size_t have = 0;
  while (have < length) {
    const std::int64_t got = Receive(static_cast<char*>(data) + have, length - have);
    if (got < 0 && errno == EINTR) continue;
    if (got < 1) return got;
    have += static_cast<std::size_t>(got);
  }
  return static_cast<std::int64_t>(length);
}

bool Socket::SetNoDelay() {
  if (handle_ < 0) return false;
  const int on = 1;
  ::setsockopt(handle_, IPPROTO_TCP, TCP_NODELAY, &on, sizeof(on));
  return true;
}

bool Socket::SetBlocking(bool blocking) {
  if (handle_ < 0) return false;
  const int flags = ::fcntl(handle_, F_GETFL);
  if (flags < 0) return false;
  const int wanted = blocking ? (flags & ~O_NONBLOCK) : (flags | O_NONBLOCK);
  return wanted == flags || ::fcntl(handle_, F_SETFL, wanted) == 0;
}

bool Socket::SetReceiveTimeout(std::int64_t timeoutMs) {
  if (handle_ < 0) return false;
  timeval value{};
  if (timeoutMs != kNoTimeout) {
    const auto ms = static_cast<std::uint32_t>(timeoutMs);  // the low 32 bits
    value.tv_sec = static_cast<time_t>(ms / 1000);
    value.tv_usec = static_cast<suseconds_t>((ms % 1000) * 1000);
  }
  return ::setsockopt(handle_, SOL_SOCKET, SO_RCVTIMEO, &value, sizeof(value)) == 0;
}

std::vector<Socket*> Socket::WaitReadable(const std::vector<Socket*>& sockets, std::int64_t timeoutMs) {
  const std::int64_t start = SteadyNowNs();
  // A timeout too large to count in nanoseconds waits for ever.
  const bool forever = timeoutMs > INT64_MAX / 1000000;
  const std::int64_t deadline = forever ? 0 : timeoutMs * 1000000;
  if (!forever && SteadyNowNs() - start >= deadline) return {};

  std::vector<pollfd> entries;
  std::vector<Socket*> owners;
  entries.reserve(sockets.size());
  owners.reserve(sockets.size());
  for (Socket* socket : sockets) {
    if (socket == nullptr || socket->handle_ < 0) continue;
    entries.push_back(pollfd{socket->handle_, kPollAsk, 0});
    owners.push_back(socket);
  }
  for (;;) {
    int waitMs = -1;
    if (!forever) {
      const std::int64_t remaining = deadline - (SteadyNowNs() - start);
      if (remaining <= 0) return {};
      waitMs = static_cast<int>(std::min<std::int64_t>(remaining / 1000000, INT_MAX));
    }
    const int ready = ::poll(entries.data(), entries.size(), waitMs);
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return {};
    std::vector<Socket*> result;
    for (std::size_t i = 0; i < entries.size(); ++i) {
      if (entries[i].revents & kPollReady) result.push_back(owners[i]);
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
  if (handle_ < 0) return false;
  if (stopRequested_.load()) return false;
  const std::int64_t waitMs = (timeoutMs == 0 || timeoutMs == kNoTimeout) ? kDefaultAcceptTimeoutMs : timeoutMs;
  WaitReadable({this}, waitMs);  // passes whatever it found; accept() decides
  if (stopRequested_.load()) return false;
  socklen_t length = sizeof(target.address_);
  const int accepted = RetryEintr(
      [&] { return ::accept4(handle_, reinterpret_cast<sockaddr*>(&target.address_), &length, SOCK_CLOEXEC); });
  if (accepted < 0) {
    const auto error = LastSocketError::Read();
    target.Close();
    if (error.err != EAGAIN && error.err != EWOULDBLOCK && error.err != ECONNABORTED && error.err != EINVAL) {
      // Out of descriptors or memory: the pending connection stays queued
      // and the socket keeps reporting readable, so a caller that loops on
      // Accept would spin. Pause before reporting the failure.
      Log(LogType::Normal, "", "Acceptor::Accept failed : %s\n", ErrorText(error).c_str());
      if (!stopRequested_.load()) ::poll(nullptr, 0, static_cast<int>(kAcceptFailurePauseMs));
    }
    return false;
  }
  target.handle_ = accepted;
  target.port_ = ntohs(target.address_.sin_port);
  target.SetNoDelay();
  target.SetBlocking(true);
  return true;
}

void Acceptor::Close() {
  stopRequested_.store(true);
  // On Linux shutting a listening socket down ends its listening state: a
  // poll() on it reports a hang-up at once and accept() fails. This takes the
  // place of a wake-up connection to our own port, and keeps the descriptor
  // number reserved until no Accept can be using it.
  Shutdown();
}

}  // namespace pm::ip
