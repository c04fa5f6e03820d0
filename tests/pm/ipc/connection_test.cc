// Connections and the server over real loopback sockets, for what they add to
// the sockets below them (tested in tests/pm/ip): the frame size limit on
// sending, whole frames from concurrent senders (lists sent whole), reads that
// keep a partial block across a timeout, the connected flag, readiness,
// closing while other threads read, wait or send, and the listener thread.
#include "pm/ipc/connection.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <map>
#include <thread>

#include "pm/ipc/server.h"
#include "pm/runtime/little_endian.h"
#include "support/log_capture.h"
#include "support/wait.h"

namespace {

using pm::ipc::Connection;
using pm::ipc::Server;
using Bytes = std::vector<std::uint8_t>;

// A connected pair: `task` accepted by a Server, `host` opened to it.
struct Pair {
  std::unique_ptr<Server> server = Server::CreateListening();
  std::shared_ptr<Connection> host = Connection::Open(server->GetPort());
  std::shared_ptr<Connection> task = server->AcceptConnection(5000);
  Pair() { EXPECT_TRUE(host && task); }
};

Bytes ReadBytes(Connection& from, std::size_t n) {
  Bytes bytes(n);
  EXPECT_TRUE(from.ReadFromSocket(bytes.data(), n, 5000));
  return bytes;
}

std::string ReadFrame(Connection& from) {
  const Bytes body = ReadBytes(from, pm::LoadLe32(ReadBytes(from, 4).data()));
  return std::string(body.begin(), body.end());
}

// A message over the limit is refused with a line and writes nothing: the
// next thing on the wire is the next message, which at the limit goes out
// whole.
TEST(ConnectionFraming, MessageAtTheLimitGoesOutWholeOneByteMoreWritesNothing) {
  pmtest::LogCapture log;
  Pair pair;
  EXPECT_FALSE(Connection::SendMessage(pair.task, std::string(pm::ipc::kMaxFrameBytes + 1, 'x')));
  EXPECT_EQ(log.Count("message of 524289 bytes is over the limit of 524288"), 1);
  const std::string text(pm::ipc::kMaxFrameBytes, 'x');
  // The reader runs while the send is in progress: 512 KiB exceeds what the
  // socket buffers hold.
  std::future<bool> sent = std::async(std::launch::async, [&] { return Connection::SendMessage(pair.task, text); });
  EXPECT_EQ(ReadFrame(*pair.host), text);
  EXPECT_TRUE(sent.get());
  std::uint8_t extra;
  EXPECT_FALSE(pair.host->ReadFromSocket(&extra, 1, 20));
}

TEST(ConnectionSend, ConcurrentSendersNeverInterleaveFrames) {
  Pair pair;
  constexpr int kThreads = 4, kEach = 50;
  std::vector<std::thread> senders;
  for (int t = 0; t < kThreads; ++t) {
    senders.emplace_back([&, t] {
      // Sizes vary so that some frames need more than one write.
      for (int i = 0; i < kEach; ++i) {
        EXPECT_TRUE(Connection::SendMessage(pair.task, std::string(1 + (i * 977) % 70000, char('a' + t))));
      }
    });
  }
  std::map<char, int> seen;
  for (int n = 0; n < kThreads * kEach; ++n) {
    const std::string body = ReadFrame(*pair.host);
    ASSERT_FALSE(body.empty());
    ASSERT_EQ(body.find_first_not_of(body[0]), std::string::npos) << "frame " << n;
    ++seen[body[0]];
  }
  for (auto& s : senders) s.join();
  for (int t = 0; t < kThreads; ++t) EXPECT_EQ(seen[char('a' + t)], kEach);
}

// A block cut short by a timeout is completed by the next read. A reset peer
// (its close discards what was not read) reads as gone, not as a timeout:
// reads fail for good. (A plain end of stream: the dispatcher's tests.)
TEST(ConnectionRead, BlockCutShortByATimeoutIsCompletedAndAResettingPeerClearsConnected) {
  Pair pair;
  const std::uint8_t bytes[8] = {1, 2, 3, 4, 5, 6, 7, 8};
  ASSERT_TRUE(pair.task->Send({{bytes, 2}}));
  std::uint8_t buffer[4] = {};
  EXPECT_FALSE(pair.host->ReadFromSocket(buffer, 4, 30));
  EXPECT_TRUE(pair.host->IsConnected());
  ASSERT_TRUE(pair.task->Send({{bytes + 2, 6}}));
  EXPECT_EQ(ReadBytes(*pair.host, 4), (Bytes{1, 2, 3, 4}));
  EXPECT_EQ(ReadBytes(*pair.host, 4), (Bytes{5, 6, 7, 8}));
  const linger abort{1, 0};  // close sends a reset instead of an end of stream
  ASSERT_EQ(::setsockopt(pair.task->GetSocket().GetHandle(), SOL_SOCKET, SO_LINGER, &abort, sizeof abort), 0);
  pair.task.reset();  // destroyed: its end closes
  EXPECT_FALSE(pair.host->ReadFromSocket(buffer, 1, 5000));
  EXPECT_FALSE(pair.host->IsConnected());
  EXPECT_FALSE(pair.host->ReadFromSocket(buffer, 1, 5000));
}

// Close shuts the socket down before it takes the send lock: a sender blocked
// on a peer that does not read ends, and the number stays taken while other
// owners (a reader) may still use it, until the last owner goes.
TEST(ConnectionClose, EndsAStuckSenderAndReleasesTheDescriptorOnlyWithTheLastOwner) {
  Pair pair;
  const int fd = pair.task->GetSocket().GetHandle();
  const Bytes big(64 * 1024 * 1024);  // far more than both socket buffers hold
  EXPECT_FALSE(pmtest::WokenBy([&] { return pair.task->Send({{big.data(), std::uint32_t(big.size())}}); },
                               [&] { pair.task->Close(); }));
  EXPECT_NE(::fcntl(fd, F_GETFD), -1);
  std::uint8_t byte;
  EXPECT_FALSE(pair.task->ReadFromSocket(&byte, 1, 10));
  pair.task.reset();
  EXPECT_EQ(::fcntl(fd, F_GETFD), -1);
}

// Readable and hung-up connections are reported by identity in list order; a
// timeout of zero or less returns at once; a closed connection is reported
// (hung up) and the read that follows fails at once.
TEST(ConnectionWait, ReportsReadableConnectionsByIdentityAndWakesOnClose) {
  Pair a, b, quiet;
  EXPECT_TRUE(Connection::WaitReadableConnections({a.host, b.host}, 10).empty());
  const std::uint8_t byte = 1;
  ASSERT_TRUE(b.task->Send({{&byte, 1}}));
  a.task.reset();
  using List = std::vector<std::shared_ptr<Connection>>;
  EXPECT_TRUE(pmtest::WaitFor([&] {
    return Connection::WaitReadableConnections({quiet.host, b.host, nullptr, a.host}, 100) == List{b.host, a.host};
  }));
  EXPECT_TRUE(Connection::WaitReadableConnections({b.host}, 0).empty());
  EXPECT_EQ(pmtest::WokenBy([&] { return Connection::WaitReadableConnections({quiet.task}, 60000).size(); },
                            [&] { quiet.task->Close(); }),
            1u);
  std::uint8_t got;
  EXPECT_FALSE(quiet.task->ReadFromSocket(&got, 1, 60000));
}

TEST(ServerListener, StopInsideTheCallbackOrWhileWaitingEndsTheListenerAtOnce) {
  for (const bool inside : {true, false}) {
    SCOPED_TRACE(inside ? "inside the callback" : "while waiting");
    auto server = Server::CreateListening();
    std::promise<std::unique_ptr<Connection>> handed;
    server->StartWaitingForConnections([&](std::unique_ptr<Connection> c) {
      server->Stop();  // must not join its own thread
      handed.set_value(std::move(c));
    });
    // Inside: a connection comes (that the one handed over carries data: the
    // queue's records, tests/pm/shm); else 20 ms pass, into the listener's wait.
    const auto host = inside ? Connection::Open(server->GetPort()) : nullptr;
    ASSERT_EQ(handed.get_future().wait_for(std::chrono::milliseconds(inside ? 20000 : 20)),
              inside ? std::future_status::ready : std::future_status::timeout);
    // The listener waits up to 10 s per pass; Stop must end that wait.
    auto destroyed = std::async(std::launch::async, [&] { server.reset(); });
    EXPECT_EQ(destroyed.wait_for(std::chrono::seconds(5)), std::future_status::ready);
  }
}

TEST(ServerListener, ThrowingCallbackIsLoggedAndTheListenerGoesOn) {
  pmtest::LogCapture log;
  auto server = Server::CreateListening();
  std::atomic<int> calls{0};
  server->StartWaitingForConnections([&](std::unique_ptr<Connection>) {
    if (calls.fetch_add(1) == 0) throw std::runtime_error("boom");
  });
  auto a = Connection::Open(server->GetPort());
  auto b = Connection::Open(server->GetPort());
  EXPECT_TRUE(pmtest::WaitFor([&] { return calls.load() == 2; }));
  EXPECT_TRUE(log.Contains("boom"));
}

TEST(ServerListener, RunningOutOfDescriptorsDoesNotMakeItSpin) {
  pmtest::LogCapture log;
  auto server = Server::CreateListening();
  std::atomic<int> handed{0};
  server->StartWaitingForConnections([&](std::unique_ptr<Connection>) { ++handed; });
  // Use up every descriptor but one, and connect with that one: the
  // connection is queued but the listener has no descriptor to take it.
  rlimit saved{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &saved), 0);
  const rlimit low{std::min<rlim_t>(saved.rlim_cur, 1024), saved.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &low), 0);
  std::vector<int> filler;
  for (int fd; (fd = ::dup(0)) >= 0;) filler.push_back(fd);
  ASSERT_FALSE(filler.empty());
  ::close(filler.back());
  filler.pop_back();
  auto host = Connection::Open(server->GetPort());
  ASSERT_TRUE(host);
  ASSERT_TRUE(pmtest::WaitFor([&] { return log.Contains("Acceptor::Accept failed : [errno=24,wsa=24]"); }));
  // A listener that spun would log thousands of lines here.
  const int before = log.Count("Acceptor::Accept failed");
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  EXPECT_LE(log.Count("Acceptor::Accept failed") - before, 10);
  for (int fd : filler) ::close(fd);
  ::setrlimit(RLIMIT_NOFILE, &saved);
  EXPECT_TRUE(pmtest::WaitFor([&] { return handed.load() == 1; }));
  server->Stop();
}

}  // namespace
