#include "pm/ipc/dispatcher.h"

#include <exception>
#include <vector>

#include "pm/ip/socket.h"
#include "pm/ipc/connection.h"
#include "pm/ipc/framing.h"
#include "pm/runtime/clock.h"
#include "pm/runtime/json.h"
#include "pm/runtime/log.h"
#include "pm/runtime/perf.h"
#include "pm/runtime/thread_name.h"

namespace pm {
namespace {

using Json = nlohmann::json;

// Log lines quote at most this much of a bad message.
constexpr int kQuoteBytes = 200;

// now + timeoutMs in nanoseconds, saturating instead of overflowing; a
// negative timeout counts as 0.
std::int64_t DeadlineAfter(std::int64_t now, std::int64_t timeoutMs) {
  if (timeoutMs < 0) timeoutMs = 0;
  std::int64_t nanos = 0;
  std::int64_t deadline = 0;
  if (__builtin_mul_overflow(timeoutMs, std::int64_t{1'000'000}, &nanos) ||
      __builtin_add_overflow(now, nanos, &deadline) || deadline >= RpcDispatcher::kNoDeadline) {
    return RpcDispatcher::kNoDeadline - 1;
  }
  return deadline;
}

// A scalar envelope value may be echoed back; structured ones are not (a
// deeply nested value would cost deep recursion to copy and print).
bool IsScalar(const Json* value) { return value != nullptr && !value->is_structured(); }

const Json* Field(const Json& object, const char* key) {
  auto it = object.find(key);
  return it == object.end() ? nullptr : &*it;
}

}  // namespace

RpcDispatcher::RpcDispatcher(std::shared_ptr<ipc::Connection> connection, std::shared_ptr<Clock> clock)
    : connection_(std::move(connection)),
      clock_(clock ? std::move(clock) : MakeSteadyClock()),
      epoch_(clock_->NowNs()) {}

RpcDispatcher::~RpcDispatcher() {
  Stop();
  std::thread expiry;
  std::thread receive;
  {
    std::lock_guard<std::mutex> guard(threadLock_);
    expiry = std::move(expiryThread_);
    receive = std::move(receiveThread_);
  }
  // Destroying the dispatcher on one of its own threads is a caller error;
  // std::thread then ends the process rather than leaving a thread behind.
  if (expiry.joinable() && expiry.get_id() != std::this_thread::get_id()) expiry.join();
  if (receive.joinable() && receive.get_id() != std::this_thread::get_id()) receive.join();
}

void RpcDispatcher::Start(std::function<void()> onEnded) {
  bool endNow = false;
  {
    std::lock_guard<std::mutex> guard(threadLock_);
    if (started_) return;
    started_ = true;
    bool run = false;
    {
      // Checked under the running lock, where Stop clears running_, so that
      // a concurrent Stop either sees the threads or keeps them from starting.
      std::lock_guard<std::mutex> running(runningLock_);
      run = !stopRequested_.load();
      running_.store(run);
    }
    if (run) expiryThread_ = std::thread([this] { ExpiryLoop(); });
    if (run && connection_) {
      onEnded_ = std::move(onEnded);
      receiveThread_ = std::thread([this] { ReceiveLoop(); });
    } else {
      endNow = true;
    }
  }
  if (endNow) {
    ended_.store(true);
    if (onEnded) onEnded();
  }
}

void RpcDispatcher::RegisterHandler(std::string name, RpcHandler handler) {
  std::lock_guard<std::mutex> guard(handlerLock_);
  handlers_[std::move(name)] = std::move(handler);
}

bool RpcDispatcher::RpcRequest(std::string command, Json& payload, std::int64_t timeoutMs,
                               RpcCallback callback) {
  static PerformanceLog requestLog("RpcRequest", 20000);
  static PerformanceLog lockLog("RequsetLock", 200000);
  PerformanceScope requestScope(requestLog);

  if (!payload.is_object() && !payload.is_null()) {
    Log(LogType::Normal, "", "RpcDispatcher::RpcRequest: payload of '%s' is not an object\n",
        command.c_str());
    return false;
  }
  const std::uint64_t id = nextRequestId_.fetch_add(1);
  payload["pm::unique_id"] = id;
  payload["pm::command"] = command;
  payload["pm::request"] = true;
  auto text = std::make_shared<const std::string>(pmjson::Dump(payload));

  PerformanceScope lockScope(lockLog);
  bool earlier = false;
  {
    std::lock_guard<std::mutex> guard(pendingLock_);
    const std::int64_t deadline = DeadlineAfter(clock_->NowNs(), timeoutMs);
    auto [it, inserted] = pending_.try_emplace(id);
    if (!inserted) deadlineIndex_.erase({it->second.deadline, id});
    it->second.text = text;
    it->second.deadline = deadline;
    it->second.callback = std::move(callback);
    deadlineIndex_.insert({deadline, id});
    if (deadline - epoch_ < earliestDeadline_.load()) {
      earliestDeadline_.store(deadline - epoch_);
      wakeFlag_.store(true);
      earlier = true;
    }
  }
  if (earlier) {
    // A signal is kept until the expiry thread waits, so it cannot fall
    // between that thread's look at the earliest deadline and its wait.
    wakeSignals_.fetch_add(1);
    clock_->Signal();
  }
  lockScope.Stop();

  const bool sent = connection_ && ipc::Connection::SendMessage(connection_, *text);
  requestScope.Stop();
  return sent;
}

void RpcDispatcher::Stop() {
  if (stopRequested_.exchange(true)) return;
  clock_->Sleep(kStopGraceNs);
  const std::thread::id self = std::this_thread::get_id();

  if (connection_) connection_->Close();
  {
    std::lock_guard<std::mutex> running(runningLock_);
    running_.store(false);
  }
  clock_->Signal();
  std::thread expiry;
  std::thread receive;
  {
    std::lock_guard<std::mutex> guard(threadLock_);
    if (expiryThread_.get_id() != self) expiry = std::move(expiryThread_);
    if (receiveThread_.get_id() != self) receive = std::move(receiveThread_);
  }
  if (expiry.joinable()) expiry.join();
  if (receive.joinable()) receive.join();
}

std::size_t RpcDispatcher::PendingCount() const {
  std::lock_guard<std::mutex> guard(pendingLock_);
  return pending_.size();
}

std::int64_t RpcDispatcher::EarliestDeadlineNs() const {
  const std::int64_t relative = earliestDeadline_.load();
  return relative == kNoDeadline ? kNoDeadline : epoch_ + relative;
}

void RpcDispatcher::ExpiryLoop() {
  SetThreadName("pm::Rpc Expiry");
  while (running_.load()) {
    wakeFlag_.store(false);
    const std::int64_t now = clock_->NowNs();
    const std::int64_t earliest = EarliestDeadlineNs();
    if (earliest <= now) {
      ExpireDue(now);
      continue;
    }
    clock_->WaitUntil(earliest);
  }
  ClearThreadName();
}

void RpcDispatcher::ExpireDue(std::int64_t now) {
  std::vector<std::pair<std::uint64_t, PendingRequest>> expired;
  {
    std::lock_guard<std::mutex> guard(pendingLock_);
    while (!deadlineIndex_.empty() && deadlineIndex_.begin()->first <= now) {
      const std::uint64_t id = deadlineIndex_.begin()->second;
      deadlineIndex_.erase(deadlineIndex_.begin());
      auto it = pending_.find(id);
      if (it == pending_.end()) continue;
      expired.emplace_back(id, std::move(it->second));
      pending_.erase(it);
    }
    earliestDeadline_.store(deadlineIndex_.empty() ? kNoDeadline
                                                   : deadlineIndex_.begin()->first - epoch_);
  }
  for (auto& [id, request] : expired) {
    if (!request.callback) continue;
    Json reply = Json::object();
    reply["pm::unique_id"] = id;
    const Json sent = Json::parse(*request.text, nullptr, false);
    if (sent.is_object()) {
      if (const Json* command = Field(sent, "pm::command"); IsScalar(command)) {
        reply["pm::command"] = *command;
      }
    }
    reply["pm::response"] = true;
    reply["pm::error"] = "timeout";
    try {
      request.callback(reply);
    } catch (const std::exception& e) {
      Log(LogType::Normal, "", "RpcDispatcher: callback of request %llu threw: %s\n",
          static_cast<unsigned long long>(id), e.what());
    } catch (...) {
      Log(LogType::Normal, "", "RpcDispatcher: callback of request %llu threw\n",
          static_cast<unsigned long long>(id));
    }
  }
}

void RpcDispatcher::ReceiveLoop() {
  SetThreadName("pm::Rpc Receive");
  ipc::FrameReader reader;
  std::string text;
  for (;;) {
    const std::size_t wanted = reader.Wanted();
    if (!connection_->ReadFromSocket(reader.WritePointer(), wanted, ip::kNoTimeout)) {
      if (reader.MidFrame() && !stopRequested_.load()) {
        Log(LogType::Normal, "", "RpcDispatcher: connection ended inside a frame\n");
      }
      break;
    }
    reader.Commit(wanted);
    if (reader.Oversize()) {
      Log(LogType::Normal, "",
          "RpcDispatcher: frame of %u bytes exceeds %u, closing the connection\n",
          static_cast<unsigned>(reader.OversizeLength()),
          static_cast<unsigned>(ipc::kMaxFrameBytes));
      break;
    }
    while (reader.Next(&text)) HandleMessage(text);
  }
  FinishReceiving();
  ClearThreadName();
}

void RpcDispatcher::FinishReceiving() {
  connection_->Close();
  std::function<void()> onEnded;
  {
    std::lock_guard<std::mutex> guard(threadLock_);
    onEnded = std::move(onEnded_);
    onEnded_ = nullptr;
  }
  ended_.store(true);
  if (onEnded) onEnded();
}

void RpcDispatcher::HandleMessage(const std::string& text) {
  // A message nested too deep is refused before any value is built: copying
  // or printing it would recurse once per level, past the end of the stack.
  bool tooDeep = false;
  const Json message = pmjson::ParseUntrusted(text, &tooDeep);
  if (tooDeep) {
    Log(LogType::Normal, "", "RpcDispatcher: message nests deeper than %zu levels, skipped: '%.*s'\n",
        pmjson::kMaxNestingDepth, kQuoteBytes, text.c_str());
    return;
  }
  if (message.is_discarded()) {
    Log(LogType::Normal, "", "RpcDispatcher: message is not JSON, skipped: '%.*s'\n", kQuoteBytes,
        text.c_str());
    return;
  }
  if (!message.is_object()) {
    Log(LogType::Normal, "", "RpcDispatcher: message is not a JSON object, skipped: '%.*s'\n",
        kQuoteBytes, text.c_str());
    return;
  }
  const Json* response = Field(message, "pm::response");
  if (response != nullptr && response->is_boolean() && response->get<bool>()) {
    HandleReply(message);
  } else {
    HandleRequest(message);
  }
}

void RpcDispatcher::HandleReply(const Json& message) {
  const Json* idField = Field(message, "pm::unique_id");
  if (idField == nullptr || !(idField->is_number_unsigned() ||
                              (idField->is_number_integer() && idField->get<std::int64_t>() >= 0))) {
    Log(LogType::Normal, "", "RpcDispatcher: reply without a request id, skipped\n");
    return;
  }
  const std::uint64_t id = idField->get<std::uint64_t>();
  RpcCallback callback;
  bool found = false;
  {
    std::lock_guard<std::mutex> guard(pendingLock_);
    auto it = pending_.find(id);
    if (it != pending_.end()) {
      found = true;
      callback = std::move(it->second.callback);
      deadlineIndex_.erase({it->second.deadline, id});
      pending_.erase(it);
    }
  }
  if (!found) {
    Log(LogType::Normal, "", "RpcDispatcher: reply to unknown request %llu, skipped\n",
        static_cast<unsigned long long>(id));
    return;
  }
  if (!callback) return;
  try {
    callback(message);
  } catch (const std::exception& e) {
    Log(LogType::Normal, "", "RpcDispatcher: callback of request %llu threw: %s\n",
        static_cast<unsigned long long>(id), e.what());
  } catch (...) {
    Log(LogType::Normal, "", "RpcDispatcher: callback of request %llu threw\n",
        static_cast<unsigned long long>(id));
  }
}

void RpcDispatcher::HandleRequest(const Json& message) {
  const Json* commandField = Field(message, "pm::command");
  const std::string command =
      commandField != nullptr && commandField->is_string() ? commandField->get<std::string>() : "";
  RpcHandler handler;
  {
    std::lock_guard<std::mutex> guard(handlerLock_);
    auto it = handlers_.find(command);
    if (it != handlers_.end()) handler = it->second;
  }

  Json response = Json::object();
  if (!handler) {
    Log(LogType::Normal, "", "RpcDispatcher: unknown command '%.*s'\n", kQuoteBytes,
        command.c_str());
    response["pm::error"] = "unknown command";
  } else {
    try {
      handler(message, response);
      if (!response.is_object()) {
        Log(LogType::Normal, "", "RpcDispatcher: handler '%s' left a response that is not an object\n",
            command.c_str());
        response = Json::object();
        response["pm::error"] = "response is not an object";
      }
    } catch (const std::exception& e) {
      Log(LogType::Normal, "", "RpcDispatcher: handler '%s' threw: %s\n", command.c_str(), e.what());
      response = Json::object();
      response["pm::error"] = e.what();
    } catch (...) {
      Log(LogType::Normal, "", "RpcDispatcher: handler '%s' threw\n", command.c_str());
      response = Json::object();
      response["pm::error"] = "unknown exception";
    }
  }

  const Json* idField = Field(message, "pm::unique_id");
  if (IsScalar(idField)) response["pm::unique_id"] = *idField;
  if (IsScalar(commandField)) response["pm::command"] = *commandField;
  response["pm::response"] = true;
  std::string text = pmjson::Dump(response);
  if (text.size() > ipc::kMaxFrameBytes) {
    Log(LogType::Normal, "", "RpcDispatcher: reply to '%s' is %zu bytes, too long to send\n",
        command.c_str(), text.size());
    Json error = Json::object();
    if (IsScalar(idField)) error["pm::unique_id"] = *idField;
    if (IsScalar(commandField)) error["pm::command"] = *commandField;
    error["pm::response"] = true;
    error["pm::error"] = "reply too long";
    text = pmjson::Dump(error);
  }
  ipc::Connection::SendMessage(connection_, text);
}

}  // namespace pm
