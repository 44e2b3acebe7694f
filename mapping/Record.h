// What this box has made at routers, or may have made: the memory that tells our mappings from everybody else's.
// Relies on a text that it is given and hands back; no file, no clock.
// Promises: a row goes only when the router has shown that the mapping is gone, or when its lease has surely ended;
// a text that is damaged loses the rows that cannot be read, and no other.
#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "ground/Marks.h"
#include "mapping/Router.h"

namespace tavo {

// A place in a router's table.
using MappingKey = std::pair<std::string, uint16_t>;  // the entry's protocol and first port of the router

inline MappingKey KeyOf(const RouterMapping& mapping) {
    return {mapping.szProtocol, mapping.nRouterPort};
}

// A router is its hardware where that is known, whatever address it has; else its address.
struct RouterName {
    std::string szGateway;
    std::string szHardware;
    std::string szLine = {};  // which of its lines, each with a table of its own, where it has several

    bool operator==(const RouterName& other) const = default;
    // One that says nothing of a line may be any of them.
    bool IsSame(const RouterName& other) const {
        const bool blOne = szHardware.empty() || other.szHardware.empty() ? szGateway == other.szGateway
                                                                          : szHardware == other.szHardware;
        return blOne && (szLine.empty() || szLine == other.szLine);
    }
};

// Where a mapping leads.
struct Target {
    std::string szClient;
    uint16_t nBoxPort = 0;  // 0: nowhere

    bool operator==(const Target& other) const = default;
};

// One mapping of ours.
struct Made {
    std::string szClient;  // the box's own address when it was made
    uint16_t nBoxPort = 0;
    std::string szText;     // as the router shows it; until then, as it was given
    bool blShown = false;   // else it was asked for, or for a change of it, and may not be there
    uint32_t nLease = 0;    // seconds from nAsked; 0: until the router restarts
    int64_t nAsked = 0;     // seconds of boot time; of an earlier boot: 0
    bool blBefore = false;  // asked for before this boot, or doubtful for another reason: to be asked for anew
    // Where else it may lead: a change was asked for, or what was there before was taken away, and what came of that
    // was not shown.
    Target other = {};
    std::string szHardware = {};  // of the router that it was made at, where the one in front does not show its own
    uint16_t nMore = 0;           // of a range

    bool operator==(const Made& other) const = default;
    // Whether an entry at its place is this one. Routers rewrite texts: until it is shown, what it leads to will do, or
    // our mark. A text that the router gives to everybody's says nothing.
    bool IsEntry(const RouterMapping& entry) const {
        const bool blPort = entry.nBoxPort == nBoxPort && entry.nMore == nMore;
        const bool blText = entry.szDescription == szText;
        const bool blMark = blText && szText.starts_with(kOwnPrefix);
        const bool blThis = entry.szClient == szClient && (blShown ? blPort && blText : blPort || blMark);
        const bool blOther = !blShown && entry.szClient == other.szClient && entry.nBoxPort == other.nBoxPort;
        return blThis || blOther;
    }
    bool IsDue(int64_t nNow) const { return blBefore || (nLease != 0 && nNow - nAsked >= nLease / 2); }
    // Boot time at which the router has ended it by itself; -1: never, or nobody knows.
    int64_t End() const { return nLease == 0 ? -1 : nAsked + nLease; }
    // Whether its lease has surely ended. What a router has not shown may have been made without one: some refuse
    // leases, and the answer may be lost. blLeases: not this one.
    bool IsSurelyOver(int64_t nNow, bool blLeases = false) const {
        return (blShown || blLeases) && End() >= 0 && nNow > End() + kSurely;
    }

    // Whether the router may have it and only not show it yet.
    bool MayShowLate(int64_t nNow) const { return !blShown && !blBefore && nNow - nAsked <= kShows; }

    static constexpr int64_t kSurely = 60;  // seconds after its end until a lease is believed to have ended
    static constexpr int64_t kShows = 20;   // seconds until a router shows what it has
};

// What goes on record of a mapping that was asked for at that time; and back, with so many seconds of its lease left.
Made RowOf(const RouterMapping& mapping, bool blShown, int64_t nAsked);
RouterMapping MappingOf(const MappingKey& key, const Made& made, uint32_t nLeft);

class Record {
public:
    using Rows = std::map<MappingKey, Made>;
    // szText: what the last Text() was, empty for none. szBoot: what tells this boot from every other one.
    Record(std::string_view szText, std::string szBoot);
    bool operator==(const Record& other) const = default;

    // The rows of one router, to be read and changed; those of the others wait.
    void TurnTo(const RouterName& router);
    const RouterName& Router() const { return mRouter; }
    Rows& Here() { return mHere; }
    const Rows& Here() const { return mHere; }

    // The other lines of this router that have rows.
    std::set<std::string> OtherLines() const;
    // Whether anything is known of this router, at whichever line.
    bool HasRows() const { return !mHere.empty() || !OtherLines().empty(); }
    // Drops the rows of other routers that have surely run out.
    void Prune(int64_t nNow, bool blLeases = false);
    // Nothing that this router once granted counts any more: all of it is due.
    void Doubt();
    // This router has lost all that it had: ours is to be made anew, and what led to an address that the box had before
    // is gone.
    void Lose(const std::string& szBox);
    std::string Text() const;

private:
    struct Elsewhere {
        RouterName router;
        MappingKey key;
        Made made;

        bool operator==(const Elsewhere& other) const = default;
    };

    RouterName NameOf(const Made& made) const {
        return {mRouter.szGateway, made.szHardware.empty() ? mRouter.szHardware : made.szHardware, mRouter.szLine};
    }

    std::string mSzBoot;
    RouterName mRouter;
    Rows mHere;
    std::vector<Elsewhere> mRgElsewhere;
};

}  // namespace tavo
