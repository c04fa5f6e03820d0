#pragma once
// What the tests that drive real processes share: a private registry folder
// per case, ndi-testsrc with its event lines, host options pointing at the
// built runner and module, and probes of a process's and /dev/shm's state.
#include <sys/types.h>

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "pm-host/host.h"
#include "pm-host/process.h"
#include "pm-host/receive.h"

namespace pmtest {

// How long a case waits for something the programs are to do. Waits end as
// soon as it happens, so the limit costs nothing when all is well; it is
// generous because the sanitizer builds on a busy two-core machine start
// processes and move pictures many times slower than a quiet optimised one.
inline constexpr std::chrono::seconds kPatience{30};

// The programs under test; set from the build (see pm_e2e_support).
struct Programs {
  std::string runner;
  std::string module;
  std::string testsrc;
  std::string host;  // the pm-host program
};
const Programs& BuiltPrograms();

// A private registry folder (NDI_LOOPBACK_DIR) and a folder for logs; both
// removed with the object.
struct Folder {
  Folder();
  ~Folder();
  Folder(const Folder&) = delete;
  Folder& operator=(const Folder&) = delete;
  std::string Registry() const { return path + "/registry"; }
  std::string RunnerLog() const { return path + "/runner.log"; }
  std::string ReadRunnerLog() const;
  std::string path;
  // When not 0, senders started in it take the lowest free port from this
  // one (NDI_LOOPBACK_FIRST_PORT), as the vendor runtime's do from 5961.
  int firstPort = 0;
};

// ndi-testsrc with its event lines (JSON objects on stdout) collected.
class Sender {
 public:
  // Starts `--name name args...` (with `--seconds 120` unless args give
  // --seconds or --frames) and waits for its "ready".
  bool Start(const Folder& folder, const std::string& name, std::vector<std::string> args);
  std::string Name() { return Find("ready").value("name", ""); }
  // The first event of this kind for which `match` holds, or null.
  nlohmann::json Find(const std::string& kind, const std::function<bool(const nlohmann::json&)>& match = {});
  bool WaitFor(const std::string& kind, const std::function<bool(const nlohmann::json&)>& match = {});
  pmhost::ChildProcess& Process() { return process_; }

 private:
  std::mutex lock_;  // guards events_
  std::vector<nlohmann::json> events_;
  // Last: destroyed first, which joins the thread that fills events_.
  pmhost::ChildProcess process_;
};

// Host options for the built runner and module in the folder's registry.
pmhost::HostOptions HostOptionsFor(const Folder& folder);
pmhost::ReceiveOptions ReceiveFrom(const Folder& folder, const std::string& source);
// Receives until `done` holds (looked at every few milliseconds from the
// start) or `limit` passes, instead of for a fixed time that a loaded machine
// may not give the chain to get going. `o.seconds` and `o.interrupted` are
// taken over.
pmhost::ReceiveResult ReceiveUntil(pmhost::ReceiveOptions o, const std::function<bool()>& done,
                                   std::chrono::milliseconds limit = std::chrono::seconds(30));

// A sender that died with nothing connected, its port taken at once by
// another sender, and itself started again elsewhere; a source started for it
// while its old URL is still listed (for about a second on either runtime) is
// first led to the other sender, and must come to its own: pictures of its
// own size arrive, and none of the other's after them.
void ExpectASourceLedToAnotherSendersPortToComeToItsOwn(const Folder& folder);

// Entries of /dev/shm whose names start with one of the bases.
int SegmentsOf(const std::vector<std::string>& bases);

// The run ended in order: the last stop_source ended the runner with 0 and
// nothing of the queue is left in /dev/shm.
void ExpectOrderlyEnd(const pmhost::ReceiveResult& result, const Folder& folder);

// What a live process holds, from /proc/PID: open descriptors, threads and
// resident memory, with its private (anonymous) part apart: the resident
// shared memory is the pool the host is handed pictures in, which grows with
// the host's reading pace, not with what the process keeps for itself.
// nullopt when the process cannot be read.
struct ProcessUsage {
  int descriptors = 0;
  int threads = 0;
  long residentKiB = 0;
  long privateKiB = 0;
};
std::optional<ProcessUsage> UsageOf(pid_t pid);
// Of this process.
std::optional<ProcessUsage> OwnUsage();
// A process's level: descriptors and threads at their lowest, memory at its
// highest, over a few looks (a descriptor the runtime opens for a moment, say
// to list the registry, is not part of it).
std::optional<ProcessUsage> LevelOf(pid_t pid);
// Threads end and descriptors close a moment after the reply that stopped
// them: waits for the level, then expects it exactly (no growth, and nothing
// closed that should still be open).
void ExpectBackAtLevel(pid_t pid, const ProcessUsage& level, const std::string& what);

// The /dev/shm entries a live process has mapped (names without the folder,
// each once), from /proc/PID/maps; entries already unlinked are included.
std::vector<std::string> SharedMemoryMappedBy(pid_t pid);

}  // namespace pmtest
