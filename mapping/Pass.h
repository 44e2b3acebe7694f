// One pass over the wanted mappings: what came of it, and when it has to end. Relies on nothing.
// Promises: a pass is over well before a save stops waiting for it, whatever the router does.
#pragma once

#include <cstdint>
#include <functional>

#include "ground/BootClock.h"
#include "mapping/Outcome.h"
#include "mapping/Router.h"

namespace tavo {

struct PassResult {
    OutcomeList rgOutcomes;  // those of the wanted mappings first, in their order
    RouterReply transport;   // not kOk: why the router could not be spoken to
    bool blStopped = false;
    bool blUnfinished = false;  // its time was up: the next one goes on where it ended
    int nNextSeconds = 0;       // until something has to be done again; 0: nothing has to
    RouterState enRouter = RouterState::kNotAsked;
};

class PassGuard {
public:
    PassGuard(PassResult& result, const std::function<bool()>& fnStop, std::function<int64_t()> fnNow = BootSeconds)
        : mResult(result), mFnStop(fnStop), mFnNow(std::move(fnNow)), mNEnd(mFnNow() + kPassLimit) {}

    bool IsOver() {
        mResult.blStopped = mResult.blStopped || mFnStop();
        mResult.blUnfinished = mResult.blUnfinished || mFnNow() > mNEnd;
        return mResult.blStopped || mResult.blUnfinished || !mResult.transport.IsOk();
    }
    // Counts answers that did not come; after a few in a row the pass is over.
    RouterReply Note(RouterReply reply) {
        mNSilent = reply.IsSilence() ? mNSilent + 1 : 0;
        if (mNSilent >= kTransportTries || reply.enReply == Reply::kUnreachable) {
            mResult.transport = reply;
        }
        return reply;
    }

private:
    static constexpr int64_t kPassLimit = 150;  // seconds, well below the five minutes that a save waits
    static constexpr int kTransportTries = 2;   // silent answers in a row before a pass gives up

    PassResult& mResult;
    const std::function<bool()>& mFnStop;
    std::function<int64_t()> mFnNow;
    int64_t mNEnd;
    int mNSilent = 0;
};

}  // namespace tavo
