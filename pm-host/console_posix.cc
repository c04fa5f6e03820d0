#include <signal.h>
#include <unistd.h>

#include "pm-host/console.h"

namespace pmhost {
namespace {

std::atomic<bool>* g_flag = nullptr;

void Interrupted(int) {
  if (g_flag != nullptr) g_flag->store(true);
}

}  // namespace

void OnInterrupt(std::atomic<bool>* flag) {
  g_flag = flag;
  struct sigaction action {};
  action.sa_handler = Interrupted;
  sigemptyset(&action.sa_mask);
  ::sigaction(SIGINT, &action, nullptr);
  ::sigaction(SIGTERM, &action, nullptr);
  ::signal(SIGPIPE, SIG_IGN);
}

bool StdoutIsTerminal() { return ::isatty(STDOUT_FILENO) != 0; }

}  // namespace pmhost
