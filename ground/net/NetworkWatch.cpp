// See NetworkWatch.h.
#include "ground/net/NetworkWatch.h"

#include <linux/rtnetlink.h>
#include <netlink/socket.h>
#include <sys/socket.h>

#include <cerrno>

#include "ground/SysLog.h"

namespace tavo {

namespace {

constexpr int kMessageSize = 16384;
constexpr int kMessagesAtOnce = 256;  // of a flood, no more than these are taken in in one go

}  // namespace

NetworkWatch::NetworkWatch() : mPSocket(Connect()) {
    if (mPSocket && nl_socket_add_memberships(mPSocket.get(), RTNLGRP_LINK, RTNLGRP_IPV4_IFADDR, RTNLGRP_IPV4_ROUTE,
                                              RTNLGRP_NONE) < 0) {
        mPSocket.reset();
    }
    if (!mPSocket) {
        SysLog(LOG_WARNING, "a change of the network is noticed at the next check only");
    }
}

bool NetworkWatch::TakeChange() {
    bool blChange = false;
    char szMessage[kMessageSize];
    for (int i = 0; i < kMessagesAtOnce; ++i) {
        const ssize_t nRead = recv(Fd(), szMessage, sizeof(szMessage), MSG_DONTWAIT);
        if (nRead < 0 && errno != ENOBUFS && errno != EINTR) {
            return blChange;
        }
        blChange = true;
    }
    return blChange;
}

}  // namespace tavo
