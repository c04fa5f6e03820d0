#include "ndi-loopback/registry.h"

#include <algorithm>
#include <cctype>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <system_error>

#include "ndi-loopback/registry_system.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"

namespace ndilb {
namespace {

constexpr const char* kSuffix = ".ndi";
constexpr std::size_t kMaxEntryBytes = 4096;

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
  } else {
    dir = sys::DefaultRegistryDir();
  }
  int error = 0;
  if (!sys::MakePrivateDir(dir, &error)) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot create registry folder %s: %s", dir.c_str(),
            pm::SystemErrorText(error).c_str());
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
  int error = 0;
  if (!sys::WriteNewFile(temp, text, &error)) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot write registry entry %s: %s", temp.c_str(),
            pm::SystemErrorText(error).c_str());
    sys::RemoveFile(temp);
    return {};
  }
  if (!sys::RenameFile(temp, path, &error)) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot publish registry entry %s: %s", path.c_str(),
            pm::SystemErrorText(error).c_str());
    sys::RemoveFile(temp);
    return {};
  }
  return path;
}

void RemoveRegistryEntry(const std::string& path) {
  if (!path.empty()) sys::RemoveFile(path);
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

bool ProcessAlive(int pid) { return pid > 0 && sys::ProcessAlive(pid); }

std::vector<RegistryEntry> ListRegistry() {
  std::vector<RegistryEntry> entries;
  const std::string dir = RegistryDir();
  std::error_code error;
  for (std::filesystem::directory_iterator it(dir, error), end; !error && it != end; it.increment(error)) {
    const std::string file = it->path().filename().string();
    if (file.size() <= std::strlen(kSuffix) || file[0] == '.' ||
        file.compare(file.size() - std::strlen(kSuffix), std::string::npos, kSuffix) != 0) {
      continue;
    }
    std::string text;
    RegistryEntry e;
    if (!sys::ReadSmallFile(dir + "/" + file, kMaxEntryBytes, &text) || text.size() > kMaxEntryBytes ||
        !ParseRegistryEntry(text, &e)) {
      continue;
    }
    if (!ProcessAlive(e.pid)) continue;
    entries.push_back(std::move(e));
  }
  std::sort(entries.begin(), entries.end(), [](const RegistryEntry& a, const RegistryEntry& b) {
    return a.name != b.name ? a.name < b.name : a.url < b.url;
  });
  return entries;
}

std::string FullSourceName(const std::string& name) {
  std::string upper = pm::HostName();
  for (char& c : upper) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return upper + " (" + name + ")";
}

}  // namespace ndilb
