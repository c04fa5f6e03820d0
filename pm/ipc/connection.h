#pragma once
// One connected TCP stream on 127.0.0.1 with its own write lock.
//
// Wire formats carried on a connection (all integers little-endian):
//  1. Message frame (request dispatcher): 4-byte length N, then N bytes of
//     JSON text, N <= kMaxFrameBytes (pm/ipc/framing.h).
//  2. Queue record, task to host: 4-byte token, then exactly R record bytes
//     (R fixed when the queue producer starts; 60 for the shared-memory queue).
//  3. Token return, host to task: 4 bytes.
//  4. Wake word FF FF FF FF, only on a queue producer's private loopback pair.
//
// Which thread calls this: Send, SendMessage and Close from any thread (they
// take the connection's lock); ReadFromSocket from one reader thread at a time
// (it takes no lock). WaitReadableConnections from any thread.
//
// Closing and the descriptor: Close clears `connected` and shuts the socket
// down in both directions, which wakes a reader blocked in ReadFromSocket or
// in WaitReadableConnections (it sees the socket hang up) and a sender blocked
// in a full socket buffer, and sends the peer its end of stream. The
// descriptor number itself stays reserved until the Connection is destroyed,
// that is until its last shared owner lets go: on Linux a closed number can be
// handed to the next open() at once, and a reader that is still inside a call
// must never read from an unrelated file. Close never waits behind a sender
// that is blocked on a peer that does not read.
//
// Lock: lock_ guards the socket's writes; nothing else is locked while it is
// held (it is the innermost lock).

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "pm/ip/socket.h"
#include "pm/ipc/framing.h"

namespace pm::ipc {

class Connection {
 public:
  Connection();
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Connects to 127.0.0.1:port. None on failure (logged).
  static std::unique_ptr<Connection> Open(int port);

  // Marks the connection closed and shuts the socket down; wakes a reader
  // blocked in ReadFromSocket (see above for the descriptor).
  void Close();
  // Sends the buffers back to back as one write, atomically with respect to
  // other senders. False when not connected or when the write failed.
  bool Send(BufferList buffers);
  // Message frame: false (nothing written) for texts over kMaxFrameBytes.
  static bool SendMessage(std::shared_ptr<Connection> connection, const std::string& text);
  // Reads exactly `length` bytes. False when not connected, on timeout (the
  // connection stays usable) or when the peer has gone (connected turns false).
  // Bytes of a block that arrived only in part before the timeout are kept
  // and begin the next read, so the stream never loses its place. A timeout
  // of kNoTimeout (INT64_MAX) or 0 waits for ever.
  bool ReadFromSocket(void* destination, std::size_t length, std::int64_t timeoutMs);

  bool IsConnected() const;
  // For options and the descriptor number; close through Close(), never
  // through the socket (that would release the number under a reader).
  ip::Socket& GetSocket() { return socket_; }

  // The listed connections whose sockets became readable (or hung up) within
  // timeoutMs, in the order the wait reported them. Empty on timeout or error.
  static std::vector<std::shared_ptr<Connection>> WaitReadableConnections(
      const std::vector<std::shared_ptr<Connection>>& connections, std::int64_t timeoutMs);

 private:
  friend class Server;
  ip::Socket socket_;  // its descriptor is fixed from Open/Accept until destruction
  std::mutex lock_;  // serialises Send and Close (the socket's writes and its closing)
  std::atomic<bool> connected_{false};
  // Reader thread only:
  std::int64_t receiveTimeoutMs_ = INT64_MAX;  // the SO_RCVTIMEO last applied
  std::vector<std::uint8_t> carry_;            // start of a block cut short by a timeout
};

}  // namespace pm::ipc
