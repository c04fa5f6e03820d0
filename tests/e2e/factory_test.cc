// The task factory on scripted runtimes and on stand-in libraries: a runtime
// that cannot run here gives no task after one log line, and the runtime is
// shut down exactly once for every task object made.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "support/log_capture.h"
#include "taskndisource/ndi_source_task.h"

namespace {

// What the scripted runtime answers, and what was called.
std::atomic<bool> g_cpuSupported{true};
std::atomic<bool> g_initializeResult{true};
std::atomic<int> g_initializeCalls{0};
std::atomic<int> g_destroyCalls{0};

std::shared_ptr<const TaskNDISource::NdiApi> ScriptedApi() {
  auto api = std::make_shared<TaskNDISource::NdiApi>();
  api->is_supported_CPU = [] { return g_cpuSupported.load(); };
  api->initialize = [] {
    ++g_initializeCalls;
    return g_initializeResult.load();
  };
  api->version = [] { return "scripted 9.9"; };
  api->destroy = [] { ++g_destroyCalls; };
  return api;
}

TEST(Factory, GivesATaskOnlyOnAUsableRuntimeAndShutsTheRuntimeDownOnceForEach) {
  const struct {
    bool cpu, initializes;
    int initializeCalls;
    const char* line;
  } cases[] = {
      {false, true, 0, "#ndisource: failed initialization. CPU not supported\n"},
      {true, false, 1, "#ndisource: failed initialization.\n"},
      {true, true, 1, "#ndisource: Initialized NDIlib (scripted 9.9)\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.line);
    g_cpuSupported = c.cpu;
    g_initializeResult = c.initializes;
    g_initializeCalls = 0;
    g_destroyCalls = 0;
    pmtest::LogCapture log;
    pm::TaskBase* base = TaskNDISource::MakeTask(ScriptedApi());
    EXPECT_EQ(log.Lines(), std::vector<std::string>{c.line});
    // A task only on a usable runtime; a refused runtime is shut down at once.
    EXPECT_EQ(std::make_tuple(base != nullptr, g_initializeCalls.load(), g_destroyCalls.load()),
              std::make_tuple(c.cpu && c.initializes, c.initializeCalls, base ? 0 : 1));
    if (base == nullptr) continue;
    // Shutdown of an idle task touches no runtime, and the destructor (through
    // the base, as the runner ends it) shuts the runtime down once.
    base->Shutdown();
    EXPECT_EQ(g_destroyCalls.load(), 0);
    delete base;
    EXPECT_EQ(g_destroyCalls.load(), 1);
  }
}

// A library that is missing or lacks a function gives no task, after one
// line naming it. (A complete one is what every whole-chain case loads.)
TEST(FactoryLibrary, AMissingOrIncompleteLibraryGivesNoTaskAfterOneLineSayingWhy) {
  std::vector<std::pair<std::string, std::string>> cases = {{"/nonexistent/libno-such-ndi.so", "/nonexistent/libno-such-ndi.so"}};
#ifdef STUB_RUNTIME_PARTIAL_PATH
  cases.emplace_back(STUB_RUNTIME_PARTIAL_PATH, "lacks 'NDIlib_");
#endif
  for (const auto& [path, text] : cases) {
    pmtest::LogCapture log;
    EXPECT_EQ(TaskNDISource::MakeTaskFromLibrary(path.c_str()), nullptr) << path;
    ASSERT_EQ(log.Lines().size(), 1u) << path;
    EXPECT_TRUE(log.Lines()[0].rfind("#ndisource: ", 0) == 0 && log.Contains(text)) << log.Lines()[0];
  }
}

}  // namespace
