// A task module for the runner tests: a pm::Task with handlers that answer,
// hang, and end the task.
#include <unistd.h>

#include <chrono>
#include <memory>
#include <thread>

#include <nlohmann/json.hpp>

#include "pm/ipc/dispatcher.h"
#include "pm/runtime/log.h"
#include "pm/task/task.h"

namespace {

using Json = nlohmann::json;

class EchoTask : public pm::Task {
 public:
  ~EchoTask() override { pm::Log(pm::LogType::Normal, "", "EchoTask: destroyed\n"); }

  void AttachDispatcher(std::shared_ptr<pm::RpcDispatcher> dispatcher) override {
    dispatcher->RegisterHandler("test::echo", [](const Json& request, Json& response) {
      response["value"] = request.value("value", Json());
      response["pid"] = ::getpid();
    });
    dispatcher->RegisterHandler("test::stop_task", [this](const Json&, Json&) { StopTask(); });
    // A handler that never comes back in time (it tells the host it started):
    // the runner must not wait for it for ever when it ends.
    dispatcher->RegisterHandler("test::hang", [weak = std::weak_ptr(dispatcher)](const Json&, Json&) {
      Json note = Json::object();
      if (auto self = weak.lock()) self->RpcRequest("test::hanging", note, 10000);
      std::this_thread::sleep_for(std::chrono::seconds(60));
    });
  }

  void Shutdown() override { pm::Log(pm::LogType::Normal, "", "EchoTask: Shutdown\n"); }
};

}  // namespace

extern "C" __attribute__((visibility("default"))) pm::TaskBase* pmTask_Factory() {
  return new EchoTask();
}
