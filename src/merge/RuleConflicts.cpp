// The passes that decide, port by port, which side keeps a port. Relies on the operation rules.
// Promises: what a search finds, and the error it meets, are those of a walk over the rules in order.
#include "RuleConflicts.h"

#include <algorithm>

namespace tavo::lib {

namespace {

enum class Selection { In, Out, Unclear };

// The name decides first: a rule that it turns away never meets a filter that wants nothing.
Selection Select(const OPERATION_RULE& rule, const RULE_FILTER* pFilter) {
    if (pFilter == nullptr) {
        return Selection::In;
    }
    if (pFilter->szServiceName != nullptr && IsOf(rule, pFilter->szServiceName) != pFilter->blMatchServiceName) {
        return Selection::Out;
    }
    if (!pFilter->blMatchEnabledRules && !pFilter->blMatchDisabledRules) {
        return Selection::Unclear;
    }
    return (rule.blEnable ? pFilter->blMatchEnabledRules : pFilter->blMatchDisabledRules) ? Selection::In
                                                                                          : Selection::Out;
}

bool CheckArguments(const OPERATION_RULE* rgOpRules1, int nOpRules1, const OPERATION_RULE* rgOpRules, int nOpRules) {
    if (nOpRules1 < 0) {
        LogError("%s:%d Bad parameter, 0 > nOpRules1=%d", kHopLinkFile, __LINE__, nOpRules1);
        return false;
    }
    if (nOpRules1 > 0 && rgOpRules1 == nullptr) {
        LogError("%s:%d Bad parameter, 0 < nOpRules1=%d, but rgOpRules1 is NULL", kHopLinkFile, __LINE__, nOpRules1);
        return false;
    }
    if (nOpRules < 0) {
        LogError("%s:%d Bad parameter, 0 > nOpRules=%d", kHopLinkFile, __LINE__, nOpRules);
        return false;
    }
    if (nOpRules > 0 && rgOpRules == nullptr) {
        LogError("%s:%d Bad parameter, 0 < nOpRules=%d, but rgOpRules is NULL", kHopLinkFile, __LINE__, nOpRules);
        return false;
    }
    return true;
}

int Count(const PortList& ports) {
    return static_cast<int>(ports.size());
}

bool CheckLists(const OPERATION_RULE& rule, int i) {
    if (rule.routerPortSet == nullptr) {
        LogError("%s:%d rgOpRules1[%d].routerPortSet is NULL", kHopLinkFile, __LINE__, i);
        return false;
    }
    if (rule.boxPortSet == nullptr) {
        LogError("%s:%d rgOpRules1[%d].boxPortSet is NULL", kHopLinkFile, __LINE__, i);
        return false;
    }
    if (rule.routerPortSet->size() != rule.boxPortSet->size()) {
        LogError("%s:%d begin, router port numbers=%d != box port numbers=%d", kHopLinkFile, __LINE__,
                 Count(*rule.routerPortSet), Count(*rule.boxPortSet));
        return false;
    }
    if (rule.routerPortSet->empty()) {
        LogError("%s:%d router port list size == 0", kHopLinkFile, __LINE__);
        return false;
    }
    return true;
}

// Whether one pair goes; nothing when that cannot be told.
std::optional<bool> IsToGo(OpRulesSearch& search, int nRouterPort, int nBoxPort, PORTMAP_PROTOCOL protocol,
                           bool blDeleteFound) {
    auto enStatus = SearchStatus::Unknown;
    if (search.IsPortInOpRules(nRouterPort, nBoxPort, protocol, &enStatus) != 0) {
        LogError("%s:%d IsPortInOpRules() failed", kHopLinkFile, __LINE__);
        return std::nullopt;
    }
    if (enStatus == SearchStatus::PartialMatched) {
        LogError("%s:%d failed, port is partial matched", kHopLinkFile, __LINE__);
        return std::nullopt;
    }
    return (enStatus == SearchStatus::Found) == blDeleteFound;
}

// One rule of a pass.
bool DeletePortsFromRule(OPERATION_RULE& rule, OpRulesSearch& search, bool blDeleteFound) {
    if (!RemovePairs(rule, [&](int nRouterPort, int nBoxPort) {
            return IsToGo(search, nRouterPort, nBoxPort, rule.protocol, blDeleteFound);
        })) {
        return false;
    }
    if (rule.routerPortSet->size() != rule.boxPortSet->size()) {
        LogError("%s:%d end, router port numbers=%d != box port numbers=%d", kHopLinkFile, __LINE__,
                 Count(*rule.routerPortSet), Count(*rule.boxPortSet));
        return false;
    }
    if (rule.routerPortSet->empty()) {
        rule.blDeleted = true;
    }
    return true;
}

}  // namespace

int IsNeedToFilterOut(bool* pblFilterOut, const OPERATION_RULE& rule, const RULE_FILTER* pFilter) {
    const Selection selection = Select(rule, pFilter);
    if (selection == Selection::Unclear) {
        LogError("%s:%d Bad parameter, blMatchEnabledRules and blMatchDisabledRules shall not both be false",
                 kHopLinkFile, __LINE__);
        return -1;
    }
    *pblFilterOut = selection == Selection::Out;
    return 0;
}

// ---- the search -------------------------------------------------------------------------------------

void OpRulesSearch::Places::Add(const PortList& ports, int nRule) {
    int nPosition = 0;
    for (const int nPort : ports) {
        const auto nKey = static_cast<unsigned>(nPort);
        Place& place = mPages[nKey / kPageSize][nKey % kPageSize];
        if (place.nRule == kNoRule) {
            place = {nRule, nPosition};
        }
        ++nPosition;
    }
}

OpRulesSearch::Place OpRulesSearch::Places::Find(int nPort) const {
    const auto nKey = static_cast<unsigned>(nPort);
    const auto it = mPages.find(nKey / kPageSize);
    return it == mPages.end() ? Place{} : it->second[nKey % kPageSize];
}

// Says nothing: an error is one only for a search that gets as far as the rule that causes it.
void OpRulesSearch::Index() {
    mBlIndexed = true;
    for (int i = 0; i < mNRules; ++i) {
        const OPERATION_RULE& rule = mRgRules[i];
        if (rule.blDeleted) {
            continue;
        }
        if (rule.routerPortSet == nullptr || rule.boxPortSet == nullptr) {
            mNBroken = i;
            return;
        }
        ProtocolIndex& index = mProtocols[rule.protocol];
        const Selection selection = Select(rule, mPFilter);
        if (selection == Selection::In) {
            index.router.Add(*rule.routerPortSet, i);
            index.box.Add(*rule.boxPortSet, i);
        } else if (selection == Selection::Unclear) {
            index.nBadFilter = std::min(index.nBadFilter, i);
        }
    }
}

// The rule that a search stumbled over says why, as it would on a walk.
int OpRulesSearch::Refuse(int nRule) const {
    const OPERATION_RULE& rule = mRgRules[nRule];
    bool blFilterOut = false;
    if (rule.routerPortSet == nullptr) {
        LogError("%s:%d rgOpRules[%d].routerPortSet is NULL", kHopLinkFile, __LINE__, nRule);
    } else if (rule.boxPortSet == nullptr) {
        LogError("%s:%d rgOpRules[%d].boxPortSet is NULL", kHopLinkFile, __LINE__, nRule);
    } else if (IsNeedToFilterOut(&blFilterOut, rule, mPFilter) != 0) {
        LogError("%s:%d IsNeedToFilterOut() rules2 failed", kHopLinkFile, __LINE__);
    }
    return -1;
}

// Two ports that are first met in different rules: the earlier rule has only one of them.
SearchStatus OpRulesSearch::Judge(const Place& router, const Place& box) {
    if (router.nRule == kNoRule && box.nRule == kNoRule) {
        return SearchStatus::NotFound;
    }
    const bool blPair = router.nRule == box.nRule && router.nPosition == box.nPosition;
    return blPair ? SearchStatus::Found : SearchStatus::PartialMatched;
}

int OpRulesSearch::IsPortInOpRules(int nRouterPortNumber, int nBoxPortNumber, PORTMAP_PROTOCOL protocol,
                                   SearchStatus* pStatus) {
    if (nRouterPortNumber < 1) {
        LogError("%s:%d Bad parameter, nRouterPortNumber=%d", kHopLinkFile, __LINE__, nRouterPortNumber);
        return -1;
    }
    if (nBoxPortNumber < 1) {
        LogError("%s:%d Bad parameter, nBoxPortNumber=%d", kHopLinkFile, __LINE__, nBoxPortNumber);
        return -1;
    }
    if (!mBlIndexed) {
        Index();
    }
    Place router;
    Place box;
    int nObstacle = mNBroken;
    for (const PORTMAP_PROTOCOL searched : {protocol, PORTMAP_PROTOCOL_ALL}) {
        const auto it = mProtocols.find(searched);
        if (it == mProtocols.end()) {
            continue;
        }
        const auto fnEarlier = [](const Place& one, const Place& other) { return one.nRule < other.nRule; };
        router = std::min(router, it->second.router.Find(nRouterPortNumber), fnEarlier);
        box = std::min(box, it->second.box.Find(nBoxPortNumber), fnEarlier);
        nObstacle = std::min(nObstacle, it->second.nBadFilter);
    }
    const int nFirst = std::min(router.nRule, box.nRule);
    if (nObstacle < nFirst) {
        return Refuse(nObstacle);
    }
    *pStatus = Judge(router, box);
    if (*pStatus == SearchStatus::Unknown) {
        LogError("%s:%d failed, search done but search status is unknown", kHopLinkFile, __LINE__);
        return -1;
    }
    return 0;
}

// ---- the passes -------------------------------------------------------------------------------------

int DeletePortsFromRules1(OPERATION_RULE* rgOpRules1, int nOpRules1, const OPERATION_RULE* rgOpRules, int nOpRules,
                          bool blDeleteFound, const RULE_FILTER* pFilter1, const RULE_FILTER* pFilter2) {
    if (!CheckArguments(rgOpRules1, nOpRules1, rgOpRules, nOpRules)) {
        return -1;
    }
    OpRulesSearch search(rgOpRules, nOpRules, pFilter2);
    for (int i = 0; i < nOpRules1; ++i) {
        OPERATION_RULE& rule = rgOpRules1[i];
        if (rule.blDeleted) {
            continue;
        }
        bool blFilterOut = false;
        if (IsNeedToFilterOut(&blFilterOut, rule, pFilter1) != 0) {
            LogError("%s:%d IsNeedToFilterOut() rules1 failed", kHopLinkFile, __LINE__);
            return -1;
        }
        if (blFilterOut) {
            continue;
        }
        if (!CheckLists(rule, i) || !DeletePortsFromRule(rule, search, blDeleteFound)) {
            return -1;
        }
    }
    return 0;
}

int DeletePortsFromRuleConf(OPERATION_RULE* rgRuleConfOpRules, int nRuleConfOpRules, const char* szServiceName) {
    if (szServiceName == nullptr || szServiceName[0] == '\0') {
        LogError("%s:%d Bad parameter, szServiceName shall not be empty", kHopLinkFile, __LINE__);
        return -1;
    }
    if (nRuleConfOpRules > 0 && rgRuleConfOpRules == nullptr) {
        LogError("%s:%d Bad parameter, 0 < nRuleConfOpRules=%d but rgRuleConfOpRules is NULL", kHopLinkFile, __LINE__,
                 nRuleConfOpRules);
        return -1;
    }
    for (int i = 0; i < nRuleConfOpRules; ++i) {
        OPERATION_RULE& rule = rgRuleConfOpRules[i];
        if (rule.blEnable && IsOf(rule, szServiceName)) {
            rule.blDeleted = true;
        }
    }
    return 0;
}

int DeletePortsFromInputRules(OPERATION_RULE* rgOpRules, int nOpRules, OPERATION_RULE* rgRuleConfOpRules,
                              int nRuleConfOpRules, const char* szServiceName) {
    const RULE_FILTER filterA{szServiceName, false, true, false};  // what others map
    const RULE_FILTER filterB{szServiceName, true, false, true};   // what the user switched off for the service
    const RULE_FILTER filterC{nullptr, false, true, true};         // the whole request
    if (DeletePortsFromRules1(rgRuleConfOpRules, nRuleConfOpRules, rgOpRules, nOpRules, false, &filterB, &filterC) !=
        0) {
        LogError("%s:%d DeletePortsFromRules1(B->C) failed", kHopLinkFile, __LINE__);
        return -1;
    }
    if (DeletePortsFromRules1(rgOpRules, nOpRules, rgRuleConfOpRules, nRuleConfOpRules, true, &filterC, &filterA) !=
        0) {
        LogError("%s:%d DeletePortsFromRules1(C->A) failed", kHopLinkFile, __LINE__);
        return -1;
    }
    if (DeletePortsFromRules1(rgOpRules, nOpRules, rgRuleConfOpRules, nRuleConfOpRules, true, &filterC, &filterB) !=
        0) {
        LogError("%s:%d DeletePortsFromRules1(C->B) failed", kHopLinkFile, __LINE__);
        return -1;
    }
    return 0;
}

}  // namespace tavo::lib
