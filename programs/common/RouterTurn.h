// Whose turn it is at the router. The two daemons may ask one router for one and the same mapping; were
// one still taking its own away while the other makes its own, a mapping just made would vanish.
// What is on record of one that is switched off, and no rule asks for, goes without a turn, too: the router may have
// been away when it had its turn, or it has crashed.
// Relies on FileLock: a daemon that is killed gives its turn back. Promises: bounded waiting.
#pragma once

#include <functional>

#include "ground/FileLock.h"

namespace tavo {

class RouterTurn {
public:
    // Takes the turn or keeps it. Waits while the other daemon has it and fnWait answers true.
    bool Take(const std::function<bool()>& fnWait);
    void GiveBack() { mLock.Release(); }

private:
    FileLock mLock;
};

}  // namespace tavo
