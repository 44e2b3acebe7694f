// See Wanted.h.
#include "mapping/Wanted.h"

#include <map>
#include <set>
#include <utility>

#include "ground/Marks.h"
#include "ground/PortText.h"
#include "ground/TextFile.h"
#include "mapping/Record.h"

namespace tavo {

namespace {

constexpr size_t kMaxDescription = 60;
constexpr size_t kMaxRuleText = 200;

// Nothing that separates keys from values, or starts a comment, in a key file.
std::string KeyText(const std::string& szText) {
    std::string szKey = PrintableText(szText, kMaxRuleText);
    for (char& c : szKey) {
        c = c == '=' || c == '#' ? '_' : c;
    }
    return szKey;
}

// What no router is asked for, under a name for the status file.
Outcome RefusedRule(const std::string& szName, const char* szWord, const RuleText& rule) {
    Outcome outcome{KeyText(szName), {PortState::kRefused, szWord}};
    outcome.szRule = RuleTitle(rule);
    return outcome;
}

// The port as the one rule asks for it, beside the same port, which another rule has.
Outcome Duplicate(const RouterMapping& mapping, const RuleText& rule) {
    Outcome outcome = RefusedRule(MappingName(mapping), "duplicate", rule);
    outcome.szProtocol = mapping.szProtocol;
    outcome.nRouterPort = mapping.nRouterPort;
    outcome.nBoxPort = mapping.nBoxPort;
    return outcome;
}

// Two outcomes of one name would be one to the status file and to the notices, and a change at every pass. So what
// is not asked for stands beside "5000/tcp" as "5000/tcp (web)", and next to that as "5000/tcp (web, 2)".
void NameApart(WantedSet& wanted) {
    std::set<std::string> setNames;
    for (const RouterMapping& mapping : wanted.rgMappings) {
        setNames.insert(MappingName(mapping));
    }
    for (Outcome& outcome : wanted.rgRefused) {
        const std::string szPlain = outcome.szName;
        for (int i = 1; !setNames.insert(outcome.szName).second; ++i) {
            outcome.szName = szPlain + " (" + KeyText(outcome.szRule) + (i == 1 ? "" : ", " + std::to_string(i)) + ")";
        }
    }
}

// Takes a rule's single mappings in; the first rule that asks for a port has it.
void AddRule(const RuleText& rule, const std::vector<SingleMapping>& rgSingles,
             std::map<MappingKey, uint16_t>& mapBoxPorts, WantedSet& wanted) {
    for (const SingleMapping& single : rgSingles) {
        RouterMapping mapping{
            single.szProtocol, single.nRouterPort, single.nBoxPort, "", MappingDescription(rule), 0, true};
        const auto [it, blNew] = mapBoxPorts.try_emplace(KeyOf(mapping), mapping.nBoxPort);
        if (blNew) {
            wanted.rgMappings.push_back(std::move(mapping));
            wanted.rgszRules.push_back(RuleTitle(rule));
        } else if (it->second != mapping.nBoxPort) {
            wanted.rgRefused.push_back(Duplicate(mapping, rule));
        }
    }
}

}  // namespace

WantedSet Expand(const std::vector<RuleText>& rgRules) {
    WantedSet wanted;
    std::map<MappingKey, uint16_t> mapBoxPorts;
    for (const RuleText& rule : rgRules) {
        const auto rgSingles = ExpandRule(rule.szProtocol, rule.szRouterPorts, rule.szBoxPorts);
        if (rgSingles) {
            AddRule(rule, *rgSingles, mapBoxPorts, wanted);
        }
        if (!rgSingles || MayBeCut(rule.szRouterPorts) || MayBeCut(rule.szBoxPorts)) {
            wanted.rgRefused.push_back(RefusedRule(RuleName(rule), rgSingles ? "cut" : "invalid", rule));
        }
    }
    NameApart(wanted);
    return wanted;
}

std::string MappingDescription(const RuleText& rule) {
    std::string szText = kOwnPrefix;
    for (const char c : rule.szService) {
        szText += c >= ' ' && c <= '~' ? c : '_';
    }
    return szText.substr(0, kMaxDescription);
}

std::string RuleTitle(const RuleText& rule) {
    return HarmlessText(rule.szService, kMaxRuleText);
}

std::string RuleName(const RuleText& rule) {
    return KeyText(rule.szRouterPorts + "/" + rule.szProtocol);
}

}  // namespace tavo
