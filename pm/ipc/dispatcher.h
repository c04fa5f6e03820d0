#pragma once
// pm::RpcDispatcher drives one IPC connection between the task process and the
// host: a table of named request handlers, outgoing requests and
// notifications (RpcRequest) with a deadline each, and the receiving side
// that reads message frames, runs handlers and matches replies to the
// requests that are still pending.
//
// Messages are JSON objects sent as message frames (pm/ipc/framing.h
// gives the wire format). Envelope keys:
//   request / notification: "pm::unique_id" (unsigned), "pm::command"
//     (string), "pm::request": true, plus the command's own keys;
//   reply: the handler's response plus "pm::unique_id" and "pm::command" of
//     the request and "pm::response": true; "pm::error" (string) when the
//     command is unknown ("unknown command") or the handler threw (the
//     exception's text).
//
// Threads:
//   - the receive thread ("pm::Rpc Receive") reads frames and runs handlers
//     and the callbacks of answered requests;
//   - the expiry thread ("pm::Rpc Expiry") removes pending requests whose
//     deadline passed and runs their callbacks with a "timeout" error; it
//     waits on the dispatcher's clock (pm/runtime/clock.h) until the earliest
//     deadline, and RpcRequest (for an earlier deadline) and Stop signal it;
//   - RegisterHandler, RpcRequest and Stop may be called from any thread,
//     including from a handler or a callback (Stop never joins the thread it
//     runs on; that thread ends by itself once its handler returns).
//   Stop before destroy; destroy on a thread other than the dispatcher's own.
//
// Locks (none is held while a handler, a callback, the log, a send or the
// clock runs; none is held while another is taken, except in the order
// threadLock_ -> runningLock_ in Start):
//   handlerLock_  guards handlers_
//   pendingLock_  guards pending_, deadlineIndex_ and updates of earliestDeadline_
//   runningLock_  guards the writes of running_ (Start sets it, Stop clears it)
//   threadLock_   guards the thread handles and onEnded_

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <utility>

#include <nlohmann/json.hpp>

#include "pm/runtime/clock.h"

namespace pm {

namespace ipc {
class Connection;
}  // namespace ipc

// A command handler: reads the request, writes its results into the response
// (a fresh JSON object). Runs on the receive thread. A thrown exception
// becomes the reply's "pm::error".
using RpcHandler = std::function<void(const nlohmann::json& request, nlohmann::json& response)>;

// What runs when a request completes: on the receive thread with the reply,
// or on the expiry thread with {"pm::unique_id", "pm::command",
// "pm::response": true, "pm::error": "timeout"} when no reply came in time.
using RpcCallback = std::function<void(const nlohmann::json& reply)>;

class RpcDispatcher {
 public:
  static constexpr std::int64_t kNoDeadline = Clock::kNoDeadline;
  // Stop waits this long before closing the connection, so that replies that
  // are being written still leave.
  static constexpr std::int64_t kStopGraceNs = 50'000'000;
  static constexpr std::uint64_t kFirstRequestId = 1;

  // `connection` may be null (nothing is sent or received then). `clock` is
  // the dispatcher's own (its expiry thread waits on it; Stop's grace period
  // is slept on it); without one it makes a steady clock. Tests pass a clock
  // they move by hand.
  explicit RpcDispatcher(std::shared_ptr<ipc::Connection> connection, std::shared_ptr<Clock> clock = nullptr);
  // Stops (see Stop) and joins what is left.
  ~RpcDispatcher();
  RpcDispatcher(const RpcDispatcher&) = delete;
  RpcDispatcher& operator=(const RpcDispatcher&) = delete;

  // Starts the expiry and receive threads, once. `onEnded` runs once when the
  // receiving side has finished (peer closed, bad frame, read error or Stop):
  // on the receive thread after the connection is closed, or at once on the
  // caller when the dispatcher was stopped before it started or has no
  // connection (then only the expiry thread runs). It must not destroy the
  // dispatcher.
  void Start(std::function<void()> onEnded = {});

  // Installs `handler` under `name`, replacing an earlier one of that name.
  void RegisterHandler(std::string name, RpcHandler handler);

  // Sends one request or notification: writes the envelope keys into
  // `payload` (overwriting them; they stay there), registers it as pending
  // with deadline now + timeoutMs (a negative timeout counts as 0), and sends
  // it as one frame. True when the connection accepted the frame; a text over
  // ipc::kMaxFrameBytes is not sent (false). The pending entry stays either way
  // until a reply or the deadline removes it. A payload that is neither an
  // object nor null is not sent (false, logged).
  bool RpcRequest(std::string command, nlohmann::json& payload, std::int64_t timeoutMs,
                  RpcCallback callback = {});

  // Closes the connection and ends both threads; idempotent (a second call
  // returns at once). Joins neither thread when called on it.
  void Stop();

  // True once the receiving side has finished (onEnded has run or is running).
  bool Ended() const { return ended_.load(); }

  const std::shared_ptr<ipc::Connection>& GetConnection() const { return connection_; }

  // Diagnostics.
  std::size_t PendingCount() const;
  // The earliest deadline among pending requests on the dispatcher's clock, or
  // kNoDeadline. May be earlier than the real one after a reply removed the
  // earliest request; the expiry thread then catches up.
  std::int64_t EarliestDeadlineNs() const;
  // How many times RpcRequest woke the expiry thread for an earlier deadline.
  std::uint64_t WakeSignals() const { return wakeSignals_.load(); }
  bool WakeFlag() const { return wakeFlag_.load(); }

 private:
  // Hands message texts to HandleMessage without a socket (the fuzz targets).
  friend struct RpcDispatcherTestAccess;

  struct PendingRequest {
    std::shared_ptr<const std::string> text;  // the request as sent
    std::int64_t deadline = 0;                // on the dispatcher's clock
    RpcCallback callback;                     // may be empty
  };

  void ReceiveLoop();
  void ExpiryLoop();
  void HandleMessage(const std::string& text);
  void HandleReply(const nlohmann::json& message);
  void HandleRequest(const nlohmann::json& message);
  // Removes every pending request due at `now` and runs their callbacks.
  void ExpireDue(std::int64_t now);
  void FinishReceiving();

  const std::shared_ptr<ipc::Connection> connection_;
  const std::shared_ptr<Clock> clock_;
  std::atomic<std::uint64_t> nextRequestId_{kFirstRequestId};
  const std::int64_t epoch_;                        // origin of earliestDeadline_
  std::atomic<std::int64_t> earliestDeadline_{kNoDeadline};  // relative to epoch_
  std::mutex handlerLock_;
  std::map<std::string, RpcHandler> handlers_;      // guarded by handlerLock_
  mutable std::mutex pendingLock_;
  std::map<std::uint64_t, PendingRequest> pending_;              // guarded by pendingLock_
  // Every pending request as (deadline, id): equal deadlines stay distinct.
  std::set<std::pair<std::int64_t, std::uint64_t>> deadlineIndex_;  // guarded by pendingLock_
  // Receiving side.
  std::atomic<bool> stopRequested_{false};
  std::atomic<bool> ended_{false};
  std::atomic<std::uint64_t> wakeSignals_{0};
  std::mutex threadLock_;
  bool started_ = false;                 // guarded by threadLock_
  std::function<void()> onEnded_;        // guarded by threadLock_ until the receive thread starts
  std::thread expiryThread_;             // guarded by threadLock_
  std::atomic<bool> running_{false};     // written under runningLock_
  std::thread receiveThread_;            // guarded by threadLock_
  std::mutex runningLock_;
  std::atomic<bool> wakeFlag_{false};    // the earliest deadline moved earlier since the last look
};

}  // namespace pm
