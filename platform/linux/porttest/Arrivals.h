// Tells whether a connection that the checker made came to this box or to another host. Relies on a packet
// socket where the process may have one, else on the kernel's table of connections.
// Promises: "here" and "elsewhere" are certain; whatever is not is "untold".
#pragma once

#include <netinet/in.h>

#include <cstddef>
#include <cstdint>
#include <map>
#include <set>

#include "ground/Descriptor.h"

namespace tavo {

enum class Arrival { kHere, kElsewhere, kUntold };

class Arrivals {
public:
    // Watches from now on for what is addressed to the box.
    Arrivals();
    // Whether a TCP connection to this port of the box came from this port of the checker. Its address is
    // not looked at: the checker may itself stand behind a translation, which keeps ports where it can.
    //
    // With a packet socket every request for a connection is seen before any filter or redirection of the
    // box, so that none at all means that it went elsewhere; one from another port only may be somebody
    // else's, or the checker's with its port translated. Without one, a connection that stands in the table
    // is here, and nothing more can be told: it may have been passed on to a container, say.
    Arrival Of(uint16_t nBoxPort, uint16_t nCheckerPort);

private:
    void TakePackets();

    std::set<in_addr_t> mSetOwn;  // the box's addresses
    Descriptor mFdPackets;
    bool mBlMissed = false;
    size_t mNRequests = 0;
    std::map<uint16_t, std::set<uint16_t>> mMapRequests;  // by port of the box: ports they came from
};

}  // namespace tavo
