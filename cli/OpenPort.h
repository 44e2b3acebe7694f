// One port opened or closed in the rules, without a word to the router. Relies on nothing but the rules. Promises:
// what is asked for and nothing else changes; a rule that shares its ports with others keeps those.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "PortPairs.h"
#include "RuleStore.h"

namespace tavo::cli {

struct Opening {
    std::string szFault = {};  // why it cannot be, with what helps; the rules are as they were then
    bool blAlready = false;    // every port is in the rules already
    Rules rules = {};
};
// rules with wanted in force; a rule that was switched off and forwards just this is switched on.
Opening Open(const Rules& rules, const Rule& wanted);

// rules without the ports in force for which fnGoes is true; what that closed.
std::vector<PortPair> Close(Rules& rules, const std::function<bool(const Rule&, const PortPair&)>& fnGoes);

// "8 (shop)", cleaned.
std::string NameOf(const Rule& rule);

}  // namespace tavo::cli
