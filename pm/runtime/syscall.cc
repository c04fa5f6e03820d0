#include "pm/runtime/syscall.h"

#include <system_error>

namespace pm {

std::string ErrnoText(int err) {
  // The C library's text (strerror), safely from any thread.
  return std::generic_category().message(err) + " (errno " + std::to_string(err) + ")";
}

}  // namespace pm
