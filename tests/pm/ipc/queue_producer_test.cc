// The queue producer against real loopback readers: record layout and its
// validation, token accounting across readers, bad returns, Stop, restarts,
// and a reader that goes away while it still owes tokens.
#include "pm/ipc/queue_producer.h"

#include <sys/socket.h>

#include <array>
#include <functional>
#include <thread>

#include "pm/ipc/server.h"
#include "pm/runtime/little_endian.h"
#include "support/log_capture.h"
#include "support/wait.h"

namespace {

using pm::ipc::Connection;
using pm::ipc::Server;
using pm::ipc::queue::Producer;

// Collects release callbacks (from any thread) in order, with the thread
// each ran on.
class Releases {
 public:
  Producer::ReleaseCallback Callback() {
    return [this](std::uint32_t token) {
      std::lock_guard<std::mutex> hold(mutex_);
      tokens_.push_back(token);
      threads_.push_back(std::this_thread::get_id());
    };
  }
  std::vector<std::uint32_t> Tokens() {
    std::lock_guard<std::mutex> hold(mutex_);
    return tokens_;
  }
  std::thread::id ThreadOf(std::size_t i) {
    std::lock_guard<std::mutex> hold(mutex_);
    return threads_.at(i);
  }
  bool WaitForCount(std::size_t n) {
    return pmtest::WaitFor([&] { return Tokens().size() >= n; });
  }

 private:
  std::mutex mutex_;
  std::vector<std::uint32_t> tokens_;      // guarded by mutex_
  std::vector<std::thread::id> threads_;   // guarded by mutex_
};

// A reader as the host sees it: `host` is its end, `task` the end added to
// the producer.
struct Reader {
  std::shared_ptr<Connection> host;
  std::shared_ptr<Connection> task;
  explicit Reader(Server& server) {
    host = Connection::Open(server.GetPort());
    task = server.AcceptConnection(5000);
    EXPECT_TRUE(host && task);
  }
  std::vector<std::uint8_t> ReadRecord(std::size_t bytes) {
    std::vector<std::uint8_t> record(bytes);
    EXPECT_TRUE(host->ReadFromSocket(record.data(), bytes, 5000));
    return record;
  }
  bool Quiet() {
    std::uint8_t byte;
    return !host->ReadFromSocket(&byte, 1, 20);
  }
  void Return(std::uint32_t token) {
    std::uint8_t bytes[4];
    pm::StoreLe32(bytes, token);
    EXPECT_TRUE(host->Send({{bytes, 4}}));
  }
};

std::uint32_t TokenOf(const std::vector<std::uint8_t>& r) {
  return pm::LoadLe32(r.data());
}

struct Fixture : ::testing::Test {
  // First, so that it outlives the producer thread, which may log until it
  // is joined.
  pmtest::LogCapture log;
  std::unique_ptr<Server> server = Server::CreateListening();
  Releases releases;
  std::array<std::uint8_t, 60> record{};
  Producer producer;

  void SetUp() override {
    for (std::size_t i = 0; i < record.size(); ++i) record[i] = std::uint8_t(i + 1);
    ASSERT_TRUE(producer.Start(60, releases.Callback()));
  }
  bool Send(std::uint32_t token) { return producer.Send(token, {{record.data(), 60}}); }
  // The producer thread passes its loop about once per 250 ms wait; one that
  // still watched a dead socket, which keeps reporting a hang-up, would pass
  // it thousands of times in this interval.
  void ExpectNoSpin() {
    const std::uint64_t before = producer.LoopPasses();
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_LE(producer.LoopPasses() - before, 10u);
  }
  std::unique_ptr<Reader> Add() {
    auto reader = std::make_unique<Reader>(*server);
    EXPECT_TRUE(producer.AddConnection(reader->task));
    return reader;
  }
};

// ---------------------------------------------------------------------------

using ProducerRecord = Fixture;

// A record is its token (little-endian) and the record bytes, written as one
// block from any number of entries; entries that do not add up to the record
// size, or miss their bytes, write nothing and take no token.
TEST_F(ProducerRecord, IsTheTokenThenTheEntriesAndWrongEntriesWriteNothing) {
  auto reader = Add();
  EXPECT_FALSE(producer.Send(1, {{record.data(), 59}}));
  EXPECT_FALSE(producer.Send(2, {{record.data(), 60}, {record.data(), 1}}));
  EXPECT_FALSE(producer.Send(3, {{record.data(), 30}, {nullptr, 30}}));
  EXPECT_FALSE(producer.Send(4, {{record.data(), 60}, {nullptr, 0}}));
  EXPECT_FALSE(producer.Send(5, {}));
  // Lengths that add up to 60 only modulo 2^32 must not pass either.
  EXPECT_FALSE(producer.Send(6, {{record.data(), 0xFFFFFFFFu}, {record.data(), 61}}));
  EXPECT_EQ(producer.PendingCount(), 0u);
  EXPECT_TRUE(releases.Tokens().empty());

  ASSERT_TRUE(producer.Send(0x11223344, {{record.data(), 24}, {record.data() + 24, 34}, {record.data() + 58, 2}}));
  const auto got = reader->ReadRecord(64);
  EXPECT_EQ(std::vector<std::uint8_t>(got.begin(), got.begin() + 4), (std::vector<std::uint8_t>{0x44, 0x33, 0x22, 0x11}));
  EXPECT_TRUE(std::equal(record.begin(), record.end(), got.begin() + 4));
  EXPECT_TRUE(reader->Quiet());
}

TEST_F(ProducerRecord, SendBeforeAnyReaderReleasesDuringTheCall) {
  EXPECT_TRUE(Send(9));
  ASSERT_EQ(releases.Tokens(), (std::vector<std::uint32_t>{9}));
  EXPECT_EQ(releases.ThreadOf(0), std::this_thread::get_id());
  EXPECT_EQ(producer.PendingCount(), 0u);
}

// ---------------------------------------------------------------------------

using ProducerTokens = Fixture;

// A token is released, on the producer thread, once every reader it went to
// has returned it; returns a reader does not owe (again, or never sent) are
// logged and ignored and do not cost the reader its place.
TEST_F(ProducerTokens, ReleasedOnlyWhenEveryReaderReturnedAndBadReturnsAreIgnored) {
  auto a = Add();
  auto b = Add();
  ASSERT_TRUE(Send(5));
  EXPECT_EQ(TokenOf(a->ReadRecord(64)), 5u);
  EXPECT_EQ(TokenOf(b->ReadRecord(64)), 5u);
  a->Return(5);
  a->Return(5);
  a->Return(77);
  ASSERT_TRUE(pmtest::WaitFor([&] {
    return log.Contains("pm::ipc:queue::Producer : Connection not found for token (5).") &&
           log.Contains("pm::ipc:queue::Producer : Token (77) not found.");
  }));
  EXPECT_TRUE(releases.Tokens().empty());
  b->Return(5);
  ASSERT_TRUE(releases.WaitForCount(1));
  EXPECT_NE(releases.ThreadOf(0), std::this_thread::get_id());
  b->Return(5);
  ASSERT_TRUE(pmtest::WaitFor([&] { return log.Contains("pm::ipc:queue::Producer : Token (5) not found."); }));
  EXPECT_EQ(releases.Tokens(), (std::vector<std::uint32_t>{5}));
  EXPECT_EQ(producer.ReaderCount(), 2u);
  EXPECT_EQ(producer.PendingCount(), 0u);
}

TEST_F(ProducerTokens, StopReleasesEveryPendingTokenInAscendingOrder) {
  auto reader = Add();
  for (std::uint32_t token : {30u, 10u, 20u}) ASSERT_TRUE(Send(token));
  producer.Stop();
  EXPECT_EQ(releases.Tokens(), (std::vector<std::uint32_t>{10, 20, 30}));
  for (std::size_t i = 0; i < 3; ++i) EXPECT_EQ(releases.ThreadOf(i), std::this_thread::get_id());
  EXPECT_EQ(producer.PendingCount(), 0u);
  producer.Stop();  // nothing more
  EXPECT_EQ(releases.Tokens().size(), 3u);
}

TEST_F(ProducerTokens, ConcurrentSendersAndReturnsReleaseEachTokenOnce) {
  auto a = Add();
  auto b = Add();
  constexpr std::uint32_t kPerSender = 200;
  auto echo = [](Reader* r) {
    for (std::uint32_t n = 0; n < 2 * kPerSender; ++n) r->Return(TokenOf(r->ReadRecord(64)));
  };
  std::vector<std::thread> threads;
  for (Reader* reader : {a.get(), b.get()}) threads.emplace_back(echo, reader);
  for (std::uint32_t first : {0u, 1000u}) {
    threads.emplace_back([&, first] {
      for (std::uint32_t t = first; t < first + kPerSender; ++t) EXPECT_TRUE(Send(t));
    });
  }
  for (auto& thread : threads) thread.join();
  ASSERT_TRUE(releases.WaitForCount(2 * kPerSender));
  auto tokens = releases.Tokens();
  std::sort(tokens.begin(), tokens.end());
  EXPECT_EQ(std::adjacent_find(tokens.begin(), tokens.end()), tokens.end());
  EXPECT_EQ(tokens.size(), 2 * kPerSender);
  EXPECT_EQ(producer.PendingCount(), 0u);
}

// Release and write are exclusive: a token given up while Send is still
// writing its record (Stop, or its only reader gone) is released by that
// Send once the write has ended, never under it. The reader does not read, so
// its socket buffers fill and the write blocks until the test reads.
TEST_F(ProducerTokens, TokenGivenUpWhileItsRecordIsBeingWrittenIsReleasedAfterTheWrite) {
  constexpr std::uint32_t kBig = 4 << 20;  // many times what the socket buffers below hold
  const std::vector<std::uint8_t> big(kBig, 0x5A);
  struct Case {
    const char* name;
    std::function<void(Reader&)> giveUp;
  };
  const Case cases[] = {
      {"stop", [&](Reader&) { producer.Stop(); }},
      {"reader gone",
       [&](Reader& reader) {
         ::shutdown(reader.host->GetSocket().GetHandle(), SHUT_WR);  // its end of stream; it can still read
         ASSERT_TRUE(pmtest::WaitFor([&] { return producer.ReaderCount() == 0; }));
         // The pass that dropped the reader is over once the next one begins.
         const std::uint64_t passes = producer.LoopPasses();
         producer.Wake();
         ASSERT_TRUE(pmtest::WaitFor([&] { return producer.LoopPasses() > passes; }));
       }},
  };
  std::uint32_t token = 500;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(producer.Start(kBig, releases.Callback()));
    const std::size_t before = releases.Tokens().size();
    auto reader = Add();
    // Small enough to hold a fraction of the record, large enough not to
    // make the reading crawl.
    const int bytes = 65536;
    ::setsockopt(reader->task->GetSocket().GetHandle(), SOL_SOCKET, SO_SNDBUF, &bytes, sizeof bytes);
    ::setsockopt(reader->host->GetSocket().GetHandle(), SOL_SOCKET, SO_RCVBUF, &bytes, sizeof bytes);
    std::thread sender([&] { EXPECT_TRUE(producer.Send(token, {{big.data(), kBig}})); });
    // Whatever fails below, the write is cut short and the sender joined.
    struct Ender {
      Reader& reader;
      std::thread& sender;
      ~Ender() {
        if (!sender.joinable()) return;
        reader.task->Close();
        sender.join();
      }
    } ender{*reader, sender};
    ASSERT_TRUE(pmtest::WaitFor([&] { return producer.PendingCount() == 1; }));
    c.giveUp(*reader);
    EXPECT_EQ(releases.Tokens().size(), before) << "released while its record was being written";
    reader->ReadRecord(kBig + 4);
    sender.join();
    ASSERT_EQ(releases.Tokens().size(), before + 1);
    EXPECT_EQ(releases.Tokens().back(), token);
    ++token;
  }
}

// ---------------------------------------------------------------------------

using ProducerReaders = Fixture;

TEST_F(ProducerReaders, SameConnectionTwiceIsRefused) {
  auto reader = std::make_unique<Reader>(*server);
  EXPECT_TRUE(producer.AddConnection(reader->task));
  EXPECT_FALSE(producer.AddConnection(reader->task));
  EXPECT_FALSE(producer.AddConnection(nullptr));
  EXPECT_EQ(producer.ReaderCount(), 1u);
  ASSERT_TRUE(Send(1));
  reader->ReadRecord(64);
  EXPECT_TRUE(reader->Quiet());  // one record, not two
}

// Returns that arrive while the producer does not watch the reader (before it
// is added, or while the producer is stopped) are stale: discarded when it
// starts watching, never taken for returns of later records.
TEST_F(ProducerReaders, ReturnsFromBeforeTheReaderWasWatchedAreDiscarded) {
  for (const bool restart : {false, true}) {
    SCOPED_TRACE(restart ? "returned while stopped" : "returned before added");
    const std::size_t before = releases.Tokens().size();
    auto reader = std::make_unique<Reader>(*server);
    if (restart) {
      ASSERT_TRUE(producer.AddConnection(reader->task));
      ASSERT_TRUE(Send(1));
      reader->ReadRecord(64);
      producer.Stop();  // releases 1
    }
    reader->Return(1);
    reader->Return(4);
    ASSERT_TRUE(pmtest::WaitFor([&] { return !Connection::WaitReadableConnections({reader->task}, 10).empty(); }));
    if (restart) {
      ASSERT_TRUE(producer.Start(60, releases.Callback()));
      EXPECT_EQ(producer.ReaderCount(), 1u);
    } else {
      ASSERT_TRUE(producer.AddConnection(reader->task));
    }
    ASSERT_TRUE(Send(4));
    reader->ReadRecord(64);
    reader->Return(4);
    ASSERT_TRUE(releases.WaitForCount(before + 1 + restart));
    EXPECT_EQ(releases.Tokens().back(), 4u);
    EXPECT_FALSE(log.Contains("not found"));
  }
}

TEST_F(ProducerReaders, ReaderThatGoesAwayGivesUpWhatItOwedWithoutSpinning) {
  auto a = Add();
  auto b = Add();
  for (std::uint32_t token : {7u, 2u, 5u}) ASSERT_TRUE(Send(token));
  for (int i = 0; i < 3; ++i) {
    a->ReadRecord(64);
    b->ReadRecord(64);
  }
  b->Return(5);
  b->Return(7);
  // Let b's returns be taken before a goes (a 6th token round trip as marker).
  ASSERT_TRUE(Send(6));
  a->ReadRecord(64);
  b->ReadRecord(64);
  a->Return(6);
  b->Return(6);
  ASSERT_TRUE(releases.WaitForCount(1));

  a->host.reset();  // a's process ends: its end closes while it owes 7, 2 and 5
  ASSERT_TRUE(releases.WaitForCount(3));
  // 5 and 7 were owed by a only now; 2 is still owed by b.
  EXPECT_EQ(releases.Tokens(), (std::vector<std::uint32_t>{6, 5, 7}));
  EXPECT_EQ(producer.ReaderCount(), 1u);
  EXPECT_TRUE(log.Contains("Reader gone"));

  ExpectNoSpin();

  // New records go to b alone, and b's return alone releases them.
  ASSERT_TRUE(Send(11));
  b->ReadRecord(64);
  b->Return(2);
  b->Return(11);
  ASSERT_TRUE(releases.WaitForCount(5));
  EXPECT_EQ(releases.Tokens(), (std::vector<std::uint32_t>{6, 5, 7, 2, 11}));
}

TEST_F(ProducerReaders, ReaderClosedOnOurSideIsDroppedToo) {
  auto a = Add();
  ASSERT_TRUE(Send(3));
  a->task->Close();
  ASSERT_TRUE(releases.WaitForCount(1));
  EXPECT_EQ(producer.ReaderCount(), 0u);
  ExpectNoSpin();
}

// ---------------------------------------------------------------------------

TEST(ProducerDestroy, PendingTokensAreDroppedWithoutCallbacks) {
  auto server = Server::CreateListening();
  Releases releases;
  Reader reader(*server);
  {
    Producer producer;
    ASSERT_TRUE(producer.Start(4, releases.Callback()));
    ASSERT_TRUE(producer.AddConnection(reader.task));
    const std::uint32_t value = 0;
    ASSERT_TRUE(producer.Send(1, {{&value, 4}}));
  }
  EXPECT_TRUE(releases.Tokens().empty());
  // The reader's Connection belongs to its other owners and stays usable.
  EXPECT_TRUE(reader.task->IsConnected());
}

}  // namespace
