// pm-host: the reference host. Starts pm-runner with the task module, and
// drives it over the command connection and the frame queues.
//
//   pm-host list [--seconds S]
//   pm-host receive SOURCE [--seconds S | --frames N] [--bandwidth highest|lowest|audio_only]
//                  [--snapshot FILE.png] [--wav FILE.wav] [--ptz JSON]... [--tally live|preview|both]
//                  [--shot-event TEXT]... [--json]
//   pm-host demo [--png FILE] [--sender PATH] [--json]
// --runner PATH, --module PATH and --runner-log FILE may come before or after
// the command (default: the programs found beside pm-host, see locate.h).
//
// Exit status: 0 success; 1 the job failed; 2 a usage error. Standard output
// carries the results (with --json exactly one JSON document); log lines and
// errors go to standard error.
#include <atomic>
#include <cstdio>

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include "pm-host/console.h"
#include "pm-host/locate.h"
#include "pm-host/process.h"
#include "pm-host/receive.h"
#include "pm/runtime/context.h"
#include "pm/runtime/system.h"

namespace {

constexpr int kExitUsage = 2;

std::atomic<bool> g_interrupted{false};

// The default of --runner, --module or --sender as help shows it.
std::string DefaultPath(pmhost::Companion companion) {
  const std::string path = pmhost::LocateIn(companion, pmhost::ProgramDirectory());
  return path.empty() ? std::string("none found beside pm-host") : path;
}

// The options of the host itself, on the main command and on each command,
// so that they may be given before or after it.
void AddHostOptions(CLI::App* app, pmhost::HostOptions& host) {
  app->add_option("--runner", host.runnerPath, "the runner program")
      ->check(CLI::ExistingFile)
      ->default_str(DefaultPath(pmhost::Companion::Runner));
  app->add_option("--module", host.modulePath, "the task module")
      ->check(CLI::ExistingFile)
      ->default_str(DefaultPath(pmhost::Companion::Module));
  app->add_option("--runner-log", host.runnerLog, "write the runner's log lines to this file")
      ->default_str("this program's stderr; demo: shown only when it fails");
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"pm-host: the reference host of the NDI source task.\n"
               "Exit status: 0 success, 1 the job failed, 2 a usage error."};
  app.set_version_flag("--version", "pm-host " PM_VERSION);
  app.require_subcommand(1);
  pmhost::HostOptions host;
  AddHostOptions(&app, host);

  pmhost::ListOptions list;
  CLI::App* listCommand = app.add_subcommand("list", "discover NDI sources; print each as it appears and vanishes");
  listCommand->add_option("--seconds", list.seconds, "how long to watch (0: until interrupted)")
      ->check(CLI::NonNegativeNumber)
      ->capture_default_str();

  pmhost::ReceiveOptions receive;
  bool json = false;
  std::vector<std::string> ptz;
  CLI::App* receiveCommand = app.add_subcommand("receive", "receive one source");
  receiveCommand->add_option("SOURCE", receive.source, "NDI name, unique id, or text matching exactly one name")
      ->required();
  auto* seconds = receiveCommand->add_option("--seconds", receive.seconds, "receive for S seconds")
                      ->check(CLI::NonNegativeNumber)
                      ->default_str("until interrupted");
  auto* frames = receiveCommand->add_option("--frames", receive.frames, "receive N pictures")
                     ->check(CLI::NonNegativeNumber)
                     ->default_str("until interrupted");
  seconds->excludes(frames);
  receiveCommand->add_option("--bandwidth", receive.bandwidth, "what the sender sends")
      ->check(CLI::IsMember({"highest", "lowest", "audio_only"}))
      ->capture_default_str();
  receiveCommand->add_option("--snapshot", receive.snapshot, "write the last picture as PNG");
  receiveCommand->add_option("--wav", receive.wav, "write the sound as WAV");
  receiveCommand->add_option("--ptz", ptz, "a PTZ command as JSON, e.g. {\"command\":\"Zoom\",\"zoom\":0.5}")
      ->check([](const std::string& text) {
        const auto value = nlohmann::json::parse(text, nullptr, false);
        return value.is_object() ? std::string() : std::string("not a JSON object: ") + text;
      });
  receiveCommand->add_option("--tally", receive.tally, "tally to send")
      ->check(CLI::IsMember({"live", "preview", "both"}));
  receiveCommand->add_option("--shot-event", receive.shotEvents, "a shot event to send");
  receiveCommand->add_flag("--json", json, "print the summary as one JSON document");

  pmhost::DemoOptions demo;
  CLI::App* demoCommand = app.add_subcommand("demo", "send colour bars from a private sender, receive and check them");
  demoCommand->add_option("--sender", demo.senderPath, "the test sender")
      ->check(CLI::ExistingFile)
      ->default_str(DefaultPath(pmhost::Companion::Sender));
  demoCommand->add_option("--png", demo.png, "where to write the snapshot (relative: in the current folder)")
      ->capture_default_str();
  demoCommand->add_flag("--json", demo.json, "print the summary as one JSON document");
#ifdef PM_NDI_VENDOR_RUNTIME
  demo.lossy = true;  // built on the vendor runtime
#endif
  demoCommand->add_flag("--lossy", demo.lossy,
                        "check the pictures within a lossy codec's tolerance (the vendor runtime's; the default when "
                        "built on it)");
  for (CLI::App* command : {listCommand, receiveCommand, demoCommand}) AddHostOptions(command, host);

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    // Help and --version end with 0; every mistake on the line with 2.
    return app.exit(e) == 0 ? 0 : kExitUsage;
  }

  pm::GetContext()->logSink = [](pm::LogType, const char* line) { pm::WriteToStderr(line); };
  pmhost::OnInterrupt(&g_interrupted);
  const pmhost::Progress progress = pmhost::StdoutIsTerminal() ? pmhost::Progress::Terminal : pmhost::Progress::Lines;

  if (*listCommand) {
    list.host = host;
    list.interrupted = &g_interrupted;
    return pmhost::Discover(list);
  }
  if (*receiveCommand) {
    receive.host = host;
    receive.interrupted = &g_interrupted;
    receive.progress = json ? pmhost::Progress::None : progress;
    for (const std::string& text : ptz) receive.ptz.push_back(nlohmann::json::parse(text));
    const pmhost::ReceiveResult result = pmhost::Receive(receive);
    if (!result.error.empty()) std::fprintf(stderr, "pm-host: %s\n", result.error.c_str());
    if (json) {
      std::printf("%s\n", result.ToJson().dump().c_str());
    } else if (!result.id.empty()) {
      std::printf("%s\n", pmhost::SummaryText(result).c_str());
    }
    return result.exitStatus;
  }
  demo.host = host;
  demo.interrupted = &g_interrupted;
  demo.progress = demo.json ? pmhost::Progress::None : progress;
  return pmhost::RunDemo(demo);
}
