// The whole chain through real processes, each case in its own registry
// folder: ndi-testsrc -> loopback runtime -> task module in pm-runner ->
// shared memory -> the host library (the code behind `pm-host`).
//
// Pictures of both host codes through the whole chain are the fault suite's
// (2vuy in most cases, rgba in the token case); the host's PTZ, tally, shot
// events and audio-only bandwidth through the whole chain are the vendor
// run's case, and each layer's part its own (tests/taskndisource,
// tests/ndi-loopback).
#include <gtest/gtest.h>

#include <signal.h>
#include <unistd.h>

#include "e2e_support.h"
#include "support/wait.h"

namespace {


using pmtest::SegmentsOf;
using pmtest::kPatience;

// The loopback runtime keeps a sender that went listed for a second, as the
// vendor runtime does; senders here take ports as the vendor's do (the lowest
// free one), so the dead sender's port goes to the next sender at once.
TEST(EndToEnd, ASourceLedToAnotherSendersPortByAStaleListingComesToItsOwnSender) {
  pmtest::Folder folder;
  folder.firstPort = 20000 + static_cast<int>(::getpid() % 10000);
  pmtest::ExpectASourceLedToAnotherSendersPortToComeToItsOwn(folder);
}

// Nothing of the run is left open in this process afterwards (queue and
// command connections, the runner's and the sender's pipes): the fixture.
using CrashedRunner = pmtest::OwnLevelKept;

TEST_F(CrashedRunner, ItsSegmentsAreRemovedAndUnmappedByTheHost) {
  pmtest::Chain c(/*ramp=*/false);
  ASSERT_NO_FATAL_FAILURE(c.Start("Crash", {"--width", "64", "--height", "16", "--fps", "30", "--no-audio"}));
  ASSERT_TRUE(c.Session().StartSource(c.id, nlohmann::json::object()));
  ASSERT_TRUE(pmtest::WaitFor([&] { return c.sink.Videos(c.id) > 3; }, kPatience));
  const std::vector<std::string> bases = c.Session().MemoryBases();
  ASSERT_EQ(bases.size(), 1u);
  ASSERT_GT(SegmentsOf(bases), 0);  // the runner's pool is there
  ::kill(c.Runner(), SIGKILL);
  ASSERT_TRUE(c.host.WaitRunner(kPatience).has_value());
  EXPECT_TRUE(pmtest::WaitFor([&] { return SegmentsOf(bases) == 0; }, kPatience));
  EXPECT_GT(c.host.RemovedSegments(), 0);
  EXPECT_EQ(c.host.Stop(), 128 + SIGKILL);
  for (const std::string& name : pmtest::SharedMemoryMappedBy(::getpid())) {
    EXPECT_NE(name.rfind(bases[0], 0), 0u) << name << " is still mapped";
  }
}

}  // namespace
