// Request dispatcher round trips over real loopback connections, against a
// raw TCP ping-pong of the same frames measured in the same run:
//   RawPingPong              one thread writes the request frame, an echo
//                            thread answers with the reply frame; plain
//                            send/recv, no JSON.
//   HostRequestToDispatcher  a plain-socket host sends the request; the
//                            dispatcher's receive thread parses it, runs the
//                            handler and sends the reply.
//   DispatcherRoundTrip      RpcRequest on one dispatcher, the handler on a
//                            second one, the reply completing the pending
//                            request and its callback waking the caller.
// Prints the ratios to the raw ping-pong at the end (goal: at most 1.5).
#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <benchmark/benchmark.h>
#include <nlohmann/json.hpp>

#include "pm/ipc/connection.h"
#include "pm/ipc/server.h"
#include "pm/runtime/dispatcher.h"
#include "pm/runtime/json.h"

namespace {

using Json = nlohmann::json;

constexpr const char* kCommand = "bench::ping";

// The frames the dispatcher benchmarks put on the wire.
std::string RequestText() {
  return pmjson::Dump(
      {{"pm::command", kCommand}, {"pm::request", true}, {"pm::unique_id", 1000}, {"value", 12345}});
}
std::string ReplyText() {
  return pmjson::Dump(
      {{"pm::command", kCommand}, {"pm::response", true}, {"pm::unique_id", 1000}, {"value", 12345}});
}

std::string Frame(const std::string& text) {
  const auto n = static_cast<std::uint32_t>(text.size());
  std::string out(4, '\0');
  for (int i = 0; i < 4; ++i) out[static_cast<std::size_t>(i)] = static_cast<char>((n >> (8 * i)) & 0xFF);
  return out + text;
}

bool SendAll(int fd, const std::string& bytes) {
  std::size_t at = 0;
  while (at < bytes.size()) {
    const ssize_t n = ::send(fd, bytes.data() + at, bytes.size() - at, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    at += static_cast<std::size_t>(n);
  }
  return true;
}

bool RecvExact(int fd, char* out, std::size_t n) {
  std::size_t at = 0;
  while (at < n) {
    const ssize_t got = ::recv(fd, out + at, n - at, 0);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) return false;
    at += static_cast<std::size_t>(got);
  }
  return true;
}

// One frame into `body`; false at the end of the stream.
bool RecvFrame(int fd, std::string& body) {
  unsigned char header[4];
  if (!RecvExact(fd, reinterpret_cast<char*>(header), 4)) return false;
  const std::uint32_t n = header[0] | header[1] << 8 | header[2] << 16 |
                          static_cast<std::uint32_t>(header[3]) << 24;
  body.resize(n);
  return RecvExact(fd, body.data(), n);
}

// A connected pair of plain loopback TCP sockets (Nagle off), or a listener
// for Connection::Open.
struct Listener {
  int fd = -1;
  int port = 0;
  Listener() {
    fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address);
    ::listen(fd, 4);
    ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
    port = ntohs(address.sin_port);
  }
  ~Listener() { ::close(fd); }
  int Accept() const {
    const int peer = ::accept4(fd, nullptr, nullptr, SOCK_CLOEXEC);
    const int one = 1;
    ::setsockopt(peer, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    return peer;
  }
};

int ConnectTo(int port) {
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(static_cast<std::uint16_t>(port));
  ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address);
  const int one = 1;
  ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
  return fd;
}

void RawPingPong(benchmark::State& state) {
  Listener listener;
  const int client = ConnectTo(listener.port);
  const int server = listener.Accept();
  const std::string request = Frame(RequestText());
  const std::string reply = Frame(ReplyText());
  std::thread echo([&] {
    std::string body;
    while (RecvFrame(server, body)) {
      if (!SendAll(server, reply)) break;
    }
  });
  std::string body;
  for (auto _ : state) {
    if (!SendAll(client, request) || !RecvFrame(client, body)) {
      state.SkipWithError("raw ping-pong failed");
      break;
    }
  }
  ::shutdown(client, SHUT_RDWR);
  echo.join();
  ::close(client);
  ::close(server);
}

void InstallPingHandler(pm::RpcDispatcher& dispatcher) {
  dispatcher.RegisterHandler(kCommand, [](const Json& request, Json& response) {
    response["value"] = request.value("value", 0);
  });
}

void HostRequestToDispatcher(benchmark::State& state) {
  Listener listener;
  std::shared_ptr<pm::ipc::Connection> connection = pm::ipc::Connection::Open(listener.port);
  const int host = listener.Accept();
  if (!connection || host < 0) {
    state.SkipWithError("no connection");
    return;
  }
  auto dispatcher = std::make_shared<pm::RpcDispatcher>(connection);
  InstallPingHandler(*dispatcher);
  dispatcher->Start();
  const std::string request = Frame(RequestText());
  std::string body;
  for (auto _ : state) {
    if (!SendAll(host, request) || !RecvFrame(host, body)) {
      state.SkipWithError("round trip failed");
      break;
    }
  }
  if (body != ReplyText()) state.SkipWithError("unexpected reply");
  dispatcher->Stop();
  ::close(host);
}

void DispatcherRoundTrip(benchmark::State& state) {
  auto server = pm::ipc::Server::CreateListening();
  if (!server) {
    state.SkipWithError("no server");
    return;
  }
  std::shared_ptr<pm::ipc::Connection> taskEnd = pm::ipc::Connection::Open(server->GetPort());
  std::shared_ptr<pm::ipc::Connection> hostEnd = server->AcceptConnection(5000);
  if (!taskEnd || !hostEnd) {
    state.SkipWithError("no connection");
    return;
  }
  auto task = std::make_shared<pm::RpcDispatcher>(taskEnd);
  auto host = std::make_shared<pm::RpcDispatcher>(hostEnd);
  InstallPingHandler(*host);
  task->Start();
  host->Start();

  std::mutex mutex;
  std::condition_variable done;
  std::uint64_t completed = 0;  // guarded by mutex
  std::uint64_t expected = 0;
  for (auto _ : state) {
    Json payload = {{"value", 12345}};
    task->RpcRequest(kCommand, payload, 10000, [&](const Json&) {
      std::lock_guard<std::mutex> guard(mutex);
      ++completed;
      done.notify_one();
    });
    ++expected;
    std::unique_lock<std::mutex> lock(mutex);
    if (!done.wait_for(lock, std::chrono::seconds(5), [&] { return completed == expected; })) {
      state.SkipWithError("reply missing");
      break;
    }
  }
  task->Stop();
  host->Stop();
}

struct Comparison {
  const char* subject;
  const char* baseline;
  double goal;
};
constexpr Comparison kComparisons[] = {
    {"HostRequestToDispatcher", "RawPingPong", 1.5},
    {"DispatcherRoundTrip", "RawPingPong", 1.5},
};

// The console report, plus the time per iteration of each benchmark for the
// ratios printed at the end.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    // With --benchmark_repetitions the median stands for the benchmark.
    for (const Run& run : runs) {
      if (run.error_occurred) continue;
      const std::string& name = run.run_name.function_name;
      if (run.run_type == Run::RT_Aggregate && run.aggregate_name == "median") {
        realTime_[name] = run.GetAdjustedRealTime();
        fromMedian_[name] = true;
      } else if (run.run_type == Run::RT_Iteration && !fromMedian_[name]) {
        realTime_[name] = run.GetAdjustedRealTime();
      }
    }
  }
  void PrintRatios() const {
    for (const Comparison& c : kComparisons) {
      const auto s = realTime_.find(c.subject);
      const auto b = realTime_.find(c.baseline);
      if (s == realTime_.end() || b == realTime_.end() || b->second <= 0) continue;
      const double ratio = s->second / b->second;
      std::printf("ratio %s / %s = %.2f (goal <= %.2f: %s)\n", c.subject, c.baseline, ratio, c.goal,
                  ratio <= c.goal ? "met" : "MISSED");
    }
  }

 private:
  std::map<std::string, double> realTime_;
  std::map<std::string, bool> fromMedian_;
};

}  // namespace

int main(int argc, char** argv) {
  benchmark::RegisterBenchmark("RawPingPong", RawPingPong)->UseRealTime();
  benchmark::RegisterBenchmark("HostRequestToDispatcher", HostRequestToDispatcher)->UseRealTime();
  benchmark::RegisterBenchmark("DispatcherRoundTrip", DispatcherRoundTrip)->UseRealTime();
  benchmark::Initialize(&argc, argv);
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  reporter.PrintRatios();
  benchmark::Shutdown();
  return 0;
}
