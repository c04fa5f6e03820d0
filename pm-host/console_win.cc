#include <io.h>
#include <windows.h>

#include <cstdio>

#include "pm-host/console.h"

namespace pmhost {
namespace {

std::atomic<bool>* g_flag = nullptr;

// Runs on a thread the system starts for the event.
BOOL WINAPI Interrupted(DWORD) {
  if (g_flag != nullptr) g_flag->store(true);
  return TRUE;
}

}  // namespace

void OnInterrupt(std::atomic<bool>* flag) {
  g_flag = flag;
  ::SetConsoleCtrlHandler(Interrupted, TRUE);
}

bool StdoutIsTerminal() { return ::_isatty(::_fileno(stdout)) != 0; }

}  // namespace pmhost
