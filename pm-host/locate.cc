#include "pm-host/locate.h"

#include <sys/stat.h>

#include <algorithm>
#include <filesystem>

#include "pm-host/process.h"
#include "pm/runtime/log.h"

namespace pmhost {

const char* CompanionName(Companion companion) {
  switch (companion) {
    case Companion::Runner: return "pm-runner";
    case Companion::Module: return "libtaskndisource.so";
    case Companion::Sender: return "ndi-testsrc";
  }
  return "";
}

std::vector<std::string> CompanionCandidates(Companion companion) {
  const std::string name = CompanionName(companion);
  if (companion != Companion::Module) return {name, "../" + name + "/" + name};
  // The install's own module folder first (from the configured layout), then
  // the usual library folders, then the build tree's lib/.
  std::vector<std::string> candidates{PM_MODULEDIR_FROM_BINDIR "/" + name};
  const std::string arch = PM_LIBRARY_ARCHITECTURE;
  if (!arch.empty()) candidates.push_back("../lib/" + arch + "/" PM_PACKAGE_NAME "/" + name);
  candidates.push_back("../lib/" PM_PACKAGE_NAME "/" + name);
  candidates.push_back("../lib/" + name);
  std::vector<std::string> unique;
  for (const std::string& c : candidates) {
    if (std::find(unique.begin(), unique.end(), c) == unique.end()) unique.push_back(c);
  }
  return unique;
}

std::string LocateIn(Companion companion, const std::string& folder) {
  for (const std::string& candidate : CompanionCandidates(companion)) {
    struct stat info {};
    const std::string path = folder + candidate;
    if (::stat(path.c_str(), &info) == 0 && S_ISREG(info.st_mode)) return std::filesystem::path(path).lexically_normal();
  }
  return {};
}

std::string Locate(Companion companion) {
  const std::string folder = ProgramDirectory();
  std::string path = LocateIn(companion, folder);
  if (path.empty()) {
    std::string tried;
    for (const std::string& candidate : CompanionCandidates(companion)) tried += " " + folder + candidate;
    pm::Log(pm::LogType::Normal, "", "pm-host: cannot find %s; looked at:%s\n", CompanionName(companion),
            tried.c_str());
  }
  return path;
}

}  // namespace pmhost
