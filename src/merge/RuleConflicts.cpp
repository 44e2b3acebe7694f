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

bool CheckArguments(const MergeHost& host, const OPERATION_RULE* rgOpRules1, int nOpRules1,
                    const OPERATION_RULE* rgOpRules, int nOpRules) {
    if (nOpRules1 < 0) {
        host.LogError("%s:%d Bad parameter, 0 > nOpRules1=%d", kHopLinkFile, __LINE__, nOpRules1);
        return false;
    }
    if (nOpRules1 > 0 && rgOpRules1 == nullptr) {
        host.LogError("%s:%d Bad parameter, 0 < nOpRules1=%d, but rgOpRules1 is NULL", kHopLinkFile, __LINE__,
                      nOpRules1);
        return false;
    }
    if (nOpRules < 0) {
        host.LogError("%s:%d Bad parameter, 0 > nOpRules=%d", kHopLinkFile, __LINE__, nOpRules);
        return false;
    }
    if (nOpRules > 0 && rgOpRules == nullptr) {
        host.LogError("%s:%d Bad parameter, 0 < nOpRules=%d, but rgOpRules is NULL", kHopLinkFile, __LINE__, nOpRules);
        return false;
    }
    return true;
}

int Count(const PortList& ports) {
    return static_cast<int>(ports.size());
}

bool CheckLists(const MergeHost& host, const OPERATION_RULE& rule, int i, MergeObserver* pObserver) {
    if (rule.routerPortSet == nullptr) {
        host.LogError("%s:%d rgOpRules1[%d].routerPortSet is NULL", kHopLinkFile, __LINE__, i);
        return false;
    }
    if (rule.boxPortSet == nullptr) {
        host.LogError("%s:%d rgOpRules1[%d].boxPortSet is NULL", kHopLinkFile, __LINE__, i);
        return false;
    }
    if (rule.routerPortSet->size() != rule.boxPortSet->size()) {
        host.LogError("%s:%d begin, router port numbers=%d != box port numbers=%d", kHopLinkFile, __LINE__,
                      Count(*rule.routerPortSet), Count(*rule.boxPortSet));
        if (pObserver != nullptr) {
            pObserver->OnUneven(rule);
        }
        return false;
    }
    if (rule.routerPortSet->empty()) {
        host.LogError("%s:%d router port list size == 0", kHopLinkFile, __LINE__);
        return false;
    }
    return true;
}

// What a pass takes away, of what it finds where.
struct Pass {
    const MergeHost& host;
    OpRulesSearch& search;
    bool blDeleteFound;
    MergeObserver* pObserver;  // may be null
};

// Whether one pair goes; nothing when that cannot be told.
std::optional<bool> IsToGo(const Pass& pass, const OPERATION_RULE& rule, int nRouterPort, int nBoxPort) {
    auto enStatus = SearchStatus::Unknown;
    const OPERATION_RULE* pDecider = nullptr;
    if (pass.search.IsPortInOpRules(nRouterPort, nBoxPort, rule.protocol, &enStatus, &pDecider) != 0) {
        pass.host.LogError("%s:%d IsPortInOpRules() failed", kHopLinkFile, __LINE__);
        return std::nullopt;
    }
    if (enStatus == SearchStatus::PartialMatched) {
        pass.host.LogError("%s:%d failed, port is partial matched", kHopLinkFile, __LINE__);
        if (pass.pObserver != nullptr) {
            pass.pObserver->OnTorn(rule, nRouterPort, nBoxPort, *pDecider);
        }
        return std::nullopt;
    }
    const bool blToGo = (enStatus == SearchStatus::Found) == pass.blDeleteFound;
    if (blToGo && pass.pObserver != nullptr) {
        pass.pObserver->OnRemoved(rule, nRouterPort, nBoxPort, pDecider);
    }
    return blToGo;
}

// One rule of a pass.
bool DeletePortsFromRule(const Pass& pass, OPERATION_RULE& rule) {
    if (!RemovePairs(rule, [&](int nRouterPort, int nBoxPort) { return IsToGo(pass, rule, nRouterPort, nBoxPort); })) {
        return false;
    }
    if (rule.routerPortSet->size() != rule.boxPortSet->size()) {
        pass.host.LogError("%s:%d end, router port numbers=%d != box port numbers=%d", kHopLinkFile, __LINE__,
                           Count(*rule.routerPortSet), Count(*rule.boxPortSet));
        return false;
    }
    if (rule.routerPortSet->empty()) {
        rule.blDeleted = true;
    }
    return true;
}

}  // namespace

int IsNeedToFilterOut(const MergeHost& host, bool* pblFilterOut, const OPERATION_RULE& rule,
                      const RULE_FILTER* pFilter) {
    const Selection selection = Select(rule, pFilter);
    if (selection == Selection::Unclear) {
        host.LogError("%s:%d Bad parameter, blMatchEnabledRules and blMatchDisabledRules shall not both be false",
                      kHopLinkFile, __LINE__);
        return -1;
    }
    *pblFilterOut = selection == Selection::Out;
    return 0;
}

// ---- the search -------------------------------------------------------------------------------------

void OpRulesSearch::Places::Add(const PortList& ports, int nRule) {
    int nPosition = 0;
    unsigned nPage = 0;
    std::array<Place, kPageSize>* pPage = nullptr;  // neighbours are mostly on one
    for (const int nPort : ports) {
        const auto nKey = static_cast<unsigned>(nPort);
        if (pPage == nullptr || nPage != nKey / kPageSize) {
            nPage = nKey / kPageSize;
            pPage = &mPages[nPage];
        }
        Place& place = (*pPage)[nKey % kPageSize];
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
        mHost.LogError("%s:%d rgOpRules[%d].routerPortSet is NULL", kHopLinkFile, __LINE__, nRule);
    } else if (rule.boxPortSet == nullptr) {
        mHost.LogError("%s:%d rgOpRules[%d].boxPortSet is NULL", kHopLinkFile, __LINE__, nRule);
    } else if (IsNeedToFilterOut(mHost, &blFilterOut, rule, mPFilter) != 0) {
        mHost.LogError("%s:%d IsNeedToFilterOut() rules2 failed", kHopLinkFile, __LINE__);
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
                                   SearchStatus* pStatus, const OPERATION_RULE** ppDecider) {
    if (nRouterPortNumber < 1) {
        mHost.LogError("%s:%d Bad parameter, nRouterPortNumber=%d", kHopLinkFile, __LINE__, nRouterPortNumber);
        return -1;
    }
    if (nBoxPortNumber < 1) {
        mHost.LogError("%s:%d Bad parameter, nBoxPortNumber=%d", kHopLinkFile, __LINE__, nBoxPortNumber);
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
    *ppDecider = nFirst == kNoRule ? nullptr : mRgRules + nFirst;
    if (*pStatus == SearchStatus::Unknown) {
        mHost.LogError("%s:%d failed, search done but search status is unknown", kHopLinkFile, __LINE__);
        return -1;
    }
    return 0;
}

// ---- the passes -------------------------------------------------------------------------------------

int DeletePortsFromRules1(const MergeHost& host, OPERATION_RULE* rgOpRules1, int nOpRules1,
                          const OPERATION_RULE* rgOpRules, int nOpRules, bool blDeleteFound,
                          const RULE_FILTER* pFilter1, const RULE_FILTER* pFilter2, MergeObserver* pObserver) {
    if (!CheckArguments(host, rgOpRules1, nOpRules1, rgOpRules, nOpRules)) {
        return -1;
    }
    OpRulesSearch search(host, rgOpRules, nOpRules, pFilter2);
    const Pass pass{host, search, blDeleteFound, pObserver};
    for (int i = 0; i < nOpRules1; ++i) {
        OPERATION_RULE& rule = rgOpRules1[i];
        if (rule.blDeleted) {
            continue;
        }
        bool blFilterOut = false;
        if (IsNeedToFilterOut(host, &blFilterOut, rule, pFilter1) != 0) {
            host.LogError("%s:%d IsNeedToFilterOut() rules1 failed", kHopLinkFile, __LINE__);
            return -1;
        }
        if (blFilterOut) {
            continue;
        }
        if (!CheckLists(host, rule, i, pObserver) || !DeletePortsFromRule(pass, rule)) {
            return -1;
        }
    }
    return 0;
}

int DeletePortsFromRuleConf(const MergeHost& host, OPERATION_RULE* rgRuleConfOpRules, int nRuleConfOpRules,
                            const char* szServiceName) {
    if (szServiceName == nullptr || szServiceName[0] == '\0') {
        host.LogError("%s:%d Bad parameter, szServiceName shall not be empty", kHopLinkFile, __LINE__);
        return -1;
    }
    if (nRuleConfOpRules > 0 && rgRuleConfOpRules == nullptr) {
        host.LogError("%s:%d Bad parameter, 0 < nRuleConfOpRules=%d but rgRuleConfOpRules is NULL", kHopLinkFile,
                      __LINE__, nRuleConfOpRules);
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

int DeletePortsFromInputRules(const MergeHost& host, OPERATION_RULE* rgOpRules, int nOpRules,
                              OPERATION_RULE* rgRuleConfOpRules, int nRuleConfOpRules, const char* szServiceName,
                              MergeObserver* pObserver) {
    const RULE_FILTER filterA{szServiceName, false, true, false};  // what others map
    const RULE_FILTER filterB{szServiceName, true, false, true};   // what the user switched off for the service
    const RULE_FILTER filterC{nullptr, false, true, true};         // the whole request
    if (DeletePortsFromRules1(host, rgRuleConfOpRules, nRuleConfOpRules, rgOpRules, nOpRules, false, &filterB, &filterC,
                              pObserver) != 0) {
        host.LogError("%s:%d DeletePortsFromRules1(B->C) failed", kHopLinkFile, __LINE__);
        return -1;
    }
    if (DeletePortsFromRules1(host, rgOpRules, nOpRules, rgRuleConfOpRules, nRuleConfOpRules, true, &filterC, &filterA,
                              pObserver) != 0) {
        host.LogError("%s:%d DeletePortsFromRules1(C->A) failed", kHopLinkFile, __LINE__);
        return -1;
    }
    if (DeletePortsFromRules1(host, rgOpRules, nOpRules, rgRuleConfOpRules, nRuleConfOpRules, true, &filterC, &filterB,
                              pObserver) != 0) {
        host.LogError("%s:%d DeletePortsFromRules1(C->B) failed", kHopLinkFile, __LINE__);
        return -1;
    }
    return 0;
}

}  // namespace tavo::lib
