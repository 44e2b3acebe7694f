// Tells from a gateway's "seconds since start" whether it has lost its mappings since it last spoke.
// Relies on a clock that goes on while the box sleeps. Promises: a gateway whose clock is up to an
// eighth slow, or two seconds off, counts as one that went on; one whose clock goes back does not.
#pragma once

#include <chrono>
#include <cstdint>
#include <utility>

#include "ground/BootClock.h"

namespace tavo {

class EpochWatch {
public:
    bool IsRestart(uint32_t nEpoch, BootClock::time_point now) const {
        const int64_t nElapsed = std::chrono::duration_cast<std::chrono::seconds>(now - mSeen).count();
        const bool blBehind = int64_t{nEpoch} + kToleranceSeconds < int64_t{mNEpoch} + nElapsed * 7 / 8;
        return mBlKnown && (blBehind || int64_t{nEpoch} + 1 < int64_t{mNEpoch});
    }
    void Note(uint32_t nEpoch, BootClock::time_point now) {
        mBlRestarted = mBlRestarted || IsRestart(nEpoch, now);
        mNEpoch = nEpoch;
        mSeen = now;
        mBlKnown = true;
    }
    // Whether it has started so lately that a second start since would not show.
    bool IsYoung() const { return mBlKnown && mNEpoch < kYoungSeconds; }
    // Whether the gateway has restarted since this was last asked.
    bool TakeRestart() { return std::exchange(mBlRestarted, false); }

private:
    static constexpr int64_t kToleranceSeconds = 2;
    static constexpr uint32_t kYoungSeconds = 8;

    bool mBlKnown = false;
    bool mBlRestarted = false;
    uint32_t mNEpoch = 0;
    BootClock::time_point mSeen;
};

}  // namespace tavo
