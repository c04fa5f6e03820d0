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
  HostLink() {
    HostListener listener;
    dispatcher_ = std::make_shared<pm::RpcDispatcher>(pm::ipc::Connection::Open(listener.Port()));
    host_ = listener.Accept();
    dispatcher_->Start();
  }
  ~HostLink() { dispatcher_->Stop(); }

  // The dispatcher the code under test sends on (started).
  const std::shared_ptr<pm::RpcDispatcher>& Dispatcher() const { return dispatcher_; }
  // Reads messages until one has "pm::command" == command; nullopt when none
  // comes within `timeoutMs`.
  std::optional<nlohmann::json> ReadCommand(const std::string& command, std::int64_t timeoutMs = 5000) {
    for (;;) {
      const nlohmann::json message = host_.ReadJson(std::chrono::milliseconds(timeoutMs));
      if (message.is_discarded()) return std::nullopt;
      if (message.value("pm::command", "") == command) return message;
    }
  }

 private:
  HostPeer host_;
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
};

// The host's end of a shared-memory queue: connects to the queue's port, reads
// 64-byte records (token + 60 record bytes, written by the task as one block)
// and returns tokens.
class QueueReader {
 public:
  explicit QueueReader(int port) : connection_(pm::ipc::Connection::Open(port)) {}
  // Reads one record; false on timeout or a closed connection.
  bool ReadRecord(std::uint32_t* token, std::uint8_t record[60], std::int64_t timeoutMs = 5000) {
    return connection_ && connection_->ReadFromSocket(token, 4, timeoutMs) &&
           connection_->ReadFromSocket(record, 60, timeoutMs);
  }
  bool ReturnToken(std::uint32_t token) {
    pm::BufferList list;
    list.emplace_back(&token, 4u);
    return connection_ && connection_->Send(std::move(list));
  }

 private:
  std::shared_ptr<pm::ipc::Connection> connection_;
};

}  // namespace pmtest
