// See Notify.h.
#include "wire/upnp/Notify.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <strings.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "ground/SysLog.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr uint16_t kSsdpPort = 1900;
constexpr char kGroup[] = "239.255.255.250";
constexpr size_t kMaxMessage = 4096;
constexpr size_t kMaxLife = 256;
constexpr size_t kMostDevices = 64;
constexpr int kMessagesAtOnce = 64;  // of a flood, no more than these are looked at in one go

// The value of a header, whose name ends with the colon; empty where there is none.
std::string_view Header(std::string_view szMessage, std::string_view szName) {
    for (const std::string_view szLine : SplitLines(szMessage)) {
        if (szLine.size() > szName.size() && strncasecmp(szLine.data(), szName.data(), szName.size()) == 0) {
            return Trim(szLine.substr(szName.size()));
        }
    }
    return "";
}

}  // namespace

std::optional<std::string> LifeOf(std::string_view szMessage) {
    const std::string_view szKind = szMessage.starts_with("NOTIFY ") ? Header(szMessage, "NTS:") : "";
    if (szKind != "ssdp:alive") {
        return szKind == "ssdp:byebye" ? std::optional<std::string>("") : std::nullopt;
    }
    const std::string_view szBoot = Header(szMessage, "BOOTID.UPNP.ORG:");
    std::string szLife = PrintableText(szBoot.empty() ? Header(szMessage, "LOCATION:") : szBoot, kMaxLife);
    return szLife.empty() ? std::nullopt : std::optional(std::move(szLife));
}

bool Lives::IsNews(std::string_view szMessage) {
    const auto szLife = LifeOf(szMessage);
    if (!szLife) {
        return false;
    }
    const std::string szDevice = PrintableText(Header(szMessage, "USN:"), kMaxLife);
    if (szLife->empty()) {
        return mMapLives.erase(szDevice) != 0;
    }
    if (mMapLives.size() >= kMostDevices && !mMapLives.contains(szDevice)) {
        mMapLives.clear();
    }
    return std::exchange(mMapLives[szDevice], *szLife) != *szLife;
}

void Announcements::Listen(const std::string& szLocal) {
    mLives.Forget();
    mFd.Reset(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const int nOn = 1;
    const int nOff = 0;
    sockaddr_in group = {};
    group.sin_family = AF_INET;
    group.sin_port = htons(kSsdpPort);
    inet_pton(AF_INET, kGroup, &group.sin_addr);
    ip_mreq membership = {};
    membership.imr_multiaddr = group.sin_addr;
    setsockopt(mFd.Get(), SOL_SOCKET, SO_REUSEADDR, &nOn, sizeof(nOn));
    setsockopt(mFd.Get(), IPPROTO_IP, IP_MULTICAST_ALL, &nOff, sizeof(nOff));
    if (inet_pton(AF_INET, szLocal.c_str(), &membership.imr_interface) != 1 ||
        bind(mFd.Get(), reinterpret_cast<const sockaddr*>(&group), sizeof(group)) != 0 ||
        setsockopt(mFd.Get(), IPPROTO_IP, IP_ADD_MEMBERSHIP, &membership, sizeof(membership)) != 0) {
        SysLog(LOG_WARNING, "a router that restarts is noticed at the next check only: %s", std::strerror(errno));
        mFd.Reset();
    }
}

bool Announcements::TakeNews(const std::string& szGateway) {
    bool blNews = false;
    char szMessage[kMaxMessage];
    sockaddr_in sender = {};
    for (int i = 0; i < kMessagesAtOnce; ++i) {
        socklen_t nLength = sizeof(sender);
        const ssize_t nRead =
            recvfrom(mFd.Get(), szMessage, sizeof(szMessage), 0, reinterpret_cast<sockaddr*>(&sender), &nLength);
        if (nRead < 0) {
            break;
        }
        char szSender[INET_ADDRSTRLEN] = {};
        inet_ntop(AF_INET, &sender.sin_addr, szSender, sizeof(szSender));
        if (szGateway == szSender && mLives.IsNews({szMessage, static_cast<size_t>(nRead)})) {
            blNews = true;
        }
    }
    return blNews;
}

}  // namespace tavo
