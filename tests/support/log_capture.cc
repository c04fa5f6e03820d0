#include "support/log_capture.h"

namespace pmtest {

LogCapture::LogCapture() {
  pm::Context* context = pm::GetContext();
  previous_ = context->logSink;
  context->logSink = [this](pm::LogType, const char* line) {
    std::lock_guard<std::mutex> guard(mutex_);
    lines_.emplace_back(line);
  };
}

LogCapture::~LogCapture() { pm::GetContext()->logSink = previous_; }

std::vector<std::string> LogCapture::Lines() const {
  std::lock_guard<std::mutex> guard(mutex_);
  return lines_;
}

int LogCapture::Count(const std::string& text) const {
  std::lock_guard<std::mutex> guard(mutex_);
  int n = 0;
  for (const auto& line : lines_) n += line.find(text) != std::string::npos;
  return n;
}

void LogCapture::Clear() {
  std::lock_guard<std::mutex> guard(mutex_);
  lines_.clear();
}

}  // namespace pmtest
