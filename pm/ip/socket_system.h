#pragma once
// The system's socket calls, one thin function each, for IPv4 TCP on the
// loopback address 127.0.0.1: socket_posix.cc (BSD sockets) and
// socket_win.cc (Windows Sockets 2). pm::ip::Socket and the loopback NDI
// runtime build their rules (retries, classification, deadlines) on these;
// nothing here logs or retries except where said.
//
// A failing call returns -1 (or false, or kNoSocket) and leaves its error
// where LastSocketError::Read (socket.h) finds it.
#include <cstddef>
#include <cstdint>

#include "pm/ip/socket_types.h"

namespace pm::ip::sys {

// Starts the socket library once per process (WSAStartup 2.2 on Windows;
// nothing elsewhere) and keeps it until the process ends. False, after one
// "WSAStartup failed %d\n" line, when it cannot start. Any thread.
bool StartOnce();

// A new TCP socket, not inherited by child processes; non-blocking when
// asked.
SocketHandle OpenTcp(bool nonBlocking);
// Releases the handle (close, closesocket); the handle may be reused at once.
void CloseHandle(SocketHandle handle);

bool BindLoopback(SocketHandle handle, int port);
// The locally bound port; -1 when the system cannot say.
int LocalPort(SocketHandle handle);
bool Listen(SocketHandle handle, int backlog);
// connect() to 127.0.0.1:port; 0 on success, -1 on failure. A non-blocking
// socket's connect that goes on in the background fails with an error
// LastSocketError::InProgress() recognises.
int ConnectLoopback(SocketHandle handle, int port);
// accept(); the new socket (not inherited) and the peer's port, or kNoSocket.
SocketHandle Accept(SocketHandle listener, int* peerPort);
// Ends both directions and wakes every thread blocked in a call on the
// handle (Windows needs CancelIoEx for that besides shutdown). The handle
// stays reserved. A wait that starts after this may not see it on Windows:
// callers keep a flag of their own (see Socket::Shutdown).
void Shutdown(SocketHandle handle);

// One send; bytes sent or -1. Never raises SIGPIPE.
std::int64_t Send(SocketHandle handle, const void* data, std::size_t length);
// One gather send of up to kMaxChunks pieces; bytes sent or -1.
struct Chunk {
  const void* data;
  std::size_t length;
};
inline constexpr std::size_t kMaxChunks = 64;
std::int64_t SendGather(SocketHandle handle, const Chunk* chunks, std::size_t count);

enum class ReceiveMode {
  kNormal,    // the socket's own mode
  kDontWait,  // never blocks: would-block (LastSocketError::WouldBlock) when nothing is waiting
  kWaitAll,   // blocks until the whole length arrived, the stream ended or an error came
};
// One receive; bytes read, 0 at the end of the stream, -1 on error.
std::int64_t Receive(SocketHandle handle, void* data, std::size_t length, ReceiveMode mode);

bool SetNoDelay(SocketHandle handle);
bool SetNonBlocking(SocketHandle handle, bool nonBlocking);
// Receive and send timeouts in milliseconds; 0 waits for ever.
bool SetReceiveTimeout(SocketHandle handle, std::uint32_t ms);
bool SetSendTimeout(SocketHandle handle, std::uint32_t ms);
// The error of a background connect once it has settled (SO_ERROR): 0 when it
// connected; -1 when the system cannot say.
int PendingError(SocketHandle handle);

struct PollEntry {
  SocketHandle handle;
  bool writable;  // ask for writability instead of readability
  bool ready;     // out: readable (or writable), hung up or failed
};
// poll()/WSAPoll(): the number of ready entries, 0 on timeout, -1 on error.
// timeoutMs < 0 waits for ever.
int Poll(PollEntry* entries, std::size_t count, int timeoutMs);

// The longest single wait in Poll that code needing to notice its own
// Shutdown should use: unbounded on POSIX, where a shut-down socket polls as
// hung up; 100 ms on Windows, where a WSAPoll that starts after our own
// shutdown reports nothing until it times out.
extern const int kPollSliceMs;

// A pair of connected sockets for waking a thread that waits in Poll:
// writing a byte to `write` makes `read` readable. Non-blocking, not
// inherited. False when it cannot be made.
struct WakePair {
  SocketHandle read = kNoSocket;
  SocketHandle write = kNoSocket;
};
bool MakeWakePair(WakePair* pair);

}  // namespace pm::ip::sys
