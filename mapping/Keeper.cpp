// See Keeper.h.
#include "mapping/Keeper.h"

#include <algorithm>
#include <utility>

namespace tavo {

namespace {

constexpr int kFirstPause = 10;  // seconds after a change; each pause that follows is twice as long
constexpr int kRetryPause = 10;  // after a failure
constexpr int kFailuresToLoss = 3;

}  // namespace

NextLook Keeper::After(const PassResult& result, bool blChange, int nMost) {
    if (!result.transport.IsOk()) {
        mNPause = 0;
        mNFailures = (mNFailures + 1) % kFailuresToLoss;
        return {std::min(nMost, kRetryPause), mNFailures == 0};
    }
    mNFailures = 0;
    mNPause = std::min(blChange || mNPause == 0 ? kFirstPause : 2 * mNPause, nMost);
    return {result.nNextSeconds > 0 ? std::min(mNPause, result.nNextSeconds) : mNPause};
}

}  // namespace tavo
