// Passes news on to the hooks of the administrator. Relies on the program tavohook, which runs them in a process of
// its own. Promises: never waits; what the hooks cannot keep up with is left out, with a line in the system log;
// nothing of the daemon's is open in them.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "ground/Descriptor.h"

namespace tavo {

inline constexpr char kHookDirectory[] = "/etc/tavo/hooks.d";
inline constexpr size_t kMaxHookFacts = 16384;  // bytes of one notice

class HookQueue {
public:
    HookQueue() = default;
    ~HookQueue();
    HookQueue(const HookQueue&) = delete;
    HookQueue& operator=(const HookQueue&) = delete;

    // rgFacts: "NAME=value" each, as the hooks find them in their environment.
    void Run(const std::vector<std::string>& rgFacts);

private:
    bool Start();
    bool Send(const std::string& szFacts);

    Descriptor mFdFacts;
    pid_t mPid = -1;
};

}  // namespace tavo
