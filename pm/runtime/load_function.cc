#include "pm/runtime/load_function.h"

#include <dlfcn.h>

namespace pm {

void* LoadFunction(const std::string& library, const std::string& function) {
  void* handle = ::dlopen(library.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (handle == nullptr) return nullptr;
  return ::dlsym(handle, function.c_str());
}

}  // namespace pm
