// Who is at an address of the home network: its hardware address, and whether it is there at all.
// Relies on the kernel's table of neighbours over netlink; asking anew needs root.
// Promises: bounded; what the kernel cannot tell counts as there.
#pragma once

#include <functional>
#include <string>

namespace tavo {

// "00:11:22:33:44:55" as the kernel last learnt it; empty when it knows none.
std::string HardwareAddress(const std::string& szAddress);

// Whether it is an address of this box.
bool IsOwnAddress(const std::string& szAddress);

// Has the kernel ask for the host once more. False: nobody answers there. 4 seconds at most; fnStop ends it early,
// with true.
bool IsNeighbourThere(const std::string& szAddress, const std::function<bool()>& fnStop);

}  // namespace tavo
