// Queue producer round trip and throughput against a raw loopback TCP
// ping-pong of the same bytes (64 out, 4 back), measured in the same run.
//
//   BM_RawPingPong           64-byte write, 4-byte answer, plain sockets
//   BM_ProducerRoundTrip     Send of a 60-byte record until the release
//                            callback fires; counter "ratio" = its time per
//                            round trip / a raw ping-pong measured right after
//                            it in the same process (goal: at most 1.5)
//   BM_ProducerInFlight8     records per second with 8 records in flight
#include <benchmark/benchmark.h>
#include <sys/socket.h>

#include <array>
#include <atomic>
#include <chrono>
#include <thread>

#include "pm/ipc/queue_producer.h"
#include "pm/ipc/server.h"

namespace {

using pm::ipc::Connection;
using pm::ipc::Server;
using pm::ipc::queue::Producer;

constexpr std::size_t kRecord = 60;

bool ReadAll(int fd, void* data, std::size_t length) {
  auto* out = static_cast<char*>(data);
  while (length > 0) {
    const ssize_t got = ::recv(fd, out, length, 0);
    if (got <= 0) return false;
    out += got;
    length -= static_cast<std::size_t>(got);
  }
  return true;
}

bool WriteAll(int fd, const void* data, std::size_t length) {
  return ::send(fd, data, length, MSG_NOSIGNAL) == static_cast<ssize_t>(length);
}

// A loopback pair and a host thread that answers every 64-byte block with
// its first 4 bytes (the token), until the pair closes.
struct Host {
  std::unique_ptr<Server> server = Server::CreateListening();
  std::shared_ptr<Connection> hostEnd = Connection::Open(server->GetPort());
  std::shared_ptr<Connection> taskEnd = server->AcceptConnection(5000);
  std::thread echo;

  Host() {
    echo = std::thread([fd = hostEnd->GetSocket().GetHandle()] {
      std::array<std::uint8_t, 4 + kRecord> block;
      while (ReadAll(fd, block.data(), block.size()) && WriteAll(fd, block.data(), 4)) {
      }
    });
  }
  ~Host() {
    taskEnd->Close();
    hostEnd->Close();
    echo.join();
  }
};

// ns per raw ping-pong over `rounds` rounds on a fresh pair.
double RawPingPongNs(std::int64_t rounds) {
  Host host;
  const int fd = host.taskEnd->GetSocket().GetHandle();
  std::array<std::uint8_t, 4 + kRecord> block{};
  std::uint8_t answer[4];
  const auto start = std::chrono::steady_clock::now();
  for (std::int64_t i = 0; i < rounds; ++i) {
    WriteAll(fd, block.data(), block.size());
    ReadAll(fd, answer, 4);
  }
  const auto elapsed = std::chrono::steady_clock::now() - start;
  return std::chrono::duration<double, std::nano>(elapsed).count() / static_cast<double>(rounds);
}

void BM_RawPingPong(benchmark::State& state) {
  Host host;
  const int fd = host.taskEnd->GetSocket().GetHandle();
  std::array<std::uint8_t, 4 + kRecord> block{};
  std::uint8_t answer[4];
  for (auto _ : state) {
    WriteAll(fd, block.data(), block.size());
    ReadAll(fd, answer, 4);
  }
}
BENCHMARK(BM_RawPingPong)->UseRealTime();

void BM_ProducerRoundTrip(benchmark::State& state) {
  Host host;
  std::atomic<std::uint32_t> released{0};
  Producer producer;
  producer.Start(kRecord, [&](std::uint32_t) {
    released.fetch_add(1);
    released.notify_one();
  });
  producer.AddConnection(host.taskEnd);
  std::array<std::uint8_t, kRecord> record{};
  std::uint32_t token = 0;
  const auto start = std::chrono::steady_clock::now();
  for (auto _ : state) {
    const std::uint32_t before = released.load();
    producer.Send(token++, {{record.data(), kRecord}});
    std::uint32_t now;
    while ((now = released.load()) == before) released.wait(now);
  }
  const auto elapsed = std::chrono::steady_clock::now() - start;
  producer.Stop();
  const double ns = std::chrono::duration<double, std::nano>(elapsed).count() / static_cast<double>(state.iterations());
  const double raw = RawPingPongNs(std::max<std::int64_t>(state.iterations(), 1000));
  state.counters["raw_ns"] = raw;
  state.counters["ratio"] = ns / raw;
}
BENCHMARK(BM_ProducerRoundTrip)->UseRealTime();

void BM_ProducerInFlight8(benchmark::State& state) {
  constexpr int kInFlight = 8;
  Host host;
  std::atomic<std::int64_t> released{0};
  Producer producer;
  producer.Start(kRecord, [&](std::uint32_t) {
    released.fetch_add(1);
    released.notify_one();
  });
  producer.AddConnection(host.taskEnd);
  std::array<std::uint8_t, kRecord> record{};
  std::int64_t sent = 0;
  for (auto _ : state) {
    std::int64_t done;
    while (sent - (done = released.load()) >= kInFlight) released.wait(done);
    producer.Send(static_cast<std::uint32_t>(sent % 1024), {{record.data(), kRecord}});
    ++sent;
  }
  std::int64_t done;
  while ((done = released.load()) < sent) released.wait(done);
  producer.Stop();
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ProducerInFlight8)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
