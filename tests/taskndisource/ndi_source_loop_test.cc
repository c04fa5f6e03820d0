// The receiver loop's state machine, its timing and its reports, with a
// scripted runtime and a clock the test advances: no test waits for real
// seconds.

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "fakes.h"
#include "scripted_ndi.h"
#include "support/log_capture.h"
#include "support/wait.h"
#include "taskndisource/ndi_config.h"
#include "taskndisource/ndi_source.h"

namespace {

using nditest::Entry;
using nditest::VideoCapture;
using TaskNDISource::NDISource;
using TaskNDISource::ReceiverState;

constexpr char kName[] = "STUDIO (Cam 1)";
constexpr char kId[] = "NDICaptureDevice~STUDIO (Cam 1)";
constexpr char kUrl[] = "127.0.0.1:5961";

class LoopTest : public ::testing::Test {
 protected:
  ~LoopTest() override {
    if (source) source->Stop();
  }

  void Make(std::chrono::milliseconds stopTimeout = std::chrono::seconds(5), std::function<void()> onExit = nullptr) {
    source = std::make_shared<NDISource>(callbacks, kId, ndi.Api(), env.Make(stopTimeout, std::move(onExit)));
  }
  // Makes the source and starts its loop.
  void Run() {
    Make();
    source->Start();
  }

  // Waits (real time) until `done` holds.
  static void Until(const std::function<bool()>& done) { ASSERT_TRUE(pmtest::WaitFor(done)); }

  void UntilState(ReceiverState state) {
    Until([&] { return source->State() == state; });
  }

  void UntilStates(std::vector<std::int32_t> states) {
    Until([&] { return callbacks->Seen().states == states; });
  }

  pmtest::LogCapture logs;
  nditest::ScriptedNdi ndi;
  std::shared_ptr<nditest::FakeCallbacks> callbacks = std::make_shared<nditest::FakeCallbacks>();
  nditest::TestEnvironment env;
  std::shared_ptr<NDISource> source;
};

TEST_F(LoopTest, SenderNeverFoundKeepsConnectingAndLogsEvery250Ms) {
  Run();
  for (int attempt = 1; attempt <= 130; ++attempt) {
    ASSERT_EQ(env.clock->AwaitWait(attempt), 250) << attempt;
    ASSERT_EQ(logs.Count("#ndisource: waiting for source to be found\n"), attempt);
    env.clock->AdvanceMs(250);
  }
  ASSERT_EQ(env.clock->AwaitWait(131), 250);
  EXPECT_EQ(source->State(), ReceiverState::Connecting);
  EXPECT_EQ(callbacks->Seen().states, std::vector<std::int32_t>{1});
  EXPECT_TRUE(ndi.Seen().receivers.empty());
  EXPECT_EQ(ndi.Seen().findersCreated, 1);  // one finder for the whole loop
  source->Stop();
  EXPECT_EQ(source->State(), ReceiverState::None);
  EXPECT_EQ(ndi.Seen().findersDestroyed, 1);
  EXPECT_EQ(*env.exits, 0);
}

TEST_F(LoopTest, SenderListedWithoutUrlGoesToErrorAndStays) {
  ndi.SetSources({Entry{kName, ""}});
  Run();
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  EXPECT_TRUE(logs.Contains("#ndisource: source has no url\n"));
  EXPECT_EQ(source->State(), ReceiverState::Error);
  const std::string gui = callbacks->Seen().guis.back();
  EXPECT_NE(gui.find("\"indication\":101"), std::string::npos) << gui;
  EXPECT_NE(gui.find("taskvistafeed_status_error"), std::string::npos) << gui;
  // The sender comes back with a URL: Error is left only by a reconnect.
  ndi.SetSources({Entry{kName, kUrl}});
  env.clock->AdvanceMs(5000);
  ASSERT_EQ(env.clock->AwaitWait(2), 5000);
  EXPECT_EQ(source->State(), ReceiverState::Error);
  EXPECT_TRUE(ndi.Seen().receivers.empty());
  for (std::int32_t state : callbacks->Seen().states) EXPECT_NE(state, 4);
  source->ExecuteCustomActionCommand("taskndisource::reconnect");
  ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  UntilState(ReceiverState::Receiving);
}

TEST_F(LoopTest, FirstOfTwoSendersWithOneNameIsUsed) {
  ndi.SetSources({Entry{"OTHER (x)", "10.0.0.1:1"}, Entry{std::nullopt, "10.0.0.2:1"}, Entry{kName, kUrl},
                  Entry{kName, "10.0.0.3:1"}});
  Run();
  Until([&] { return !ndi.Seen().receivers.empty(); });
  const auto created = ndi.Seen().receivers.at(0);
  EXPECT_EQ(created.name, kName);
  EXPECT_EQ(created.url, kUrl);
  EXPECT_EQ(created.colorFormat, 1);
  EXPECT_EQ(created.bandwidth, 100);
  EXPECT_FALSE(created.allowFields);
}

TEST_F(LoopTest, FailingFinderOrReceiverGoesToError) {
  ndi.FailFinderCreate(true);
  Run();
  UntilState(ReceiverState::Error);
  EXPECT_TRUE(logs.Contains("#ndisource: failed to create NDI finder\n"));
  source->Stop();

  ndi.FailFinderCreate(false);
  ndi.FailReceiverCreate(true);
  ndi.SetSources({Entry{kName, kUrl}});
  source->Start();
  UntilState(ReceiverState::Error);
  EXPECT_TRUE(logs.Contains("#ndisource: failed to create NDI receiver\n"));
}

TEST_F(LoopTest, ConnectedSenderAnnouncedWithTallyAndBothDocumentsThenReceives) {
  ndi.SetSources({Entry{kName, kUrl}});
  ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  Make();
  source->HandleShotEvent("TALLY_LIVE_ON");
  source->Start();
  UntilStates({1, 2});
  const auto sent = ndi.Seen().metadataSent;
  ASSERT_GE(sent.size(), 2u);
  EXPECT_EQ(sent[0],
            "<metadata>\n    <receiver_info name=\"Skyrelay\" vendor=\"Quillfront LLC\" protocol_version=\"1\"/>\n"
            "</metadata>\n");
  EXPECT_EQ(sent[1], "<metadata>\n    <media_settings width=\"1280\" height=\"720\" framerate=\"1\"/>\n</metadata>\n");
  EXPECT_EQ(ndi.Seen().metadataLengths[0], static_cast<int>(sent[0].size()) + 1);
  ASSERT_FALSE(ndi.Seen().tallies.empty());
  EXPECT_TRUE(ndi.Seen().tallies[0].on_program);
  EXPECT_FALSE(ndi.Seen().tallies[0].on_preview);
  // One panel for Connecting, one for Receiving with the media format.
  Until([&] { return callbacks->Seen().guis.size() >= 2; });
  const std::string gui = callbacks->Seen().guis.at(1);
  EXPECT_NE(gui.find("ndi_state_receiving"), std::string::npos) << gui;
  EXPECT_NE(gui.find("16x4 @ 29.97 fps"), std::string::npos) << gui;
  EXPECT_EQ(source->PublishedMediaInfo().videoWidth, 16);
  source->Stop();
  EXPECT_TRUE(ndi.Seen().freesMatched);
  EXPECT_EQ(ndi.Seen().receiversDestroyed, 1);
}

TEST_F(LoopTest, RefusedTallyOrMetadataCountsAsAnAttemptAndRetriesAfter250Ms) {
  ndi.SetSources({Entry{kName, kUrl}});
  ndi.SetTallyResult(false);
  Run();
  ASSERT_EQ(env.clock->AwaitWait(1), 250);
  ndi.SetTallyResult(true);
  ndi.SetMetadataResult(false);
  env.clock->AdvanceMs(250);
  ASSERT_EQ(env.clock->AwaitWait(2), 250);
  EXPECT_EQ(ndi.Seen().captures, 0);
  ndi.SetMetadataResult(true);
  ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  env.clock->AdvanceMs(250);
  UntilState(ReceiverState::Receiving);
}

TEST_F(LoopTest, AfterRetryLimitGoesIdleReportsAtOnceThenPollsEvery5s) {
  ndi.SetSources({Entry{kName, kUrl}});
  ndi.SetConnections(0);
  Run();
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  EXPECT_EQ(ndi.Seen().captures, 120);
  EXPECT_EQ(source->State(), ReceiverState::Idle);
  EXPECT_EQ(callbacks->Seen().states, (std::vector<std::int32_t>{1, 3}));
  const int queries = ndi.Seen().connectionQueries;
  for (int poll = 2; poll <= 4; ++poll) {
    env.clock->AdvanceMs(5000);
    ASSERT_EQ(env.clock->AwaitWait(poll), 5000);
    EXPECT_EQ(ndi.Seen().connectionQueries, queries + poll - 1);
  }
  EXPECT_EQ(ndi.Seen().receivers.size(), 1u);  // the receiver stays in Idle

  // The sender is back: reconnect from Idle, then receive.
  ndi.SetConnections(1);
  ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  env.clock->AdvanceMs(5000);
  UntilStates({1, 3, 1, 2});
  EXPECT_TRUE(logs.Contains("#ndisource: attempting to reconnect from idle state\n"));
  EXPECT_EQ(ndi.Seen().receivers.size(), 1u);
}

TEST_F(LoopTest, SenderSlowToAppearSendsTheLoopToIdleOnceItsReceiverExists) {
  Run();
  ndi.SetConnections(0);
  for (int attempt = 1; attempt <= 120; ++attempt) {
    ASSERT_EQ(env.clock->AwaitWait(attempt), 250);
    if (attempt == 120) ndi.SetSources({Entry{kName, kUrl}});
    env.clock->AdvanceMs(250);
  }
  UntilState(ReceiverState::Idle);
  EXPECT_EQ(ndi.Seen().captures, 0);
}

TEST_F(LoopTest, LostConnectionWhileReceivingGoesIdle) {
  ndi.SetSources({Entry{kName, kUrl}});
  ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  Run();
  UntilStates({1, 2});
  ndi.SetConnections(0);
  UntilStates({1, 2, 3});
  EXPECT_TRUE(logs.Contains("#ndisource: lost connection from receiving state\n"));
  // Media texts are emptied outside Receiving.
  EXPECT_EQ(source->PublishedMediaInfo(), TaskNDISource::MediaInfo{});
}

// The runtime keeps a dead sender's URL listed for a while, and a receiver
// takes whichever sender listens at its URL: when the finder lists the sender
// at another URL than its receiver was made for, the receiver is made again
// for the listed one, while connecting as while receiving. The list is looked
// at every 250 ms; a sender missing from it for a moment keeps its receiver.
struct ListedCase {
  const char* what;
  bool receiving;                // else still connecting, with a receiver
  std::vector<Entry> listed;     // the list from then on
  const char* madeAgainFor;      // null: the receiver stays
  std::vector<std::int32_t> states;
};
void PrintTo(const ListedCase& c, std::ostream* os) { *os << c.what; }

class ListedUrl : public LoopTest, public ::testing::WithParamInterface<ListedCase> {};

TEST_P(ListedUrl, MakesTheReceiverAgainOnlyForAnotherListedUrl) {
  const ListedCase& c = GetParam();
  ndi.SetSources({Entry{kName, kUrl}});
  if (c.receiving) ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  Run();
  if (c.receiving) UntilStates({1, 2});
  Until([&] { return ndi.Seen().captures >= 3; });
  ndi.SetSources(c.listed);
  const int lists = ndi.Seen().listCalls, captures = ndi.Seen().captures;
  Until([&] { return ndi.Seen().captures >= captures + 20; });
  EXPECT_EQ(ndi.Seen().listCalls, lists) << "not looked at before 250 ms have passed";
  env.clock->AdvanceMs(250);
  if (c.madeAgainFor != nullptr) {
    ASSERT_TRUE(pmtest::WaitFor([&] { return ndi.Seen().receivers.size() == 2; }));
    EXPECT_EQ(ndi.Seen().receivers[1].url, c.madeAgainFor);
    EXPECT_EQ(ndi.Seen().receiversDestroyed, 1);
    ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  } else {
    Until([&] { return ndi.Seen().captures >= captures + 40; });
    EXPECT_EQ(ndi.Seen().receivers.size(), 1u);
  }
  UntilStates(c.states);
  EXPECT_EQ(logs.Count(std::string("#ndisource: source listed at a new url (") +
                       (c.madeAgainFor ? c.madeAgainFor : "") + "): making its receiver again\n"),
            c.madeAgainFor ? 1 : 0);
}

INSTANTIATE_TEST_SUITE_P(
    LoopTest, ListedUrl,
    ::testing::Values(ListedCase{"moved_while_receiving", true, {Entry{kName, "10.0.0.9:2"}}, "10.0.0.9:2", {1, 2, 1, 2}},
                      ListedCase{"moved_while_connecting", false, {Entry{kName, "10.0.0.9:2"}}, "10.0.0.9:2", {1, 2}},
                      ListedCase{"missing_from_the_list", true, {}, nullptr, {1, 2}},
                      ListedCase{"listed_without_url", true, {Entry{kName, ""}}, nullptr, {1, 2}},
                      ListedCase{"still_first_at_its_url", true,
                                 {Entry{kName, kUrl}, Entry{kName, "10.0.0.9:2"}}, nullptr, {1, 2}}),
    [](const ::testing::TestParamInfo<ListedCase>& info) { return std::string(info.param.what); });

TEST_F(LoopTest, StopEndsAWaitingLoopAtOnceAndReleasesEverything) {
  ndi.SetSources({Entry{kName, kUrl}});
  ndi.SetConnections(0);
  Run();
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);  // Idle, waiting for the next poll
  source->Stop();
  EXPECT_EQ(*env.exits, 0);
  EXPECT_EQ(source->State(), ReceiverState::None);
  EXPECT_EQ(ndi.Seen().receiversDestroyed, 1);
  EXPECT_EQ(ndi.Seen().findersDestroyed, 1);
  // Stop and Stop again, or Stop without Start, only leave state 0.
  source->Stop();
  NDISource never(callbacks, kId, ndi.Api(), env.Make());
  never.Stop();
  EXPECT_EQ(never.State(), ReceiverState::None);
}

TEST_F(LoopTest, LoopStuckPastTheStopDeadlineEndsTheProcess) {
  ndi.SetSources({Entry{kName, kUrl}});
  ndi.BlockCapture(true);
  Make(std::chrono::milliseconds(20), [this] { ndi.BlockCapture(false); });
  source->Start();
  Until([&] { return ndi.Seen().captures >= 1; });
  source->Stop();
  EXPECT_EQ(*env.exits, 1);
  EXPECT_TRUE(logs.Contains("#ndisource: failed to exit receiver loop\n"));
}

TEST_F(LoopTest, StartedSourceRestartsOnReconnectAndConfiguration) {
  ndi.SetSources({Entry{kName, kUrl}});
  Make();
  source->ExecuteCustomActionCommand("taskndisource::reconnect");
  source->SetConfiguration(R"({"bandwidth":"ndi_bandwidth_audio_only"})");
  source->ExecuteCustomActionCommand("something else");
  EXPECT_FALSE(source->Started());
  EXPECT_EQ(source->Bandwidth(), 10u);
  EXPECT_EQ(ndi.Seen().findersCreated, 0);

  source->Start();
  Until([&] { return ndi.Seen().receivers.size() == 1; });
  EXPECT_EQ(ndi.Seen().receivers[0].bandwidth, 10);
  source->SetConfiguration(R"({"bandwidth":"ndi_bandwidth_lowest"})");
  Until([&] { return ndi.Seen().receivers.size() == 2; });
  EXPECT_EQ(ndi.Seen().receivers[1].bandwidth, 0);
  EXPECT_EQ(ndi.Seen().receiversDestroyed, 1);
  source->ExecuteCustomActionCommand("taskndisource::reconnect");
  Until([&] { return ndi.Seen().receivers.size() == 3; });
  EXPECT_EQ(ndi.Seen().receivers[2].bandwidth, 0);
}

TEST_F(LoopTest, ConcurrentReconnectsNeverRunTwoLoops) {
  ndi.SetSources({Entry{kName, kUrl}});
  Run();
  std::vector<std::thread> threads;
  for (int t = 0; t < 3; ++t) {
    threads.emplace_back([this, t] {
      for (int i = 0; i < 20; ++i) {
        if (t == 0) {
          source->ExecuteCustomActionCommand("taskndisource::reconnect");
        } else if (t == 1) {
          source->SetConfiguration(i % 2 ? R"({"bandwidth":"ndi_bandwidth_lowest"})" : "{}");
        } else {
          source->Start();  // a start over a running loop is refused
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();
  Until([&] { return ndi.Seen().findersCreated - ndi.Seen().findersDestroyed == 1; });
  EXPECT_EQ(ndi.Seen().maxLiveFinders, 1);
  source->Stop();
  EXPECT_EQ(ndi.Seen().findersCreated, ndi.Seen().findersDestroyed);
  EXPECT_EQ(*env.exits, 0);
}

TEST_F(LoopTest, SourceReleasedWhileRunningStopsItsLoop) {
  ndi.SetSources({Entry{kName, kUrl}});
  Run();
  Until([&] { return ndi.Seen().captures > 0; });
  source.reset();
  EXPECT_EQ(ndi.Seen().findersCreated, ndi.Seen().findersDestroyed);
}

TEST_F(LoopTest, ShortUniqueIdLooksForAnEmptyNameWithoutFailing) {
  source = std::make_shared<NDISource>(callbacks, "short", ndi.Api(), env.Make());
  source->Start();
  ASSERT_EQ(env.clock->AwaitWait(1), 250);
  EXPECT_TRUE(logs.Contains("#ndisource: waiting for source to be found\n"));
}

TEST_F(LoopTest, LoopWithoutCallbacksRunsAndIdlesWithoutSpinning) {
  ndi.SetSources({Entry{kName, kUrl}});
  ndi.SetConnections(0);
  source = std::make_shared<NDISource>(nullptr, kId, ndi.Api(), env.Make());
  source->Start();
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  EXPECT_EQ(source->State(), ReceiverState::Idle);
}

}  // namespace
