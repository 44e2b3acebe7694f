// What tells this boot from every other one, whose times mean nothing here. Relies on /proc.
#pragma once

#include <fstream>
#include <string>

namespace tavo {

inline std::string BootId() {
    std::ifstream file("/proc/sys/kernel/random/boot_id");
    std::string szId;
    std::getline(file, szId);
    return szId;
}

}  // namespace tavo
