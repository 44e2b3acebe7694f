// Reads and refreshes one row of the kernel's table of neighbours. Relies on libnl-route-3.
// Promises: see Neighbour.h.
#include "ground/net/Neighbour.h"

#include <arpa/inet.h>
#include <netlink/route/neighbour.h>
#include <poll.h>
#include <sys/socket.h>

#include <array>
#include <chrono>
#include <cstring>

#include "ground/Descriptor.h"
#include "ground/net/Netlink.h"

namespace tavo {

namespace {

constexpr auto kProbeLimit = std::chrono::seconds(4);  // the kernel asks three times, a second apart
constexpr int kPollMilliseconds = 50;
constexpr uint16_t kDiscardPort = 9;
constexpr size_t kEthernetSize = 6;

struct NeighbourFree {
    void operator()(rtnl_neigh* pNeighbour) const { rtnl_neigh_put(pNeighbour); }
};
using Neighbour = std::unique_ptr<rtnl_neigh, NeighbourFree>;

// The row of an address; null when there is none.
Neighbour Find(nl_sock* pSocket, const in_addr& address) {
    nl_cache* pRaw = nullptr;
    if (rtnl_neigh_alloc_cache(pSocket, &pRaw) < 0) {
        return nullptr;
    }
    const Cache pNeighbours(pRaw);
    for (nl_object* pObject = nl_cache_get_first(pNeighbours.get()); pObject != nullptr;
         pObject = nl_cache_get_next(pObject)) {
        auto* pNeighbour = reinterpret_cast<rtnl_neigh*>(pObject);
        nl_addr* pAddress = rtnl_neigh_get_dst(pNeighbour);
        if (pAddress != nullptr && nl_addr_get_family(pAddress) == AF_INET &&
            nl_addr_get_len(pAddress) == sizeof(address) &&
            std::memcmp(nl_addr_get_binary_addr(pAddress), &address, sizeof(address)) == 0) {
            nl_object_get(pObject);
            return Neighbour(pNeighbour);
        }
    }
    return nullptr;
}

int StateOf(const Neighbour& pNeighbour) {
    return pNeighbour == nullptr ? NUD_NONE : rtnl_neigh_get_state(pNeighbour.get());
}

// What the kernel once learnt is looked at again; what it does not know it asks for when something is to be sent.
void Ask(nl_sock* pSocket, const Neighbour& pKnown, const in_addr& address) {
    const int nState = StateOf(pKnown);
    if ((nState & (NUD_REACHABLE | NUD_STALE | NUD_DELAY)) != 0) {
        rtnl_neigh_unset_state(pKnown.get(), nState);
        rtnl_neigh_set_state(pKnown.get(), NUD_PROBE);
        rtnl_neigh_add(pSocket, pKnown.get(), NLM_F_REPLACE);
        return;
    }
    const Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_in to = {};
    to.sin_family = AF_INET;
    to.sin_port = htons(kDiscardPort);
    to.sin_addr = address;
    sendto(fd.Get(), nullptr, 0, 0, reinterpret_cast<const sockaddr*>(&to), sizeof(to));
}

}  // namespace

std::string HardwareAddress(const std::string& szAddress) {
    in_addr address = {};
    const NetlinkSocket pSocket = Connect();
    if (pSocket == nullptr || inet_pton(AF_INET, szAddress.c_str(), &address) != 1) {
        return "";
    }
    const Neighbour pNeighbour = Find(pSocket.get(), address);
    nl_addr* pHardware = pNeighbour == nullptr ? nullptr : rtnl_neigh_get_lladdr(pNeighbour.get());
    if (pHardware == nullptr || nl_addr_get_len(pHardware) != kEthernetSize) {
        return "";
    }
    std::array<char, 32> szText = {};
    return nl_addr2str(pHardware, szText.data(), szText.size());
}

bool IsOwnAddress(const std::string& szAddress) {
    const Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    sockaddr_in own = {};
    own.sin_family = AF_INET;
    return inet_pton(AF_INET, szAddress.c_str(), &own.sin_addr) == 1 && own.sin_addr.s_addr != INADDR_ANY &&
           bind(fd.Get(), reinterpret_cast<const sockaddr*>(&own), sizeof(own)) == 0;
}

bool IsNeighbourThere(const std::string& szAddress, const std::function<bool()>& fnStop) {
    in_addr address = {};
    const NetlinkSocket pSocket = Connect();
    if (pSocket == nullptr || inet_pton(AF_INET, szAddress.c_str(), &address) != 1) {
        return true;
    }
    const auto end = std::chrono::steady_clock::now() + kProbeLimit;
    Ask(pSocket.get(), Find(pSocket.get(), address), address);
    while (std::chrono::steady_clock::now() < end && !fnStop()) {
        const int nState = StateOf(Find(pSocket.get(), address));
        if ((nState & NUD_FAILED) != 0) {
            return false;
        }
        if ((nState & (NUD_INCOMPLETE | NUD_PROBE)) == 0) {
            return true;  // it answered, or the link has no such question, as one to a single peer
        }
        poll(nullptr, 0, kPollMilliseconds);
    }
    return true;
}

}  // namespace tavo
