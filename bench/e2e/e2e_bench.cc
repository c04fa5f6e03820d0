// The whole chain between processes: a sender (this program, started again
// as "--sender NAME W H FPS FRAMES") sends exactly FRAMES pictures of W x H
// UYVY at FPS, each with one picture's worth of 48 kHz stereo sound, once a
// receiver is connected; pm-runner with the task module receives them; the
// host library reads them from shared memory.
//
//   frames_sent / frames_received / frames_lost   counted by picture number
//   latency_p50_ms / latency_p99_ms               host read time minus media
//        time, above the quickest picture (see pm-host/README.md), first
//        second left out
//   runner_cpu_ms_per_frame                        pm-runner's user+system time
//                                                  per received picture
//   memcpy_ms_per_frame                            baseline in the same run: one
//                                                  copy of the picture's bytes
//   cpu_vs_memcpy                                  the ratio of the two
#include <signal.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <atomic>
#include <chrono>
#include <cmath>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "ndi-testsrc/pattern.h"
#include "pm-host/process.h"
#include "pm-host/receive.h"
#include "taskndisource/ndi_abi.h"

namespace {

std::string g_self;

int RunSender(const std::string& name, int width, int height, int fps, std::int64_t frames) {
  if (!NDIlib_initialize()) return 1;
  ndi_send_create settings{name.c_str(), nullptr, true, false};
  void* sender = NDIlib_send_create(&settings);
  if (sender == nullptr) return 1;
  const auto planes = ndits::PictureLayout(kNdiFourCCUYVY, width, height);
  std::vector<std::uint8_t> picture(ndits::PictureSize(planes));
  ndits::Bars(kNdiFourCCUYVY, width, height).Fill(0, picture.data());
  const int samples = 48000 / fps;
  std::vector<float> sound(static_cast<std::size_t>(samples) * 2);
  // Once a receiver is there, and a moment for the task to set up.
  NDIlib_send_get_no_connections(sender, 15000);
  std::this_thread::sleep_for(std::chrono::milliseconds(500));
  std::int64_t t = 0;
  for (std::int64_t n = 0; n < frames; ++n) {
    for (int c = 0; c < 2; ++c) {
      for (int s = 0; s < samples; ++s) {
        sound[static_cast<std::size_t>(c) * samples + s] =
            static_cast<float>(0.25 * std::sin(2.0 * M_PI * 1000.0 * static_cast<double>(t + s) / 48000.0));
      }
    }
    t += samples;
    ndi_audio_frame_v2 a{};
    a.sample_rate = 48000;
    a.no_channels = 2;
    a.no_samples = samples;
    a.timecode = kNdiSendTimecodeSynthesize;
    a.data = sound.data();
    a.channel_stride_in_bytes = samples * 4;
    NDIlib_send_send_audio_v2(sender, &a);
    std::memcpy(picture.data(), &n, 8);
    ndi_video_frame_v2 f{};
    f.xres = width;
    f.yres = height;
    f.FourCC = kNdiFourCCUYVY;
    f.frame_rate_N = fps;
    f.frame_rate_D = 1;
    f.frame_format_type = kNdiFrameFormatProgressive;
    f.timecode = kNdiSendTimecodeSynthesize;
    f.data = picture.data();
    f.line_stride_in_bytes = width * 2;
    NDIlib_send_send_video_v2(sender, &f);  // paced by the runtime
  }
  std::this_thread::sleep_for(std::chrono::milliseconds(500));
  NDIlib_send_destroy(sender);
  NDIlib_destroy();
  return 0;
}

void Chain(benchmark::State& state, int width, int height) {
  constexpr int kFps = 60;
  constexpr std::int64_t kFrames = 600;  // 10 s
  std::string folder = (std::filesystem::temp_directory_path() / "pm-e2e-bench-XXXXXX").string();
  if (::mkdtemp(folder.data()) == nullptr) {
    state.SkipWithError("no temporary folder");
    return;
  }
  const std::string registry = folder + "/registry";
  const std::size_t frameBytes = static_cast<std::size_t>(width) * height * 2;

  for (auto _ : state) {
    pmhost::ChildProcess sender;
    pmhost::ChildOptions child;
    child.path = g_self;
    child.args = {"--sender", "bench", std::to_string(width), std::to_string(height), std::to_string(kFps),
                  std::to_string(kFrames)};
    child.env = {{"NDI_LOOPBACK_DIR", registry}};
    if (!sender.Start(child)) {
      state.SkipWithError("sender did not start");
      break;
    }
    char host[256] = {};
    ::gethostname(host, sizeof host - 1);
    std::string name = host;
    for (char& c : name) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    name += " (bench)";

    std::mutex lock;  // guards seen
    std::vector<bool> seen(kFrames, false);
    std::atomic<bool> stop{false};
    pmhost::ReceiveOptions o;
    o.host.runnerPath = PM_RUNNER_PATH;
    o.host.modulePath = PM_MODULE_PATH;
    o.host.env = {{"NDI_LOOPBACK_DIR", registry}};
    o.host.runnerLog = folder + "/runner.log";
    o.source = name;
    o.discoverySeconds = 10;
    o.frames = kFrames;
    o.seconds = 30;
    o.interrupted = &stop;
    o.out = stderr;
    o.onVideo = [&](const pmhost::VideoFrame& f) {
      std::int64_t n = -1;
      if (f.bytes >= 8) std::memcpy(&n, f.data, 8);
      std::lock_guard<std::mutex> guard(lock);
      if (n >= 0 && n < kFrames) seen[static_cast<std::size_t>(n)] = true;
    };
    // Ends the run shortly after the sender has sent everything.
    std::thread watch([&] {
      sender.Wait(std::chrono::seconds(40));
      std::this_thread::sleep_for(std::chrono::milliseconds(300));
      stop = true;
    });
    const pmhost::ReceiveResult result = pmhost::Receive(o);
    stop = true;
    watch.join();
    sender.Terminate();

    std::int64_t received = 0;
    {
      std::lock_guard<std::mutex> guard(lock);
      for (bool b : seen) received += b ? 1 : 0;
    }
    // Baseline: one copy of a picture's bytes, in this run.
    std::vector<std::uint8_t> from(frameBytes, 1), to(frameBytes);
    const auto copyStart = std::chrono::steady_clock::now();
    constexpr int kCopies = 50;
    for (int i = 0; i < kCopies; ++i) {
      from[static_cast<std::size_t>(i)] = static_cast<std::uint8_t>(i);
      std::memcpy(to.data(), from.data(), frameBytes);
      benchmark::DoNotOptimize(to.data());
    }
    const double memcpyMs =
        std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - copyStart).count() / kCopies;
    const double cpuMs = received > 0 ? result.runnerCpuSeconds * 1000.0 / static_cast<double>(received) : 0;
    state.counters["frames_sent"] = static_cast<double>(kFrames);
    state.counters["frames_received"] = static_cast<double>(received);
    state.counters["frames_lost"] = static_cast<double>(kFrames - received);
    state.counters["latency_p50_ms"] = result.stats.p50Ms;
    state.counters["latency_p99_ms"] = result.stats.p99Ms;
    state.counters["audio_seconds"] = result.stats.audioSeconds();
    state.counters["runner_cpu_ms_per_frame"] = cpuMs;
    state.counters["memcpy_ms_per_frame"] = memcpyMs;
    state.counters["cpu_vs_memcpy"] = memcpyMs > 0 ? cpuMs / memcpyMs : 0;
    state.counters["bad_records"] = static_cast<double>(result.stats.badRecords);
    state.counters["runner_exit"] = result.runnerExit;
    if (!result.error.empty()) state.SkipWithError(result.error.c_str());
  }
  std::error_code ignored;
  std::filesystem::remove_all(folder, ignored);
}

void BM_Chain1080p60(benchmark::State& state) { Chain(state, 1920, 1080); }
void BM_Chain2160p60(benchmark::State& state) { Chain(state, 3840, 2160); }
BENCHMARK(BM_Chain1080p60)->Iterations(1)->Unit(benchmark::kSecond)->UseRealTime();
BENCHMARK(BM_Chain2160p60)->Iterations(1)->Unit(benchmark::kSecond)->UseRealTime();

}  // namespace

int main(int argc, char** argv) {
  g_self = pmhost::ProgramDirectory();
  char path[4096] = {};
  const ssize_t n = ::readlink("/proc/self/exe", path, sizeof path - 1);
  if (n > 0) g_self.assign(path, static_cast<std::size_t>(n));
  if (argc == 7 && std::strcmp(argv[1], "--sender") == 0) {
    return RunSender(argv[2], std::atoi(argv[3]), std::atoi(argv[4]), std::atoi(argv[5]), std::atoll(argv[6]));
  }
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
