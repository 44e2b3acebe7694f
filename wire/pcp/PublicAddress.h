// Asks a gateway by NAT-PMP for its outside address. Relies on one UDP socket.
// Promises: changes nothing at the gateway; less than a second, whatever it does.
#pragma once

#include <netinet/in.h>

#include <optional>

namespace tavo {

struct NatPmpWord {
    std::optional<int> nCode;        // the protocol's result code; nothing when the gateway does not speak NAT-PMP
    std::optional<in_addr> address;  // nothing when it refuses, or has no outside address now
};
NatPmpWord AskNatPmp(const in_addr& gateway);

}  // namespace tavo
