// What arrives from senders and on sockets, against the real programs: every
// case has its own registry folder, sender and runner, and ends by checking
// that nothing was lost or leaked (the runner ends with 0 after the last
// stop_source having removed its own segments, nothing of the queue's memory
// base is left in /dev/shm, this process holds the descriptors it held
// before).
//
//  - channel counts: 127 arrive intact; 128 (negative in the record's signed
//    channel byte) never reaches the host and is logged once;
//  - a sender that changes its picture size mid-stream (1080p, 720p, 2160p);
//  - a host that misbehaves on its queue: unknown and repeated tokens, a
//    second connection to the queue's server.
//
// Bad message frames to the runner are the dispatcher's and the frame
// reader's cases (tests/pm/ipc), and a runner whose host leaves with a
// source running ends in order in the killed-host fault case.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "e2e_support.h"
#include "pm/shm/queue_record.h"
#include "pm-host/queue_reader.h"
#include "pm/ipc/connection.h"
#include "pm/runtime/proc_stat.h"
#include "support/host_link.h"
#include "support/host_socket.h"
#include "support/wait.h"

namespace {

using nlohmann::json;

using pmtest::RampSink;
using pmtest::SegmentsOf;
using pmtest::kPatience;

// Small pictures keep the sound cases cheap.
const std::vector<std::string> kSmallPictures = {"--pattern", "ramp", "--width", "64", "--height", "16", "--fps", "30"};

using InputFaults = pmtest::OwnLevelKept;

// Starts the chain's source and receives until `done` (or the patience runs
// out); then the source stops and the runner ends in order, having removed
// its own segments.
void ReceiveUntil(pmtest::Chain& c, const std::function<bool()>& done) {
  ASSERT_TRUE(c.Session().StartSource(c.id, json::object()));
  EXPECT_TRUE(pmtest::WaitFor(done, kPatience)) << c.Log();
  EXPECT_GT(SegmentsOf({c.QueueBase()}), 0) << "nothing in /dev/shm to leave behind";
  // What arrived while the source ran is intact. (A record still on its way
  // when the source stops may name a segment the task has already removed.)
  EXPECT_EQ(c.sink.Problems(), std::vector<std::string>{});
  EXPECT_TRUE(c.Session().StopSource(c.id));
  c.EndAndExpectOrderlyExit();
}

// --- Channel counts ------------------------------------------------------

// 127 channels arrive intact and continuous. 128 fits the record's byte but
// reads back negative where sizes are computed: no sound buffer may be asked
// for (a negative size must not become a huge or a wrapped one), the refusal
// is told once with the channel count (not as the pool running dry), and the
// pictures keep coming. (The other counts are tested at the intake.)
class Channels : public InputFaults, public ::testing::WithParamInterface<int> {};

TEST_P(Channels, ArriveIntactUpTo127AndAreRefusedWithOneLineFrom128) {
  const int channels = GetParam();
  const bool fits = channels <= 127;
  const std::string refusal = "#ndisource: too many channels in NDI audio frame (" + std::to_string(channels) + ")";
  pmtest::Chain c;
  std::vector<std::string> args = kSmallPictures;
  args.insert(args.end(), {"--audio-rate", "48000", "--audio-channels", std::to_string(channels)});
  ASSERT_NO_FATAL_FAILURE(c.Start("Channels", args));
  ASSERT_NO_FATAL_FAILURE(ReceiveUntil(c, [&] {
    return fits ? c.sink.Sounds() >= 15 : c.sink.Videos() >= 15 && c.Log().find(refusal) != std::string::npos;
  }));
  const std::string log = c.Log();
  EXPECT_EQ(pmtest::Occurrences(log, refusal), fits ? 0 : 1) << log;
  EXPECT_EQ(log.find("audio well ran dry"), std::string::npos) << log;
  EXPECT_EQ(c.sink.Channels(), fits ? std::set<int>{channels} : std::set<int>{});
}

INSTANTIATE_TEST_SUITE_P(Sound, Channels, ::testing::Values(127, 128),
                         [](const ::testing::TestParamInfo<int>& info) { return std::to_string(info.param); });

// --- Picture size changes ------------------------------------------------

TEST_F(InputFaults, PictureSizeChangesMidStreamKeepEveryPictureIntact) {
  pmtest::Chain c;
  // Six frames of each size, round and round, at 15 fps: a 2160p picture is
  // 16 MB, so only a few of them travel.
  ASSERT_NO_FATAL_FAILURE(c.Start("Zoom", {"--pattern", "ramp", "--sizes", "1920x1080,1280x720,3840x2160",
                                           "--frames-per-size", "6", "--fps", "15", "--no-audio"}));
  // Done once the host has seen 1080p shrink to 720p, 720p grow to 2160p
  // and 2160p shrink back to 1080p (into the pool's larger segments), with
  // two pictures of the last.
  const RampSink::Size order[] = {{1920, 1080}, {1280, 720}, {3840, 2160}, {1920, 1080}};
  const auto sawTheSequence = [&] {
    const auto runs = c.sink.SizeRuns();
    const auto sizeIs = [](const RampSink::Size& size, const auto& run) { return run.first == size; };
    for (std::size_t i = 0; i + 3 < runs.size(); ++i) {
      if (std::equal(order, order + 4, runs.data() + i, sizeIs) && runs[i + 3].second >= 2) return true;
    }
    return false;
  };
  ASSERT_NO_FATAL_FAILURE(ReceiveUntil(c, sawTheSequence));
  EXPECT_TRUE(sawTheSequence()) << ::testing::PrintToString(c.sink.SizeRuns());
  // A picture never goes past its segment: the host refuses a record whose
  // picture does not fit (counted as a problem above). How many segments the
  // pool holds depends on how quickly the host gives them back (only the
  // pool's cap bounds it), so it is not checked here.
}

// --- A host that misbehaves on its queue ----------------------------------

// What a host may do wrong on a queue: return tokens never issued or twice,
// and come again on a second connection. Each is logged or refused, the first
// reader keeps its pictures intact, and nothing is lost in the runner. The
// host here is a plain socket peer (the reference host never does this); the
// records are decoded by the reference host's reader. The sender sends BGRA,
// so this is also the whole chain's case of 'rgba' pictures (the other cases
// carry '2vuy').
TEST_F(InputFaults, UnknownAndRepeatedTokensAndASecondReaderLeaveThePicturesFlowingIntact) {
  pmtest::Folder folder;
  pmtest::Sender sender;
  std::vector<std::string> args = kSmallPictures;
  args.insert(args.end(), {"--format", "bgra", "--no-audio"});
  ASSERT_TRUE(sender.Start(folder, "Tokens", args));
  pmtest::HostListener listener;
  pmtest::RunnerProcess runner(pmtest::Args(PM_MODULE_PATH, {listener.Port()}),
                               {{"NDI_LOOPBACK_DIR", folder.Registry()}});
  ASSERT_TRUE(runner.Started());
  pmtest::HostPeer host = listener.Accept(kPatience);
  ASSERT_TRUE(host.Valid());
  const std::string id = pmhost::kSourceIdPrefix + sender.Name();
  ASSERT_TRUE(
      host.WriteJson(pmtest::Request("pm::tsrc::start_source", 1, {{"unique_id", id}, {"config", json::object()}})));
  json start = json::object();
  while (start.value("pm::command", "") != id + "::start_queue") {
    start = host.ReadJson(kPatience);
    ASSERT_TRUE(start.is_object()) << runner.Stderr();
  }
  const int port = start.value("port", 0);
  const std::string base = start.value("memoryBase", "");
  pmtest::QueueReader queue(port);
  RampSink sink;
  pmhost::QueueReader decoder(id, base, &sink);
  // Reads `n` records, hands each to the decoder and returns its token
  // (`twice`: two times back to back; the second return finds nothing owed).
  std::vector<std::uint32_t> repeated;
  auto read = [&](int n, bool twice = false) {
    for (int i = 0; i < n; ++i) {
      std::uint8_t wire[pm::kQueueWireRecordBytes];
      std::uint32_t token = 0;
      if (!queue.ReadRecord(&token, wire + 4, 20000)) return false;
      std::memcpy(wire, &token, 4);
      if (!decoder.Handle(wire, sizeof wire, &token) || !queue.ReturnToken(token)) return false;
      if (twice && !queue.ReturnToken(token)) return false;
      if (twice) repeated.push_back(token);
    }
    return true;
  };
  ASSERT_TRUE(read(5)) << runner.Stderr();
  const pid_t pid = pm::ChildrenNamed(::getpid(), "pm-runner").at(0);
  const auto level = pmtest::LevelOf(pid);
  ASSERT_TRUE(level.has_value());

  // Never issued: 0 (no segment has it), far beyond the pool, the top bit,
  // and the queue's wake word, which belongs on the producer's own pair only.
  const std::vector<std::uint32_t> unknown = {0u, 1000000u, 0x7FFFFFFFu, 0x80000000u, 0xFFFFFFFEu, 0xFFFFFFFFu};
  for (int round = 0; round < 3; ++round) {
    for (std::uint32_t token : unknown) ASSERT_TRUE(queue.ReturnToken(token));
    ASSERT_TRUE(read(3));
  }
  // Returned twice in a row. (A second return that came after the segment
  // was sent again would give it up early; the tokens are segment ids, so no
  // producer could tell.)
  ASSERT_TRUE(read(3, true));
  // The queue's server stopped listening once the first reader came: a
  // second one is refused, or if the system still lets it in, it is never
  // given a record.
  for (int attempt = 0; attempt < 5; ++attempt) {
    const std::unique_ptr<pm::ipc::Connection> second = pm::ipc::Connection::Open(port);
    std::uint8_t wire[pm::kQueueWireRecordBytes];
    EXPECT_FALSE(second && second->ReadFromSocket(wire, sizeof wire, 300)) << "a second reader was given a record";
  }
  ASSERT_TRUE(read(10));

  const std::string log = runner.Stderr();
  // Each unknown token told every time (as the signed number the queue's
  // log shows), each repeated one at least once.
  const auto told = [&](std::uint32_t token) {
    return pmtest::Occurrences(log, "Token (" + std::to_string(static_cast<std::int32_t>(token)) + ") not found.");
  };
  for (std::uint32_t token : unknown) EXPECT_EQ(told(token), 3) << token << "\n" << log;
  for (std::uint32_t token : repeated) EXPECT_GE(told(token), 1) << token << "\n" << log;
  pmtest::ExpectBackAtLevel(pid, *level, "after the tokens and the refused readers");
  EXPECT_EQ(sink.Problems(), std::vector<std::string>{});
  EXPECT_EQ(sink.Videos(), 5 + 9 + 3 + 10);
  // The last stop_source ends the runner in order, having removed its
  // segments.
  EXPECT_TRUE(host.WriteJson(pmtest::Request("pm::tsrc::stop_source", 2, {{"unique_id", id}})));
  EXPECT_EQ(runner.Wait(kPatience), std::optional<int>(0)) << runner.Stderr();
  EXPECT_EQ(SegmentsOf({base}), 0);
}

}  // namespace
