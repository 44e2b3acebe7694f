// The default gateway and the box's own addresses. Relies on libnl-route-3 (routes and addresses over
// netlink) and the kernel's routing decision for a destination.
// Promises: outputs untouched on failure; nothing is sent on the network.
#include "tavo/net.h"

#include <arpa/inet.h>
#include <net/if.h>
#include <netlink/route/addr.h>
#include <netlink/route/link.h>
#include <netlink/route/route.h>
#include <sys/socket.h>

#include <cstdint>
#include <cstdio>
#include <cstring>
#include <optional>

#include "ground/Border.h"
#include "ground/Descriptor.h"
#include "ground/Fail.h"
#include "ground/net/Netlink.h"

namespace {

constexpr uint16_t kAnyPort = 9;  // a destination port is needed, though nothing is sent

using tavo::AtBorder;
using tavo::Fail;

using tavo::Cache;
using tavo::Connect;
using tavo::NetlinkSocket;

// The IPv4 next hop of a default route; nothing for any other route.
std::optional<in_addr> DefaultNextHop(rtnl_route* pRoute) {
    nl_addr* pDestination = rtnl_route_get_dst(pRoute);
    if (rtnl_route_get_family(pRoute) != AF_INET || rtnl_route_get_table(pRoute) != RT_TABLE_MAIN ||
        (pDestination != nullptr && nl_addr_get_prefixlen(pDestination) != 0) || rtnl_route_get_nnexthops(pRoute) < 1) {
        return std::nullopt;
    }
    nl_addr* pGateway = rtnl_route_nh_get_gateway(rtnl_route_nexthop_n(pRoute, 0));
    if (pGateway == nullptr || nl_addr_get_len(pGateway) != sizeof(in_addr)) {
        return std::nullopt;
    }
    in_addr gateway = {};
    std::memcpy(&gateway, nl_addr_get_binary_addr(pGateway), sizeof(gateway));
    return gateway;
}

std::optional<in_addr> DefaultGateway() {
    const NetlinkSocket pSocket = Connect();
    nl_cache* pRaw = nullptr;
    if (!pSocket || rtnl_route_alloc_cache(pSocket.get(), AF_INET, 0, &pRaw) < 0) {
        return std::nullopt;
    }
    const Cache pRoutes(pRaw);
    std::optional<in_addr> best;
    uint32_t nBestMetric = UINT32_MAX;
    for (nl_object* pObject = nl_cache_get_first(pRoutes.get()); pObject != nullptr;
         pObject = nl_cache_get_next(pObject)) {
        auto* pRoute = reinterpret_cast<rtnl_route*>(pObject);
        const std::optional<in_addr> gateway = DefaultNextHop(pRoute);
        if (gateway && (!best || rtnl_route_get_priority(pRoute) < nBestMetric)) {
            best = gateway;
            nBestMetric = rtnl_route_get_priority(pRoute);
        }
    }
    return best;
}

bool CopyAddress(const in_addr& address, char* szText, int nSize) {
    char szAddress[INET_ADDRSTRLEN];
    inet_ntop(AF_INET, &address, szAddress, sizeof(szAddress));
    if (std::strlen(szAddress) >= static_cast<size_t>(nSize)) {
        return false;
    }
    std::snprintf(szText, static_cast<size_t>(nSize), "%s", szAddress);
    return true;
}

// The source address that the kernel would use towards a destination.
std::optional<in_addr> SourceTowards(const in_addr& peer) {
    const tavo::Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    sockaddr_in destination = {};
    destination.sin_family = AF_INET;
    destination.sin_port = htons(kAnyPort);
    destination.sin_addr = peer;
    sockaddr_in source = {};
    socklen_t nLength = sizeof(source);
    if (fd.Get() < 0 || connect(fd.Get(), reinterpret_cast<sockaddr*>(&destination), sizeof(destination)) != 0 ||
        getsockname(fd.Get(), reinterpret_cast<sockaddr*>(&source), &nLength) != 0) {
        return std::nullopt;
    }
    return source.sin_addr;
}

struct InterfaceAddress {
    in_addr address;
    in_addr mask;
    int nInterface;
};

// Calls fnSeen with every IPv4 address of the box; false when netlink failed.
template <typename Seen>
bool ForEachAddress(Seen fnSeen) {
    const NetlinkSocket pSocket = Connect();
    nl_cache* pRaw = nullptr;
    if (!pSocket || rtnl_addr_alloc_cache(pSocket.get(), &pRaw) < 0) {
        return false;
    }
    const Cache pAddresses(pRaw);
    for (nl_object* pObject = nl_cache_get_first(pAddresses.get()); pObject != nullptr;
         pObject = nl_cache_get_next(pObject)) {
        auto* pAddress = reinterpret_cast<rtnl_addr*>(pObject);
        nl_addr* pLocal = rtnl_addr_get_local(pAddress);
        if (pLocal == nullptr || nl_addr_get_family(pLocal) != AF_INET) {
            continue;
        }
        InterfaceAddress seen = {};
        std::memcpy(&seen.address, nl_addr_get_binary_addr(pLocal), sizeof(seen.address));
        const int nPrefix = rtnl_addr_get_prefixlen(pAddress);
        seen.mask.s_addr = nPrefix <= 0 ? 0 : htonl(UINT32_MAX << (32U - static_cast<unsigned>(nPrefix)));
        seen.nInterface = rtnl_addr_get_ifindex(pAddress);
        fnSeen(seen);
    }
    return true;
}

}  // namespace

int TAVONetDefaultGatewayGet(char* szGateway, int nSize) {
    return AtBorder(-1, [&] {
        if (szGateway == nullptr || nSize < 1) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const std::optional<in_addr> gateway = DefaultGateway();
        return gateway && CopyAddress(*gateway, szGateway, nSize) ? 0 : Fail(TLIBC_ERR_NOT_FOUND);
    });
}

int BlTLIBIsIpAddr(const char* szText) {
    unsigned char rgBytes[sizeof(in6_addr)];
    return szText != nullptr && (inet_pton(AF_INET, szText, rgBytes) == 1 || inet_pton(AF_INET6, szText, rgBytes) == 1)
               ? 1
               : 0;
}

int TAVONetLocalAddressGet(const char* szPeer, char* szLocal, int nSize, char* szInterface, int nInterfaceSize) {
    return AtBorder(-1, [&] {
        in_addr peer = {};
        if (szPeer == nullptr || szLocal == nullptr || nSize < 1 || inet_pton(AF_INET, szPeer, &peer) != 1) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const std::optional<in_addr> source = SourceTowards(peer);
        if (!source) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        int nInterface = 0;
        ForEachAddress([&](const InterfaceAddress& seen) {
            if (seen.address.s_addr == source->s_addr) {
                nInterface = seen.nInterface;
            }
        });
        char szName[IF_NAMESIZE] = {};
        if (szInterface != nullptr && (if_indextoname(static_cast<unsigned>(nInterface), szName) == nullptr ||
                                       std::strlen(szName) >= static_cast<size_t>(nInterfaceSize))) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        if (!CopyAddress(*source, szLocal, nSize)) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        if (szInterface != nullptr) {
            std::snprintf(szInterface, static_cast<size_t>(nInterfaceSize), "%s", szName);
        }
        return 0;
    });
}

int TAVONetIsSameSubnet(const char* szOne, const char* szOther, const char* szMask) {
    in_addr one = {};
    in_addr other = {};
    in_addr mask = {};
    if (szOne == nullptr || szOther == nullptr || szMask == nullptr || inet_pton(AF_INET, szOne, &one) != 1 ||
        inet_pton(AF_INET, szOther, &other) != 1 || inet_pton(AF_INET, szMask, &mask) != 1) {
        return Fail(TLIBC_ERR_BAD_PARAMETER);
    }
    return (one.s_addr & mask.s_addr) == (other.s_addr & mask.s_addr) ? 1 : 0;
}
