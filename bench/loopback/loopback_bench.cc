// The loopback runtime between two processes. This program starts a copy of
// itself as the sender ("--sender NAME W H FPS SECONDS": a ramp picture sent
// over and over with only its frame number changed, so the figures are the
// runtime's, not the pattern generator's) and receives in the benchmark.
//
//   BM_TwoProcess4K60      3840x2160 UYVY at 60 fps for 10 s: frames counted,
//                          missing frame numbers counted, capture-to-free time.
//   BM_Unthrottled1080p    1920x1080 UYVY as fast as the sender can: frames per
//                          second, against memcpy of the same bytes in the same
//                          run ("vs_memcpy" = loopback fps / memcpy fps).
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "ndi-testsrc/pattern.h"
#include "pm/runtime/little_endian.h"
#include "ndi/ndi_abi.h"

extern char** environ;

namespace {

std::string g_self;

int RunSender(const std::string& name, int width, int height, int fps, double seconds) {
  NDIlib_initialize();
  ndi_send_create settings{name.c_str(), nullptr, fps > 0, false};
  void* sender = NDIlib_send_create(&settings);
  if (sender == nullptr) return 1;
  const auto planes = ndits::PictureLayout(kNdiFourCCUYVY, width, height);
  std::vector<std::uint8_t> picture(ndits::PictureSize(planes));
  ndits::FillRamp(planes, 0, picture.data());
  NDIlib_send_get_no_connections(sender, 10000);
  const auto end = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  for (std::int64_t n = 0; std::chrono::steady_clock::now() < end; ++n) {
    pm::StoreLe64(picture.data(), static_cast<std::uint64_t>(n));
    ndi_video_frame_v2 f{};
    f.xres = width;
    f.yres = height;
    f.FourCC = kNdiFourCCUYVY;
    f.frame_rate_N = fps > 0 ? fps : 60;
    f.frame_rate_D = 1;
    f.frame_format_type = kNdiFrameFormatProgressive;
    f.timecode = kNdiSendTimecodeSynthesize;
    f.data = picture.data();
    f.line_stride_in_bytes = width * 2;
    NDIlib_send_send_video_v2(sender, &f);
  }
  NDIlib_send_destroy(sender);
  return 0;
}

class Child {
 public:
  Child(const std::string& name, int w, int h, int fps, double seconds) {
    std::vector<std::string> args = {g_self, "--sender", name, std::to_string(w), std::to_string(h),
                                     std::to_string(fps), std::to_string(seconds)};
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    if (posix_spawn(&pid_, g_self.c_str(), nullptr, nullptr, argv.data(), environ) != 0) pid_ = -1;
  }
  ~Child() {
    if (pid_ > 0) {
      kill(pid_, SIGTERM);
      waitpid(pid_, nullptr, 0);
    }
  }
  bool ok() const { return pid_ > 0; }

 private:
  pid_t pid_ = -1;
};

std::string FullName(const std::string& name) {
  char host[256] = {};
  gethostname(host, sizeof host - 1);
  std::string s = host;
  for (char& c : s) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return s + " (" + name + ")";
}

void* MakeReceiver(const std::string& full_name) {
  ndi_recv_create settings{};
  settings.source_to_connect_to.ndi_name = full_name.c_str();
  settings.color_format = kNdiColorUyvyBgra;
  settings.bandwidth = kNdiBandwidthHighest;
  return NDIlib_recv_create_v2(&settings);
}

// The next video frame (other kinds freed); false after `timeout_ms` without one.
bool NextVideo(void* rx, ndi_video_frame_v2* v, std::uint32_t timeout_ms) {
  const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeout_ms);
  while (std::chrono::steady_clock::now() < end) {
    ndi_metadata_frame m{};
    const std::int32_t got = NDIlib_recv_capture_v2(rx, v, nullptr, &m, 250);
    if (got == kNdiFrameVideo) return true;
    if (got == kNdiFrameMetadata) NDIlib_recv_free_metadata(rx, &m);
  }
  return false;
}

void BM_TwoProcess4K60(benchmark::State& state) {
  const std::string name = "bench4k-" + std::to_string(getpid());
  Child child(name, 3840, 2160, 60, 14.0);
  void* rx = MakeReceiver(FullName(name));
  std::int64_t frames = 0, missing = 0, last = -1;
  double free_ns = 0;
  for (auto _ : state) {
    ndi_video_frame_v2 v{};
    if (!child.ok() || !NextVideo(rx, &v, 5000)) {
      state.SkipWithError("no frames from the sender");
      break;
    }
    NDIlib_recv_free_video_v2(rx, &v);
    const auto start = std::chrono::steady_clock::now();
    const auto end = start + std::chrono::seconds(10);
    while (std::chrono::steady_clock::now() < end) {
      if (NDIlib_recv_capture_v2(rx, &v, nullptr, nullptr, 250) != kNdiFrameVideo) continue;
      const auto t0 = std::chrono::steady_clock::now();
      const std::int64_t n = ndits::RampFrameNumber(v.data);
      if (last >= 0 && n > last + 1) missing += n - last - 1;
      last = n;
      benchmark::DoNotOptimize(v.data[static_cast<std::size_t>(v.line_stride_in_bytes) * v.yres - 1]);
      NDIlib_recv_free_video_v2(rx, &v);
      free_ns += static_cast<double>(std::chrono::duration_cast<std::chrono::nanoseconds>(
                                         std::chrono::steady_clock::now() - t0).count());
      ++frames;
    }
  }
  NDIlib_recv_destroy(rx);
  state.counters["frames"] = static_cast<double>(frames);
  state.counters["expected"] = 600;
  state.counters["missing"] = static_cast<double>(missing);
  state.counters["capture_to_free_us"] = frames > 0 ? free_ns / frames / 1000.0 : 0;
  state.SetBytesProcessed(frames * 3840 * 2 * 2160);
}
BENCHMARK(BM_TwoProcess4K60)->Iterations(1)->Unit(benchmark::kSecond)->UseRealTime();

void BM_Unthrottled1080p(benchmark::State& state) {
  const std::string name = "bench1080-" + std::to_string(getpid());
  Child child(name, 1920, 1080, 0, 60.0);
  void* rx = MakeReceiver(FullName(name));
  ndi_video_frame_v2 v{};
  if (!child.ok() || !NextVideo(rx, &v, 5000)) {
    state.SkipWithError("no frames from the sender");
    NDIlib_recv_destroy(rx);
    return;
  }
  NDIlib_recv_free_video_v2(rx, &v);
  const std::size_t bytes = 1920u * 2 * 1080;
  std::int64_t frames = 0, missing = 0, last = -1;
  const auto start = std::chrono::steady_clock::now();
  for (auto _ : state) {
    if (!NextVideo(rx, &v, 5000)) {
      state.SkipWithError("the sender stopped");
      break;
    }
    const std::int64_t n = ndits::RampFrameNumber(v.data);
    if (last >= 0 && n > last + 1) missing += n - last - 1;
    last = n;
    NDIlib_recv_free_video_v2(rx, &v);
    ++frames;
  }
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  NDIlib_recv_destroy(rx);

  // Baseline in the same run: memcpy of the same bytes, frame by frame.
  std::vector<std::uint8_t> a(bytes, 1), b(bytes, 2);
  const auto m0 = std::chrono::steady_clock::now();
  std::int64_t copies = 0;
  while (std::chrono::steady_clock::now() - m0 < std::chrono::seconds(2)) {
    std::memcpy(b.data(), a.data(), bytes);
    benchmark::ClobberMemory();
    ++copies;
  }
  const double memcpy_fps = copies / std::chrono::duration<double>(std::chrono::steady_clock::now() - m0).count();
  const double fps = frames / seconds;
  state.counters["fps"] = fps;
  state.counters["missing"] = static_cast<double>(missing);
  state.counters["memcpy_fps"] = memcpy_fps;
  state.counters["vs_memcpy"] = fps / memcpy_fps;
  state.SetBytesProcessed(static_cast<std::int64_t>(frames * bytes));
}
BENCHMARK(BM_Unthrottled1080p)->Iterations(1500)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace

int main(int argc, char** argv) {
  char self[4096] = {};
  const ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
  g_self = n > 0 ? std::string(self, static_cast<std::size_t>(n)) : argv[0];
  if (argc == 7 && std::strcmp(argv[1], "--sender") == 0) {
    return RunSender(argv[2], std::atoi(argv[3]), std::atoi(argv[4]), std::atoi(argv[5]), std::atof(argv[6]));
  }
  // A private registry, so that the run sees only its own senders.
  if (std::getenv("NDI_LOOPBACK_DIR") == nullptr) {
    char dir[] = "/tmp/ndilb-bench-XXXXXX";
    if (mkdtemp(dir) != nullptr) setenv("NDI_LOOPBACK_DIR", dir, 1);
  }
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  if (const char* dir = std::getenv("NDI_LOOPBACK_DIR"); dir != nullptr && std::strstr(dir, "ndilb-bench-") != nullptr) {
    rmdir(dir);
  }
  return 0;
}
