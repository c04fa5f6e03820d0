#pragma once
// Discovery through a registry folder: each sender writes one small entry
// file (name, URL, process id, when it was made); finders list the folder.
// The folder is $NDI_LOOPBACK_DIR when set, else
// $XDG_RUNTIME_DIR/ndi-loopback, else /tmp/ndi-loopback-<uid>.
//
// Entry file "<pid>-<port>.ndi", written to a temporary name and renamed so
// that readers never see half an entry:
//   ndi-loopback 1
//   name=<full NDI name>
//   url=127.0.0.1:<port>
//   pid=<decimal process id>
//   since=<CLOCK_REALTIME ns when the sender was made>
//   gone=<CLOCK_REALTIME ns when it went>   (only in "<pid>-<port>.gone")
//
// As with the vendor runtime's discovery, a sender that went stays listed
// for kListedAfterGoneMs: a sender destroyed in order turns its entry into
// "<pid>-<port>.gone" with the time; the entry of a process that died is
// turned so by the first reader that finds the process gone. A name is
// listed once, with the entry made first while that is listed: a sender that
// comes back at once under its name shows its old URL for that while, as on
// the vendor runtime (which lists one URL per name).
#include <cstdint>
#include <string>
#include <vector>

namespace ndilb {

// How long a sender that went stays listed (the vendor's discovery: about a
// second after a sender ended or died).
inline constexpr std::int64_t kListedAfterGoneMs = 1000;
// A ".gone" entry older than this is removed by the reader that finds it.
inline constexpr std::int64_t kKeptAfterGoneMs = 10000;

struct RegistryEntry {
  std::string name;
  std::string url;
  int pid = 0;
  std::int64_t since = 0;  // CLOCK_REALTIME ns; 0 when the entry does not say
  std::int64_t gone = 0;   // CLOCK_REALTIME ns; 0 while the sender is there
  // The same sender as listed: name, URL and process.
  bool operator==(const RegistryEntry& o) const { return name == o.name && url == o.url && pid == o.pid; }
};

// The folder, created (mode 0700) when missing. Read from the environment on
// every call.
std::string RegistryDir();

// Writes the entry (stamped with the time now); returns its path, or empty
// on failure (logged).
std::string WriteRegistryEntry(const RegistryEntry& entry);
// The sender of the entry at `path` went now: its entry becomes a ".gone"
// one, listed for kListedAfterGoneMs more.
void RetireRegistryEntry(const std::string& path);

// What a finder lists, sorted by name: per name, the entry made first among
// those of live processes and those gone less than kListedAfterGoneMs ago.
// Malformed entries are skipped.
std::vector<RegistryEntry> ListRegistry();

// Parses one entry's text; false when malformed.
bool ParseRegistryEntry(const std::string& text, RegistryEntry* out);

// "HOSTNAME (name)" with the host name upper-cased.
std::string FullSourceName(const std::string& name);

}  // namespace ndilb
