// The queue producer against real loopback readers: record layout and its
// validation, token accounting across readers, bad returns, Stop, restarts,
// and a reader that goes away while it still owes tokens. (Returns racing
// sends run in every whole-chain case under ThreadSanitizer.)
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
using pm::ipc::queue::Producer;
using Tokens = std::vector<std::uint32_t>;

// A reader as the host sees it: `host` is its end, `task` the end added to
// the producer.
struct Reader {
  std::shared_ptr<Connection> host, task;
  explicit Reader(pm::ipc::Server& server)
      : host(Connection::Open(server.GetPort())), task(server.AcceptConnection(5000)) {
    EXPECT_TRUE(host && task);
  }
  std::vector<std::uint8_t> ReadRecord(std::size_t bytes = 64) {
    std::vector<std::uint8_t> record(bytes);
    EXPECT_TRUE(host->ReadFromSocket(record.data(), bytes, 5000));
    return record;
  }
  void Return(std::uint32_t token) { EXPECT_TRUE(host->Send({{&token, 4}})); }  // little-endian hosts only
};

struct QueueProducer : ::testing::Test {
  // First, so that it outlives the producer thread, which may log until it
  // is joined.
  pmtest::LogCapture log;
  std::unique_ptr<pm::ipc::Server> server = pm::ipc::Server::CreateListening();
  std::mutex mutex;
  Tokens released, releasedOnTheTestThread;  // guarded by mutex
  std::array<std::uint8_t, 60> record{};
  Producer producer;

  void SetUp() override {
    for (std::size_t i = 0; i < record.size(); ++i) record[i] = std::uint8_t(i + 1);
    ASSERT_TRUE(Start(60));
  }
  bool Start(std::uint32_t size) {
    const auto test = std::this_thread::get_id();
    return producer.Start(size, [this, test](std::uint32_t token) {
      std::lock_guard<std::mutex> hold(mutex);
      released.push_back(token);
      if (std::this_thread::get_id() == test) releasedOnTheTestThread.push_back(token);
    });
  }
  Tokens Released(bool onTheTestThread = false) {
    std::lock_guard<std::mutex> hold(mutex);
    return onTheTestThread ? releasedOnTheTestThread : released;
  }
  bool WaitForReleases(std::size_t n) { return pmtest::WaitFor([&] { return Released().size() >= n; }); }
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

// A record is its token (little-endian) and the record bytes, written as one
// block from any number of entries to each reader once; entries that do not
// add up to the record size (also only modulo 2^32), or miss their bytes,
// write nothing and take no token. The same connection again, or none, is
// refused.
TEST_F(QueueProducer, RecordIsTheTokenThenTheEntriesAndWrongEntriesWriteNothing) {
  auto reader = Add();
  EXPECT_FALSE(producer.AddConnection(reader->task));
  EXPECT_FALSE(producer.AddConnection(nullptr));
  const std::uint8_t* r = record.data();
  const pm::BufferList wrong[] = {{{r, 59}}, {{r, 60}, {r, 1}}, {{r, 30}, {nullptr, 30}},
                                  {{r, 60}, {nullptr, 0}}, {}, {{r, 0xFFFFFFFFu}, {r, 61}}};
  for (const pm::BufferList& entries : wrong) EXPECT_FALSE(producer.Send(1, entries));
  EXPECT_EQ(producer.PendingCount(), 0u);

  ASSERT_TRUE(producer.Send(0x11223344, {{r, 24}, {r + 24, 34}, {r + 58, 2}}));
  const auto got = reader->ReadRecord();
  EXPECT_EQ(pm::LoadLe32(got.data()), 0x11223344u);
  EXPECT_TRUE(std::equal(record.begin(), record.end(), got.begin() + 4));
  std::uint8_t byte;
  EXPECT_FALSE(reader->host->ReadFromSocket(&byte, 1, 20));  // one record, not two
  EXPECT_TRUE(Released().empty());
}

// A token is released, on the producer thread, once every reader it went to
// has returned it; returns a reader does not owe (again, or never sent) are
// logged and ignored and do not cost the reader its place.
TEST_F(QueueProducer, TokenReleasedOnlyWhenEveryReaderReturnedAndBadReturnsAreIgnored) {
  auto a = Add();
  auto b = Add();
  ASSERT_TRUE(Send(5));
  EXPECT_EQ(pm::LoadLe32(a->ReadRecord().data()), 5u);
  EXPECT_EQ(pm::LoadLe32(b->ReadRecord().data()), 5u);
  for (std::uint32_t token : {5u, 5u, 77u}) a->Return(token);
  ASSERT_TRUE(pmtest::WaitFor([&] {
    return log.Contains("Connection not found for token (5).") && log.Contains("Token (77) not found.");
  }));
  EXPECT_TRUE(Released().empty());
  b->Return(5);
  ASSERT_TRUE(WaitForReleases(1));
  EXPECT_TRUE(Released(true).empty());
  b->Return(5);
  ASSERT_TRUE(pmtest::WaitFor([&] { return log.Contains("Token (5) not found."); }));
  EXPECT_EQ(Released(), Tokens{5});
  EXPECT_EQ(producer.ReaderCount(), 2u);
  EXPECT_EQ(producer.PendingCount(), 0u);
}

// A record sent before any reader is released during the call; Stop releases
// every pending token in ascending order, both on the calling thread; a
// destroyed producer drops what is pending without callbacks and leaves the
// reader's connection to its other owners.
TEST_F(QueueProducer, SendBeforeAnyReaderAndStopReleaseOnTheCallingThreadDestructionDropsSilently) {
  EXPECT_TRUE(Send(9));
  EXPECT_EQ(Released(), Tokens{9});
  auto reader = Add();
  for (std::uint32_t token : {30u, 10u, 20u}) ASSERT_TRUE(Send(token));
  producer.Stop();
  producer.Stop();  // nothing more
  EXPECT_EQ(Released(true), (Tokens{9, 10, 20, 30}));
  EXPECT_EQ(Released(), Released(true));

  auto destroyed = std::make_unique<Producer>();
  ASSERT_TRUE(destroyed->Start(60, [&](std::uint32_t token) { ADD_FAILURE() << token; }));
  ASSERT_TRUE(destroyed->AddConnection(reader->task));
  ASSERT_TRUE(destroyed->Send(1, {{record.data(), 60}}));
  destroyed.reset();
  EXPECT_TRUE(reader->task->IsConnected());
}

// Release and write are exclusive: a token given up while Send is still
// writing its record (Stop, or its only reader gone) is released by that
// Send once the write has ended, never under it. The reader does not read, so
// its socket buffers fill and the write blocks until the test reads.
TEST_F(QueueProducer, TokenGivenUpWhileItsRecordIsBeingWrittenIsReleasedAfterTheWrite) {
  constexpr std::uint32_t kBig = 4 << 20;  // many times what the socket buffers below hold
  const std::vector<std::uint8_t> big(kBig, 0x5A);
  const std::pair<const char*, std::function<void(Reader&)>> cases[] = {
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
  for (const auto& [name, giveUp] : cases) {
    SCOPED_TRACE(name);
    ASSERT_TRUE(Start(kBig));
    const std::size_t before = Released().size();
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
    giveUp(*reader);
    EXPECT_EQ(Released().size(), before) << "released while its record was being written";
    reader->ReadRecord(kBig + 4);
    sender.join();
    ASSERT_EQ(Released().size(), before + 1);
    EXPECT_EQ(Released().back(), token++);
  }
}

// Returns that arrive while the producer does not watch the reader (before it
// is added, or while the producer is stopped) are stale: discarded when it
// starts watching, never taken for returns of later records.
TEST_F(QueueProducer, ReturnsFromBeforeTheReaderWasWatchedAreDiscarded) {
  for (const bool restart : {false, true}) {
    SCOPED_TRACE(restart ? "returned while stopped" : "returned before added");
    const std::size_t before = Released().size();
    Reader reader(*server);
    if (restart) {
      ASSERT_TRUE(producer.AddConnection(reader.task));
      ASSERT_TRUE(Send(1));
      reader.ReadRecord();
      producer.Stop();  // releases 1
    }
    for (std::uint32_t token : {1u, 4u}) reader.Return(token);
    ASSERT_TRUE(pmtest::WaitFor([&] { return !Connection::WaitReadableConnections({reader.task}, 10).empty(); }));
    ASSERT_TRUE(restart ? Start(60) : producer.AddConnection(reader.task));
    EXPECT_EQ(producer.ReaderCount(), 1u);
    ASSERT_TRUE(Send(4));
    reader.ReadRecord();
    reader.Return(4);
    ASSERT_TRUE(WaitForReleases(before + 1 + restart));
    EXPECT_EQ(Released().back(), 4u);
    EXPECT_FALSE(log.Contains("not found"));
  }
}

// A reader whose end closes (the host's process ended, or we closed it) is
// dropped with what it alone still owed, and its dead socket does not make
// the producer spin.
TEST_F(QueueProducer, ReaderThatGoesAwayGivesUpWhatItOwedWithoutSpinning) {
  auto a = Add();
  auto b = Add();
  for (std::uint32_t token : {7u, 2u, 5u, 6u}) ASSERT_TRUE(Send(token));
  a->ReadRecord(4 * 64);
  b->ReadRecord(4 * 64);
  // 6 released marks b's earlier returns as taken before a goes.
  for (std::uint32_t token : {5u, 7u, 6u}) b->Return(token);
  a->Return(6);
  ASSERT_TRUE(WaitForReleases(1));

  a->host.reset();  // a's end closes while it owes 7, 2 and 5
  ASSERT_TRUE(WaitForReleases(3));
  EXPECT_EQ(Released(), (Tokens{6, 5, 7}));  // 2 is still owed by b
  EXPECT_EQ(producer.ReaderCount(), 1u);
  EXPECT_TRUE(log.Contains("Reader gone"));
  ExpectNoSpin();

  // New records go to b alone, and b's return alone releases them.
  ASSERT_TRUE(Send(11));
  b->ReadRecord();
  for (std::uint32_t token : {2u, 11u}) b->Return(token);
  ASSERT_TRUE(WaitForReleases(5));
  EXPECT_EQ(Released(), (Tokens{6, 5, 7, 2, 11}));

  ASSERT_TRUE(Send(12));
  b->task->Close();
  ASSERT_TRUE(WaitForReleases(6));
  EXPECT_EQ(producer.ReaderCount(), 0u);
  ExpectNoSpin();
}

}  // namespace
