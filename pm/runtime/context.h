#pragma once
// The process-wide context block shared by the runner and every task module it
// loads. The runner defines it and exports `QFProcessManagementGlobals`, which
// returns it; a module finds that export at run time (GetContext). Both sides
// compile this one definition, so the layout always agrees.

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "pm/runtime/log.h"

namespace pm {

struct Context {
  // Base of the process-wide singletons kept in the registry.
  struct SingletonBase {
    virtual ~SingletonBase() = default;
  };
  using LogSink = std::function<void(LogType, const char*)>;

  bool fromHost = false;   // set when the process offers the context export
  LogSink logSink;         // where log lines go; empty until installed
  std::mutex registryLock; // guards registry
  std::map<std::string, std::shared_ptr<SingletonBase>> registry;
};

// The signature of the runner's export "QFProcessManagementGlobals".
using ContextExport = Context* (*)();
inline constexpr const char* kContextExportName = "QFProcessManagementGlobals";

// The process-wide context: the one the process exports, or a private, empty
// one when it exports none. Never null; the same pointer on every call.
Context* GetContext();

// The log sink of the context, or the default sink (WriteDefaultLogLine: one
// write of the line to stderr, or OutputDebugStringA on Windows) when the
// slot is empty; the slot itself is left as it is. Read
// without a lock: the runner installs its sink before the task starts logging.
Context::LogSink CurrentLogSink();

// Looks `name` up in the context's registry under its lock, inserting an empty
// entry when missing; an empty entry is filled with what `create` gives (which
// may itself be empty). Returns the stored object.
std::shared_ptr<Context::SingletonBase> FindSingleton(
    const std::string& name,
    const std::function<std::shared_ptr<Context::SingletonBase>()>& create);

}  // namespace pm
