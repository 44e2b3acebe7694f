// The output of another program. Relies on posix_spawn. Promises: no shell; bounded in time and size; the program has
// ended when the call returns.
#pragma once

#include <chrono>
#include <string>
#include <vector>

namespace tavo::cli {

// What the program at rgszArguments[0] (a path) writes to its standard output. Empty when there is no such program,
// it fails, or it needs longer or says more than it may. blOwnSession: the user's Ctrl-C ends us, and not it.
std::string OutputOf(const std::vector<std::string>& rgszArguments, std::chrono::milliseconds limit, size_t nMost,
                     bool blOwnSession = false);

}  // namespace tavo::cli
