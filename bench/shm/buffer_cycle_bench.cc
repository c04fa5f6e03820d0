// The whole trip of a frame through a source's buffer queue: request a
// buffer, copy the picture in (from a source with another stride), send it,
// and wait until the host (a reader thread on the real queue connection) has
// read the record and returned the token, so the segment is free again.
// Compared with a plain memcpy of the same bytes measured in the same run;
// segments are reused, so after warm-up no page is faulted in.
//
// Prints per-cycle times and the ratio cycle / memcpy as counters.

#include <benchmark/benchmark.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <memory>
#include <thread>
#include <vector>

#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"
#include "pm/ipc/server.h"
#include "pm/shm/shared_memory_queue.h"
#include "pm/task/callbacks.h"

namespace {

using Clock = std::chrono::steady_clock;

// A task-side dispatcher, its callbacks with an open queue, and a host thread
// that returns every token it reads.
class Harness {
 public:
  Harness() {
    auto server = pm::ipc::Server::CreateListening();
    std::shared_ptr<pm::ipc::Connection> task = pm::ipc::Connection::Open(server->GetPort());
    host_ = server->AcceptConnection(5000);
    dispatcher_ = std::make_shared<pm::RpcDispatcher>(task);
    dispatcher_->Start();
    callbacks_ = std::make_shared<pm::SourceCallbacks>(dispatcher_, "bench");
    callbacks_->OpenBufferQueue(dispatcher_, "bench");
    reader_ = pm::ipc::Connection::Open(callbacks_->Producer()->Port());
    while (!callbacks_->Producer()->HostConnected()) std::this_thread::yield();
    thread_ = std::thread([this] {
      std::uint8_t record[64];
      while (reader_->ReadFromSocket(record, sizeof record, 200) || running_.load()) {
        if (!reader_->IsConnected()) break;
        std::uint32_t token;
        std::memcpy(&token, record, 4);
        pm::BufferList list;
        list.emplace_back(&token, 4u);
        reader_->Send(std::move(list));
      }
    });
  }
  ~Harness() {
    running_ = false;
    reader_->Close();
    thread_.join();
    callbacks_.reset();
    dispatcher_->Stop();
  }
  pm::SourceCallbacks& Callbacks() { return *callbacks_; }

 private:
  std::shared_ptr<pm::ipc::Connection> host_;
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
  std::shared_ptr<pm::SourceCallbacks> callbacks_;
  std::shared_ptr<pm::ipc::Connection> reader_;
  std::atomic<bool> running_{true};
  std::thread thread_;
};

double MemcpyNsPerOp(const std::uint8_t* from, std::uint8_t* to, std::size_t bytes) {
  constexpr int kRounds = 40;
  std::memcpy(to, from, bytes);
  const auto start = Clock::now();
  for (int i = 0; i < kRounds; ++i) {
    std::memcpy(to, from, bytes);
    benchmark::ClobberMemory();
  }
  return std::chrono::duration<double, std::nano>(Clock::now() - start).count() / kRounds;
}

void VideoCycle(benchmark::State& state) {
  const int width = static_cast<int>(state.range(0));
  const int height = static_cast<int>(state.range(1));
  Harness harness;
  harness.Callbacks().SetMaxVideoBuffers(1);  // the cycle must wait for the one segment
  pm::VideoFormat format;
  format.code = pm::kCode2vuy;
  format.width = static_cast<std::int16_t>(width);
  format.height = static_cast<std::int16_t>(height);
  format.scan = 'P';
  const std::int32_t sourceStride = width * 2 + 64;
  std::vector<std::uint8_t> source(static_cast<std::size_t>(sourceStride) * height, 0x42);
  const std::size_t frameBytes = static_cast<std::size_t>(width) * 2 * height;
  std::vector<std::uint8_t> copy(frameBytes);
  const double memcpyNs = MemcpyNsPerOp(source.data(), copy.data(), frameBytes);

  std::int64_t time = 0;
  double cycleNs = 0;
  std::int64_t cycles = 0;
  for (auto _ : state) {
    const auto start = Clock::now();
    std::shared_ptr<pm::VideoBuffer> buffer;
    while (!(buffer = harness.Callbacks().RequestVideoBuffer(format, 0))) std::this_thread::yield();
    buffer->CopyFrame(source.data(), sourceStride);
    harness.Callbacks().SendVideoBuffer(time += 23520000, std::move(buffer));
    cycleNs += std::chrono::duration<double, std::nano>(Clock::now() - start).count();
    ++cycles;
  }
  // Include the wait for the last token in nothing: each cycle above already
  // waited for the previous one's return before it could get the segment.
  state.counters["memcpy_ns"] = memcpyNs;
  state.counters["cycle_ns"] = cycleNs / static_cast<double>(cycles);
  state.counters["ratio"] = cycleNs / static_cast<double>(cycles) / memcpyNs;
  state.SetBytesProcessed(static_cast<std::int64_t>(frameBytes) * cycles);
}
BENCHMARK(VideoCycle)->Args({1920, 1080})->Args({3840, 2160})->UseRealTime()->Unit(benchmark::kMicrosecond);

void AudioCycle(benchmark::State& state) {
  Harness harness;
  harness.Callbacks().SetMaxAudioBuffers(1);
  const pm::AudioFormat format{pm::kCodeFl32, 48000, 2};
  constexpr int kSamples = 1600;
  std::vector<float> interleaved(kSamples * 2, 0.25f);
  const std::size_t bytes = interleaved.size() * sizeof(float);
  std::vector<std::uint8_t> copy(bytes);
  const double memcpyNs =
      MemcpyNsPerOp(reinterpret_cast<const std::uint8_t*>(interleaved.data()), copy.data(), bytes);
  double cycleNs = 0;
  std::int64_t cycles = 0;
  for (auto _ : state) {
    const auto start = Clock::now();
    std::shared_ptr<pm::AudioBuffer> buffer;
    while (!(buffer = harness.Callbacks().RequestAudioBuffer(format, kSamples))) std::this_thread::yield();
    buffer->Fill([&](void* data, std::int64_t n) { std::memcpy(data, interleaved.data(), static_cast<std::size_t>(n)); });
    harness.Callbacks().SendAudioBuffer(harness.Callbacks().AudioTime(48000), std::move(buffer));
    cycleNs += std::chrono::duration<double, std::nano>(Clock::now() - start).count();
    ++cycles;
  }
  state.counters["memcpy_ns"] = memcpyNs;
  state.counters["cycle_ns"] = cycleNs / static_cast<double>(cycles);
}
BENCHMARK(AudioCycle)->UseRealTime()->Unit(benchmark::kMicrosecond);

}  // namespace

BENCHMARK_MAIN();
