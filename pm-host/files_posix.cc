#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "pm-host/files.h"

namespace pmhost {

std::string CannotWrite(const std::string& path) {
  const bool existed = ::access(path.c_str(), F_OK) == 0;
  const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_NONBLOCK | O_CLOEXEC, 0644);
  if (fd < 0) return "cannot write " + path + ": " + std::strerror(errno);
  ::close(fd);
  if (!existed) ::unlink(path.c_str());
  return {};
}

}  // namespace pmhost
