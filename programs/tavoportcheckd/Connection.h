// One client of the port checker: one HTTP request, checked, served and answered. Relies on HttpRequest's bounds
// and on Prober. Promises: a client costs one thread for a bounded
// time and a bounded number of bytes, whatever it sends; nothing but its own address is ever connected to.
#pragma once

#include <atomic>

#include "ground/Descriptor.h"
#include "programs/tavoportcheckd/Address.h"
#include "programs/tavoportcheckd/Config.h"
#include "programs/tavoportcheckd/Limits.h"

namespace tavo {

// What all connections share.
struct CheckdState {
    const CheckdConfig& config;
    Limits limits;
    int fdStop;  // readable when the program is to end
    std::atomic<int> nUnderWay = 0;
};

// Returns when the client has been answered and the connections made to it have been held open for a while.
void ServeConnection(Descriptor fd, const Address& peer, CheckdState& state);

}  // namespace tavo
