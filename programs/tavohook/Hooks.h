// The hooks of the administrator: which of what lies in a directory is one, and running one. Relies on POSIX.
// Promises: only plain files are run that are root's and nobody else's to change, in a directory of the same kind;
// no shell; every run is bounded and gets nothing but the facts.
#pragma once

#include <chrono>
#include <functional>
#include <string>
#include <vector>

namespace tavo {

// The names of a directory's hooks in the order of their bytes. Names with characters besides letters, digits, "_"
// and "-" are none of hooks. rgszRefused: why others were left out, as a user reads it.
std::vector<std::string> FindHooks(const std::string& szDirectory, std::vector<std::string>& rgszRefused);

struct HookEnd {
    bool blStarted = false;
    bool blInTime = true;
    int nStatus = 0;       // the exit status, or 128 + a signal
    std::string szOutput;  // the beginning of what it said, in one line
};

// Runs a program with rgFacts ("NAME=value") and a PATH as its whole environment, and waits for its end. One that
// takes longer than the limit, or runs when fnStop says so, is ended with all its process group.
HookEnd RunHook(const std::string& szPath, const std::vector<std::string>& rgFacts, std::chrono::milliseconds limit,
                const std::function<bool()>& fnStop);

}  // namespace tavo
