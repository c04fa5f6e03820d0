#pragma once
// IPv4 TCP sockets on the loopback address 127.0.0.1, and the listening
// Acceptor that accepts into another Socket and can be stopped from another
// thread.
//
// Errors: nothing here throws. Operations report through their result and
// write the log lines quoted beside them. A Socket without a handle makes
// every operation fail harmlessly.
//
// No send ever raises SIGPIPE: a peer that has gone makes the send fail.
//
// Threads and handle lifetime. A Socket is used by one thread at a time,
// with two exceptions that are safe from any thread while another thread is
// blocked in Receive, ReceiveExact, SendAll, WaitReadable or Accept on it:
//   - Socket::Shutdown, which makes a blocked or later receive return end of
//     stream or fail as gone, and a blocked or later WaitReadable report the
//     socket;
//   - Acceptor::Close, which sets the stop flag and shuts the listening
//     socket down (a waiting Accept wakes and fails at once).
// Neither releases the handle. Closing wakes nobody on Linux, and the number
// may be handed to the next open at once, so a thread still inside a call
// could end up reading or accepting on an unrelated file or socket.
// The handle is released only by Socket::Close / the destructor, which the
// owner calls once no other thread can still use the socket (after joining
// the listener thread; when the last shared owner of a Connection goes).
//
// The system calls are in socket_system.h, one file per platform. On
// Windows the socket library (Winsock 2) is started once per process, by the
// first Socket.

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "pm/ip/socket_types.h"

namespace pm {
// An ordered list of (pointer, length) pairs written back to back as one
// logical write.
using BufferList = std::vector<std::pair<const void*, std::uint32_t>>;
}  // namespace pm

namespace pm::ip {

inline constexpr std::int64_t kNoTimeout = INT64_MAX;

class Socket {
 public:
  Socket();
  virtual ~Socket();  // Close()
  Socket(const Socket&) = delete;
  Socket& operator=(const Socket&) = delete;

  // Closes the handle (when there is one) and sets it to kNoSocket. Not safe while another thread uses the socket: use
  // Shutdown to wake such a thread first and Close once it is done.
  virtual void Close();

  // Stores the port (the address is always 127.0.0.1:port) and creates the
  // socket. True when a handle was created. An earlier handle is not closed.
  bool Init(int port);
  // Binds to the address; on success the port becomes GetPort() (0 when the
  // system's port cannot be read back). Logs
  // "ipc::Socket : Bind failed : err : %d, was : %d\n" on failure.
  bool Bind();
  // The stored port when positive, else the system's (getsockname); 0 and
  // "ipc::Socket : Fetching assigned port failed : err : %d, was : %d\n"
  // when that fails.
  int GetPort();
  // listen() with a backlog of 5, then non-blocking. False only without a
  // handle.
  bool Listen();
  // Connects to the address (interrupted attempts repeat, up to 1024 in all),
  // switches Nagle off. Logs "Socket::Connect Failed : %s\n" with ErrorText on
  // failure. LastSocketError::Read after a false result gives the last
  // attempt's error.
  bool Connect();
  // Wakes any thread blocked on this socket and ends both directions, keeping
  // the handle reserved (see the header comment). Any thread. Sets a flag
  // that later waits check before blocking, since on Windows a wait that
  // starts after the shutdown would not see it.
  void Shutdown();

  // One send; its result, or 0 without a handle.
  std::int64_t Send(const void* data, std::size_t length);
  // The entries in order; 0 when any entry is not sent whole (also without a
  // handle), else the total byte count. Partial writes are continued, so
  // a large entry is not cut short by a full socket buffer.
  std::int64_t SendAll(BufferList buffers);
  // One recv(); its result, or 0 without a handle.
  std::int64_t Receive(void* data, std::size_t length);
  // Reads exactly length bytes: the length on success, 0 for a length below
  // 1, -1 without a handle; an end of stream (0) or an error (<0) is
  // returned at once (bytes already read are lost). Interruptions repeat.
  std::int64_t ReceiveExact(void* data, std::size_t length);

  // TCP_NODELAY on. False without a handle.
  bool SetNoDelay();
  // Blocking (true) or non-blocking (false): O_NONBLOCK, ioctlsocket(FIONBIO).
  // False without a handle or when the call fails.
  bool SetBlocking(bool blocking);
  // SO_RCVTIMEO: kNoTimeout means wait for ever (0), other values are
  // milliseconds (the low 32 bits, as an unsigned count). False when the
  // call fails.
  bool SetReceiveTimeout(std::int64_t timeoutMs);

  // The listed sockets that become readable, hang up or fail within
  // timeoutMs, in list order; a socket that was Shutdown counts as ready.
  // Sockets without a handle are not polled. Empty on timeout (0 returns at
  // once without polling) or error.
  static std::vector<Socket*> WaitReadable(const std::vector<Socket*>& sockets,
                                           std::int64_t timeoutMs);

  SocketHandle GetHandle() const { return handle_; }
  int StoredPort() const { return port_; }
  bool WasShutDown() const { return shutDown_.load(); }

 protected:
  SocketHandle handle_ = kNoSocket;
  int port_ = 0;  // Init's port, the bound port, or the peer's port after Accept
  std::atomic<bool> shutDown_{false};  // set by Shutdown, cleared by Init and Accept

  friend class Acceptor;
};

class Acceptor : public Socket {
 public:
  Acceptor() = default;
  ~Acceptor() override;

  // Accepts one connection into target (closed first). Waits up to timeoutMs
  // (0 or kNoTimeout mean 60,000 ms) for a pending connection; false when
  // none came, when there is no handle, or once Close has been called.
  // On success target holds the connection (blocking, Nagle off) and its port
  // is the peer's port. When accept itself fails for want of descriptors or
  // memory, logs "Acceptor::Accept failed : [errno=E,wsa=W]" and pauses
  // 100 ms before returning false, so a listener loop does not spin on a
  // connection it cannot take. One thread at a time.
  bool Accept(Socket& target, std::int64_t timeoutMs);

  // Stops the acceptor: sets the stop flag (Accept fails from now on) and
  // shuts the listening socket down, which wakes an Accept waiting on
  // another thread. Safe from any thread. The handle is released by
  // ReleaseDescriptor or the destructor, once no Accept can be running.
  void Close() override;
  // Releases the handle. Only when no thread can be in Accept.
  void ReleaseDescriptor() { Socket::Close(); }

  bool StopRequested() const { return stopRequested_.load(); }

 private:
  std::atomic<bool> stopRequested_{false};
};

}  // namespace pm::ip
