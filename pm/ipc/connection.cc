#include "pm/ipc/connection.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "pm/runtime/log.h"

namespace pm::ipc {

namespace {
constexpr int kOpenAttempts = 64;
}  // namespace

Connection::Connection() = default;

Connection::~Connection() { Close(); }

std::unique_ptr<Connection> Connection::Open(int port) {
  auto connection = std::make_unique<Connection>();
  if (!connection->socket_.Init(port)) {
    const auto error = ip::LastSocketError::Read();
    Log(LogType::Normal, "", "Connection::Open: Failed on port %d, %s\n", port, ip::ErrorText(error).c_str());
    return nullptr;
  }
  ip::LastSocketError error;
  for (int call = 0; call < kOpenAttempts; ++call) {
    if (connection->socket_.Connect()) {
      connection->connected_.store(true);
      return connection;
    }
    error = ip::LastSocketError::Read();
    if (error.AlreadyConnected()) {
      connection->connected_.store(true);
      return connection;
    }
    if (!error.Interrupted()) break;
  }
  // Also after 64 interrupted calls: the caller gets none rather than a
  // connection in an unknown state.
  Log(LogType::Normal, "", "Connection::Open: Failed on port %d, %s\n", port, ip::ErrorText(error).c_str());
  return nullptr;
}

void Connection::Close() {
  connected_.store(false);
  // Shut down before taking the lock: a sender blocked on a peer that stopped
  // reading holds the lock, and the shutdown is what ends its send.
  socket_.Shutdown();
  std::lock_guard<std::mutex> hold(lock_);
}

bool Connection::Send(BufferList buffers) {
  std::lock_guard<std::mutex> hold(lock_);
  if (!connected_.load()) return false;
  return socket_.SendAll(std::move(buffers)) != 0;
}

bool Connection::SendMessage(std::shared_ptr<Connection> connection, const std::string& text) {
  if (!connection) return false;
  if (text.size() > kMaxFrameBytes) {
    Log(LogType::Normal, "", "Connection::SendMessage: message of %zu bytes is over the limit of %u\n", text.size(),
        kMaxFrameBytes);
    return false;
  }
  const auto length = static_cast<std::uint32_t>(text.size());
  const auto prefix = FramePrefix(length);
  return connection->Send(BufferList{{prefix.data(), kFrameHeaderBytes}, {text.data(), length}});
}

bool Connection::ReadFromSocket(void* destination, std::size_t length, std::int64_t timeoutMs) {
  if (!connected_.load()) return false;
  if (timeoutMs != receiveTimeoutMs_) {
    receiveTimeoutMs_ = timeoutMs;
    socket_.SetReceiveTimeout(timeoutMs);
  }
  auto* out = static_cast<std::uint8_t*>(destination);
  std::size_t have = std::min(carry_.size(), length);
  if (have > 0) {
    std::memcpy(out, carry_.data(), have);
    carry_.erase(carry_.begin(), carry_.begin() + static_cast<std::ptrdiff_t>(have));
  }
  auto keepPartial = [&] { carry_.insert(carry_.begin(), out, out + have); };
  while (have < length) {
    const std::int64_t got = socket_.Receive(out + have, length - have);
    if (got > 0) {
      have += static_cast<std::size_t>(got);
      continue;
    }
    if (got == 0) {  // end of stream (also after our own Close)
      connected_.store(false);
      return false;
    }
    const auto error = ip::LastSocketError::Read();
    if (error.Interrupted()) continue;
    if (error.Gone()) {
      connected_.store(false);
      return false;
    }
    keepPartial();
    if (error.TimedOut()) return false;
    Log(LogType::Normal, "", "Connection::ReadFromSocket: No Data : %d bytes %s\n", static_cast<int>(got),
        ip::ErrorText(error).c_str());
    return false;
  }
  return true;
}

bool Connection::IsConnected() const { return connected_.load(); }

std::vector<std::shared_ptr<Connection>> Connection::WaitReadableConnections(
    const std::vector<std::shared_ptr<Connection>>& connections, std::int64_t timeoutMs) {
  std::vector<ip::Socket*> sockets;
  sockets.reserve(connections.size());
  for (const auto& connection : connections) {
    if (connection) sockets.push_back(&connection->socket_);
  }
  const std::vector<ip::Socket*> ready = ip::Socket::WaitReadable(sockets, timeoutMs);
  std::vector<std::shared_ptr<Connection>> result;
  result.reserve(ready.size());
  for (ip::Socket* socket : ready) {
    for (const auto& connection : connections) {
      if (connection && &connection->socket_ == socket) {
        result.push_back(connection);
        break;
      }
    }
  }
  return result;
}

}  // namespace pm::ipc
