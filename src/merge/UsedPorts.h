// The ports that other hosts hold on the router, against the rules of a service. Relies on the operation rules.
// Promises: as the passes of RuleConflicts.h, it only ever takes away.
#pragma once

#include <unordered_set>

#include "OperationRules.h"

namespace tavo::lib {

struct UsedPorts {
    std::unordered_set<int> tcp;
    std::unordered_set<int> udp;
};

// A rule for both protocols loses what is taken for TCP.
int DeleteConflictPortsFromOpRule(const MergeHost& host, OPERATION_RULE& opRule, const UsedPorts& used,
                                  MergeObserver* pObserver = nullptr);

// The same for the rules of the service (null: all rules) in both arrays, the deleted ones too.
int DeleteUsedPorts(const MergeHost& host, OPERATION_RULE* rgOpRules, int nOpRules, OPERATION_RULE* rgOpConfRules,
                    int nOpConfRules, const char* szServiceName, const UsedPorts& used,
                    MergeObserver* pObserver = nullptr);

}  // namespace tavo::lib
