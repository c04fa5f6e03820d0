// The command line of every program, run as programs: the exit statuses (0
// success, 1 the job failed, 2 a usage error; pm-runner's own 3), host
// options before and after the command, --version and --help, --json output
// that is exactly one document, failures that exit non-zero; and
// `pm-host demo` itself, which must pass (its snapshot showing the bars).
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <fstream>
#include <mutex>
#include <string>
#include <vector>

#include "e2e_support.h"

namespace {

using nlohmann::json;
using namespace std::chrono_literals;

struct Case {
  const char* name;
  const char* program;  // its path
  // {folder} {sender} {dying-runner} stand for paths and the running
  // sender's name.
  std::vector<std::string> args;
  int status;
  const char* out;  // nullptr: not checked; "": nothing; else a text it holds
  const char* err = "";  // a text standard error holds
  bool sender = false;   // a sender runs in the registry
  bool json = false;     // standard output is exactly one JSON document
};

class CommandLine : public ::testing::TestWithParam<Case> {};

TEST_P(CommandLine, ExitsWithItsStatusAndPrintsWhereItShould) {
  const Case& c = GetParam();
  pmtest::Folder folder;
  pmtest::Sender sender;
  if (c.sender) {
    ASSERT_TRUE(sender.Start(folder, "Cli", {"--width", "64", "--height", "16", "--fps", "60"}));
  }
  // Not a module; and a runner that dies (SIGKILL) once its task has started
  // discovery for the host.
  std::ofstream(folder.path + "/not-a-module.so") << "text";
  const std::string dying = folder.path + "/dying-runner";
  std::ofstream(dying) << "#!/bin/sh\n\"" << PM_RUNNER_PATH << "\" \"$@\" 2>\"$0.log\" &\npid=$!\n"
                       << "until grep -q 'creating discovery' \"$0.log\"; do sleep 0.05; done\n"
                       << "kill -9 $pid\nwait $pid\n";
  ::chmod(dying.c_str(), 0755);

  // Run to its end, standard output and error apart (the runner's log goes
  // with the host's).
  pmhost::ChildOptions o;
  o.path = c.program;
  const std::pair<std::string, std::string> names[] = {
      {"{folder}", folder.path}, {"{dying-runner}", dying}, {"{sender}", c.sender ? sender.Name() : ""}};
  for (std::string arg : c.args) {
    for (const auto& [name, value] : names) {
      if (const std::size_t at = arg.find(name); at != std::string::npos) arg.replace(at, name.size(), value);
    }
    o.args.push_back(arg);
  }
  o.env = {{"NDI_LOOPBACK_DIR", folder.Registry()}};
  o.stderrPath = folder.RunnerLog();
  o.captureStdout = true;
  std::mutex lock;  // guards out
  std::string out;
  o.onLine = [&](const std::string& line) {
    std::lock_guard<std::mutex> guard(lock);
    out += line + "\n";
  };
  int status = -1;
  {
    pmhost::ChildProcess child;
    ASSERT_TRUE(child.Start(std::move(o)));
    status = child.Wait(90s).value_or(-2);
  }  // joins the reader of standard output
  const std::string err = folder.ReadRunnerLog();
  EXPECT_EQ(status, c.status) << err;
  if (c.out != nullptr && *c.out == '\0') {
    EXPECT_EQ(out, "");
  } else if (c.out != nullptr) {
    EXPECT_NE(out.find(c.out), std::string::npos) << out;
  }
  EXPECT_NE(err.find(c.err), std::string::npos) << err;
  if (c.json) {
    const json document = json::parse(out, nullptr, false);
    ASSERT_TRUE(document.is_object()) << out;
    EXPECT_GE(document.value("frames", 0), 10) << out;
    EXPECT_EQ(document.value("source", ""), sender.Name());
  }
}

const std::vector<std::string> kHostOptions{"--runner", PM_RUNNER_PATH, "--module", PM_MODULE_PATH};

std::vector<std::string> Join(std::vector<std::string> a, const std::vector<std::string>& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

INSTANTIATE_TEST_SUITE_P(
    Programs, CommandLine,
    ::testing::Values(
        // --version and --help end with 0 and print to standard output; help
        // shows the defaults. (Every program's come from the same parser.)
        Case{"HostVersion", PM_HOST_PATH, {"--version"}, 0, "pm-host "},
        Case{"HostHelp", PM_HOST_PATH, {"--help"}, 0, "2 a usage error"},
        Case{"ReceiveHelp", PM_HOST_PATH, {"receive", "--help"}, 0, "=highest"},
        Case{"RunnerHelp", PM_RUNNER_PATH, {"--help"}, 0, "--connect"},
        // Usage errors: 2 from every program, nothing on standard output.
        Case{"HostWithoutCommand", PM_HOST_PATH, {}, 2, "", "subcommand is required"},
        Case{"HostSecondsAndFrames", PM_HOST_PATH, {"receive", "x", "--seconds", "1", "--frames", "1"}, 2, ""},
        Case{"HostRunnerAfterCommandMissing", PM_HOST_PATH, {"receive", "x", "--runner", "{folder}/none"}, 2, "",
             "--runner"},
        Case{"HostBadPtz", PM_HOST_PATH, {"receive", "x", "--ptz", "[1]"}, 2, "", "not a JSON object"},
        Case{"RunnerWithoutConnect", PM_RUNNER_PATH, {"--module", PM_MODULE_PATH}, 2, ""},
        Case{"RunnerModuleMissing", PM_RUNNER_PATH, {"--module", "{folder}/none.so", "--connect", "1"}, 2, ""},
        Case{"TestsrcWithoutName", PM_TESTSRC_PATH, {"--width", "64"}, 2, "", "--name"},
        // Jobs that fail.
        Case{"RunnerModuleCannotRun", PM_RUNNER_PATH, {"--module", "{folder}/not-a-module.so", "--connect", "1"}, 3,
             "", "cannot load"},
        Case{"ReceiveWavCannotBeWritten", PM_HOST_PATH,
             Join({"receive", "{sender}", "--seconds", "1", "--wav", "{folder}/none/x.wav"}, kHostOptions), 1, "",
             "cannot write", true},
        Case{"ListRunnerDies", PM_HOST_PATH, {"list", "--seconds", "60", "--runner", "{dying-runner}"}, 1, nullptr,
             "during the run"},
        Case{"ReceiveNoSuchSource", PM_HOST_PATH, Join({"receive", "nobody", "--seconds", "1"}, kHostOptions), 1,
             "", "no source matches"},
        // The host options before and after the command.
        Case{"ListOptionsAfter", PM_HOST_PATH, Join({"list", "--seconds", "1"}, kHostOptions), 0, "+ ", "", true},
        Case{"ListOptionsBefore", PM_HOST_PATH, Join(kHostOptions, {"list", "--seconds", "1"}), 0, "+ ", "", true},
        // The demo: its pictures and sound intact, and its snapshot showing
        // the bars (it reads its PNG back), found in the build tree.
        Case{"Demo", PM_HOST_PATH, {"demo", "--json", "--png", "{folder}/demo.png"}, 0, "\"passed\":true",
             "frames arrived intact"},
        Case{"ReceiveJson", PM_HOST_PATH,
             Join({"receive", "{sender}", "--frames", "10", "--json", "--wav", "{folder}/x.wav"}, kHostOptions), 0,
             "\"frames\"", "", true, true}),
    [](const ::testing::TestParamInfo<Case>& info) { return std::string(info.param.name); });

}  // namespace
