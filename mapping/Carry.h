// Brings a router's table in line with the wanted mappings: looks, has every place decided, does it, looks again.
// Relies on a Router, a Record and the Plan. Promises: mappings of other hosts and of other programs are never
// touched; every mapping is on record before the router is asked for it, and what cannot be put there is not asked for,
// while what stands there is renewed; one counts as there only when the router
// showed it (or granted it, where it cannot show any), and as gone only when the router says so; ends soon after fnStop
// answers true or the limit has passed.
#pragma once

#include <functional>
#include <map>
#include <string>
#include <vector>

#include "mapping/Pass.h"
#include "mapping/Plan.h"
#include "mapping/Record.h"
#include "mapping/Router.h"

namespace tavo {

// What was learnt about one router, kept between passes.
struct Habits {
    uint32_t nLease = 3600;        // seconds to ask for
    bool blPermanentOnly = false;  // it refuses leases
    // Places that it gave another one instead of, each with its word. Each asking opens a wrong port for a moment: they
    // are not asked for again while they stand here.
    std::map<MappingKey, std::string> mapElsewhere = {};
    MappingKey next = {};  // where to go on, after a pass that its time was too short for
};

// Asks for one mapping, with its client set and the lease that the router is known to take; mapping.nLease is what it
// was given.
RouterReply AddWithLease(Router& router, RouterMapping& mapping, Habits& habit);

struct Surroundings {
    std::string szBox;               // the box's own address
    std::function<int64_t()> fnNow;  // seconds of boot time
    std::function<bool()> fnStop;
    std::function<bool()> fnSave;  // puts the record where it survives us; whether it is there
    // Is told of each step that changes something at the router, and why.
    std::function<void(const RouterMapping&, const Step&)> fnTell = [](const RouterMapping&, const Step&) {};
};

// rgWanted: with client addresses unset. The result says when the next pass is due.
PassResult BringInLine(Router& router, const std::vector<RouterMapping>& rgWanted, Record& record, Habits& habit,
                       const Surroundings& around);

// A mapping that is not there, as the router has it. kOk: it was not asked for.
Verdict RefusedBy(const RouterReply& reply);

}  // namespace tavo
