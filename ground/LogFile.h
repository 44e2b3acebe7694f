// What the logs of the platform have in common: one line an entry, with its time. Relies on appending to a
// file. Promises: one write a line, so that two processes never mix theirs; a link is not followed.
#pragma once

#include <string>

namespace tavo {

// The time now, with its zone, as every log of ours writes it.
std::string LogTime();
// Appends a line; false when it could not be written whole.
bool AppendLogLine(const char* szPath, std::string szLine);

}  // namespace tavo
