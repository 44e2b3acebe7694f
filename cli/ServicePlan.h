// What a service's request would come to: which of its ports open, which do not and why, and what becomes of
// the stored rules. Relies on the library's own merge, over what is handed in. Promises: the outcome is the merge's,
// rule by rule and port by port; nothing is changed.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "RuleStore.h"
#include "src/merge/UsedPorts.h"

namespace tavo::cli {

using Requests = std::vector<__tag_TAVO_PORTMAP_RULE>;

using lib::UsedPorts;  // what other hosts hold on the router

struct PortFate {
    std::string szPorts;
    std::string szProtocol;
    std::string szWhyNot;  // empty: they open
};

struct RuleFate {
    std::string szRule;  // id and name
    std::string szWhat;
};

struct ServicePlan {
    std::string szRefusal = {};  // why the request would fail as a whole; the rest is empty then
    std::vector<PortFate> rgPorts = {};
    std::vector<RuleFate> rgRules = {};
    Rules after = {};  // rule.conf, as it would be
    std::string szCut =
        {};  // whose list of ports would be longer there than a rule holds, and lose its end; empty: none
};

// rgStored: as the library's own reader gives them. used: nothing where the router is not asked.
ServicePlan MakePlan(const std::string& szService, const Requests& rgRequests,
                     const std::vector<__tag_TAVO_ROUTER_RULE>& rgStored, const std::optional<UsedPorts>& used);

// The protocol words of requests, in the order of their numbers.
extern const std::vector<std::string> kProtocolWords;

}  // namespace tavo::cli
