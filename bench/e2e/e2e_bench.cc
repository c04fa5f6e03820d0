// The whole chain between processes, on the NDI runtime this build's task
// loads (the loopback runtime, or the vendor's: then run it inside
// scripts/ndi-sandbox). A sender (this program again, "--sender NAME W H FPS
// FRAMES") sends exactly FRAMES counted pictures of W x H UYVY "blocks"
// (colour bars and the picture number in cells that survive lossy
// compression) at FPS, each with one picture's worth of 48 kHz stereo sound,
// from half a second after a receiver connected (before that it sends
// uncounted pictures, so that the receiver meets a live sender). pm-runner with the task module receives them; the host library
// reads them from shared memory. Then, in the same run, the same stream goes
// to a bare receive loop (this program again, "--bare NAME FRAMES"): the same
// runtime and receiver settings, capture and free only.
//
//   frames_sent / frames_received / frames_lost   counted by picture number
//   latency_p50_ms / latency_p99_ms               host read time minus media
//        time, above the quickest picture (see pm-host/README.md), first
//        second left out
//   first_picture_ms                               start_source sent to the
//        first picture read by the host (the sender already on the network)
//   runner_cpu_ms_per_frame                        pm-runner's user+system time
//        from its first picture to its last, per picture in between
//   bare_cpu_ms_per_frame                          the bare loop's, the same way
//   cpu_vs_bare                                    the ratio of the two
// With two sources the figures are summed (pictures, CPU) or the larger one
// (first picture, latency) over both.
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <atomic>
#include <chrono>
#include <cmath>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include <nlohmann/json.hpp>

#include "ndi-testsrc/pattern.h"
#include "pm-host/checks.h"
#include "pm-host/process.h"
#include "pm-host/receive.h"
#include "ndi/ndi_abi.h"

namespace {

using namespace std::chrono_literals;

std::string g_self;

double OwnCpuSeconds() {
  rusage usage{};
  ::getrusage(RUSAGE_SELF, &usage);
  return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
         static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

std::string FullName(const std::string& name) {
  char host[256] = {};
  ::gethostname(host, sizeof host - 1);
  std::string full = host;
  for (char& c : full) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return full + " (" + name + ")";
}

int RunSender(const std::string& name, int width, int height, int fps, std::int64_t frames) {
  if (!NDIlib_initialize()) return 1;
  ndi_send_create settings{name.c_str(), nullptr, true, false};
  void* sender = NDIlib_send_create(&settings);
  if (sender == nullptr) return 1;
  const auto planes = ndits::PictureLayout(kNdiFourCCUYVY, width, height);
  std::vector<std::uint8_t> picture(ndits::PictureSize(planes));
  const ndits::Bars blocks(kNdiFourCCUYVY, width, height, true);
  const int samples = 48000 / fps;
  std::vector<float> sound(static_cast<std::size_t>(samples) * 2);
  // Until a receiver is there, and for a moment while it sets up, the
  // sender already sends, at its pace, pictures numbered kIdle (not counted):
  // the first picture a receiver sees comes from a live sender. Then the
  // FRAMES counted pictures 0, 1, ...
  constexpr std::int64_t kIdle = 0x7FFFFFFF;
  const auto giveUp = std::chrono::steady_clock::now() + 60s;
  std::optional<std::chrono::steady_clock::time_point> counted;
  std::int64_t t = 0;
  for (std::int64_t n = 0; n < frames;) {
    const auto now = std::chrono::steady_clock::now();
    if (!counted && (NDIlib_send_get_no_connections(sender, 0) > 0 || now > giveUp)) counted = now + 500ms;
    const bool live = counted && now >= *counted;
    for (int c = 0; c < 2; ++c) {
      for (int s = 0; s < samples; ++s) sound[static_cast<std::size_t>(c) * samples + s] = ndits::AudioRampSample(t + s, c);
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
    blocks.Fill(live ? n : kIdle, picture.data());
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
    if (live) ++n;
  }
  std::this_thread::sleep_for(500ms);
  NDIlib_send_destroy(sender);
  NDIlib_destroy();
  return 0;
}

// The baseline: what the task's receiver does minus the task's own work.
// Prints {"pictures":N,"cpu_seconds":S} once the sender stopped (a second
// without pictures), FRAMES pictures came, or 60 s went by.
int RunBare(const std::string& name, std::int64_t frames) {
  if (!NDIlib_initialize()) return 1;
  ndi_find_create find{true, nullptr, nullptr};
  void* finder = NDIlib_find_create_v2(&find);
  const std::string full = FullName(name);
  std::string url;
  const auto deadline = std::chrono::steady_clock::now() + 60s;
  while (url.empty() && std::chrono::steady_clock::now() < deadline) {
    std::uint32_t count = 0;
    const ndi_source* sources = NDIlib_find_get_current_sources(finder, &count);
    for (std::uint32_t i = 0; i < count; ++i) {
      if (sources[i].ndi_name != nullptr && sources[i].url_address != nullptr && full == sources[i].ndi_name) {
        url = sources[i].url_address;
      }
    }
    if (url.empty()) NDIlib_find_wait_for_sources(finder, 250);
  }
  ndi_recv_create settings{{full.c_str(), url.c_str()}, kNdiColorUyvyBgra, kNdiBandwidthHighest, false};
  void* receiver = NDIlib_recv_create_v2(&settings);
  std::int64_t pictures = 0;
  double cpuAtFirst = 0, cpuAtLast = 0;
  auto last = std::chrono::steady_clock::now();
  // Until the sender has stopped (a second without pictures) or FRAMES came.
  while (receiver != nullptr && pictures < frames && std::chrono::steady_clock::now() < deadline &&
         (pictures == 0 || std::chrono::steady_clock::now() - last < 1s)) {
    ndi_video_frame_v2 v{};
    ndi_audio_frame_v2 a{};
    ndi_metadata_frame m{};
    switch (NDIlib_recv_capture_v2(receiver, &v, &a, &m, 250)) {
      case kNdiFrameVideo:
        NDIlib_recv_free_video_v2(receiver, &v);
        if (++pictures == 1) cpuAtFirst = OwnCpuSeconds();
        cpuAtLast = OwnCpuSeconds();
        last = std::chrono::steady_clock::now();
        break;
      case kNdiFrameAudio: NDIlib_recv_free_audio_v2(receiver, &a); break;
      case kNdiFrameMetadata: NDIlib_recv_free_metadata(receiver, &m); break;
      default: break;
    }
  }
  // From the first picture to the last: the set-up and the wait for the end
  // are left out, as for the runner.
  std::printf("%s\n", nlohmann::json{{"pictures", pictures}, {"cpu_seconds", cpuAtLast - cpuAtFirst}}.dump().c_str());
  std::fflush(stdout);
  if (receiver != nullptr) NDIlib_recv_destroy(receiver);
  NDIlib_find_destroy(finder);
  NDIlib_destroy();
  return 0;
}

struct Stream {
  std::string name;
  std::unique_ptr<pmhost::ChildProcess> sender = std::make_unique<pmhost::ChildProcess>();
};

bool StartSender(Stream& s, const std::string& registry, int width, int height, int fps, std::int64_t frames) {
  pmhost::ChildOptions child;
  child.path = g_self;
  child.args = {"--sender", s.name, std::to_string(width), std::to_string(height), std::to_string(fps),
                std::to_string(frames)};
  child.env = {{"NDI_LOOPBACK_DIR", registry}};
  s.sender = std::make_unique<pmhost::ChildProcess>();
  return s.sender->Start(child);
}

struct ChainFigures {
  std::int64_t received = 0;  // counted pictures
  std::int64_t read = 0;      // every picture the host read
  double p50 = 0, p99 = 0, firstMs = 0, runnerCpu = 0;
  std::string error;
};

// One stream through the task: the host library, pm-runner, the module.
ChainFigures ThroughTheTask(Stream& s, const std::string& folder, std::int64_t frames) {
  std::mutex lock;  // guards seen
  std::set<std::int64_t> seen;
  std::atomic<bool> stop{false};
  pmhost::ReceiveOptions o;
  o.host.runnerPath = PM_RUNNER_PATH;
  o.host.modulePath = PM_MODULE_PATH;
  o.host.env = {{"NDI_LOOPBACK_DIR", folder + "/registry"}};
  o.host.runnerLog = folder + "/runner-" + s.name + ".log";
  o.source = FullName(s.name);
  o.discoverySeconds = 20;
  o.seconds = 90;  // ends when the sender has sent everything (below)
  o.interrupted = &stop;
  o.out = stderr;
  o.onVideo = [&](const pmhost::VideoFrame& f) {
    const std::int64_t n = pmhost::ReadBlocks(f).number;
    std::lock_guard<std::mutex> guard(lock);
    if (n >= 0 && n < frames) seen.insert(n);
  };
  // Ends the run shortly after the sender has sent everything.
  std::thread watch([&] {
    s.sender->Wait(60s);
    std::this_thread::sleep_for(300ms);
    stop = true;
  });
  const pmhost::ReceiveResult result = pmhost::Receive(o);
  stop = true;
  watch.join();
  s.sender->Terminate();
  ChainFigures f;
  {
    std::lock_guard<std::mutex> guard(lock);
    f.received = static_cast<std::int64_t>(seen.size());
  }
  f.read = static_cast<std::int64_t>(result.stats.frames);
  f.p50 = result.stats.p50Ms;
  f.p99 = result.stats.p99Ms;
  f.firstMs = result.firstPictureSeconds * 1000;
  f.runnerCpu = result.runnerCpuSeconds - result.runnerCpuAtFirstPicture;
  f.error = result.error;
  return f;
}

struct BareFigures {
  std::int64_t pictures = 0;
  double cpu = 0;
};

BareFigures Bare(Stream& s, const std::string& registry, std::int64_t frames) {
  std::mutex lock;  // guards figures
  BareFigures figures;
  pmhost::ChildProcess bare;
  pmhost::ChildOptions child;
  child.path = g_self;
  child.args = {"--bare", s.name, std::to_string(2 * frames)};
  child.env = {{"NDI_LOOPBACK_DIR", registry}};
  child.captureStdout = true;
  child.onLine = [&](const std::string& line) {
    const auto j = nlohmann::json::parse(line, nullptr, false);
    if (!j.is_object()) return;
    std::lock_guard<std::mutex> guard(lock);
    figures.pictures = j.value("pictures", 0);
    figures.cpu = j.value("cpu_seconds", 0.0);
  };
  if (bare.Start(child)) bare.Wait(90s);
  bare.Terminate();
  s.sender->Terminate();
  std::lock_guard<std::mutex> guard(lock);
  return figures;
}

// `sources` streams of W x H at `fps` for `seconds`, at once.
void Chain(benchmark::State& state, int width, int height, int fps, int seconds, int sources) {
#ifdef PM_NDI_VENDOR_RUNTIME
  const char* sandbox = std::getenv("PM_NDI_SANDBOX");
  if (sandbox == nullptr || std::string(sandbox) != "1") {
    state.SkipWithError("the vendor runtime runs only inside scripts/ndi-sandbox");
    return;
  }
#endif
  const std::int64_t frames = static_cast<std::int64_t>(fps) * seconds;
  std::string folder = (std::filesystem::temp_directory_path() / "pm-e2e-bench-XXXXXX").string();
  if (::mkdtemp(folder.data()) == nullptr) {
    state.SkipWithError("no temporary folder");
    return;
  }
  const std::string registry = folder + "/registry";
  bool keep = false;
  for (auto _ : state) {
    std::vector<Stream> streams(static_cast<std::size_t>(sources));
    // A name of its own per case: a sender of an earlier case may still be
    // listed by the vendor runtime's discovery for a while after it ended.
    for (int i = 0; i < sources; ++i) {
      streams[static_cast<std::size_t>(i)].name = "bench " + std::to_string(height) + "p" + std::to_string(fps) + " " +
                                                  std::to_string(sources) + "." + std::to_string(i + 1);
    }
    bool started = true;
    for (Stream& s : streams) started = started && StartSender(s, registry, width, height, fps, frames);
    if (!started) {
      state.SkipWithError("a sender did not start");
      break;
    }
    std::vector<ChainFigures> chain(streams.size());
    {
      std::vector<std::thread> runs;
      for (std::size_t i = 0; i < streams.size(); ++i) {
        runs.emplace_back([&, i] { chain[i] = ThroughTheTask(streams[i], folder, frames); });
      }
      for (auto& t : runs) t.join();
    }
    // The same streams again, to the bare loop.
    for (Stream& s : streams) StartSender(s, registry, width, height, fps, frames);
    std::vector<BareFigures> bare(streams.size());
    {
      std::vector<std::thread> runs;
      for (std::size_t i = 0; i < streams.size(); ++i) {
        runs.emplace_back([&, i] { bare[i] = Bare(streams[i], registry, frames); });
      }
      for (auto& t : runs) t.join();
    }
    std::int64_t received = 0, read = 0, barePictures = 0;
    double p50 = 0, p99 = 0, first = 0, runnerCpu = 0, bareCpu = 0;
    std::string error;
    for (std::size_t i = 0; i < streams.size(); ++i) {
      received += chain[i].received;
      read += chain[i].read;
      p50 = std::max(p50, chain[i].p50);
      p99 = std::max(p99, chain[i].p99);
      first = std::max(first, chain[i].firstMs);
      runnerCpu += chain[i].runnerCpu;
      if (error.empty()) error = chain[i].error;
      barePictures += bare[i].pictures;
      bareCpu += bare[i].cpu;
    }
    // CPU from each one's first picture to its last, per picture after the
    // first; the uncounted pictures before the stream count for both.
    const auto per = [](double cpu, std::int64_t pictures, std::size_t streams) {
      const auto after = pictures - static_cast<std::int64_t>(streams);
      return after > 0 ? cpu * 1000 / static_cast<double>(after) : 0.0;
    };
    const double runnerPer = per(runnerCpu, read, streams.size());
    const double barePer = per(bareCpu, barePictures, streams.size());
    state.counters["frames_sent"] = static_cast<double>(frames * sources);
    state.counters["frames_received"] = static_cast<double>(received);
    state.counters["frames_lost"] = static_cast<double>(frames * sources - received);
    state.counters["latency_p50_ms"] = p50;
    state.counters["latency_p99_ms"] = p99;
    state.counters["first_picture_ms"] = first;
    state.counters["runner_cpu_ms_per_frame"] = runnerPer;
    state.counters["bare_frames"] = static_cast<double>(barePictures);
    state.counters["bare_cpu_ms_per_frame"] = barePer;
    state.counters["cpu_vs_bare"] = barePer > 0 ? runnerPer / barePer : 0;
    if (!error.empty()) state.SkipWithError(error.c_str());
    keep = !error.empty() || received < frames * sources;
  }
  // The runners' logs stay when something went wrong.
  if (keep) {
    std::fprintf(stderr, "e2e_bench: pictures were lost; the runners' logs are in %s\n", folder.c_str());
    return;
  }
  std::error_code ignored;
  std::filesystem::remove_all(folder, ignored);
}

void BM_Chain1080p60(benchmark::State& state) { Chain(state, 1920, 1080, 60, 10, 1); }
void BM_Chain2160p60(benchmark::State& state) { Chain(state, 3840, 2160, 60, 10, 1); }
void BM_Chain2160p30(benchmark::State& state) { Chain(state, 3840, 2160, 30, 10, 1); }
void BM_ChainTwo1080p30(benchmark::State& state) { Chain(state, 1920, 1080, 30, 10, 2); }
BENCHMARK(BM_Chain1080p60)->Iterations(1)->Unit(benchmark::kSecond)->UseRealTime();
BENCHMARK(BM_Chain2160p60)->Iterations(1)->Unit(benchmark::kSecond)->UseRealTime();
BENCHMARK(BM_Chain2160p30)->Iterations(1)->Unit(benchmark::kSecond)->UseRealTime();
BENCHMARK(BM_ChainTwo1080p30)->Iterations(1)->Unit(benchmark::kSecond)->UseRealTime();

}  // namespace

int main(int argc, char** argv) {
  char path[4096] = {};
  const ssize_t n = ::readlink("/proc/self/exe", path, sizeof path - 1);
  if (n > 0) g_self.assign(path, static_cast<std::size_t>(n));
  if (argc == 7 && std::strcmp(argv[1], "--sender") == 0) {
    return RunSender(argv[2], std::atoi(argv[3]), std::atoi(argv[4]), std::atoi(argv[5]), std::atoll(argv[6]));
  }
  if (argc == 4 && std::strcmp(argv[1], "--bare") == 0) return RunBare(argv[2], std::atoll(argv[3]));
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
