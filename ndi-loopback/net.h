#pragma once
// Small socket helpers of the loopback runtime (127.0.0.1 TCP only).
#include <sys/uio.h>

#include <cstdint>
#include <string>

namespace ndilb {

// A listening socket on 127.0.0.1; -1 on failure (logged). The port is the
// lowest free one of the kFirstPortTries from $NDI_LOOPBACK_FIRST_PORT on when
// that is set (as the vendor runtime's senders take theirs from 5961), else
// one chosen by the system.
inline constexpr long kFirstPortTries = 64;
int ListenLoopback(int* port);
// Connects to "HOST:PORT" within `timeout_ms`; -1 when it cannot.
int ConnectTo(const std::string& url, int timeout_ms);
// Options of every frame connection: no Nagle, a send timeout so that a
// stalled peer cannot block a writer for longer than `send_timeout_ms`.
void TuneConnection(int fd, int send_timeout_ms);
// Writes every byte of the vector (advancing it); false when the peer is
// gone or the send timeout passed. Never raises SIGPIPE.
bool WriteAll(int fd, iovec* iov, int count);
// An eventfd used to wake a thread sleeping in poll.
int MakeWakeFd();
void Wake(int fd);
void Drain(int fd);
// Sleeps in poll on the wake fd for up to `ms`; true when woken.
bool WaitWake(int fd, int ms);

}  // namespace ndilb
