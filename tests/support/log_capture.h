#pragma once
// Captures the log lines of the process-wide context for the life of the
// object. The context's sink slot is written once per process (a forwarder
// installed by the first capture); captures only change which one is active,
// under a mutex, so threads that keep logging while captures come and go never
// race with the slot. Lines logged while no capture is active go to stderr.
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

  // Called by the forwarder.
  void Add(const char* line);

 private:
  LogCapture* previous_ = nullptr;   // the capture active before this one
  mutable std::mutex mutex_;         // guards lines_
  std::vector<std::string> lines_;
};

}  // namespace pmtest
