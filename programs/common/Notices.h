// What has changed for a user since he was last told: a pure comparison of what a daemon remembers with what it
// knows now. Relies on nothing: no file, no clock, no network.
// Promises: the same trouble is told once, and its end once, also over a restart of the daemon; what changes all
// the time is told a few times an hour and no more; what a user did himself is no news.
#pragma once

#include <ctime>
#include <map>
#include <string>
#include <vector>

#include "programs/common/Published.h"

namespace tavo {

enum class Change {
    kPortLost,
    kPortRefused,
    kPortBack,
    kRouterGone,
    kRouterBack,
    kRouterReplaced,
    kAddressChanged,
    kRenewed  // the router had lost ports without being asked to; they are open again
};

struct Notice {
    Change enChange;
    std::string szText;                // what the message of the event log leaves open
    OutcomeList rgPorts = {};          // what it is about
    std::string szOutsideBefore = {};  // of kAddressChanged
};

// What a user has been told, and what was seen last.
struct Told {
    enum class Word { kNothing, kOpen, kRefused };
    struct Port {
        uint16_t nBoxPort = 0;
        PortState enSeen = PortState::kUnknown;
        std::string szWord = {};
        time_t nSince = 0;
        Word enTold = Word::kNothing;
    };
    std::map<std::string, Port> mapPorts;
    std::string szGateway;  // where the router last answered
    std::string szHardware;
    std::string szOutside;
    RouterState enRouter = RouterState::kNotAsked;
    time_t nRouterSince = 0;
    int nFailing = 0;          // passes in a row without the router; counted as far as it matters
    bool blGone = false;       // and told
    bool blWithdrawn = false;  // the daemon itself has taken its ports away since the last pass
    std::map<std::string, std::vector<time_t>> mapTimes;  // when each subject was told of
};

// Since when things are as they are: what is as it was before keeps its time.
void NoteSince(const Told& told, Published& now);
// The news, and what is remembered from now on. blRequested: a save or a start, which tells its caller itself what
// was refused.
std::vector<Notice> Compare(Told& told, const Published& now, bool blRequested);

}  // namespace tavo
