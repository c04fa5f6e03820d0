// The task module's only export. PM_NDI_RUNTIME names the NDI runtime library
// (a build setting). A bare file name means the copy beside this module when
// there is one ($ORIGIN), else whatever the loader's search finds.
#include <dlfcn.h>
#include <unistd.h>

#include <string>

#include "taskndisource/ndi_source_task.h"

#ifndef PM_NDI_RUNTIME
#error "PM_NDI_RUNTIME must name the NDI runtime library"
#endif

namespace {

const char kAnchor = 0;  // an address inside this module

// The module's run path says $ORIGIN as well, but the loader judges the
// caller by return address, and an interposed dlopen (a sanitizer runtime's)
// hides this module from it; so the directory is found here.
std::string RuntimeLibrary() {
  const std::string name = PM_NDI_RUNTIME;
  if (name.find('/') != std::string::npos) return name;
  Dl_info info{};
  if (::dladdr(&kAnchor, &info) == 0 || info.dli_fname == nullptr) return name;
  const std::string self = info.dli_fname;
  const std::size_t slash = self.rfind('/');
  if (slash == std::string::npos) return name;
  std::string beside = self.substr(0, slash + 1) + name;
  return ::access(beside.c_str(), F_OK) == 0 ? beside : name;
}

}  // namespace

extern "C" __attribute__((visibility("default"))) pm::TaskBase* pmTask_Factory() {
  return TaskNDISource::MakeTaskFromLibrary(RuntimeLibrary());
}
