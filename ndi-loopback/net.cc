#include "ndi-loopback/net.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>

#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"

namespace ndilb {

int ListenLoopback(int* port) {
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: socket failed: %s", pm::ErrnoText(errno).c_str());
    return -1;
  }
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  addr.sin_port = 0;
  // The lowest free port from NDI_LOOPBACK_FIRST_PORT on, as the vendor
  // runtime's senders take the lowest free one from 5961 (a port that a
  // dead sender left is taken again at once); else any port.
  const char* first = std::getenv("NDI_LOOPBACK_FIRST_PORT");
  const long from = first != nullptr ? std::strtol(first, nullptr, 10) : 0;
  bool bound = false;
  for (long p = from; !bound && p > 0 && p < from + kFirstPortTries && p <= 65535; ++p) {
    addr.sin_port = htons(static_cast<std::uint16_t>(p));
    bound = ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
  }
  if (!bound) addr.sin_port = 0;
  socklen_t len = sizeof addr;
  if ((!bound && ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) || ::listen(fd, 32) != 0 ||
      ::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot listen on 127.0.0.1: %s", pm::ErrnoText(errno).c_str());
    ::close(fd);
    return -1;
  }
  *port = ntohs(addr.sin_port);
  return fd;
}

int ConnectTo(const std::string& url, int timeout_ms) {
  const std::size_t colon = url.rfind(':');
  if (colon == std::string::npos || colon == 0) return -1;
  const std::string host = url.substr(0, colon);
  char* end = nullptr;
  const long port = std::strtol(url.c_str() + colon + 1, &end, 10);
  if (end == url.c_str() + colon + 1 || *end != '\0' || port <= 0 || port > 65535) return -1;
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<std::uint16_t>(port));
  if (::inet_pton(AF_INET, host.c_str(), &addr.sin_addr) != 1) return -1;
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (fd < 0) return -1;
  int rc = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  if (rc != 0 && errno == EINPROGRESS) {
    pollfd p{fd, POLLOUT, 0};
    rc = pm::RetryEintr([&] { return ::poll(&p, 1, timeout_ms); });
    int err = 0;
    socklen_t len = sizeof err;
    if (rc == 1 && ::getsockopt(fd, SOL_SOCKET, SO_ERROR, &err, &len) == 0 && err == 0) {
      rc = 0;
    } else {
      rc = -1;
    }
  }
  if (rc != 0) {
    ::close(fd);
    return -1;
  }
  ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) & ~O_NONBLOCK);
  return fd;
}

void TuneConnection(int fd, int send_timeout_ms) {
  int one = 1;
  ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
  timeval tv{};
  tv.tv_sec = send_timeout_ms / 1000;
  tv.tv_usec = (send_timeout_ms % 1000) * 1000;
  ::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof tv);
}

bool WriteAll(int fd, iovec* iov, int count) {
  while (count > 0) {
    if (iov->iov_len == 0) {
      ++iov;
      --count;
      continue;
    }
    msghdr msg{};
    msg.msg_iov = iov;
    msg.msg_iovlen = static_cast<std::size_t>(count < IOV_MAX ? count : IOV_MAX);
    const ssize_t n = pm::RetryEintr([&] { return ::sendmsg(fd, &msg, MSG_NOSIGNAL); });
    if (n <= 0) return false;
    std::size_t left = static_cast<std::size_t>(n);
    while (left > 0 && count > 0) {
      if (left >= iov->iov_len) {
        left -= iov->iov_len;
        ++iov;
        --count;
      } else {
        iov->iov_base = static_cast<char*>(iov->iov_base) + left;
        iov->iov_len -= left;
        left = 0;
      }
    }
  }
  return true;
}

int MakeWakeFd() { return ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK); }

void Wake(int fd) {
  const std::uint64_t one = 1;
  [[maybe_unused]] ssize_t n = ::write(fd, &one, sizeof one);
}

void Drain(int fd) {
  std::uint64_t value = 0;
  [[maybe_unused]] ssize_t n = ::read(fd, &value, sizeof value);
}

bool WaitWake(int fd, int ms) {
  pollfd p{fd, POLLIN, 0};
  return pm::RetryEintr([&] { return ::poll(&p, 1, ms); }) == 1;
}

}  // namespace ndilb
