// Gathers what is so. Relies on the library, the seam and getifaddrs. Promises: see Situation.h.
#include "Situation.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <netinet/in.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <memory>

#include "Pages.h"
#include "tavo/core.h"
#include "tavo/net.h"

namespace tavo::cli {

namespace {

constexpr char kRuleFile[] = "/etc/portforward/rule.conf";
constexpr char kRouterFile[] = "/etc/portforward/router.conf";
constexpr char kSystemFile[] = "/etc/tavoinfo.conf";
constexpr int64_t kLateSeconds = 240;  // the longest that a pass may take after the moment that it was due

// There, and not for this user.
bool IsHidden(const char* szPath) {
    return access(szPath, R_OK) != 0 && errno == EACCES;
}

bool IsKeyOn(const char* szKey) {
    char szValue[8] = {};
    return TLIBCFileGetKeyValue(kSystemFile, szKey, szValue, sizeof(szValue), 0) >= 1 &&
           std::strcmp(szValue, "yes") == 0;
}

StoredRules ReadStoredRules() {
    StoredRules rules{.blHidden = IsHidden(kRuleFile)};
    if (!rules.blHidden) {
        rules.inForce = LoadRules();
        rules.blDraft = HasDraft();
        rules.draft = rules.blDraft ? LoadDraft() : std::nullopt;
        rules.off = LoadOff();
        rules.blOffUnreadable = IsOffUnreadable();
    }
    return rules;
}

std::optional<DetectResult> ReadDetected() {
    DetectResult result = {};
    const bool blComplete = TLibGetRouterDetectResult(&result) == 0;
    // A router whose limit is unknown fails the call; what was found is there all the same.
    const bool blFound = blComplete || WayOf(result) == Way::kUpnp || WayOf(result) == Way::kNatpmp;
    const bool blEmpty = WayOf(result) == Way::kUnknown && *result.szBrand == '\0';
    return blFound && !blEmpty ? std::optional(result) : std::nullopt;
}

std::string GlobalIpv6() {
    ifaddrs* pList = nullptr;
    if (getifaddrs(&pList) != 0) {
        return "";
    }
    const std::unique_ptr<ifaddrs, decltype(&freeifaddrs)> pOwned(pList, &freeifaddrs);
    for (const ifaddrs* p = pList; p != nullptr; p = p->ifa_next) {
        if (p->ifa_addr == nullptr || p->ifa_addr->sa_family != AF_INET6) {
            continue;
        }
        sockaddr_in6 address = {};
        std::memcpy(&address, p->ifa_addr, sizeof(address));
        char szText[INET6_ADDRSTRLEN] = {};
        const bool blGlobal = (address.sin6_addr.s6_addr[0] & 0xe0) == 0x20;  // 2000::/3
        if (blGlobal && inet_ntop(AF_INET6, &address.sin6_addr, szText, sizeof(szText)) != nullptr) {
            return szText;
        }
    }
    return "";
}

void LookAt(Daemon& daemon, const char* szRunKey, bool blAlive) {
    daemon.blSwitchedOn = IsKeyOn(szRunKey);
    daemon.unit = ReadUnit(daemon.szName);
    daemon.published = ReadPublished(daemon.szName);
    // While a compatibility test runs the library takes its daemon for the other one.
    daemon.blAlive = blAlive || daemon.published;
}

void AskRouter(Situation& situation) {
    if (situation.Keeper() == &situation.natpmpd) {
        situation.szNotAsked = "a NAT-PMP router cannot be asked what it has; this is what it granted to natpmpd";
    } else if (situation.IsByPages()) {
        situation.szNotAsked = "what stands in a router's own pages is not read back; this is what they took";
    } else if (situation.szGateway) {
        situation.blAsked = true;
        situation.live = ReadLiveTable();
    }
}

}  // namespace

bool Daemon::IsLate(int64_t nNow) const {
    // A word from the future was said before the clock was set; it says nothing about its age.
    return published && published->nNextLook && published->nAt <= nNow && nNow > *published->nNextLook + kLateSeconds;
}

const Daemon* Situation::Keeper() const {
    return natpmpd.blSwitchedOn ? &natpmpd : upnpd.blSwitchedOn ? &upnpd : nullptr;
}

const Published* Situation::Word() const {
    const Daemon* pKeeper = Keeper();
    const auto& published = pKeeper != nullptr ? pKeeper->published : pages;
    const bool blCounts = pKeeper != nullptr ? pKeeper->blAlive : IsByPages();
    return blCounts && published ? &*published : nullptr;
}

std::vector<PublishedLeftOver> Situation::LeftOver() const {
    const Published* pWord = Word();
    auto rgLeftOver = pWord != nullptr ? pWord->rgLeftOver : std::vector<PublishedLeftOver>();
    for (const Daemon* pDaemon : {&upnpd, &natpmpd}) {  // of one that has ended, what it could not take away
        if (pDaemon->published && &*pDaemon->published != pWord) {
            const auto& rgMore = pDaemon->published->rgLeftOver;
            rgLeftOver.insert(rgLeftOver.end(), rgMore.begin(), rgMore.end());
        }
    }
    if (pagesLeft) {
        rgLeftOver.insert(rgLeftOver.end(), pagesLeft->rgLeftOver.begin(), pagesLeft->rgLeftOver.end());
    }
    return rgLeftOver;
}

Reach ReachOf(const std::string& szAddress) {
    in_addr address = {};
    if (inet_pton(AF_INET, szAddress.c_str(), &address) != 1) {
        return Reach::kUnknown;
    }
    const uint32_t nHost = ntohl(address.s_addr);
    const auto fnIn = [nHost](uint32_t nNet, int nBits) { return (nHost >> (32 - nBits)) == (nNet >> (32 - nBits)); };
    if (fnIn(0x64400000, 10)) {
        return Reach::kCarrier;
    }
    const bool blPrivate = fnIn(0x0a000000, 8) || fnIn(0xac100000, 12) || fnIn(0xc0a80000, 16) ||
                           fnIn(0xa9fe0000, 16) || fnIn(0x7f000000, 8) || nHost == 0;
    return blPrivate ? Reach::kPrivate : Reach::kPublic;
}

const char* ToWord(Reach enReach) {
    constexpr const char* kWords[] = {"unknown", "public", "private", "carrier"};
    return kWords[static_cast<size_t>(enReach)];
}

std::string ReachCaveat(Reach enReach) {
    switch (enReach) {
        case Reach::kPrivate:
            return "which is a private one: another router stands between this one and the Internet, and has to "
                   "forward the ports, too";
        case Reach::kCarrier:
            return "which is the provider's own: nobody outside reaches it; ask the provider for a public address";
        default:
            return "";
    }
}

Situation LookAround(bool blLive) {
    Situation situation;
    situation.nNow = std::time(nullptr);
    situation.szGateway = Gateway();
    char szBox[INET_ADDRSTRLEN] = {};
    if (situation.szGateway &&
        TAVONetLocalAddressGet(situation.szGateway->c_str(), szBox, sizeof(szBox), nullptr, 0) == 0) {
        situation.szBox = szBox;
    }
    situation.szIpv6 = GlobalIpv6();
    situation.blSettingsHidden = IsHidden(kRouterFile);
    if (!situation.blSettingsHidden) {
        situation.settings = ReadStoredRouter();
    }
    situation.detected = ReadDetected();
    LookAt(situation.upnpd, "runupnpportmapping", UpnpDaemon().IsAlive());
    LookAt(situation.natpmpd, "runnatpmpportmapping", NatpmpDaemon().IsAlive());
    situation.pages = PagesWord(true);
    if (!situation.IsByPages()) {
        situation.pagesLeft = LeftByPages();
    }
    situation.rules = ReadStoredRules();
    situation.running = WhatRuns();
    if (blLive) {
        AskRouter(situation);
    }
    return situation;
}

}  // namespace tavo::cli
