#include <dlfcn.h>

#include "pm/runtime/library.h"

namespace pm {

void* OpenLibrary(const std::string& library) { return ::dlopen(library.c_str(), RTLD_NOW | RTLD_LOCAL); }

void* FindSymbol(void* library, const char* name) { return ::dlsym(library, name); }

std::string LastLibraryError() {
  const char* error = ::dlerror();
  return error != nullptr ? error : "not found";
}

std::string ModulePathOf(const void* address) {
  Dl_info info{};
  if (::dladdr(address, &info) == 0 || info.dli_fname == nullptr) return {};
  return info.dli_fname;
}

}  // namespace pm
