// The tool's own files beside the library's. Relies on POSIX files. Promises: a reader sees the whole old text or the
// whole new one, also after a power cut; a file that others could have written is not read.
#pragma once

#include <optional>
#include <string>

namespace tavo::cli {

enum class ReadState { kRead, kAbsent, kUnreadable };

// A plain file of root's (or this user's) that nobody else may write, of 64 MiB at most.
ReadState ReadOwnFile(const std::string& szPath, std::string& szText);
// The whole of a file that the user names, or of standard input for "-", of 16 MiB at most.
std::optional<std::string> ReadUsersFile(const std::string& szPath);
// Replaces it, for its owner alone. False, also for a text that could not be read again: the old one is still there, or
// may be there again after a power cut.
bool WriteOwnFile(const std::string& szPath, const std::string& szText);
// True when it is gone for good; what is no file at all is put beside it as ".aside".
bool RemoveOwnFile(const std::string& szPath);

}  // namespace tavo::cli
