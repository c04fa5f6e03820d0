#pragma once
// The socket handle and the error of a failed socket call, the same on every
// platform; what the numbers mean is the platform's (socket_posix.cc,
// socket_win.cc).
#include <cstdint>
#include <string>

namespace pm::ip {

// A descriptor (POSIX) or a SOCKET (Windows) in a signed integer wide enough
// for both; kNoSocket (-1, also Windows' INVALID_SOCKET) when there is none.
using SocketHandle = std::intptr_t;
inline constexpr SocketHandle kNoSocket = -1;

// The C library's errno and the socket library's error number
// (WSAGetLastError on Windows; on POSIX the socket call's errno again), read
// together right after a failing call.
struct LastSocketError {
  int err = 0;  // errno
  int wsa = 0;  // the socket call's error number

  // Reads both now (call right after the failing call).
  static LastSocketError Read();
  // Puts both back, for a caller that classifies after a log line.
  void Restore() const;

  // POSIX numbers                                 | Windows numbers
  bool AlreadyConnected() const;  // EISCONN       | EISCONN, WSAEISCONN
  bool Interrupted() const;       // EINTR         | EINTR, WSAEINTR
  // ENOTSOCK, EBADF, ECONNRESET, EPIPE            | WSAENOTSOCK, WSAECONNRESET, and after our own
  //                                               | Shutdown WSAESHUTDOWN and the cancelled call's 995
  bool Gone() const;
  // ECONNABORTED, ETIMEDOUT, EAGAIN/EWOULDBLOCK   | WSAECONNABORTED, WSAETIMEDOUT
  // (an expired SO_RCVTIMEO)                      |
  bool TimedOut() const;
  bool WouldBlock() const;  // EAGAIN/EWOULDBLOCK | WSAEWOULDBLOCK (a non-blocking call found nothing)
  bool InProgress() const;  // EINPROGRESS, EALREADY | WSAEWOULDBLOCK, WSAEALREADY (a connect goes on)
};

// "[errno=E,wsa=W]", both numbers in decimal.
std::string ErrorText(const LastSocketError& error);

}  // namespace pm::ip
