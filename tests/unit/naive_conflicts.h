// The merge written the plain way: every pair of ports is looked for by walking the other side's lists.
// What the library's indexed search must be indistinguishable from, and what it is measured against.
#pragma once

#include <algorithm>
#include <list>
#include <string>

#include "HopLink.h"
#include "Log.h"
#include "src/merge/RuleConflicts.h"

namespace naive {

using namespace tavo::lib;

inline int PositionOf(const PortList& ports, int nPort) {
    const auto it = std::find(ports.begin(), ports.end(), nPort);
    return it == ports.end() ? -1 : static_cast<int>(std::distance(ports.begin(), it));
}

inline int Fail(const std::string& szLine) {
    LogError("%s:%d %s", kHopLinkFile, __LINE__, szLine.c_str());
    return -1;
}

inline int Search(int nRouter, int nBox, PORTMAP_PROTOCOL protocol, const OPERATION_RULE* rgRules, int nRules,
                  const RULE_FILTER* pFilter, SearchStatus& enStatus) {
    enStatus = SearchStatus::NotFound;
    if (nRouter < 1) {
        return Fail("Bad parameter, nRouterPortNumber=" + std::to_string(nRouter));
    }
    if (nBox < 1) {
        return Fail("Bad parameter, nBoxPortNumber=" + std::to_string(nBox));
    }
    for (int i = 0; i < nRules; ++i) {
        const OPERATION_RULE& rule = rgRules[i];
        if (rule.blDeleted) {
            continue;
        }
        if (rule.routerPortSet == nullptr || rule.boxPortSet == nullptr) {
            return Fail("rgOpRules[" + std::to_string(i) + "]." +
                        (rule.routerPortSet == nullptr ? "routerPortSet" : "boxPortSet") + " is NULL");
        }
        if (rule.protocol != protocol && rule.protocol != PORTMAP_PROTOCOL_ALL) {
            continue;
        }
        bool blFilterOut = false;
        if (IsNeedToFilterOut(Host(), &blFilterOut, rule, pFilter) != 0) {
            return Fail("IsNeedToFilterOut() rules2 failed");
        }
        const int nAtRouter = blFilterOut ? -1 : PositionOf(*rule.routerPortSet, nRouter);
        const int nAtBox = blFilterOut ? -1 : PositionOf(*rule.boxPortSet, nBox);
        if (nAtRouter >= 0 || nAtBox >= 0) {
            enStatus = nAtRouter == nAtBox ? SearchStatus::Found : SearchStatus::PartialMatched;
            return 0;
        }
    }
    return 0;
}

inline int WalkLists(std::list<int>& router, std::list<int>& box, PORTMAP_PROTOCOL protocol,
                     const OPERATION_RULE* rgRules, int nRules, bool blDeleteFound, const RULE_FILTER* pFilter) {
    auto itRouter = router.end();
    auto itBox = box.end();
    for (size_t nLeft = router.size(); nLeft > 0; --nLeft) {
        --itRouter;
        --itBox;
        SearchStatus enStatus{};
        if (Search(*itRouter, *itBox, protocol, rgRules, nRules, pFilter, enStatus) != 0) {
            return Fail("IsPortInOpRules() failed");
        }
        if (enStatus == SearchStatus::PartialMatched) {
            return Fail("failed, port is partial matched");
        }
        if ((enStatus == SearchStatus::Found) == blDeleteFound) {
            itRouter = router.erase(itRouter);
            itBox = box.erase(itBox);
        }
    }
    return 0;
}

inline int Walk(OPERATION_RULE& rule, const OPERATION_RULE* rgRules, int nRules, bool blDeleteFound,
                const RULE_FILTER* pFilter) {
    std::list<int> router(rule.routerPortSet->begin(), rule.routerPortSet->end());
    std::list<int> box(rule.boxPortSet->begin(), rule.boxPortSet->end());
    const int nResult = WalkLists(router, box, rule.protocol, rgRules, nRules, blDeleteFound, pFilter);
    *rule.routerPortSet = PortList(router.begin(), router.end());
    *rule.boxPortSet = PortList(box.begin(), box.end());
    rule.blDeleted = nResult == 0 && router.empty();
    return nResult;
}
inline int DeletePortsFromRules1(const MergeHost& /*host*/, OPERATION_RULE* rgRules1, int nRules1,
                                 const OPERATION_RULE* rgRules, int nRules, bool blDeleteFound,
                                 const RULE_FILTER* pFilter1, const RULE_FILTER* pFilter2,
                                 MergeObserver* /*pObserver*/ = nullptr) {
    for (int i = 0; i < nRules1; ++i) {
        OPERATION_RULE& rule = rgRules1[i];
        bool blFilterOut = rule.blDeleted;
        if (!blFilterOut && IsNeedToFilterOut(Host(), &blFilterOut, rule, pFilter1) != 0) {
            return Fail("IsNeedToFilterOut() rules1 failed");
        }
        if (blFilterOut) {
            continue;
        }
        if (rule.routerPortSet == nullptr || rule.boxPortSet == nullptr) {
            return Fail("rgOpRules1[" + std::to_string(i) + "]." +
                        (rule.routerPortSet == nullptr ? "routerPortSet" : "boxPortSet") + " is NULL");
        }
        const size_t nRouter = rule.routerPortSet->size();
        const size_t nBox = rule.boxPortSet->size();
        if (nRouter != nBox) {
            return Fail("begin, router port numbers=" + std::to_string(nRouter) +
                        " != box port numbers=" + std::to_string(nBox));
        }
        if (nRouter == 0) {
            return Fail("router port list size == 0");
        }
        if (Walk(rule, rgRules, nRules, blDeleteFound, pFilter2) != 0) {
            return -1;
        }
    }
    return 0;
}

}  // namespace naive
