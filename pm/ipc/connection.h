#pragma once
// One connected TCP stream on 127.0.0.1 with its own write lock.
//
// Wire formats carried on a connection (all integers little-endian):
//  1. Message frame (request dispatcher): 4-byte length N, then N bytes of
//     JSON text. N <= kMaxMessageBytes (524,288); a longer message is never
//     sent, and a receiver closes a connection that announces one.
//  2. Queue record, task to host: 4-byte token, then exactly R record bytes
//     (R fixed when the queue producer starts; 60 for the shared-memory queue).
//  3. Token return, host to task: 4 bytes.
//  4. Wake word FF FF FF FF, only on a queue producer's private loopback pair.
//
// Which thread calls this: Send, SendMessage and Close from any thread (they
// take the connection's lock); ReadFromSocket from one reader thread at a time
// (it takes no lock).

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "pm/ip/socket.h"

namespace pm::ipc {

inline constexpr std::uint32_t kMaxMessageBytes = 524288;

class Connection {
 public:
  Connection();
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Connects to 127.0.0.1:port. None on failure (logged).
  static std::unique_ptr<Connection> Open(int port);

  // Marks the connection closed and closes the socket; wakes a reader blocked
  // in ReadFromSocket.
  void Close();
  // Sends the buffers back to back as one write, atomically with respect to
  // other senders. False when not connected or when the write failed.
  bool Send(BufferList buffers);
  // Message frame: false (nothing written) for texts over kMaxMessageBytes.
  static bool SendMessage(std::shared_ptr<Connection> connection, const std::string& text);
  // Reads exactly `length` bytes. False when not connected, on timeout (the
  // connection stays usable) or when the peer has gone (connected turns false).
  bool ReadFromSocket(void* destination, std::size_t length, std::int64_t timeoutMs);

  bool IsConnected() const;
  ip::Socket& GetSocket() { return socket_; }

  // The listed connections whose sockets became readable (or hung up) within
  // timeoutMs, in the order the wait reported them. Empty on timeout or error.
  static std::vector<std::shared_ptr<Connection>> WaitReadableConnections(
      const std::vector<std::shared_ptr<Connection>>& connections, std::int64_t timeoutMs);

 private:
  friend class Server;
  ip::Socket socket_;
  std::mutex lock_;  // serialises Send and Close (the socket's writes and its closing)
  std::atomic<bool> connected_{false};
  std::int64_t receiveTimeoutMs_ = INT64_MAX;  // used by the reader thread only
};

}  // namespace pm::ipc
