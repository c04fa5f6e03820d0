// Discovery: the scan schedule, announcements as senders come and go, and
// stopping, on a clock the test advances.

#include <gtest/gtest.h>

#include "ndi_harness.h"
#include "support/log_capture.h"
#include "support/wait.h"
#include "taskndisource/discovery.h"

namespace {

using nditest::Entry;
using TaskNDISource::Discovery;

// The discovery goes first, stopping its loop.
class DiscoveryTest : public ::testing::Test {
 protected:
  // Lets the waiting scan loop run its next scan and waits for the wait
  // after it; returns that wait's length in ms.
  std::int64_t NextScan() {
    const std::int64_t wait = env.clock->AwaitWait(waits);
    env.clock->AdvanceMs(wait);
    return env.clock->AwaitWait(++waits);
  }

  pmtest::LogCapture logs;
  nditest::ScriptedNdi ndi;
  std::shared_ptr<nditest::FakeCallbacks> callbacks = std::make_shared<nditest::FakeCallbacks>();
  nditest::TestEnvironment env;
  std::shared_ptr<Discovery> discovery = std::make_shared<Discovery>(callbacks, ndi.Api(), env.Make());
  int waits = 1;
};

// A sender is announced once while it stays, withdrawn once, and announced
// anew when it is back. Senders are told apart by URL, so two with one name
// are two entries with one id. Within a scan every withdrawal comes first, and an id that an entry
// still carries afterwards is announced again: the last word about a present
// sender is "available", whatever order the table walks its URLs in (each
// move is scripted both ways round).
TEST_F(DiscoveryTest, WithdrawalsComeFirstSoAPresentIdEndsAvailable) {
  const Entry at1{"A (x)", "10.0.0.1:1"}, at2{"A (x)", "10.0.0.2:1"}, at9{"A (x)", "10.0.0.9:1"};
  const std::string on = "+NDICaptureDevice~A (x) A (x)", off = "-NDICaptureDevice~A (x)";
  struct Script {
    const char* name;
    std::vector<std::vector<Entry>> scans;
    std::vector<std::string> calls;  // of every scan, in order
  };
  const Script scripts[] = {
      {"moved", {{at1}, {at9}}, {on, off, on}},
      {"moved back", {{at9}, {at1}}, {on, off, on}},
      {"first of two sharing a name vanished", {{at1, at2}, {at2}}, {on, on, off, on}},
      {"second of two sharing a name vanished", {{at1, at2}, {at1}}, {on, on, off, on}},
      {"both of two vanished", {{at1, at2}, {}, {}}, {on, on, off, off}},

      {"entries without name or url are ignored",
       {{Entry{nullptr, "10.0.0.1:1"}, Entry{"B (y)", nullptr}, Entry{"", "10.0.0.3:1"}, Entry{"C (z)", ""}, at1}},
       {on}},
      {"stays, vanishes and comes back", {{at1}, {at1}, {}, {}, {at1}}, {on, off, on}},
  };
  for (const Script& script : scripts) {
    SCOPED_TRACE(script.name);
    logs.Clear();
    auto calls = std::make_shared<nditest::FakeCallbacks>();
    Discovery fresh(calls, ndi.Api(), env.Make());
    for (const std::vector<Entry>& scan : script.scans) {
      ndi.SetSources(scan);
      ASSERT_TRUE(fresh.ScanOnce(reinterpret_cast<void*>(0x10)));
    }
    EXPECT_EQ(calls->Seen().calls, script.calls);
  }
  // Of the last script: one line for each announcement.
  EXPECT_EQ(logs.Count("#ndisource: Discovered NDI Source: A (x) (10.0.0.1:1)\n"), 2);
}

// Scans come 125 ms after a start, then at intervals doubling to 4 s. Stop
// ends a wait without another scan; a restart keeps the table and is not cut
// short by an earlier Stop.
TEST_F(DiscoveryTest, ScansDoubleTo4sUntilAStopAndARestartKeepsTheTable) {
  ndi.SetSources({Entry{"A (x)", "10.0.0.1:1"}});
  discovery->Stop();  // nothing runs: the signal must not outlive this call's purpose
  discovery->Start();
  ASSERT_EQ(env.clock->AwaitWait(1), 125);
  EXPECT_EQ(ndi.Seen().listCalls, 0);
  std::vector<std::int64_t> intervals;
  for (int scan = 1; scan <= 7; ++scan) intervals.push_back(NextScan());
  EXPECT_EQ(intervals, (std::vector<std::int64_t>{250, 500, 1000, 2000, 4000, 4000, 4000}));
  discovery->Stop();  // during a wait
  EXPECT_EQ(ndi.Seen().listCalls, 7);
  EXPECT_EQ(ndi.Seen().findersDestroyed, 1);
  discovery->Start();
  discovery->Start();  // a second start while running is ignored
  ASSERT_EQ(env.clock->AwaitWait(++waits), 125);  // after the first loop's eight waits
  NextScan();
  EXPECT_EQ(callbacks->Seen().calls.size(), 1u);  // still there: not announced again
  EXPECT_EQ(ndi.Seen().findersCreated, 2);
  EXPECT_EQ(ndi.Seen().maxLiveFinders, 1);
}

TEST_F(DiscoveryTest, FinderThatCannotBeCreatedEndsTheLoopUntilTheNextStart) {
  ndi.FailCreate("finder");
  discovery->Start();
  ASSERT_TRUE(pmtest::WaitFor([&] { return logs.Contains("#ndisource: failed to create NDI source finder\n"); }));
  ndi.FailCreate("");
  ndi.SetSources({Entry{"A (x)", "10.0.0.1:1"}});
  discovery->Start();
  NextScan();
  EXPECT_EQ(callbacks->Seen().calls.size(), 1u);
}

TEST_F(DiscoveryTest, WithoutCallbacksTheTableIsKeptAndNothingAnnounced) {
  ndi.SetSources({Entry{"A (x)", "10.0.0.1:1"}});
  Discovery quiet(nullptr, ndi.Api(), env.Make());
  EXPECT_FALSE(quiet.ScanOnce(nullptr));
  EXPECT_TRUE(quiet.ScanOnce(reinterpret_cast<void*>(0x10)));
  EXPECT_TRUE(quiet.ScanOnce(reinterpret_cast<void*>(0x10)));
  EXPECT_EQ(logs.Count("Discovered NDI Source"), 1);
}

}  // namespace
