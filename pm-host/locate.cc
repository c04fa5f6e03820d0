#include "pm-host/locate.h"

#include <algorithm>
#include <filesystem>
#include <system_error>

#include "pm-host/process.h"
#include "pm/runtime/log.h"

namespace pmhost {

const char* CompanionName(Companion companion) {
  switch (companion) {
    case Companion::Runner: return "pm-runner" PM_EXECUTABLE_SUFFIX;
    case Companion::Module: return PM_MODULE_FILE;
    case Companion::Sender: return "ndi-testsrc" PM_EXECUTABLE_SUFFIX;
  }
  return "";
}

std::vector<std::string> CompanionCandidates(Companion companion) {
  const std::string name = CompanionName(companion);
  if (companion != Companion::Module) return {name, "../" + name + "/" + name};
  // Beside the program first (a Windows build or install: one folder holds
  // the programs, the module and the DLLs), then the install's own module
  // folder (from the configured layout), the usual library folders, and the
  // build tree's lib/.
  std::vector<std::string> candidates{name, PM_MODULEDIR_FROM_BINDIR "/" + name};
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
    const std::string path = folder + candidate;
    std::error_code error;
    if (std::filesystem::is_regular_file(path, error)) return std::filesystem::path(path).lexically_normal().string();
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
