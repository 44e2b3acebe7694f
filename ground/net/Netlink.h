// The kernel's tables over netlink, with their owners. Relies on libnl-3. Promises: nothing is left open.
#pragma once

#include <netlink/cache.h>
#include <netlink/netlink.h>

#include <memory>

namespace tavo {

struct SocketFree {
    void operator()(nl_sock* pSocket) const { nl_socket_free(pSocket); }
};
struct CacheFree {
    void operator()(nl_cache* pCache) const { nl_cache_free(pCache); }
};
using NetlinkSocket = std::unique_ptr<nl_sock, SocketFree>;
using Cache = std::unique_ptr<nl_cache, CacheFree>;

// Null when the kernel is not to be spoken to.
inline NetlinkSocket Connect() {
    NetlinkSocket pSocket(nl_socket_alloc());
    if (pSocket && nl_connect(pSocket.get(), NETLINK_ROUTE) < 0) {
        pSocket.reset();
    }
    return pSocket;
}

}  // namespace tavo
