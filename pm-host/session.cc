#include "pm-host/session.h"

#include <chrono>
#include <future>

#include "pm/runtime/json.h"
#include "pm/runtime/log.h"

namespace pmhost {

using nlohmann::json;

const std::vector<std::string>& Session::NotificationCommands() {
  static const std::vector<std::string> commands = {
      "pm::tsrc::update_maximum_latency_seconds", "pm::tsrc::set_fixed_latency_seconds",
      "pm::tsrc::update_configuration",           "pm::tsrc::update_gui",
      "pm::tsrc::update_production",              "pm::tsrc::timestamp_reset",
      "pm::tsrc::update_build_out_duration",      "pm::tsrc::update_ptz_command_suite",
      "pm::tsrc::update_connection_state",        "pm::tsrc::trigger_shutdown",
      "pm::tsrc::source_available",               "pm::tsrc::source_unavailable"};
  return commands;
}

Session::Session(std::shared_ptr<pm::ipc::Connection> connection, NotificationListener listener, FrameSink* sink)
    : dispatcher_(std::make_shared<pm::RpcDispatcher>(std::move(connection))),
      listener_(std::move(listener)),
      sink_(sink) {
  for (const std::string& command : NotificationCommands()) {
    dispatcher_->RegisterHandler(command, [this, command](const json& request, json&) {
      if (listener_) listener_(command, request);
    });
  }
}

Session::~Session() { Stop(); }

void Session::Start(std::function<void()> onEnded) { dispatcher_->Start(std::move(onEnded)); }

void Session::Stop() {
  dispatcher_->Stop();
  std::map<std::string, std::shared_ptr<QueueReader>> queues;
  std::vector<std::shared_ptr<QueueReader>> retired;
  {
    std::lock_guard<std::mutex> guard(lock_);
    queues = queues_;
    retired.swap(retired_);
  }
  for (auto& [id, queue] : queues) queue->Stop();
  for (auto& queue : retired) queue->Stop();
}

std::optional<json> Session::Request(const std::string& command, json payload, std::int64_t timeoutMs) {
  auto reply = std::make_shared<std::promise<json>>();
  std::future<json> future = reply->get_future();
  if (!dispatcher_->RpcRequest(command, payload, timeoutMs, [reply](const json& message) {
        reply->set_value(message);
      })) {
    return std::nullopt;
  }
  // The dispatcher runs the callback once: with the reply, or with a timeout
  // error at the deadline; the extra second covers the expiry thread's delay.
  // A connection that ends (the task stops itself after the last
  // stop_source, sometimes before its reply leaves) ends the wait as well.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs + 1000);
  while (future.wait_for(std::chrono::milliseconds(20)) != std::future_status::ready) {
    if (dispatcher_->Ended() || std::chrono::steady_clock::now() >= deadline) return std::nullopt;
  }
  json message = future.get();
  if (message.is_object() && message.value("pm::error", "") == "timeout") return std::nullopt;
  return message;
}

bool Session::Notify(const std::string& command, json payload, std::int64_t timeoutMs) {
  return dispatcher_->RpcRequest(command, payload, timeoutMs);
}

std::optional<json> Session::StartDiscovery() {
  return Request("pm::tsrc::start_discovery", {{"unique_id", "discovery"}});
}

std::optional<json> Session::StopDiscovery() {
  return Request("pm::tsrc::stop_discovery", {{"unique_id", "discovery"}});
}

std::optional<json> Session::StartSource(const std::string& id, const json& config) {
  AcceptQueue(id);
  json payload = {{"unique_id", id}};
  if (!config.is_null()) payload["config"] = config;
  return Request("pm::tsrc::start_source", std::move(payload), 10000);
}

std::optional<json> Session::StopSource(const std::string& id) {
  {
    std::lock_guard<std::mutex> guard(lock_);
    if (const auto found = queues_.find(id); found != queues_.end()) found->second->Stopping();
  }
  auto reply = Request("pm::tsrc::stop_source", {{"unique_id", id}}, 10000);
  std::shared_ptr<QueueReader> queue;
  {
    std::lock_guard<std::mutex> guard(lock_);
    auto found = queues_.find(id);
    if (found != queues_.end()) {
      queue = found->second;
      queues_.erase(found);
    }
  }
  if (queue) queue->Stop();
  return reply;
}

std::optional<json> Session::PtzCommand(const std::string& id, json command) {
  if (!command.is_object()) command = json::object();
  command["unique_id"] = id;
  return Request("pm::tsrc::execute_ptz_command", std::move(command));
}

std::optional<json> Session::ShotEvent(const std::string& id, const std::string& event) {
  return Request("pm::tsrc::handle_shot_event", {{"unique_id", id}, {"event", event}});
}

void Session::AcceptQueue(const std::string& id) {
  dispatcher_->RegisterHandler(id + "::start_queue",
                               [this, id](const json& request, json& response) { OnStartQueue(id, request, response); });
  dispatcher_->RegisterHandler(id + "::delete_memory",
                               [this, id](const json& request, json&) { OnDeleteMemory(id, request); });
}

void Session::OnStartQueue(const std::string& id, const json& request, json& response) {
  const std::int64_t port = pmjson::FieldAsInteger(request, "port", 0);
  const std::string memoryBase = pmjson::FieldAsString(request, "memoryBase", "");
  if (!ValidMemoryBase(memoryBase) || port <= 0 || port > 65535) {
    pm::Log(pm::LogType::Normal, "", "Session: '%s::start_queue' with port %lld and memory base '%s' refused\n",
            id.c_str(), static_cast<long long>(port), memoryBase.c_str());
    response["pm::error"] = "bad queue";
    return;
  }
  {
    std::lock_guard<std::mutex> guard(lock_);
    memoryBases_.insert(memoryBase);
    auto found = queues_.find(id);
    // A queue restarted on the same pool keeps its connection (the task
    // accepts one host connection per queue).
    if (found != queues_.end() && found->second->MemoryBase() == memoryBase && !found->second->Ended()) return;
  }
  auto queue = std::make_shared<QueueReader>(id, memoryBase, sink_);
  if (!queue->Start(static_cast<int>(port))) {
    response["pm::error"] = "cannot connect";
    return;
  }
  std::lock_guard<std::mutex> guard(lock_);
  auto& slot = queues_[id];
  if (slot) retired_.push_back(std::move(slot));
  slot = std::move(queue);
}

void Session::OnDeleteMemory(const std::string& id, const json& request) {
  const std::int64_t segment = pmjson::FieldAsInteger(request, "unique_id", -1);
  if (segment < 0 || segment > 0xFFFFFFFFll) return;
  std::shared_ptr<QueueReader> queue = Queue(id);
  if (queue) queue->Forget(static_cast<std::uint32_t>(segment));
}

std::vector<std::string> Session::MemoryBases() const {
  std::lock_guard<std::mutex> guard(lock_);
  return {memoryBases_.begin(), memoryBases_.end()};
}

std::shared_ptr<QueueReader> Session::Queue(const std::string& id) const {
  std::lock_guard<std::mutex> guard(lock_);
  auto found = queues_.find(id);
  return found == queues_.end() ? nullptr : found->second;
}

std::uint64_t Session::BadRecords() const {
  std::uint64_t total = 0;
  std::lock_guard<std::mutex> guard(lock_);
  for (const auto& [id, queue] : queues_) total += queue->BadRecords();
  for (const auto& queue : retired_) total += queue->BadRecords();
  return total;
}

}  // namespace pmhost
