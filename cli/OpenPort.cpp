// Works on rules only. Relies on PortPairs. Promises: see OpenPort.h.
#include "OpenPort.h"

#include <fmt/format.h>

#include <algorithm>
#include <map>

namespace tavo::cli {

namespace {

// The rule in force that has each router port, with the box port that it leads to.
struct Owner {
    const Rule* pRule;
    int nBox;
};

std::map<std::string, Owner> OwnersOf(const Rules& rules) {
    std::map<std::string, Owner> mapOwners;
    for (const Rule& rule : rules) {
        const auto rgPairs = rule.blEnabled ? PairsOf(rule) : std::nullopt;
        for (const PortPair& pair : rgPairs.value_or(std::vector<PortPair>())) {
            mapOwners.try_emplace(pair.Name(), Owner{&rule, pair.nBox});
        }
    }
    return mapOwners;
}

}  // namespace

std::string NameOf(const Rule& rule) {
    return Clean(rule.szId) + (rule.szName.empty() ? "" : fmt::format(" ({})", Clean(rule.szName)));
}

Opening Open(const Rules& rules, const Rule& wanted) {
    const auto mapOwners = OwnersOf(rules);
    const auto fnIsThere = [&](const PortPair& pair) { return mapOwners.count(pair.Name()) > 0; };
    for (const PortPair& pair : PairsOf(wanted).value_or(std::vector<PortPair>())) {
        const auto it = mapOwners.find(pair.Name());
        if (it != mapOwners.end() && it->second.nBox != pair.nBox) {
            return {.szFault = fmt::format("router port {} leads to port {} of this box already, by rule {}; "
                                           "'sudo tavoportmap close {}' takes it away first",
                                           pair.Name(), it->second.nBox, NameOf(*it->second.pRule), pair.Name()),
                    .rules = rules};
        }
    }
    Opening opening{.rules = rules};
    const Rules missing = Without(wanted, fnIsThere);
    opening.blAlready = missing.empty();
    for (Rule rule : missing) {
        const auto pOff = std::find_if(opening.rules.begin(), opening.rules.end(), [&](Rule there) {
            there.szName = rule.szName;
            there.szServiceId = rule.szServiceId;
            there.blEnabled = !there.blEnabled;
            return IsSameContent(there, rule);
        });
        if (pOff != opening.rules.end()) {
            pOff->blEnabled = true;
            pOff->szName = rule.szName.empty() ? pOff->szName : rule.szName;
        } else {
            rule.szId = NextId(opening.rules);
            opening.rules.push_back(rule);
        }
    }
    return opening;
}

std::vector<PortPair> Close(Rules& rules, const std::function<bool(const Rule&, const PortPair&)>& fnGoes) {
    std::vector<PortPair> rgClosed;
    Rules left;
    for (const Rule& rule : rules) {
        if (!rule.blEnabled) {
            left.push_back(rule);
            continue;
        }
        Rules parts = Without(rule, [&](const PortPair& pair) {
            const bool blGoes = fnGoes(rule, pair);
            if (blGoes) {
                rgClosed.push_back(pair);
            }
            return blGoes;
        });
        for (size_t i = 0; i < parts.size(); ++i) {
            Rules others = rules;
            others.insert(others.end(), left.begin(), left.end());
            parts[i].szId = i == 0 ? rule.szId : NextId(others);
            left.push_back(parts[i]);
        }
    }
    rules = left;
    return rgClosed;
}

}  // namespace tavo::cli
