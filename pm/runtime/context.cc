#include "pm/runtime/context.h"

#include <atomic>

#include "pm/runtime/system.h"

namespace pm {
namespace {

std::atomic<Context*> g_context{nullptr};

void DefaultSink(LogType, const char* line) { WriteDefaultLogLine(line); }

}  // namespace

Context* GetContext() {
  if (Context* cached = g_context.load(std::memory_order_acquire)) return cached;
  static std::mutex mutex;
  std::lock_guard<std::mutex> guard(mutex);
  if (Context* cached = g_context.load(std::memory_order_acquire)) return cached;

  Context* context = nullptr;
  if (void* symbol = FindProgramExport(kContextExportName)) {
    auto exported = reinterpret_cast<ContextExport>(symbol);
    context = exported();
    if (context == nullptr) context = new Context();
    context->fromHost = true;
  } else {
    context = new Context();  // private to this module; never destroyed
  }
  g_context.store(context, std::memory_order_release);
  return context;
}

Context::LogSink CurrentLogSink() {
  Context* context = GetContext();
  if (context->logSink) return context->logSink;
  // Not stored in the slot: two threads logging for the first time would
  // both write it while others read it.
  return DefaultSink;
}

std::shared_ptr<Context::SingletonBase> FindSingleton(
    const std::string& name,
    const std::function<std::shared_ptr<Context::SingletonBase>()>& create) {
  Context* context = GetContext();
  std::lock_guard<std::mutex> guard(context->registryLock);
  std::shared_ptr<Context::SingletonBase>& entry = context->registry[name];
  if (!entry && create) entry = create();
  return entry;
}

}  // namespace pm
