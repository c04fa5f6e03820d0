#include <windows.h>

#include <cstdlib>

#include "ndi-loopback/registry_system.h"

namespace ndilb::sys {

std::string DefaultRegistryDir() {
  if (const char* local = std::getenv("LOCALAPPDATA"); local != nullptr && local[0] != '\0') {
    return std::string(local) + "\\ndi-loopback";
  }
  char temp[MAX_PATH + 1] = {};
  const DWORD n = ::GetTempPathA(sizeof temp, temp);
  return (n > 0 && n < sizeof temp ? std::string(temp, n) : std::string(".\\")) + "ndi-loopback";
}

bool MakePrivateDir(const std::string& dir, int* error) {
  // The user's own folders (LOCALAPPDATA, the temporary folder) are private
  // to the user already; the new folder inherits that.
  if (::CreateDirectoryA(dir.c_str(), nullptr) || ::GetLastError() == ERROR_ALREADY_EXISTS) return true;
  *error = static_cast<int>(::GetLastError());
  return false;
}

bool ReadSmallFile(const std::string& path, std::size_t limit, std::string* out) {
  HANDLE file = ::CreateFileA(path.c_str(), GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE,
                              nullptr, OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL | FILE_FLAG_OPEN_REPARSE_POINT, nullptr);
  if (file == INVALID_HANDLE_VALUE) return false;
  std::string buffer(limit + 1, '\0');
  std::size_t have = 0;
  while (have < buffer.size()) {
    DWORD n = 0;
    if (!::ReadFile(file, buffer.data() + have, static_cast<DWORD>(buffer.size() - have), &n, nullptr) || n == 0) {
      break;
    }
    have += n;
  }
  ::CloseHandle(file);
  buffer.resize(have);
  *out = std::move(buffer);
  return true;
}

bool WriteNewFile(const std::string& path, const std::string& text, int* error) {
  HANDLE file = ::CreateFileA(path.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS,
                              FILE_ATTRIBUTE_NORMAL | FILE_FLAG_OPEN_REPARSE_POINT, nullptr);
  if (file == INVALID_HANDLE_VALUE) {
    *error = static_cast<int>(::GetLastError());
    return false;
  }
  std::size_t done = 0;
  bool ok = true;
  while (ok && done < text.size()) {
    DWORD n = 0;
    ok = ::WriteFile(file, text.data() + done, static_cast<DWORD>(text.size() - done), &n, nullptr) && n > 0;
    done += n;
  }
  if (!ok) *error = static_cast<int>(::GetLastError());
  ::CloseHandle(file);
  return ok;
}

bool RenameFile(const std::string& from, const std::string& to, int* error) {
  if (::MoveFileExA(from.c_str(), to.c_str(), MOVEFILE_REPLACE_EXISTING)) return true;
  *error = static_cast<int>(::GetLastError());
  return false;
}

void RemoveFile(const std::string& path) { ::DeleteFileA(path.c_str()); }

}  // namespace ndilb::sys
