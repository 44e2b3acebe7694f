// Brings a router's table in line with the wanted mappings: looks, has every place decided, does it, looks again.
// Relies on a Router, a Record and the Plan. Promises: mappings of other hosts and of other programs are never
// touched; every mapping is on record before the router is asked for it; one counts as there only when the router
// showed it, and as gone only when the router says so; ends soon after fnStop answers true or the limit has passed.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "mapping/Pass.h"
#include "mapping/Record.h"
#include "mapping/Router.h"

namespace tavo {

// What was learnt about one router, kept between passes.
struct LeaseHabit {
    uint32_t nLease = 3600;        // seconds to ask for
    bool blPermanentOnly = false;  // it refuses leases
};

// Asks for one mapping, with its client set and the lease that the router is known to take; mapping.nLease is what it
// was given.
int AddWithLease(Router& router, RouterMapping& mapping, LeaseHabit& habit);

struct Surroundings {
    std::string szBox;               // the box's own address
    std::function<int64_t()> fnNow;  // seconds of boot time
    std::function<bool()> fnStop;
    std::function<void()> fnSave;  // puts the record where it survives us
};

// rgWanted: with client addresses unset. The result says when the next pass is due.
PassResult BringInLine(Router& router, const std::vector<RouterMapping>& rgWanted, Record& record, LeaseHabit& habit,
                       const Surroundings& around);

// The text of a failure in the status file: the protocol's code, or "timeout", "unreachable", "garbage".
std::string CodeText(int nCode);
// A mapping that is not there, as the router's code has it.
Verdict Refusal(int nCode);

}  // namespace tavo
