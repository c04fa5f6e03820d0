#include <windows.h>

#include <mutex>

#include "pm/runtime/load_function.h"
#include "pm/runtime/text.h"
#include "pm/runtime/thread_name.h"

namespace pm {
namespace {

using SetDescription = HRESULT(WINAPI*)(HANDLE, PCWSTR);
using GetDescription = HRESULT(WINAPI*)(HANDLE, PWSTR*);

// kernel32's thread description calls, resolved once (null on systems
// without them: names are then silently not set).
struct DescriptionCalls {
  SetDescription set = nullptr;
  GetDescription get = nullptr;
};

const DescriptionCalls& Calls() {
  static const DescriptionCalls calls = [] {
    DescriptionCalls c;
    c.set = reinterpret_cast<SetDescription>(LoadFunction("kernel32", "SetThreadDescription"));
    c.get = reinterpret_cast<GetDescription>(LoadFunction("kernel32", "GetThreadDescription"));
    return c;
  }();
  return calls;
}

void Describe(const std::u16string& name) {
  if (Calls().set == nullptr) return;
  Calls().set(::GetCurrentThread(), reinterpret_cast<PCWSTR>(name.c_str()));
}

}  // namespace

void SetThreadName(const std::string& name) { Describe(Utf8ToUtf16(name)); }

void ClearThreadName() { Describe(std::u16string()); }

std::string CurrentThreadName() {
  PWSTR wide = nullptr;
  if (Calls().get == nullptr || FAILED(Calls().get(::GetCurrentThread(), &wide)) || wide == nullptr) return {};
  std::string out;
  const int n = ::WideCharToMultiByte(CP_UTF8, 0, wide, -1, nullptr, 0, nullptr, nullptr);
  if (n > 1) {
    out.resize(static_cast<std::size_t>(n));
    ::WideCharToMultiByte(CP_UTF8, 0, wide, -1, out.data(), n, nullptr, nullptr);
    out.resize(static_cast<std::size_t>(n - 1));
  }
  ::LocalFree(wide);
  return out;
}

}  // namespace pm
