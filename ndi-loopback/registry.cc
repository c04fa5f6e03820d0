#include "ndi-loopback/registry.h"

#include <algorithm>
#include <atomic>
#include <cctype>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <map>
#include <system_error>

#include "ndi-loopback/registry_system.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"

namespace ndilb {
namespace {

constexpr const char* kSuffix = ".ndi";
constexpr const char* kGoneSuffix = ".gone";
constexpr std::size_t kMaxEntryBytes = 4096;

std::int64_t RealtimeNs() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::system_clock::now().time_since_epoch())
      .count();
}

bool EndsWith(const std::string& s, const char* suffix) {
  const std::size_t n = std::strlen(suffix);
  return s.size() > n && s.compare(s.size() - n, n, suffix) == 0;
}

bool ReadSmallFile(const std::string& path, std::string* out) {
  // Anything longer is not one of ours.
  return sys::ReadSmallFile(path, kMaxEntryBytes, out) && out->size() <= kMaxEntryBytes;
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

namespace {

std::string EntryText(const RegistryEntry& e) {
  std::string text = "ndi-loopback 1\nname=" + Clean(e.name) + "\nurl=" + Clean(e.url) + "\npid=" + std::to_string(e.pid) +
                     "\nsince=" + std::to_string(e.since) + "\n";
  if (e.gone != 0) text += "gone=" + std::to_string(e.gone) + "\n";
  return text;
}

// Writes `text` to `path` through a temporary file of this writer's own, so
// that readers and other writers never see half an entry; false (logged
// unless quiet) on failure.
bool Publish(const std::string& dir, const std::string& path, const std::string& text, bool quiet = false) {
  static std::atomic<unsigned> serial{0};
  const std::string temp =
      dir + "/." + std::to_string(pm::CurrentProcessId()) + "-" + std::to_string(serial.fetch_add(1)) + ".tmp";
  int error = 0;
  if (!sys::WriteNewFile(temp, text, &error)) {
    if (!quiet) {
      pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot write registry entry %s: %s", temp.c_str(),
              pm::SystemErrorText(error).c_str());
    }
    sys::RemoveFile(temp);
    return false;
  }
  if (!sys::RenameFile(temp, path, &error)) {
    if (!quiet) {
      pm::Log(pm::LogType::Normal, "", "ndi-loopback: cannot publish registry entry %s: %s", path.c_str(),
              pm::SystemErrorText(error).c_str());
    }
    sys::RemoveFile(temp);
    return false;
  }
  return true;
}

// Turns the entry `e` read from "<base>.ndi" into "<base>.gone", gone at
// e.gone; false when the ".gone" entry cannot be written.
bool Retire(const std::string& dir, const std::string& base, const RegistryEntry& e, bool quiet) {
  if (!Publish(dir, dir + "/" + base + kGoneSuffix, EntryText(e), quiet)) return false;
  sys::RemoveFile(dir + "/" + base + kSuffix);
  return true;
}

}  // namespace

std::string WriteRegistryEntry(const RegistryEntry& entry) {
  const std::string dir = RegistryDir();
  const std::size_t colon = entry.url.rfind(':');
  const std::string port = colon == std::string::npos ? "0" : entry.url.substr(colon + 1);
  const std::string path = dir + "/" + std::to_string(entry.pid) + "-" + port + kSuffix;
  RegistryEntry stamped = entry;
  stamped.since = RealtimeNs();
  stamped.gone = 0;
  return Publish(dir, path, EntryText(stamped)) ? path : std::string();
}

void RetireRegistryEntry(const std::string& path) {
  if (path.empty() || !EndsWith(path, kSuffix)) return;
  const std::size_t slash = path.rfind('/');
  const std::string dir = slash == std::string::npos ? "." : path.substr(0, slash);
  const std::string file = slash == std::string::npos ? path : path.substr(slash + 1);
  std::string text;
  RegistryEntry e;
  if (!ReadSmallFile(path, &text) || !ParseRegistryEntry(text, &e)) {
    sys::RemoveFile(path);
    return;
  }
  e.gone = RealtimeNs();
  if (!Retire(dir, file.substr(0, file.size() - std::strlen(kSuffix)), e, false)) sys::RemoveFile(path);
}

namespace {

// 1 to `most` decimal digits.
bool Digits(const std::string& s, std::size_t most) {
  return !s.empty() && s.size() <= most && std::all_of(s.begin(), s.end(), [](char c) { return c >= '0' && c <= '9'; });
}

}  // namespace

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
      if (!Digits(digits, 9)) return false;
      e.pid = std::atoi(digits.c_str());
      have_pid = e.pid > 0;
    } else if (line.rfind("since=", 0) == 0 || line.rfind("gone=", 0) == 0) {
      const bool since = line[0] == 's';
      const std::string digits = line.substr(since ? 6 : 5);
      // A time in ns fits a signed 64-bit value.
      if (!Digits(digits, 19) || (digits.size() == 19 && digits > "9223372036854775807")) return false;
      (since ? e.since : e.gone) = std::strtoll(digits.c_str(), nullptr, 10);
    }
  }
  if (!have_name || !have_url || !have_pid) return false;
  *out = std::move(e);
  return true;
}

std::vector<RegistryEntry> ListRegistry() {
  const std::string dir = RegistryDir();
  const std::int64_t now = RealtimeNs();
  std::map<std::string, RegistryEntry> byName;  // per name, the entry made first
  std::error_code error;
  for (std::filesystem::directory_iterator at(dir, error), end; !error && at != end; at.increment(error)) {
    const std::string file = at->path().filename().string();
    const bool present = EndsWith(file, kSuffix);
    if (file[0] == '.' || (!present && !EndsWith(file, kGoneSuffix))) continue;
    std::string text;
    RegistryEntry e;
    if (!ReadSmallFile(dir + "/" + file, &text) || !ParseRegistryEntry(text, &e)) continue;
    if (present && e.gone != 0) continue;   // not one of ours
    if (!present && e.gone == 0) continue;
    if (present && !pm::ProcessAlive(e.pid)) {
      // Found gone just now. Where that cannot be written down (a folder
      // this process may not write), it is not listed at all: each look
      // would find it gone "just now" again.
      e.gone = now;
      if (!Retire(dir, file.substr(0, file.size() - std::strlen(kSuffix)), e, true)) continue;
    }
    if (e.gone != 0) {
      // A time ahead of ours (a clock set back, another machine's folder)
      // is not listed either.
      const std::int64_t goneMs = (now - e.gone) / 1'000'000;
      if (goneMs < 0 || goneMs >= kListedAfterGoneMs) {
        if (goneMs >= kKeptAfterGoneMs || goneMs <= -kKeptAfterGoneMs) sys::RemoveFile(dir + "/" + file);
        continue;
      }
    }
    auto [it, added] = byName.emplace(e.name, e);
    if (!added && (e.since < it->second.since || (e.since == it->second.since && e.url < it->second.url))) {
      it->second = std::move(e);
    }
  }
  std::vector<RegistryEntry> entries;
  entries.reserve(byName.size());
  for (auto& [name, e] : byName) entries.push_back(std::move(e));
  return entries;
}

std::string FullSourceName(const std::string& name) {
  std::string upper = pm::HostName();
  for (char& c : upper) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return upper + " (" + name + ")";
}

}  // namespace ndilb
