#pragma once
// The system's side of the registry folder, one file per platform
// (registry_posix.cc, registry_win.cc): where the folder is by default, how
// an entry file is read and written.
#include <cstddef>
#include <string>

namespace ndilb::sys {

// The folder when $NDI_LOOPBACK_DIR is not set: $XDG_RUNTIME_DIR/ndi-loopback,
// else /tmp/ndi-loopback-<uid> (POSIX); %LOCALAPPDATA%\ndi-loopback, else the
// temporary folder's ndi-loopback (Windows).
std::string DefaultRegistryDir();
// Creates the folder for this user only when it is missing; false when it
// cannot. Failures leave the system's error number in *error
// (pm::SystemErrorText reads it).
bool MakePrivateDir(const std::string& dir, int* error);
// Reads at most `limit` + 1 bytes of a regular file (not through a symbolic
// link on POSIX; on Windows shared for deletion, so that a sender can remove
// its entry while a finder reads it).
bool ReadSmallFile(const std::string& path, std::size_t limit, std::string* out);
// Creates or truncates `path` (this user only; not through a symbolic link)
// and writes all of `text`; false with *error on failure.
bool WriteNewFile(const std::string& path, const std::string& text, int* error);
// Gives `from` the name `to`, replacing it; false with *error on failure.
bool RenameFile(const std::string& from, const std::string& to, int* error);
void RemoveFile(const std::string& path);

}  // namespace ndilb::sys
