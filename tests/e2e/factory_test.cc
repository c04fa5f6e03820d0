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

class FactoryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    g_cpuSupported = true;
    g_initializeResult = true;
    g_initializeCalls = 0;
    g_destroyCalls = 0;
    auto api = std::make_shared<TaskNDISource::NdiApi>();
    api->is_supported_CPU = ScriptedCpu;
    api->initialize = ScriptedInitialize;
    api->version = ScriptedVersion;
    api->destroy = ScriptedDestroy;
    api_ = api;
  }
  std::shared_ptr<const TaskNDISource::NdiApi> api_;
};

TEST_F(FactoryTest, UnsupportedProcessorGivesNoTaskAndShutsTheRuntimeDownOnce) {
  g_cpuSupported = false;
  pmtest::LogCapture log;
  EXPECT_EQ(TaskNDISource::MakeTask(api_), nullptr);
  EXPECT_EQ(g_initializeCalls.load(), 0);
  EXPECT_EQ(g_destroyCalls.load(), 1);
  EXPECT_EQ(log.Lines(), std::vector<std::string>{"#ndisource: failed initialization. CPU not supported\n"});
}

TEST_F(FactoryTest, FailedInitialisationGivesNoTaskAndShutsTheRuntimeDownOnce) {
  g_initializeResult = false;
  pmtest::LogCapture log;
  EXPECT_EQ(TaskNDISource::MakeTask(api_), nullptr);
  EXPECT_EQ(g_destroyCalls.load(), 1);
  EXPECT_EQ(log.Lines(), std::vector<std::string>{"#ndisource: failed initialization.\n"});
}

TEST_F(FactoryTest, SuccessLogsOneLineInstallsBothFactoriesAndDestroysOnce) {
  pmtest::LogCapture log;
  pm::TaskBase* base = TaskNDISource::MakeTask(api_);
  ASSERT_NE(base, nullptr);
  EXPECT_EQ(log.Lines(), std::vector<std::string>{"#ndisource: Initialized NDIlib (scripted 9.9)\n"});
  auto* task = dynamic_cast<TaskNDISource::NDISourceTask*>(base);
  ASSERT_NE(task, nullptr);
  EXPECT_TRUE(task->HasSourceFactory());
  EXPECT_TRUE(task->HasDiscoveryFactory());
  EXPECT_EQ(g_destroyCalls.load(), 0);
  // Shutdown of an idle task touches no runtime, and the destructor (through
  // the base, as the runner ends it) shuts the runtime down once.
  base->Shutdown();
  EXPECT_EQ(g_destroyCalls.load(), 0);
  delete base;
  EXPECT_EQ(g_destroyCalls.load(), 1);
  EXPECT_EQ(g_initializeCalls.load(), 1);
}

TEST(FactoryLibrary, MissingLibraryIsNamedInOneLine) {
  pmtest::LogCapture log;
  EXPECT_EQ(TaskNDISource::MakeTaskFromLibrary("/nonexistent/libno-such-ndi.so"), nullptr);
  ASSERT_EQ(log.Lines().size(), 1u);
  EXPECT_EQ(log.Lines()[0].rfind("#ndisource: ", 0), 0u);
  EXPECT_TRUE(log.Contains("/nonexistent/libno-such-ndi.so"));
}

#ifdef STUB_RUNTIME_PARTIAL_PATH
TEST(FactoryLibrary, MissingSymbolIsNamedInOneLine) {
  pmtest::LogCapture log;
  EXPECT_EQ(TaskNDISource::MakeTaskFromLibrary(STUB_RUNTIME_PARTIAL_PATH), nullptr);
  ASSERT_EQ(log.Lines().size(), 1u);
  const std::string line = log.Lines()[0];
  EXPECT_EQ(line.rfind("#ndisource: ", 0), 0u);
  EXPECT_NE(line.find("lacks 'NDIlib_"), std::string::npos) << line;
}
#endif

#ifdef STUB_RUNTIME_COMPLETE_PATH
TEST(FactoryLibrary, CompleteLibraryGivesATaskAfterOneInitialisationLine) {
  pmtest::LogCapture log;
  pm::TaskBase* task = TaskNDISource::MakeTaskFromLibrary(STUB_RUNTIME_COMPLETE_PATH);
  ASSERT_NE(task, nullptr);
  EXPECT_EQ(log.Lines(), std::vector<std::string>{"#ndisource: Initialized NDIlib (stub 1.0)\n"});
  delete task;
}
#endif

}  // namespace
