// Connections and the server over real loopback sockets: message framing and
// its size limit, reads with timeouts, a peer that goes, closing while other
// threads read or send, and the listener thread.
#include "pm/ipc/connection.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <map>
#include <thread>

#include "pm/ipc/server.h"
#include "pm/runtime/little_endian.h"
#include "pm/runtime/thread_name.h"
#include "support/log_capture.h"
#include "support/wait.h"

namespace {

using pm::ipc::Connection;
using pm::ipc::Server;

bool DescriptorOpen(int fd) { return fd >= 0 && ::fcntl(fd, F_GETFD) != -1; }

// A connected pair: `task` accepted by a Server, `host` opened to it.
struct Pair {
  std::unique_ptr<Server> server = Server::CreateListening();
  std::shared_ptr<Connection> host;
  std::shared_ptr<Connection> task;
  Pair() {
    host = Connection::Open(server->GetPort());
    task = server->AcceptConnection(5000);
    EXPECT_TRUE(host && task);
  }
};

std::vector<std::uint8_t> ReadBytes(Connection& from, std::size_t n) {
  std::vector<std::uint8_t> bytes(n);
  EXPECT_TRUE(from.ReadFromSocket(bytes.data(), n, 5000));
  return bytes;
}

std::uint32_t LittleEndian(const std::vector<std::uint8_t>& b) {
  return pm::LoadLe32(b.data());
}

// ---------------------------------------------------------------------------

TEST(ConnectionOpen, NobodyListeningGivesNoneAndALogLine) {
  pmtest::LogCapture log;
  int port = 0;
  {
    auto gone = Server::CreateListening();
    port = gone->GetPort();
  }
  EXPECT_EQ(Connection::Open(port), nullptr);
  EXPECT_TRUE(log.Contains("Connection::Open: Failed on port " + std::to_string(port) + ", [errno=111,wsa=111]"));
}

// ---------------------------------------------------------------------------

TEST(ConnectionFraming, MessageAtTheLimitGoesOutWithItsLength) {
  Pair pair;
  const std::string text(pm::ipc::kMaxFrameBytes, 'x');
  std::future<bool> sent = std::async(std::launch::async, [&] { return Connection::SendMessage(pair.task, text); });
  const auto prefix = ReadBytes(*pair.host, 4);
  EXPECT_EQ(prefix, (std::vector<std::uint8_t>{0x00, 0x00, 0x08, 0x00}));
  const auto body = ReadBytes(*pair.host, LittleEndian(prefix));
  EXPECT_TRUE(sent.get());
  EXPECT_EQ(std::string(body.begin(), body.end()), text);
}

TEST(ConnectionFraming, MessageOverTheLimitWritesNothing) {
  pmtest::LogCapture log;
  Pair pair;
  EXPECT_FALSE(Connection::SendMessage(pair.task, std::string(pm::ipc::kMaxFrameBytes + 1, 'x')));
  EXPECT_TRUE(log.Contains("Connection::SendMessage"));
  // The next thing on the wire is the next message, the empty one.
  EXPECT_TRUE(Connection::SendMessage(pair.task, ""));
  EXPECT_EQ(ReadBytes(*pair.host, 4), (std::vector<std::uint8_t>{0, 0, 0, 0}));
  std::uint8_t extra;
  EXPECT_FALSE(pair.host->ReadFromSocket(&extra, 1, 20));
}

TEST(ConnectionSend, ConcurrentSendersNeverInterleaveFrames) {
  Pair pair;
  constexpr int kThreads = 4;
  constexpr int kEach = 100;
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
    const auto body = ReadBytes(*pair.host, LittleEndian(ReadBytes(*pair.host, 4)));
    ASSERT_FALSE(body.empty());
    const char who = static_cast<char>(body[0]);
    ASSERT_EQ(std::count(body.begin(), body.end(), body[0]), std::ptrdiff_t(body.size())) << "frame " << n;
    ++seen[who];
  }
  for (auto& s : senders) s.join();
  for (int t = 0; t < kThreads; ++t) EXPECT_EQ(seen[char('a' + t)], kEach);
}

TEST(ConnectionSend, SendAfterCloseFailsAndPeerSeesTheEnd) {
  Pair pair;
  pair.task->Close();
  EXPECT_FALSE(pair.task->IsConnected());
  const std::uint8_t byte = 1;
  EXPECT_FALSE(pair.task->Send({{&byte, 1}}));
  std::uint8_t got;
  EXPECT_FALSE(pair.host->ReadFromSocket(&got, 1, 5000));
  EXPECT_FALSE(pair.host->IsConnected());
}

// Not connected any more does not mean the peer's end is read: a send on a
// connection whose peer vanished fails, and the process lives on.
TEST(ConnectionSend, PeerGoneFailsWithoutSigpipe) {
  sigset_t set, previous;
  sigemptyset(&set);
  sigaddset(&set, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &set, &previous);
  {
    Pair pair;
    pair.host.reset();
    bool failed = false;
    for (int i = 0; i < 200 && !failed; ++i) {
      failed = !Connection::SendMessage(pair.task, std::string(100, 'z'));
      if (!failed) std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    EXPECT_TRUE(failed);
    EXPECT_FALSE(Connection::SendMessage(pair.task, "{}"));
    EXPECT_TRUE(pair.task->IsConnected());  // only reads find out that the peer has gone
  }
  sigset_t pending;
  sigpending(&pending);
  const bool raised = sigismember(&pending, SIGPIPE) == 1;
  EXPECT_FALSE(raised);
  if (raised) {
    int signal = 0;
    sigwait(&set, &signal);
  }
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
}

// ---------------------------------------------------------------------------

TEST(ConnectionRead, TimeoutLeavesTheConnectionUsable) {
  Pair pair;
  std::uint8_t buffer[4];
  EXPECT_FALSE(pair.host->ReadFromSocket(buffer, 4, 20));
  EXPECT_TRUE(pair.host->IsConnected());
  const std::uint8_t data[4] = {9, 8, 7, 6};
  ASSERT_TRUE(pair.task->Send({{data, 4}}));
  EXPECT_TRUE(pair.host->ReadFromSocket(buffer, 4, 5000));
  EXPECT_EQ(std::vector<std::uint8_t>(buffer, buffer + 4), (std::vector<std::uint8_t>{9, 8, 7, 6}));
}

TEST(ConnectionRead, BlockCutShortByATimeoutIsCompletedByTheNextRead) {
  Pair pair;
  const std::uint8_t first[2] = {1, 2};
  const std::uint8_t rest[6] = {3, 4, 5, 6, 7, 8};
  ASSERT_TRUE(pair.task->Send({{first, 2}}));
  std::uint8_t buffer[4] = {};
  EXPECT_FALSE(pair.host->ReadFromSocket(buffer, 4, 30));
  EXPECT_TRUE(pair.host->IsConnected());
  ASSERT_TRUE(pair.task->Send({{rest, 6}}));
  ASSERT_TRUE(pair.host->ReadFromSocket(buffer, 4, 5000));
  EXPECT_EQ(std::vector<std::uint8_t>(buffer, buffer + 4), (std::vector<std::uint8_t>{1, 2, 3, 4}));
  ASSERT_TRUE(pair.host->ReadFromSocket(buffer, 4, 5000));
  EXPECT_EQ(std::vector<std::uint8_t>(buffer, buffer + 4), (std::vector<std::uint8_t>{5, 6, 7, 8}));
}

TEST(ConnectionRead, PeerCloseClearsConnectedOnce) {
  Pair pair;
  const std::uint8_t last = 42;
  ASSERT_TRUE(pair.task->Send({{&last, 1}}));
  pair.task.reset();  // destroyed: its end closes
  std::uint8_t byte = 0;
  EXPECT_TRUE(pair.host->ReadFromSocket(&byte, 1, 5000));  // what was sent before still arrives
  EXPECT_EQ(byte, 42);
  EXPECT_FALSE(pair.host->ReadFromSocket(&byte, 1, 5000));
  EXPECT_FALSE(pair.host->IsConnected());
  EXPECT_FALSE(pair.host->ReadFromSocket(&byte, 1, 5000));
}

TEST(ConnectionRead, PeerResetClearsConnected) {
  Pair pair;
  const linger abort{1, 0};  // close sends a reset instead of an end of stream
  ASSERT_EQ(::setsockopt(pair.task->GetSocket().GetHandle(), SOL_SOCKET, SO_LINGER, &abort, sizeof abort), 0);
  pair.task.reset();
  std::uint8_t byte;
  EXPECT_FALSE(pair.host->ReadFromSocket(&byte, 1, 5000));
  EXPECT_FALSE(pair.host->IsConnected());
}

// ---------------------------------------------------------------------------

TEST(ConnectionClose, WakesAReaderBlockedWithoutTimeout) {
  Pair pair;
  std::atomic<bool> done{false};
  bool result = true;
  std::thread reader([&] {
    std::uint8_t byte;
    result = pair.task->ReadFromSocket(&byte, 1, INT64_MAX);
    done = true;
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  pair.task->Close();
  EXPECT_TRUE(pmtest::WaitFor([&] { return done.load(); }));
  reader.join();
  EXPECT_FALSE(result);
}

TEST(ConnectionClose, WakesAWaitOnReadableConnections) {
  Pair pair;
  std::future<std::size_t> waited = std::async(std::launch::async, [&] {
    return Connection::WaitReadableConnections({pair.task}, 60000).size();
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  pair.task->Close();
  ASSERT_EQ(waited.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_EQ(waited.get(), 1u);  // reported (hung up); the read that follows fails at once
  std::uint8_t byte;
  EXPECT_FALSE(pair.task->ReadFromSocket(&byte, 1, 60000));
}

TEST(ConnectionClose, DoesNotWaitBehindASenderStuckOnAPeerThatDoesNotRead) {
  Pair pair;
  std::vector<std::uint8_t> big(64 * 1024 * 1024);  // far more than both socket buffers hold
  std::atomic<bool> done{false};
  bool result = true;
  std::thread sender([&] {
    result = pair.task->Send({{big.data(), std::uint32_t(big.size())}});
    done = true;
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(50));
  pair.task->Close();
  EXPECT_TRUE(pmtest::WaitFor([&] { return done.load(); }));
  sender.join();
  EXPECT_FALSE(result);
}

TEST(ConnectionClose, DescriptorIsReleasedOnlyWithTheLastOwner) {
  Pair pair;
  const int fd = pair.task->GetSocket().GetHandle();
  pair.task->Close();
  // A reader holding its own owner may still be about to use this number; it
  // must not be given to another open() yet.
  EXPECT_TRUE(DescriptorOpen(fd));
  std::uint8_t byte;
  EXPECT_FALSE(pair.task->ReadFromSocket(&byte, 1, 10));
  pair.task.reset();
  EXPECT_FALSE(DescriptorOpen(fd));
}

TEST(ConnectionWait, ReportsOnlyReadableConnectionsByIdentity) {
  Pair a;
  Pair b;
  EXPECT_TRUE(Connection::WaitReadableConnections({a.host, b.host}, 10).empty());
  const std::uint8_t byte = 1;
  ASSERT_TRUE(b.task->Send({{&byte, 1}}));
  const auto ready = Connection::WaitReadableConnections({a.host, nullptr, b.host}, 5000);
  ASSERT_EQ(ready.size(), 1u);
  EXPECT_EQ(ready[0], b.host);
}

// ---------------------------------------------------------------------------

TEST(ServerPorts, TwoServersGetTwoPorts) {
  auto a = Server::CreateListening();
  auto b = Server::CreateListening();
  ASSERT_TRUE(a && b);
  EXPECT_GT(a->GetPort(), 0);
  EXPECT_GT(b->GetPort(), 0);
  EXPECT_NE(a->GetPort(), b->GetPort());
}

TEST(ServerAccept, NobodyConnectingGivesNoneAfterTheTimeout) {
  auto server = Server::CreateListening();
  EXPECT_EQ(server->AcceptConnection(20), nullptr);
}

TEST(ServerAccept, AfterStopNothingIsAccepted) {
  auto server = Server::CreateListening();
  const int port = server->GetPort();
  server->Stop();
  auto accepted = std::async(std::launch::async, [&] { return server->AcceptConnection(0) != nullptr; });
  ASSERT_EQ(accepted.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_FALSE(accepted.get());
  pmtest::LogCapture log;
  EXPECT_EQ(Connection::Open(port), nullptr);
}

TEST(ServerListener, HandsConnectionsOverOnItsNamedThread) {
  auto server = Server::CreateListening();
  std::mutex mutex;
  std::vector<std::shared_ptr<Connection>> accepted;  // guarded by mutex
  std::vector<std::string> names;                      // guarded by mutex
  server->StartWaitingForConnections([&](std::unique_ptr<Connection> c) {
    std::lock_guard<std::mutex> hold(mutex);
    names.push_back(pm::CurrentThreadName());
    accepted.push_back(std::move(c));
  });
  auto first = Connection::Open(server->GetPort());
  auto second = Connection::Open(server->GetPort());
  ASSERT_TRUE(first && second);
  ASSERT_TRUE(pmtest::WaitFor([&] {
    std::lock_guard<std::mutex> hold(mutex);
    return accepted.size() == 2;
  }));
  server->Stop();
  std::lock_guard<std::mutex> hold(mutex);
  EXPECT_EQ(names[0], "pm::Ipc Listene");  // the name cut to Linux's 15 bytes
  EXPECT_TRUE(accepted[0]->IsConnected());
  // The accepted end talks with the opened one.
  const std::uint8_t byte = 5;
  ASSERT_TRUE(first->Send({{&byte, 1}}));
  std::uint8_t got = 0;
  EXPECT_TRUE(accepted[0]->ReadFromSocket(&got, 1, 5000));
  EXPECT_EQ(got, 5);
}

TEST(ServerListener, StopInsideTheCallbackEndsTheListenerWithoutSelfJoin) {
  auto server = Server::CreateListening();
  std::promise<std::unique_ptr<Connection>> handed;
  server->StartWaitingForConnections([&](std::unique_ptr<Connection> c) {
    server->Stop();
    handed.set_value(std::move(c));
  });
  auto host = Connection::Open(server->GetPort());
  auto future = handed.get_future();
  ASSERT_EQ(future.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_TRUE(future.get()->IsConnected());
  auto destroyed = std::async(std::launch::async, [&] { server.reset(); });
  EXPECT_EQ(destroyed.wait_for(std::chrono::seconds(5)), std::future_status::ready);
}

TEST(ServerListener, DestroyingAWaitingServerDoesNotWaitOutTheAcceptTimeout) {
  auto server = Server::CreateListening();
  server->StartWaitingForConnections([](std::unique_ptr<Connection>) {});
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  // The listener waits up to 10 s per pass; Stop must end that wait.
  auto destroyed = std::async(std::launch::async, [&] { server.reset(); });
  EXPECT_EQ(destroyed.wait_for(std::chrono::seconds(5)), std::future_status::ready);
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

TEST(ServerListener, EmptyCallbackOrStoppedServerStartsNothing) {
  pmtest::LogCapture log;
  auto server = Server::CreateListening();
  server->StartWaitingForConnections(nullptr);
  EXPECT_TRUE(log.Contains("Server::StartWaitingForConnections"));
  server->Stop();
  log.Clear();
  server->StartWaitingForConnections([](std::unique_ptr<Connection>) {});
  EXPECT_TRUE(log.Contains("was stopped"));
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
  rlimit low = saved;
  low.rlim_cur = std::min<rlim_t>(saved.rlim_cur, 1024);
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
