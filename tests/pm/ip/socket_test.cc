// Loopback sockets and the acceptor against the real kernel: ports, error
// classification, timeouts, waking a blocked accept, descriptor lifetime,
// and that a vanished peer never raises SIGPIPE.
#include "pm/ip/socket.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <future>
#include <thread>
#include <vector>

#include "support/log_capture.h"
#include "support/wait.h"

namespace {

using pm::ip::Acceptor;
using pm::ip::LastSocketError;
using pm::ip::Socket;

bool DescriptorOpen(int fd) { return fd >= 0 && ::fcntl(fd, F_GETFD) != -1; }

// A listening acceptor on a system-assigned port.
struct Listening {
  Acceptor acceptor;
  Listening() {
    EXPECT_TRUE(acceptor.Init(0));
    EXPECT_TRUE(acceptor.Bind());
    EXPECT_TRUE(acceptor.Listen());
  }
  int port() const { return acceptor.StoredPort(); }
};

// A connected pair: `client` connected to `server` through an acceptor.
struct Pair {
  Listening listening;
  Socket client;
  Socket server;
  Pair() {
    EXPECT_TRUE(client.Init(listening.port()));
    EXPECT_TRUE(client.Connect());
    EXPECT_TRUE(listening.acceptor.Accept(server, 5000));
  }
};

// Blocks SIGPIPE on this thread for the scope; a SIGPIPE raised by a send
// then stays pending where the test can see it instead of ending the process.
class SigpipeWatch {
 public:
  SigpipeWatch() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGPIPE);
    pthread_sigmask(SIG_BLOCK, &set, &previous_);
  }
  ~SigpipeWatch() {
    // Take a pending SIGPIPE away before unblocking, so a failing test does
    // not end the process.
    if (Raised()) {
      sigset_t set;
      sigemptyset(&set);
      sigaddset(&set, SIGPIPE);
      int signal = 0;
      sigwait(&set, &signal);
    }
    pthread_sigmask(SIG_SETMASK, &previous_, nullptr);
  }
  bool Raised() const {
    sigset_t pending;
    sigpending(&pending);
    return sigismember(&pending, SIGPIPE) == 1;
  }

 private:
  sigset_t previous_;
};

// ---------------------------------------------------------------------------

TEST(SocketErrors, TextKeepsBothNumbers) {
  EXPECT_EQ(pm::ip::ErrorText(LastSocketError{0, 10054}), "[errno=0,wsa=10054]");
  EXPECT_EQ(pm::ip::ErrorText(LastSocketError{0, 10061}), "[errno=0,wsa=10061]");
  EXPECT_EQ(pm::ip::ErrorText(LastSocketError{-3, 111}), "[errno=-3,wsa=111]");
}

TEST(SocketErrors, LinuxNumbersClassifyAsTheConnectionLayerExpects) {
  for (int e : {ENOTSOCK, EBADF, ECONNRESET, EPIPE}) {
    const LastSocketError error{e, e};
    EXPECT_TRUE(error.Gone()) << e;
    EXPECT_FALSE(error.TimedOut()) << e;
  }
  // An expired SO_RCVTIMEO is EAGAIN/EWOULDBLOCK on Linux: it must read as a
  // timeout, not as a dead peer.
  for (int e : {ECONNABORTED, ETIMEDOUT, EAGAIN, EWOULDBLOCK}) {
    const LastSocketError error{e, e};
    EXPECT_TRUE(error.TimedOut()) << e;
    EXPECT_FALSE(error.Gone()) << e;
  }
  EXPECT_TRUE((LastSocketError{EINTR, 0}).Interrupted());
  EXPECT_TRUE((LastSocketError{0, EINTR}).Interrupted());
  EXPECT_TRUE((LastSocketError{EISCONN, EISCONN}).AlreadyConnected());
  const LastSocketError refused{ECONNREFUSED, ECONNREFUSED};
  EXPECT_FALSE(refused.Gone() || refused.TimedOut() || refused.Interrupted() || refused.AlreadyConnected());
}

// ---------------------------------------------------------------------------

TEST(SocketPorts, BindToPortZeroGetsADistinctSystemPort) {
  Listening a;
  Listening b;
  EXPECT_GT(a.port(), 0);
  EXPECT_GT(b.port(), 0);
  EXPECT_NE(a.port(), b.port());
  EXPECT_EQ(a.acceptor.GetPort(), a.port());
}

TEST(SocketPorts, BindToAPortInUseFailsWithALogLine) {
  pmtest::LogCapture log;
  Listening taken;
  Socket second;
  ASSERT_TRUE(second.Init(taken.port()));
  EXPECT_FALSE(second.Bind());
  EXPECT_TRUE(log.Contains("ipc::Socket : Bind failed : err : " + std::to_string(EADDRINUSE) +
                           ", was : " + std::to_string(EADDRINUSE)));
}

TEST(SocketPorts, ConnectToAClosedPortFailsAndKeepsErrno) {
  pmtest::LogCapture log;
  int port = 0;
  {
    Listening gone;
    port = gone.port();
  }
  Socket client;
  ASSERT_TRUE(client.Init(port));
  EXPECT_FALSE(client.Connect());
  EXPECT_EQ(errno, ECONNREFUSED);  // the caller classifies this after the log line
  EXPECT_TRUE(log.Contains("Socket::Connect Failed : [errno=111,wsa=111]"));
}

// ---------------------------------------------------------------------------

TEST(SocketAccept, ConnectedEndsAreBlockingWithoutNagle) {
  Pair pair;
  for (Socket* s : {&pair.client, &pair.server}) {
    int on = 0;
    socklen_t length = sizeof(on);
    ASSERT_EQ(::getsockopt(s->GetHandle(), IPPROTO_TCP, TCP_NODELAY, &on, &length), 0);
    EXPECT_NE(on, 0);
    EXPECT_EQ(::fcntl(s->GetHandle(), F_GETFL) & O_NONBLOCK, 0);
  }
  // The accepted end's port is the peer's (the client's local) port.
  sockaddr_in local{};
  socklen_t length = sizeof(local);
  ASSERT_EQ(::getsockname(pair.client.GetHandle(), reinterpret_cast<sockaddr*>(&local), &length), 0);
  EXPECT_EQ(pair.server.StoredPort(), ntohs(local.sin_port));
  EXPECT_EQ(::fcntl(pair.listening.acceptor.GetHandle(), F_GETFL) & O_NONBLOCK, O_NONBLOCK);
}

TEST(SocketAccept, NobodyConnectingFailsAfterTheTimeout) {
  Listening listening;
  Socket target;
  EXPECT_FALSE(listening.acceptor.Accept(target, 30));
  EXPECT_EQ(target.GetHandle(), -1);
}

TEST(SocketAccept, CloseWakesAnAcceptWaitingOnAnotherThread) {
  Listening listening;
  const int fd = listening.acceptor.GetHandle();
  std::atomic<bool> done{false};
  bool accepted = true;
  std::thread waiter([&] {
    Socket target;
    accepted = listening.acceptor.Accept(target, 0);  // 0 means 60 seconds
    done = true;
  });
  // Let the waiter reach its poll (a close before it only makes it fail
  // sooner, which the test accepts as well).
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  listening.acceptor.Close();
  EXPECT_TRUE(pmtest::WaitFor([&] { return done.load(); }, std::chrono::seconds(20)));
  waiter.join();
  EXPECT_FALSE(accepted);
  // The number stays ours while a thread might still be inside Accept; the
  // owner releases it after joining.
  EXPECT_TRUE(DescriptorOpen(fd));
  listening.acceptor.ReleaseDescriptor();
  EXPECT_FALSE(DescriptorOpen(fd));
}

TEST(SocketAccept, AfterCloseAcceptFailsAtOnceEvenWithAPendingConnection) {
  Listening listening;
  Socket client;
  ASSERT_TRUE(client.Init(listening.port()));
  ASSERT_TRUE(client.Connect());
  listening.acceptor.Close();
  auto result = std::async(std::launch::async, [&] {
    Socket target;
    return listening.acceptor.Accept(target, 0);
  });
  ASSERT_EQ(result.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_FALSE(result.get());
}

// ---------------------------------------------------------------------------

TEST(SocketReceiveTimeout, LargestValueMeansWaitForEver) {
  Pair pair;
  timeval value{};
  socklen_t length = sizeof(value);
  ASSERT_TRUE(pair.server.SetReceiveTimeout(1500));
  ASSERT_EQ(::getsockopt(pair.server.GetHandle(), SOL_SOCKET, SO_RCVTIMEO, &value, &length), 0);
  EXPECT_EQ(value.tv_sec, 1);
  EXPECT_EQ(value.tv_usec, 500000);
  ASSERT_TRUE(pair.server.SetReceiveTimeout(pm::ip::kNoTimeout));
  ASSERT_EQ(::getsockopt(pair.server.GetHandle(), SOL_SOCKET, SO_RCVTIMEO, &value, &length), 0);
  EXPECT_EQ(value.tv_sec, 0);
  EXPECT_EQ(value.tv_usec, 0);
}

TEST(SocketReceiveTimeout, ExpiryClassifiesAsTimedOutNotGone) {
  Pair pair;
  ASSERT_TRUE(pair.server.SetReceiveTimeout(20));
  char buffer[4];
  EXPECT_LT(pair.server.ReceiveExact(buffer, sizeof buffer), 0);
  const auto error = LastSocketError::Read();
  EXPECT_TRUE(error.TimedOut()) << pm::ip::ErrorText(error);
  EXPECT_FALSE(error.Gone());
}

TEST(SocketReceive, ShutdownWakesABlockedReaderAndKeepsTheNumber) {
  Pair pair;
  const int fd = pair.server.GetHandle();
  std::atomic<bool> done{false};
  std::int64_t result = 1;
  std::thread reader([&] {
    char byte;
    result = pair.server.ReceiveExact(&byte, 1);
    done = true;
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  pair.server.Shutdown();
  EXPECT_TRUE(pmtest::WaitFor([&] { return done.load(); }, std::chrono::seconds(20)));
  reader.join();
  EXPECT_EQ(result, 0);
  EXPECT_TRUE(DescriptorOpen(fd));
  pair.server.Close();
  EXPECT_FALSE(DescriptorOpen(fd));
  EXPECT_EQ(pair.server.GetHandle(), -1);
}

// ---------------------------------------------------------------------------

TEST(SocketSendAll, LargeListArrivesWholeAndInOrder) {
  Pair pair;
  std::vector<std::uint8_t> big(3 * 1024 * 1024);
  for (std::size_t i = 0; i < big.size(); ++i) big[i] = static_cast<std::uint8_t>(i * 7);
  const std::uint8_t head[3] = {0xA, 0xB, 0xC};
  std::vector<std::uint8_t> got(big.size() + 3);
  std::thread reader([&] { EXPECT_EQ(pair.server.ReceiveExact(got.data(), got.size()), std::int64_t(got.size())); });
  EXPECT_EQ(pair.client.SendAll({{head, 3}, {nullptr, 0}, {big.data(), std::uint32_t(big.size())}}),
            std::int64_t(big.size() + 3));
  reader.join();
  EXPECT_TRUE(std::equal(head, head + 3, got.begin()));
  EXPECT_TRUE(std::equal(big.begin(), big.end(), got.begin() + 3));
}

TEST(SocketSigpipe, SendingToAPeerThatClosedNeverRaisesSigpipe) {
  SigpipeWatch watch;
  Pair pair;
  pair.server.Close();
  const char data[64] = {};
  bool failed = false;
  // The first send after the peer's close draws a reset; the next fail with
  // EPIPE, which is where SIGPIPE would be raised.
  for (int i = 0; i < 200 && !failed; ++i) {
    failed = pair.client.Send(data, sizeof data) < 0;
    if (!failed) std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  EXPECT_TRUE(failed);
  EXPECT_TRUE(LastSocketError::Read().Gone());
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(pair.client.SendAll({{data, 32}, {data, 32}}), 0);
    EXPECT_LT(pair.client.Send(data, sizeof data), 0);
  }
  EXPECT_FALSE(watch.Raised());
}

// ---------------------------------------------------------------------------

TEST(SocketWaitReadable, NoDescriptorsPollsNothingUntilTheDeadline) {
  Socket a;
  Socket b;
  EXPECT_TRUE(Socket::WaitReadable({&a, &b}, 20).empty());
  EXPECT_TRUE(Socket::WaitReadable({}, 5).empty());
}

TEST(SocketWaitReadable, ZeroTimeoutReturnsAtOnceEvenWhenReadable) {
  Pair pair;
  const char byte = 1;
  ASSERT_EQ(pair.client.Send(&byte, 1), 1);
  ASSERT_EQ(Socket::WaitReadable({&pair.server}, 5000).size(), 1u);
  EXPECT_TRUE(Socket::WaitReadable({&pair.server}, 0).empty());
  EXPECT_TRUE(Socket::WaitReadable({&pair.server}, -5).empty());
}

TEST(SocketWaitReadable, ReportsReadableAndHungUpSocketsInListOrder) {
  Pair one;
  Pair two;
  Pair quiet;
  const char byte = 1;
  ASSERT_EQ(two.client.Send(&byte, 1), 1);
  one.client.Close();  // hang-up counts as readable
  ASSERT_TRUE(pmtest::WaitFor([&] { return Socket::WaitReadable({&one.server, &two.server}, 100).size() == 2; }));
  const auto ready = Socket::WaitReadable({&quiet.server, &two.server, &one.server}, 1000);
  ASSERT_EQ(ready.size(), 2u);
  EXPECT_EQ(ready[0], &two.server);
  EXPECT_EQ(ready[1], &one.server);
  EXPECT_TRUE(Socket::WaitReadable({&quiet.server}, 10).empty());
}

}  // namespace
