#include "pm/ipc/queue_producer.h"

#include <algorithm>

#include "pm/runtime/little_endian.h"
#include "pm/runtime/log.h"
#include "pm/runtime/thread_name.h"

namespace pm::ipc::queue {

namespace {

// Reads and discards 4-byte blocks until none arrives within a millisecond.
void Drain(Connection& connection) {
  std::uint8_t block[4];
  while (connection.ReadFromSocket(block, sizeof block, Producer::kDrainReadTimeoutMs)) {
  }
}

}  // namespace

Producer::Producer() = default;

Producer::~Producer() {
  running_.store(false);
  Wake();
  if (thread_.joinable()) thread_.join();
  // Members go without callbacks: pending tokens are dropped.
}

bool Producer::Start(std::uint32_t recordSize, ReleaseCallback releaseCallback) {
  Stop();
  // Stop woke the earlier thread; it leaves its loop at the next check.
  running_.store(false);
  Wake();
  if (thread_.joinable()) thread_.join();

  std::shared_ptr<Server> server = Server::CreateListening();
  std::shared_ptr<Connection> reader = server ? Connection::Open(server->GetPort()) : nullptr;
  std::shared_ptr<Connection> writer = reader ? server->AcceptConnection(0) : nullptr;
  if (!writer) {
    Log(LogType::Normal, "", "pm::ipc:queue::Producer : Could not make the wake connection pair.\n");
    return false;
  }
  server->Stop();  // the pair is made; nobody else may connect to it

  auto started = std::make_shared<Semaphore>();
  {
    std::lock_guard<std::mutex> hold(lock_);
    wakeServer_ = std::move(server);
    wakeReader_ = std::move(reader);
    wakeWriter_ = std::move(writer);
    recordSize_ = recordSize;
    for (const auto& connection : connections_) Drain(*connection);
    releaseCallback_ = std::move(releaseCallback);
    running_.store(true);
  }
  thread_ = std::thread(&Producer::ThreadMain, this, std::weak_ptr<Semaphore>(started));
  started->Wait();
  return true;
}

void Producer::Stop() {
  std::lock_guard<std::mutex> hold(lock_);
  if (!running_.load()) return;
  running_.store(false);
  auto released = std::move(pending_);
  pending_.clear();
  for (auto& [token, readers] : released) {  // ascending
    readers.clear();
    if (GiveUpLocked(token) && releaseCallback_) releaseCallback_(token);
  }
  WakeLocked();
}

bool Producer::GiveUpLocked(std::uint32_t token) {
  auto writing = inFlight_.find(token);
  if (writing == inFlight_.end()) return true;
  writing->second.givenUp = true;
  return false;
}

void Producer::Wake() {
  std::lock_guard<std::mutex> hold(lock_);
  WakeLocked();
}

void Producer::WakeLocked() {
  if (!wakeWriter_) return;
  static const std::uint8_t kWake[4] = {0xFF, 0xFF, 0xFF, 0xFF};
  wakeWriter_->Send(BufferList{{kWake, 4}});
}

bool Producer::AddConnection(std::shared_ptr<Connection> connection) {
  if (!connection) return false;
  std::lock_guard<std::mutex> hold(lock_);
  if (std::find(connections_.begin(), connections_.end(), connection) != connections_.end()) return false;
  Drain(*connection);
  connections_.push_back(std::move(connection));
  WakeLocked();
  return true;
}

bool Producer::Send(std::uint32_t token, const BufferList& record) {
  std::vector<std::shared_ptr<Connection>> readers;
  {
    std::lock_guard<std::mutex> hold(lock_);
    std::uint64_t total = 0;  // 64-bit: lengths that wrap round 32 bits must not pass
    for (const auto& [pointer, length] : record) {
      if (recordSize_ >= 1 && pointer == nullptr) return false;
      total += length;
    }
    if (total != recordSize_) return false;

    if (connections_.empty()) {
      if (releaseCallback_) releaseCallback_(token);
      return true;
    }
    // Every reader owes the token before its record can reach it, so that a
    // quick return always finds it pending.
    auto& owing = pending_[token];
    for (const auto& connection : connections_) owing.insert(connection);
    readers = connections_;
    // Until its writes are done the token cannot be released under them.
    ++inFlight_[token].writers;
  }
  // The writes go out after the lock is let go: a reader that does not read
  // (its socket buffer full) then blocks only this sender, never Stop, the
  // other senders' accounting or the producer thread's token returns. Each
  // Connection's own lock keeps concurrent records whole on its wire.
  std::uint8_t tokenBytes[4];
  StoreLe32(tokenBytes, token);
  BufferList list;
  list.reserve(record.size() + 1);
  list.emplace_back(tokenBytes, 4);
  list.insert(list.end(), record.begin(), record.end());
  for (const auto& connection : readers) {
    // A reader whose write failed still owes the token; if it has gone, the
    // producer thread finds out on its next read and gives the token up.
    connection->Send(list);
  }
  // A token given up while it was being written (Stop, its last reader gone
  // or returned) is released now, under the lock as Stop releases.
  std::lock_guard<std::mutex> hold(lock_);
  auto writing = inFlight_.find(token);
  if (--writing->second.writers == 0) {
    const bool givenUp = writing->second.givenUp;
    inFlight_.erase(writing);
    if (givenUp && releaseCallback_) releaseCallback_(token);
  }
  return true;
}

bool Producer::Release(const std::shared_ptr<Connection>& reader, std::uint32_t token) {
  std::lock_guard<std::mutex> hold(lock_);
  auto entry = pending_.find(token);
  if (entry == pending_.end()) {
    Log(LogType::Normal, "", "pm::ipc:queue::Producer : Token (%d) not found.\n", static_cast<int>(token));
    return false;
  }
  if (entry->second.erase(reader) == 0) {
    Log(LogType::Normal, "", "pm::ipc:queue::Producer : Connection not found for token (%d).\n",
        static_cast<int>(token));
    return false;
  }
  if (!entry->second.empty()) return false;
  pending_.erase(entry);
  return GiveUpLocked(token);
}

std::vector<std::uint32_t> Producer::DropReader(const std::shared_ptr<Connection>& reader) {
  std::vector<std::uint32_t> released;
  std::size_t owed = 0;
  {
    std::lock_guard<std::mutex> hold(lock_);
    auto found = std::find(connections_.begin(), connections_.end(), reader);
    if (found == connections_.end()) return released;
    connections_.erase(found);
    for (auto entry = pending_.begin(); entry != pending_.end();) {  // ascending
      if (entry->second.erase(reader) > 0) ++owed;
      if (entry->second.empty()) {
        if (GiveUpLocked(entry->first)) released.push_back(entry->first);
        entry = pending_.erase(entry);
      } else {
        ++entry;
      }
    }
  }
  Log(LogType::Normal, "", "pm::ipc:queue::Producer : Reader gone, %zu owed tokens given up, %zu released.\n",
      owed, released.size());
  return released;
}

std::size_t Producer::ReaderCount() {
  std::lock_guard<std::mutex> hold(lock_);
  return connections_.size();
}

std::size_t Producer::PendingCount() {
  std::lock_guard<std::mutex> hold(lock_);
  return pending_.size();
}

void Producer::ThreadMain(const std::weak_ptr<Semaphore>& started) {
  SetThreadName("pm::Ipc Producer");
  if (auto semaphore = started.lock()) semaphore->Signal();

  std::vector<std::shared_ptr<Connection>> watched;
  std::shared_ptr<Connection> wakeReader;
  while (running_.load()) {
    loopPasses_.fetch_add(1, std::memory_order_relaxed);
    {
      std::lock_guard<std::mutex> hold(lock_);
      watched = connections_;
      wakeReader = wakeReader_;
    }
    // A wake end that has failed is left out rather than reported as hung up
    // on every pass; the thread then still wakes every kWaitMs.
    if (wakeReader && wakeReader->IsConnected()) watched.push_back(wakeReader);
    const auto ready = Connection::WaitReadableConnections(watched, kWaitMs);
    if (!running_.load()) break;
    for (const auto& connection : ready) {
      std::uint8_t block[4];
      const bool read = connection->ReadFromSocket(block, sizeof block, kTokenReadTimeoutMs);
      if (connection == wakeReader) continue;  // the wake word only ends the wait
      if (read) {
        const std::uint32_t token = LoadLe32(block);
        if (Release(connection, token) && releaseCallback_) releaseCallback_(token);
      } else if (!connection->IsConnected()) {
        for (std::uint32_t token : DropReader(connection)) {
          if (releaseCallback_) releaseCallback_(token);
        }
      }
    }
  }
  ClearThreadName();
}

}  // namespace pm::ipc::queue
