#pragma once
// Discovery through a registry folder: each sender writes one small entry
// file (name, URL, process id) and removes it when destroyed; finders list
// the folder. The folder is $NDI_LOOPBACK_DIR when set, else
// $XDG_RUNTIME_DIR/ndi-loopback, else /tmp/ndi-loopback-<uid>.
//
// Entry file "<pid>-<port>.ndi", written to a temporary name and renamed so
// that readers never see half an entry:
//   ndi-loopback 1
//   name=<full NDI name>
//   url=127.0.0.1:<port>
//   pid=<decimal process id>
#include <string>
#include <vector>

namespace ndilb {

struct RegistryEntry {
  std::string name;
  std::string url;
  int pid = 0;
  bool operator==(const RegistryEntry&) const = default;
};

// The folder, created (mode 0700) when missing. Read from the environment on
// every call.
std::string RegistryDir();

// Writes the entry; returns its path, or empty on failure (logged).
std::string WriteRegistryEntry(const RegistryEntry& entry);
void RemoveRegistryEntry(const std::string& path);

// Entries of live processes, sorted by name then URL. Malformed entries and
// those whose process is gone (or a zombie) are skipped.
std::vector<RegistryEntry> ListRegistry();

// Parses one entry's text; false when malformed.
bool ParseRegistryEntry(const std::string& text, RegistryEntry* out);

// Whether the process exists and is not a zombie.
bool ProcessAlive(int pid);

// "HOSTNAME (name)" with the host name upper-cased.
std::string FullSourceName(const std::string& name);

}  // namespace ndilb
