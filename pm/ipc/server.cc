#include "pm/ipc/server.h"

#include <exception>

#include "pm/runtime/log.h"
#include "pm/runtime/semaphore.h"
#include "pm/runtime/thread_name.h"

namespace pm::ipc {

Server::~Server() {
  Stop();
  if (listenerThread_.joinable()) listenerThread_.join();
  // The acceptor's destructor releases the listening descriptor; no Accept
  // can run any more.
}

std::unique_ptr<Server> Server::CreateListening() {
  auto server = std::make_unique<Server>();
  if (!server->acceptor_.Init(0) || !server->acceptor_.Bind() || !server->acceptor_.Listen()) return nullptr;
  return server;
}

void Server::StartWaitingForConnections(OnConnection onConnection) {
  const int port = GetPort();
  if (port <= 0) {
    Log(LogType::Normal, "", "Server::StartWaitingForConnections: Bad port %d\n", port);
    return;
  }
  if (!onConnection) {
    Log(LogType::Normal, "", "Server::StartWaitingForConnections: No connection callback\n");
    return;
  }
  running_.store(false);
  if (listenerThread_.joinable()) listenerThread_.join();
  if (acceptor_.StopRequested()) {
    Log(LogType::Normal, "", "Server::StartWaitingForConnections: Server on port %d was stopped\n", port);
    return;
  }
  running_.store(true);
  auto started = std::make_shared<Semaphore>();
  listenerThread_ = std::thread(&Server::ListenerMain, this, started, std::move(onConnection));
  started->Wait();
}

void Server::Stop() {
  running_.store(false);
  acceptor_.Close();
}

std::unique_ptr<Connection> Server::AcceptConnection(std::int64_t timeoutMs) {
  auto connection = std::make_unique<Connection>();
  if (!acceptor_.Accept(connection->socket_, timeoutMs)) return nullptr;
  connection->connected_.store(true);
  return connection;
}

void Server::ListenerMain(const std::shared_ptr<Semaphore>& started, OnConnection onConnection) {
  SetThreadName("pm::Ipc Listener");
  started->Signal();
  // A stopped acceptor refuses at once; leaving then keeps the loop from
  // spinning when running was set again after a Stop.
  while (running_.load() && !acceptor_.StopRequested()) {
    std::unique_ptr<Connection> connection = AcceptConnection(kListenerAcceptTimeoutMs);
    if (!connection || !running_.load()) continue;  // one not handed over closes here
    try {
      onConnection(std::move(connection));
    } catch (const std::exception& e) {
      Log(LogType::Normal, "", "Server: connection callback failed: %s\n", e.what());
    } catch (...) {
      Log(LogType::Normal, "", "Server: connection callback failed\n");
    }
  }
  ClearThreadName();
}

}  // namespace pm::ipc
