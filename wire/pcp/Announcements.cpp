// See Announcements.h.
#include "wire/pcp/Announcements.h"

#include <arpa/inet.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>

#include "ground/SysLog.h"

namespace tavo {

namespace {

constexpr int kAtOnce = 64;

}  // namespace

// Hosts are members of their all-hosts group without asking.
GatewayAnnouncements::GatewayAnnouncements() : mFd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)) {
    const int nOn = 1;
    setsockopt(mFd.Get(), SOL_SOCKET, SO_REUSEADDR, &nOn, sizeof(nOn));
    sockaddr_in group = {};
    group.sin_family = AF_INET;
    group.sin_port = htons(kAnnouncementPort);
    group.sin_addr.s_addr = htonl(INADDR_ALLHOSTS_GROUP);
    if (bind(mFd.Get(), reinterpret_cast<const sockaddr*>(&group), sizeof(group)) != 0) {
        SysLog(LOG_WARNING, "a router that restarts is noticed at the next check only: %s", std::strerror(errno));
        mFd.Reset();
    }
}

std::vector<GatewayAnnouncement> GatewayAnnouncements::Take(const std::string& szGateway) {
    std::vector<GatewayAnnouncement> rgHeard;
    uint8_t rgDatagram[kMostPacket];
    for (int i = 0; i < kAtOnce; ++i) {
        sockaddr_in sender = {};
        socklen_t nLength = sizeof(sender);
        const ssize_t nSize =
            recvfrom(mFd.Get(), rgDatagram, sizeof(rgDatagram), 0, reinterpret_cast<sockaddr*>(&sender), &nLength);
        if (nSize < 0) {
            break;
        }
        char szSender[INET_ADDRSTRLEN] = {};
        inet_ntop(AF_INET, &sender.sin_addr, szSender, sizeof(szSender));
        const auto announcement = ReadAnnouncement(std::span(rgDatagram).first(static_cast<size_t>(nSize)));
        if (announcement && szGateway == szSender) {
            rgHeard.push_back(*announcement);
        }
    }
    return rgHeard;
}

}  // namespace tavo
