// Asks a gateway by NAT-PMP for its outside address. Relies on one UDP socket.
// Promises: changes nothing at the gateway; less than a second, whatever it does.
#pragma once

#include <netinet/in.h>

#include <optional>

namespace tavo {

// Nothing when the gateway does not speak NAT-PMP, refuses, or has no outside address now.
std::optional<in_addr> NatPmpPublicAddress(const in_addr& gateway);

}  // namespace tavo
