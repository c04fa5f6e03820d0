#pragma once
// What the tests that drive real processes share: a private registry folder
// per case, ndi-testsrc with its event lines, host options pointing at the
// built runner and module, one case's whole chain (sender, host and runner),
// and probes of a process's and /dev/shm's state.
#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "pm-host/checks.h"
#include "pm-host/host.h"
#include "pm-host/process.h"
#include "pm-host/queue_reader.h"
#include "pm-host/receive.h"
#include "pm/runtime/json.h"
#include "support/runner_child.h"  // Occurrences
#include "support/wait.h"

namespace pmtest {

// How long a case waits for something the programs are to do. Waits end as
// soon as it happens, so the limit costs nothing when all is well; it is
// generous because the sanitizer builds on a busy two-core machine start
// processes and move pictures many times slower than a quiet optimised one.
inline constexpr std::chrono::seconds kPatience{30};

// The programs under test come from the build: PM_RUNNER_PATH,
// PM_MODULE_PATH, PM_TESTSRC_PATH and PM_HOST_PATH (see pm_e2e_support).

// A private registry folder (NDI_LOOPBACK_DIR) and a folder for logs; both
// removed with the object.
struct Folder {
  std::string Registry() const { return path + "/registry"; }
  std::string RunnerLog() const { return path + "/runner.log"; }
  std::string ReadRunnerLog() const;
  const pmtest::Registry made;  // made now, removed with the object
  const std::string path = made.path;
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

// What the host is handed, checked on the queues' reader threads as it
// arrives: ramp pictures and sound intact (when the senders send the ramp
// pattern), picture numbers rising and sound without gaps for each source,
// the picture sizes and channel counts seen.
//
// It is also a gate: while shut, a reader thread waits inside OnVideo with
// the picture it brought, so neither that token nor any record queued behind
// it goes back to the task. Open it before the host stops (stopping joins
// those threads).
//
// Lock: lock_ guards every field below it; nothing is called under it.
class RampSink : public pmhost::FrameSink {
 public:
  using Size = std::pair<int, int>;  // width, height

  explicit RampSink(bool ramp = true) : ramp_(ramp) {}

  void OnVideo(const std::string& id, const pmhost::VideoFrame& frame) override {
    std::int64_t n = -1;
    const std::string check = ramp_ ? pmhost::CheckRampPicture(frame, &n) : std::string();
    std::unique_lock<std::mutex> hold(lock_);
    Stream& s = streams_[id];
    if (!check.empty()) Problem("picture " + std::to_string(n) + ": " + check);
    if (ramp_ && s.pictures > 0 && n <= s.lastFrame) {
      Problem("frame " + std::to_string(n) + " after " + std::to_string(s.lastFrame));
    }
    ++s.pictures;
    s.lastFrame = n;
    const Size size{frame.width, frame.height};
    if (sizes_.empty() || !(sizes_.back().first == size)) sizes_.push_back({size, 0});
    ++sizes_.back().second;
    ++holding_;
    changed_.wait(hold, [this] { return open_; });
    --holding_;
  }

  void OnAudio(const std::string& id, const pmhost::AudioFrame& frame) override {
    if (!ramp_) return;
    std::int64_t first = -1;
    const std::string check = pmhost::CheckRampSound(frame, &first);
    std::lock_guard<std::mutex> guard(lock_);
    Stream& s = streams_[id];
    ++s.sounds;
    if (!check.empty()) Problem("sound: " + check);
    if (s.nextSample >= 0 && first != s.nextSample % 1024) {
      Problem("sound continues at " + std::to_string(first) + " instead of " + std::to_string(s.nextSample % 1024));
    }
    s.nextSample = first + frame.samples;
    channels_.insert(frame.channels);
  }

  void OnBadRecord(const std::string&, const std::string& reason) override {
    std::lock_guard<std::mutex> guard(lock_);
    Problem("bad record: " + reason);
  }

  void Shut() {
    std::lock_guard<std::mutex> guard(lock_);
    open_ = false;
  }
  void Open() {
    {
      std::lock_guard<std::mutex> guard(lock_);
      open_ = true;
    }
    changed_.notify_all();
  }
  // A reader thread is waiting in the shut gate.
  bool Holding() const {
    std::lock_guard<std::mutex> guard(lock_);
    return holding_ > 0 && !open_;
  }
  // Pictures of one source, or of all.
  int Videos(const std::string& id = {}) const { return Count(id, &Stream::pictures); }
  int Sounds() const { return Count({}, &Stream::sounds); }
  // Every fault seen, in order (empty when everything arrived intact).
  std::vector<std::string> Problems() const {
    std::lock_guard<std::mutex> guard(lock_);
    return problems_;
  }
  // The runs of equal picture sizes, in order, with their picture counts.
  std::vector<std::pair<Size, int>> SizeRuns() const {
    std::lock_guard<std::mutex> guard(lock_);
    return sizes_;
  }
  // The channel counts of the sound seen.
  std::set<int> Channels() const {
    std::lock_guard<std::mutex> guard(lock_);
    return channels_;
  }

 private:
  struct Stream {
    int pictures = 0;
    int sounds = 0;
    std::int64_t lastFrame = -1;
    std::int64_t nextSample = -1;
  };

  int Count(const std::string& id, int Stream::*field) const {
    std::lock_guard<std::mutex> guard(lock_);
    int n = 0;
    for (const auto& [key, stream] : streams_) n += id.empty() || key == id ? stream.*field : 0;
    return n;
  }
  void Problem(std::string text) {  // lock_ held
    if (problems_.size() < 20) problems_.push_back(std::move(text));
  }

  const bool ramp_;
  mutable std::mutex lock_;  // guards everything below
  std::condition_variable changed_;
  bool open_ = true;
  int holding_ = 0;
  std::map<std::string, Stream> streams_;
  std::vector<std::pair<Size, int>> sizes_;
  std::set<int> channels_;
  std::vector<std::string> problems_;
};

// ndi-testsrc's arguments for the "blocks" pattern at 30 fps, then `more`.
inline std::vector<std::string> BlocksArgs(int width, int height, std::vector<std::string> more = {}) {
  std::vector<std::string> args = {"--pattern", "blocks", "--width", std::to_string(width),
                                   "--height",  std::to_string(height), "--fps", "30"};
  args.insert(args.end(), more.begin(), more.end());
  return args;
}

// Host options for the built runner and module in the folder's registry.
pmhost::HostOptions HostOptionsFor(const Folder& folder);
// Receiving `source` from the folder's registry.
pmhost::ReceiveOptions ReceiveFrom(const Folder& folder, const std::string& source);

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
// nullopt when the process cannot be read. pid 0 is this process.
struct ProcessUsage {
  int descriptors = 0;
  int threads = 0;
  long residentKiB = 0;
  long privateKiB = 0;
};
std::optional<ProcessUsage> UsageOf(pid_t pid);
// A process's level: descriptors and threads at their lowest, memory at its
// highest, over a few looks (a descriptor the runtime opens for a moment, say
// to list the registry, is not part of it).
std::optional<ProcessUsage> LevelOf(pid_t pid);
// Threads end and descriptors close a moment after the reply that stopped
// them (in this process: after the objects that held them go): waits for the
// level, then expects it exactly (no growth, and nothing closed that should
// still be open).
void ExpectBackAtLevel(pid_t pid, const ProcessUsage& level, const std::string& what);

// What the task reported to the host, by source id. Record runs on the
// dispatcher's receive thread; the rest on the test's thread.
class Reports {
 public:
  void Record(const std::string& command, const nlohmann::json& message) {
    const std::string id = pmjson::FieldAsString(message, "unique_id", "");
    std::lock_guard<std::mutex> guard(lock_);
    if (command == "pm::tsrc::update_connection_state") {
      states_[id].push_back(static_cast<int>(pmjson::FieldAsInteger(message, "state", 0)));
    } else if (command == "pm::tsrc::source_available") {
      ++announced_[id];
    }
  }
  std::vector<int> States(const std::string& id) const {
    std::lock_guard<std::mutex> guard(lock_);
    return states_.count(id) != 0 ? states_.at(id) : std::vector<int>{};
  }
  // How often discovery announced `id`.
  int Announced(const std::string& id) const {
    std::lock_guard<std::mutex> guard(lock_);
    return announced_.count(id) != 0 ? announced_.at(id) : 0;
  }

 private:
  mutable std::mutex lock_;  // guards states_, announced_
  std::map<std::string, std::vector<int>> states_;
  std::map<std::string, int> announced_;
};

// One case's process tree: the sink, a registry folder, the host in this
// process with its runner, what the task reported, and the case's sender
// (made in the folder, so it goes first). The gate opens when the chain
// goes, before the host stops: a failed assertion must not leave a reader
// thread waiting in it while the host joins that thread.
struct Chain {
  explicit Chain(bool ramp = true) : sink(ramp) {}
  ~Chain() { sink.Open(); }
  pmhost::Session& Session() { return host.GetSession(); }
  pid_t Runner() const { return host.RunnerPid(); }
  std::string Log() const { return folder.ReadRunnerLog(); }

  // Starts the sender as `name`, then the host and discovery, and waits
  // until the sender is announced.
  void Start(const std::string& name, const std::vector<std::string>& args) {
    ASSERT_TRUE(sender->Start(folder, name, args));
    id = pmhost::kSourceIdPrefix + sender->Name();
    ASSERT_TRUE(host.Start());
    ASSERT_TRUE(Session().StartDiscovery());
    ASSERT_TRUE(WaitFor([&] { return reports.Announced(id) > 0; }, kPatience)) << id << " never announced";
  }
  // Starts the source until a picture arrives, then stops it: whatever the
  // runtime makes once and keeps is then made before `level` is taken.
  void WarmUp(std::optional<ProcessUsage>* level = nullptr) {
    ASSERT_TRUE(Session().StartSource(id, nlohmann::json::object()));
    ASSERT_TRUE(WaitFor([&] { return sink.Videos(id) > 0; }, kPatience)) << Log();
    ASSERT_TRUE(Session().StopSource(id));
    if (level != nullptr) *level = LevelOf(Runner());
    ASSERT_TRUE(level == nullptr || *level);
  }
  std::string QueueBase() {
    std::string base;
    WaitFor([&] {
      if (const auto queue = Session().Queue(id)) base = queue->MemoryBase();
      return !base.empty();
    }, kPatience);
    return base;
  }
  // The orderly end of the tree, and the runner exits 0 having removed
  // every segment of every memory base of the run itself. Given the
  // running `sources`, stopping them ends the task (the last reply may not
  // leave first); without, the only remaining task work is discovery, and
  // stop_discovery alone does not end the task: the connection closes.
  void EndAndExpectOrderlyExit(const std::vector<std::string>& sources = {}) {
    const std::vector<std::string> bases = Session().MemoryBases();
    for (const std::string& source : sources) Session().StopSource(source);
    if (sources.empty()) {
      EXPECT_TRUE(Session().StopDiscovery());
    } else {
      EXPECT_EQ(host.WaitRunner(kPatience), std::optional<int>(0)) << Log();
    }
    EXPECT_EQ(host.Stop(), 0) << Log();
    EXPECT_EQ(SegmentsOf(bases), 0);
    EXPECT_EQ(host.RemovedSegments(), 0) << "an orderly runner removes its own segments";
  }
  // A source that stops and gives back its segments leaves the runner at
  // `level`.
  void StopAndExpectBackAt(const std::string& base, const ProcessUsage& level) {
    ASSERT_TRUE(Session().StopSource(id));
    EXPECT_TRUE(WaitFor([&] { return SegmentsOf({base}) == 0; }, kPatience)) << SegmentsOf({base});
    ASSERT_NO_FATAL_FAILURE(ExpectBackAtLevel(Runner(), level, "after stop_source"));
    EndAndExpectOrderlyExit();
  }

  RampSink sink;  // first: outlives the host's readers
  Folder folder;
  Reports reports;
  pmhost::Host host{HostOptionsFor(folder),
                    [this](const std::string& c, const nlohmann::json& m) { reports.Record(c, m); }, &sink};
  std::unique_ptr<Sender> sender = std::make_unique<Sender>();
  std::string id;
};

// For cases that run programs: whatever the case did, this process holds
// what it held before it.
class OwnLevelKept : public ::testing::Test {
 protected:
  // A thread is started and joined first: ThreadSanitizer starts a
  // background thread of its own with the first one, and that thread stays.
  void SetUp() override {
    std::thread([] {}).join();
    own_ = UsageOf(0);
    ASSERT_TRUE(own_);
  }
  void TearDown() override { if (own_) ExpectBackAtLevel(0, *own_, "the test process"); }

 private:
  std::optional<ProcessUsage> own_;
};

// The /dev/shm entries a live process has mapped (names without the folder,
// each once), from /proc/PID/maps; entries already unlinked are included.
std::vector<std::string> SharedMemoryMappedBy(pid_t pid);

}  // namespace pmtest
