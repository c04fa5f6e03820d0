#include "taskndisource/discovery.h"

#include <algorithm>
#include <exception>
#include <set>
#include <utility>
#include <vector>

#include "pm/runtime/log.h"
#include "pm/runtime/thread_name.h"
#include "taskndisource/ndi_source.h"

namespace TaskNDISource {

Discovery::Discovery(std::shared_ptr<Callbacks> callbacks, std::shared_ptr<const NdiApi> api,
                     LoopEnvironment environment)
    : pm::SourceDiscovery(std::move(callbacks)),
      api_(std::move(api)),
      env_(CompleteLoopEnvironment(std::move(environment))) {}

Discovery::~Discovery() {
  std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
  if (thread_.joinable()) StopLocked();
}

void Discovery::Start() {
  std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
  if (thread_.joinable()) {
    // A loop that ended by itself (no finder) is collected; a running one
    // is left alone rather than doubled.
    if (loopDone_.wait_for(std::chrono::seconds(0)) != std::future_status::ready) return;
    thread_.join();
    loopDone_ = {};
  }
  // A Stop that found no loop waiting left its signal behind; it must not end
  // the new loop before its first scan.
  env_.clock->ClearSignals();
  std::promise<void> done;
  loopDone_ = done.get_future();
  thread_ = std::thread([this, done = std::move(done)]() mutable {
    try {
      ScanLoop();
    } catch (const std::exception& e) {
      pm::Log(pm::LogType::Normal, kLogTag, "NDI scan loop ended with an error: %s", e.what());
    } catch (...) {
      pm::LogText(kLogTag, "NDI scan loop ended with an error");
    }
    done.set_value();
  });
}

void Discovery::Stop() {
  std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
  StopLocked();
}

void Discovery::StopLocked() {
  env_.clock->Signal();
  if (!thread_.joinable()) return;
  if (loopDone_.wait_for(env_.stopTimeout) != std::future_status::ready) {
    pm::LogText(kLogTag, "failed to exit NDI scan loop in time");
    env_.exitProcess();
  }
  thread_.join();
  loopDone_ = {};
}

void Discovery::ScanLoop() {
  pm::SetThreadName("NDI Discovery");
  ndi_find_create settings{};
  settings.show_local_sources = true;
  settings.groups = nullptr;
  settings.extra_ips = nullptr;
  void* finder = api_->find_create_v2(&settings);
  if (finder == nullptr) {
    pm::LogText(kLogTag, "failed to create NDI source finder");
    pm::ClearThreadName();
    return;
  }
  struct FinderOwner {
    const NdiApi& api;
    void* finder;
    ~FinderOwner() {
      api.find_destroy(finder);
      pm::ClearThreadName();
    }
  } owner{*api_, finder};
  std::uint32_t interval = firstInterval_;
  pm::Clock& clock = *env_.clock;
  while (!clock.WaitUntil(clock.NowNs() + std::int64_t{interval} * 1'000'000)) {
    if (!ScanOnce(finder)) {
      pm::LogText(kLogTag, "failed to update the NDI source list. exiting scan loop");
      break;
    }
    interval = std::min(interval * 2, maxInterval_);
  }
}

bool Discovery::ScanOnce(void* finder) {
  if (finder == nullptr) return false;
  ++scanNumber_;
  std::uint32_t count = 0;
  const ndi_source* list = api_->find_get_current_sources(finder, &count);
  if (list == nullptr) count = 0;
  for (std::uint32_t i = 0; i < count; ++i) {
    const char* name = list[i].ndi_name;
    const char* url = list[i].url_address;
    if (name == nullptr || url == nullptr || *name == '\0' || *url == '\0') continue;
    auto it = sources_.find(url);
    if (it == sources_.end()) {
      auto info = std::make_shared<NDISourceInfo>();
      info->name = name;
      info->url = url;
      info->firstSeenScan = scanNumber_;
      info->lastSeenScan = scanNumber_;
      sources_.emplace(info->url, info);
      pm::Log(pm::LogType::Normal, kLogTag, "Discovered NDI Source: %s (%s)", name, url);
    } else {
      it->second->lastSeenScan = scanNumber_;
    }
  }
  // Withdraw first, then announce: the last word about an id that is still
  // in the table must be "available". A sender that moved to a new URL, or
  // one of two senders sharing a name that vanished, withdraws an id that a
  // remaining entry still carries; that id is announced again afterwards.
  const bool announce = GetCallbacks() != nullptr;
  std::set<std::string> withdrawn;
  for (auto it = sources_.begin(); it != sources_.end();) {
    if (it->second->lastSeenScan == scanNumber_) {
      ++it;
      continue;
    }
    const std::string uniqueId = std::string(kSourceIdPrefix) + it->second->name;
    if (announce) GetCallbacks()->SourceUnavailable(uniqueId);
    withdrawn.insert(uniqueId);
    it = sources_.erase(it);
  }
  for (const auto& [url, info] : sources_) {
    const std::string uniqueId = std::string(kSourceIdPrefix) + info->name;
    // A withdrawn id is announced once again, by its first remaining entry.
    const bool again = withdrawn.erase(uniqueId) > 0;
    if ((info->firstSeenScan == scanNumber_ || again) && announce) AnnounceSource(uniqueId, info->name);
  }
  return true;
}

}  // namespace TaskNDISource
