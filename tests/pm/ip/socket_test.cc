// Loopback sockets and the acceptor against the real kernel: ports, error
// classification, timeouts, waking a blocked accept, descriptor lifetime, and
// that a vanished peer never raises SIGPIPE. (An accepted end that did not
// block would fail every timed read of the connection tests; Nagle's delay
// is the benchmarks'.) Waking a blocked reader or
// sender, readiness and sending lists are tested through the connections
// above (tests/pm/ipc).
#include "pm/ip/socket.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/time.h>

#include "support/log_capture.h"
#include "support/wait.h"

namespace {

using pm::ip::LastSocketError;
using pm::ip::Socket;

bool DescriptorOpen(int fd) { return fd >= 0 && ::fcntl(fd, F_GETFD) != -1; }

// A listening acceptor on a system-assigned port.
struct Listening {
  pm::ip::Acceptor acceptor;
  Listening() { EXPECT_TRUE(acceptor.Init(0) && acceptor.Bind() && acceptor.Listen()); }
  int port() const { return acceptor.StoredPort(); }
};

// A connected pair: `client` connected to `server` through an acceptor.
struct Pair {
  Listening listening;
  Socket client;
  Socket server;
  Pair() {
    EXPECT_TRUE(client.Init(listening.port()) && client.Connect());
    EXPECT_TRUE(listening.acceptor.Accept(server, 5000));
  }
};

TEST(SocketErrors, ClassifyByTheirNumbers) {
  struct Row {
    int err, wsa;
    const char* classes;  // g: gone, t: timed out, i: interrupted, a: already connected
  };
  // An expired SO_RCVTIMEO is EAGAIN/EWOULDBLOCK on Linux: it must read as a
  // timeout, not as a dead peer.
  const Row rows[] = {
      {ENOTSOCK, ENOTSOCK, "g"},          {EBADF, EBADF, "g"},           {ECONNRESET, ECONNRESET, "g"},
      {EPIPE, EPIPE, "g"},                {ECONNABORTED, ECONNABORTED, "t"}, {ETIMEDOUT, ETIMEDOUT, "t"},
      {EAGAIN, EAGAIN, "t"},              {EINTR, 0, "i"},               {0, EINTR, "i"},
      {EISCONN, EISCONN, "a"},            {ECONNREFUSED, ECONNREFUSED, ""}, {0, 10054, ""},
      {-3, 111, ""},
  };
  for (const Row& row : rows) {
    const LastSocketError error{row.err, row.wsa};
    SCOPED_TRACE(pm::ip::ErrorText(error));  // (its form: in the acceptor's line, tests/pm/ipc)
    EXPECT_EQ(std::string(error.Gone() ? "g" : "") + (error.TimedOut() ? "t" : "") + (error.Interrupted() ? "i" : "") +
                  (error.AlreadyConnected() ? "a" : ""),
              row.classes);
  }
}

TEST(SocketPorts, PortZeroGivesDistinctPortsAndTakenOrClosedPortsFailWithALogLine) {
  pmtest::LogCapture log;
  Listening a, b;
  EXPECT_GT(a.port(), 0);
  EXPECT_NE(a.port(), b.port());

  Socket second;
  ASSERT_TRUE(second.Init(a.port()));
  EXPECT_FALSE(second.Bind());
  EXPECT_EQ(log.Count("Bind failed"), 1);

  b.acceptor.Close();
  b.acceptor.ReleaseDescriptor();
  Socket client;
  ASSERT_TRUE(client.Init(b.port()));  // the port it had
  EXPECT_FALSE(client.Connect());
  EXPECT_EQ(errno, ECONNREFUSED);  // the caller classifies this after the log line
  EXPECT_EQ(log.Count("Connect Failed"), 1);
}

// Nobody connecting fails after the timeout. Close wakes an accept waiting on
// another thread, and one after it fails at once even with a connection pending; the number stays ours while a thread
// might still be inside Accept, until the owner releases it.
TEST(SocketAccept, CloseWakesAWaitingAcceptAndKeepsTheNumberUntilReleased) {
  Listening listening;
  const int fd = listening.acceptor.GetHandle();
  Socket target;
  EXPECT_FALSE(listening.acceptor.Accept(target, 30));
  EXPECT_EQ(target.GetHandle(), -1);
  EXPECT_FALSE(pmtest::WokenBy([&] { return listening.acceptor.Accept(target, 0); },  // 0 means 60 seconds
                               [&] { listening.acceptor.Close(); }));
  EXPECT_TRUE(DescriptorOpen(fd));
  listening.acceptor.ReleaseDescriptor();
  EXPECT_FALSE(DescriptorOpen(fd));

  Listening pending;
  Socket client;
  ASSERT_TRUE(client.Init(pending.port()) && client.Connect());
  pending.acceptor.Close();
  EXPECT_FALSE(pmtest::WokenBy([&] { return pending.acceptor.Accept(target, 0); }, [] {}));
}

// (A timeout that expires reads as one, not as a dead peer: tests/pm/ipc.)
TEST(SocketReceive, TimeoutIsSetExactlyAndTheLargestValueWaitsForEver) {
  Pair pair;
  // Milliseconds set, and the seconds and microseconds the socket holds.
  for (const auto& [ms, sec, usec] : {std::tuple{std::int64_t{1500}, 1, 500000}, {pm::ip::kNoTimeout, 0, 0}}) {
    ASSERT_TRUE(pair.server.SetReceiveTimeout(ms));
    timeval value{};
    socklen_t length = sizeof(value);
    EXPECT_EQ(::getsockopt(pair.server.GetHandle(), SOL_SOCKET, SO_RCVTIMEO, &value, &length), 0);
    EXPECT_EQ(std::make_pair(value.tv_sec, value.tv_usec), std::make_pair(time_t{sec}, suseconds_t{usec}));
  }
}

// SIGPIPE is blocked on this thread for the test, so that one raised by a send
// stays pending where the test sees it instead of ending the process.
TEST(SocketSigpipe, SendingToAPeerThatClosedNeverRaisesSigpipe) {
  sigset_t pipe, previous, pending;
  sigemptyset(&pipe);
  sigaddset(&pipe, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &pipe, &previous);
  {
    Pair pair;
    pair.server.Close();
    const char data[64] = {};
    // The first send after the peer's close draws a reset; the next fail with
    // EPIPE, which is where SIGPIPE would be raised.
    EXPECT_TRUE(pmtest::WaitFor([&] { return pair.client.Send(data, sizeof data) < 0; }));
    EXPECT_TRUE(LastSocketError::Read().Gone());
    EXPECT_EQ(pair.client.SendAll({{data, 32}, {data, 32}}), 0);
    EXPECT_LT(pair.client.Send(data, sizeof data), 0);
  }
  sigpending(&pending);
  const bool raised = sigismember(&pending, SIGPIPE) == 1;
  EXPECT_FALSE(raised);
  int signal = 0;
  if (raised) sigwait(&pipe, &signal);  // taken away so that a failure does not end the process
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
}

}  // namespace
