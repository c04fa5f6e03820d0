#pragma once
// What pm-host needs of its console, one file per platform (console_posix.cc,
// console_win.cc).
#include <atomic>

namespace pmhost {

// Sets *flag when the user interrupts the program: SIGINT or SIGTERM (POSIX;
// SIGPIPE is ignored as well, so a closed output never kills the host); Ctrl-C,
// Ctrl-Break or the console closing (Windows). `flag` must outlive the
// program.
void OnInterrupt(std::atomic<bool>* flag);

// Whether standard output is a terminal (the live progress line is drawn
// only there).
bool StdoutIsTerminal();

}  // namespace pmhost
