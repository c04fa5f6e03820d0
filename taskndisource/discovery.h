#pragma once
// TaskNDISource::Discovery: finds NDI senders and announces them to the host.
//
// Start runs a scan thread that polls an NDI finder 125 ms after Start, then
// after 250, 500, 1000 and 2000 ms more, then every 4000 ms. A sender seen for
// the first time is announced available with the unique id
// "NDICaptureDevice~" + its NDI name; one missing from a scan is announced
// unavailable and forgotten (and announced anew if it comes back). Senders
// are told apart by URL, so two senders with one name are two entries with
// the same unique id. Within one scan every withdrawal comes before every
// announcement, and an id withdrawn while another entry still carries it (a
// sender that moved to a new URL, the other of two senders sharing a name)
// is announced available again: the last word about a present id is
// "available".
//
// Threads: host request threads call Start and Stop (serialised by
// lifecycleMutex_); the scan thread alone touches the finder, the table and
// scanNumber, and calls the callbacks. Stop before destroy: the destructor
// stops a scan loop that still runs.

#include <cstdint>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_map>

#include "pm/task/source.h"
#include "taskndisource/loop_environment.h"
#include "taskndisource/ndi_api.h"

namespace TaskNDISource {

struct NDISourceInfo {
  std::string name;
  std::string url;
  std::uint32_t firstSeenScan = 0;
  std::uint32_t lastSeenScan = 0;
};

class Discovery : public pm::SourceDiscovery {
 public:
  static constexpr std::uint32_t kFirstIntervalMs = 125;
  static constexpr std::uint32_t kMaxIntervalMs = 4000;

  Discovery(std::shared_ptr<Callbacks> callbacks, std::shared_ptr<const NdiApi> api,
            LoopEnvironment environment = DefaultLoopEnvironment());
  ~Discovery() override;
  Discovery(const Discovery&) = delete;
  Discovery& operator=(const Discovery&) = delete;

  // Starts the scan loop; does nothing while one runs.
  void Start() override;
  // Ends the scan loop within its current wait.
  void Stop() override;

  // One scan with `finder`: updates the table and announces what changed.
  // False only without a finder. Scan thread only (or a test while no loop
  // runs).
  bool ScanOnce(void* finder);

 private:
  void StopLocked();  // lifecycleMutex_ held
  void ScanLoop();

  const std::shared_ptr<const NdiApi> api_;
  const LoopEnvironment env_;

  // Held by Start and Stop from beginning to end; guards thread_ and
  // loopDone_. Held while Stop waits for the loop (the loop never takes it).
  std::mutex lifecycleMutex_;
  std::thread thread_;
  std::future<void> loopDone_;

  // Scan thread only.
  std::unordered_map<std::string, std::shared_ptr<NDISourceInfo>> sources_;  // by URL
  std::uint32_t scanNumber_ = 0;
  const std::uint32_t firstInterval_ = kFirstIntervalMs;
  const std::uint32_t maxInterval_ = kMaxIntervalMs;
};

}  // namespace TaskNDISource
