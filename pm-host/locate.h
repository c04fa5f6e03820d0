#pragma once
// Where pm-host finds the programs it starts when no option names them:
// relative to its own folder (/proc/self/exe), first beside it (a Windows
// build or install keeps everything in one folder), then as installed
// (bin/pm-runner and bin/ndi-testsrc beside bin/pm-host; the task module in
// the package's folder under the library folder, lib/pm-ndisource or
// lib/<multiarch>/pm-ndisource), then as built (build/pm-host/pm-host beside
// build/pm-runner/, build/ndi-testsrc/ and build/lib/).

#include <string>
#include <vector>

namespace pmhost {

enum class Companion { Runner, Module, Sender };

// "pm-runner", "libtaskndisource.so", "ndi-testsrc" (on Windows
// "pm-runner.exe", "taskndisource.dll", "ndi-testsrc.exe", all in one folder).
const char* CompanionName(Companion companion);

// The paths tried, relative to the program's folder, in order.
std::vector<std::string> CompanionCandidates(Companion companion);

// The first candidate under `folder` (ending in '/') that is a regular file;
// empty when there is none.
std::string LocateIn(Companion companion, const std::string& folder);

// LocateIn the folder of this program; logs one line naming the folders it
// looked in when there is none.
std::string Locate(Companion companion);

}  // namespace pmhost
