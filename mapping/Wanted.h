// What the rules ask of a router: single mappings, and the rules that cannot be taken apart. Relies on port lists as
// text; no file. Promises: the first rule that asks for a port has it; each outcome has a name of its own.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "mapping/Outcome.h"
#include "mapping/Router.h"

namespace tavo {

// A rule, as the user wrote it.
struct RuleText {
    std::string szService;  // that it is for, else the rule's number
    std::string szProtocol;
    std::string szRouterPorts;
    std::string szBoxPorts;
};

struct WantedSet {
    std::vector<RouterMapping> rgMappings;  // client and lease still to be filled
    std::vector<std::string> rgszRules;     // which rule asked for each of them
    // What no router is asked for, each under a name of its own: rules whose ports cannot be paired ("invalid"), what
    // may have lost its end ("cut"), and ports that an earlier rule sends to another port of the box ("duplicate").
    OutcomeList rgRefused;
    bool blReadable = true;
    bool blSwitchedOn = false;  // else nothing is wanted, whatever the rules say
    // Where it is not: what the rules ask of the other daemon; none where they cannot be read.
    std::optional<std::vector<RouterMapping>> rgOthers = {};
};

// Of the rules that are in force.
WantedSet Expand(const std::vector<RuleText>& rgRules);

// What a router keeps as the text of a rule's mappings: our mark, then the service's name or the rule's
// number; plain ASCII, which every router keeps.
std::string MappingDescription(const RuleText& rule);
// The service that a rule is for, else the rule's number, as text for a user.
std::string RuleTitle(const RuleText& rule);
// A rule as text for a user, and fit to be a key of the status file: no separator, no end of line in it.
std::string RuleName(const RuleText& rule);

}  // namespace tavo
