#include "e2e_support.h"

#include <signal.h>
#include <stdlib.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <mutex>
#include <set>
#include <thread>

#include <gtest/gtest.h>

#include "support/wait.h"

namespace pmtest {

using nlohmann::json;
using namespace std::chrono_literals;

std::string Folder::ReadRunnerLog() const {
  std::ifstream in(RunnerLog());
  return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

bool Sender::Start(const Folder& folder, const std::string& name, std::vector<std::string> args) {
  pmhost::ChildOptions o;
  o.path = PM_TESTSRC_PATH;
  o.args = {"--name", name};
  // Two minutes unless the caller says how long.
  if (std::find(args.begin(), args.end(), "--seconds") == args.end() &&
      std::find(args.begin(), args.end(), "--frames") == args.end()) {
    o.args.insert(o.args.end(), {"--seconds", "120"});
  }
  o.args.insert(o.args.end(), args.begin(), args.end());
  o.env = {{"NDI_LOOPBACK_DIR", folder.Registry()}};
  if (folder.firstPort != 0) o.env["NDI_LOOPBACK_FIRST_PORT"] = std::to_string(folder.firstPort);
  o.captureStdout = true;
  o.onLine = [this](const std::string& line) {
    json event = json::parse(line, nullptr, false);
    std::lock_guard<std::mutex> guard(lock_);
    if (event.is_object()) events_.push_back(std::move(event));
  };
  return process_.Start(std::move(o)) && WaitFor("ready");
}

json Sender::Find(const std::string& kind, const std::function<bool(const json&)>& match) {
  std::lock_guard<std::mutex> guard(lock_);
  for (const json& e : events_) {
    if (e.value("event", "") == kind && (!match || match(e))) return e;
  }
  return nullptr;
}

bool Sender::WaitFor(const std::string& kind, const std::function<bool(const json&)>& match) {
  return pmtest::WaitFor([&] { return !Find(kind, match).is_null(); }, kPatience);
}

pmhost::HostOptions HostOptionsFor(const Folder& folder) {
  return {.runnerPath = PM_RUNNER_PATH,
          .modulePath = PM_MODULE_PATH,
          .env = {{"NDI_LOOPBACK_DIR", folder.Registry()}},
          .runnerLog = folder.RunnerLog()};
}

pmhost::ReceiveOptions ReceiveFrom(const Folder& folder, const std::string& source) {
  pmhost::ReceiveOptions o;
  o.host = HostOptionsFor(folder);
  o.source = source;
  o.out = stderr;
  return o;
}

int SegmentsOf(const std::vector<std::string>& bases) {
  int count = 0;
  std::error_code error;
  for (const auto& entry : std::filesystem::directory_iterator("/dev/shm", error)) {
    const std::string name = entry.path().filename().string();
    for (const std::string& base : bases) count += !base.empty() && name.rfind(base, 0) == 0 ? 1 : 0;
  }
  return count;
}

void ExpectASourceLedToAnotherSendersPortToComeToItsOwn(const Folder& folder) {
  constexpr int kOwnWidth = 640, kOtherWidth = 320;
  const auto args = [](int width) { return BlocksArgs(width, width * 9 / 16, {"--no-audio"}); };
  Sender own, other, again;
  ASSERT_TRUE(own.Start(folder, "Own", args(kOwnWidth)));
  const std::string id = pmhost::kSourceIdPrefix + own.Name();
  own.Process().Signal(SIGKILL);
  ASSERT_TRUE(own.Process().Wait(kPatience).has_value());
  bool up = false;
  std::thread starts(
      [&] { up = other.Start(folder, "Other", args(kOtherWidth)) && again.Start(folder, "Own", args(kOwnWidth)); });
  std::mutex lock;  // guards widths
  std::vector<int> widths;
  std::atomic<bool> stop{false};
  pmhost::ReceiveOptions o = ReceiveFrom(folder, id);
  o.seconds = 120;
  o.interrupted = &stop;
  o.onVideo = [&](const pmhost::VideoFrame& frame) {
    std::lock_guard<std::mutex> guard(lock);
    widths.push_back(frame.width);
  };
  o.whileReceiving = [&](pmhost::Session&, const std::string&) {
    pmtest::WaitFor([&] {
      std::lock_guard<std::mutex> guard(lock);
      return std::count(widths.begin(), widths.end(), kOwnWidth) >= 10;
    }, kPatience);
    stop = true;
  };
  const pmhost::ReceiveResult result = pmhost::Receive(o);
  starts.join();
  ExpectOrderlyEnd(result, folder);
  EXPECT_TRUE(up);
  std::lock_guard<std::mutex> guard(lock);
  const auto first = std::find(widths.begin(), widths.end(), kOwnWidth);
  EXPECT_NE(first, widths.end()) << std::count(widths.begin(), widths.end(), kOtherWidth) << " pictures of the other";
  EXPECT_EQ(std::find(first, widths.end(), kOtherWidth), widths.end());
}

void ExpectOrderlyEnd(const pmhost::ReceiveResult& result, const Folder& folder) {
  EXPECT_EQ(result.error, "");
  EXPECT_EQ(result.runnerExit, 0) << folder.ReadRunnerLog();
  EXPECT_FALSE(result.memoryBases.empty());
  EXPECT_EQ(SegmentsOf(result.memoryBases), 0);
  EXPECT_EQ(result.stats.badRecords, 0u);
}

std::optional<ProcessUsage> UsageOf(pid_t pid) {
  const std::string proc = pid == 0 ? "/proc/self" : "/proc/" + std::to_string(pid);
  ProcessUsage usage;
  std::error_code error;
  usage.descriptors = static_cast<int>(std::distance(std::filesystem::directory_iterator(proc + "/fd", error), {}));
  if (error) return std::nullopt;
  if (pid == 0) --usage.descriptors;  // the directory stream itself
  std::ifstream status(proc + "/status");
  if (!status) return std::nullopt;
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("Threads:", 0) == 0) usage.threads = std::atoi(line.c_str() + 8);
    if (line.rfind("VmRSS:", 0) == 0) usage.residentKiB = std::atol(line.c_str() + 6);
    if (line.rfind("RssAnon:", 0) == 0) usage.privateKiB = std::atol(line.c_str() + 8);
  }
  return usage;
}

std::optional<ProcessUsage> LevelOf(pid_t pid) {
  std::optional<ProcessUsage> level = UsageOf(pid);
  for (int i = 0; i < 4 && level; ++i) {
    std::this_thread::sleep_for(10ms);
    const std::optional<ProcessUsage> now = UsageOf(pid);
    if (!now) return std::nullopt;
    level->descriptors = std::min(level->descriptors, now->descriptors);
    level->threads = std::min(level->threads, now->threads);
    level->residentKiB = std::max(level->residentKiB, now->residentKiB);
    level->privateKiB = std::max(level->privateKiB, now->privateKiB);
  }
  return level;
}

void ExpectBackAtLevel(pid_t pid, const ProcessUsage& level, const std::string& what) {
  std::optional<ProcessUsage> now;
  pmtest::WaitFor([&] {
    now = UsageOf(pid);
    return now && now->descriptors == level.descriptors && now->threads == level.threads;
  }, kPatience);
  ASSERT_TRUE(now.has_value()) << what << ": the process is gone";
  EXPECT_EQ(now->descriptors, level.descriptors) << what << ": descriptors";
  EXPECT_EQ(now->threads, level.threads) << what << ": threads";
}

std::vector<std::string> SharedMemoryMappedBy(pid_t pid) {
  std::set<std::string> names;
  std::ifstream maps("/proc/" + std::to_string(pid) + "/maps");
  std::string line;
  const std::string folder = "/dev/shm/";
  while (std::getline(maps, line)) {
    // The name runs to the end, or to the " (deleted)" of an unlinked entry.
    const std::size_t at = line.find(folder), from = at + folder.size(), to = line.find(" (deleted)");
    if (at != std::string::npos) names.insert(line.substr(from, to - from));
  }
  return {names.begin(), names.end()};
}

}  // namespace pmtest
