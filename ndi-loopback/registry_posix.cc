#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "ndi-loopback/registry_system.h"
#include "pm/runtime/syscall.h"

namespace ndilb::sys {

std::string DefaultRegistryDir() {
  if (const char* xdg = std::getenv("XDG_RUNTIME_DIR"); xdg != nullptr && xdg[0] != '\0') {
    return std::string(xdg) + "/ndi-loopback";
  }
  return "/tmp/ndi-loopback-" + std::to_string(::getuid());
}

bool MakePrivateDir(const std::string& dir, int* error) {
  if (::mkdir(dir.c_str(), 0700) == 0 || errno == EEXIST) return true;
  *error = errno;
  return false;
}

bool ReadSmallFile(const std::string& path, std::size_t limit, std::string* out) {
  const int fd = pm::RetryEintr([&] { return ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW); });
  if (fd < 0) return false;
  std::string buffer(limit + 1, '\0');
  std::size_t have = 0;
  while (have < buffer.size()) {
    const ssize_t n = pm::RetryEintr([&] { return ::read(fd, buffer.data() + have, buffer.size() - have); });
    if (n <= 0) break;
    have += static_cast<std::size_t>(n);
  }
  ::close(fd);
  buffer.resize(have);
  *out = std::move(buffer);
  return true;
}

bool WriteNewFile(const std::string& path, const std::string& text, int* error) {
  const int fd = pm::RetryEintr(
      [&] { return ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0600); });
  if (fd < 0) {
    *error = errno;
    return false;
  }
  std::size_t done = 0;
  while (done < text.size()) {
    const ssize_t n = pm::RetryEintr([&] { return ::write(fd, text.data() + done, text.size() - done); });
    if (n <= 0) {
      *error = n < 0 ? errno : EIO;
      ::close(fd);
      return false;
    }
    done += static_cast<std::size_t>(n);
  }
  ::close(fd);
  return true;
}

bool RenameFile(const std::string& from, const std::string& to, int* error) {
  if (::rename(from.c_str(), to.c_str()) == 0) return true;
  *error = errno;
  return false;
}

void RemoveFile(const std::string& path) { ::unlink(path.c_str()); }

}  // namespace ndilb::sys
