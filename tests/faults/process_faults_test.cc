// Faults of the process tree: a host that stops returning tokens, closes its
// queue connection or dies; senders that die mid-frame and come back; long
// start/stop cycles. Each case has its own registry folder, its own senders
// and its own runner, and checks that nothing was lost or leaked: the
// runner's descriptors and threads come back to their level, its resident
// memory stays bounded, this process gets its descriptors back, and nothing
// of the run's memory bases is left in /dev/shm.
//
// The runner ends itself after the last stop_source when no discovery runs,
// so cases that stop and start a source keep discovery running (and the
// discovery cycles keep a source running) to hold the runner up.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "e2e_support.h"
#include "pm/ipc/connection.h"
#include "pm/runtime/ids.h"
#include "pm/runtime/proc_stat.h"
#include "pm/runtime/system.h"
#include "pm/shm/shared_memory_queue.h"
#include "support/wait.h"

namespace {

using nlohmann::json;
using namespace std::chrono_literals;
using pmtest::Chain;
using pmtest::ProcessUsage;
using pmtest::Sender;
using pmtest::SegmentsOf;
using pmtest::ExpectBackAtLevel;
using pmtest::LevelOf;
using pmtest::kPatience;

using Clock = std::chrono::steady_clock;

// Resident memory measures leaks only without a sanitizer: AddressSanitizer
// keeps freed memory in quarantine and ThreadSanitizer adds shadow memory in
// proportion to what was touched, so both grow with traffic alone. Those runs
// have their own checks instead: LeakSanitizer at the runner's exit (its
// status must be 0) and the race reports.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kWithoutSanitizer = false;
#else
constexpr bool kWithoutSanitizer = true;
#endif

double SecondsSince(Clock::time_point start) { return std::chrono::duration<double>(Clock::now() - start).count(); }

// Small silent pictures at `fps`.
std::vector<std::string> Small(const char* fps) {
  return {"--width", "64", "--height", "16", "--fps", fps, "--no-audio"};
}

using ProcessFaults = pmtest::OwnLevelKept;

// Runs `cycle` `count` times; the runner's level taken after the first
// `warmUp` cycles (this process's too) must come back after the last, and
// (optimised build only) its resident memory grow by less than `limitKiB`.
void ExpectCyclesLeaveNothing(Chain& c, const char* what, int count, int warmUp, long limitKiB,
                              const std::function<bool()>& cycle) {
  std::optional<ProcessUsage> level, ownLevel;
  for (int n = 0; n < count; ++n) {
    ASSERT_TRUE(cycle()) << what << " cycle " << n << "\n" << c.Log();
    if (n + 1 == warmUp) {
      level = LevelOf(c.Runner());
      ownLevel = pmtest::UsageOf(0);
      ASSERT_TRUE(level && ownLevel);
    }
  }
  ASSERT_NO_FATAL_FAILURE(ExpectBackAtLevel(c.Runner(), *level, "after the cycles"));
  const std::optional<ProcessUsage> after = pmtest::UsageOf(c.Runner());
  ASSERT_TRUE(after);
  if (kWithoutSanitizer) {
    EXPECT_LT(after->residentKiB - level->residentKiB, limitKiB)
        << what << ": resident KiB " << level->residentKiB << " -> " << after->residentKiB;
  }
  ExpectBackAtLevel(0, *ownLevel, "the test process");
}

TEST_F(ProcessFaults, AHostThatNeverReturnsTokensStopsTheSourceAt240VideoSegmentsUntilItReadsAgain) {
  // 256x144 UYVY: 72 KiB a picture, so that a copy kept per refused frame
  // would show in the runner's resident memory within a second.
  constexpr long kPictureKiB = 256 * 144 * 2 / 1024;
  Chain c(/*ramp=*/true);
  ASSERT_NO_FATAL_FAILURE(c.Start("Stall", {"--width", "256", "--height", "144", "--fps", "120", "--pattern", "ramp",
                                            "--no-audio"}));
  std::optional<ProcessUsage> level;
  ASSERT_NO_FATAL_FAILURE(c.WarmUp(&level));
  const int warmUpVideos = c.sink.Videos(c.id);

  const auto dry = [&] { return pmtest::Occurrences(c.Log(), "video well ran dry"); };
  c.sink.Shut();
  ASSERT_TRUE(c.Session().StartSource(c.id, json::object()));
  const std::string base = c.QueueBase();
  ASSERT_FALSE(base.empty());
  ASSERT_TRUE(pmtest::WaitFor([&] { return SegmentsOf({base}) >= 240 && dry() > 0; }, kPatience))
      << SegmentsOf({base}) << " segments\n" << c.Log();
  EXPECT_TRUE(c.sink.Holding());
  const std::optional<ProcessUsage> whenDry = pmtest::UsageOf(c.Runner());
  ASSERT_TRUE(whenDry);

  // A further second of pictures, every one refused: no new segment, and
  // nothing of them kept.
  const int refused = dry();
  ASSERT_TRUE(pmtest::WaitFor([&] { return dry() >= refused + 120; }, kPatience));
  EXPECT_EQ(SegmentsOf({base}), 240);
  const std::optional<ProcessUsage> later = pmtest::UsageOf(c.Runner());
  ASSERT_TRUE(later);
  if (kWithoutSanitizer) {
    // 120 refused pictures kept would be 8.4 MiB.
    EXPECT_LT(later->residentKiB - whenDry->residentKiB, 2 * 1024) << "grew while every picture was refused";
    // Bounded by the pool: the level, the 240 segments it touched, and 16
    // MiB for the runtime's bounded frame queues and the allocator.
    EXPECT_LT(later->residentKiB, level->residentKiB + 240 * kPictureKiB + 16 * 1024);
  }
  EXPECT_EQ(c.sink.Videos(c.id), warmUpVideos + 1) << "only the held picture reached the host";

  // Reading again: the 240 queued pictures, then new ones through the same
  // pool, intact and in order.
  c.sink.Open();
  ASSERT_TRUE(pmtest::WaitFor([&] { return c.sink.Videos(c.id) >= warmUpVideos + 240 + 60; }, kPatience))
      << c.sink.Videos(c.id) - warmUpVideos << " pictures after the release";
  const int dryAfterRecovery = dry();
  const int recovered = c.sink.Videos(c.id);
  ASSERT_TRUE(pmtest::WaitFor([&] { return c.sink.Videos(c.id) >= recovered + 60; }, kPatience));
  EXPECT_EQ(dry(), dryAfterRecovery) << "still dry while the host reads";
  EXPECT_EQ(SegmentsOf({base}), 240) << "segments are reused, not made anew";
  EXPECT_EQ(c.sink.Problems(), std::vector<std::string>{});

  c.StopAndExpectBackAt(base, *level);
}

TEST_F(ProcessFaults, AHostThatClosesItsQueueMidStreamIsDroppedAndTheSourceRunsOnWithoutGrowingItsPool) {
  Chain c(/*ramp=*/false);
  ASSERT_NO_FATAL_FAILURE(c.Start("Drop", Small("60")));
  std::optional<ProcessUsage> level;
  ASSERT_NO_FATAL_FAILURE(c.WarmUp(&level));

  // The host holds one picture and reads nothing more: every record sent
  // from now on is owed.
  c.sink.Shut();
  ASSERT_TRUE(c.Session().StartSource(c.id, json::object()));
  const std::string base = c.QueueBase();
  ASSERT_FALSE(base.empty());
  ASSERT_TRUE(pmtest::WaitFor([&] { return c.sink.Holding() && SegmentsOf({base}) >= 6; }, kPatience)) << c.Log();

  // The host closes its end while the reader thread still holds the
  // picture (Stop joins that thread, so it runs beside the test).
  const std::shared_ptr<pmhost::QueueReader> queue = c.Session().Queue(c.id);
  ASSERT_TRUE(queue);
  std::thread closer([queue] { queue->Stop(); });
  const bool dropped = pmtest::WaitFor(
      [&] { return c.Log().find("pm::ipc:queue::Producer : Reader gone") != std::string::npos; }, kPatience);
  c.sink.Open();
  closer.join();
  ASSERT_TRUE(dropped) << c.Log();
  // (That the tokens it owed are given up is the producer's case,
  // tests/pm/ipc.)

  // Without a reader every record is released as it is sent: the pool does
  // not grow and never runs dry. (Time must pass here: 30 pictures at 60 fps.)
  const int pool = SegmentsOf({base});
  std::this_thread::sleep_for(500ms);
  EXPECT_EQ(SegmentsOf({base}), pool);
  EXPECT_EQ(c.Log().find("video well ran dry"), std::string::npos);

  // The runner still answers, and the source's loop still runs: the tally
  // reaches the sender.
  EXPECT_TRUE(c.Session().ShotEvent(c.id, "TALLY_PREVIEW_ON").has_value());
  EXPECT_TRUE(c.sender->WaitFor("tally", [](const json& e) { return e.value("preview", false); }));
  EXPECT_EQ(c.reports.States(c.id).back(), 2);

  c.StopAndExpectBackAt(base, *level);
}

// Makes this process the reaper of orphaned descendants for its life, so
// that a runner whose host was killed becomes our child; reaps (killing it
// first when it still runs) the process it was told to watch.
struct Subreaper {
  Subreaper() : enabled(::prctl(PR_SET_CHILD_SUBREAPER, 1) == 0) {}
  ~Subreaper() {
    if (watched > 0 && !status) {
      ::kill(watched, SIGKILL);
      Reap();
    }
    ::prctl(PR_SET_CHILD_SUBREAPER, 0);
  }
  // The watched process's wait status once it ended and was reaped by us.
  std::optional<int> Reap() {
    pmtest::WaitFor([&] {
      int s = 0;
      if (::waitpid(watched, &s, WNOHANG) == watched) status = s;
      return status.has_value();
    }, kPatience);
    return status;
  }
  const bool enabled;
  pid_t watched = -1;
  std::optional<int> status;  // once reaped
};

TEST_F(ProcessFaults, ARunnerWhoseHostIsKilledEndsWithin5sAndLeavesNothingInDevShm) {
  Subreaper reaper;
  ASSERT_TRUE(reaper.enabled);
  pmtest::Folder folder;
  Sender sender;
  ASSERT_TRUE(sender.Start(folder, "Orphan", Small("60")));

  // `pm-host receive` as its own process, with its runner under it.
  pmhost::ChildProcess host;
  pmhost::ChildOptions o;
  o.path = PM_HOST_PATH;
  o.args = {"--runner", PM_RUNNER_PATH, "--module", PM_MODULE_PATH,
            "--runner-log", folder.RunnerLog(), "receive", sender.Name(), "--seconds", "60"};
  o.env = {{"NDI_LOOPBACK_DIR", folder.Registry()}};
  ASSERT_TRUE(host.Start(std::move(o)));
  std::vector<pid_t> runners;
  ASSERT_TRUE(pmtest::WaitFor([&] {
    runners = pm::ChildrenNamed(host.Pid(), "pm-runner");
    return runners.size() == 1;
  }, kPatience));
  const pid_t runner = runners[0];
  reaper.watched = runner;

  // Pictures flow once the runner has segments mapped (a segment is made
  // for a picture to send); their names are the queue's 22-character memory
  // base followed by the segment id.
  std::vector<std::string> mapped;
  ASSERT_TRUE(pmtest::WaitFor([&] {
    mapped = pmtest::SharedMemoryMappedBy(runner);
    return !mapped.empty();
  }, kPatience)) << folder.ReadRunnerLog();
  ASSERT_GT(mapped[0].size(), 22u) << mapped[0];
  const std::string base = mapped[0].substr(0, 22);
  ASSERT_GT(SegmentsOf({base}), 0);

  const auto killed = Clock::now();
  host.Signal(SIGKILL);
  EXPECT_EQ(host.Wait(kPatience), std::optional<int>(128 + SIGKILL));
  const std::optional<int> status = reaper.Reap();
  ASSERT_TRUE(status.has_value()) << "the runner outlived its host\n" << folder.ReadRunnerLog();
  EXPECT_LT(SecondsSince(killed), 5.0) << folder.ReadRunnerLog();
  EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 0) << "wait status " << *status << "\n"
                                                               << folder.ReadRunnerLog();
  EXPECT_EQ(SegmentsOf({base}), 0) << folder.ReadRunnerLog();
}

TEST_F(ProcessFaults, SendersKilledMidFrameAndStartedAgainAfterEachDelayAreReceivedFromTheirFirstReceivingReport) {
  // Four sources in one runner, each sender killed and restarted five times
  // together: 20 kills and returns. A source notices a returned sender on
  // its 5-second poll of the idle state, so 20 rounds one after another
  // would take over 100 s; four at a time keep the same count in a quarter
  // of that. Each round starts the senders again at its own delay after
  // their sources reported them gone, and each time every source reports
  // it connecting and receiving once, with pictures coming with that
  // "receiving" (not a second connecting/receiving cycle later). Delays
  // are the input; everything else waits for its condition.
  constexpr int kSenders = 4;
  const std::chrono::milliseconds delays[] = {200ms, 500ms, 1000ms, 2000ms, 6000ms};
  // 1080p at 30 fps: a 4 MB picture is on the socket a good part of each
  // frame period, and every kill lands at a random point of one.
  const std::vector<std::string> args = {"--width", "1920", "--height", "1080", "--fps", "30", "--no-audio"};
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("kill offsets seed " + std::to_string(seed));
  std::mt19937 random(seed);
  std::uniform_int_distribution<int> offsetUs(0, 33'333);

  Chain c(/*ramp=*/false);
  std::vector<std::unique_ptr<Sender>> senders(kSenders);
  std::vector<std::string> ids;
  auto name = [](int i) { return "Phoenix " + std::to_string(i); };
  for (int i = 0; i < kSenders; ++i) {
    senders[i] = std::make_unique<Sender>();
    ASSERT_TRUE(senders[i]->Start(c.folder, name(i), args));
    ids.push_back(pmhost::kSourceIdPrefix + senders[i]->Name());
  }
  ASSERT_TRUE(c.host.Start());
  const std::optional<ProcessUsage> idle = pmtest::UsageOf(c.Runner());
  ASSERT_TRUE(idle);
  for (const std::string& id : ids) ASSERT_TRUE(c.Session().StartSource(id, json::object()));
  std::vector<std::size_t> marks(kSenders, 0);  // reports before this round
  std::vector<int> videos(kSenders, 0);         // pictures before this round
  // Every source reported `state` since its mark (and, for 2, has pictures
  // since then).
  auto allReportedSince = [&](int state) {
    for (int i = 0; i < kSenders; ++i) {
      const std::vector<int> s = c.reports.States(ids[i]);
      if (std::find(s.begin() + static_cast<long>(std::min(marks[i], s.size())), s.end(), state) == s.end() ||
          (state == 2 && c.sink.Videos(ids[i]) <= videos[i])) {
        return false;
      }
    }
    return true;
  };
  ASSERT_TRUE(pmtest::WaitFor([&] { return allReportedSince(2); }, kPatience)) << c.Log();
  const std::optional<ProcessUsage> level = LevelOf(c.Runner());
  ASSERT_TRUE(level);

  double goneCpu = 0, goneWall = 0;
  long highestPrivate = level->privateKiB;
  for (const auto delay : delays) {
    SCOPED_TRACE("started again " + std::to_string(delay.count()) + " ms after state 3");
    for (int i = 0; i < kSenders; ++i) marks[i] = c.reports.States(ids[i]).size();
    for (auto& sender : senders) {
      std::this_thread::sleep_for(std::chrono::microseconds(offsetUs(random)));
      sender->Process().Signal(SIGKILL);
    }
    for (auto& sender : senders) ASSERT_TRUE(sender->Process().Wait(kPatience).has_value());
    ASSERT_TRUE(pmtest::WaitFor([&] { return allReportedSince(3); }, kPatience))
        << "a source did not notice its sender's end";

    // Every sender gone, every source idle: the runner must sleep.
    goneCpu -= pm::ProcessCpuSeconds(c.Runner());
    const auto start = Clock::now();
    std::this_thread::sleep_for(delay);
    goneCpu += pm::ProcessCpuSeconds(c.Runner());
    goneWall += SecondsSince(start);
    if (const auto gone = pmtest::UsageOf(c.Runner())) highestPrivate = std::max(highestPrivate, gone->privateKiB);

    for (int i = 0; i < kSenders; ++i) {
      videos[i] = c.sink.Videos(ids[i]);
      senders[i] = std::make_unique<Sender>();
      ASSERT_TRUE(senders[i]->Start(c.folder, name(i), args));
    }
    // A picture may overtake the report it came with.
    ASSERT_TRUE(pmtest::WaitFor([&] { return allReportedSince(2); }, kPatience))
        << "not every source came back\n" << c.Log();
    for (int i = 0; i < kSenders; ++i) {
      const std::vector<int> all = c.reports.States(ids[i]);
      EXPECT_EQ(std::vector<int>(all.begin() + static_cast<long>(marks[i]), all.end()), (std::vector<int>{3, 1, 2}))
          << ids[i] << ": states since the kill, when pictures came again";
    }
    if (const auto now = pmtest::UsageOf(c.Runner())) highestPrivate = std::max(highestPrivate, now->privateKiB);
  }
  // Only the optimised build tells: under the sanitizers the runner's
  // allocator and shadow bookkeeping for the pictures it just let go of
  // keep it busy after its sources went idle.
  if (kWithoutSanitizer) {
    EXPECT_LT(goneCpu / goneWall, 0.05) << "runner CPU share while the senders were gone";
  }
  ASSERT_NO_FATAL_FAILURE(ExpectBackAtLevel(c.Runner(), *level, "receiving again after the last round"));
  if (kWithoutSanitizer) {
    // The runtime keeps at most 8 queued and 4 pooled pictures for each
    // receiver, and the source captures one: 13 pictures of 4,050 KiB for
    // each of the four, plus 32 MiB for the allocator. The runner's
    // private memory stays under that however full its queues get (110 to
    // 145 MiB here, on a busy machine too); pictures kept beyond them add
    // to that and cross it past about 100 MiB. The queues' shared-memory
    // pools are left out: they grow as far as the host's readers lag
    // behind, which is the machine's load, and are checked to be gone at
    // the end.
    constexpr long kPictureKiB = 1920L * 1080 * 2 / 1024;
    EXPECT_LT(highestPrivate, idle->privateKiB + kSenders * 13 * kPictureKiB + 32 * 1024)
        << "private KiB " << idle->privateKiB << " before the sources, " << level->privateKiB << " receiving";
  }
  EXPECT_EQ(c.Session().MemoryBases().size(), static_cast<std::size_t>(kSenders));
  c.EndAndExpectOrderlyExit(ids);
  senders.clear();
}

TEST_F(ProcessFaults, AThousandSourceStartStopCyclesLeaveNoDescriptorThreadMemoryOrSegmentBehind) {
  constexpr int kCycles = 1000;
  Chain c(/*ramp=*/false);
  // Pictures often enough that some cycles stop a source that has started
  // delivering.
  ASSERT_NO_FATAL_FAILURE(c.Start("Cycle", Small("120")));
  ASSERT_NO_FATAL_FAILURE(c.WarmUp());

  // 4 MiB over 990 cycles is under one page (4 KiB) a cycle: a leaked
  // thread stack page, picture or segment mapping per cycle shows; the
  // allocator's own slack does not.
  ASSERT_NO_FATAL_FAILURE(ExpectCyclesLeaveNothing(c, "start_source/stop_source", kCycles, 10, 4 * 1024, [&] {
    return c.Session().StartSource(c.id, json::object()) && c.Session().StopSource(c.id);
  }));
  const std::vector<std::string> bases = c.Session().MemoryBases();
  EXPECT_EQ(bases.size(), static_cast<std::size_t>(kCycles + 1));
  EXPECT_EQ(SegmentsOf(bases), 0);
  c.EndAndExpectOrderlyExit();
}

// stop_source may destroy a source's queue at the very moment its listener
// thread accepts the host's connection. The cycles above once ended the
// runner that way ("Resource deadlock avoided": the listener thread held the
// last owner of its own server and joined itself). Here, in this process, a
// queue goes a few microseconds after its host connection was taken, on four
// threads at once, 1,200 times; before the mend about every other run ended
// the process.
TEST_F(ProcessFaults, AQueueDestroyedWhileItsHostConnectionIsAcceptedDoesNotEndTheProcess) {
  constexpr int kThreads = 4;
  constexpr int kTimesEach = 300;
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([t, &failures] {
      std::mt19937 random(static_cast<unsigned>(t));
      std::uniform_int_distribution<int> delayNs(0, 5000);
      for (int i = 0; i < kTimesEach; ++i) {
        auto queue = std::make_shared<pm::SharedMemoryQueueProducer>();
        std::atomic<bool> accepted{false};
        queue->StartQueue(nullptr, "fault", pm::NewShortId(), [&accepted] { accepted = true; });
        const std::unique_ptr<pm::ipc::Connection> host = pm::ipc::Connection::Open(queue->Port());
        // A tight wait: the race lasts microseconds.
        const auto limit = Clock::now() + 5s;
        while (host && !accepted && Clock::now() < limit) std::this_thread::yield();
        if (!host || !accepted) ++failures;
        const auto until = Clock::now() + std::chrono::nanoseconds(delayNs(random));
        while (Clock::now() < until) {
        }
        queue.reset();
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0) << "host connections not accepted";
}

TEST_F(ProcessFaults, TwoHundredDiscoveryStartStopCyclesLeaveNoDescriptorThreadOrMemoryBehind) {
  Chain c(/*ramp=*/false);
  ASSERT_NO_FATAL_FAILURE(c.Start("Scan", Small("30")));
  // The source keeps the runner up while discovery comes and goes.
  ASSERT_TRUE(c.Session().StartSource(c.id, json::object()));
  ASSERT_TRUE(pmtest::WaitFor([&] { return c.sink.Videos(c.id) > 0; }, kPatience));
  ASSERT_TRUE(c.Session().StopDiscovery());

  // Under 5 KiB a cycle: a leaked finder, or a scan thread's stack page,
  // per cycle shows.
  ASSERT_NO_FATAL_FAILURE(ExpectCyclesLeaveNothing(c, "discovery", 200, 5, 1024, [&] {
    return c.Session().StartDiscovery() && c.Session().StopDiscovery();
  }));

  // A discovery started after all those cycles still finds the sender.
  const int announced = c.reports.Announced(c.id);
  ASSERT_TRUE(c.Session().StartDiscovery());
  EXPECT_TRUE(pmtest::WaitFor([&] { return c.reports.Announced(c.id) > announced; }, kPatience));
  ASSERT_TRUE(c.Session().StopDiscovery());
  c.EndAndExpectOrderlyExit({c.id});
}

}  // namespace
