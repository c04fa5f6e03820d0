#include "support/host_link.h"

#include <cstring>

#include "pm/ipc/server.h"
#include "pm/shm/queue_record.h"

namespace pmtest {

HostLink::HostLink() {
  auto server = pm::ipc::Server::CreateListening();
  std::shared_ptr<pm::ipc::Connection> task = pm::ipc::Connection::Open(server->GetPort());
  host_ = server->AcceptConnection(5000);
  server->Stop();
  dispatcher_ = std::make_shared<pm::RpcDispatcher>(task);
  dispatcher_->Start();
}

HostLink::~HostLink() {
  dispatcher_->Stop();
  host_->Close();
}

std::optional<nlohmann::json> HostLink::Read(std::int64_t timeoutMs) {
  std::uint32_t length = 0;
  if (!host_->ReadFromSocket(&length, 4, timeoutMs)) return std::nullopt;
  std::string text(length, '\0');
  if (length > 0 && !host_->ReadFromSocket(text.data(), length, timeoutMs)) return std::nullopt;
  return nlohmann::json::parse(text, nullptr, false);
}

std::optional<nlohmann::json> HostLink::ReadCommand(const std::string& command, std::int64_t timeoutMs) {
  for (;;) {
    auto message = Read(timeoutMs);
    if (!message) return std::nullopt;
    if (message->value("pm::command", "") == command) return message;
  }
}

QueueReader::QueueReader(int port) { connection_ = pm::ipc::Connection::Open(port); }

bool QueueReader::ReadRecord(std::uint32_t* token, std::uint8_t record[60], std::int64_t timeoutMs) {
  if (!connection_) return false;
  std::uint8_t bytes[64];
  if (!connection_->ReadFromSocket(bytes, sizeof bytes, timeoutMs)) return false;
  std::memcpy(token, bytes, 4);
  std::memcpy(record, bytes + 4, 60);
  return true;
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

std::pair<unsigned, unsigned> FletcherSums(const std::uint8_t* bytes, std::size_t length) {
  const pm::FletcherSums sums = pm::Fletcher16(bytes, length);
  return {sums.sum1, sums.sum2};
}

}  // namespace pmtest
