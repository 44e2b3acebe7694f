// Decides what is to be done about one place in a router's table, and why. Relies on nothing: no socket, no file, no
// clock. It is decided here, and nowhere else, whose a mapping is, when it is renewed and what is in its way.
#pragma once

#include <cstdint>
#include <string>

#include "mapping/Record.h"
#include "mapping/Router.h"

namespace tavo {

enum class Seen {
    kUnknown,  // nobody has looked
    kHidden,   // the router does not say
    kAbsent,
    kPresent
};

// All that is known of a place. A null pointer: there is none.
struct PlaceView {
    const RouterMapping* pWanted = nullptr;
    Seen enSeen = Seen::kUnknown;
    const RouterMapping* pEntry = nullptr;  // where it is present
    const Made* pMade = nullptr;            // our record of it
};

enum class Action {
    kNothing,  // it is no concern of ours
    kLook,     // ask the router for this place
    kKeep,     // ours, and as it is to be
    kLeave,    // somebody else's on this box, and it does what is wanted
    kAdd,
    kRenew,    // in place: what goes through it goes on
    kChange,   // in place, where the router lets us; else take away and add
    kReplace,  // take away, then add
    kRemove,
    kForget,   // our record is out of date
    kInTheWay  // the place is another host's or program's
};

struct Step {
    Action enAction = Action::kNothing;
    const char* szWhy = "";  // for the log; of kLeave and kInTheWay, which end in what is said of a port, for users too
};

// Whether an entry is ours: by our record, or by our mark and our address.
bool IsOurs(const RouterMapping& entry, const Made* pMade, const std::string& szBox);
// Whether an entry leads where it is wanted to.
bool Serves(const RouterMapping& entry, const RouterMapping& wanted, const std::string& szBox);

// nNow: seconds of boot time.
// what: the router can do.
Step Decide(const PlaceView& view, const std::string& szBox, int64_t nNow, const Abilities& what = {});

}  // namespace tavo
