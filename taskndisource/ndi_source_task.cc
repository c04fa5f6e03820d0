// The NDI source task: runtime start-up, the two factories, runtime shutdown.
#include "taskndisource/ndi_source_task.h"

#include <utility>

#include "pm/runtime/library.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"
#include "taskndisource/discovery.h"
#include "taskndisource/ndi_source.h"

namespace TaskNDISource {

NDISourceTask::NDISourceTask(std::shared_ptr<const NdiApi> api) : api_(std::move(api)) {}

NDISourceTask::~NDISourceTask() {
  if (api_ && api_->destroy) api_->destroy();
}

pm::TaskBase* MakeTask(std::shared_ptr<const NdiApi> api) {
  if (!api) return nullptr;
  auto task = std::make_unique<NDISourceTask>(api);
  if (!api->is_supported_CPU()) {
    pm::LogText(kLogTag, "failed initialization. CPU not supported");
    return nullptr;
  }
  if (!api->initialize()) {
    pm::LogText(kLogTag, "failed initialization.");
    return nullptr;
  }
  const char* version = api->version ? api->version() : nullptr;
  pm::Log(pm::LogType::Normal, kLogTag, "Initialized NDIlib (%s)", version ? version : "");

  task->SetDiscoveryFactory([api](std::shared_ptr<pm::SourceDiscovery::Callbacks> callbacks) {
    pm::Log(pm::LogType::Normal, kLogTag, "creating discovery in pid %d\n", pm::CurrentProcessId());
    return std::shared_ptr<pm::SourceDiscovery>(std::make_shared<Discovery>(std::move(callbacks), api));
  });
  task->SetSourceFactory([api](std::shared_ptr<pm::Source::Callbacks> callbacks, std::string uniqueId) {
    pm::Log(pm::LogType::Normal, kLogTag, "creating '%s' in pid %d\n", uniqueId.c_str(),
            pm::CurrentProcessId());
    return std::shared_ptr<pm::Source>(std::make_shared<NDISource>(std::move(callbacks), std::move(uniqueId), api));
  });
  return task.release();
}

pm::TaskBase* MakeTaskFromLibrary(const std::string& library) {
  auto api = std::make_shared<NdiApi>();
  std::string missing;
  if (!LoadNdiApi(library, api.get(), &missing)) {
    // Copied at once: the next loader call (the log's context lookup is one)
    // frees the loader's text.
    const std::string reason = pm::LastLibraryError();
    if (missing == library) {
      pm::Log(pm::LogType::Normal, kLogTag, "failed initialization. Cannot load the NDI runtime '%s': %s\n",
              library.c_str(), reason.c_str());
    } else {
      pm::Log(pm::LogType::Normal, kLogTag, "failed initialization. The NDI runtime '%s' lacks '%s'\n",
              library.c_str(), missing.c_str());
    }
    return nullptr;
  }
  return MakeTask(std::move(api));
}

}  // namespace TaskNDISource
