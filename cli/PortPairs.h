// Rules taken apart into single ports and put together again. Relies on nothing but the rules' texts.
// Promises: the n-th router port goes with the n-th box port; what cannot be paired is nothing.
#pragma once

#include <compare>
#include <optional>
#include <string>
#include <vector>

#include "RuleStore.h"

namespace tavo::cli {

// One port of the router and where it leads to.
struct PortPair {
    std::string szProtocol;  // "tcp" or "udp"
    int nRouter = 0;
    int nBox = 0;
    auto operator<=>(const PortPair&) const = default;

    std::string Name() const { return std::to_string(nRouter) + "/" + szProtocol; }
};

// "tcp" and "udp" for "all".
std::vector<std::string> ProtocolsOf(const std::string& szProtocol);
// Nothing when the ports of the rule cannot be read or paired.
std::optional<std::vector<PortPair>> PairsOf(const Rule& rule);
// Of all rules that are switched on.
std::vector<PortPair> PairsOf(const Rules& rules);

// "80,443,5000-5010", in the order of rgPorts; runs that rise are shortened.
std::string PortsText(const std::vector<int>& rgPorts);

// The rule without the ports for which fnGoes answers true, in as many rules as that takes (a rule for both
// protocols may have to become one of each). Empty when nothing is left.
template <typename Function>
Rules Without(const Rule& rule, Function fnGoes) {
    const auto rgRouter = ParsePorts(rule.szRouterPorts);
    const auto rgBox = ParsePorts(rule.szBoxPorts);
    if (!rgRouter || !rgBox || rgRouter->size() != rgBox->size()) {
        return {rule};
    }
    Rules rules;
    for (const std::string& szProtocol : ProtocolsOf(rule.szProtocol)) {
        std::vector<int> rgLeftRouter, rgLeftBox;
        for (size_t i = 0; i < rgRouter->size(); ++i) {
            if (!fnGoes(PortPair{szProtocol, (*rgRouter)[i], (*rgBox)[i]})) {
                rgLeftRouter.push_back((*rgRouter)[i]);
                rgLeftBox.push_back((*rgBox)[i]);
            }
        }
        Rule left = rule;
        left.szProtocol = szProtocol;
        left.szRouterPorts = PortsText(rgLeftRouter);
        left.szBoxPorts = PortsText(rgLeftBox);
        if (rgLeftRouter.size() == rgRouter->size()) {  // its text stays as the user wrote it
            left.szRouterPorts = rule.szRouterPorts;
            left.szBoxPorts = rule.szBoxPorts;
        }
        if (!rgLeftRouter.empty()) {
            rules.push_back(left);
        }
    }
    if (rules.size() == 2 && rules[0].szRouterPorts == rules[1].szRouterPorts) {
        rules.pop_back();
        rules[0].szProtocol = rule.szProtocol;
    }
    return rules;
}

}  // namespace tavo::cli
