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
//   Paired/...               the subject and the raw ping-pong alternately,
//                            round trip by round trip, so that both see the
//                            same machine load; counter "ratio".
// Prints the paired ratios at the end (goal: at most 1.5).
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
#include "pm/ipc/dispatcher.h"
#include "pm/ipc/framing.h"
#include "pm/ipc/server.h"
#include "pm/runtime/clock.h"
#include "pm/runtime/json.h"
#include "pm/runtime/little_endian.h"

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
  const std::uint32_t n = pm::LoadLe32(header);
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

// The baseline: a client socket and an echo thread that answers each request
// frame with the reply frame.
class RawPair {
 public:
  RawPair() : request_(pm::ipc::EncodeFrame(RequestText())), reply_(pm::ipc::EncodeFrame(ReplyText())) {
    client_ = ConnectTo(listener_.port);
    server_ = listener_.Accept();
    echo_ = std::thread([this] {
      std::string body;
      while (RecvFrame(server_, body)) {
        if (!SendAll(server_, reply_)) break;
      }
    });
  }
  ~RawPair() {
    ::shutdown(client_, SHUT_RDWR);
    echo_.join();
    ::close(client_);
    ::close(server_);
  }
  bool RoundTrip() { return SendAll(client_, request_) && RecvFrame(client_, body_); }

 private:
  Listener listener_;
  const std::string request_;
  const std::string reply_;
  int client_ = -1;
  int server_ = -1;
  std::string body_;
  std::thread echo_;
};

void InstallPingHandler(pm::RpcDispatcher& dispatcher) {
  dispatcher.RegisterHandler(kCommand, [](const Json& request, Json& response) {
    response["value"] = request.value("value", 0);
  });
}

// A plain-socket host sending requests to a dispatcher's handler.
class HostToDispatcher {
 public:
  HostToDispatcher() : request_(pm::ipc::EncodeFrame(RequestText())) {
    std::shared_ptr<pm::ipc::Connection> connection = pm::ipc::Connection::Open(listener_.port);
    host_ = listener_.Accept();
    if (!connection || host_ < 0) return;
    dispatcher_ = std::make_shared<pm::RpcDispatcher>(connection);
    InstallPingHandler(*dispatcher_);
    dispatcher_->Start();
  }
  ~HostToDispatcher() {
    if (dispatcher_) dispatcher_->Stop();
    if (host_ >= 0) ::close(host_);
  }
  bool Ready() const { return dispatcher_ != nullptr; }
  bool RoundTrip() {
    return SendAll(host_, request_) && RecvFrame(host_, body_) && body_ == ReplyText();
  }

 private:
  Listener listener_;
  const std::string request_;
  int host_ = -1;
  std::string body_;
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
};

// RpcRequest on one dispatcher, answered by a handler on another, the
// callback waking the caller.
class DispatcherPair {
 public:
  DispatcherPair() {
    server_ = pm::ipc::Server::CreateListening();
    if (!server_) return;
    std::shared_ptr<pm::ipc::Connection> taskEnd = pm::ipc::Connection::Open(server_->GetPort());
    std::shared_ptr<pm::ipc::Connection> hostEnd = server_->AcceptConnection(5000);
    if (!taskEnd || !hostEnd) return;
    task_ = std::make_shared<pm::RpcDispatcher>(taskEnd);
    host_ = std::make_shared<pm::RpcDispatcher>(hostEnd);
    InstallPingHandler(*host_);
    task_->Start();
    host_->Start();
  }
  ~DispatcherPair() {
    if (task_) task_->Stop();
    if (host_) host_->Stop();
  }
  bool Ready() const { return task_ && host_; }
  bool RoundTrip() {
    Json payload = {{"value", 12345}};
    task_->RpcRequest(kCommand, payload, 10000, [this](const Json&) {
      {
        std::lock_guard<std::mutex> guard(mutex_);
        ++completed_;
      }
      done_.notify_one();
    });
    ++expected_;
    std::unique_lock<std::mutex> lock(mutex_);
    return done_.wait_for(lock, std::chrono::seconds(5), [this] { return completed_ == expected_; });
  }

 private:
  std::unique_ptr<pm::ipc::Server> server_;
  std::shared_ptr<pm::RpcDispatcher> task_;
  std::shared_ptr<pm::RpcDispatcher> host_;
  std::mutex mutex_;
  std::condition_variable done_;
  std::uint64_t completed_ = 0;  // guarded by mutex_
  std::uint64_t expected_ = 0;   // caller's thread only
};

void RawPingPong(benchmark::State& state) {
  RawPair raw;
  for (auto _ : state) {
    if (!raw.RoundTrip()) {
      state.SkipWithError("raw ping-pong failed");
      break;
    }
  }
}

template <class Subject>
void Alone(benchmark::State& state) {
  Subject subject;
  if (!subject.Ready()) {
    state.SkipWithError("no connection");
    return;
  }
  for (auto _ : state) {
    if (!subject.RoundTrip()) {
      state.SkipWithError("round trip failed");
      break;
    }
  }
}

// The subject and the raw ping-pong alternately, so that both see the same
// load; counters: raw_ns and subject_ns per round trip, and their ratio.
template <class Subject>
void Paired(benchmark::State& state) {
  RawPair raw;
  Subject subject;
  if (!subject.Ready()) {
    state.SkipWithError("no connection");
    return;
  }
  std::int64_t rawNs = 0;
  std::int64_t subjectNs = 0;
  for (auto _ : state) {
    const std::int64_t t0 = pm::SteadyNowNs();
    const bool rawOk = raw.RoundTrip();
    const std::int64_t t1 = pm::SteadyNowNs();
    const bool subjectOk = subject.RoundTrip();
    const std::int64_t t2 = pm::SteadyNowNs();
    if (!rawOk || !subjectOk) {
      state.SkipWithError("round trip failed");
      return;
    }
    rawNs += t1 - t0;
    subjectNs += t2 - t1;
  }
  const double n = static_cast<double>(state.iterations());
  state.counters["raw_ns"] = static_cast<double>(rawNs) / n;
  state.counters["subject_ns"] = static_cast<double>(subjectNs) / n;
  state.counters["ratio"] = rawNs > 0 ? static_cast<double>(subjectNs) / static_cast<double>(rawNs) : 0;
}

constexpr double kGoal = 1.5;

// The console report, plus the ratio counter of each paired benchmark (the
// median when repeated), printed at the end.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run& run : runs) {
      if (run.error_occurred) continue;
      const auto counter = run.counters.find("ratio");
      if (counter == run.counters.end()) continue;
      const std::string& name = run.run_name.function_name;
      if (run.run_type == Run::RT_Aggregate && run.aggregate_name == "median") {
        ratio_[name] = counter->second.value;
        fromMedian_[name] = true;
      } else if (run.run_type == Run::RT_Iteration && !fromMedian_[name]) {
        ratio_[name] = counter->second.value;
      }
    }
  }
  void PrintRatios() const {
    for (const auto& [name, ratio] : ratio_) {
      std::printf("ratio %s = %.2f (goal <= %.2f: %s)\n", name.c_str(), ratio, kGoal,
                  ratio <= kGoal ? "met" : "MISSED");
    }
  }

 private:
  std::map<std::string, double> ratio_;
  std::map<std::string, bool> fromMedian_;
};

}  // namespace

int main(int argc, char** argv) {
  benchmark::RegisterBenchmark("RawPingPong", RawPingPong)->UseRealTime();
  benchmark::RegisterBenchmark("HostRequestToDispatcher", Alone<HostToDispatcher>)->UseRealTime();
  benchmark::RegisterBenchmark("DispatcherRoundTrip", Alone<DispatcherPair>)->UseRealTime();
  benchmark::RegisterBenchmark("Paired/HostRequestToDispatcher", Paired<HostToDispatcher>)->UseRealTime();
  benchmark::RegisterBenchmark("Paired/DispatcherRoundTrip", Paired<DispatcherPair>)->UseRealTime();
  benchmark::Initialize(&argc, argv);
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  reporter.PrintRatios();
  benchmark::Shutdown();
  return 0;
}
