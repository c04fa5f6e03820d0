#pragma once
// The host's side of one connection to a task: a request dispatcher that
// sends the "pm::tsrc::" commands, receives the task's notifications, and
// answers the queue requests of each source ("<id>::start_queue" opens a
// QueueReader on the announced port; "<id>::delete_memory" unmaps a segment).
//
// Threads: handlers and listener calls run on the dispatcher's receive
// thread; frames reach the FrameSink on each queue's reader thread. Every
// public operation may be called from any thread except the dispatcher's own
// (Request waits for the reply, which that thread delivers). Stop before
// destroy (the destructor stops).
//
// Locks: lock_ guards queues_ and memoryBases_ (taken alone; never held while
// a reader starts or stops, a listener runs or a request is sent).

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "pm-host/queue_reader.h"
#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"

namespace pmhost {

inline constexpr char kSourceIdPrefix[] = "NDICaptureDevice~";

// The task's notifications, as they arrive ("pm::tsrc::update_connection_state"
// and the rest; the message with its envelope keys). Runs on the dispatcher's
// receive thread; must not call Session::Request (it would wait on itself).
using NotificationListener = std::function<void(const std::string& command, const nlohmann::json& message)>;

class Session {
 public:
  // Every notification command the task sends.
  static const std::vector<std::string>& NotificationCommands();

  Session(std::shared_ptr<pm::ipc::Connection> connection, NotificationListener listener, FrameSink* sink);
  ~Session();
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;

  // Starts receiving. `onEnded` runs once when the connection ends (on the
  // receive thread).
  void Start(std::function<void()> onEnded = {});
  // Closes the connection and every queue; idempotent.
  void Stop();
  bool Ended() const { return dispatcher_->Ended(); }

  // Sends a request and waits for its reply; nullopt when it could not be
  // sent or no reply came within timeoutMs.
  std::optional<nlohmann::json> Request(const std::string& command, nlohmann::json payload,
                                        std::int64_t timeoutMs = 5000);
  // Sends a request without waiting.
  bool Notify(const std::string& command, nlohmann::json payload, std::int64_t timeoutMs = 5000);

  // The commands of the "pm::tsrc::" family. StartSource prepares the queue
  // handlers of the id before the request goes out.
  std::optional<nlohmann::json> StartDiscovery();
  std::optional<nlohmann::json> StopDiscovery();
  std::optional<nlohmann::json> StartSource(const std::string& id, const nlohmann::json& config);
  std::optional<nlohmann::json> StopSource(const std::string& id);
  std::optional<nlohmann::json> PtzCommand(const std::string& id, nlohmann::json command);
  std::optional<nlohmann::json> ShotEvent(const std::string& id, const std::string& event);

  // Installs the "<id>::start_queue" and "<id>::delete_memory" handlers.
  void AcceptQueue(const std::string& id);

  // Every memory base announced on this connection (for the removal of a
  // crashed runner's segments).
  std::vector<std::string> MemoryBases() const;
  // The queue of a source, or null.
  std::shared_ptr<QueueReader> Queue(const std::string& id) const;
  std::uint64_t BadRecords() const;

 private:
  void OnStartQueue(const std::string& id, const nlohmann::json& request, nlohmann::json& response);
  void OnDeleteMemory(const std::string& id, const nlohmann::json& request);

  const std::shared_ptr<pm::RpcDispatcher> dispatcher_;
  NotificationListener listener_;
  FrameSink* const sink_;
  mutable std::mutex lock_;  // guards queues_, memoryBases_, retired_
  std::map<std::string, std::shared_ptr<QueueReader>> queues_;
  std::set<std::string> memoryBases_;
  std::vector<std::shared_ptr<QueueReader>> retired_;  // replaced queues, stopped by Stop
};

}  // namespace pmhost
