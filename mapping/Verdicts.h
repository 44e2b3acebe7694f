// What there is to say of each place, and when it is to be looked at again. Relies on what the pass knows.
// Promises: nothing is said to be open that the router did not show or grant; every mapping of ours that no rule asks
// for and that may still be there is named.
#pragma once

#include <vector>

#include "mapping/Places.h"

namespace tavo {

// A mapping that the router showed.
Verdict Open(Places& places, const Place& place);
// A mapping that cannot be made because of another entry, and whose that is. szWhy: the plan's reason, where it has
// one.
Verdict InTheWay(const Places& places, const RouterMapping& entry, const char* szWhy = "");
// Ours, and the router does not take it away: from whom it belongs to, which this box is no more, until its lease ends.
Verdict StillHeld(Places& places, const Place& place, const RouterReply& reply);

// The pass as a whole. applied: whether what was done has taken effect.
PassResult Conclude(Places& places, const std::vector<RouterMapping>& rgWanted, const RouterReply& applied);

}  // namespace tavo
