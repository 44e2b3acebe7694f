// Everything that "status" speaks of, as it is at one moment. Relies on the library's readers, the published state,
// the system and, where it is asked to, the router itself. Promises: waits for nobody but the router; what this user
// may not read is told apart from what is not there.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "LiveTable.h"
#include "Published.h"
#include "RuleStore.h"
#include "StoredRouter.h"
#include "Unit.h"
#include "Verdict.h"

namespace tavo::cli {

// One of the two daemons.
struct Daemon {
    const char* szName;
    const char* szProtocol;
    bool blSwitchedOn = false;  // its run key
    bool blAlive = false;
    std::optional<UnitState> unit = {};
    std::optional<Published> published = {};

    // It should have looked at the router long ago.
    bool IsLate(int64_t nNow) const;
};

struct StoredRules {
    bool blHidden = false;  // this user may not read them
    std::optional<Rules> inForce = {};
    bool blDraft = false;
    std::optional<Rules> draft = {};
    std::optional<Rules> off = {};  // what 'off' switched off
    bool blOffUnreadable = false;   // it did, and what cannot be read any more
};

// What an address on the router's other side says of the way beyond: another translation where it is a private one
// or a provider's own (100.64.0.0/10).
enum class Reach { kUnknown, kPublic, kPrivate, kCarrier };
Reach ReachOf(const std::string& szAddress);
const char* ToWord(Reach enReach);
// What that means for who calls from outside; empty for a public one.
std::string ReachCaveat(Reach enReach);

struct Situation {
    int64_t nNow = 0;
    std::optional<std::string> szGateway;
    std::string szBox;                     // this box's address towards it
    std::string szIpv6;                    // a global address of this box; empty without one
    bool blSettingsHidden = false;         // this user may not read them
    StoredRouter settings;                 // those that a save goes by
    std::optional<DetectResult> detected;  // the last detection
    Daemon upnpd{"upnpd", "UPnP"};
    Daemon natpmpd{"natpmpd", "NAT-PMP"};
    std::optional<Published> pages;      // what tavoportforward came to, when it last wrote the rules
    std::optional<Published> pagesLeft;  // what the router's pages still forward although they are not in use
    StoredRules rules;
    Running running;
    bool blAsked = false;    // --live: the router was asked
    std::string szNotAsked;  // why not, although it should have been
    std::optional<LiveTable> live;

    // The daemon whose run key is on; none for a router that is driven through its pages, and where nobody may map.
    const Daemon* Keeper() const;
    bool IsByPages() const { return Keeper() == nullptr && settings.blAny && settings.enWay == Way::kManual; }
    // What is known of the mappings: the keeper's word, or that of the pages.
    const Published* Word() const;
    // What no rule asks for and the router still has: by that word, and by that of a daemon that is switched off and
    // has not been able to take away what it made; and what its pages forward that are not in use.
    std::vector<PublishedLeftOver> LeftOver() const;
    // The router's address on its other side; empty where nobody has said it.
    std::string Outside() const { return Word() == nullptr ? "" : Word()->szOutside; }
};

Situation LookAround(bool blLive);

}  // namespace tavo::cli
