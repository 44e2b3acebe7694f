// Brings a router's table in line with the wanted mappings. Relies on a Router and nothing else.
// Promises: mappings of other hosts and of other programs are never touched; a mapping counts as there
// only when the router showed it; ends soon after fnStop answers true or the deadline has passed.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "daemons/common/Pass.h"
#include "upnp/Router.h"

namespace tavo {

// What was learnt about one router, kept between passes.
struct LeaseHabit {
    uint32_t nLease = 3600;        // seconds to ask for
    bool blPermanentOnly = false;  // it refuses leases
};

// Asks for one mapping, with its client set and the lease that the router is known to take.
int AddWithLease(Router& router, RouterMapping mapping, LeaseHabit& habit);

// rgWanted: with client addresses unset; szBox: the box's own address. blRenew: leases are due.
PassResult Reconcile(Router& router, const std::vector<RouterMapping>& rgWanted, const std::string& szBox,
                     LeaseHabit& habit, bool blRenew, const std::function<bool()>& fnStop);

// The text of a failure in the status file: the protocol's code, or "timeout", "unreachable", "garbage".
std::string CodeText(int nCode);
// A mapping that is not there, as the router's code has it.
Verdict Refusal(int nCode);

}  // namespace tavo
