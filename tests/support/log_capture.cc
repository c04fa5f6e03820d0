#include "support/log_capture.h"

#include "pm/runtime/system.h"

namespace pmtest {
namespace {

std::mutex g_activeMutex;        // guards g_active
LogCapture* g_active = nullptr;  // the innermost live capture

void Forward(pm::LogType, const char* line) {
  std::lock_guard<std::mutex> guard(g_activeMutex);
  if (g_active != nullptr) {
    g_active->Add(line);
    return;
  }
  pm::WriteToStderr(line);
}

using SinkFunction = void (*)(pm::LogType, const char*);

// The forwarder goes into the context's slot before main, while the process
// has one thread: a test that starts capturing after its threads log never
// writes the slot under them.
[[maybe_unused]] const bool g_forwarderInstalled = [] {
  pm::GetContext()->logSink = Forward;
  return true;
}();

}  // namespace

LogCapture::LogCapture() {
  std::lock_guard<std::mutex> guard(g_activeMutex);
  pm::Context* context = pm::GetContext();
  const SinkFunction* installed = context->logSink.target<SinkFunction>();
  if (installed == nullptr || *installed != &Forward) context->logSink = Forward;
  previous_ = g_active;
  g_active = this;
}

LogCapture::~LogCapture() {
  std::lock_guard<std::mutex> guard(g_activeMutex);
  if (g_active == this) g_active = previous_;
}

void LogCapture::Add(const char* line) {
  std::lock_guard<std::mutex> guard(mutex_);
  lines_.emplace_back(line);
}

std::vector<std::string> LogCapture::Lines() const {
  std::lock_guard<std::mutex> guard(mutex_);
  return lines_;
}

int LogCapture::Count(const std::string& text) const {
  int n = 0;
  for (const auto& line : Lines()) n += line.find(text) != std::string::npos;
  return n;
}

void LogCapture::Clear() {
  std::lock_guard<std::mutex> guard(mutex_);
  lines_.clear();
}

}  // namespace pmtest
