// The request dispatcher against a host end made of plain sockets: requests
// and their envelope, the frame size limit, replies to the task's requests,
// handlers and their failures, bad frames, expiry on a clock the test drives,
// and stopping (also from a handler).
#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <future>
#include <memory>
#include <mutex>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"
#include "pm/runtime/json.h"
#include "support/host_socket.h"
#include "support/log_capture.h"
#include "support/manual_clock.h"
#include "support/wait.h"

namespace {

using Json = nlohmann::json;
using namespace std::chrono_literals;

constexpr std::int64_t kMs = 1'000'000;

// A dispatcher on a real loopback connection whose other end the test holds.
class DispatcherTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_GT(listener_.Port(), 0);
    connection_ = pm::ipc::Connection::Open(listener_.Port());
    ASSERT_TRUE(connection_);
    host_ = listener_.Accept();
    ASSERT_TRUE(host_.Valid());
    dispatcher_ = std::make_shared<pm::RpcDispatcher>(connection_, clock_);
  }
  void TearDown() override {
    if (dispatcher_) dispatcher_->Stop();
    dispatcher_.reset();
  }

  void StartReceiving() {
    dispatcher_->Start([this] { endedCalls_.fetch_add(1); });
  }
  void RegisterEcho() {
    dispatcher_->RegisterHandler("echo", [](const Json& request, Json& response) {
      response["value"] = request.value("value", Json());
    });
  }
  // A request as the host sends it; the reply it gets.
  Json Ask(const std::string& command, std::uint64_t id, Json body = Json::object()) {
    body["pm::command"] = command;
    body["pm::unique_id"] = id;
    body["pm::request"] = true;
    EXPECT_TRUE(host_.WriteJson(body));
    return host_.ReadJson();
  }

  pmtest::LogCapture log_;  // first: outlives the dispatcher's threads
  std::shared_ptr<pmtest::ManualClock> clock_ = std::make_shared<pmtest::ManualClock>();
  pmtest::HostListener listener_;
  std::shared_ptr<pm::ipc::Connection> connection_;
  pmtest::HostPeer host_;
  std::atomic<int> endedCalls_{0};
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
};

// --- Requests from the task ---------------------------------------------

TEST_F(DispatcherTest, SuccessiveRequestsCarryIdsOneApartAndOverwriteTheEnvelope) {
  Json first = {{"pm::unique_id", "forged"}, {"pm::command", 5}, {"pm::request", false}, {"arg", 1}};
  Json second = Json::object();
  EXPECT_TRUE(dispatcher_->RpcRequest("pm::tsrc::update_gui", first, 10000));
  EXPECT_TRUE(dispatcher_->RpcRequest("pm::tsrc::update_gui", second, 10000));

  // The caller's payload keeps the envelope that went out.
  EXPECT_TRUE(first["pm::unique_id"].is_number_unsigned());
  EXPECT_EQ(first["pm::command"], "pm::tsrc::update_gui");
  EXPECT_EQ(first["pm::request"], true);
  EXPECT_EQ(first["arg"], 1);

  const Json sentFirst = host_.ReadJson();
  const Json sentSecond = host_.ReadJson();
  ASSERT_TRUE(sentFirst.is_object());
  ASSERT_TRUE(sentSecond.is_object());
  EXPECT_EQ(sentFirst, first);
  EXPECT_EQ(sentSecond["pm::unique_id"].get<std::uint64_t>(),
            sentFirst["pm::unique_id"].get<std::uint64_t>() + 1);
  EXPECT_EQ(dispatcher_->PendingCount(), 2u);
}

TEST_F(DispatcherTest, TextOfExactlyTheLimitIsSentOneByteMoreIsNotButStaysPending) {
  // Envelope overhead of a request with id 1 or 2 and an empty "pad".
  const Json probe = {{"pad", ""}, {"pm::unique_id", 1u}, {"pm::command", "c"}, {"pm::request", true}};
  const std::size_t overhead = pmjson::Dump(probe).size();
  Json atLimit = {{"pad", std::string(524288 - overhead, 'p')}};
  Json overLimit = {{"pad", std::string(524288 - overhead + 1, 'p')}};

  // The host reads while the send is in progress: 512 KiB exceeds what the
  // socket buffers hold.
  auto received = std::async(std::launch::async, [this] { return host_.ReadFrame(); });
  EXPECT_TRUE(dispatcher_->RpcRequest("c", atLimit, 10000));
  const auto text = received.get();
  ASSERT_TRUE(text.has_value());
  EXPECT_EQ(text->size(), 524288u);

  EXPECT_FALSE(dispatcher_->RpcRequest("c", overLimit, 10000));
  EXPECT_EQ(dispatcher_->PendingCount(), 2u);
  EXPECT_FALSE(host_.ReadFrame(100ms).has_value());  // nothing went out
}

TEST_F(DispatcherTest, ZeroTimeoutIsRegisteredAtTheSendTimeAndSent) {
  Json payload = Json::object();
  const std::int64_t now = clock_->NowNs();
  EXPECT_TRUE(dispatcher_->RpcRequest("c", payload, 0));
  EXPECT_EQ(dispatcher_->PendingCount(), 1u);
  EXPECT_EQ(dispatcher_->EarliestDeadlineNs(), now);
  EXPECT_TRUE(host_.ReadJson().is_object());
}

TEST_F(DispatcherTest, OnlyAnEarlierDeadlineWakesTheExpiryThread) {
  const std::int64_t now = clock_->NowNs();
  EXPECT_FALSE(dispatcher_->WakeFlag());
  Json a, b, c;
  dispatcher_->RpcRequest("a", a, 1000);
  EXPECT_TRUE(dispatcher_->WakeFlag());
  EXPECT_EQ(dispatcher_->WakeSignals(), 1u);
  EXPECT_EQ(dispatcher_->EarliestDeadlineNs(), now + 1000 * kMs);

  dispatcher_->RpcRequest("b", b, 5000);  // later: no wake, earliest unchanged
  EXPECT_EQ(dispatcher_->WakeSignals(), 1u);
  EXPECT_EQ(dispatcher_->EarliestDeadlineNs(), now + 1000 * kMs);

  dispatcher_->RpcRequest("c", c, 1000);  // equal: not earlier either
  EXPECT_EQ(dispatcher_->WakeSignals(), 1u);

  Json d;
  dispatcher_->RpcRequest("d", d, 10);
  EXPECT_EQ(dispatcher_->WakeSignals(), 2u);
  EXPECT_EQ(dispatcher_->EarliestDeadlineNs(), now + 10 * kMs);
}

TEST_F(DispatcherTest, RequestsWithEqualDeadlinesAllExpireWithATimeoutCallback) {
  StartReceiving();
  std::mutex mutex;
  std::vector<Json> timeouts;
  auto record = [&](const Json& reply) {
    std::lock_guard<std::mutex> guard(mutex);
    timeouts.push_back(reply);
  };
  for (int i = 0; i < 3; ++i) {
    Json payload;
    dispatcher_->RpcRequest("same", payload, 100, record);
  }
  Json later;
  dispatcher_->RpcRequest("later", later, 200, record);
  EXPECT_EQ(dispatcher_->PendingCount(), 4u);

  // Just before the deadline nothing goes: once the expiry thread waits on
  // the clock for the earliest deadline, 99 ms later it is still in that wait.
  ASSERT_TRUE(pmtest::WaitFor([&] { return clock_->LastWaitDeadline() == dispatcher_->EarliestDeadlineNs(); }));
  clock_->Advance(99 * kMs);
  EXPECT_EQ(clock_->AwaitWait(clock_->WaitsBegun()), 1);
  EXPECT_EQ(dispatcher_->PendingCount(), 4u);

  clock_->Advance(1 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->PendingCount() == 1u; }));
  {
    std::lock_guard<std::mutex> guard(mutex);
    ASSERT_EQ(timeouts.size(), 3u);
    for (const Json& reply : timeouts) {
      EXPECT_EQ(reply["pm::error"], "timeout");
      EXPECT_EQ(reply["pm::command"], "same");
      EXPECT_EQ(reply["pm::response"], true);
    }
  }
  clock_->Advance(100 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->PendingCount() == 0u; }));
  std::lock_guard<std::mutex> guard(mutex);
  EXPECT_EQ(timeouts.size(), 4u);
  EXPECT_EQ(timeouts.back()["pm::command"], "later");
}

TEST_F(DispatcherTest, ReplyCompletesItsPendingRequestOnceAndRunsTheCallback) {
  StartReceiving();
  std::atomic<int> calls{0};
  Json answer;
  std::mutex mutex;
  Json payload = {{"q", 1}};
  dispatcher_->RpcRequest("x::start_queue", payload, 100, [&](const Json& reply) {
    std::lock_guard<std::mutex> guard(mutex);
    answer = reply;
    calls.fetch_add(1);
  });
  Json other;
  dispatcher_->RpcRequest("x::other", other, 100);
  const Json sent = host_.ReadJson();
  ASSERT_TRUE(sent.is_object());
  host_.ReadJson();

  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", sent["pm::unique_id"]}, {"port", 7}});
  ASSERT_TRUE(pmtest::WaitFor([&] { return calls.load() == 1; }));
  EXPECT_EQ(dispatcher_->PendingCount(), 1u);
  {
    std::lock_guard<std::mutex> guard(mutex);
    EXPECT_EQ(answer["port"], 7);
  }

  // The same reply again, and one to an id never sent: logged and skipped.
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", sent["pm::unique_id"]}});
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", 999999}});
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", "not a number"}});
  ASSERT_TRUE(pmtest::WaitFor([&] { return log_.Count("reply to unknown request") == 2; }));
  ASSERT_TRUE(pmtest::WaitFor([&] { return log_.Contains("reply without a request id"); }));

  // Its deadline passing later runs nothing more.
  clock_->Advance(1000 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->PendingCount() == 0u; }));
  EXPECT_EQ(calls.load(), 1);
  EXPECT_FALSE(dispatcher_->Ended());
}

// --- Requests from the host ---------------------------------------------

TEST_F(DispatcherTest, HandlerReplyCarriesTheRequestsIdAndCommand) {
  RegisterEcho();
  StartReceiving();
  const Json reply = Ask("echo", 41, {{"value", "héllo"}});
  ASSERT_TRUE(reply.is_object());
  EXPECT_EQ(reply["value"], "héllo");
  EXPECT_EQ(reply["pm::unique_id"], 41);
  EXPECT_EQ(reply["pm::command"], "echo");
  EXPECT_EQ(reply["pm::response"], true);
  EXPECT_FALSE(reply.contains("pm::request"));
  EXPECT_FALSE(reply.contains("pm::error"));
}

TEST_F(DispatcherTest, SecondRegistrationUnderOneNameReplacesTheFirst) {
  dispatcher_->RegisterHandler("h", [](const Json&, Json& response) { response["which"] = 1; });
  dispatcher_->RegisterHandler("h", [](const Json&, Json& response) { response["which"] = 2; });
  StartReceiving();
  EXPECT_EQ(Ask("h", 1)["which"], 2);
}

TEST_F(DispatcherTest, UnknownCommandAndThrowingHandlerGetAnErrorAndTheConnectionStays) {
  RegisterEcho();
  dispatcher_->RegisterHandler("boom", [](const Json&, Json& response) {
    response["partial"] = true;
    throw std::runtime_error("no such source");
  });
  dispatcher_->RegisterHandler("strict", [](const Json& request, Json&) {
    (void)request.at("missing").get<int>();  // the JSON library's own error
  });
  dispatcher_->RegisterHandler("scalar", [](const Json&, Json& response) { response = 5; });
  StartReceiving();

  const Json unknown = Ask("pm::tsrc::nope", 1);
  EXPECT_EQ(unknown["pm::error"], "unknown command");
  EXPECT_EQ(unknown["pm::unique_id"], 1);
  EXPECT_EQ(unknown["pm::command"], "pm::tsrc::nope");
  EXPECT_EQ(unknown["pm::response"], true);

  const Json thrown = Ask("boom", 2);
  EXPECT_EQ(thrown["pm::error"], "no such source");
  EXPECT_FALSE(thrown.contains("partial"));
  EXPECT_EQ(thrown["pm::unique_id"], 2);

  EXPECT_TRUE(Ask("strict", 3)["pm::error"].is_string());
  EXPECT_TRUE(Ask("scalar", 4)["pm::error"].is_string());
  // A request without a command is an unknown command too.
  EXPECT_TRUE(host_.WriteJson({{"pm::unique_id", 5}}));
  EXPECT_EQ(host_.ReadJson()["pm::error"], "unknown command");

  EXPECT_EQ(Ask("echo", 6, {{"value", 3}})["value"], 3);
  EXPECT_TRUE(log_.Contains("no such source"));
  EXPECT_FALSE(dispatcher_->Ended());
}

TEST_F(DispatcherTest, TextThatIsNotAJsonObjectIsSkippedAndTheConnectionStays) {
  RegisterEcho();
  StartReceiving();
  for (const char* text : {"not json", "[1,2]", "\"text\"", "null", "", "{\"a\":", "\xff\xfe"}) {
    ASSERT_TRUE(host_.WriteFrame(text));
  }
  // Nesting too deep to copy or print safely is refused before it is parsed
  // and skipped like text that is not JSON, even inside a valid request.
  ASSERT_TRUE(host_.WriteFrame(std::string(100000, '[') + std::string(100000, ']')));
  ASSERT_TRUE(host_.WriteFrame("{\"pm::command\":\"echo\",\"pm::unique_id\":" +
                               std::string(50000, '[') + std::string(50000, ']') + "}"));

  // The first reply the host sees is the one to its valid request.
  const Json reply = Ask("echo", 7, {{"value", "after"}});
  EXPECT_EQ(reply["value"], "after");
  EXPECT_EQ(reply["pm::unique_id"], 7);
  EXPECT_EQ(log_.Count("is not JSON, skipped"), 4);          // bad text, also the empty one
  EXPECT_EQ(log_.Count("is not a JSON object, skipped"), 3);  // array, string, null
  EXPECT_EQ(log_.Count("message nests deeper than 256 levels, skipped: '[[["), 1);
  EXPECT_EQ(log_.Count("message nests deeper than 256 levels, skipped: '{\"pm::command\":\"echo\""), 1);
  EXPECT_FALSE(dispatcher_->Ended());
}

TEST_F(DispatcherTest, RequestOfExactlyTheLimitIsHandled) {
  RegisterEcho();
  StartReceiving();
  Json request = {{"pm::command", "echo"}, {"pm::unique_id", 9}, {"value", ""}};
  const std::size_t overhead = request.dump().size();
  request["value"] = std::string(524288 - overhead, 'v');
  ASSERT_EQ(request.dump().size(), 524288u);
  auto sent = std::async(std::launch::async, [&] { return host_.WriteJson(request); });
  const Json reply = host_.ReadJson();
  EXPECT_TRUE(sent.get());
  // The echo is longer than a frame may be: the host gets an error instead.
  EXPECT_EQ(reply["pm::unique_id"], 9);
  EXPECT_EQ(reply["pm::error"], "reply too long");
}

TEST_F(DispatcherTest, OversizeLengthClosesTheConnectionWithoutWaitingForTheBody) {
  StartReceiving();
  // Only the prefix: a receiver that waited for (or allocated) the body would
  // still be reading.
  ASSERT_TRUE(host_.WriteRaw(pmtest::HostPeer::Prefix(524289)));
  EXPECT_TRUE(host_.SeesEndOfStream());
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->Ended(); }));
  EXPECT_EQ(endedCalls_.load(), 1);
  EXPECT_TRUE(log_.Contains("frame of 524289 bytes exceeds 524288"));
  Json payload;
  EXPECT_FALSE(dispatcher_->RpcRequest("c", payload, 100));
}

TEST_F(DispatcherTest, HostLeavingInsideAFrameEndsReceivingWithoutRunningAHandler) {
  std::atomic<int> calls{0};
  dispatcher_->RegisterHandler("echo", [&](const Json&, Json&) { calls.fetch_add(1); });
  StartReceiving();
  const std::string text = R"({"pm::command":"echo","pm::unique_id":1})";
  ASSERT_TRUE(host_.WriteRaw(pmtest::HostPeer::Prefix(static_cast<std::uint32_t>(text.size())) +
                             text.substr(0, 10)));
  host_.Close();
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->Ended(); }));
  EXPECT_EQ(calls.load(), 0);
  EXPECT_EQ(endedCalls_.load(), 1);
  EXPECT_TRUE(log_.Contains("connection ended inside a frame"));
}

// --- Stopping -------------------------------------------------------------

TEST_F(DispatcherTest, StopFromAHandlerEndsWithoutJoiningItsOwnThread) {
  std::atomic<bool> handlerReturned{false};
  dispatcher_->RegisterHandler("stop", [&](const Json&, Json&) {
    dispatcher_->Stop();
    handlerReturned = true;
  });
  StartReceiving();
  ASSERT_TRUE(host_.WriteJson({{"pm::command", "stop"}, {"pm::unique_id", 1}}));
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->Ended(); }));
  EXPECT_TRUE(handlerReturned.load());
  EXPECT_TRUE(host_.SeesEndOfStream());
  EXPECT_EQ(endedCalls_.load(), 1);
  EXPECT_EQ(clock_->Sleeps(), 1);
  dispatcher_.reset();  // joins the receive thread from here
}

TEST_F(DispatcherTest, StopIsIdempotentAndLaterRequestsStayPendingUnsent) {
  StartReceiving();
  dispatcher_->Stop();
  dispatcher_->Stop();
  EXPECT_EQ(clock_->Sleeps(), 1);  // the second call returned at once
  EXPECT_TRUE(dispatcher_->Ended());
  EXPECT_EQ(endedCalls_.load(), 1);
  EXPECT_TRUE(host_.SeesEndOfStream());
  Json payload;
  EXPECT_FALSE(dispatcher_->RpcRequest("late", payload, 100));
  EXPECT_EQ(dispatcher_->PendingCount(), 1u);
}

TEST_F(DispatcherTest, HostClosingEndsReceivingAndStopAfterwardsStillWorks) {
  StartReceiving();
  host_.Close();
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->Ended(); }));
  EXPECT_EQ(endedCalls_.load(), 1);
  EXPECT_FALSE(log_.Contains("inside a frame"));
  dispatcher_->Stop();
  EXPECT_EQ(endedCalls_.load(), 1);
}

TEST(DispatcherLifecycle, StoppedBeforeStartReportsTheEndAtOnce) {
  auto clock = std::make_shared<pmtest::ManualClock>();
  auto dispatcher = std::make_shared<pm::RpcDispatcher>(nullptr, clock);
  dispatcher->Stop();
  int ended = 0;
  dispatcher->Start([&] { ++ended; });
  EXPECT_EQ(ended, 1);
  EXPECT_TRUE(dispatcher->Ended());
  Json payload;
  EXPECT_FALSE(dispatcher->RpcRequest("c", payload, 10));
}

TEST(DispatcherLifecycle, ExpiryRunsWithoutAConnection) {
  auto clock = std::make_shared<pmtest::ManualClock>();
  auto dispatcher = std::make_shared<pm::RpcDispatcher>(nullptr, clock);
  int ended = 0;
  dispatcher->Start([&] { ++ended; });
  EXPECT_EQ(ended, 1);
  std::atomic<int> expired{0};
  Json payload;
  EXPECT_FALSE(dispatcher->RpcRequest("c", payload, 5, [&](const Json&) { expired.fetch_add(1); }));
  clock->Advance(5 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return expired.load() == 1; }));
  dispatcher->Stop();
}

}  // namespace
