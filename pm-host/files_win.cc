#include <windows.h>

#include "pm-host/files.h"
#include "pm/runtime/system.h"
#include "pm/runtime/text.h"

namespace pmhost {

std::string CannotWrite(const std::string& path) {
  const std::u16string wide = pm::Utf8ToUtf16(path);
  const auto* name = reinterpret_cast<const wchar_t*>(wide.c_str());
  HANDLE file = ::CreateFileW(name, GENERIC_WRITE, FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr, OPEN_ALWAYS,
                              FILE_ATTRIBUTE_NORMAL, nullptr);
  if (file == INVALID_HANDLE_VALUE) {
    return "cannot write " + path + ": " + pm::SystemErrorText(static_cast<int>(::GetLastError()));
  }
  const bool existed = ::GetLastError() == ERROR_ALREADY_EXISTS;
  ::CloseHandle(file);
  if (!existed) ::DeleteFileW(name);
  return {};
}

}  // namespace pmhost
