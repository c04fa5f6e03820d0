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

constexpr std::int64_t kMs = 1'000'000;

// A dispatcher on a real loopback connection whose other end the test holds.
class DispatcherTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dispatcher_ = std::make_shared<pm::RpcDispatcher>(pm::ipc::Connection::Open(listener_.Port()), clock_);
    host_ = listener_.Accept();
    ASSERT_TRUE(host_.Valid());
  }

  void StartReceiving() { dispatcher_->Start([this] { endedCalls_.fetch_add(1); }); }
  void RegisterEcho() {
    dispatcher_->RegisterHandler("echo", [](const Json& request, Json& response) {
      response["value"] = request.value("value", Json());
    });
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
  pmtest::LogCapture log_;  // first: outlives the dispatcher's threads
  std::shared_ptr<pmtest::ManualClock> clock_ = std::make_shared<pmtest::ManualClock>();
  pmtest::HostListener listener_;
  pmtest::HostPeer host_;
  std::atomic<int> endedCalls_{0};
  std::mutex repliesMutex_;
  std::vector<Json> replies_;  // guarded by repliesMutex_
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
};

// --- Requests from the task ---------------------------------------------

TEST_F(DispatcherTest, RequestsWithEqualDeadlinesAllExpireWithATimeoutCallback) {
  StartReceiving();
  for (const auto& [command, ms] : {std::pair{"same", 100}, {"same", 100}, {"same", 100}, {"later", 200}}) {
    Json payload;
    dispatcher_->RpcRequest(command, payload, ms, Collect());
  }

  // Just before the deadline nothing goes: once the expiry thread waits on
  // the clock for the earliest deadline, 99 ms later it is still in that wait.
  ASSERT_TRUE(pmtest::WaitFor([&] { return clock_->LastWaitDeadline() == dispatcher_->EarliestDeadlineNs(); }));
  clock_->Advance(99 * kMs);
  EXPECT_EQ(clock_->AwaitWait(clock_->WaitsBegun()), 1);
  EXPECT_EQ(dispatcher_->PendingCount(), 4u);

  clock_->Advance(1 * kMs);
  // The expired requests leave the table before their callbacks run.
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->PendingCount() == 1u && Replies().size() == 3u; }));
  for (Json reply : Replies()) {
    EXPECT_EQ(reply.erase("pm::unique_id"), 1u);
    EXPECT_EQ(reply, (Json{{"pm::error", "timeout"}, {"pm::command", "same"}, {"pm::response", true}}));
  }
  clock_->Advance(100 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return Replies().size() == 4u; }));
  EXPECT_EQ(Replies().back()["pm::command"], "later");
  EXPECT_EQ(dispatcher_->PendingCount(), 0u);
}

// The envelope goes over whatever the caller put in its place, and the
// caller's payload keeps the envelope that went out; ids go up by one. A
// reply completes its request once; the same reply again, one to an id never
// sent, and one without a usable id are logged and skipped.
TEST_F(DispatcherTest, RequestsCarryTheirEnvelopeAndAReplyCompletesThemOnce) {
  StartReceiving();
  Json payload = {{"pm::unique_id", "forged"}, {"pm::command", 5}, {"pm::request", false}, {"q", 1}}, other;
  dispatcher_->RpcRequest("x::start_queue", payload, 100, Collect());
  dispatcher_->RpcRequest("x::other", other, 100);
  const Json sent = host_.ReadJson();
  EXPECT_EQ(sent, payload);
  EXPECT_EQ(sent, pmtest::Request("x::start_queue", sent["pm::unique_id"].get<std::uint64_t>(), {{"q", 1}}));
  EXPECT_EQ(host_.ReadJson()["pm::unique_id"], sent["pm::unique_id"].get<std::uint64_t>() + 1);
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", sent["pm::unique_id"]}, {"port", 7}});
  ASSERT_TRUE(pmtest::WaitFor([&] { return Replies().size() == 1; }));
  EXPECT_EQ(Replies()[0]["port"], 7);
  EXPECT_EQ(dispatcher_->PendingCount(), 1u);

  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", sent["pm::unique_id"]}});
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", 999999}});
  host_.WriteJson({{"pm::response", true}, {"pm::unique_id", "not a number"}});
  ASSERT_TRUE(pmtest::WaitFor(
      [&] { return log_.Count("reply to unknown request") == 2 && log_.Contains("reply without a request id"); }));

  // Its deadline passing later runs nothing more.
  clock_->Advance(1000 * kMs);
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->PendingCount() == 0u; }));
  EXPECT_EQ(Replies().size(), 1u);
  EXPECT_FALSE(dispatcher_->Ended());
}

// --- Requests from the host ---------------------------------------------

// A handler's reply carries the request's id and command; an unknown
// command, a handler that throws (ours or the JSON library's error) or one
// that makes the reply no object gets an error reply alone, and the
// connection stays.
TEST_F(DispatcherTest, HandlerRepliesCarryTheRequestAndFailuresGetAnErrorReply) {
  RegisterEcho();
  dispatcher_->RegisterHandler("boom", [](const Json&, Json& response) {
    response["partial"] = true;
    throw std::runtime_error("no such source");
  });
  dispatcher_->RegisterHandler("strict", [](const Json& request, Json&) { (void)request.at("missing").get<int>(); });
  dispatcher_->RegisterHandler("scalar", [](const Json&, Json& response) { response = 5; });
  StartReceiving();

  EXPECT_EQ(pmtest::Ask(host_, "echo", 41, {{"value", "héllo"}}),
            (Json{{"value", "héllo"}, {"pm::unique_id", 41}, {"pm::command", "echo"}, {"pm::response", true}}));
  const std::pair<const char*, const char*> failures[] = {  // command, error (null: any text)
      {"pm::tsrc::nope", "unknown command"}, {"boom", "no such source"}, {"strict", nullptr}, {"scalar", nullptr}};
  std::uint64_t id = 100;
  for (const auto& [command, text] : failures) {
    SCOPED_TRACE(command);
    const Json error = pmtest::Ask(host_, command, ++id);
    ASSERT_TRUE(error["pm::error"].is_string());
    // The envelope and the error, nothing the handler left.
    EXPECT_EQ(error, (Json{{"pm::unique_id", id}, {"pm::command", command}, {"pm::response", true},
                           {"pm::error", text ? Json(text) : error["pm::error"]}}));
  }
  // A request without a command is an unknown command too.
  EXPECT_TRUE(host_.WriteJson({{"pm::unique_id", 5}}));
  EXPECT_EQ(host_.ReadJson()["pm::error"], "unknown command");
  EXPECT_TRUE(log_.Contains("no such source"));
}

TEST_F(DispatcherTest, TextThatIsNotAJsonObjectIsSkippedAndTheConnectionStays) {
  RegisterEcho();
  StartReceiving();
  for (const char* text : {"not json", "[1,2]", "\"text\"", "null", "", "{\"a\":", "\xff\xfe"}) {
    ASSERT_TRUE(host_.WriteFrame(text));
  }
  // Nesting too deep to copy or print safely is refused before it is parsed
  // and skipped like text that is not JSON, even inside a valid request.
  ASSERT_TRUE(host_.WriteFrame("{\"pm::command\":\"echo\",\"pm::unique_id\":" +
                               std::string(50000, '[') + std::string(50000, ']') + "}"));

  // The first reply the host sees is the one to its valid request.
  EXPECT_EQ(pmtest::Ask(host_, "echo", 7, {{"value", "after"}}),
            (Json{{"value", "after"}, {"pm::unique_id", 7}, {"pm::command", "echo"}, {"pm::response", true}}));
  EXPECT_EQ(log_.Count("is not JSON, skipped"), 4);          // bad text, also the empty one
  EXPECT_EQ(log_.Count("is not a JSON object, skipped"), 3);  // array, string, null
  EXPECT_EQ(log_.Count("message nests deeper than 256 levels, skipped: '{\"pm::command\":\"echo\""), 1);
}

TEST_F(DispatcherTest, RequestOfExactlyTheLimitIsHandled) {
  RegisterEcho();
  StartReceiving();
  Json request = {{"pm::command", "echo"}, {"pm::unique_id", 9}, {"value", ""}};
  request["value"] = std::string(524288 - request.dump().size(), 'v');
  ASSERT_EQ(request.dump().size(), 524288u);
  auto sent = std::async(std::launch::async, [&] { return host_.WriteJson(request); });
  const Json reply = host_.ReadJson();
  EXPECT_TRUE(sent.get());
  // The echo is longer than a frame may be: the host gets an error instead.
  EXPECT_EQ(reply, (Json{{"pm::unique_id", 9}, {"pm::command", "echo"}, {"pm::response", true},
                         {"pm::error", "reply too long"}}));
}

// Every way receiving ends, it ends once: the ended callback runs once, the
// host sees the connection close, no handler runs for a cut frame, a Stop
// from a handler does not join its own thread, a further Stop returns at
// once, and later requests are refused and stay pending until they expire.
enum class Ending { kStop, kStopFromAHandler, kHostLeaves, kHostLeavesInsideAFrame, kOversizeLength };

class DispatcherEnding : public DispatcherTest, public ::testing::WithParamInterface<Ending> {};

TEST_P(DispatcherEnding, EndsReceivingOnce) {
  std::atomic<int> echoes{0};
  std::atomic<bool> handlerReturned{false};
  dispatcher_->RegisterHandler("echo", [&](const Json&, Json&) { echoes.fetch_add(1); });
  dispatcher_->RegisterHandler("stop", [&](const Json&, Json&) {
    dispatcher_->Stop();
    handlerReturned = true;
  });
  StartReceiving();
  const Ending ending = GetParam();
  if (ending == Ending::kStop) dispatcher_->Stop();
  EXPECT_TRUE(ending != Ending::kStopFromAHandler || host_.WriteJson({{"pm::command", "stop"}, {"pm::unique_id", 1}}));
  EXPECT_TRUE(ending != Ending::kHostLeavesInsideAFrame ||
              host_.WriteRaw(pm::ipc::EncodeFrame(R"({"pm::command":"echo","pm::unique_id":1})").substr(0, 14)));
  if (ending == Ending::kHostLeaves || ending == Ending::kHostLeavesInsideAFrame) host_.Close();
  // Only the prefix: a receiver that waited for (or allocated) the body would
  // still be reading.
  EXPECT_TRUE(ending != Ending::kOversizeLength || host_.WriteRaw(pmtest::HostPeer::Prefix(524289)));
  ASSERT_TRUE(pmtest::WaitFor([&] { return dispatcher_->Ended(); }));
  EXPECT_TRUE(pmtest::WaitFor([&] { return handlerReturned.load() == (ending == Ending::kStopFromAHandler); }));
  EXPECT_TRUE(!host_.Valid() || host_.SeesEndOfStream());
  dispatcher_->Stop();
  const int sleeps = clock_->Sleeps();
  EXPECT_LE(sleeps, 1);
  dispatcher_->Stop();
  EXPECT_EQ(clock_->Sleeps(), sleeps);
  EXPECT_EQ(std::make_pair(endedCalls_.load(), echoes.load()), std::make_pair(1, 0));
  EXPECT_EQ(std::make_pair(log_.Contains("connection ended inside a frame"),
                           log_.Contains("frame of 524289 bytes exceeds 524288")),
            std::make_pair(ending == Ending::kHostLeavesInsideAFrame, ending == Ending::kOversizeLength));
  Json payload;
  EXPECT_FALSE(dispatcher_->RpcRequest("late", payload, 100));
  EXPECT_EQ(dispatcher_->PendingCount(), 1u);
  dispatcher_.reset();  // joins the receive thread from here
}

INSTANTIATE_TEST_SUITE_P(Ways, DispatcherEnding,
                         ::testing::Values(Ending::kStop, Ending::kStopFromAHandler, Ending::kHostLeaves,
                                           Ending::kHostLeavesInsideAFrame, Ending::kOversizeLength));

}  // namespace
