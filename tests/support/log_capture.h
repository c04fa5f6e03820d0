#pragma once
// Captures the log lines of the process-wide context for the life of the
// object, restoring the previous sink afterwards. Safe for concurrent log
// calls.
#include <mutex>
#include <string>
#include <vector>

#include "pm/runtime/context.h"

namespace pmtest {

class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<std::string> Lines() const;
  // Number of captured lines that contain `text`.
  int Count(const std::string& text) const;
  bool Contains(const std::string& text) const { return Count(text) > 0; }
  void Clear();

 private:
  pm::Context::LogSink previous_;
  mutable std::mutex mutex_;         // guards lines_
  std::vector<std::string> lines_;
};

}  // namespace pmtest
