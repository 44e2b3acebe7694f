// A password that never stands on the command line. Relies on the terminal. Promises: it is not shown
// while it is typed, and the terminal is as it was afterwards.
#pragma once

#include <optional>
#include <string>

namespace tavo::cli {

// The first line of a file, of standard input for "-"; nothing when it cannot be read.
std::optional<std::string> ReadSecret(const std::string& szPath);
// Asks for it at the terminal; nothing when standard input is none, or the line was cut off.
std::optional<std::string> AskSecret(const std::string& szQuestion);

}  // namespace tavo::cli
