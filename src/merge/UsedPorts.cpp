// Takes away what other hosts hold on the router. Relies on the operation rules. Promises: see UsedPorts.h.
#include "UsedPorts.h"

namespace tavo::lib {

namespace {

bool HasEqualSides(const MergeHost& host, const OPERATION_RULE& opRule) {
    if (opRule.routerPortSet->size() == opRule.boxPortSet->size()) {
        return true;
    }
    host.LogError("%s:%d router port number = %d != box port number =%d", kHopLinkFile, __LINE__,
                  static_cast<int>(opRule.routerPortSet->size()), static_cast<int>(opRule.boxPortSet->size()));
    return false;
}

// A rule for both protocols is held against the TCP mappings alone; that is meant.
const std::unordered_set<int>* UsedBy(PORTMAP_PROTOCOL protocol, const UsedPorts& used) {
    switch (protocol) {
        case PORTMAP_PROTOCOL_TCP:
        case PORTMAP_PROTOCOL_ALL:
            return &used.tcp;
        case PORTMAP_PROTOCOL_UDP:
            return &used.udp;
    }
    return nullptr;
}

// One array. szFailure takes the file, the line and the index.
bool DeleteFromArray(const MergeHost& host, OPERATION_RULE* rgOpRules, int nOpRules, const char* szServiceName,
                     const UsedPorts& used, MergeObserver* pObserver, const char* szFailure) {
    for (int i = 0; i < nOpRules; ++i) {
        if (szServiceName != nullptr && !IsOf(rgOpRules[i], szServiceName)) {
            continue;
        }
        if (DeleteConflictPortsFromOpRule(host, rgOpRules[i], used, pObserver) != 0) {
            host.LogError(szFailure, kHopLinkFile, __LINE__, i);
            return false;
        }
    }
    return true;
}

}  // namespace

int DeleteConflictPortsFromOpRule(const MergeHost& host, OPERATION_RULE& opRule, const UsedPorts& used,
                                  MergeObserver* pObserver) {
    if (opRule.routerPortSet == nullptr) {
        host.LogError("%s:%d opRule.routerPortSet == NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (opRule.boxPortSet == nullptr) {
        host.LogError("%s:%d opRule.boxPortSet == NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (!HasEqualSides(host, opRule)) {
        if (pObserver != nullptr) {
            pObserver->OnUneven(opRule);
        }
        return -1;
    }
    if (opRule.routerPortSet->empty()) {
        return 0;
    }
    const std::unordered_set<int>* pUsed = UsedBy(opRule.protocol, used);
    RemovePairs(opRule, [&](int nRouterPort, int nBoxPort) {
        const bool blToGo = pUsed != nullptr && pUsed->count(nRouterPort) != 0;
        if (blToGo && pObserver != nullptr) {
            pObserver->OnRemoved(opRule, nRouterPort, nBoxPort, nullptr);
        }
        return std::optional(blToGo);
    });
    if (!HasEqualSides(host, opRule)) {
        return -1;
    }
    if (opRule.routerPortSet->empty()) {
        opRule.blDeleted = true;
    }
    return 0;
}

int DeleteUsedPorts(const MergeHost& host, OPERATION_RULE* rgOpRules, int nOpRules, OPERATION_RULE* rgOpConfRules,
                    int nOpConfRules, const char* szServiceName, const UsedPorts& used, MergeObserver* pObserver) {
    return DeleteFromArray(host, rgOpRules, nOpRules, szServiceName, used, pObserver,
                           "%s:%d DeleteConflictPortsForUPnPRouter(rgOpRules[%d]) failed") &&
                   DeleteFromArray(host, rgOpConfRules, nOpConfRules, szServiceName, used, pObserver,
                                   "%s:%d DeleteConflictPortsForUPnPRouter(rgOpConfRules[%d]) failed")
               ? 0
               : -1;
}

}  // namespace tavo::lib
