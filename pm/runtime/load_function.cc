#include "pm/runtime/load_function.h"

#include "pm/runtime/library.h"

namespace pm {

void* LoadFunction(const std::string& library, const std::string& function) {
  void* handle = OpenLibrary(library);
  if (handle == nullptr) return nullptr;
  return FindSymbol(handle, function.c_str());
}

}  // namespace pm
