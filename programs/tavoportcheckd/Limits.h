// How often an address, and everybody together, may ask. Relies on nothing. Promises: constant memory; who is
// refused costs the others nothing.
#pragma once

#include <chrono>
#include <map>
#include <mutex>

#include "programs/tavoportcheckd/Address.h"

namespace tavo {

class Limits {
public:
    using Clock = std::chrono::steady_clock;
    // Requests a minute; as many may come at once.
    Limits(int nPerAddress, int nTotal) : mNPerAddress(nPerAddress), mNTotal(nTotal), mTotal{mNTotal, {}} {}
    // Whether one more request of this address is served.
    bool Take(const Address& address, Clock::time_point now = Clock::now());

private:
    struct Bucket {
        double nLeft;
        Clock::time_point last;
        void Refill(double nPerMinute, Clock::time_point now);
    };
    bool MakeRoom(Clock::time_point now);

    double mNPerAddress;
    double mNTotal;
    std::mutex mMutex;
    Bucket mTotal;
    std::map<Address, Bucket> mMapBuckets;
};

}  // namespace tavo
