// Has the router's own pages take away what they forward although UPnP or NAT-PMP drives the router by now: whoever
// saves rules through the library alone does not see to it. Relies on the program that keeps the record of it, which
// looks under its lock whether the pages are in use again.
// Promises: waits for nothing; one at a time; after one that has not come to its end with all of it, by whomever, none
// for minutes.
#pragma once

#include <sys/types.h>

#include "ground/BootClock.h"
#include "ground/Descriptor.h"
#include "mapping/Record.h"

namespace tavo {

class UnusedPages {
public:
    // Begins with it where something is on record of this router.
    void Clear(const RouterName& router);
    // Can be read once that has ended; -1: nothing goes on.
    int Fd() const { return mFdEnd.Get(); }
    // True once after the end: the places are free.
    bool TakeEnd();

private:
    pid_t mPid = -1;
    Descriptor mFdEnd;
    BootClock::time_point mNext;
};

}  // namespace tavo
