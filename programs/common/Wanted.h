// What the rules ask of the router: single mappings, and the rules that cannot be taken apart.
// Relies on the rule file and the run key. Promises: an unreadable rule file is told apart from an
// empty one, so that nothing is taken away because of it.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "mapping/Outcome.h"
#include "mapping/Router.h"
#include "tavo/portforward.h"

namespace tavo {

struct WantedSet {
    std::vector<RouterMapping> rgMappings;  // client and lease still to be filled
    // What no router is asked for, each under a name of its own: rules whose ports cannot be paired ("invalid"), what
    // may have lost its end ("cut"), and ports that an earlier rule sends to another port of the box ("duplicate").
    OutcomeList rgRefused;
    std::map<std::string, std::string> mapRules;  // which rule asked for a mapping, by the mapping's name
    bool blReadable = true;
    bool blSwitchedOn = false;  // else nothing is wanted, whatever the rules say
};

// Whether szRunKey of the system settings is "yes".
bool IsRunKeyOn(const char* szRunKey);

// Nothing when szRunKey of the system settings is not "yes".
WantedSet ReadWanted(const char* szRunKey);

// What a router keeps as the text of a rule's mappings: our mark, then the service's name or the rule's
// number; plain ASCII, which every router keeps.
std::string MappingDescription(const TAVO_PF_CONF* pRule);
// The service that a rule is for, else the rule's number, as text for a user.
std::string RuleTitle(const TAVO_PF_CONF* pRule);
// A rule as text for a user, and fit to be a key of the status file: no separator, no end of line in it.
std::string RuleName(const TAVO_PF_CONF* pRule);

}  // namespace tavo
