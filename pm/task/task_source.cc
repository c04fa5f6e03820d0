// pm::TaskSource: the "pm::tsrc::" command handlers and the sources table.
#include "pm/task/task_source.h"

#include <exception>
#include <utility>

#include "pm/ipc/dispatcher.h"
#include "pm/runtime/json.h"
#include "pm/runtime/log.h"
#include "pm/task/callbacks.h"

namespace pm {
namespace {

using Json = nlohmann::json;

// The value under `key`, or null when the request is not an object or lacks it.
Json FieldOrNull(const Json& request, const char* key) {
  if (!request.is_object()) return nullptr;
  const auto it = request.find(key);
  return it == request.end() ? Json() : *it;
}

std::string LenientId(const Json& request) { return pmjson::FieldAsString(request, "unique_id", ""); }

// Stops `source`, logging instead of letting an exception escape: used where
// the caller is already unwinding or must go on with the next source.
void StopQuietly(const std::shared_ptr<Source>& source, const char* where) {
  if (!source) return;
  try {
    source->Stop();
  } catch (const std::exception& e) {
    Log(LogType::Normal, "", "%s : Stop of '%s' threw: %s\n", where, source->UniqueId().c_str(), e.what());
  } catch (...) {
    Log(LogType::Normal, "", "%s : Stop of '%s' threw\n", where, source->UniqueId().c_str());
  }
}

}  // namespace

TaskSource::~TaskSource() {
  std::vector<std::weak_ptr<RpcDispatcher>> attached;
  {
    std::lock_guard<std::mutex> guard(lock_);
    attached.swap(attached_);
  }
  for (const auto& weak : attached) {
    const std::shared_ptr<RpcDispatcher> dispatcher = weak.lock();
    if (!dispatcher) continue;
    dispatcher->Stop();
    // The start/stop handlers own their dispatcher; replacing them ends that
    // cycle so the dispatcher can go when its other owners let it.
    dispatcher->RegisterHandler("pm::tsrc::start_source", [](const Json&, Json&) {});
    dispatcher->RegisterHandler("pm::tsrc::stop_source", [](const Json&, Json&) {});
  }
  // discovery_, the factories and sources_ are released by the members'
  // destructors, without Stop.
}

void TaskSource::SetSourceFactory(SourceFactory factory) {
  std::lock_guard<std::mutex> guard(lock_);
  sourceFactory_ = std::move(factory);
}

void TaskSource::SetDiscoveryFactory(DiscoveryFactory factory) {
  std::lock_guard<std::mutex> guard(lock_);
  discoveryFactory_ = std::move(factory);
}

bool TaskSource::HasSourceFactory() {
  std::lock_guard<std::mutex> guard(lock_);
  return static_cast<bool>(sourceFactory_);
}

bool TaskSource::HasDiscoveryFactory() {
  std::lock_guard<std::mutex> guard(lock_);
  return static_cast<bool>(discoveryFactory_);
}

std::shared_ptr<Source> TaskSource::FindSource(const std::string& uniqueId) {
  std::lock_guard<std::mutex> guard(lock_);
  const auto it = sources_.find(uniqueId);
  return it == sources_.end() ? nullptr : it->second;
}

std::shared_ptr<Source> TaskSource::InsertSource(const std::string& uniqueId, std::shared_ptr<Source> source) {
  std::lock_guard<std::mutex> guard(lock_);
  std::shared_ptr<Source>& slot = sources_[uniqueId];
  std::shared_ptr<Source> previous = std::move(slot);
  slot = std::move(source);
  return previous;
}

void TaskSource::EraseSource(const std::string& uniqueId) {
  std::shared_ptr<Source> erased;  // released after the lock
  std::lock_guard<std::mutex> guard(lock_);
  const auto it = sources_.find(uniqueId);
  if (it == sources_.end()) return;
  erased = std::move(it->second);
  sources_.erase(it);
}

std::shared_ptr<Source> TaskSource::TakeSource(const std::string& uniqueId) {
  std::lock_guard<std::mutex> guard(lock_);
  const auto it = sources_.find(uniqueId);
  if (it == sources_.end()) return nullptr;
  std::shared_ptr<Source> taken = std::move(it->second);
  sources_.erase(it);
  return taken;
}

void TaskSource::EraseSourceIfSame(const std::string& uniqueId, const std::shared_ptr<Source>& source) {
  std::lock_guard<std::mutex> guard(lock_);
  const auto it = sources_.find(uniqueId);
  if (it != sources_.end() && it->second == source) sources_.erase(it);
}

bool TaskSource::HasWork() {
  std::lock_guard<std::mutex> guard(lock_);
  return !sources_.empty() || discovery_ != nullptr;
}

std::size_t TaskSource::SourceCount() {
  std::lock_guard<std::mutex> guard(lock_);
  return sources_.size();
}

std::shared_ptr<SourceDiscovery> TaskSource::CurrentDiscovery() {
  std::lock_guard<std::mutex> guard(lock_);
  return discovery_;
}

std::shared_ptr<SourceDiscovery> TaskSource::SwapDiscovery(std::shared_ptr<SourceDiscovery> next) {
  std::lock_guard<std::mutex> guard(lock_);
  std::shared_ptr<SourceDiscovery> previous = std::move(discovery_);
  discovery_ = std::move(next);
  return previous;
}

void TaskSource::StartDiscovery(std::shared_ptr<RpcDispatcher> dispatcher) {
  DiscoveryFactory factory;
  {
    std::lock_guard<std::mutex> guard(lock_);
    factory = discoveryFactory_;
  }
  if (!factory || !dispatcher) return;
  std::shared_ptr<SourceDiscovery> made = factory(std::make_shared<DiscoveryCallbacks>(std::move(dispatcher)));
  // Stored before it starts, so that the task has work all along: a last
  // stop_source on another connection meanwhile must not end the task. The
  // discovery it replaces (whoever takes one out of the field stops it) is
  // stopped before this one starts, so at most one runs.
  if (std::shared_ptr<SourceDiscovery> displaced = SwapDiscovery(made)) displaced->Stop();
  if (!made) return;
  try {
    made->Start();
  } catch (...) {
    if (TakeDiscoveryIfSame(made)) made->Stop();
    throw;
  }
  // Taken out by a stop_discovery or start_discovery on another connection
  // before it had started, it may have been stopped too early to end: stop
  // it again, so that it is not released running.
  if (CurrentDiscovery() != made) made->Stop();
}

bool TaskSource::TakeDiscoveryIfSame(const std::shared_ptr<SourceDiscovery>& discovery) {
  std::lock_guard<std::mutex> guard(lock_);
  if (discovery_ != discovery) return false;
  discovery_ = nullptr;
  return true;
}

void TaskSource::StopDiscovery() {
  if (std::shared_ptr<SourceDiscovery> running = SwapDiscovery(nullptr)) running->Stop();
}

void TaskSource::Shutdown() {
  StopDiscovery();
  std::map<std::string, std::shared_ptr<Source>> copy;
  {
    std::lock_guard<std::mutex> guard(lock_);
    copy = sources_;
  }
  for (const auto& [id, source] : copy) {
    if (source) source->Stop();
  }
}

std::string TaskSource::ConfigurationText(const Json& config) {
  if (config.is_null()) return std::string();
  if ((config.is_object() || config.is_array()) && config.empty()) return std::string();
  return pmjson::Dump(config);
}

void TaskSource::StartSource(const std::shared_ptr<RpcDispatcher>& dispatcher, const Json& request) {
  std::shared_ptr<Source> source;
  bool startCalled = false;
  try {
    const std::string uniqueId = request.value("unique_id", std::string());
    const Json config = request.contains("config") ? request["config"] : Json();
    SourceFactory factory;
    {
      std::lock_guard<std::mutex> guard(lock_);
      factory = sourceFactory_;
    }
    if (!factory) return;
    // A source already running under this id is stopped before it is replaced.
    if (std::shared_ptr<Source> running = TakeSource(uniqueId)) running->Stop();

    auto callbacks = std::make_shared<SourceCallbacks>(dispatcher, uniqueId);
    source = factory(callbacks, uniqueId);
    if (!source) return;
    const std::string text = ConfigurationText(config);
    callbacks->OpenBufferQueue(dispatcher, uniqueId);
    source->SetConfiguration(text);
    startCalled = true;
    source->Start();
    // Another connection may have started the same id meanwhile: that one
    // gives way.
    if (std::shared_ptr<Source> displaced = InsertSource(uniqueId, source)) {
      if (displaced != source) StopQuietly(displaced, "pm::tsrc::start_source");
    }
  } catch (const std::exception&) {
    if (startCalled) StopQuietly(source, "pm::tsrc::start_source");
    Log(LogType::Normal, "", "pm::tsrc::start_source : Caught exception : %s\n",
        request.dump(4, ' ', false, Json::error_handler_t::replace).c_str());
  } catch (...) {
    if (startCalled) StopQuietly(source, "pm::tsrc::start_source");
    Log(LogType::Normal, "", "pm::tsrc::start_source : Caught exception : %s\n",
        request.dump(4, ' ', false, Json::error_handler_t::replace).c_str());
  }
}

void TaskSource::StopSource(const Json& request) {
  const std::string uniqueId = LenientId(request);
  const std::shared_ptr<Source> source = FindSource(uniqueId);
  if (!source) return;
  source->Stop();
  // A start_source on another connection may have replaced the entry while
  // this one stopped; that newer source stays.
  EraseSourceIfSame(uniqueId, source);
  if (!HasWork()) StopTask();
}

void TaskSource::AttachDispatcher(std::shared_ptr<RpcDispatcher> dispatcher) {
  if (!dispatcher) return;
  {
    std::lock_guard<std::mutex> guard(lock_);
    attached_.push_back(dispatcher);
  }
  RpcDispatcher& d = *dispatcher;

  // Owning references: these two handlers keep their dispatcher alive while
  // its handler table exists (the destructor replaces them to let it go).
  d.RegisterHandler("pm::tsrc::start_source", [this, dispatcher](const Json& request, Json&) {
    StartSource(dispatcher, request);
  });
  d.RegisterHandler("pm::tsrc::stop_source", [this, dispatcher](const Json& request, Json&) {
    StopSource(request);
  });

  // "gui"/"config" in, the source's answer parsed back into `outKey`.
  const auto convert = [this](const char* inKey, const char* outKey, const char* label,
                              std::string (Source::*operation)(std::string)) {
    return [this, inKey, outKey, label, operation](const Json& request, Json& response) {
      const std::string uniqueId = LenientId(request);
      response["unique_id"] = uniqueId;
      const std::shared_ptr<Source> source = FindSource(uniqueId);
      if (!source) return;
      const std::string text = pmjson::Dump(FieldOrNull(request, inKey));
      response[outKey] = pmjson::Parse(((*source).*operation)(text), label);
    };
  };
  d.RegisterHandler("pm::tsrc::validate_gui", convert("gui", "gui", "validate_gui", &Source::ValidateGui));
  d.RegisterHandler("pm::tsrc::gui_to_configuration",
                    convert("gui", "config", "gui_to_configuration", &Source::GuiToConfiguration));
  d.RegisterHandler("pm::tsrc::configuration_to_gui",
                    convert("config", "gui", "configuration_to_gui", &Source::ConfigurationToGui));

  d.RegisterHandler("pm::tsrc::execute_custom_action_command", [this](const Json& request, Json& response) {
    const std::string uniqueId = LenientId(request);
    response["unique_id"] = uniqueId;
    if (const std::shared_ptr<Source> source = FindSource(uniqueId)) {
      source->ExecuteCustomActionCommand(pmjson::FieldAsString(request, "command", ""));
    }
  });
  d.RegisterHandler("pm::tsrc::execute_ptz_command", [this](const Json& request, Json& response) {
    const std::string uniqueId = LenientId(request);
    response["unique_id"] = uniqueId;
    if (const std::shared_ptr<Source> source = FindSource(uniqueId)) source->ExecutePtzCommand(request);
  });
  d.RegisterHandler("pm::tsrc::handle_shot_event", [this](const Json& request, Json& response) {
    const std::string uniqueId = LenientId(request);
    response["unique_id"] = uniqueId;
    if (const std::shared_ptr<Source> source = FindSource(uniqueId)) {
      source->HandleShotEvent(pmjson::FieldAsString(request, "event", ""));
    }
  });
  d.RegisterHandler("pm::tsrc::source_hotplug_event", [this](const Json& request, Json& response) {
    const std::string uniqueId = LenientId(request);
    response["unique_id"] = uniqueId;
    if (const std::shared_ptr<Source> source = FindSource(uniqueId)) source->SourceHotplugEvent();
  });
  d.RegisterHandler("pm::tsrc::set_configuration", [this](const Json& request, Json& response) {
    const std::string uniqueId = LenientId(request);
    response["unique_id"] = uniqueId;
    if (const std::shared_ptr<Source> source = FindSource(uniqueId)) {
      source->SetConfiguration(pmjson::Dump(FieldOrNull(request, "config")));
    }
  });

  // A weak reference: discovery's callbacks take their own owning one.
  std::weak_ptr<RpcDispatcher> weak = dispatcher;
  d.RegisterHandler("pm::tsrc::start_discovery", [this, weak](const Json& request, Json& response) {
    response["unique_id"] = LenientId(request);
    if (std::shared_ptr<RpcDispatcher> owner = weak.lock()) StartDiscovery(std::move(owner));
  });
  d.RegisterHandler("pm::tsrc::stop_discovery", [this](const Json& request, Json& response) {
    response["unique_id"] = LenientId(request);
    StopDiscovery();
  });
  d.RegisterHandler("pm::tsrc::discovery_hotplug_event", [this](const Json& request, Json& response) {
    response["unique_id"] = LenientId(request);
    if (const std::shared_ptr<SourceDiscovery> discovery = CurrentDiscovery()) discovery->DiscoveryHotplugEvent();
  });
}

}  // namespace pm
