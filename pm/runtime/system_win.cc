#include <windows.h>

#include <cstring>

#include "pm/runtime/system.h"

namespace pm {

void* FindProgramExport(const char* name) {
  HMODULE program = ::GetModuleHandleW(nullptr);
  if (program == nullptr) return nullptr;
  return reinterpret_cast<void*>(::GetProcAddress(program, name));
}

void WriteDefaultLogLine(const char* line) { ::OutputDebugStringA(line); }

void WriteToStderr(const char* text) {
  HANDLE err = ::GetStdHandle(STD_ERROR_HANDLE);
  if (err == nullptr || err == INVALID_HANDLE_VALUE) return;
  std::size_t length = std::strlen(text);
  while (length > 0) {
    const DWORD chunk = length > 0x40000000 ? 0x40000000 : static_cast<DWORD>(length);
    DWORD written = 0;
    if (!::WriteFile(err, text, chunk, &written, nullptr) || written == 0) return;
    text += written;
    length -= written;
  }
}

std::string SystemErrorText(int code) {
  char text[512] = {};
  const DWORD n = ::FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                                   static_cast<DWORD>(code), 0, text, sizeof text, nullptr);
  std::string message(text, n);
  while (!message.empty() && (message.back() == '\n' || message.back() == '\r' || message.back() == ' ')) {
    message.pop_back();
  }
  return (message.empty() ? std::string("Windows error") : message) + " (" + std::to_string(code) + ")";
}

int CurrentProcessId() { return static_cast<int>(::GetCurrentProcessId()); }

bool ProcessAlive(int pid) {
  if (pid <= 0) return false;
  HANDLE process = ::OpenProcess(PROCESS_QUERY_LIMITED_INFORMATION, FALSE, static_cast<DWORD>(pid));
  if (process == nullptr) return ::GetLastError() == ERROR_ACCESS_DENIED;  // exists, not ours to look at
  // An ended process can still be opened for a while: its exit code says.
  DWORD code = 0;
  const bool running = ::GetExitCodeProcess(process, &code) && code == STILL_ACTIVE;
  ::CloseHandle(process);
  return running;
}

double ProcessCpuSeconds(int pid) {
  if (pid <= 0) return 0;
  HANDLE process = ::OpenProcess(PROCESS_QUERY_LIMITED_INFORMATION, FALSE, static_cast<DWORD>(pid));
  if (process == nullptr) return 0;
  FILETIME created{}, ended{}, kernel{}, user{};
  const bool ok = ::GetProcessTimes(process, &created, &ended, &kernel, &user);
  ::CloseHandle(process);
  if (!ok) return 0;
  auto ticks = [](const FILETIME& t) { return (static_cast<ULONGLONG>(t.dwHighDateTime) << 32) | t.dwLowDateTime; };
  return static_cast<double>(ticks(kernel) + ticks(user)) / 1e7;  // 100 ns units
}

std::string HostName() {
  char host[MAX_COMPUTERNAME_LENGTH + 1] = {};
  DWORD size = sizeof host;
  if (!::GetComputerNameA(host, &size) || host[0] == '\0') return "localhost";
  return host;
}

}  // namespace pm
