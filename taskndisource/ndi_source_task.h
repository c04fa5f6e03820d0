#pragma once
// TaskNDISource::NDISourceTask: the source task whose sources are NDI senders.
// MakeTask initialises the NDI runtime through a loaded table and installs the
// two factories; the module's pmTask_Factory (entry.cc) only loads the table.
//
// Threads: MakeTask runs once on the runner's thread before any dispatcher is
// attached; the factories it installs run on dispatcher receive threads and
// touch no task state.

#include <memory>
#include <string>

#include "pm/task/task_source.h"
#include "taskndisource/ndi_api.h"

namespace TaskNDISource {

class NDISourceTask : public pm::TaskSource {
 public:
  // `api` must stay usable for the task's life; its destroy entry is called
  // exactly once, by the destructor.
  explicit NDISourceTask(std::shared_ptr<const NdiApi> api);
  // Shuts the NDI runtime down (NDIlib_destroy), then the base classes
  // release the table and stop the connections.
  ~NDISourceTask() override;

  const std::shared_ptr<const NdiApi>& Api() const { return api_; }

 private:
  std::shared_ptr<const NdiApi> api_;
};

// Checks and initialises the runtime behind `api`, then makes the task with
// its discovery and source factories. Null, after one "#ndisource: " line,
// when the processor is not supported or initialisation fails (the task made
// for the check is destroyed, which shuts the runtime down again).
pm::TaskBase* MakeTask(std::shared_ptr<const NdiApi> api);

// Loads the runtime library `library` by name and runs MakeTask on it. A
// library or symbol that cannot be found: one "#ndisource: " line naming it,
// null.
pm::TaskBase* MakeTaskFromLibrary(const std::string& library);

}  // namespace TaskNDISource
