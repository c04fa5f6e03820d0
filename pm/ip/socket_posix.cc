// BSD sockets for socket_system.h.
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/uio.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <vector>

#include "pm/ip/socket_system.h"
#include "pm/runtime/syscall.h"

namespace pm::ip {

LastSocketError LastSocketError::Read() {
  const int e = errno;
  return LastSocketError{e, e};
}

void LastSocketError::Restore() const { errno = err; }

bool LastSocketError::AlreadyConnected() const { return err == EISCONN; }

bool LastSocketError::Interrupted() const { return err == EINTR || wsa == EINTR; }

bool LastSocketError::Gone() const {
  return wsa == ENOTSOCK || wsa == EBADF || wsa == ECONNRESET || wsa == EPIPE;
}

bool LastSocketError::TimedOut() const {
  return wsa == ECONNABORTED || wsa == ETIMEDOUT || wsa == EAGAIN || wsa == EWOULDBLOCK;
}

bool LastSocketError::WouldBlock() const { return wsa == EAGAIN || wsa == EWOULDBLOCK; }

bool LastSocketError::InProgress() const { return wsa == EINPROGRESS || wsa == EALREADY; }

namespace sys {
namespace {

constexpr short kPollAskRead = POLLIN | POLLRDNORM | POLLRDBAND;
constexpr short kPollReady = POLLIN | POLLRDNORM | POLLRDBAND | POLLPRI | POLLOUT | POLLERR | POLLHUP | POLLNVAL;

sockaddr_in LoopbackAddress(int port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(static_cast<std::uint16_t>(port));
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return address;
}

int Fd(SocketHandle handle) { return static_cast<int>(handle); }

bool SetTimeout(SocketHandle handle, int option, std::uint32_t ms) {
  timeval value{};
  value.tv_sec = static_cast<time_t>(ms / 1000);
  value.tv_usec = static_cast<suseconds_t>((ms % 1000) * 1000);
  return ::setsockopt(Fd(handle), SOL_SOCKET, option, &value, sizeof(value)) == 0;
}

}  // namespace

const int kPollSliceMs = INT_MAX;

bool StartOnce() { return true; }

SocketHandle OpenTcp(bool nonBlocking) {
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | (nonBlocking ? SOCK_NONBLOCK : 0), IPPROTO_TCP);
  return fd < 0 ? kNoSocket : fd;
}

void CloseHandle(SocketHandle handle) { ::close(Fd(handle)); }

bool BindLoopback(SocketHandle handle, int port) {
  const sockaddr_in address = LoopbackAddress(port);
  return ::bind(Fd(handle), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0;
}

int LocalPort(SocketHandle handle) {
  sockaddr_in bound{};
  socklen_t length = sizeof(bound);
  if (::getsockname(Fd(handle), reinterpret_cast<sockaddr*>(&bound), &length) != 0) return -1;
  return ntohs(bound.sin_port);
}

bool Listen(SocketHandle handle, int backlog) { return ::listen(Fd(handle), backlog) == 0; }

int ConnectLoopback(SocketHandle handle, int port) {
  const sockaddr_in address = LoopbackAddress(port);
  return ::connect(Fd(handle), reinterpret_cast<const sockaddr*>(&address), sizeof(address));
}

SocketHandle Accept(SocketHandle listener, int* peerPort) {
  sockaddr_in peer{};
  socklen_t length = sizeof(peer);
  const int fd = ::accept4(Fd(listener), reinterpret_cast<sockaddr*>(&peer), &length, SOCK_CLOEXEC);
  if (fd < 0) return kNoSocket;
  if (peerPort != nullptr) *peerPort = ntohs(peer.sin_port);
  return fd;
}

void Shutdown(SocketHandle handle) { ::shutdown(Fd(handle), SHUT_RDWR); }

std::int64_t Send(SocketHandle handle, const void* data, std::size_t length) {
  return ::send(Fd(handle), data, length, MSG_NOSIGNAL);
}

std::int64_t SendGather(SocketHandle handle, const Chunk* chunks, std::size_t count) {
  iovec vectors[kMaxChunks];
  static_assert(kMaxChunks <= IOV_MAX);
  if (count > kMaxChunks) count = kMaxChunks;
  for (std::size_t i = 0; i < count; ++i) vectors[i] = iovec{const_cast<void*>(chunks[i].data), chunks[i].length};
  msghdr message{};
  message.msg_iov = vectors;
  message.msg_iovlen = count;
  return ::sendmsg(Fd(handle), &message, MSG_NOSIGNAL);
}

std::int64_t Receive(SocketHandle handle, void* data, std::size_t length, ReceiveMode mode) {
  const int flags = mode == ReceiveMode::kDontWait ? MSG_DONTWAIT : mode == ReceiveMode::kWaitAll ? MSG_WAITALL : 0;
  return ::recv(Fd(handle), data, length, flags);
}

bool SetNoDelay(SocketHandle handle) {
  const int on = 1;
  return ::setsockopt(Fd(handle), IPPROTO_TCP, TCP_NODELAY, &on, sizeof(on)) == 0;
}

bool SetNonBlocking(SocketHandle handle, bool nonBlocking) {
  const int flags = ::fcntl(Fd(handle), F_GETFL);
  if (flags < 0) return false;
  const int wanted = nonBlocking ? (flags | O_NONBLOCK) : (flags & ~O_NONBLOCK);
  return wanted == flags || ::fcntl(Fd(handle), F_SETFL, wanted) == 0;
}

bool SetReceiveTimeout(SocketHandle handle, std::uint32_t ms) { return SetTimeout(handle, SO_RCVTIMEO, ms); }

bool SetSendTimeout(SocketHandle handle, std::uint32_t ms) { return SetTimeout(handle, SO_SNDTIMEO, ms); }

int PendingError(SocketHandle handle) {
  int error = 0;
  socklen_t length = sizeof(error);
  if (::getsockopt(Fd(handle), SOL_SOCKET, SO_ERROR, &error, &length) != 0) return -1;
  return error;
}

int Poll(PollEntry* entries, std::size_t count, int timeoutMs) {
  pollfd polled[64];
  std::vector<pollfd> many;
  pollfd* fds = polled;
  if (count > 64) {
    many.resize(count);
    fds = many.data();
  }
  for (std::size_t i = 0; i < count; ++i) {
    fds[i] = pollfd{Fd(entries[i].handle), entries[i].writable ? static_cast<short>(POLLOUT) : kPollAskRead, 0};
  }
  const int ready = ::poll(fds, count, timeoutMs < 0 ? -1 : timeoutMs);
  for (std::size_t i = 0; i < count; ++i) entries[i].ready = ready > 0 && (fds[i].revents & kPollReady) != 0;
  return ready;
}

bool MakeWakePair(WakePair* pair) {
  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, fds) != 0) return false;
  pair->read = fds[0];
  pair->write = fds[1];
  return true;
}

}  // namespace sys
}  // namespace pm::ip
