#pragma once
// A task-side request dispatcher connected over loopback to a plain host end
// that the test reads and writes itself, and a host reader for shared-memory
// queue records. For tests of code that talks to the host.
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include <nlohmann/json.hpp>

#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"
#include "support/host_socket.h"

namespace pmtest {

class HostLink {
 public:
  HostLink();
  ~HostLink();

  // The dispatcher the code under test sends on (started).
  const std::shared_ptr<pm::RpcDispatcher>& Dispatcher() const { return dispatcher_; }
  // The next message the task sent, or nullopt after `timeoutMs`.
  std::optional<nlohmann::json> Read(std::int64_t timeoutMs = 5000);
  // Reads messages until one has "pm::command" == command.
  std::optional<nlohmann::json> ReadCommand(const std::string& command, std::int64_t timeoutMs = 5000);

 private:
  HostPeer host_;
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
};

// The host's end of a shared-memory queue: connects to the queue's port, reads
// 64-byte records (token + 60 record bytes) and returns tokens.
class QueueReader {
 public:
  explicit QueueReader(int port);
  bool Connected() const { return connection_ != nullptr; }
  // Reads one record; false on timeout or a closed connection.
  bool ReadRecord(std::uint32_t* token, std::uint8_t record[60], std::int64_t timeoutMs = 5000);
  bool ReturnToken(std::uint32_t token);
  void Close();

 private:
  std::shared_ptr<pm::ipc::Connection> connection_;
};

}  // namespace pmtest
