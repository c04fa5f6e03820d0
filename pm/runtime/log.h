#pragma once
// Logging: one line per event, tag + message + '\n', handed to the sink held
// in the process-wide context (pm/runtime/context.h). Nothing else is added to
// a line (no time, pid or thread id).
//
// Which thread calls this: any. Log() serialises formatting and the sink call
// on one process-wide mutex; LogText() takes no lock, so a sink must be safe
// against concurrent calls.

#include <cstdint>
#include <cstdio>

// The printf dialect of the C library the program formats with: mingw-w64's
// own (C99) printf on Windows, whose checks differ from the Microsoft one's.
#if defined(__MINGW_PRINTF_FORMAT)
#define PM_PRINTF_FORMAT(format_index, first_arg) __attribute__((format(__MINGW_PRINTF_FORMAT, format_index, first_arg)))
#else
#define PM_PRINTF_FORMAT(format_index, first_arg) __attribute__((format(printf, format_index, first_arg)))
#endif

namespace pm {

// The level is passed to the sink unchanged; every line of this program uses 100.
enum class LogType : std::uint8_t { Normal = 100 };

// printf-style: the tag (may be null) goes in front of the formatted message; a
// newline is appended when the message does not end in one. A bad format
// writes nothing. Lines of any length are delivered whole.
void Log(LogType level, const char* tag, const char* format, ...) PM_PRINTF_FORMAT(3, 4);

// An already formatted text, always at level 100. A null text counts as "\n".
// With an empty tag and a text that already ends in '\n' the caller's own
// buffer is handed to the sink without a copy.
void LogText(const char* tag, const char* text);

}  // namespace pm
