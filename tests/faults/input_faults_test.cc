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
//  - a host that misbehaves on its sockets: bad message frames and oversize
//    lengths to the runner, unknown and repeated tokens to a queue, a second
//    connection to a queue server.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstring>
#include <future>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "e2e_support.h"
#include "faults/ramp_sink.h"
#include "pm-host/checks.h"
#include "pm-host/queue_reader.h"
#include "pm-host/session.h"
#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"
#include "pm/ipc/server.h"
#include "pm/runtime/little_endian.h"
#include "support/wait.h"

namespace {

using nlohmann::json;
using namespace std::chrono_literals;

using pmtest::Folder;
using pmtest::RampSink;
using pmtest::Sender;
using pmtest::SegmentsOf;

// Generous: the sanitizer builds start processes slowly on a busy machine.
constexpr auto kArrivalLimit = 30s;
constexpr auto kExitLimit = 15s;

// Small pictures keep the sound cases cheap.
const std::vector<std::string> kSmallPictures = {"--pattern", "ramp", "--width", "64", "--height", "16", "--fps", "30"};

std::string Id(Sender& sender) { return std::string(pmhost::kSourceIdPrefix) + sender.Name(); }

// Every case: this process holds the descriptors it held before (the host's
// connections, mappings, children's pipes and threads all let go).
class InputFaults : public ::testing::Test {
 protected:
  void SetUp() override {
    before_ = pmtest::OwnUsage();
    ASSERT_TRUE(before_.has_value());
  }
  void TearDown() override {
    // The children's pipes and the readers' connections close a moment
    // after the case ends.
    std::optional<pmtest::ProcessUsage> after;
    pmtest::WaitFor([&] {
      after = pmtest::OwnUsage();
      return after && after->descriptors == before_->descriptors;
    }, kExitLimit);
    ASSERT_TRUE(after.has_value());
    EXPECT_EQ(after->descriptors, before_->descriptors) << "descriptors of the test process leaked";
  }

 private:
  std::optional<pmtest::ProcessUsage> before_;
};


// How a run through the reference host ended.
struct RunEnd {
  std::optional<int> runnerExit;  // after the last stop_source, without being asked
  int leftInShm = -1;             // entries of the run's memory bases once the runner ended
  int removedByHost = -1;         // segments the host had to remove for the runner
  std::vector<std::string> bases;
  int segmentsWhileRunning = 0;   // entries of the bases just before stop_source
};

// Receives `id` through the reference host until `done` (or the arrival
// limit), then stops the source and lets the runner end by itself.
RunEnd ReceiveThroughHost(const Folder& folder, const std::string& id, pmhost::FrameSink* sink,
                          const std::function<bool()>& done) {
  RunEnd end;
  pmhost::Host host(pmtest::HostOptionsFor(folder), {}, sink);
  if (!host.Start()) {
    ADD_FAILURE() << "the runner did not start\n" << folder.ReadRunnerLog();
    return end;
  }
  EXPECT_TRUE(host.GetSession().StartSource(id, json::object()).has_value());
  EXPECT_TRUE(pmtest::WaitFor(done, kArrivalLimit)) << folder.ReadRunnerLog();
  end.bases = host.GetSession().MemoryBases();
  end.segmentsWhileRunning = SegmentsOf(end.bases);
  host.GetSession().StopSource(id);
  end.runnerExit = host.WaitRunner(kExitLimit);
  end.leftInShm = SegmentsOf(end.bases);
  host.Stop();
  end.removedByHost = host.RemovedSegments();
  return end;
}

void ExpectCleanEnd(const RunEnd& end, const Folder& folder) {
  EXPECT_EQ(end.runnerExit, std::optional<int>(0)) << folder.ReadRunnerLog();
  EXPECT_EQ(end.bases.size(), 1u);
  EXPECT_GT(end.segmentsWhileRunning, 0) << "nothing in /dev/shm to leave behind";
  EXPECT_EQ(end.leftInShm, 0);
  EXPECT_EQ(end.removedByHost, 0) << "the runner left segments for the host to remove";
}

std::size_t Occurrences(const std::string& text, const std::string& what) {
  std::size_t count = 0;
  for (std::size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + what.size())) ++count;
  return count;
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
  Folder folder;
  Sender sender;
  std::vector<std::string> args = kSmallPictures;
  args.insert(args.end(), {"--audio-rate", "48000", "--audio-channels", std::to_string(channels)});
  ASSERT_TRUE(sender.Start(folder, "Channels", args));
  RampSink sink;
  const RunEnd end = ReceiveThroughHost(folder, Id(sender), &sink, [&] {
    return fits ? sink.Sounds() >= 15
                : sink.Pictures() >= 15 && folder.ReadRunnerLog().find(refusal) != std::string::npos;
  });
  ExpectCleanEnd(end, folder);
  const std::string log = folder.ReadRunnerLog();
  EXPECT_EQ(Occurrences(log, refusal), fits ? 0u : 1u) << log;
  EXPECT_EQ(log.find("audio well ran dry"), std::string::npos) << log;
  EXPECT_EQ(sink.Problems(), std::vector<std::string>{});
  const std::vector<int> seen = sink.Channels();
  EXPECT_EQ(std::count(seen.begin(), seen.end(), channels), static_cast<long>(seen.size()));
  EXPECT_GE(fits ? sink.Sounds() : sink.Pictures(), 15);
  EXPECT_EQ(sink.Sounds() == 0, !fits);
}

INSTANTIATE_TEST_SUITE_P(Sound, Channels, ::testing::Values(127, 128),
                         [](const ::testing::TestParamInfo<int>& info) { return std::to_string(info.param); });

// --- Picture size changes ------------------------------------------------

TEST_F(InputFaults, PictureSizeChangesMidStreamKeepEveryPictureIntact) {
  Folder folder;
  Sender sender;
  // Six frames of each size, round and round, at 15 fps: a 2160p picture is
  // 16 MB, so only a few of them travel.
  ASSERT_TRUE(sender.Start(folder, "Zoom", {"--pattern", "ramp", "--sizes", "1920x1080,1280x720,3840x2160",
                                            "--frames-per-size", "6", "--fps", "15", "--no-audio"}));
  using Size = RampSink::Size;
  const Size hd{1920, 1080}, small{1280, 720}, uhd{3840, 2160};
  RampSink sink;
  // Done once the host has seen 1080p shrink to 720p, 720p grow to 2160p
  // and 2160p shrink back to 1080p (into the pool's larger segments), with
  // two pictures of the last.
  const auto sawTheSequence = [&] {
    const auto runs = sink.SizeRuns();
    for (std::size_t i = 0; i + 3 < runs.size(); ++i) {
      if (runs[i].first == hd && runs[i + 1].first == small && runs[i + 2].first == uhd && runs[i + 3].first == hd &&
          runs[i + 3].second >= 2) {
        return true;
      }
    }
    return false;
  };
  const RunEnd end = ReceiveThroughHost(folder, Id(sender), &sink, sawTheSequence);
  ExpectCleanEnd(end, folder);
  EXPECT_TRUE(sawTheSequence()) << ::testing::PrintToString(sink.SizeRuns());
  EXPECT_EQ(sink.Problems(), std::vector<std::string>{});
  // A picture never goes past its segment: the host refuses a record whose
  // picture does not fit (counted as a problem above). How many segments the
  // pool holds depends on how quickly the host gives them back (only the
  // pool's cap bounds it), so it is not checked here.
}

// --- A host that misbehaves on its sockets --------------------------------

// The host made of plain pieces, for input the reference host never sends:
// it listens, starts the runner on the port, keeps the raw connection (with a
// request dispatcher on it) and reads a source's queue itself, decoding each
// record with the reference host's reader, so that it can write anything back.
//
// Threads: the dispatcher's receive thread runs the handlers (queue
// announcements, notifications); the tap thread reads records and returns
// tokens. Lock: lock_ guards port_, memoryBase_, repeated_ and the
// setting of decoder_; the only lock taken inside it is the decoder's segment
// cache lock (Forget).
class RawHost {
 public:
  explicit RawHost(const Folder& folder) : folder_(folder) {}
  ~RawHost() { Shutdown(); }
  RawHost(const RawHost&) = delete;
  RawHost& operator=(const RawHost&) = delete;

  bool Start() {
    std::unique_ptr<pm::ipc::Server> server = pm::ipc::Server::CreateListening();
    if (!server) return false;
    pmhost::ChildOptions child;
    child.path = pmtest::BuiltPrograms().runner;
    child.args = {"--module", pmtest::BuiltPrograms().module, "--connect", std::to_string(server->GetPort())};
    child.env = {{"NDI_LOOPBACK_DIR", folder_.Registry()}};
    child.stderrPath = folder_.RunnerLog();
    if (!runner_.Start(std::move(child))) return false;
    std::unique_ptr<pm::ipc::Connection> accepted;
    const auto deadline = std::chrono::steady_clock::now() + 20s;
    while (!accepted && runner_.Running() && std::chrono::steady_clock::now() < deadline) {
      accepted = server->AcceptConnection(200);
    }
    server->Stop();
    if (!accepted) return false;
    connection_ = std::shared_ptr<pm::ipc::Connection>(std::move(accepted));
    dispatcher_ = std::make_shared<pm::RpcDispatcher>(connection_);
    // The task's notifications are taken and left unread.
    for (const std::string& command : pmhost::Session::NotificationCommands()) {
      dispatcher_->RegisterHandler(command, [](const json&, json&) {});
    }
    dispatcher_->Start();
    return true;
  }

  // Starts the source and waits for its queue announcement; then connects
  // the tap to the queue and starts reading.
  bool StartSource(const std::string& id, pmhost::FrameSink* sink) {
    dispatcher_->RegisterHandler(id + "::start_queue", [this](const json& message, json&) {
      std::lock_guard<std::mutex> guard(lock_);
      port_ = static_cast<int>(message.value("port", 0));
      memoryBase_ = message.value("memoryBase", "");
    });
    dispatcher_->RegisterHandler(id + "::delete_memory", [this](const json& message, json&) {
      std::lock_guard<std::mutex> guard(lock_);
      if (decoder_) decoder_->Forget(static_cast<std::uint32_t>(message.value("unique_id", 0u)));
    });
    if (!Request("pm::tsrc::start_source", {{"unique_id", id}, {"config", json::object()}})) return false;
    if (!pmtest::WaitFor([&] { return Port() > 0; }, kArrivalLimit)) return false;
    // The decoder exists before the tap connects: delete_memory may follow.
    {
      std::lock_guard<std::mutex> guard(lock_);
      decoder_ = std::make_unique<pmhost::QueueReader>(id, memoryBase_, sink);
    }
    queue_ = pm::ipc::Connection::Open(Port());
    if (!queue_) return false;
    tapRunning_ = true;
    tap_ = std::thread([this] { Tap(); });
    return true;
  }

  std::optional<json> Request(const std::string& command, json payload, std::int64_t timeoutMs = 10000) {
    auto reply = std::make_shared<std::promise<json>>();
    std::future<json> future = reply->get_future();
    if (!dispatcher_->RpcRequest(command, payload, timeoutMs, [reply](const json& m) { reply->set_value(m); })) {
      return std::nullopt;
    }
    // A connection that ends ends the wait too: the task ends itself after the
    // last stop_source, sometimes before its reply leaves.
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs + 2000);
    while (future.wait_for(20ms) != std::future_status::ready) {
      if (dispatcher_->Ended() || std::chrono::steady_clock::now() >= deadline) return std::nullopt;
    }
    json message = future.get();
    if (message.value("pm::error", "") == "timeout") return std::nullopt;
    return message;
  }

  // Bytes straight onto the runner's connection, beside the dispatcher's.
  bool WriteRaw(const std::string& bytes) {
    pm::BufferList list;
    list.emplace_back(bytes.data(), static_cast<std::uint32_t>(bytes.size()));
    return connection_->Send(std::move(list));
  }
  static std::string Prefix(std::uint32_t length) {
    std::string bytes(4, '\0');
    pm::StoreLe32(bytes.data(), length);
    return bytes;
  }
  static std::string Frame(const std::string& text) {
    return Prefix(static_cast<std::uint32_t>(text.size())) + text;
  }
  // Ends our side of the runner's connection.
  void CloseRunnerConnection() { connection_->Close(); }

  // Writes tokens onto the queue connection, beside the tap's returns.
  bool WriteTokens(const std::vector<std::uint32_t>& tokens) {
    std::vector<std::uint8_t> bytes;
    for (std::uint32_t t : tokens) {
      bytes.resize(bytes.size() + 4);
      pm::StoreLe32(bytes.data() + bytes.size() - 4, t);
    }
    pm::BufferList list;
    list.emplace_back(bytes.data(), static_cast<std::uint32_t>(bytes.size()));
    return queue_->Send(std::move(list));
  }
  // The next `count` tokens the tap returns are returned twice, back to back.
  void RepeatTokens(int count) { repeat_ = count; }
  std::vector<std::uint32_t> Repeated() {
    std::lock_guard<std::mutex> guard(lock_);
    return repeated_;
  }
  // The tap saw the task end the queue connection.
  bool QueueEnded() const { return queueEnded_.load(); }

  int Port() {
    std::lock_guard<std::mutex> guard(lock_);
    return port_;
  }
  std::string MemoryBase() {
    std::lock_guard<std::mutex> guard(lock_);
    return memoryBase_;
  }
  pid_t RunnerPid() const { return runner_.Pid(); }
  std::optional<int> WaitRunner(std::chrono::milliseconds limit) { return runner_.Wait(limit); }

  // Stops the tap and the dispatcher; the runner, if it still runs, is
  // killed by its ChildProcess.
  void Shutdown() {
    tapRunning_ = false;
    if (queue_) queue_->Close();
    if (tap_.joinable()) tap_.join();
    if (dispatcher_) dispatcher_->Stop();
  }

 private:
  void Tap() {
    std::uint8_t wire[pm::kQueueWireRecordBytes];
    while (tapRunning_) {
      if (!queue_->ReadFromSocket(wire, sizeof wire, 250)) {
        if (!queue_->IsConnected()) break;
        continue;
      }
      std::uint32_t token = 0;
      if (!decoder_->Handle(wire, sizeof wire, &token)) continue;
      std::vector<std::uint32_t> back = {token};
      if (repeat_.load() > 0) {
        --repeat_;
        back.push_back(token);
        std::lock_guard<std::mutex> guard(lock_);
        repeated_.push_back(token);
      }
      if (!WriteTokens(back) && !queue_->IsConnected()) break;
    }
    queueEnded_ = !queue_->IsConnected();
  }

  const Folder& folder_;
  // Last to go of what the threads use: the runner.
  pmhost::ChildProcess runner_;
  std::shared_ptr<pm::ipc::Connection> connection_;
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
  // Set under lock_ before the tap starts (the tap then reads it without the
  // lock: it never changes again); delete_memory reads it under lock_.
  std::unique_ptr<pmhost::QueueReader> decoder_;
  std::shared_ptr<pm::ipc::Connection> queue_;    // set before the tap starts
  std::thread tap_;
  std::atomic<bool> tapRunning_{false};
  std::atomic<bool> queueEnded_{false};
  std::atomic<int> repeat_{0};
  std::mutex lock_;  // guards port_, memoryBase_, repeated_, the setting of decoder_
  int port_ = 0;
  std::string memoryBase_;
  std::vector<std::uint32_t> repeated_;
};

const std::vector<std::string> kSmallSilentPictures = {"--pattern", "ramp",  "--width", "64",        "--height",
                                                       "16",        "--fps", "30",      "--no-audio"};

// Waits for `more` pictures beyond those already seen.
bool MorePictures(const RampSink& sink, int more) {
  const int target = sink.Pictures() + more;
  return pmtest::WaitFor([&] { return sink.Pictures() >= target; }, kArrivalLimit);
}

// One sender of small silent ramp pictures received through a RawHost, five
// pictures in (`started`).
struct RawStream {
  explicit RawStream(const std::string& name) {
    started = sender.Start(folder, name, kSmallSilentPictures) && host.Start() &&
              host.StartSource(Id(sender), &sink) && MorePictures(sink, 5);
    base = host.MemoryBase();
  }
  // The runner ends in order (after a stop_source when `stop`): exit 0, the
  // queue connection ended, nothing of the base left in /dev/shm, every
  // picture intact. Returns the runner's log.
  std::string ExpectOrderlyEnd(bool stop) {
    if (stop) host.Request("pm::tsrc::stop_source", {{"unique_id", Id(sender)}});
    EXPECT_EQ(host.WaitRunner(kExitLimit), std::optional<int>(0)) << folder.ReadRunnerLog();
    EXPECT_TRUE(pmtest::WaitFor([&] { return host.QueueEnded(); }, kExitLimit));
    EXPECT_EQ(SegmentsOf({base}), 0);
    host.Shutdown();
    const std::string log = folder.ReadRunnerLog();
    EXPECT_NE(log.find("pm-runner: done"), std::string::npos) << log;
    EXPECT_EQ(sink.Problems(), std::vector<std::string>{});
    return log;
  }

  Folder folder;
  Sender sender;
  RampSink sink;
  RawHost host{folder};
  bool started = false;
  std::string base;
};

TEST_F(InputFaults, GarbageMessagesMidStreamAreSkippedThenAnOversizeLengthEndsTheRunnerInOrder) {
  RawStream s("Garbage");
  ASSERT_TRUE(s.started) << s.folder.ReadRunnerLog();
  ASSERT_GT(SegmentsOf({s.base}), 0);
  // Texts that are not requests: skipped, the connection stays.
  std::string binary(300, '\0');
  for (std::size_t i = 0; i < binary.size(); ++i) binary[i] = static_cast<char>(i * 37 + 11);
  ASSERT_TRUE(s.host.WriteRaw(RawHost::Frame("this is not json") + RawHost::Frame("") + RawHost::Frame("[1,2,3]") +
                              RawHost::Frame("\"a string\"") + RawHost::Frame("{\"pm::command\":") +
                              RawHost::Frame(binary) + RawHost::Frame("{\"pm::response\":true,\"pm::unique_id\":999999}") +
                              RawHost::Frame("{\"pm::command\":42,\"pm::unique_id\":\"x\"}")));
  // A frame of exactly the largest length is taken in whole.
  const std::string filler = "{\"pm::command\":\"pm::tsrc::no_such\",\"pm::unique_id\":4000000000,\"pad\":\"";
  std::string largest = filler + std::string(pm::ipc::kMaxFrameBytes - filler.size() - 2, 'x') + "\"}";
  ASSERT_EQ(largest.size(), pm::ipc::kMaxFrameBytes);
  ASSERT_TRUE(s.host.WriteRaw(RawHost::Frame(largest)));
  // The connection still carries requests, and the source still runs.
  const auto answer = s.host.Request("pm::tsrc::handle_shot_event", {{"unique_id", Id(s.sender)}, {"event", "X"}});
  ASSERT_TRUE(answer.has_value()) << s.folder.ReadRunnerLog();
  EXPECT_EQ(answer->value("pm::error", ""), "");
  EXPECT_TRUE(MorePictures(s.sink, 10));

  // A length over the limit: the runner drops the connection and, with no
  // other connection left, ends in order, its segments gone.
  ASSERT_TRUE(s.host.WriteRaw(RawHost::Prefix(pm::ipc::kMaxFrameBytes + 1) + "{}"));
  const std::string log = s.ExpectOrderlyEnd(false);
  EXPECT_NE(log.find("message is not JSON, skipped: 'this is not json'"), std::string::npos) << log;
  EXPECT_NE(log.find("message is not a JSON object, skipped"), std::string::npos) << log;
  EXPECT_NE(log.find("frame of 524289 bytes exceeds 524288, closing the connection"), std::string::npos) << log;
}

TEST_F(InputFaults, AHostLeavingInsideAFrameMidStreamEndsTheRunnerInOrder) {
  RawStream s("Cut short");
  ASSERT_TRUE(s.started) << s.folder.ReadRunnerLog();
  ASSERT_TRUE(s.host.WriteRaw(RawHost::Prefix(1000) + "{\"pm::command\":\"pm::tsrc::stop_source\""));
  s.host.CloseRunnerConnection();
  const std::string log = s.ExpectOrderlyEnd(false);
  EXPECT_NE(log.find("connection ended inside a frame"), std::string::npos) << log;
}

TEST_F(InputFaults, UnknownAndRepeatedTokensAreLoggedAndPicturesKeepFlowingIntact) {
  RawStream s("Tokens");
  ASSERT_TRUE(s.started) << s.folder.ReadRunnerLog();
  const auto level = pmtest::LevelOf(s.host.RunnerPid());
  ASSERT_TRUE(level.has_value());

  // Never issued: 0 (no segment has it), far beyond the pool, the top bit,
  // and the queue's wake word, which belongs on the producer's own pair only.
  const std::vector<std::uint32_t> unknown = {0u, 1000000u, 0x7FFFFFFFu, 0x80000000u, 0xFFFFFFFEu, 0xFFFFFFFFu};
  for (int round = 0; round < 3; ++round) {
    ASSERT_TRUE(s.host.WriteTokens(unknown));
    ASSERT_TRUE(MorePictures(s.sink, 3));
  }
  // Returned twice in a row: the second return finds nothing owed. (A second
  // return that came after the segment was sent again would give it up
  // early; the tokens are segment ids, so no producer could tell.)
  s.host.RepeatTokens(3);
  ASSERT_TRUE(pmtest::WaitFor([&] { return s.host.Repeated().size() == 3; }, kArrivalLimit));
  EXPECT_TRUE(MorePictures(s.sink, 10));

  const std::string log = s.folder.ReadRunnerLog();
  for (const char* line : {"Token (0) not found.", "Token (1000000) not found.", "Token (2147483647) not found.",
                           "Token (-2147483648) not found.", "Token (-2) not found.", "Token (-1) not found."}) {
    EXPECT_EQ(Occurrences(log, line), 3u) << line << "\n" << log;
  }
  for (std::uint32_t token : s.host.Repeated()) {
    EXPECT_GE(Occurrences(log, "Token (" + std::to_string(token) + ") not found."), 1u) << token << "\n" << log;
  }
  // Nothing was lost in the runner along the way.
  pmtest::ExpectBackAtLevel(s.host.RunnerPid(), *level, "after the tokens");
  s.ExpectOrderlyEnd(true);
}

TEST_F(InputFaults, ASecondQueueConnectionIsRefusedAndTheFirstKeepsItsPictures) {
  RawStream s("Two readers");
  ASSERT_TRUE(s.started) << s.folder.ReadRunnerLog();
  const auto level = pmtest::LevelOf(s.host.RunnerPid());
  ASSERT_TRUE(level.has_value());

  // The queue's server stopped listening once the first reader came: a
  // second one is refused, or if the system still lets it in, it is never
  // given a record.
  for (int attempt = 0; attempt < 5; ++attempt) {
    std::unique_ptr<pm::ipc::Connection> second = pm::ipc::Connection::Open(s.host.Port());
    if (!second) continue;
    std::uint8_t wire[pm::kQueueWireRecordBytes];
    EXPECT_FALSE(second->ReadFromSocket(wire, sizeof wire, 300)) << "a second reader was given a record";
    second->Close();
  }
  EXPECT_TRUE(MorePictures(s.sink, 10));
  pmtest::ExpectBackAtLevel(s.host.RunnerPid(), *level, "after the refused readers");
  s.ExpectOrderlyEnd(true);
}

}  // namespace
