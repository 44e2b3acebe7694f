// Reads the run key and the rule file. Relies on the platform's port-forward library. Promises: see RuleFile.h.
#include "programs/common/RuleFile.h"

#include <cstring>
#include <utility>

#include "ground/ConfList.h"

namespace tavo {

namespace {

constexpr char kSystemConf[] = "/etc/tavoinfo.conf";

}  // namespace

bool IsRunKeyOn(const char* szRunKey) {
    char szValue[8] = {};
    return TLIBCFileGetKeyValue(kSystemConf, szRunKey, szValue, sizeof(szValue), 0) >= 1 &&
           std::strcmp(szValue, "yes") == 0;
}

WantedSet ReadWanted(const char* szRunKey) {
    const bool blSwitchedOn = IsRunKeyOn(szRunKey);
    const ConfList pRules(TAVOPFRuleGet());
    const bool blReadable =
        pRules != nullptr || TLIBCErrGet() == TLIBC_ERR_NONE || TLIBCErrGet() == TLIBC_ERR_NOT_FOUND;
    std::vector<RuleText> rgRules;
    for (const TAVO_PF_CONF* pRule = pRules.get(); pRule != nullptr; pRule = pRule->pNext) {
        if (Value(pRule, "enabled") == "1") {
            rgRules.push_back(RuleTextOf(pRule));
        }
    }
    WantedSet wanted = Expand(rgRules);
    if (!blSwitchedOn) {
        WantedSet none;
        none.rgOthers = blReadable ? std::make_optional(std::move(wanted.rgMappings)) : std::nullopt;
        return none;
    }
    wanted.blReadable = blReadable;
    wanted.blSwitchedOn = true;
    return wanted;
}

RuleText RuleTextOf(const TAVO_PF_CONF* pRule) {
    std::string szService = Value(pRule, "service");
    return {szService.empty() ? pRule->szSection : std::move(szService), Value(pRule, "protocol name"),
            Value(pRule, "r_port"), Value(pRule, "s_port")};
}

}  // namespace tavo
