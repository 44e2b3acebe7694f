// Wakes whoever waits for its descriptor at a time of the boot clock: at once after the box has slept past it, where
// the time limit of a wait would only go on. Relies on timerfd. Promises: readable from that time on, until it is set
// anew.
#pragma once

#include <sys/timerfd.h>

#include <algorithm>
#include <chrono>

#include "ground/BootClock.h"
#include "ground/Descriptor.h"

namespace tavo {

class BootTimer {
public:
    BootTimer() : mFd(timerfd_create(CLOCK_BOOTTIME, TFD_CLOEXEC | TFD_NONBLOCK)) {}
    int Fd() const { return mFd.Get(); }
    void Set(BootClock::time_point time) {
        // Of a time of 0 the kernel thinks that there is none.
        const auto nLeft = std::max<int64_t>(std::chrono::nanoseconds(time.time_since_epoch()).count(), 1);
        const itimerspec when{{}, {nLeft / kSecond, nLeft % kSecond}};
        timerfd_settime(mFd.Get(), TFD_TIMER_ABSTIME, &when, nullptr);
    }

private:
    static constexpr int64_t kSecond = 1000000000;

    Descriptor mFd;
};

}  // namespace tavo
