#pragma once
// Small socket helpers of the loopback runtime (127.0.0.1 TCP only), on the
// system calls of pm/ip/socket_system.h (BSD sockets or Winsock 2).
#include <cstddef>
#include <cstdint>
#include <string>

#include "pm/ip/socket_system.h"

namespace ndilb {

using SocketHandle = pm::ip::SocketHandle;
inline constexpr SocketHandle kNoSocket = pm::ip::kNoSocket;
// One piece of a gather write.
using Piece = pm::ip::sys::Chunk;

// A listening socket on 127.0.0.1; kNoSocket on failure (logged). The port is
// the lowest free one of the kFirstPortTries from $NDI_LOOPBACK_FIRST_PORT on
// when that is set (as the vendor runtime's senders take theirs from 5961),
// else one chosen by the system.
inline constexpr long kFirstPortTries = 64;
SocketHandle ListenLoopback(int* port);
// Accepts a pending connection of a listening socket; kNoSocket when none.
SocketHandle AcceptFrom(SocketHandle listener);
// Connects to "127.0.0.1:PORT" within `timeout_ms`; kNoSocket when it cannot.
SocketHandle ConnectTo(const std::string& url, int timeout_ms);
// Options of every frame connection: no Nagle, a send timeout so that a
// stalled peer cannot block a writer for longer than `send_timeout_ms`.
void TuneConnection(SocketHandle fd, int send_timeout_ms);
// Writes every byte of the pieces (advancing them); false when the peer is
// gone or the send timeout passed. Never raises SIGPIPE.
bool WriteAll(SocketHandle fd, Piece* pieces, int count);
// Ends both directions and wakes a thread blocked on the socket (also on
// Windows, see pm/ip/socket_system.h); the handle stays reserved.
void ShutdownSocket(SocketHandle fd);
void CloseSocket(SocketHandle fd);

// Wakes a thread sleeping in Poll: a pair of connected sockets whose read
// end becomes readable on Wake. Any thread may Wake; one thread waits.
class Waker {
 public:
  Waker();
  ~Waker();
  Waker(const Waker&) = delete;
  Waker& operator=(const Waker&) = delete;

  bool ok() const { return pair_.read != kNoSocket; }
  // The handle to poll for readability beside others.
  SocketHandle handle() const { return pair_.read; }
  void Wake();
  // Takes back what Wake wrote.
  void Drain();
  // Sleeps in poll on the read end for up to `ms`; true when woken.
  bool Wait(int ms);

 private:
  pm::ip::sys::WakePair pair_;
};

}  // namespace ndilb
