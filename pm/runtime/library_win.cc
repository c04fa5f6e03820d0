#include <windows.h>

#include <string>

#include "pm/runtime/library.h"
#include "pm/runtime/system.h"

namespace pm {

void* OpenLibrary(const std::string& library) { return ::LoadLibraryA(library.c_str()); }

void* FindSymbol(void* library, const char* name) {
  return reinterpret_cast<void*>(::GetProcAddress(static_cast<HMODULE>(library), name));
}

std::string LastLibraryError() { return SystemErrorText(static_cast<int>(::GetLastError())); }

std::string ModulePathOf(const void* address) {
  HMODULE module = nullptr;
  if (!::GetModuleHandleExW(GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS | GET_MODULE_HANDLE_EX_FLAG_UNCHANGED_REFCOUNT,
                            static_cast<LPCWSTR>(address), &module)) {
    return {};
  }
  char path[MAX_PATH * 4] = {};
  const DWORD n = ::GetModuleFileNameA(module, path, sizeof path);
  if (n == 0 || n >= sizeof path) return {};
  return std::string(path, n);
}

}  // namespace pm
