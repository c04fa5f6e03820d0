#include "pm/runtime/log.h"

#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <vector>

#include "pm/runtime/context.h"

namespace pm {
namespace {

// The process-wide format buffer; it only grows. Guarded by FormatMutex().
std::vector<char>& FormatBuffer() {
  static auto* buffer = new std::vector<char>();
  return *buffer;
}

std::mutex& FormatMutex() {
  static auto* mutex = new std::mutex();
  return *mutex;
}

}  // namespace

void Log(LogType level, const char* tag, const char* format, ...) {
  Context::LogSink sink = CurrentLogSink();
  if (!sink || format == nullptr) return;
  if (tag == nullptr) tag = "";

  va_list args;
  va_start(args, format);
  va_list counting;
  va_copy(counting, args);
  const int n = std::vsnprintf(nullptr, 0, format, counting);
  va_end(counting);
  if (n < 0) {
    va_end(args);
    return;
  }
  const std::size_t t = std::strlen(tag);
  const std::size_t needed = static_cast<std::size_t>(n) + 2 + t;

  std::lock_guard<std::mutex> guard(FormatMutex());
  std::vector<char>& buffer = FormatBuffer();
  if (needed > buffer.size()) buffer.resize(needed + 1024);
  std::memcpy(buffer.data(), tag, t);
  std::vsnprintf(buffer.data() + t, buffer.size() - t, format, args);
  va_end(args);
  std::size_t end = t + static_cast<std::size_t>(n);
  if (n == 0 || buffer[end - 1] != '\n') buffer[end++] = '\n';
  buffer[end] = '\0';
  sink(level, buffer.data());
}

void LogText(const char* tag, const char* text) {
  Context::LogSink sink = CurrentLogSink();
  if (!sink) return;
  if (tag == nullptr) tag = "";
  if (text == nullptr) text = "\n";
  const std::size_t t = std::strlen(tag);
  const std::size_t m = std::strlen(text);
  const bool endsWithNewline = m > 0 && text[m - 1] == '\n';
  if (t == 0 && endsWithNewline) {
    sink(LogType::Normal, text);
    return;
  }
  char local[1024];
  std::vector<char> heap;
  char* line = local;
  if (t + m + 2 > sizeof local) {
    heap.resize(t + m + 2);
    line = heap.data();
  }
  std::memcpy(line, tag, t);
  std::memcpy(line + t, text, m);
  std::size_t end = t + m;
  if (!endsWithNewline) line[end++] = '\n';
  line[end] = '\0';
  sink(LogType::Normal, line);
}

}  // namespace pm
