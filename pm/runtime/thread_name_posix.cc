#include "pm/runtime/thread_name.h"

#include <pthread.h>

#include "pm/runtime/text.h"

namespace pm {

void SetThreadName(const std::string& name) {
  Utf8ToUtf16(name);  // validates: invalid UTF-8 throws std::range_error
  std::string cut = name.substr(0, 15);
  // Do not leave half a character at the end.
  if (name.size() > 15) {
    std::size_t end = 15;
    while (end > 0 && (static_cast<unsigned char>(name[end]) & 0xC0) == 0x80) --end;
    cut = name.substr(0, end);
  }
  pthread_setname_np(pthread_self(), cut.c_str());
}

void ClearThreadName() { pthread_setname_np(pthread_self(), ""); }

std::string CurrentThreadName() {
  char buffer[32] = {};
  if (pthread_getname_np(pthread_self(), buffer, sizeof buffer) != 0) return {};
  return buffer;
}

}  // namespace pm
