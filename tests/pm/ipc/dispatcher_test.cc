// The request dispatcher against a host end made of plain sockets: requests
// and their envelope, the frame size limit, replies to the task's requests,
// handlers and their failures, bad frames, expiry on a clock the test drives,
// and stopping (also from a handler).
#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <vector>

#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"
#include "pm/ipc/framing.h"
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
  // The host leaving ends receiving once, between frames or inside one (the
  // cut frame's handler never runs); a Stop afterwards still works.
  void HostLeavingEndsReceivingOnce(bool insideAFrame) {
    std::atomic<int> calls{0};
    dispatcher_->RegisterHandler("echo", [&](const Json&, Json&) { calls.fetch_add(1); });
    StartReceiving();
    const std::string frame = pm::ipc::EncodeFrame(R"({"pm::command":"echo","pm::unique_id":1})");
    EXPECT_TRUE(!insideAFrame || host_.WriteRaw(frame.substr(0, 14)));
    host_.Close();
    ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->Ended(); }));
    EXPECT_EQ(calls.load(), 0);
    EXPECT_EQ(log_.Contains("connection ended inside a frame"), insideAFrame);
    dispatcher_->Stop();
    EXPECT_EQ(endedCalls_.load(), 1);
  }
  // A request callback that keeps the replies (and timeouts) it is given.
  pm::RpcCallback Collect() {
    return [this](const Json& reply) {
      std::lock_guard<std::mutex> guard(repliesMutex_);
      replies_.push_back(reply);
    };
  }
  std::vector<Json> Replies() {
    std::lock_guard<std::mutex> guard(repliesMutex_);
    return replies_;
  }
  // Stop ends receiving once and closes the connection, also when a handler
  // calls it (it must not join its own thread); a second Stop returns at
  // once; later requests are refused and stay pending until they expire.
  void StopEndsReceivingOnce(bool fromAHandler) {
    std::atomic<bool> handlerReturned{false};
    dispatcher_->RegisterHandler("stop", [&](const Json&, Json&) {
      dispatcher_->Stop();
      handlerReturned = true;
    });
    StartReceiving();
    if (fromAHandler) {
      ASSERT_TRUE(host_.WriteJson({{"pm::command", "stop"}, {"pm::unique_id", 1}}));
    } else {
      dispatcher_->Stop();
    }
    ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->Ended(); }));
    EXPECT_TRUE(pmtest::WaitFor([&] { return handlerReturned.load() == fromAHandler; }));
    dispatcher_->Stop();
    EXPECT_EQ(clock_->Sleeps(), 1);  // the second call returned at once
    EXPECT_EQ(endedCalls_.load(), 1);
    EXPECT_TRUE(host_.SeesEndOfStream());
    Json payload;
    EXPECT_FALSE(dispatcher_->RpcRequest("late", payload, 100));
    EXPECT_EQ(dispatcher_->PendingCount(), 1u);
    dispatcher_.reset();  // joins the receive thread from here
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
  std::mutex repliesMutex_;
  std::vector<Json> replies_;  // guarded by repliesMutex_
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
};

// --- Requests from the task ---------------------------------------------

// The envelope goes over whatever the caller put in its place, and the
// caller's payload keeps the envelope that went out; a request with no time
// at all is still sent.
TEST_F(DispatcherTest, SuccessiveRequestsCarryIdsOneApartAndOverwriteTheEnvelope) {
  Json first = {{"pm::unique_id", "forged"}, {"pm::command", 5}, {"pm::request", false}, {"arg", 1}};
  Json second = Json::object();
  EXPECT_TRUE(dispatcher_->RpcRequest("pm::tsrc::update_gui", first, 10000));
  EXPECT_TRUE(dispatcher_->RpcRequest("pm::tsrc::update_gui", second, 0));
  EXPECT_EQ(dispatcher_->EarliestDeadlineNs(), clock_->NowNs());  // a zero timeout is due at once
  const std::uint64_t id = first["pm::unique_id"].get<std::uint64_t>();
  EXPECT_EQ(first, (Json{{"pm::unique_id", id}, {"pm::command", "pm::tsrc::update_gui"}, {"pm::request", true},
                         {"arg", 1}}));
  EXPECT_EQ(host_.ReadJson(), first);
  EXPECT_EQ(host_.ReadJson()["pm::unique_id"], id + 1);
  EXPECT_EQ(dispatcher_->PendingCount(), 2u);
}

TEST_F(DispatcherTest, RequestsWithEqualDeadlinesAllExpireWithATimeoutCallback) {
  StartReceiving();
  for (const char* command : {"same", "same", "same"}) {
    Json payload;
    dispatcher_->RpcRequest(command, payload, 100, Collect());
  }
  Json later;
  dispatcher_->RpcRequest("later", later, 200, Collect());

  // Just before the deadline nothing goes: once the expiry thread waits on
  // the clock for the earliest deadline, 99 ms later it is still in that wait.
  ASSERT_TRUE(pmtest::WaitFor([&] { return clock_->LastWaitDeadline() == dispatcher_->EarliestDeadlineNs(); }));
  clock_->Advance(99 * kMs);
  EXPECT_EQ(clock_->AwaitWait(clock_->WaitsBegun()), 1);
  EXPECT_EQ(dispatcher_->PendingCount(), 4u);

  clock_->Advance(1 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->PendingCount() == 1u; }));
  const std::vector<Json> timeouts = Replies();
  ASSERT_EQ(timeouts.size(), 3u);
  for (const Json& reply : timeouts) {
    EXPECT_EQ(reply.value("pm::error", ""), "timeout");
    EXPECT_EQ(reply.value("pm::command", ""), "same");
    EXPECT_EQ(reply.value("pm::response", false), true);
  }
  clock_->Advance(100 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return Replies().size() == 4u; }));
  EXPECT_EQ(Replies().back()["pm::command"], "later");
  EXPECT_EQ(dispatcher_->PendingCount(), 0u);
}

// A reply completes its request once; the same reply again, one to an id
// never sent, and one without a usable id are logged and skipped.
TEST_F(DispatcherTest, ReplyCompletesItsPendingRequestOnceAndRunsTheCallback) {
  StartReceiving();
  Json payload = {{"q", 1}}, other;
  dispatcher_->RpcRequest("x::start_queue", payload, 100, Collect());
  dispatcher_->RpcRequest("x::other", other, 100);
  const Json sent = host_.ReadJson();
  host_.ReadJson();
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", sent["pm::unique_id"]}, {"port", 7}});
  ASSERT_TRUE(pmtest::WaitFor([&] { return Replies().size() == 1; }));
  EXPECT_EQ(Replies()[0]["port"], 7);
  EXPECT_EQ(dispatcher_->PendingCount(), 1u);

  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", sent["pm::unique_id"]}});
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", 999999}});
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", "not a number"}});
  ASSERT_TRUE(pmtest::WaitFor([&] { return log_.Count("reply to unknown request") == 2; }));
  ASSERT_TRUE(pmtest::WaitFor([&] { return log_.Contains("reply without a request id"); }));

  // Its deadline passing later runs nothing more.
  clock_->Advance(1000 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->PendingCount() == 0u; }));
  EXPECT_EQ(Replies().size(), 1u);
  EXPECT_FALSE(dispatcher_->Ended());
}

// --- Requests from the host ---------------------------------------------

// A handler's reply carries the request's id and command; the last handler
// registered under a name is the one that runs; an unknown command, a handler
// that throws (ours or the JSON library's error) or one that makes the reply
// no object gets an error reply alone, and the connection stays.
TEST_F(DispatcherTest, HandlerRepliesCarryTheRequestAndFailuresGetAnErrorReply) {
  RegisterEcho();
  dispatcher_->RegisterHandler("h", [](const Json&, Json& response) { response["which"] = 1; });
  dispatcher_->RegisterHandler("h", [](const Json&, Json& response) { response["which"] = 2; });
  dispatcher_->RegisterHandler("boom", [](const Json&, Json& response) {
    response["partial"] = true;
    throw std::runtime_error("no such source");
  });
  dispatcher_->RegisterHandler("strict", [](const Json& request, Json&) { (void)request.at("missing").get<int>(); });
  dispatcher_->RegisterHandler("scalar", [](const Json&, Json& response) { response = 5; });
  StartReceiving();

  const Json reply = Ask("echo", 41, {{"value", "héllo"}});
  EXPECT_EQ(reply, (Json{{"value", "héllo"}, {"pm::unique_id", 41}, {"pm::command", "echo"}, {"pm::response", true}}));
  EXPECT_EQ(Ask("h", 1)["which"], 2);
  struct Failure {
    const char* command;
    const char* error;  // null: any text
  };
  const Failure failures[] = {
      {"pm::tsrc::nope", "unknown command"}, {"boom", "no such source"}, {"strict", nullptr}, {"scalar", nullptr}};
  std::uint64_t id = 100;
  for (const Failure& failure : failures) {
    SCOPED_TRACE(failure.command);
    const Json error = Ask(failure.command, ++id);
    ASSERT_TRUE(error["pm::error"].is_string());
    EXPECT_EQ(error["pm::error"], failure.error ? failure.error : error["pm::error"]);
    EXPECT_EQ(error.size(), 4u);  // the envelope and the error, nothing the handler left
    EXPECT_EQ(error["pm::unique_id"], id);
    EXPECT_EQ(error["pm::command"], failure.command);
    EXPECT_EQ(error["pm::response"], true);
  }
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

TEST_F(DispatcherTest, StopEndsReceivingOnce) { StopEndsReceivingOnce(false); }
TEST_F(DispatcherTest, StopFromAHandlerEndsReceivingWithoutJoiningItsOwnThread) { StopEndsReceivingOnce(true); }
TEST_F(DispatcherTest, HostLeavingBetweenFramesEndsReceivingOnce) { HostLeavingEndsReceivingOnce(false); }
TEST_F(DispatcherTest, HostLeavingInsideAFrameEndsReceivingWithoutRunningItsHandler) {
  HostLeavingEndsReceivingOnce(true);
}

// Without a connection, Start reports the end at once (also after an early
// Stop), requests are refused, and their expiry still runs.
TEST(DispatcherWithoutConnection, ReportsTheEndAtOnceAndStillExpiresRequests) {
  for (const bool stopFirst : {true, false}) {
    SCOPED_TRACE(stopFirst ? "stopped before start" : "started");
    auto clock = std::make_shared<pmtest::ManualClock>();
    auto dispatcher = std::make_shared<pm::RpcDispatcher>(nullptr, clock);
    if (stopFirst) dispatcher->Stop();
    int ended = 0;
    dispatcher->Start([&] { ++ended; });
    EXPECT_EQ(ended, 1);
    EXPECT_TRUE(dispatcher->Ended());
    std::atomic<int> expired{0};
    Json payload;
    EXPECT_FALSE(dispatcher->RpcRequest("c", payload, 5, [&](const Json&) { expired.fetch_add(1); }));
    clock->Advance(5 * kMs);
    EXPECT_TRUE(stopFirst || pmtest::WaitFor([&] { return expired.load() == 1; }));
    dispatcher->Stop();
  }
}

}  // namespace
