// The task module's only export. PM_NDI_RUNTIME names the NDI runtime library
// (a build setting); a bare file name is found beside this module through its
// $ORIGIN run path.
#include "taskndisource/ndi_source_task.h"

#ifndef PM_NDI_RUNTIME
#error "PM_NDI_RUNTIME must name the NDI runtime library"
#endif

extern "C" __attribute__((visibility("default"))) pm::TaskBase* pmTask_Factory() {
  return TaskNDISource::MakeTaskFromLibrary(PM_NDI_RUNTIME);
}
