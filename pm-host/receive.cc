#include "pm-host/receive.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <map>
#include <mutex>
#include <thread>

#include "pm-host/checks.h"
#include "pm-host/files.h"
#include "pm-host/locate.h"
#include "pm-host/picture.h"
#include "pm-host/wav.h"
#include "pm/runtime/ids.h"
#include "pm/runtime/json.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"
#include "pm/shm/formats.h"

namespace pmhost {

using nlohmann::json;
using namespace std::chrono_literals;

namespace {

// The demo sender's picture size.
constexpr int kDemoWidth = 1280;
constexpr int kDemoHeight = 720;

// The sources discovery has announced. Lock: lock_ guards sources_.
class SourceTable {
 public:
  void Set(bool available, const std::string& id, const std::string& name) {
    std::lock_guard<std::mutex> guard(lock_);
    if (available) {
      sources_[id] = name;
    } else {
      sources_.erase(id);
    }
  }
  std::map<std::string, std::string> Copy() const {
    std::lock_guard<std::mutex> guard(lock_);
    return sources_;
  }

 private:
  mutable std::mutex lock_;
  std::map<std::string, std::string> sources_;  // id -> name
};

std::string Lower(std::string text) {
  for (char& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return text;
}

bool Interrupted(const std::atomic<bool>* flag) { return flag != nullptr && flag->load(); }

// A new folder of ours in the system's temporary folder, named `prefix` and
// a fresh short id; empty when none can be made.
std::string MakePrivateTempFolder(const std::string& prefix) {
  std::error_code error;
  const std::filesystem::path base = std::filesystem::temp_directory_path(error);
  if (error) return {};
  for (int attempt = 0; attempt < 8; ++attempt) {
    const std::filesystem::path folder = base / (prefix + pm::NewShortId());
    if (std::filesystem::create_directory(folder, error)) {
      std::filesystem::permissions(folder, std::filesystem::perms::owner_all, error);
      return folder.string();
    }
  }
  return {};
}

const char* StateName(int state) {
  switch (state) {
    case 1: return "connecting";
    case 2: return "receiving";
    case 3: return "sender gone";
    case 4: return "error";
    case 5: return "exiting";
    default: return "waiting";
  }
}

struct Match {
  std::string id, name, error;
};

// What `text` names among the discovered sources, waiting up to `seconds`:
// an exact id or name at once; else the one name that contains the text
// (case-insensitive) once discovery has had a moment to list the others.
Match Resolve(const SourceTable& table, const std::string& text, double seconds, const std::atomic<bool>* interrupted) {
  const auto start = std::chrono::steady_clock::now();
  const auto limit = start + std::chrono::milliseconds(static_cast<std::int64_t>(seconds * 1000));
  const auto settle = start + 1500ms;
  const std::string wanted = Lower(text);
  std::vector<std::pair<std::string, std::string>> partial;
  for (;;) {
    partial.clear();
    for (const auto& [id, name] : table.Copy()) {
      if (id == text || name == text) return {id, name, {}};
      if (Lower(name).find(wanted) != std::string::npos) partial.emplace_back(id, name);
    }
    const auto now = std::chrono::steady_clock::now();
    if (partial.size() == 1 && now >= settle) return {partial[0].first, partial[0].second, {}};
    if (now >= limit || Interrupted(interrupted)) break;
    std::this_thread::sleep_for(50ms);
  }
  if (partial.size() == 1) return {partial[0].first, partial[0].second, {}};
  if (partial.size() > 1) {
    std::string names;
    for (const auto& [id, name] : partial) names += (names.empty() ? "" : ", ") + ("'" + name + "'");
    return {{}, {}, "'" + text + "' matches several sources: " + names};
  }
  // A full NDI name ("HOST (Name)") is taken as it is: the source waits for
  // its sender.
  if (!text.empty() && text.back() == ')' && text.find(" (") != std::string::npos) {
    return {kSourceIdPrefix + text, text, {}};
  }
  return {{}, {}, "no source matches '" + text + "'"};
}

// The frames of a receive run: statistics, snapshot, WAV, hooks.
class ReceiveSink : public FrameSink {
 public:
  ReceiveSink(ReceiveStats& stats, const ReceiveOptions& options) : stats_(stats), options_(options) {}

  void OnVideo(const std::string&, const VideoFrame& frame) override {
    const std::int64_t wall = WallNs();
    const std::int64_t steady = SteadyNs();
    std::int64_t none = 0;
    firstVideo_.compare_exchange_strong(none, steady);
    stats_.Video(frame.mediaTime, frame.code, frame.width, frame.height, frame.stride, wall, steady);
    if (!options_.snapshot.empty() && steady - lastCopy_ >= 200'000'000) {
      lastCopy_ = steady;
      Picture picture{frame.code, frame.width, frame.height, frame.stride,
                      std::vector<std::uint8_t>(frame.data, frame.data + frame.bytes)};
      std::lock_guard<std::mutex> guard(pictureLock_);
      picture_ = std::move(picture);
    }
    if (options_.onVideo) options_.onVideo(frame);
  }

  void OnAudio(const std::string&, const AudioFrame& frame) override {
    stats_.Audio(frame.mediaTime, frame.samples, frame.rate, frame.channels, WallNs(), SteadyNs());
    if (!options_.wav.empty()) WriteWav(frame);
    if (options_.onAudio) options_.onAudio(frame);
  }

  void OnBadRecord(const std::string&, const std::string&) override { stats_.BadRecord(); }

  Picture TakePicture() {
    std::lock_guard<std::mutex> guard(pictureLock_);
    return std::move(picture_);
  }

  // Closes the WAV file; true when every sound buffer of the run went into
  // it (false when none came or one could not be written).
  bool CloseWav() {
    const bool complete = wav_.IsOpen() && !wavFailed_;
    wav_.Close();
    return complete;
  }
  // Steady time of the first picture read; 0 before it.
  std::int64_t FirstVideoNs() const { return firstVideo_.load(); }

 private:
  void WriteWav(const AudioFrame& frame) {
    if (!wav_.IsOpen() && !wavFailed_) wavFailed_ = !wav_.Open(options_.wav, frame.rate, frame.channels);
    if (!wav_.IsOpen()) return;
    if (frame.rate != wav_.Rate() || frame.channels != wav_.Channels()) {
      if (!formatChangeLogged_) {
        pm::Log(pm::LogType::Normal, "", "pm-host: sound changed to %d Hz, %d channels; not written to the WAV\n",
                frame.rate, frame.channels);
      }
      formatChangeLogged_ = true;
      return;
    }
    const auto count = static_cast<std::size_t>(frame.samples) * static_cast<std::size_t>(frame.channels);
    bool written = false;
    if (frame.code == pm::kCodeFl32) {
      written = wav_.Write(reinterpret_cast<const float*>(frame.data), frame.samples);
    } else {
      std::vector<float> samples(count);
      const auto* in = reinterpret_cast<const std::int16_t*>(frame.data);
      for (std::size_t i = 0; i < count; ++i) samples[i] = static_cast<float>(in[i]) / 32768.0f;
      written = wav_.Write(samples.data(), frame.samples);
    }
    if (!written && !wavFailed_) pm::Log(pm::LogType::Normal, "", "pm-host: cannot write to '%s'\n", options_.wav.c_str());
    wavFailed_ = wavFailed_ || !written;
  }

  ReceiveStats& stats_;
  const ReceiveOptions& options_;
  std::atomic<std::int64_t> firstVideo_{0};
  // Reader thread only:
  std::int64_t lastCopy_ = INT64_MIN / 2;
  WavWriter wav_;  // closed by the owner after the readers stopped
  bool wavFailed_ = false;  // it could not be opened or written
  bool formatChangeLogged_ = false;
  std::mutex pictureLock_;  // guards picture_
  Picture picture_;
};

std::string ProgressText(const StatsSnapshot& s) {
  char text[256];
  std::snprintf(text, sizeof text,
                "state %d %-11s %6.2f fps %7llu frames %8.2f s audio %5llu drops  latency p50 %.2f ms p99 %.2f ms",
                s.state, StateName(s.state), s.recentFps, static_cast<unsigned long long>(s.frames), s.audioSeconds(),
                static_cast<unsigned long long>(s.drops), s.p50Ms, s.p99Ms);
  return text;
}

}  // namespace

json ReceiveResult::ToJson() const {
  json out = stats.ToJson();
  out["source"] = name;
  out["unique_id"] = id;
  out["runner_exit"] = runnerExit;
  out["runner_cpu_seconds"] = std::round(runnerCpuSeconds * 1000) / 1000;
  if (firstPictureSeconds >= 0) out["first_picture_seconds"] = std::round(firstPictureSeconds * 1000) / 1000;
  if (!error.empty()) out["error"] = error;
  return out;
}

std::string SummaryText(const ReceiveResult& r) {
  if (r.id.empty()) return {};
  const StatsSnapshot& s = r.stats;
  char text[512];
  std::snprintf(text, sizeof text,
                "%s: %llu frames", r.name.c_str(), static_cast<unsigned long long>(s.frames));
  std::string out = text;
  if (s.frames > 0) {
    std::snprintf(text, sizeof text, " (%dx%d '%s', stride %u) at %.2f fps", s.width, s.height,
                  CodeText(s.videoCode).c_str(), s.stride, s.fps);
    out += text;
  }
  std::snprintf(text, sizeof text, ", %.2f s of sound", s.audioSeconds());
  out += text;
  if (s.audioBuffers > 0) {
    std::snprintf(text, sizeof text, " (%d Hz, %d channels)", s.audioRate, s.audioChannels);
    out += text;
  }
  std::snprintf(text, sizeof text,
                ", %llu drops, %llu bad records, latency p50 %.2f ms p99 %.2f ms, last state %d (%s), runner exit %d",
                static_cast<unsigned long long>(s.drops), static_cast<unsigned long long>(s.badRecords), s.p50Ms,
                s.p99Ms, s.state, StateName(s.state), r.runnerExit);
  return out + text;
}

int Discover(const ListOptions& options) {
  SourceTable table;
  std::mutex outLock;  // guards writes to options.out from the dispatcher thread
  Host host(options.host, [&](const std::string& command, const json& message) {
    const bool available = command == "pm::tsrc::source_available";
    if (!available && command != "pm::tsrc::source_unavailable") return;
    const std::string id = pmjson::FieldAsString(message, "unique_id", "");
    std::string name = pmjson::FieldAsString(message, "name", "");
    if (!available) {
      for (const auto& [known, knownName] : table.Copy()) {
        if (known == id) name = knownName;
      }
    }
    table.Set(available, id, name);
    {
      std::lock_guard<std::mutex> guard(outLock);
      std::fprintf(options.out, "%s %s\t%s\n", available ? "+" : "-", name.c_str(), id.c_str());
      std::fflush(options.out);
    }
    if (options.onChange) options.onChange(available, id, name);
  }, nullptr);
  if (!host.Start()) return 1;
  host.GetSession().StartDiscovery();
  const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(static_cast<std::int64_t>(options.seconds * 1000));
  while ((options.seconds <= 0 || std::chrono::steady_clock::now() < end) && !Interrupted(options.interrupted) &&
         host.RunnerRunning()) {
    std::this_thread::sleep_for(50ms);
  }
  // Ctrl-C on a terminal reaches the runner too, which then ends in order.
  const bool died = !host.RunnerRunning() && !Interrupted(options.interrupted);
  if (host.RunnerRunning()) host.GetSession().StopDiscovery();
  const int runnerExit = host.Stop();
  if (died || runnerExit != 0) {
    pm::Log(pm::LogType::Normal, "", "pm-host: the runner ended %s with status %d\n",
            died ? "during the run" : "after it", runnerExit);
    return 1;
  }
  return 0;
}

ReceiveResult Receive(const ReceiveOptions& options) {
  ReceiveResult result;
  for (const std::string* path : {&options.snapshot, &options.wav}) {
    if (!path->empty() && result.error.empty()) result.error = CannotWrite(*path);
  }
  if (!result.error.empty()) return result;
  ReceiveStats stats;
  SourceTable table;
  ReceiveSink sink(stats, options);
  std::mutex idLock;  // guards watchedId
  std::string watchedId;
  std::atomic<bool> shutdownAsked{false};

  Host host(options.host, [&](const std::string& command, const json& message) {
    const std::string id = pmjson::FieldAsString(message, "unique_id", "");
    if (command == "pm::tsrc::source_available") {
      table.Set(true, id, pmjson::FieldAsString(message, "name", ""));
    } else if (command == "pm::tsrc::source_unavailable") {
      table.Set(false, id, "");
    } else {
      bool ours = false;
      {
        std::lock_guard<std::mutex> guard(idLock);
        ours = id == watchedId;
      }
      if (ours && command == "pm::tsrc::update_connection_state") {
        stats.State(static_cast<int>(pmjson::FieldAsInteger(message, "state", 0)));
      } else if (ours && command == "pm::tsrc::update_production") {
        stats.Produces(static_cast<int>(pmjson::FieldAsInteger(message, "produces", 0)));
      } else if (ours && command == "pm::tsrc::trigger_shutdown") {
        shutdownAsked = true;
      }
    }
    if (options.onNotification) options.onNotification(command, message);
  }, &sink);

  if (!host.Start()) {
    result.error = "the runner did not start (see the lines above)";
    return result;
  }
  Session& session = host.GetSession();

  Match match;
  if (options.source.rfind(kSourceIdPrefix, 0) == 0) {
    match = {options.source, options.source.substr(sizeof kSourceIdPrefix - 1), {}};
  } else {
    session.StartDiscovery();
    match = Resolve(table, options.source, options.discoverySeconds, options.interrupted);
    session.StopDiscovery();
  }
  if (!match.error.empty()) {
    result.error = match.error;
    result.runnerExit = host.Stop();
    return result;
  }
  result.id = match.id;
  result.name = match.name;
  {
    std::lock_guard<std::mutex> guard(idLock);
    watchedId = match.id;
  }

  const json config = {{"bandwidth", "ndi_bandwidth_" + options.bandwidth}};
  const std::int64_t startSourceNs = SteadyNs();
  if (!session.StartSource(match.id, config)) {
    result.error = "the task did not answer start_source";
    result.runnerExit = host.Stop();
    return result;
  }

  const auto start = std::chrono::steady_clock::now();
  const auto elapsed = [&] { return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(); };
  bool commandsSent = false;
  auto lastPrint = std::chrono::steady_clock::now() - 10s;
  auto lastLatency = lastPrint;
  double shownP50 = 0, shownP99 = 0;  // latency on the progress line, refreshed once a second
  bool printedTerminal = false;
  for (;;) {
    StatsSnapshot now = stats.Snapshot(SteadyNs(), /*latency=*/false);
    if (now.frames > 0 && result.runnerCpuAtFirstPicture == 0) {
      result.runnerCpuAtFirstPicture = pm::ProcessCpuSeconds(host.RunnerPid());
    }
    if (!commandsSent && (now.state == 2 || now.frames > 0 || now.audioBuffers > 0 || elapsed() > 5)) {
      commandsSent = true;
      if (options.tally == "live" || options.tally == "both") session.ShotEvent(match.id, "TALLY_LIVE_ON");
      if (options.tally == "preview" || options.tally == "both") session.ShotEvent(match.id, "TALLY_PREVIEW_ON");
      for (const json& ptz : options.ptz) session.PtzCommand(match.id, ptz);
      for (const std::string& event : options.shotEvents) session.ShotEvent(match.id, event);
      if (options.whileReceiving) options.whileReceiving(session, match.id);
    }
    const bool done = (options.seconds >= 0 && elapsed() >= options.seconds) ||
                      (options.frames >= 0 && now.frames >= static_cast<std::uint64_t>(options.frames)) ||
                      Interrupted(options.interrupted) || shutdownAsked || !host.RunnerRunning() || session.Ended();
    const auto t = std::chrono::steady_clock::now();
    if (options.progress != Progress::None && t - lastLatency >= 1s) {
      const StatsSnapshot withLatency = stats.Snapshot(SteadyNs());
      shownP50 = withLatency.p50Ms;
      shownP99 = withLatency.p99Ms;
      lastLatency = t;
    }
    now.p50Ms = shownP50;
    now.p99Ms = shownP99;
    if (options.progress == Progress::Terminal && t - lastPrint >= 250ms) {
      std::fprintf(options.out, "\r%s\x1b[K", ProgressText(now).c_str());
      std::fflush(options.out);
      printedTerminal = true;
      lastPrint = t;
    } else if (options.progress == Progress::Lines && t - lastPrint >= 1s) {
      std::fprintf(options.out, "%s\n", ProgressText(now).c_str());
      std::fflush(options.out);
      lastPrint = t;
    }
    if (done) break;
    std::this_thread::sleep_for(20ms);
  }
  if (printedTerminal) std::fprintf(options.out, "\n");
  // Ctrl-C on a terminal reaches the runner too, which then ends in order.
  if (!host.RunnerRunning() && !Interrupted(options.interrupted)) result.error = "the runner ended during the run";

  if (sink.FirstVideoNs() != 0) result.firstPictureSeconds = static_cast<double>(sink.FirstVideoNs() - startSourceNs) / 1e9;
  result.memoryBases = session.MemoryBases();
  result.runnerCpuSeconds = pm::ProcessCpuSeconds(host.RunnerPid());
  session.StopSource(match.id);
  // With no discovery running, the last stop_source ends the task and the
  // runner with it.
  result.runnerExit = host.Stop();
  if (result.error.empty() && result.runnerExit != 0) {
    result.error = "the runner exited with status " + std::to_string(result.runnerExit);
  }
  const bool wavComplete = sink.CloseWav();
  result.stats = stats.Snapshot(SteadyNs());
  if (!options.wav.empty() && !wavComplete && result.error.empty()) {
    result.error = (result.stats.audioBuffers == 0 ? "no sound for " : "the sound could not be written to ") + options.wav;
  }
  result.stats.badRecords = std::max(result.stats.badRecords, session.BadRecords());
  if (!options.snapshot.empty()) {
    Picture picture = sink.TakePicture();
    const std::vector<std::uint8_t> rgb = ToRgb(picture);
    if (rgb.empty() || !WritePng(options.snapshot, picture.width, picture.height, rgb)) {
      if (result.error.empty()) result.error = "no picture for the snapshot " + options.snapshot;
    }
  }
  result.exitStatus = result.error.empty() ? 0 : 1;
  return result;
}

int RunDemo(const DemoOptions& options) {
  // With --json the one JSON document is the only thing on `out`; every
  // other line goes to `err`.
  std::FILE* info = options.json ? options.err : options.out;
  const std::string folder = MakePrivateTempFolder("pm-host-demo-");
  if (folder.empty()) {
    std::fprintf(options.err, "pm-host demo: cannot make a temporary folder\n");
    return 1;
  }
  const std::string registry = folder + "/registry";
  const std::string senderPath = options.senderPath.empty() ? Locate(Companion::Sender) : options.senderPath;

  std::mutex readyLock;  // guards senderName
  std::condition_variable readyChanged;
  std::string senderName;
  ChildProcess sender;
  ChildOptions child;
  child.path = senderPath;
  child.args = {"--name", "pm-host demo", "--pattern", options.lossy ? "blocks" : "bars",
                "--width", std::to_string(kDemoWidth), "--height", std::to_string(kDemoHeight),
                "--fps", "30", "--seconds", std::to_string(static_cast<int>(options.seconds) + 60)};
  child.env = {{"NDI_LOOPBACK_DIR", registry}};
  child.captureStdout = true;
  child.onLine = [&](const std::string& line) {
    const json event = pmjson::ParseUntrusted(line);
    if (!event.is_object() || event.value("event", "") != "ready") return;
    {
      std::lock_guard<std::mutex> guard(readyLock);
      senderName = event.value("name", "");
    }
    readyChanged.notify_all();
  };
  int status = 1;
  std::error_code ignored;
  if (senderPath.empty() || !sender.Start(child)) {
    std::fprintf(options.err, "pm-host demo: cannot start the sender %s\n", senderPath.c_str());
    std::filesystem::remove_all(folder, ignored);
    return 1;
  }
  std::string name;
  {
    std::unique_lock<std::mutex> lock(readyLock);
    readyChanged.wait_for(lock, 10s, [&] { return !senderName.empty(); });
    name = senderName;
  }
  if (name.empty()) {
    std::fprintf(options.err, "pm-host demo: the sender did not start\n");
  } else {
    std::fprintf(info, "pm-host demo: sending %s as '%s'; receiving for %.0f s\n",
                 options.lossy ? "numbered colour bars and a ramp" : "colour bars and a 1 kHz tone", name.c_str(),
                 options.seconds);
    std::fflush(info);
    std::atomic<std::uint64_t> goodPictures{0}, badPictures{0}, goodSound{0}, badSound{0};
    std::mutex firstLock;  // guards firstProblem
    std::string firstProblem;
    auto problem = [&](const std::string& what) {
      std::lock_guard<std::mutex> guard(firstLock);
      if (firstProblem.empty()) firstProblem = what;
    };
    ReceiveOptions receive;
    receive.host = options.host;
    receive.host.env["NDI_LOOPBACK_DIR"] = registry;
    // The runner's own lines go to a file, shown when something went wrong.
    const bool ownLog = receive.host.runnerLog.empty();
    if (ownLog) receive.host.runnerLog = folder + "/runner.log";
    receive.source = name;
    receive.seconds = options.seconds;
    receive.snapshot = options.png;
    receive.progress = options.progress;
    receive.out = info;
    receive.interrupted = options.interrupted;
    std::int64_t lastNumber = -1;  // reader thread only
    receive.onVideo = [&](const VideoFrame& frame) {
      std::string check;
      if (options.lossy) {
        // Through a lossy codec: the bars within a tolerance, and each
        // picture's number one above the last.
        const BlocksReading r = ReadBlocks(frame);
        check = r.problem;
        if (check.empty() && lastNumber >= 0 && r.number != lastNumber + 1) {
          check = "picture " + std::to_string(r.number) + " after " + std::to_string(lastNumber);
        }
        lastNumber = r.number;
      } else {
        check = CheckBars(frame);
      }
      ++(check.empty() ? goodPictures : badPictures);
      if (!check.empty()) problem("picture: " + check);
    };
    receive.onAudio = [&](const AudioFrame& frame) {
      std::int64_t first = 0;
      const std::string check = options.lossy ? CheckRampSound(frame, &first, 1e-4f) : CheckTone(frame);
      ++(check.empty() ? goodSound : badSound);
      if (!check.empty()) problem("sound: " + check);
    };
    const ReceiveResult result = Receive(receive);
    // The snapshot on disk must show the bars too; through a lossy codec
    // no pixel is exact, so there it must be a readable picture of the
    // stream's size (its pictures were checked within tolerances above).
    if (result.exitStatus == 0) {
      std::string check;
      if (options.lossy) {
        int width = 0, height = 0;
        std::vector<std::uint8_t> rgb;
        if (!ReadPng(options.png, &width, &height, &rgb)) {
          check = "cannot read " + options.png;
        } else if (width != kDemoWidth || height != kDemoHeight) {
          check = "a " + std::to_string(width) + "x" + std::to_string(height) + " picture, not " +
                  std::to_string(kDemoWidth) + "x" + std::to_string(kDemoHeight);
        }
      } else {
        check = CheckBarsPng(options.png);
      }
      if (!check.empty()) problem("snapshot " + options.png + ": " + check);
    }
    int left = 0;
    for (const std::string& base : result.memoryBases) left += CountSegments(base);
    const bool intact = result.exitStatus == 0 && goodPictures > 0 && badPictures == 0 && goodSound > 0 &&
                        badSound == 0 && result.stats.badRecords == 0 && left == 0 && firstProblem.empty();
    if (!result.error.empty()) std::fprintf(options.err, "pm-host demo: %s\n", result.error.c_str());
    if (!firstProblem.empty()) std::fprintf(options.err, "pm-host demo: first damage seen: %s\n", firstProblem.c_str());
    if (left > 0) std::fprintf(options.err, "pm-host demo: %d segments are left in /dev/shm\n", left);
    if (options.json) {
      json out = result.ToJson();
      out["pictures_intact"] = goodPictures.load();
      out["pictures_damaged"] = badPictures.load();
      out["sound_buffers_intact"] = goodSound.load();
      out["sound_buffers_damaged"] = badSound.load();
      out["segments_left"] = left;
      out["png"] = options.png;
      out["passed"] = intact;
      if (!firstProblem.empty()) out["first_damage"] = firstProblem;
      std::fprintf(options.out, "%s\n", out.dump().c_str());
    } else if (!result.id.empty()) {
      std::fprintf(options.out, "%s\n", SummaryText(result).c_str());
      std::fprintf(options.out, "pictures intact: %llu of %llu; sound buffers intact: %llu of %llu\n",
                   static_cast<unsigned long long>(goodPictures.load()),
                   static_cast<unsigned long long>(goodPictures.load() + badPictures.load()),
                   static_cast<unsigned long long>(goodSound.load()),
                   static_cast<unsigned long long>(goodSound.load() + badSound.load()));
    }
    if (intact) {
      std::fprintf(info, "pm-host demo: frames arrived intact; wrote %s\n", options.png.c_str());
      status = 0;
    } else {
      if (ownLog) {
        std::ifstream in(receive.host.runnerLog);
        std::stringstream text;
        text << in.rdbuf();
        if (!text.str().empty()) std::fprintf(options.err, "the runner's log:\n%s", text.str().c_str());
      }
      std::fprintf(options.err, "pm-host demo: FAILED\n");
    }
  }
  sender.Terminate();
  std::filesystem::remove_all(folder, ignored);
  std::fflush(options.out);
  std::fflush(options.err);
  return status;
}

}  // namespace pmhost
