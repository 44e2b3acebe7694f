// A clock that never jumps and goes on while the box sleeps, as a router's leases do.
// Relies on CLOCK_BOOTTIME. Promises: never goes backwards.
#pragma once

#include <chrono>
#include <cstdint>
#include <ctime>

namespace tavo {

struct BootClock {
    using rep = std::chrono::nanoseconds::rep;
    using period = std::chrono::nanoseconds::period;
    using duration = std::chrono::nanoseconds;
    using time_point = std::chrono::time_point<BootClock>;
    static constexpr bool is_steady = true;

    static time_point now() {
        timespec time = {};
        clock_gettime(CLOCK_BOOTTIME, &time);
        return time_point(std::chrono::seconds(time.tv_sec) + std::chrono::nanoseconds(time.tv_nsec));
    }
};

// Its seconds since the boot.
inline int64_t BootSeconds() {
    return std::chrono::duration_cast<std::chrono::seconds>(BootClock::now().time_since_epoch()).count();
}

}  // namespace tavo
