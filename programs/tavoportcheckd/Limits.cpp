// Token buckets. Relies on the steady clock. Promises: see Limits.h.
#include "programs/tavoportcheckd/Limits.h"

#include <algorithm>

namespace tavo {

namespace {

constexpr size_t kMaxAddresses = 4096;

}  // namespace

void Limits::Bucket::Refill(double nPerMinute, Clock::time_point now) {
    const std::chrono::duration<double, std::ratio<60>> passed = now - last;
    nLeft = std::min(nPerMinute, nLeft + passed.count() * nPerMinute);
    last = now;
}

// Whoever has not asked for a minute needs no memory of it.
bool Limits::MakeRoom(Clock::time_point now) {
    if (mMapBuckets.size() >= kMaxAddresses) {
        for (auto it = mMapBuckets.begin(); it != mMapBuckets.end();) {
            it->second.Refill(mNPerAddress, now);
            it = it->second.nLeft >= mNPerAddress ? mMapBuckets.erase(it) : std::next(it);
        }
    }
    return mMapBuckets.size() < kMaxAddresses;
}

bool Limits::Take(const Address& address, Clock::time_point now) {
    const std::lock_guard lock(mMutex);
    const Address owner = address.Owner();
    auto it = mMapBuckets.find(owner);
    if (it == mMapBuckets.end()) {
        if (!MakeRoom(now)) {
            return false;
        }
        it = mMapBuckets.insert({owner, {mNPerAddress, now}}).first;
    }
    it->second.Refill(mNPerAddress, now);
    mTotal.Refill(mNTotal, now);
    if (it->second.nLeft < 1 || mTotal.nLeft < 1) {
        return false;
    }
    it->second.nLeft -= 1;
    mTotal.nLeft -= 1;
    return true;
}

}  // namespace tavo
