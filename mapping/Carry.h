// Brings a router's table in line with the wanted mappings: looks, has every place decided, does it, looks again.
// Relies on a Router, a Record and the Plan. Promises: mappings of other hosts and of other programs are never
// touched; every mapping is on record before the router is asked for it, and what cannot be put there is not asked for,
// while what stands there is renewed; one counts as there only when the router
// showed it (or granted it, where it cannot show any), and as gone only when the router says so; ends soon after fnStop
// answers true or the limit has passed.
#pragma once

#include <string>
#include <vector>

#include "mapping/Pass.h"

namespace tavo {

// Of what a router granted that shows nothing, before it is asked: drops what no longer counts. blRestarted: it has
// lost all that it had; blDoubtful: it may have.
void Forget(Record& record, Habits& habit, const std::string& szBox, bool blRestarted, bool blDoubtful, int64_t nNow);

// Asks for one mapping, with its client set and the lease that the router is known to take; mapping.nLease is what it
// was given.
RouterReply AddWithLease(Router& router, RouterMapping& mapping, Habits& habit);

// rgWanted: with client addresses unset. The result says when the next pass is due.
PassResult BringInLine(Router& router, const std::vector<RouterMapping>& rgWanted, Record& record, Habits& habit,
                       const Surroundings& around);

// What is on record, wanted by no rule, and may be there still: for a router that cannot be asked for anything, and
// why.
OutcomeList LeftOnRecord(const Record& record, const std::vector<RouterMapping>& rgWanted, const Abilities& what,
                         const RouterReply& why, int64_t nNow);

}  // namespace tavo
