#pragma once
// Output files of pm-host, one file per platform (files_posix.cc,
// files_win.cc).
#include <string>

namespace pmhost {

// Empty when `path` can be written: it is opened for writing (created when
// missing, and then removed again; never waiting on a FIFO), so that a run
// never ends by finding out that its output cannot be kept. Otherwise
// "cannot write PATH: REASON".
std::string CannotWrite(const std::string& path);

}  // namespace pmhost
