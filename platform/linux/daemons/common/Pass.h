// One pass over the wanted mappings: what came of it, and when it has to end. Relies on nothing.
// Promises: a pass is over well before a save stops waiting for it, whatever the router does.
#pragma once

#include <chrono>
#include <functional>

#include "daemons/common/Outcome.h"
#include "upnp/Router.h"

namespace tavo {

struct PassResult {
    OutcomeList rgOutcomes;       // those of the wanted mappings first, in their order
    uint32_t nShortestLease = 0;  // seconds granted; 0: all permanent
    int nTransport = kRouterOk;   // below 0: why the router could not be spoken to
    bool blStopped = false;
    bool blRenewed = false;  // every lease was asked for anew, due or not
    RouterState enRouter = RouterState::kNotAsked;
};

class PassGuard {
public:
    PassGuard(PassResult& result, const std::function<bool()>& fnStop) : mResult(result), mFnStop(fnStop) {}

    bool IsOver() {
        mResult.blStopped = mResult.blStopped || mFnStop();
        if (std::chrono::steady_clock::now() > mEnd && mResult.nTransport == kRouterOk) {
            mResult.nTransport = kRouterTimeout;
        }
        return mResult.blStopped || mResult.nTransport != kRouterOk;
    }
    // Counts answers that did not come; after a few in a row the pass is over.
    int Note(int nCode) {
        mNSilent = nCode < 0 ? mNSilent + 1 : 0;
        if (mNSilent >= kTransportTries || nCode == kRouterUnreachable) {
            mResult.nTransport = nCode;
        }
        return nCode;
    }

private:
    static constexpr auto kPassLimit = std::chrono::seconds(150);  // well below the five minutes that a save waits
    static constexpr int kTransportTries = 2;                      // silent answers in a row before a pass gives up

    PassResult& mResult;
    const std::function<bool()>& mFnStop;
    std::chrono::steady_clock::time_point mEnd = std::chrono::steady_clock::now() + kPassLimit;
    int mNSilent = 0;
};

}  // namespace tavo
