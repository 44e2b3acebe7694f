// Reads the run key and the rule file. Relies on the platform's port-forward library and PortText.
// Promises: see Wanted.h.
#include "daemons/common/Wanted.h"

#include <cstring>
#include <memory>
#include <set>

#include "core/TextFile.h"
#include "portforward/ConfList.h"
#include "portforward/PortText.h"

namespace tavo {

namespace {

constexpr char kSystemConf[] = "/etc/tavoinfo.conf";
constexpr size_t kMaxDescription = 60;
constexpr size_t kMaxRuleText = 200;

}  // namespace

std::string MappingDescription(const TAVO_PF_CONF* pRule) {
    const std::string szService = Value(pRule, "service");
    std::string szText = kOwnPrefix;
    for (const char c : szService.empty() ? std::string(pRule->szSection) : szService) {
        szText += c >= ' ' && c <= '~' ? c : '_';
    }
    return szText.substr(0, kMaxDescription);
}

std::string RuleName(const TAVO_PF_CONF* pRule) {
    std::string szName = PrintableText(Value(pRule, "r_port") + "/" + Value(pRule, "protocol name"), kMaxRuleText);
    for (char& c : szName) {
        c = c == '=' || c == '#' ? '_' : c;
    }
    return szName;
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
    const ConfList pRules(TAVOPFRuleGet());
    wanted.blReadable =
        pRules != nullptr || TLIBCErrGet() == TLIBC_ERR_NONE || TLIBCFileExist("/etc/portforward/rule.conf") == 0;
    std::set<std::string> setNames;
    for (const TAVO_PF_CONF* pRule = pRules.get(); pRule != nullptr; pRule = pRule->pNext) {
        if (Value(pRule, "enabled") != "1") {
            continue;
        }
        const auto rgSingles =
            ExpandRule(Value(pRule, "protocol name"), Value(pRule, "r_port"), Value(pRule, "s_port"));
        if (!rgSingles) {
            wanted.rgszInvalid.push_back(RuleName(pRule));
            continue;
        }
        for (const SingleMapping& single : *rgSingles) {
            RouterMapping mapping{
                single.szProtocol, single.nRouterPort, single.nBoxPort, "", MappingDescription(pRule), 0, true};
            // The first rule that asks for a port has it.
            if (setNames.insert(MappingName(mapping)).second) {
                wanted.rgMappings.push_back(std::move(mapping));
            }
        }
    }
    return wanted;
}

std::string MappingName(const RouterMapping& mapping) {
    return std::to_string(mapping.nRouterPort) + (mapping.szProtocol == "TCP" ? "/tcp" : "/udp");
}

}  // namespace tavo
