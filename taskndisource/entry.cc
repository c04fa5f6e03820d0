// The task module's only export. PM_NDI_RUNTIME names the NDI runtime library
// (a build setting). A bare file name means the copy beside this module when
// there is one, else whatever the loader's search finds.
#include <filesystem>
#include <string>
#include <system_error>

#include "pm/runtime/export.h"
#include "pm/runtime/library.h"
#include "taskndisource/ndi_source_task.h"

#ifndef PM_NDI_RUNTIME
#error "PM_NDI_RUNTIME must name the NDI runtime library"
#endif

namespace {

const char kAnchor = 0;  // an address inside this module

// The loader does not look beside the module by itself everywhere (Windows
// looks beside the program; on Linux the run path's $ORIGIN is judged by the
// caller's return address, which an interposed dlopen such as a sanitizer
// runtime's hides), so the module's own folder is looked at here.
std::string RuntimeLibrary() {
  const std::string name = PM_NDI_RUNTIME;
  if (std::filesystem::path(name).has_parent_path()) return name;
  const std::string self = pm::ModulePathOf(&kAnchor);
  if (self.empty()) return name;
  const std::filesystem::path beside = std::filesystem::path(self).parent_path() / name;
  std::error_code error;
  return std::filesystem::exists(beside, error) ? beside.string() : name;
}

}  // namespace

extern "C" PM_EXPORT pm::TaskBase* pmTask_Factory() { return TaskNDISource::MakeTaskFromLibrary(RuntimeLibrary()); }
