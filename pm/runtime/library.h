#pragma once
// Loading libraries at run time, one implementation per platform
// (library_posix.cc: dlopen/dlsym/dladdr; library_win.cc: LoadLibraryA,
// GetProcAddress, GetModuleHandleExW).
//
// A library once opened stays loaded for the life of the process: the
// addresses taken from it are handed to objects that may outlive any owner
// the handle could be given.
#include <string>

namespace pm {

// Opens a library by path or by name (the platform's search); null when it
// cannot be loaded (LastLibraryError says why).
void* OpenLibrary(const std::string& library);

// The address of `name` in an opened library; null when it has none.
void* FindSymbol(void* library, const char* name);

// Why the last OpenLibrary or FindSymbol of this thread failed, as the
// platform's loader says it; read at once, before another loader call.
std::string LastLibraryError();

// The full path of the library or program that holds `address`; empty when
// the loader does not know it.
std::string ModulePathOf(const void* address);

}  // namespace pm
