#pragma once
// The jobs of the pm-host command line, as a library so that the end-to-end
// tests run them in-process against the real runner and sender:
//   Discover  - `pm-host list`: sources as they appear and vanish;
//   Receive   - `pm-host receive`: one source for a while, with snapshot,
//               WAV, PTZ, tally and shot events, progress and a summary;
//   RunDemo   - `pm-host demo`: its own sender in a private registry,
//               received and checked.
// Each starts its own runner through a Host and stops it before returning.

#include <atomic>
#include <cstdio>
#include <functional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "pm-host/host.h"
#include "pm-host/stats.h"

namespace pmhost {

enum class Progress { None, Terminal, Lines };

struct ListOptions {
  HostOptions host;
  double seconds = 5;
  std::FILE* out = stdout;
  const std::atomic<bool>* interrupted = nullptr;  // set by SIGINT
  // Every change, as it happens (on the dispatcher's thread): added or not,
  // the id and the name.
  std::function<void(bool available, const std::string& id, const std::string& name)> onChange;
};

// Runs discovery for options.seconds; returns 0, or 1 when the runner could
// not be started or did not end in order (it died during the run).
int Discover(const ListOptions& options);

struct ReceiveOptions {
  HostOptions host;
  std::string source;             // NDI name, unique id or part of one name
  double seconds = -1;            // < 0: no time limit
  std::int64_t frames = -1;       // < 0: no frame limit
  std::string bandwidth = "highest";  // highest | lowest | audio_only
  std::string snapshot;           // PNG of the last picture
  std::string wav;                // the sound
  std::vector<nlohmann::json> ptz;      // execute_ptz_command bodies
  std::string tally;              // "", live, preview, both
  std::vector<std::string> shotEvents;
  double discoverySeconds = 5;    // how long to look for the source
  Progress progress = Progress::None;
  std::FILE* out = stdout;
  const std::atomic<bool>* interrupted = nullptr;
  // Extra per-frame work (checks); on the queue's reader thread.
  std::function<void(const VideoFrame&)> onVideo;
  std::function<void(const AudioFrame&)> onAudio;
  // Every notification (on the dispatcher's thread), after the job's own use.
  NotificationListener onNotification;
  // Runs on the main thread once the source is receiving (or after 5 s
  // without), after the PTZ, tally and shot events went out; with the session.
  std::function<void(Session&, const std::string& id)> whileReceiving;
};

struct ReceiveResult {
  int exitStatus = 1;      // of the job: 0 when it ran to its end and kept its outputs
  std::string id;          // the source's unique id
  std::string name;
  std::string error;       // why it did not run
  int runnerExit = -1;
  double runnerCpuSeconds = 0;           // user + system time of pm-runner, read before stop_source
  double firstPictureSeconds = -1;       // from sending start_source to reading the first picture; -1: none
  double runnerCpuAtFirstPicture = 0;    // runnerCpuSeconds as it was when the first picture was read (20 ms)
  std::vector<std::string> memoryBases;  // of the source's queue (its segments' names start so)
  StatsSnapshot stats;
  nlohmann::json ToJson() const;
};

ReceiveResult Receive(const ReceiveOptions& options);

// A one-line human summary; empty when no source was resolved.
std::string SummaryText(const ReceiveResult& result);

struct DemoOptions {
  HostOptions host;
  std::string senderPath;        // empty: ndi-testsrc found beside this program (locate.h)
  std::string png = "demo.png";
  double seconds = 5;
  Progress progress = Progress::None;
  std::FILE* out = stdout;       // the summary (with json: only the JSON document)
  std::FILE* err = stderr;       // failures (with json: every other line too)
  const std::atomic<bool>* interrupted = nullptr;
  bool json = false;
  // The runtime compresses pictures (the vendor's): the sender sends the
  // "blocks" pattern and its ramp sound, checked within tolerances, instead
  // of bars and tone checked exactly.
  bool lossy = false;
};

// Returns the exit status: 0 only when pictures and sound arrived intact and
// the snapshot on disk shows the bars.
int RunDemo(const DemoOptions& options);

}  // namespace pmhost
