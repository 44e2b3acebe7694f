// A clock that never jumps and goes on while the box sleeps, as a router's leases do.
// Relies on CLOCK_BOOTTIME. Promises: never goes backwards.
#pragma once

#include <chrono>
#include <ctime>
#include <fstream>
#include <string>

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

// What tells this boot from every other one, whose times mean nothing here.
inline std::string BootId() {
    std::ifstream file("/proc/sys/kernel/random/boot_id");
    std::string szId;
    std::getline(file, szId);
    return szId;
}

}  // namespace tavo
