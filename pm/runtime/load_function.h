#pragma once
// Loads a library by name (OpenLibrary: dlopen, LoadLibraryA) and looks a
// function up in it (dlsym, GetProcAddress). Returns null when either step
// fails. The library stays loaded for the life of the process.
#include <string>

namespace pm {

void* LoadFunction(const std::string& library, const std::string& function);

}  // namespace pm
