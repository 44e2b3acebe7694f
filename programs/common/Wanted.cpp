// Reads the run key and the rule file. Relies on the platform's port-forward library and PortText.
// Promises: see Wanted.h.
#include "programs/common/Wanted.h"

#include <cstring>
#include <map>
#include <memory>
#include <set>
#include <utility>

#include "ground/ConfList.h"
#include "ground/Marks.h"
#include "ground/PortText.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr char kSystemConf[] = "/etc/tavoinfo.conf";
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

// The service that a rule is for, else the rule's number.
std::string ServiceOf(const TAVO_PF_CONF* pRule) {
    const std::string szService = Value(pRule, "service");
    return szService.empty() ? pRule->szSection : szService;
}

// What no router is asked for, under a name for the status file.
Outcome RefusedRule(const std::string& szName, const char* szWord, const TAVO_PF_CONF* pRule) {
    Outcome outcome{KeyText(szName), {PortState::kRefused, szWord}};
    outcome.szRule = RuleTitle(pRule);
    return outcome;
}

// The port as the one rule asks for it, beside the same port, which another rule has.
Outcome Duplicate(const RouterMapping& mapping, const TAVO_PF_CONF* pRule) {
    Outcome outcome = RefusedRule(MappingName(mapping), "duplicate", pRule);
    outcome.szProtocol = mapping.szProtocol;
    outcome.nRouterPort = mapping.nRouterPort;
    outcome.nBoxPort = mapping.nBoxPort;
    return outcome;
}

// Two outcomes of one name would be one to the status file and to the notices, and a change at every pass. So what
// is not asked for stands beside "5000/tcp" as "5000/tcp (web)", and next to that as "5000/tcp (web, 2)".
void NameApart(WantedSet& wanted) {
    std::set<std::string> setNames;
    for (const auto& [szName, szRule] : wanted.mapRules) {
        setNames.insert(szName);
    }
    for (Outcome& outcome : wanted.rgRefused) {
        const std::string szPlain = outcome.szName;
        for (int i = 1; !setNames.insert(outcome.szName).second; ++i) {
            outcome.szName = szPlain + " (" + KeyText(outcome.szRule) + (i == 1 ? "" : ", " + std::to_string(i)) + ")";
        }
    }
}

// Takes a rule's single mappings in; the first rule that asks for a port has it.
void AddRule(const TAVO_PF_CONF* pRule, const std::vector<SingleMapping>& rgSingles,
             std::map<std::string, uint16_t>& mapBoxPorts, WantedSet& wanted) {
    for (const SingleMapping& single : rgSingles) {
        RouterMapping mapping{
            single.szProtocol, single.nRouterPort, single.nBoxPort, "", MappingDescription(pRule), 0, true};
        const auto [it, blNew] = mapBoxPorts.try_emplace(MappingName(mapping), mapping.nBoxPort);
        if (blNew) {
            wanted.mapRules[it->first] = RuleTitle(pRule);
            wanted.rgMappings.push_back(std::move(mapping));
        } else if (it->second != mapping.nBoxPort) {
            wanted.rgRefused.push_back(Duplicate(mapping, pRule));
        }
    }
}

}  // namespace

std::string MappingDescription(const TAVO_PF_CONF* pRule) {
    std::string szText = kOwnPrefix;
    for (const char c : ServiceOf(pRule)) {
        szText += c >= ' ' && c <= '~' ? c : '_';
    }
    return szText.substr(0, kMaxDescription);
}

std::string RuleTitle(const TAVO_PF_CONF* pRule) {
    return HarmlessText(ServiceOf(pRule), kMaxRuleText);
}

std::string RuleName(const TAVO_PF_CONF* pRule) {
    return KeyText(Value(pRule, "r_port") + "/" + Value(pRule, "protocol name"));
}

bool IsRunKeyOn(const char* szRunKey) {
    char szValue[8] = {};
    return TLIBCFileGetKeyValue(kSystemConf, szRunKey, szValue, sizeof(szValue), 0) >= 1 &&
           std::strcmp(szValue, "yes") == 0;
}

WantedSet ReadWanted(const char* szRunKey) {
    WantedSet wanted;
    if (!IsRunKeyOn(szRunKey)) {
        return wanted;
    }
    wanted.blSwitchedOn = true;
    const ConfList pRules(TAVOPFRuleGet());
    wanted.blReadable = pRules != nullptr || TLIBCErrGet() == TLIBC_ERR_NONE || TLIBCErrGet() == TLIBC_ERR_NOT_FOUND;
    std::map<std::string, uint16_t> mapBoxPorts;
    for (const TAVO_PF_CONF* pRule = pRules.get(); pRule != nullptr; pRule = pRule->pNext) {
        if (Value(pRule, "enabled") != "1") {
            continue;
        }
        const std::string szRouterPorts = Value(pRule, "r_port");
        const std::string szBoxPorts = Value(pRule, "s_port");
        const auto rgSingles = ExpandRule(Value(pRule, "protocol name"), szRouterPorts, szBoxPorts);
        if (rgSingles) {
            AddRule(pRule, *rgSingles, mapBoxPorts, wanted);
        }
        if (!rgSingles || MayBeCut(szRouterPorts) || MayBeCut(szBoxPorts)) {
            wanted.rgRefused.push_back(RefusedRule(RuleName(pRule), rgSingles ? "cut" : "invalid", pRule));
        }
    }
    NameApart(wanted);
    return wanted;
}

}  // namespace tavo
