#pragma once
// pm::TaskSource: a task that serves the "pm::tsrc::" command family. It keeps
// the table of live sources by id, makes sources and discovery through two
// factories that the concrete task installs, and forwards each per-source
// command to its source.
//
// Commands (registered in this order on every attached dispatcher):
//   start_source, stop_source, validate_gui, gui_to_configuration,
//   configuration_to_gui, execute_custom_action_command, execute_ptz_command,
//   handle_shot_event, source_hotplug_event, set_configuration,
//   start_discovery, stop_discovery, discovery_hotplug_event.
// start_source reads "unique_id" strictly (a request that is not an object or
// an id that is not a string is logged with the caught-exception line); every
// other handler reads its text fields leniently and echoes "unique_id".
//
// A running source or discovery is never released unstopped by this class:
// a second start_source for a running id stops the old source first, a source
// that was started when a later step of StartSource failed is stopped, and a
// second start_discovery stops the running discovery before making the next.
// The destructor releases the table without stopping (Shutdown stops).
//
// Threads: handlers run on the receive thread of the dispatcher that delivered
// the command; several dispatchers may run them in parallel. Source and
// discovery operations are called without any lock of this class held and
// must be safe from any of those threads. StopSource may end in StopTask from
// a handler (the dispatcher does not join its own thread).
//
// Lock order: lock_ is taken alone, for single table operations; nothing
// (no source, discovery, factory or dispatcher call) runs while it is held.
// It comes after nothing and before nothing; pm::Task's own lock is never
// taken while it is held.

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "pm/task/source.h"
#include "pm/task/task.h"

namespace pm {

class TaskSource : public Task {
 public:
  using SourceFactory =
      std::function<std::shared_ptr<Source>(std::shared_ptr<Source::Callbacks> callbacks, std::string uniqueId)>;
  using DiscoveryFactory =
      std::function<std::shared_ptr<SourceDiscovery>(std::shared_ptr<SourceDiscovery::Callbacks> callbacks)>;

  TaskSource() = default;
  // Stops the dispatchers attached to this task (so that no handler runs on a
  // task being destroyed) and drops the owning references its handlers hold,
  // then releases discovery, the factories and the sources without stopping
  // them.
  ~TaskSource() override;

  // Registers the thirteen handlers on `dispatcher`.
  void AttachDispatcher(std::shared_ptr<RpcDispatcher> dispatcher) override;
  // Stops discovery, then every source in ascending id order; the table keeps
  // its entries.
  void Shutdown() override;

  // The factories; installed before the first dispatcher is attached.
  void SetSourceFactory(SourceFactory factory);
  void SetDiscoveryFactory(DiscoveryFactory factory);
  bool HasSourceFactory();
  bool HasDiscoveryFactory();

  // Table operations; each takes lock_ for its own duration only.
  std::shared_ptr<Source> FindSource(const std::string& uniqueId);
  // Stores `source` under `uniqueId` and returns the entry it replaced (empty
  // when none); the caller stops what it gets back.
  std::shared_ptr<Source> InsertSource(const std::string& uniqueId, std::shared_ptr<Source> source);
  void EraseSource(const std::string& uniqueId);
  // True while a source is in the table or a discovery is set.
  bool HasWork();
  std::size_t SourceCount();
  std::shared_ptr<SourceDiscovery> CurrentDiscovery();

  // Makes a discovery with the discovery factory for `dispatcher`, stores it
  // in place of the running one (which is stopped), then starts it: stored
  // first, so that the task never looks idle in between. A Start that throws
  // takes it out again (if it is still the stored one) and stops it; the
  // exception goes on. Nothing without a factory or a dispatcher.
  void StartDiscovery(std::shared_ptr<RpcDispatcher> dispatcher);
  // Stops and releases the running discovery, if any.
  void StopDiscovery();

  // The handlers of "pm::tsrc::start_source" and "pm::tsrc::stop_source".
  void StartSource(const std::shared_ptr<RpcDispatcher>& dispatcher, const nlohmann::json& request);
  void StopSource(const nlohmann::json& request);

  // The configuration text a source is given for `config`: empty for null,
  // {} and []; otherwise the compact text.
  static std::string ConfigurationText(const nlohmann::json& config);

 private:
  // Takes the entry for `uniqueId` out of the table.
  std::shared_ptr<Source> TakeSource(const std::string& uniqueId);
  // Removes the entry for `uniqueId` only while it is still `source`.
  void EraseSourceIfSame(const std::string& uniqueId, const std::shared_ptr<Source>& source);
  // Puts `next` in `discovery_` and returns what was there.
  std::shared_ptr<SourceDiscovery> SwapDiscovery(std::shared_ptr<SourceDiscovery> next);
  // Clears `discovery_` if it holds `discovery`; true when it did.
  bool TakeDiscoveryIfSame(const std::shared_ptr<SourceDiscovery>& discovery);

  std::mutex lock_;  // guards sources_, the factories, discovery_ and attached_
  std::map<std::string, std::shared_ptr<Source>> sources_;  // guarded by lock_
  SourceFactory sourceFactory_;                             // guarded by lock_
  DiscoveryFactory discoveryFactory_;                       // guarded by lock_
  std::shared_ptr<SourceDiscovery> discovery_;              // guarded by lock_
  // The dispatchers handed to AttachDispatcher; guarded by lock_.
  std::vector<std::weak_ptr<RpcDispatcher>> attached_;
};

}  // namespace pm
