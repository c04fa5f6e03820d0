#pragma once
// A listening endpoint on 127.0.0.1 with a port the system assigns, and a
// listener thread ("pm::Ipc Listener") that accepts connections and hands
// each to a callback.
//
// Threads: `onConnection` runs on the listener thread. Stop may run on any
// thread, also inside onConnection; StartWaitingForConnections and the
// destructor join the listener thread and must not run on it. Stop before
// destroying whatever onConnection uses (the destructor stops and joins).

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <thread>

#include "pm/ip/socket.h"
#include "pm/ipc/connection.h"
#include "pm/runtime/semaphore.h"

namespace pm::ipc {

class Server {
 public:
  using OnConnection = std::function<void(std::unique_ptr<Connection>)>;

  // How long one pass of the listener waits for a connection; Stop ends the
  // wait at once.
  static constexpr std::int64_t kListenerAcceptTimeoutMs = 10000;

  Server() = default;
  ~Server();
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  // Bound to 127.0.0.1 on a system-assigned port and listening (backlog 5,
  // non-blocking). None when a step fails.
  static std::unique_ptr<Server> CreateListening();

  int GetPort() const { return acceptor_.StoredPort(); }

  // Joins an earlier listener and starts a new one that hands every accepted
  // Connection to onConnection (on the listener thread). Returns once the
  // thread runs. Logs "Server::StartWaitingForConnections: Bad port %d\n" and
  // starts nothing when the port is not positive; an empty callable or a
  // stopped Server also starts nothing.
  void StartWaitingForConnections(OnConnection onConnection);

  // Ends the listener (at once, also from inside onConnection) and stops the
  // listening socket for good. Does not join.
  void Stop();

  // Accepts one connection, waiting up to timeoutMs (0 or INT64_MAX mean
  // 60,000 ms). None when nobody connected in time or after Stop.
  std::unique_ptr<Connection> AcceptConnection(std::int64_t timeoutMs);

 private:
  void ListenerMain(const std::shared_ptr<Semaphore>& started, OnConnection onConnection);

  ip::Acceptor acceptor_;
  std::thread listenerThread_;  // touched only by StartWaitingForConnections and the destructor
  std::atomic<bool> running_{false};
};

}  // namespace pm::ipc
