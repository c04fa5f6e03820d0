// Child processes with CreateProcessW. The child inherits exactly its three
// standard handles (a handle list), so that no other child holds our end of
// a pipe open; starts are serialised, as the inheritable copies exist only
// while one start runs.
#include <windows.h>

#include <algorithm>
#include <cwchar>

#include "pm-host/process.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"
#include "pm/runtime/text.h"
#include "pm/runtime/thread_name.h"

namespace pmhost {
namespace {

// The exit status of a child ended by Signal: as a SIGKILL reads on POSIX.
constexpr UINT kKilledStatus = 137;

std::wstring Wide(const std::string& text) {
  const std::u16string wide = pm::Utf8ToUtf16(text);
  return std::wstring(wide.begin(), wide.end());
}

std::string Narrow(const wchar_t* text, int length) {
  const int n = ::WideCharToMultiByte(CP_UTF8, 0, text, length, nullptr, 0, nullptr, nullptr);
  std::string out(static_cast<std::size_t>(n > 0 ? n : 0), '\0');
  if (n > 0) ::WideCharToMultiByte(CP_UTF8, 0, text, length, out.data(), n, nullptr, nullptr);
  return out;
}

// One argument as CommandLineToArgvW and the C runtime read it back.
std::wstring Quote(const std::wstring& arg) {
  if (!arg.empty() && arg.find_first_of(L" \t\n\v\"") == std::wstring::npos) return arg;
  std::wstring out = L"\"";
  for (std::size_t i = 0;; ++i) {
    std::size_t backslashes = 0;
    while (i < arg.size() && arg[i] == L'\\') {
      ++backslashes;
      ++i;
    }
    if (i == arg.size()) {
      out.append(backslashes * 2, L'\\');
      break;
    }
    out.append(arg[i] == L'"' ? backslashes * 2 + 1 : backslashes, L'\\');
    out.push_back(arg[i]);
  }
  return out + L"\"";
}

// The inherited environment with `changes` added or replacing (names
// compare without case, as Windows does), sorted as CreateProcess wants it.
std::wstring EnvironmentBlock(const std::map<std::string, std::string>& changes) {
  std::vector<std::wstring> entries;
  auto sameName = [](const std::wstring& entry, const std::wstring& name) {
    return entry.size() > name.size() && entry[name.size()] == L'=' &&
           ::CompareStringOrdinal(entry.c_str(), static_cast<int>(name.size()), name.c_str(),
                                  static_cast<int>(name.size()), TRUE) == CSTR_EQUAL;
  };
  if (wchar_t* inherited = ::GetEnvironmentStringsW()) {
    for (const wchar_t* e = inherited; *e != L'\0'; e += std::wcslen(e) + 1) entries.emplace_back(e);
    ::FreeEnvironmentStringsW(inherited);
  }
  for (const auto& [key, value] : changes) {
    const std::wstring name = Wide(key);
    entries.erase(std::remove_if(entries.begin(), entries.end(),
                                 [&](const std::wstring& entry) { return sameName(entry, name); }),
                  entries.end());
    entries.push_back(name + L"=" + Wide(value));
  }
  std::sort(entries.begin(), entries.end(), [](const std::wstring& a, const std::wstring& b) {
    return ::CompareStringOrdinal(a.c_str(), static_cast<int>(a.size()), b.c_str(), static_cast<int>(b.size()),
                                  TRUE) == CSTR_LESS_THAN;
  });
  std::wstring block;
  for (const std::wstring& entry : entries) block += entry + L'\0';
  return block + L'\0';
}

// An inheritable copy of one of our standard handles (null when we have none).
HANDLE InheritableCopy(DWORD which) {
  HANDLE own = ::GetStdHandle(which);
  HANDLE copy = nullptr;
  if (own == nullptr || own == INVALID_HANDLE_VALUE ||
      !::DuplicateHandle(::GetCurrentProcess(), own, ::GetCurrentProcess(), &copy, 0, TRUE, DUPLICATE_SAME_ACCESS)) {
    return nullptr;
  }
  return copy;
}

void CloseIfOpen(HANDLE handle) {
  if (handle != nullptr && handle != INVALID_HANDLE_VALUE) ::CloseHandle(handle);
}

std::mutex& StartMutex() {
  static std::mutex mutex;
  return mutex;
}

}  // namespace

ChildProcess::~ChildProcess() {
  if (pid_ > 0) {
    Signal(9);
    Wait(std::chrono::hours(1));
  }
  if (watcher_.joinable()) watcher_.join();
  if (reader_.joinable()) reader_.join();
  CloseIfOpen(static_cast<HANDLE>(handle_));
}

bool ChildProcess::Start(ChildOptions options) {
  if (pid_ > 0) return false;
  options_ = std::move(options);
  std::wstring commandLine = Quote(Wide(options_.path));
  for (const std::string& arg : options_.args) commandLine += L" " + Quote(Wide(arg));
  std::wstring environment = EnvironmentBlock(options_.env);

  std::lock_guard<std::mutex> starting(StartMutex());
  SECURITY_ATTRIBUTES inherit{sizeof(SECURITY_ATTRIBUTES), nullptr, TRUE};
  HANDLE readEnd = nullptr;
  HANDLE childOut = nullptr;
  if (options_.captureStdout) {
    if (!::CreatePipe(&readEnd, &childOut, &inherit, 0)) {
      pm::Log(pm::LogType::Normal, "", "ChildProcess: pipe failed: %s\n",
              pm::SystemErrorText(static_cast<int>(::GetLastError())).c_str());
      return false;
    }
    ::SetHandleInformation(readEnd, HANDLE_FLAG_INHERIT, 0);
  } else {
    childOut = InheritableCopy(STD_OUTPUT_HANDLE);
  }
  HANDLE childErr = nullptr;
  if (!options_.stderrPath.empty()) {
    childErr = ::CreateFileW(Wide(options_.stderrPath).c_str(), FILE_APPEND_DATA,
                             FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, &inherit, OPEN_ALWAYS,
                             FILE_ATTRIBUTE_NORMAL, nullptr);
    if (childErr == INVALID_HANDLE_VALUE) childErr = nullptr;
  } else {
    childErr = InheritableCopy(STD_ERROR_HANDLE);
  }
  HANDLE childIn = InheritableCopy(STD_INPUT_HANDLE);

  std::vector<HANDLE> handed;
  for (HANDLE h : {childIn, childOut, childErr}) {
    if (h != nullptr && std::find(handed.begin(), handed.end(), h) == handed.end()) handed.push_back(h);
  }
  SIZE_T attributeBytes = 0;
  ::InitializeProcThreadAttributeList(nullptr, 1, 0, &attributeBytes);
  std::vector<unsigned char> attributeStorage(attributeBytes);
  auto* attributes = reinterpret_cast<LPPROC_THREAD_ATTRIBUTE_LIST>(attributeStorage.data());
  const bool listed = !handed.empty() && ::InitializeProcThreadAttributeList(attributes, 1, 0, &attributeBytes) &&
                      ::UpdateProcThreadAttribute(attributes, 0, PROC_THREAD_ATTRIBUTE_HANDLE_LIST, handed.data(),
                                                  handed.size() * sizeof(HANDLE), nullptr, nullptr);
  STARTUPINFOEXW startup{};
  startup.StartupInfo.cb = sizeof(startup);
  startup.StartupInfo.dwFlags = STARTF_USESTDHANDLES;
  startup.StartupInfo.hStdInput = childIn;
  startup.StartupInfo.hStdOutput = childOut;
  startup.StartupInfo.hStdError = childErr;
  startup.lpAttributeList = listed ? attributes : nullptr;
  PROCESS_INFORMATION process{};
  const BOOL started = ::CreateProcessW(
      nullptr, commandLine.data(), nullptr, nullptr, !handed.empty(),
      CREATE_UNICODE_ENVIRONMENT | (listed ? EXTENDED_STARTUPINFO_PRESENT : 0), environment.data(), nullptr,
      &startup.StartupInfo, &process);
  const DWORD error = ::GetLastError();
  if (listed) ::DeleteProcThreadAttributeList(attributes);
  for (HANDLE h : handed) ::CloseHandle(h);  // the child has its own now
  if (!started) {
    pm::Log(pm::LogType::Normal, "", "ChildProcess: cannot start '%s': %s\n", options_.path.c_str(),
            pm::SystemErrorText(static_cast<int>(error)).c_str());
    CloseIfOpen(readEnd);
    return false;
  }
  ::CloseHandle(process.hThread);
  handle_ = process.hProcess;
  pid_ = static_cast<int>(process.dwProcessId);
  watcher_ = std::thread([this] { Watch(); });
  if (options_.captureStdout) {
    reader_ = std::thread([this, readEnd] {
      ReadLines([readEnd](char* buffer, std::size_t size) -> long long {
        DWORD n = 0;
        // The end of the pipe (every writer gone) reads as a failure.
        if (!::ReadFile(readEnd, buffer, static_cast<DWORD>(size), &n, nullptr)) return 0;
        return n;
      });
      ::CloseHandle(readEnd);
    });
  }
  return true;
}

void ChildProcess::Watch() {
  pm::SetThreadName("pm-host child");
  ::WaitForSingleObject(static_cast<HANDLE>(handle_), INFINITE);
  Exited([this] {
    DWORD code = 255;
    if (!::GetExitCodeProcess(static_cast<HANDLE>(handle_), &code)) code = 255;
    return code > 255 ? 255 : static_cast<int>(code);
  });
  pm::ClearThreadName();
}

void ChildProcess::Signal(int) {
  std::lock_guard<std::mutex> guard(lock_);
  if (pid_ > 0 && !exited_) ::TerminateProcess(static_cast<HANDLE>(handle_), kKilledStatus);
}

int ChildProcess::Terminate(std::chrono::milliseconds) {
  Signal(9);
  return Wait(std::chrono::hours(1)).value_or(255);
}

std::string ProgramDirectory() {
  wchar_t path[32768];
  const DWORD n = ::GetModuleFileNameW(nullptr, path, 32768);
  if (n == 0 || n >= 32768) return {};
  const std::string text = Narrow(path, static_cast<int>(n));
  const std::size_t separator = text.find_last_of("\\/");
  return separator == std::string::npos ? std::string() : text.substr(0, separator + 1);
}

}  // namespace pmhost
