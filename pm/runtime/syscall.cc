#include "pm/runtime/syscall.h"

#include <cstring>

namespace pm {

std::string ErrnoText(int err) {
  char buffer[128];
  const char* text = ::strerror_r(err, buffer, sizeof buffer);  // GNU form
  return std::string(text) + " (errno " + std::to_string(err) + ")";
}

}  // namespace pm
