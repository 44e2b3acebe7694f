// The box's interfaces and their IPv4 addresses. Relies on getifaddrs.
// Promises: outputs untouched on failure; the order is that of the interfaces' numbers.
#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <memory>
#include <optional>
#include <vector>

#include "ground/Border.h"
#include "ground/Fail.h"
#include "tavo/net.h"

namespace {

constexpr int kAll = 1;
constexpr int kInUse = 2;

using tavo::AtBorder;
using tavo::Fail;

struct ListFree {
    void operator()(ifaddrs* pList) const { freeifaddrs(pList); }
};

struct NumberedCard {
    unsigned nInterface;
    TAVO_NET_CARD card;
};

bool IsOfKind(const ifaddrs& entry, int nKind) {
    const bool blInUse = (entry.ifa_flags & IFF_UP) != 0 && (entry.ifa_flags & IFF_LOOPBACK) == 0;
    return entry.ifa_addr != nullptr && entry.ifa_addr->sa_family == AF_INET && entry.ifa_netmask != nullptr &&
           (nKind == kAll || blInUse);
}

TAVO_NET_CARD CardOf(const ifaddrs& entry) {
    TAVO_NET_CARD card = {};
    // The name as the kernel has it; an address's label ("eth0:1") ends at the colon.
    std::snprintf(card.szName, sizeof(card.szName), "%.*s", static_cast<int>(std::strcspn(entry.ifa_name, ":")),
                  entry.ifa_name);
    inet_ntop(AF_INET, &reinterpret_cast<sockaddr_in*>(entry.ifa_addr)->sin_addr, card.szAddress,
              sizeof(card.szAddress));
    inet_ntop(AF_INET, &reinterpret_cast<sockaddr_in*>(entry.ifa_netmask)->sin_addr, card.szMask, sizeof(card.szMask));
    return card;
}

std::optional<std::vector<NumberedCard>> Cards(int nKind) {
    ifaddrs* pRaw = nullptr;
    if (getifaddrs(&pRaw) != 0) {
        return std::nullopt;
    }
    const std::unique_ptr<ifaddrs, ListFree> pList(pRaw);
    std::vector<NumberedCard> rgCards;
    for (const ifaddrs* pEntry = pList.get(); pEntry != nullptr; pEntry = pEntry->ifa_next) {
        if (IsOfKind(*pEntry, nKind)) {
            const TAVO_NET_CARD card = CardOf(*pEntry);
            rgCards.push_back({if_nametoindex(card.szName), card});
        }
    }
    std::stable_sort(rgCards.begin(), rgCards.end(), [](const NumberedCard& one, const NumberedCard& other) {
        return one.nInterface < other.nInterface;
    });
    return rgCards;
}

}  // namespace

int TLIBNetGetInterfaceInfo(TAVO_NET_CARD* rgCards, int nRoom, int nKind) {
    return AtBorder(-1, [&] {
        if (rgCards == nullptr || nRoom < 1 || (nKind != kAll && nKind != kInUse)) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const auto rgFound = Cards(nKind);
        if (!rgFound) {
            return Fail(TLIBC_ERR_READ);
        }
        const int nFilled = std::min(nRoom, static_cast<int>(rgFound->size()));
        for (int i = 0; i < nFilled; ++i) {
            rgCards[i] = (*rgFound)[static_cast<size_t>(i)].card;
        }
        return nFilled;
    });
}

int TAVONetGetCard1(int nIndex, TAVO_NET_CARD* pCard) {
    return AtBorder(-1, [&] {
        if (nIndex < 0 || pCard == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const auto rgFound = Cards(kInUse);
        if (!rgFound) {
            return Fail(TLIBC_ERR_READ);
        }
        if (static_cast<size_t>(nIndex) >= rgFound->size()) {
            return 0;
        }
        *pCard = (*rgFound)[static_cast<size_t>(nIndex)].card;
        return 1;
    });
}
