#include "pm/runtime/perf.h"

#include <mutex>

#include "pm/runtime/clock.h"
#include "pm/runtime/log.h"

namespace pm {
namespace {

// The registry of accumulators; slots of destroyed ones are cleared and their
// detached copies appended. Lives until process exit.
struct RegistryData {
  std::mutex mutex;                      // guards entries
  std::vector<PerformanceLog*> entries;  // live ones, null slots, detached copies
};

RegistryData& TheRegistry() {
  static auto* registry = new RegistryData();
  return *registry;
}

}  // namespace

PerformanceLog::PerformanceLog(const char* name, std::int64_t thresholdMicros)
    : name_(name ? name : ""), threshold_(thresholdMicros) {
  RegistryData& registry = TheRegistry();
  std::lock_guard<std::mutex> guard(registry.mutex);
  registry.entries.push_back(this);
}

PerformanceLog::PerformanceLog(const PerformanceLog& from, DetachTag)
    : name_(from.name_),
      immediateLimit_(from.immediateLimit_),
      threshold_(from.threshold_),
      detached_(true),
      total_(from.total_.load()),
      count_(from.count_.load()),
      immediateCount_(from.immediateCount_.load()),
      maximum_(from.maximum_.load()) {}

PerformanceLog::~PerformanceLog() {
  if (detached_) return;
  RegistryData& registry = TheRegistry();
  std::lock_guard<std::mutex> guard(registry.mutex);
  for (PerformanceLog*& entry : registry.entries) {
    if (entry == this) entry = nullptr;
  }
  registry.entries.push_back(new PerformanceLog(*this, DetachTag{}));
}

void PerformanceLog::Record(std::int64_t d) {
  count_.fetch_add(1);
  total_.fetch_add(d);
  if (d > maximum_.load()) maximum_.store(d);
  if (d <= threshold_ * 1000) return;
  const std::int64_t k = immediateCount_.fetch_add(1);
  if (k < immediateLimit_) {
    const long long micros = d / 1000;
    const long long ms = micros / 1000;
    if (micros < 5000) {
      Log(LogType::Normal, "", "%s %lld ms (%lld micros)\n", name_.c_str(), ms, micros);
    } else {
      Log(LogType::Normal, "", "%s %lld ms\n", name_.c_str(), ms);
    }
  } else if (k == immediateLimit_) {
    Log(LogType::Normal, "",
        "%s Immediate performance logging stopped: too many entries (%d).  Summary will still be "
        "accurate\n",
        name_.c_str(), static_cast<int>(immediateLimit_));
  }
}

std::vector<PerformanceLog::Summary> PerformanceLog::Registry() {
  std::vector<Summary> out;
  auto& registry = TheRegistry();
  std::lock_guard<std::mutex> guard(registry.mutex);
  for (const PerformanceLog* entry : registry.entries) {
    if (entry == nullptr) continue;
    out.push_back({entry->name_, entry->count_.load(), entry->total_.load(), entry->maximum_.load(),
                   entry->detached_});
  }
  return out;
}

PerformanceScope::PerformanceScope(PerformanceLog& log) : log_(&log), start_(SteadyNowNs()) {}

PerformanceScope::~PerformanceScope() { Stop(); }

std::int64_t PerformanceScope::Stop() {
  if (!active_) return 0;
  active_ = false;
  const std::int64_t elapsed = SteadyNowNs() - start_;
  log_->Record(elapsed);
  return elapsed;
}

}  // namespace pm
