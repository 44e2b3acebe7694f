// Tells when this box's links, addresses or routes change. Relies on the kernel's word over netlink.
// Promises: never waits; what comes faster than it is taken in counts as one change.
#pragma once

#include "ground/net/Netlink.h"

namespace tavo {

class NetworkWatch {
public:
    NetworkWatch();
    // Readable when something has changed; -1 where the kernel is not to be listened to.
    int Fd() const { return mPSocket ? nl_socket_get_fd(mPSocket.get()) : -1; }
    // Takes in what has come. True when there was something.
    bool TakeChange();

private:
    NetlinkSocket mPSocket;
};

}  // namespace tavo
