// The Windows side of the platform layer, run under Wine: loopback sockets
// on Winsock 2 (started by the first socket; a shutdown or an acceptor's
// close wakes a thread blocked on the socket, which shutdown alone does not
// do there), CPU segments as named file mappings in the paging file, and
// what the system tells about a process (liveness, CPU time).
#include <gtest/gtest.h>

#include <windows.h>

#include <chrono>
#include <cstring>
#include <functional>
#include <future>
#include <memory>
#include <string>
#include <vector>

#include "pm/ip/socket.h"
#include "pm/runtime/system.h"
#include "pm/shm/shared_memory.h"

namespace {

using namespace std::chrono_literals;

// Generous: a wake that works comes within milliseconds.
constexpr auto kWakeLimit = 20s;

struct Connected {
  pm::ip::Acceptor listener;
  pm::ip::Socket client;
  pm::ip::Socket server;
  bool ok = listener.Init(0) && listener.Bind() && listener.Listen() && client.Init(listener.GetPort()) &&
            client.Connect() && listener.Accept(server, 10'000);
};

TEST(WindowsSocket, GatherSendArrivesWholeAndInOrder) {
  Connected c;
  ASSERT_TRUE(c.ok);
  // Larger than the socket buffers, so the sender continues partial writes.
  std::vector<std::string> pieces = {"head", std::string(3 << 20, 'x'), "", "tail"};
  pieces[1][12345] = 'y';
  std::string expected;
  pm::BufferList list;
  for (const std::string& p : pieces) {
    expected += p;
    list.emplace_back(p.data(), static_cast<std::uint32_t>(p.size()));
  }
  auto reader = std::async(std::launch::async, [&] {
    std::string got(expected.size(), '\0');
    return c.server.ReceiveExact(got.data(), got.size()) == static_cast<std::int64_t>(got.size()) ? got : "";
  });
  EXPECT_EQ(c.client.SendAll(list), static_cast<std::int64_t>(expected.size()));
  ASSERT_EQ(reader.wait_for(kWakeLimit), std::future_status::ready);
  EXPECT_TRUE(reader.get() == expected);
  c.client.Close();
  char byte = 0;
  EXPECT_EQ(c.server.Receive(&byte, 1), 0) << "the peer's close is the end of the stream";
}

// A thread blocked on a socket, and what another thread does to wake it.
TEST(WindowsSocket, ABlockedThreadIsWokenPromptly) {
  struct WakeCase {
    const char* name;
    std::function<bool(Connected&)> block;  // runs on its own thread; true when it ended as a wake should
    std::function<void(Connected&)> wake;
  };
  const WakeCase cases[] = {
      {"ReceiveByShutdown",
       [](Connected& c) {
         char buffer[16];
         return c.server.ReceiveExact(buffer, sizeof buffer) <= 0;
       },
       [](Connected& c) { c.server.Shutdown(); }},
      {"WaitReadableByShutdown",
       [](Connected& c) {
         return pm::ip::Socket::WaitReadable({&c.server}, 60'000) == std::vector<pm::ip::Socket*>{&c.server};
       },
       [](Connected& c) { c.server.Shutdown(); }},
      {"WaitReadableByData",
       [](Connected& c) {
         return pm::ip::Socket::WaitReadable({&c.client, &c.server}, 60'000) ==
                std::vector<pm::ip::Socket*>{&c.server};
       },
       [](Connected& c) { c.client.Send("!", 1); }},
      {"AcceptByClose",
       [](Connected& c) {
         pm::ip::Socket next;
         return !c.listener.Accept(next, 60'000);
       },
       [](Connected& c) { c.listener.Close(); }}};
  for (const WakeCase& wakeCase : cases) {
    SCOPED_TRACE(wakeCase.name);
    Connected c;
    ASSERT_TRUE(c.ok);
    auto blocked = std::async(std::launch::async, [&] { return wakeCase.block(c); });
    // Give it the chance to block; the case holds whether or not it has.
    EXPECT_EQ(blocked.wait_for(200ms), std::future_status::timeout);
    wakeCase.wake(c);
    ASSERT_EQ(blocked.wait_for(kWakeLimit), std::future_status::ready) << "still blocked";
    EXPECT_TRUE(blocked.get());
  }
  // A wait after the socket's own shutdown sees it at once.
  Connected c;
  ASSERT_TRUE(c.ok);
  c.server.Shutdown();
  EXPECT_EQ(pm::ip::Socket::WaitReadable({&c.server}, 60'000), std::vector<pm::ip::Socket*>{&c.server});
}

std::string UniqueName(const char* what) {
  return "pmtestwin" + std::to_string(pm::CurrentProcessId()) + "_" + what;
}

TEST(WindowsSegment, NamedMappingIsSharedAndGoesWithItsLastHandle) {
  const std::string name = UniqueName("shared");
  {
    auto writer = pm::NewCpuSegment();
    ASSERT_TRUE(writer->Create(name, 8192));
    std::memcpy(writer->Data() + 8000, "frame", 5);

    auto reader = pm::NewCpuSegment();
    ASSERT_TRUE(reader->Open(name, 8192));
    EXPECT_EQ(std::memcmp(reader->Data() + 8000, "frame", 5), 0);
    reader->Data()[0] = 7;
    EXPECT_EQ(writer->Data()[0], 7);

    // Create on an existing name opens it, no larger than it was made.
    auto again = pm::NewCpuSegment();
    EXPECT_TRUE(again->Create(name, 4096));
    EXPECT_EQ(again->Data()[0], 7);
    EXPECT_FALSE(pm::NewCpuSegment()->Open(name, 1 << 20));
  }
  EXPECT_FALSE(pm::NewCpuSegment()->Open(name, 8192)) << "nothing is left once every handle closed";
}

// A size of zero, a backslash (the namespace separator) and a missing name
// fail and map nothing. (Names made up for unnamed segments come from the
// fresh-id generator both systems share: tests/pm/runtime.)
TEST(WindowsSegment, BadRequestsFailAndMapNothing) {
  const std::function<bool(pm::SharedCpuMemory&)> attempts[] = {
      [](pm::SharedCpuMemory& s) { return s.Create(UniqueName("zero"), 0); },
      [](pm::SharedCpuMemory& s) { return s.Create(UniqueName("a\\b"), 4096); },
      [](pm::SharedCpuMemory& s) { return s.Open(UniqueName("missing"), 4096); }};
  for (const auto& attempt : attempts) {
    SCOPED_TRACE(&attempt - attempts);
    auto segment = pm::NewCpuSegment();
    EXPECT_FALSE(attempt(*segment));
    EXPECT_EQ(segment->Data(), nullptr);
  }
}

// A process that ended is no longer alive although it can still be opened
// (here: its handle is still held); a process uses CPU time as it runs.
TEST(WindowsProcess, AliveAndCpuTimeOfItselfAndOfAnEndedChild) {
  const int self = pm::CurrentProcessId();
  EXPECT_TRUE(pm::ProcessAlive(self));
  const auto limit = std::chrono::steady_clock::now() + 60s;
  while (pm::ProcessCpuSeconds(self) == 0 && std::chrono::steady_clock::now() < limit) {
  }
  EXPECT_GT(pm::ProcessCpuSeconds(self), 0);

  char program[MAX_PATH] = {};
  ASSERT_GT(::GetModuleFileNameA(nullptr, program, MAX_PATH), 0u);
  std::string line = std::string("\"") + program + "\" --gtest_filter=None.None";
  STARTUPINFOA start{};
  start.cb = sizeof start;
  PROCESS_INFORMATION child{};
  ASSERT_TRUE(::CreateProcessA(program, line.data(), nullptr, nullptr, FALSE, 0, nullptr, nullptr, &start, &child));
  EXPECT_EQ(::WaitForSingleObject(child.hProcess, 60'000), WAIT_OBJECT_0);
  EXPECT_FALSE(pm::ProcessAlive(static_cast<int>(child.dwProcessId)));
  ::CloseHandle(child.hThread);
  ::CloseHandle(child.hProcess);
  EXPECT_FALSE(pm::ProcessAlive(0));
}

}  // namespace
