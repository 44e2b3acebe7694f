// The system log, as every file of the library writes to it. Relies on nothing. Promises: errno is kept; a
// line needs no memory, but to be whole beyond 4,095 bytes; a control character in a value stands as \xHH.
#pragma once

#include <cstdarg>

namespace tavo::lib {

// Source paths in log lines of what stands in several files: who looks for a line by its path finds it wherever the
// code goes.
inline constexpr char kEntryFile[] = "src/libtavoportmap.cpp";  // the entry points with C types
inline constexpr char kCommonFile[] = "src/common.cpp";         // what the other files share

// One line of the system log at priority error. Every format begins "%s:%d ": the source path relative
// to the tree, then the line. errno is kept, so "%m" works and callers may still look at it.
void LogError(const char* szFormat, ...) __attribute__((format(printf, 1, 2)));
void LogErrorV(const char* szFormat, va_list arguments);

// The same, and the answer of whoever refuses: false.
[[nodiscard]] bool Refuse(const char* szFormat, ...) __attribute__((format(printf, 1, 2)));

}  // namespace tavo::lib
