// How soon a router is looked at again: often after a change, seldom in peace, as no router tells everything of its own
// accord. Relies on nothing: no clock, no router.
#pragma once

#include "mapping/Pass.h"

namespace tavo {

struct NextLook {
    int nSeconds = 0;
    bool blLost = false;  // the router is to be looked for anew
};

class Keeper {
public:
    // After a pass. blChange: it found or made something other than the one before, or was asked for. nMost: the
    // longest pause, in seconds.
    NextLook After(const PassResult& result, bool blChange, int nMost);

private:
    int mNPause = 0;     // seconds, after the last pass
    int mNFailures = 0;  // in a row
};

}  // namespace tavo
