// The checks of the network that the box is in. Relies on the platform's addresses, and on Outside, Walk
// and Level; the gateway is asked by NAT-PMP and by UPnP, in this order, because the first is the quicker.
// Promises: no root, no thread; each check ends within seconds; nothing is changed, but that root remembers
// where the router's UPnP was found.
#include <arpa/inet.h>
#include <net/if.h>
#include <sys/ioctl.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <string>

#include "ground/Border.h"
#include "ground/Descriptor.h"
#include "ground/Fail.h"
#include "ground/net/Level.h"
#include "ground/net/Neighbour.h"
#include "platform/linux/net/Reachability.h"
#include "tavo/net.h"
#include "wire/icmp/HopProbe.h"
#include "wire/pcp/Client.h"
#include "wire/upnp/GatewayMemory.h"

namespace {

constexpr int kMostCards = 64;
constexpr int kWalkMilliseconds = 1500;
constexpr int kOneHopMilliseconds = 700;
constexpr int kUpnpMilliseconds = 1500;

using tavo::AtBorder;
using tavo::Fail;

// A cable that is not plugged in counts as down.
bool IsRunning(const std::string& szInterface) {
    const tavo::Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    ifreq request = {};
    std::snprintf(request.ifr_name, sizeof(request.ifr_name), "%s", szInterface.c_str());
    constexpr int kNeeded = IFF_UP | IFF_RUNNING;
    return fd.Get() >= 0 && ioctl(fd.Get(), SIOCGIFFLAGS, &request) == 0 && (request.ifr_flags & kNeeded) == kNeeded;
}

std::vector<TAVO_NET_CARD> CardsInUse() {
    std::vector<TAVO_NET_CARD> rgCards(kMostCards);
    rgCards.resize(static_cast<size_t>(std::max(0, TLIBNetGetInterfaceInfo(rgCards.data(), kMostCards, 2))));
    return rgCards;
}

std::string Gateway() {
    char szGateway[INET_ADDRSTRLEN];
    return TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) == 0 ? szGateway : "";
}

// The interface that a packet for the gateway would leave by; empty when there is none.
std::string InterfaceTowards(const std::string& szGateway) {
    char szLocal[INET_ADDRSTRLEN];
    char szInterface[IF_NAMESIZE];
    return TAVONetLocalAddressGet(szGateway.c_str(), szLocal, sizeof(szLocal), szInterface, sizeof(szInterface)) == 0
               ? szInterface
               : "";
}

// The name of some interface that could be used if it were up; empty when the box has none.
std::string AnyInterface() {
    struct NamesFree {
        void operator()(struct if_nameindex* pNames) const { if_freenameindex(pNames); }
    };
    const std::unique_ptr<struct if_nameindex, NamesFree> pNames(if_nameindex());
    for (auto* pName = pNames.get(); pName != nullptr && pName->if_index != 0; ++pName) {
        if (std::strcmp(pName->if_name, "lo") != 0) {
            return pName->if_name;
        }
    }
    return "";
}

// Without a gateway, the first that is up, else any.
std::string InterfaceInQuestion(const std::vector<TAVO_NET_CARD>& rgCards) {
    const std::string szGateway = Gateway();
    std::string szInterface = szGateway.empty() ? "" : InterfaceTowards(szGateway);
    for (const TAVO_NET_CARD& card : rgCards) {
        if (szInterface.empty() && IsRunning(card.szName)) {
            szInterface = card.szName;
        }
    }
    return szInterface.empty() ? AnyInterface() : szInterface;
}

in_addr AddressOf(const std::string& szText) {
    in_addr address = {};
    inet_pton(AF_INET, szText.c_str(), &address);
    return address;
}

std::optional<in_addr> AskUpnp() {
    const auto pIgd = tavo::FindGatewayIgd(kUpnpMilliseconds, 0);
    std::string szAddress;
    if (pIgd != nullptr) {
        pIgd->SetCallLimit(kUpnpMilliseconds);
    }
    if (pIgd == nullptr || pIgd->ExternalAddress(szAddress) != tavo::kWireOk) {
        return std::nullopt;
    }
    const in_addr address = AddressOf(szAddress);
    return address.s_addr == 0 ? std::nullopt : std::optional<in_addr>(address);
}

std::optional<in_addr> ExternalAddress(const std::string& szGateway) {
    const auto address = tavo::AskNatPmp(szGateway).address;
    return address ? address : AskUpnp();
}

TAVO_NET_ADDRESS_KIND SeamKind(tavo::AddressKind enKind) {
    switch (enKind) {
        case tavo::AddressKind::kPublic:
            return TAVO_NET_ADDRESS_PUBLIC;
        case tavo::AddressKind::kPrivate:
            return TAVO_NET_ADDRESS_PRIVATE;
        case tavo::AddressKind::kCarrier:
            return TAVO_NET_ADDRESS_CARRIER;
        default:
            return TAVO_NET_ADDRESS_UNKNOWN;
    }
}

// A packet for the address that may make one hop only: when somebody else says that its life ended there,
// the gateway has passed it on and the address is not its own.
bool IsPassedOn(const in_addr& address) {
    const auto rgWho = tavo::WalkTowards(address, 1, 1, kOneHopMilliseconds);
    return rgWho.front() && rgWho.front()->s_addr != address.s_addr;
}

std::optional<int> Level(const sockaddr_in& host, int nHops) {
    char szHost[INET_ADDRSTRLEN];
    char szOwn[INET_ADDRSTRLEN];
    inet_ntop(AF_INET, &host.sin_addr, szHost, sizeof(szHost));
    if (TAVONetLocalAddressGet(szHost, szOwn, sizeof(szOwn), nullptr, 0) != 0) {
        return std::nullopt;
    }
    tavo::LevelEvidence evidence;
    evidence.own = AddressOf(szOwn);
    const std::string szGateway = Gateway();
    if (tavo::KindOf(evidence.own) == tavo::AddressKind::kPublic || szGateway.empty()) {
        return tavo::LevelOf(evidence);
    }
    evidence.external = ExternalAddress(szGateway);
    evidence.rgBeyond = tavo::WalkTowards(host.sin_addr, 2, nHops, kWalkMilliseconds);
    for (std::optional<in_addr>& router : evidence.rgBeyond) {
        // A gateway that answers for the routers behind it.
        if (router && router->s_addr == AddressOf(szGateway).s_addr) {
            router.reset();
        }
    }
    // Asked only where it decides: a public address outside, private routers beyond.
    evidence.blExternalElsewhere = true;
    if (evidence.external && tavo::KindOf(*evidence.external) == tavo::AddressKind::kPublic &&
        tavo::LevelOf(evidence) > 1) {
        evidence.blExternalElsewhere = IsPassedOn(*evidence.external);
    }
    return tavo::LevelOf(evidence);
}

}  // namespace

int checkGwIfEnable(char* szInterface, int nSize) {
    return AtBorder(-1, [&] {
        if (szInterface == nullptr || nSize < 1) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const std::vector<TAVO_NET_CARD> rgCards = CardsInUse();
        const std::string szName = InterfaceInQuestion(rgCards);
        std::snprintf(szInterface, static_cast<size_t>(nSize), "%s", szName.c_str());
        const bool blAddressed = std::any_of(rgCards.begin(), rgCards.end(),
                                             [&](const TAVO_NET_CARD& card) { return szName == card.szName; });
        return blAddressed && IsRunning(szName) ? 0 : Fail(TLIBC_ERR_NOT_FOUND);
    });
}

int checkDefaultGatewaySetting(char* szGateway, int nSize) {
    return AtBorder(-1, [&] {
        if (szGateway == nullptr || nSize < 1) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const std::string szFound = Gateway();
        std::snprintf(szGateway, static_cast<size_t>(nSize), "%s", szFound.c_str());
        bool blOnLink = false;
        for (const TAVO_NET_CARD& card : CardsInUse()) {
            if (szFound == card.szAddress) {
                return Fail(TLIBC_ERR_NOT_FOUND);  // the box as its own gateway
            }
            blOnLink = blOnLink ||
                       (!szFound.empty() && TAVONetIsSameSubnet(szFound.c_str(), card.szAddress, card.szMask) == 1);
        }
        return blOnLink ? 0 : Fail(TLIBC_ERR_NOT_FOUND);
    });
}

int checkConnectToWAN() {
    return AtBorder(-1, [] { return tavo::AnyReached(tavo::OutsideHosts()) ? 0 : Fail(TLIBC_ERR_NOT_FOUND); });
}

int checkDNSSetting() {
    return AtBorder(-1, [] { return tavo::IsNameResolved() ? 0 : Fail(TLIBC_ERR_NOT_FOUND); });
}

int getPublicIPLevel(int& nLevel, int nHops) {
    return AtBorder(-1, [&] {
        const std::vector<sockaddr_in> rgHosts = tavo::OutsideHosts();
        const std::optional<int> level = rgHosts.empty() ? std::nullopt : Level(rgHosts.front(), nHops);
        if (!level) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        nLevel = *level;
        return 0;
    });
}

int TAVONetGatewayAsk(TAVO_NET_GATEWAY_WORD* pWord) {
    return AtBorder(-1, [&] {
        const std::string szGateway = Gateway();
        if (pWord == nullptr || szGateway.empty()) {
            return Fail(pWord == nullptr ? TLIBC_ERR_BAD_PARAMETER : TLIBC_ERR_NOT_FOUND);
        }
        const tavo::NatPmpWord natpmp = tavo::AskNatPmp(szGateway);
        const auto outside = natpmp.address ? natpmp.address : AskUpnp();
        *pWord = {};
        std::snprintf(pWord->szGateway, sizeof(pWord->szGateway), "%s", szGateway.c_str());
        // Whoever has answered is there.
        pWord->nThere = natpmp.nCode || outside || tavo::IsNeighbourThere(szGateway, [] { return false; }) ? 1 : 0;
        pWord->nNatpmp = natpmp.nCode.value_or(TAVO_NET_NATPMP_SILENT);
        if (outside) {
            inet_ntop(AF_INET, &*outside, pWord->szOutside, sizeof(pWord->szOutside));
            pWord->enOutside = SeamKind(tavo::KindOf(*outside));
        }
        return 0;
    });
}
