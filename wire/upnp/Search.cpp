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
#include <span>
#include <utility>
#include <vector>

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
constexpr size_t kMostOthers = 2;  // places that others than the gateway name
constexpr size_t kMostUrl = 1000;
constexpr size_t kMaxLocations = 16;  // a gateway that names more is playing games
constexpr int kMaxRefusalsLogged = 8;
constexpr int kStopPollMilliseconds = 250;
constexpr int kLateAtOnce = 64;
constexpr auto kSilence = std::chrono::milliseconds(3000);
constexpr auto kNoWord = std::chrono::milliseconds(2500);

using Targets = std::span<const char* const>;
constexpr const char* kLikely[] = {
    "urn:schemas-upnp-org:device:InternetGatewayDevice:1", "urn:schemas-upnp-org:device:InternetGatewayDevice:2",
    "urn:schemas-upnp-org:service:WANIPConnection:1", "urn:schemas-upnp-org:service:WANPPPConnection:1"};
// Some answer to nothing else.
constexpr const char* kRest[] = {"upnp:rootdevice", "ssdp:all", "urn:schemas-upnp-org:service:WANIPConnection:2",
                                 "urn:dslforum-org:device:InternetGatewayDevice:1",
                                 "urn:dslforum-org:service:WANPPPConnection:1"};

// UDP gets lost: each question is asked again. The later ones are for a gateway that has said nothing yet.
struct Asking {
    int nMilliseconds;
    Targets rgTargets;
    bool blKnownPort = false;  // from the port of the protocol: some answer to that one only
};
constexpr Asking kAskings[] = {{0, kLikely},  {150, kLikely},        {300, kRest},   {600, kLikely},
                               {1000, kRest}, {1300, kLikely, true}, {1500, kLikely}};

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

void Ask(int fd, const std::string& szGateway, Targets rgTargets) {
    for (const char* szTarget : rgTargets) {
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
    const int nShared = nLocalPort == kSsdpPort ? 1 : 0;  // with whoever listens to announcements
    setsockopt(fd.Get(), SOL_SOCKET, SO_REUSEADDR, &nShared, sizeof(nShared));
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

struct Heard {
    bool blAnything = false;  // from anybody
    bool blGateway = false;   // from the gateway itself, though it may lead nowhere
    std::optional<HttpUrl> location = {};
};

// Takes in one answer. nRefused: how many of the gateway's led nowhere; the first of them are logged.
Heard Receive(int fd, const std::string& szGateway, int& nRefused) {
    char szAnswer[kMaxAnswer];
    sockaddr_in from = {};
    socklen_t nLength = sizeof(from);
    const ssize_t nRead = recvfrom(fd, szAnswer, sizeof(szAnswer), 0, reinterpret_cast<sockaddr*>(&from), &nLength);
    if (nRead < 0) {
        return {};
    }
    Heard heard{true, from.sin_addr.s_addr == Address(szGateway.c_str(), 0).sin_addr.s_addr};
    std::string szReason;
    heard.location = LocationOf({szAnswer, static_cast<size_t>(nRead)}, szGateway, heard.blGateway, szReason);
    if (heard.blGateway && !heard.location && ++nRefused <= kMaxRefusalsLogged) {
        SysLog(LOG_WARNING, "router's discovery answer refused: %s", szReason.c_str());
    }
    return heard;
}

int MillisecondsUntil(Clock::time_point when) {
    return static_cast<int>(
        std::max<int64_t>(0, std::chrono::duration_cast<std::chrono::milliseconds>(when - Clock::now()).count()));
}

}  // namespace

std::optional<HttpUrl> LocationOf(std::string_view szAnswer, const std::string& szGateway, bool blGateway,
                                  std::string& szReason) {
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
        std::optional<HttpUrl> url = ParseHttpUrl(szUrl);
        if (url && szUrl.size() <= kMostUrl && (blGateway || url->szHost == szGateway) &&
            IsAddressForDevices(szGateway)) {
            url->szHost = szGateway;
            return url;
        }
        szReason = "LOCATION is not on the gateway: " + PrintableText(szUrl, kMaxReason);
        return std::nullopt;
    }
    szReason = "no LOCATION";
    return std::nullopt;
}

bool SearchGateway(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds, int nLocalPort,
                   const std::function<bool(const HttpUrl&)>& fnTry, const std::function<bool()>& fnStop,
                   Descriptor* pFdLate) {
    Descriptor fd = OpenSocket(szLocal, nLocalPort);
    Descriptor fdKnown;
    if (fd.Get() < 0) {
        return false;
    }
    const Clock::time_point start = Clock::now();
    const Clock::time_point limit = start + std::chrono::milliseconds(nLimitMilliseconds);
    Clock::time_point end = std::min<Clock::time_point>(limit, start + kNoWord);
    std::set<std::string> setSeen;
    std::vector<HttpUrl> rgOthers;
    size_t nAsked = 0;
    int nRefused = 0;
    bool blFound = false;
    bool blSpoke = false;
    while (!blFound && Clock::now() < end && setSeen.size() < kMaxLocations && !(fnStop && fnStop())) {
        Clock::time_point wake = end;
        if (nAsked < std::size(kAskings)) {
            const Asking& asking = kAskings[nAsked];
            wake = std::min(end, start + std::chrono::milliseconds(asking.nMilliseconds));
            if (MillisecondsUntil(wake) == 0) {
                if (asking.blKnownPort && !blSpoke) {
                    fdKnown = OpenSocket(szLocal, kSsdpPort);
                }
                if (asking.rgTargets.data() == kLikely || !blSpoke) {
                    Ask(asking.blKnownPort ? fdKnown.Get() : fd.Get(), szGateway, asking.rgTargets);
                }
                ++nAsked;
                continue;
            }
        }
        pollfd rgWaiting[] = {{fd.Get(), POLLIN, 0}, {fdKnown.Get(), POLLIN, 0}};
        if (poll(rgWaiting, std::size(rgWaiting), std::min(MillisecondsUntil(wake) + 1, kStopPollMilliseconds)) <= 0) {
            continue;
        }
        const Heard heard = Receive(rgWaiting[0].revents != 0 ? fd.Get() : fdKnown.Get(), szGateway, nRefused);
        if (heard.blGateway) {
            blSpoke = true;
            blFound = heard.location && setSeen.insert(heard.location->Text()).second && fnTry(*heard.location);
            end = std::min(limit, std::max(end, Clock::now() + kSilence));  // a try takes its time, too
        } else if (heard.location && rgOthers.size() < kMostOthers) {
            rgOthers.push_back(*heard.location);
        }
    }
    // A router may answer from another address of its own; anybody else may say so, too.
    for (size_t i = 0; !blSpoke && !blFound && i < rgOthers.size() && !(fnStop && fnStop()); ++i) {
        blFound = fnTry(rgOthers[i]);
    }
    if (!blFound && pFdLate != nullptr) {
        *pFdLate = std::move(fd);
    }
    return blFound;
}

std::optional<HttpUrl> TakeLate(const Descriptor& fdLate, const std::string& szGateway) {
    int nRefused = kMaxRefusalsLogged;
    for (int i = 0; i < kLateAtOnce; ++i) {
        const Heard heard = Receive(fdLate.Get(), szGateway, nRefused);
        if ((heard.location && heard.blGateway) || !heard.blAnything) {
            return heard.location;
        }
    }
    return std::nullopt;
}

}  // namespace tavo
