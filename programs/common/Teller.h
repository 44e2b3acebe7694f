// Tells a user what has changed: system log, event log and hooks, with the same words. Relies on the platform's
// logs and on HookQueue. Promises: never waits; no notice is lost because one of the three could not take it.
#pragma once

#include "programs/common/HookQueue.h"
#include "programs/common/Notices.h"

namespace tavo {

class Teller {
public:
    void Tell(const Notice& notice, const Published& state);

private:
    HookQueue mHooks;
};

// What hooks find in their environment: "NAME=value" each.
std::vector<std::string> HookFacts(const Notice& notice, const Published& state);

}  // namespace tavo
