#include "support/host_link.h"

namespace pmtest {

HostLink::HostLink() {
  HostListener listener;
  std::shared_ptr<pm::ipc::Connection> task = pm::ipc::Connection::Open(listener.Port());
  host_ = listener.Accept();
  dispatcher_ = std::make_shared<pm::RpcDispatcher>(task);
  dispatcher_->Start();
}

HostLink::~HostLink() {
  dispatcher_->Stop();
  host_.Close();
}

std::optional<nlohmann::json> HostLink::Read(std::int64_t timeoutMs) {
  nlohmann::json message = host_.ReadJson(std::chrono::milliseconds(timeoutMs));
  if (message.is_discarded()) return std::nullopt;
  return message;
}

std::optional<nlohmann::json> HostLink::ReadCommand(const std::string& command, std::int64_t timeoutMs) {
  for (;;) {
    auto message = Read(timeoutMs);
    if (!message) return std::nullopt;
    if (message->value("pm::command", "") == command) return message;
  }
}

QueueReader::QueueReader(int port) { connection_ = pm::ipc::Connection::Open(port); }

// The task writes each record as one block: the token and the record bytes
// arrive together.
bool QueueReader::ReadRecord(std::uint32_t* token, std::uint8_t record[60], std::int64_t timeoutMs) {
  return connection_ && connection_->ReadFromSocket(token, 4, timeoutMs) &&
         connection_->ReadFromSocket(record, 60, timeoutMs);
}

bool QueueReader::ReturnToken(std::uint32_t token) {
  if (!connection_) return false;
  pm::BufferList list;
  list.emplace_back(&token, 4u);
  return connection_->Send(std::move(list));
}

void QueueReader::Close() {
  if (connection_) connection_->Close();
}

}  // namespace pmtest
