// The task factory on scripted runtimes and on stand-in libraries: a runtime
// that cannot run here gives no task after one log line, and the runtime is
// shut down exactly once for every task object made.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <string>

#include "support/log_capture.h"
#include "taskndisource/ndi_source_task.h"

namespace {

// What the scripted runtime answers, and what was called.
std::atomic<bool> g_cpuSupported{true};
std::atomic<bool> g_initializeResult{true};
std::atomic<int> g_initializeCalls{0};
std::atomic<int> g_destroyCalls{0};

bool ScriptedCpu() { return g_cpuSupported.load(); }
bool ScriptedInitialize() {
  ++g_initializeCalls;
  return g_initializeResult.load();
}
const char* ScriptedVersion() { return "scripted 9.9"; }
void ScriptedDestroy() { ++g_destroyCalls; }

std::shared_ptr<const TaskNDISource::NdiApi> ScriptedApi() {
  auto api = std::make_shared<TaskNDISource::NdiApi>();
  api->is_supported_CPU = ScriptedCpu;
  api->initialize = ScriptedInitialize;
  api->version = ScriptedVersion;
  api->destroy = ScriptedDestroy;
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
    EXPECT_EQ(g_initializeCalls.load(), c.initializeCalls);
    EXPECT_EQ(g_destroyCalls.load(), base ? 0 : 1);
    if (!c.cpu || !c.initializes) {
      EXPECT_EQ(base, nullptr);
      continue;
    }
    auto* task = dynamic_cast<TaskNDISource::NDISourceTask*>(base);
    ASSERT_NE(task, nullptr);
    EXPECT_TRUE(task->HasSourceFactory() && task->HasDiscoveryFactory());
    // Shutdown of an idle task touches no runtime, and the destructor (through
    // the base, as the runner ends it) shuts the runtime down once.
    base->Shutdown();
    EXPECT_EQ(g_destroyCalls.load(), 0);
    delete base;
    EXPECT_EQ(g_destroyCalls.load(), 1);
  }
}

// A library that is missing or lacks a function is named in the one line.
TEST(FactoryLibrary, GivesATaskOnlyOnACompleteLibraryAfterOneLineSayingWhy) {
  const struct {
    std::string path, text;  // the one line starts "#ndisource: " and holds text
    bool task;
  } cases[] = {
      {"/nonexistent/libno-such-ndi.so", "/nonexistent/libno-such-ndi.so", false},
#ifdef STUB_RUNTIME_PARTIAL_PATH
      {STUB_RUNTIME_PARTIAL_PATH, "lacks 'NDIlib_", false},
#endif
#ifdef STUB_RUNTIME_COMPLETE_PATH
      {STUB_RUNTIME_COMPLETE_PATH, "Initialized NDIlib (stub 1.0)\n", true},
#endif
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path);
    pmtest::LogCapture log;
    pm::TaskBase* task = TaskNDISource::MakeTaskFromLibrary(c.path.c_str());
    EXPECT_EQ(task != nullptr, c.task);
    EXPECT_EQ(log.Lines().size(), 1u);
    EXPECT_EQ(log.Lines().at(0).rfind("#ndisource: ", 0), 0u);
    EXPECT_TRUE(log.Contains(c.text)) << log.Lines()[0];
    delete task;
  }
}

}  // namespace
