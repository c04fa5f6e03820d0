#include "ndi-loopback/registry.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"

namespace ndilb {
namespace {

constexpr const char* kSuffix = ".ndi";
constexpr std::size_t kMaxEntryBytes = 4096;

bool ReadSmallFile(const std::string& path, std::string* out) {
  const int fd = pm::RetryEintr([&] { return ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW); });
  if (fd < 0) return false;
  char buffer[kMaxEntryBytes + 1];
  std::size_t have = 0;
  while (have < sizeof buffer) {
    const ssize_t n = pm::RetryEintr([&] { return ::read(fd, buffer + have, sizeof buffer - have); });
    if (n <= 0) break;
    have += static_cast<std::size_t>(n);
  }
  ::close(fd);
  if (have > kMaxEntryBytes) return false;  // not one of ours
  out->assign(buffer, have);
  return true;
}

std::string Clean(const std::string& text) {
  std::string s = text;
  for (char& c : s) {
    if (c == '\n' || c == '\r' || c == '\0') c = ' ';
  }
  return s;
}

}  // namespace

std::string RegistryDir() {
  std::string dir;
  if (const char* env = std::getenv("NDI_LOOPBACK_DIR"); env != nullptr && env[0] != '\0') {
    dir = env;
  } else if (const char* xdg = std::getenv("XDG_RUNTIME_DIR"); xdg != nullptr && xdg[0] != '\0') {
    dir = std::string(xdg) + "/ndi-loopback";
  } else {
    dir = "/tmp/ndi-loopback-" + std::to_string(::getuid());
  }
  if (::mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot create registry folder %s: %s", dir.c_str(),
            pm::ErrnoText(errno).c_str());
  }
  return dir;
}

std::string WriteRegistryEntry(const RegistryEntry& entry) {
  const std::string dir = RegistryDir();
  const std::size_t colon = entry.url.rfind(':');
  const std::string port = colon == std::string::npos ? "0" : entry.url.substr(colon + 1);
  const std::string base = std::to_string(entry.pid) + "-" + port;
  const std::string path = dir + "/" + base + kSuffix;
  const std::string temp = dir + "/." + base + ".tmp";
  const std::string text = "ndi-loopback 1\nname=" + Clean(entry.name) + "\nurl=" + Clean(entry.url) +
                           "\npid=" + std::to_string(entry.pid) + "\n";
  const int fd = pm::RetryEintr(
      [&] { return ::open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0600); });
  if (fd < 0) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot write registry entry %s: %s", temp.c_str(),
            pm::ErrnoText(errno).c_str());
    return {};
  }
  std::size_t done = 0;
  bool ok = true;
  while (done < text.size()) {
    const ssize_t n = pm::RetryEintr([&] { return ::write(fd, text.data() + done, text.size() - done); });
    if (n <= 0) {
      ok = false;
      break;
    }
    done += static_cast<std::size_t>(n);
  }
  ::close(fd);
  if (!ok || ::rename(temp.c_str(), path.c_str()) != 0) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot publish registry entry %s: %s", path.c_str(),
            pm::ErrnoText(errno).c_str());
    ::unlink(temp.c_str());
    return {};
  }
  return path;
}

void RemoveRegistryEntry(const std::string& path) {
  if (!path.empty()) ::unlink(path.c_str());
}

bool ParseRegistryEntry(const std::string& text, RegistryEntry* out) {
  RegistryEntry e;
  std::size_t pos = 0;
  int line_no = 0;
  bool have_name = false, have_url = false, have_pid = false;
  while (pos < text.size()) {
    std::size_t end = text.find('\n', pos);
    if (end == std::string::npos) return false;  // every line ends in a newline
    const std::string line = text.substr(pos, end - pos);
    pos = end + 1;
    if (line_no++ == 0) {
      if (line != "ndi-loopback 1") return false;
      continue;
    }
    if (line.rfind("name=", 0) == 0) {
      e.name = line.substr(5);
      have_name = !e.name.empty();
    } else if (line.rfind("url=", 0) == 0) {
      e.url = line.substr(4);
      have_url = !e.url.empty();
    } else if (line.rfind("pid=", 0) == 0) {
      const std::string digits = line.substr(4);
      if (digits.empty() || digits.size() > 9 ||
          !std::all_of(digits.begin(), digits.end(), [](char c) { return c >= '0' && c <= '9'; })) {
        return false;
      }
      e.pid = std::atoi(digits.c_str());
      have_pid = e.pid > 0;
    }
  }
  if (!have_name || !have_url || !have_pid) return false;
  *out = std::move(e);
  return true;
}

bool ProcessAlive(int pid) {
  if (pid <= 0) return false;
  if (::kill(pid, 0) != 0 && errno == ESRCH) return false;
  // A killed child that its parent has not reaped yet still answers kill().
  std::string stat;
  if (ReadSmallFile("/proc/" + std::to_string(pid) + "/stat", &stat)) {
    const std::size_t paren = stat.rfind(')');
    if (paren != std::string::npos && paren + 2 < stat.size() && (stat[paren + 2] == 'Z' || stat[paren + 2] == 'X')) {
      return false;
    }
  }
  return true;
}

std::vector<RegistryEntry> ListRegistry() {
  std::vector<RegistryEntry> entries;
  const std::string dir = RegistryDir();
  DIR* d = ::opendir(dir.c_str());
  if (d == nullptr) return entries;
  while (dirent* ent = ::readdir(d)) {
    const std::string file = ent->d_name;
    if (file.size() <= std::strlen(kSuffix) || file[0] == '.' ||
        file.compare(file.size() - std::strlen(kSuffix), std::string::npos, kSuffix) != 0) {
      continue;
    }
    std::string text;
    RegistryEntry e;
    if (!ReadSmallFile(dir + "/" + file, &text) || !ParseRegistryEntry(text, &e)) continue;
    if (!ProcessAlive(e.pid)) continue;
    entries.push_back(std::move(e));
  }
  ::closedir(d);
  std::sort(entries.begin(), entries.end(), [](const RegistryEntry& a, const RegistryEntry& b) {
    return a.name != b.name ? a.name < b.name : a.url < b.url;
  });
  return entries;
}

std::string FullSourceName(const std::string& name) {
  char host[256] = {};
  if (::gethostname(host, sizeof host - 1) != 0 || host[0] == '\0') std::strcpy(host, "localhost");
  std::string upper = host;
  for (char& c : upper) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return upper + " (" + name + ")";
}

}  // namespace ndilb
