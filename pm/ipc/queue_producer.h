#pragma once
// Queue producer: sends fixed-size records, each tagged with a 32-bit token,
// to every connected reader, and keeps account of which reader still owes
// which token. A reader returns a token (4 bytes, little-endian) when it has
// finished with what the record points at; once every reader that received a
// token has returned it, the release callback runs with the token.
//
// Wire (see pm/ipc/connection.h): record = token (4 bytes LE) + exactly
// recordSize bytes, one gather write per reader; token return = 4 bytes; the
// wake word FF FF FF FF travels only on the private loopback pair that lets
// other threads wake the producer thread.
//
// A reader whose peer has gone (its read reports end of stream or a reset, or
// the Connection was closed) is dropped from the readers the first time the
// producer thread finds it so, and every token it still owed is given up:
// tokens that nobody else owes are released, in ascending order.
//
// Threads:
//   - Send, AddConnection, Stop and Wake from any thread.
//   - Start and the destructor from one controlling thread, never from the
//     producer thread or from inside the release callback (they join it).
//   - The producer thread ("pm::Ipc Producer") reads token returns and calls
//     the release callback outside the lock.
//   - The release callback also runs on the calling thread with the
//     producer's lock held: in Send when there is no reader or when the token
//     was given up while Send was writing it (below), and in Stop. It must
//     therefore not call back into the producer. Stop (or destroy) the
//     producer before destroying what the callback uses.
//
// Release and write are exclusive: Send marks its token in flight (under
// lock_) before it writes, and while it is in flight nothing releases it.
// Stop, a reader that goes away and a last return mark an in-flight token
// given up instead; Send, once its writes are done, takes lock_ again and
// releases a token given up meanwhile. So a segment never goes back to its
// pool while a reader is still being told to read it.
//
// Lock order: Producer::lock_, then whatever the release callback takes (the
// shared-memory queue's lock). Records are written to the readers after
// lock_ is let go, under each Connection's own lock (never with lock_ held),
// so a reader that stops reading holds up only the sender that is writing to
// it, never Stop or the token returns. Nothing takes these locks the other
// way round.

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <thread>
#include <vector>

#include "pm/ip/socket.h"
#include "pm/ipc/connection.h"
#include "pm/ipc/server.h"
#include "pm/runtime/semaphore.h"

namespace pm::ipc::queue {

class Producer {
 public:
  using ReleaseCallback = std::function<void(std::uint32_t token)>;

  static constexpr std::int64_t kWaitMs = 250;             // one wait of the thread for returns
  static constexpr std::int64_t kTokenReadTimeoutMs = 50;  // one token read
  static constexpr std::int64_t kDrainReadTimeoutMs = 1;   // discarding stale returns
  static constexpr std::uint32_t kWakeWord = 0xFFFFFFFFu;

  Producer();
  ~Producer();  // stops the thread; pending tokens are dropped without callbacks
  Producer(const Producer&) = delete;
  Producer& operator=(const Producer&) = delete;

  // Stops an earlier run, sets the record size, makes the private wake pair,
  // discards stale bytes on the readers and starts the producer thread.
  // Returns once the thread runs; false (logged) when the wake pair cannot be
  // made, and then no thread runs. Keeps the readers of an earlier run.
  bool Start(std::uint32_t recordSize, ReleaseCallback releaseCallback);
  // Releases every pending token (ascending order, callback under the lock)
  // and ends the thread's loop. Nothing when not running.
  void Stop();
  // Cuts the thread's current wait short.
  void Wake();

  // Adds a reader after discarding its stale bytes. False for a null or an
  // already added Connection.
  bool AddConnection(std::shared_ptr<Connection> connection);
  // Writes token + record to every reader and records that each owes the
  // token. False, writing nothing, when the entries do not add up to the
  // record size exactly or (record size above 0) an entry has no pointer.
  // Without readers the token is released during the call.
  bool Send(std::uint32_t token, const BufferList& record);

  // Diagnostics.
  std::uint64_t LoopPasses() const { return loopPasses_.load(); }
  std::size_t ReaderCount();
  std::size_t PendingCount();

 private:
  // True when the reader's return completed the token (the caller then
  // releases it).
  bool Release(const std::shared_ptr<Connection>& reader, std::uint32_t token);
  // Drops a reader that has gone; returns the tokens nobody owes any more
  // (those in flight are left to their Send).
  std::vector<std::uint32_t> DropReader(const std::shared_ptr<Connection>& reader);
  // A token nobody owes any more: true when it may be released now, false
  // when a Send is still writing it (that Send then releases it). lock_ held.
  bool GiveUpLocked(std::uint32_t token);
  void WakeLocked();
  void ThreadMain(const std::weak_ptr<Semaphore>& started);

  ReleaseCallback releaseCallback_;  // written under lock_ only while no thread runs
  std::mutex lock_;                  // guards every field below except running_ and loopPasses_
  std::vector<std::shared_ptr<Connection>> connections_;                         // readers, in the order added
  std::map<std::uint32_t, std::set<std::shared_ptr<Connection>>> pending_;  // token -> readers owing it
  struct InFlight {
    int writers = 0;       // Send calls writing the token's record
    bool givenUp = false;  // nobody owes it any more: the last writer releases it
  };
  std::map<std::uint32_t, InFlight> inFlight_;  // tokens whose records are being written
  std::uint32_t recordSize_ = 0;
  std::shared_ptr<Server> wakeServer_;
  std::shared_ptr<Connection> wakeWriter_;  // other threads write the wake word here
  std::shared_ptr<Connection> wakeReader_;  // the thread waits on this end

  std::thread thread_;  // touched by Start and the destructor only
  std::atomic<bool> running_{false};
  std::atomic<std::uint64_t> loopPasses_{0};
};

}  // namespace pm::ipc::queue
