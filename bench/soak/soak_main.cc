// pm_soak: the whole chain for a long while. ndi-testsrc sends its ramp
// pattern (pictures that carry their number, sound that carries its sample
// position) in a private loopback registry; the host library starts
// pm-runner with the task module and receives through shared memory; every
// picture and sound buffer is checked on arrival. It reports
//   - timing drift: each stream's media time against its content (picture
//     numbers x frame period, sample positions / rate), and the audio media
//     time minus the video media time at the same content position; each as
//     the value at the end and as a least-squares rate per hour;
//   - losses: gaps in the picture numbers and sample positions, damaged
//     pictures and sound, records the host refused;
//   - resources: resident memory, descriptors and threads of pm-runner and of
//     this process (the host), sampled every 10 s, growth per hour as the
//     slope of a least-squares line over the samples after the first minute.
// Exit status 0 when the chain ran to the end with nothing lost or damaged.
#include <dirent.h>
#include <signal.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <atomic>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <thread>

#include "bench/soak/soak_core.h"
#include "ndi-testsrc/pattern.h"
#include "pm-host/checks.h"
#include "pm-host/process.h"
#include "pm-host/receive.h"
#include "pm/runtime/log.h"
#include "pm/runtime/proc_stat.h"

namespace {

using nlohmann::json;

std::atomic<bool> g_interrupted{false};
void OnSignal(int) { g_interrupted = true; }

struct Options {
  double minutes = 120;
  int width = 1920;
  int height = 1080;
  int fps = 30;
  std::string format = "uyvy";
  int audioRate = 48000;
  int audioChannels = 2;
  double sampleSeconds = 10;
  double progressSeconds = 60;
  double settleSeconds = 60;  // memory samples before this are not in the growth line
  double warmupSeconds = 5;   // media seconds before drift is followed
  bool json = false;
  bool keep = false;
  std::string runner = PM_RUNNER_PATH;
  std::string module = PM_MODULE_PATH;
  std::string sender = PM_TESTSRC_PATH;
};

// ---------------------------------------------------------------------------
// What a process uses, from /proc.

struct Usage {
  double rssMiB = 0;
  double anonMiB = 0;  // resident anonymous memory: heap and stacks, no shared segments
  int descriptors = 0;
  int threads = 0;
};

std::optional<Usage> UsageOf(pid_t pid) {
  const std::string proc = "/proc/" + std::to_string(pid);
  Usage usage;
  DIR* fds = ::opendir((proc + "/fd").c_str());
  if (fds == nullptr) return std::nullopt;
  while (const dirent* entry = ::readdir(fds)) usage.descriptors += entry->d_name[0] != '.' ? 1 : 0;
  ::closedir(fds);
  if (pid == ::getpid()) --usage.descriptors;  // the directory stream that listed them
  std::ifstream status(proc + "/status");
  if (!status) return std::nullopt;
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("Threads:", 0) == 0) usage.threads = std::atoi(line.c_str() + 8);
    if (line.rfind("VmRSS:", 0) == 0) usage.rssMiB = std::atof(line.c_str() + 6) / 1024.0;
    if (line.rfind("RssAnon:", 0) == 0) usage.anonMiB = std::atof(line.c_str() + 8) / 1024.0;
  }
  return usage;
}

// A child of this process by its command name; -1 when none.
pid_t FindChild(const std::string& command) {
  const std::vector<pid_t> children = pm::ChildrenNamed(::getpid(), command);
  return children.empty() ? -1 : children.front();
}

// Resident memory, descriptors and threads of one process over the run.
struct Resources {
  soak::Series rss, anon, descriptors, threads;          // every sample
  soak::Series rssSettled, anonSettled, descriptorsSettled, threadsSettled;  // after the first minute
  void Add(double elapsed, double settle, const Usage& u) {
    const double hours = elapsed / 3600.0;
    rss.Add(hours, u.rssMiB);
    anon.Add(hours, u.anonMiB);
    descriptors.Add(hours, u.descriptors);
    threads.Add(hours, u.threads);
    if (elapsed < settle) return;
    rssSettled.Add(hours, u.rssMiB);
    anonSettled.Add(hours, u.anonMiB);
    descriptorsSettled.Add(hours, u.descriptors);
    threadsSettled.Add(hours, u.threads);
  }
};

// ---------------------------------------------------------------------------
// What arrives, checked and counted.

struct Counts {
  soak::FrameNumbers pictures;
  std::int64_t picturesDamaged = 0;
  soak::SoundPositions sound;
  std::int64_t soundDamaged = 0;
  soak::ClockDrift videoDrift;
  soak::ClockDrift audioDrift;
  soak::Series avOffsetMs;  // against hours of content
  std::int64_t videoStepsBack = 0;  // media time lower than the picture before
  std::int64_t audioStepsBack = 0;
  bool shiftKnown = false;  // the sound's positions placed on the sender's scale
  std::string firstDamage;
};

// OnVideo and OnAudio run on the queue's reader thread, one call at a time;
// Snapshot on the main thread. Lock: lock_ guards every member below it
// (taken alone; nothing is called out while it is held: the pictures and
// sound are checked before it is taken, damage is logged after).
class Monitor {
 public:
  explicit Monitor(const Options& o)
      : width_(o.width), height_(o.height), fps_(o.fps), rate_(o.audioRate), channels_(o.audioChannels),
        bufferSamples_(o.fps > 0 ? o.audioRate / o.fps : 0), warmup_(o.warmupSeconds) {
    const auto planes = ndits::PictureLayout(ndits::FourCCFromName(o.format), o.width, o.height);
    tightStride_ = planes.empty() ? 0 : static_cast<std::uint32_t>(planes[0].stride);
    tightBytes_ = ndits::PictureSize(planes);
  }

  void OnVideo(const pmhost::VideoFrame& frame) {
    std::int64_t number = -1;
    std::string damage;
    // Every plane's stride scales with the luma stride; the check reads that much.
    const std::uint32_t stride = frame.stride > 0 ? frame.stride : tightStride_;
    if (frame.width != width_ || frame.height != height_) {
      damage = "picture is " + std::to_string(frame.width) + "x" + std::to_string(frame.height);
    } else if (tightStride_ == 0 || stride < tightStride_ || frame.bytes < tightBytes_ / tightStride_ * stride) {
      damage = "picture of " + std::to_string(frame.bytes) + " bytes at stride " + std::to_string(frame.stride) +
               " is short";
    } else {
      damage = pmhost::CheckRampPicture(frame, &number);
    }
    const double media = static_cast<double>(frame.mediaTime) / soak::kTicksPerSecond;
    if (!damage.empty()) {
      Damaged(&Counts::picturesDamaged, "picture: " + damage);
      return;
    }
    std::lock_guard<std::mutex> guard(lock_);
    if (counts_.pictures.first >= 0 && media < lastVideoMedia_) ++counts_.videoStepsBack;
    lastVideoMedia_ = media;
    counts_.pictures.Add(number);
    if (media < warmup_) return;
    counts_.videoDrift.Add(static_cast<double>(number) / fps_, media);
    if (const auto offset = pairs_.Video(number, media)) {
      counts_.avOffsetMs.Add(static_cast<double>(number) / fps_ / 3600.0, *offset * 1000.0);
    }
  }

  void OnAudio(const pmhost::AudioFrame& frame) {
    std::int64_t residue = -1;
    std::string damage;
    if (frame.rate != rate_ || frame.channels != channels_) {
      damage = "sound is " + std::to_string(frame.rate) + " Hz, " + std::to_string(frame.channels) + " channels";
    } else if (frame.bytes < static_cast<std::uint64_t>(frame.samples) * static_cast<std::uint64_t>(frame.channels) * 4) {
      damage = "sound buffer of " + std::to_string(frame.bytes) + " bytes is short";
    } else {
      damage = pmhost::CheckRampSound(frame, &residue);
    }
    const double media = static_cast<double>(frame.mediaTime) / soak::kTicksPerSecond;
    if (!damage.empty()) {
      Damaged(&Counts::soundDamaged, "sound: " + damage);
      return;
    }
    std::lock_guard<std::mutex> guard(lock_);
    soak::SoundPositions& sound = counts_.sound;
    // Where the media clock puts this buffer, for gaps of a period or more.
    double estimate = 0;
    if (sound.Started()) {
      if (media < lastAudioMedia_) ++counts_.audioStepsBack;
      estimate = static_cast<double>(sound.Next()) + (media - lastAudioEnd_) * rate_;
    }
    const std::int64_t position = sound.Add(residue, frame.samples, estimate);
    lastAudioMedia_ = media;
    lastAudioEnd_ = media + static_cast<double>(frame.samples) / rate_;
    // The sender's scale: the buffer of picture n starts at n x bufferSamples;
    // the pictures seen so far say about which n this is.
    if (!counts_.shiftKnown && counts_.pictures.last >= 0 && bufferSamples_ > 0) {
      const double near = static_cast<double>(counts_.pictures.last + 1) * static_cast<double>(bufferSamples_);
      if (const auto shift = soak::ResolveShift(position, bufferSamples_, near)) {
        shift_ = *shift;
        counts_.shiftKnown = true;
      }
    }
    if (media < warmup_) return;
    counts_.audioDrift.Add(static_cast<double>(position) / rate_, media);
    const std::int64_t start = position + shift_;
    if (counts_.shiftKnown && start % bufferSamples_ == 0) {
      const std::int64_t number = start / bufferSamples_;
      if (const auto offset = pairs_.Audio(number, media)) {
        counts_.avOffsetMs.Add(static_cast<double>(number) / fps_ / 3600.0, *offset * 1000.0);
      }
    }
  }

  Counts Snapshot() const {
    std::lock_guard<std::mutex> guard(lock_);
    return counts_;
  }

 private:
  void Damaged(std::int64_t Counts::*count, const std::string& what) {
    int logged = 0;
    {
      std::lock_guard<std::mutex> guard(lock_);
      ++(counts_.*count);
      if (counts_.firstDamage.empty()) counts_.firstDamage = what;
      logged = ++damageLogged_;
    }
    if (logged <= kDamageLines) {
      pm::Log(pm::LogType::Normal, "", "pm_soak: %s%s", what.c_str(),
              logged == kDamageLines ? " (further damage is counted, not logged)" : "");
    }
  }

  static constexpr int kDamageLines = 10;
  const int width_, height_, fps_, rate_, channels_;
  const std::int64_t bufferSamples_;
  const double warmup_;
  std::uint32_t tightStride_ = 0;  // of the luma plane, as the sender lays it out
  std::size_t tightBytes_ = 0;     // of the whole picture at that stride
  mutable std::mutex lock_;  // guards every member below
  Counts counts_;
  soak::ContentPairs pairs_;
  double lastVideoMedia_ = 0;
  double lastAudioMedia_ = 0;
  double lastAudioEnd_ = 0;
  std::int64_t shift_ = 0;
  int damageLogged_ = 0;
};

// ---------------------------------------------------------------------------
// The report.

double Round(double v, double places = 3) {
  const double scale = std::pow(10.0, places);
  return std::round(v * scale) / scale;
}

json SeriesJson(const soak::Series& all, const soak::Series& settled) {
  if (all.Empty()) return nullptr;
  return {{"first", Round(all.firstY)},
          {"last", Round(all.lastY)},
          {"max", Round(all.maxY)},
          {"per_hour", settled.fit.Count() >= 2 ? json(Round(settled.fit.Slope())) : json(nullptr)}};
}

json ResourcesJson(pid_t pid, const Resources& r) {
  return {{"pid", pid},
          {"rss_mib", SeriesJson(r.rss, r.rssSettled)},
          {"anon_mib", SeriesJson(r.anon, r.anonSettled)},
          {"descriptors", SeriesJson(r.descriptors, r.descriptorsSettled)},
          {"threads", SeriesJson(r.threads, r.threadsSettled)}};
}

json DriftJson(const soak::ClockDrift& d) {
  if (d.Empty()) return nullptr;
  return {{"end_ms", Round(d.EndMs())}, {"per_hour_ms", Round(d.PerHourMs())}, {"max_abs_ms", Round(d.MaxAbsMs())}};
}

std::string ProgressLine(double elapsed, double total, int rate, const Counts& c, const std::optional<Usage>& runner,
                         const std::optional<Usage>& host) {
  char text[640];
  std::snprintf(text, sizeof text,
                "[%6.1f/%.1f min] pictures %lld (lost %lld, damaged %lld) | sound %.1f s (gaps %lld, damaged %lld) | "
                "drift video %+.2f ms audio %+.2f ms, a-v %+.2f ms | runner %.1f MiB %d fds %d threads | host %.1f MiB",
                elapsed / 60.0, total / 60.0, static_cast<long long>(c.pictures.received),
                static_cast<long long>(c.pictures.lost), static_cast<long long>(c.picturesDamaged),
                static_cast<double>(c.sound.samples) / rate, static_cast<long long>(c.sound.gaps),
                static_cast<long long>(c.soundDamaged), c.videoDrift.Empty() ? 0.0 : c.videoDrift.EndMs(),
                c.audioDrift.Empty() ? 0.0 : c.audioDrift.EndMs(), c.avOffsetMs.Empty() ? 0.0 : c.avOffsetMs.lastY,
                runner ? runner->rssMiB : 0.0, runner ? runner->descriptors : 0, runner ? runner->threads : 0,
                host ? host->rssMiB : 0.0);
  return text;
}

std::string PerHour(const soak::Series& settled, const char* unit) {
  if (settled.fit.Count() < 2) return "n/a";
  char text[64];
  std::snprintf(text, sizeof text, "%+.2f %s/h", settled.fit.Slope(), unit);
  return text;
}

std::string ResourcesText(const char* who, const Resources& r) {
  if (r.rss.Empty()) return std::string(who) + ": not sampled\n";
  char text[512];
  std::snprintf(text, sizeof text,
                "%s: resident %.1f -> %.1f MiB (max %.1f), growth %s; anonymous %.1f -> %.1f MiB, growth %s;\n"
                "    descriptors %.0f -> %.0f (%s), threads %.0f -> %.0f (%s)\n",
                who, r.rss.firstY, r.rss.lastY, r.rss.maxY, PerHour(r.rssSettled, "MiB").c_str(), r.anon.firstY,
                r.anon.lastY, PerHour(r.anonSettled, "MiB").c_str(), r.descriptors.firstY, r.descriptors.lastY,
                PerHour(r.descriptorsSettled, "").c_str(), r.threads.firstY, r.threads.lastY,
                PerHour(r.threadsSettled, "").c_str());
  return text;
}

std::string DriftText(const char* what, const soak::ClockDrift& d) {
  if (d.Empty()) return std::string(what) + ": n/a\n";
  char text[256];
  std::snprintf(text, sizeof text, "%s: %+.3f ms at the end, %+.3f ms/h, largest %.3f ms\n", what, d.EndMs(),
                d.PerHourMs(), d.MaxAbsMs());
  return text;
}

// Lines of the runner's log, and those that say a pool ran dry.
std::pair<int, int> ScanLog(const std::string& path) {
  std::ifstream in(path);
  std::string line;
  int lines = 0, dry = 0;
  while (std::getline(in, line)) {
    ++lines;
    dry += line.find("well ran dry") != std::string::npos ? 1 : 0;
  }
  return {lines, dry};
}

std::string UpperHost() {
  char host[256] = {};
  if (::gethostname(host, sizeof host - 1) != 0 || host[0] == '\0') std::strcpy(host, "localhost");
  std::string name = host;
  for (char& c : name) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return name;
}

int Run(const Options& o) {
  std::string folder = (std::filesystem::temp_directory_path() / "pm-soak-XXXXXX").string();
  if (::mkdtemp(folder.data()) == nullptr) {
    pm::Log(pm::LogType::Normal, "", "pm_soak: cannot make a temporary folder: %s", std::strerror(errno));
    return 1;
  }
  const std::string registry = folder + "/registry";
  const std::string senderName = "soak-" + std::to_string(::getpid());
  const std::string fullName = UpperHost() + " (" + senderName + ")";

  // The sender runs until we end it.
  std::mutex senderLock;  // guards connectionChanges
  int connectionChanges = 0;
  pmhost::ChildProcess sender;
  pmhost::ChildOptions child;
  child.path = o.sender;
  child.args = {"--name", senderName, "--width", std::to_string(o.width), "--height", std::to_string(o.height),
                "--fps", std::to_string(o.fps), "--format", o.format, "--pattern", "ramp",
                "--audio-rate", std::to_string(o.audioRate), "--audio-channels", std::to_string(o.audioChannels)};
  child.env = {{"NDI_LOOPBACK_DIR", registry}};
  child.stderrPath = folder + "/sender.log";
  child.captureStdout = true;
  child.onLine = [&](const std::string& line) {
    const json event = json::parse(line, nullptr, false);
    if (event.is_object() && event.contains("event") && event["event"] == "connections") {
      std::lock_guard<std::mutex> guard(senderLock);
      ++connectionChanges;
    }
  };
  if (!sender.Start(child)) {
    std::error_code ignored;
    std::filesystem::remove_all(folder, ignored);
    return 1;
  }

  Monitor monitor(o);
  Resources runnerUse, hostUse;
  pid_t runnerPid = -1;
  std::atomic<bool> stop{false};
  double ran = 0;
  std::atomic<int> lastState{0};
  std::atomic<int> stateChanges{0};

  pmhost::ReceiveOptions r;
  r.host.runnerPath = o.runner;
  r.host.modulePath = o.module;
  r.host.env = {{"NDI_LOOPBACK_DIR", registry}};
  r.host.runnerLog = folder + "/runner.log";
  r.source = fullName;
  r.discoverySeconds = 15;
  r.interrupted = &stop;
  r.out = stderr;
  r.onVideo = [&](const pmhost::VideoFrame& f) { monitor.OnVideo(f); };
  r.onAudio = [&](const pmhost::AudioFrame& f) { monitor.OnAudio(f); };
  r.onNotification = [&](const std::string& command, const json& message) {
    if (command != "pm::tsrc::update_connection_state") return;
    const json state = message.contains("state") ? message["state"] : json();
    lastState = state.is_number_integer() ? state.get<int>() : -1;
    ++stateChanges;
  };
  // The soak itself, on the main thread while the source receives. Receive's
  // own loop waits meanwhile and ends when `stop` is set.
  r.whileReceiving = [&](pmhost::Session& session, const std::string&) {
    soak::Schedule s;
    s.seconds = o.minutes * 60.0;
    s.sampleSeconds = o.sampleSeconds;
    s.progressSeconds = o.progressSeconds;
    s.now = [] { return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count(); };
    s.waitUntil = [&](double until) {
      while (!g_interrupted) {
        const double left = until - s.now();
        if (left <= 0) return true;
        std::this_thread::sleep_for(std::chrono::duration<double>(std::min(left, 0.2)));
      }
      return false;
    };
    s.sample = [&](double elapsed) {
      if (runnerPid < 0) runnerPid = FindChild("pm-runner");
      if (const auto u = runnerPid > 0 ? UsageOf(runnerPid) : std::nullopt) runnerUse.Add(elapsed, o.settleSeconds, *u);
      if (const auto u = UsageOf(::getpid())) hostUse.Add(elapsed, o.settleSeconds, *u);
    };
    s.progress = [&](double elapsed) {
      const std::string line =
          ProgressLine(elapsed, s.seconds, o.audioRate, monitor.Snapshot(), runnerPid > 0 ? UsageOf(runnerPid) : std::nullopt,
                       UsageOf(::getpid()));
      std::fprintf(stderr, "%s\n", line.c_str());
      std::fflush(stderr);
    };
    s.keepGoing = [&] {
      return !session.Ended() && sender.Running() && (runnerPid < 0 || ::kill(runnerPid, 0) == 0);
    };
    ran = soak::RunSchedule(s);
    stop = true;
  };

  std::fprintf(stderr, "pm_soak: %.1f min of %dx%d %s at %d fps with %d Hz %d-channel sound; logs in %s\n", o.minutes,
               o.width, o.height, o.format.c_str(), o.fps, o.audioRate, o.audioChannels, folder.c_str());
  const pmhost::ReceiveResult result = pmhost::Receive(r);
  const bool senderWasRunning = sender.Running();
  const int senderExit = sender.Terminate();
  const Counts c = monitor.Snapshot();
  const auto [logLines, dryLines] = ScanLog(r.host.runnerLog);
  int senderConnectionChanges = 0;
  {
    std::lock_guard<std::mutex> guard(senderLock);
    senderConnectionChanges = connectionChanges;
  }

  std::string error = result.error;
  const bool shortRun = !g_interrupted && ran < o.minutes * 60.0 - 1.0;
  if (error.empty() && !senderWasRunning) error = "the sender ended during the run";
  if (error.empty() && shortRun) error = "the chain stopped after " + std::to_string(ran) + " s";
  if (error.empty() && c.pictures.received == 0) error = "no picture arrived";
  if (error.empty() && c.sound.buffers == 0) error = "no sound arrived";
  if (error.empty() && result.runnerExit != 0) error = "pm-runner exited with " + std::to_string(result.runnerExit);
  const bool lossless = c.pictures.lost == 0 && c.picturesDamaged == 0 && c.sound.gaps == 0 && c.soundDamaged == 0 &&
                        result.stats.badRecords == 0;
  const bool pass = error.empty() && lossless;

  json out = {
      {"minutes_asked", o.minutes},
      {"minutes_run", Round(ran / 60.0)},
      {"interrupted", g_interrupted.load()},
      {"settings",
       {{"width", o.width}, {"height", o.height}, {"format", o.format}, {"fps", o.fps}, {"audio_rate", o.audioRate},
        {"audio_channels", o.audioChannels}, {"samples_per_buffer", o.fps > 0 ? o.audioRate / o.fps : 0},
        {"sample_seconds", o.sampleSeconds}, {"settle_seconds", o.settleSeconds}, {"warmup_seconds", o.warmupSeconds}}},
      {"pictures",
       {{"received", c.pictures.received}, {"first", c.pictures.first}, {"last", c.pictures.last},
        {"lost", c.pictures.lost}, {"gaps", c.pictures.gaps}, {"repeats", c.pictures.repeats},
        {"damaged", c.picturesDamaged}, {"media_steps_back", c.videoStepsBack}, {"drift", DriftJson(c.videoDrift)}}},
      {"sound",
       {{"buffers", c.sound.buffers}, {"samples", c.sound.samples}, {"gaps", c.sound.gaps},
        {"lost_samples_estimate", c.sound.lostSamples}, {"damaged", c.soundDamaged},
        {"media_steps_back", c.audioStepsBack}, {"drift", DriftJson(c.audioDrift)}}},
      {"audio_minus_video_ms",
       c.avOffsetMs.Empty()
           ? json(nullptr)
           : json{{"first", Round(c.avOffsetMs.firstY)}, {"end", Round(c.avOffsetMs.lastY)},
                  {"min", Round(c.avOffsetMs.minY)}, {"max", Round(c.avOffsetMs.maxY)},
                  {"per_hour", Round(c.avOffsetMs.fit.Slope())}, {"pairs", c.avOffsetMs.fit.Count()}}},
      {"runner", ResourcesJson(runnerPid, runnerUse)},
      {"host", ResourcesJson(::getpid(), hostUse)},
      {"runner_log", {{"lines", logLines}, {"ran_dry", dryLines}}},
      {"receive", result.ToJson()},
      {"sender_exit", senderExit},
      {"sender_connection_changes", senderConnectionChanges},
      {"connection_state_changes", stateChanges.load()},
      {"last_connection_state", lastState.load()},
      {"first_damage", c.firstDamage.empty() ? json(nullptr) : json(c.firstDamage)},
      {"error", error.empty() ? json(nullptr) : json(error)},
      {"pass", pass}};

  std::string text;
  char line[512];
  std::snprintf(line, sizeof line, "pm_soak: %.2f of %.2f min%s, %dx%d %s at %d fps, %d Hz %d channels\n",
                ran / 60.0, o.minutes, g_interrupted ? " (interrupted)" : "", o.width, o.height, o.format.c_str(),
                o.fps, o.audioRate, o.audioChannels);
  text += line;
  std::snprintf(line, sizeof line,
                "pictures: %lld received (numbers %lld..%lld), %lld lost in %lld gaps, %lld damaged, %lld repeated, "
                "%llu refused records\n",
                static_cast<long long>(c.pictures.received), static_cast<long long>(c.pictures.first),
                static_cast<long long>(c.pictures.last), static_cast<long long>(c.pictures.lost),
                static_cast<long long>(c.pictures.gaps), static_cast<long long>(c.picturesDamaged),
                static_cast<long long>(c.pictures.repeats), static_cast<unsigned long long>(result.stats.badRecords));
  text += line;
  std::snprintf(line, sizeof line, "sound: %lld buffers, %.3f s, %lld gaps (about %lld samples), %lld damaged\n",
                static_cast<long long>(c.sound.buffers), static_cast<double>(c.sound.samples) / o.audioRate,
                static_cast<long long>(c.sound.gaps), static_cast<long long>(c.sound.lostSamples),
                static_cast<long long>(c.soundDamaged));
  text += line;
  text += DriftText("video media time - picture numbers x period", c.videoDrift);
  text += DriftText("audio media time - samples / rate", c.audioDrift);
  if (c.avOffsetMs.Empty()) {
    text += "audio - video media time at the same content: n/a\n";
  } else {
    std::snprintf(line, sizeof line,
                  "audio - video media time at the same content: %+.3f ms at the start, %+.3f ms at the end "
                  "(%+.3f .. %+.3f), %+.3f ms/h over %lld pairs\n",
                  c.avOffsetMs.firstY, c.avOffsetMs.lastY, c.avOffsetMs.minY, c.avOffsetMs.maxY,
                  c.avOffsetMs.fit.Slope(), static_cast<long long>(c.avOffsetMs.fit.Count()));
    text += line;
  }
  text += ResourcesText("pm-runner", runnerUse);
  text += ResourcesText("host (this process)", hostUse);
  std::snprintf(line, sizeof line,
                "runner log: %d lines, %d 'well ran dry'; connection states reported %d; latency p50 %.2f ms p99 "
                "%.2f ms; runner exit %d\n",
                logLines, dryLines, stateChanges.load(), result.stats.p50Ms, result.stats.p99Ms, result.runnerExit);
  text += line;
  if (!c.firstDamage.empty()) text += "first damage: " + c.firstDamage + "\n";
  if (!error.empty()) text += "error: " + error + "\n";
  text += pass ? "result: nothing lost or damaged\n" : "result: FAILED\n";

  if (o.json) {
    std::fputs(text.c_str(), stderr);
    std::printf("%s\n", out.dump().c_str());
  } else {
    std::fputs(text.c_str(), stdout);
  }
  std::fflush(stdout);
  if (pass && !o.keep) {
    std::error_code ignored;
    std::filesystem::remove_all(folder, ignored);
  } else {
    std::fprintf(stderr, "pm_soak: logs kept in %s\n", folder.c_str());
  }
  return pass ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  CLI::App app{"pm_soak: the sender, pm-runner with the task and the host for a long while"};
  app.add_option("--minutes", o.minutes, "how long to receive (default 120)")->check(CLI::NonNegativeNumber);
  app.add_option("--width", o.width, "picture width")->check(CLI::Range(16, 7680));
  app.add_option("--height", o.height, "picture height")->check(CLI::Range(16, 4320));
  app.add_option("--fps", o.fps, "frames per second (whole)")->check(CLI::Range(1, 240));
  app.add_option("--format", o.format, "picture format")->check(CLI::IsMember({"uyvy", "nv12", "bgra"}));
  app.add_option("--audio-rate", o.audioRate, "sample rate")->check(CLI::Range(8000, 192000));
  app.add_option("--audio-channels", o.audioChannels, "channels")->check(CLI::Range(1, 16));
  app.add_option("--sample-seconds", o.sampleSeconds, "seconds between resource samples")->check(CLI::Range(0.1, 3600.0));
  app.add_option("--progress-seconds", o.progressSeconds, "seconds between progress lines")->check(CLI::Range(1.0, 86400.0));
  app.add_option("--settle-seconds", o.settleSeconds, "samples before this are left out of the growth lines")
      ->check(CLI::NonNegativeNumber);
  app.add_flag("--json", o.json, "the summary as one JSON object on stdout (the text goes to stderr)");
  app.add_flag("--keep", o.keep, "keep the folder with the registry and the logs");
  app.add_option("--runner", o.runner, "pm-runner");
  app.add_option("--module", o.module, "the task module");
  app.add_option("--sender", o.sender, "ndi-testsrc");
  CLI11_PARSE(app, argc, argv);
  if (o.fps <= 0 || o.audioRate % o.fps != 0) {
    std::fprintf(stderr, "pm_soak: --audio-rate must be a whole number of samples per picture\n");
    return 2;
  }

  struct sigaction action {};
  action.sa_handler = OnSignal;
  sigemptyset(&action.sa_mask);
  sigaction(SIGINT, &action, nullptr);
  sigaction(SIGTERM, &action, nullptr);
  return Run(o);
}
