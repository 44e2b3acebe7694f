// What a gateway says of its own accord by NAT-PMP and PCP: that it has started, or has another address.
// Relies on one multicast UDP socket. Promises: never waits; only what comes from the gateway's address counts, and of
// a flood only so much is read at once.
#pragma once

#include <string>
#include <vector>

#include "ground/Descriptor.h"
#include "wire/pcp/Packet.h"

namespace tavo {

class GatewayAnnouncements {
public:
    GatewayAnnouncements();
    // Readable when something was said; -1 where the port is taken, which is logged.
    int Fd() const { return mFd.Get(); }
    // What the gateway has announced since the last call.
    std::vector<GatewayAnnouncement> Take(const std::string& szGateway);

private:
    Descriptor mFd;
};

}  // namespace tavo
