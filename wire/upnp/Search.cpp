// SSDP: M-SEARCH to the gateway and to the group, answers filtered by who sent them.
// Relies on one UDP socket of its own. Promises: see Search.h.
#include "wire/upnp/Search.h"

#include <arpa/inet.h>
#include <poll.h>
#include <strings.h>
#include <sys/socket.h>

#include <algorithm>
#include <chrono>
#include <iterator>
#include <set>

#include "ground/Descriptor.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

constexpr uint16_t kSsdpPort = 1900;
constexpr char kGroup[] = "239.255.255.250";
constexpr size_t kMaxAnswer = 4096;
constexpr size_t kMaxReason = 200;
constexpr size_t kMaxLocations = 16;  // a gateway that names more is playing games
constexpr int kMaxRefusalsLogged = 8;
constexpr int kStopPollMilliseconds = 250;
// UDP gets lost: each question is asked again at these times after the first.
constexpr int kAskAtMilliseconds[] = {0, 150, 600, 1500, 3000};
constexpr auto kSilence = std::chrono::milliseconds(3000);
constexpr const char* kTargets[] = {
    "urn:schemas-upnp-org:device:InternetGatewayDevice:1", "urn:schemas-upnp-org:device:InternetGatewayDevice:2",
    "urn:schemas-upnp-org:service:WANIPConnection:1", "urn:schemas-upnp-org:service:WANPPPConnection:1"};

sockaddr_in Address(const char* szHost, uint16_t nPort) {
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(nPort);
    inet_pton(AF_INET, szHost, &address.sin_addr);
    return address;
}

void Send(int fd, const std::string& szText, const sockaddr_in& to) {
    sendto(fd, szText.data(), szText.size(), 0, reinterpret_cast<const sockaddr*>(&to), sizeof(to));
}

void Ask(int fd, const std::string& szGateway) {
    for (const char* szTarget : kTargets) {
        for (const std::string& szHost : {szGateway, std::string(kGroup)}) {
            Send(fd,
                 "M-SEARCH * HTTP/1.1\r\nHOST: " + szHost +
                     ":1900\r\nMAN: \"ssdp:discover\"\r\nMX: 1\r\nST: " + szTarget + "\r\n\r\n",
                 Address(szHost.c_str(), kSsdpPort));
        }
    }
}

bool Bind(int fd, const sockaddr_in& local) {
    return bind(fd, reinterpret_cast<const sockaddr*>(&local), sizeof(local)) == 0;
}

Descriptor OpenSocket(const std::string& szLocal, int nLocalPort) {
    Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const sockaddr_in local = Address(szLocal.c_str(), static_cast<uint16_t>(nLocalPort));
    if (fd.Get() < 0 || (!Bind(fd.Get(), local) && !Bind(fd.Get(), Address(szLocal.c_str(), 0)))) {
        return Descriptor();
    }
    setsockopt(fd.Get(), IPPROTO_IP, IP_MULTICAST_IF, &local.sin_addr, sizeof(local.sin_addr));
    return fd;
}

bool IsAddressForDevices(const std::string& szHost) {
    in_addr address = {};
    if (inet_pton(AF_INET, szHost.c_str(), &address) != 1) {
        return false;
    }
    const uint32_t nHost = ntohl(address.s_addr);
    const bool blLoopback = nHost >> 24U == 127;
    const bool blLinkLocal = nHost >> 16U == 0xA9FE;
    return !blLoopback && !blLinkLocal && nHost != 0;
}

// Where one answer from the gateway points; the first refusals are logged. blHeard: it said something at all.
std::optional<HttpUrl> Receive(int fd, const std::string& szGateway, bool& blHeard, int& nRefused) {
    char szAnswer[kMaxAnswer];
    sockaddr_in from = {};
    socklen_t nLength = sizeof(from);
    const ssize_t nRead = recvfrom(fd, szAnswer, sizeof(szAnswer), 0, reinterpret_cast<sockaddr*>(&from), &nLength);
    if (nRead <= 0 || from.sin_addr.s_addr != Address(szGateway.c_str(), 0).sin_addr.s_addr) {
        return std::nullopt;  // another device on the network: not our router
    }
    blHeard = true;
    std::string szReason;
    auto location = LocationOf({szAnswer, static_cast<size_t>(nRead)}, szGateway, szReason);
    if (!location && ++nRefused <= kMaxRefusalsLogged) {
        SysLog(LOG_WARNING, "router's discovery answer refused: %s", szReason.c_str());
    }
    return location;
}

int MillisecondsUntil(Clock::time_point when) {
    return static_cast<int>(
        std::max<int64_t>(0, std::chrono::duration_cast<std::chrono::milliseconds>(when - Clock::now()).count()));
}

}  // namespace

std::optional<HttpUrl> LocationOf(std::string_view szAnswer, const std::string& szGateway, std::string& szReason) {
    if (!szAnswer.starts_with("HTTP/1.") || szAnswer.substr(0, 16).find(" 200") == std::string_view::npos) {
        szReason = "no positive answer";
        return std::nullopt;
    }
    constexpr std::string_view kHeader = "location:";
    for (const std::string_view szLine : SplitLines(szAnswer)) {
        if (szLine.size() < kHeader.size() || strncasecmp(szLine.data(), kHeader.data(), kHeader.size()) != 0) {
            continue;
        }
        const std::string szUrl(Trim(szLine.substr(kHeader.size())));
        const std::optional<HttpUrl> url = ParseHttpUrl(szUrl);
        if (url && url->szHost == szGateway && IsAddressForDevices(url->szHost)) {
            return url;
        }
        szReason = "LOCATION is not on the gateway: " + PrintableText(szUrl, kMaxReason);
        return std::nullopt;
    }
    szReason = "no LOCATION";
    return std::nullopt;
}

bool SearchGateway(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds, int nLocalPort,
                   const std::function<bool(const HttpUrl&)>& fnTry, const std::function<bool()>& fnStop) {
    const Descriptor fd = OpenSocket(szLocal, nLocalPort);
    if (fd.Get() < 0) {
        return false;
    }
    const Clock::time_point start = Clock::now();
    const Clock::time_point limit = start + std::chrono::milliseconds(nLimitMilliseconds);
    Clock::time_point end =
        std::min(limit, start + std::chrono::milliseconds(*std::rbegin(kAskAtMilliseconds)) + kSilence);
    std::set<std::string> setSeen;
    size_t nAsked = 0;
    int nRefused = 0;
    while (Clock::now() < end && setSeen.size() < kMaxLocations && !(fnStop && fnStop())) {
        Clock::time_point wake = end;
        if (nAsked < std::size(kAskAtMilliseconds)) {
            wake = std::min(end, start + std::chrono::milliseconds(kAskAtMilliseconds[nAsked]));
            if (MillisecondsUntil(wake) == 0) {
                Ask(fd.Get(), szGateway);
                ++nAsked;
                continue;
            }
        }
        pollfd waiting = {fd.Get(), POLLIN, 0};
        if (poll(&waiting, 1, std::min(MillisecondsUntil(wake) + 1, kStopPollMilliseconds)) <= 0) {
            continue;
        }
        bool blHeard = false;
        const std::optional<HttpUrl> location = Receive(fd.Get(), szGateway, blHeard, nRefused);
        if (location && setSeen.insert(location->Text()).second && fnTry(*location)) {
            return true;
        }
        if (blHeard) {
            end = std::min(limit, std::max(end, Clock::now() + kSilence));
        }
    }
    return false;
}

}  // namespace tavo
