// The rules as jobs for a manual router's pages: one for each single router port, one for each range.
// Relies on the rule file and on the description of the router's pages. Promises: never more jobs than the
// capacity check counted; a rule that the pages cannot take is named with the reason.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "mapping/Outcome.h"
#include "mapping/Router.h"
#include "tavo/portforward.h"

namespace tavo {

struct Job {
    RouterMapping mapping = {};  // with its client unset
    std::string szRule = {};     // as the user named it
};

// Whether both are the same forward; the names do not count.
bool IsSame(const RouterMapping& one, const RouterMapping& other);
// Whether one router cannot hold both.
bool Clash(const RouterMapping& one, const RouterMapping& other);

enum class RefusalKind {
    kForward,  // a forward, or a whole rule, that is not in place
    kRemoval,  // what we made earlier is still there
    kRun       // the run as a whole
};

struct Refusal {
    std::string szWhat;  // job, rule or concern as a user reads it
    std::string szWhy;
    Job job = {};  // no ports: it is about a whole rule, or about the run
    RefusalKind enKind = RefusalKind::kForward;
    bool blAnswered = true;             // false: the router did not answer, and nobody knows what it did
    std::optional<Holder> holder = {};  // who has the port
};

struct JobSet {
    std::vector<Job> rgJobs;
    std::vector<Refusal> rgRefusals;
    bool blReadable = true;  // false: the rule file could not be read, so nothing is known of what it asks
};

// The jobs of the enabled rules; pDescription: the sections that describe the router's pages.
JobSet ReadJobs(const TAVO_PF_CONF* pDescription);

}  // namespace tavo
