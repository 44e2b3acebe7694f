// The working form of port rules while a service's request is merged: every rule with its ports as
// lists. Relies on the public records. Promises: none of these names is exported; an OperationRules
// releases its block and every list in it on every path.
#pragma once

#include <cstring>
#include <list>
#include <optional>
#include <utility>

#include "common.h"

namespace tavo::lib {

// The file that every log line of the relay service's part names.
inline constexpr char kHopLinkFile[] = "src/libtavoportmapForHopLink.cpp";

// Ports in the order they were given, duplicates kept: positions matter.
using PortList = std::list<int>;

enum PORTMAP_PROTOCOL : int { PORTMAP_PROTOCOL_TCP = 0, PORTMAP_PROTOCOL_UDP = 1, PORTMAP_PROTOCOL_ALL = 2 };

struct OPERATION_RULE {
    bool blEnable;
    PORTMAP_PROTOCOL protocol;  // any int: requests are not checked
    PortList* routerPortSet;    // owned; its n-th port goes with the n-th of boxPortSet
    PortList* boxPortSet;       // owned
    char szServiceId[TAVO_TEXT_SIZE];
    char szServiceName[TAVO_TEXT_SIZE];  // empty for the user's own rules
    int nTestConnStatus;
    bool blDeleted;  // emptied or superseded: skipped by every later pass, never written back
};

// Frees both lists of each record, then the block. NULL is ignored.
void FreeOperationRulesArray(OPERATION_RULE* rgRules, int nRules);

// A block of records and its count, as the building functions hand them out.
template <typename Record, void (*pfnFree)(Record*, int)>
struct OwnedArray {
    OwnedArray() = default;
    ~OwnedArray() { Free(); }
    OwnedArray(const OwnedArray&) = delete;
    OwnedArray& operator=(const OwnedArray&) = delete;

    void MoveTo(Record** pRgOutRules, int* pnOutRules) {
        *pRgOutRules = std::exchange(rgRules, nullptr);
        *pnOutRules = std::exchange(nRules, 0);
    }
    void Free() {
        pfnFree(std::exchange(rgRules, nullptr), nRules);
        nRules = 0;
    }

    Record* rgRules = nullptr;
    int nRules = 0;
};
using OperationRules = OwnedArray<OPERATION_RULE, FreeOperationRulesArray>;

inline void FreeRouterRulesArray(__tag_TAVO_ROUTER_RULE* rgRules, int /*nRules*/) {
    TLibFreeRulesArr(rgRules);
}
using RouterRules = OwnedArray<__tag_TAVO_ROUTER_RULE, FreeRouterRulesArray>;

// Whether the rule is the service's. A name that does not fit a rule is that of the rules made under it.
inline bool IsOf(const OPERATION_RULE& rule, const char* szServiceName) {
    return std::strncmp(rule.szServiceName, szServiceName, TAVO_TEXT_SIZE - 1) == 0;
}

// Walks the pairs of a rule whose lists are there and of one length, from the last to the first, and takes
// out those that fnIsToGo(router port, box port) says; false, and no further, where it says nothing.
template <typename Judge>
bool RemovePairs(OPERATION_RULE& rule, Judge fnIsToGo) {
    auto itRouter = rule.routerPortSet->end();
    auto itBox = rule.boxPortSet->end();
    while (itRouter != rule.routerPortSet->begin()) {
        --itRouter;
        --itBox;
        const std::optional<bool> blToGo = fnIsToGo(*itRouter, *itBox);
        if (!blToGo) {
            return false;
        }
        if (*blToGo) {  // the successor of what is erased is the place to step back from
            itRouter = rule.routerPortSet->erase(itRouter);
            itBox = rule.boxPortSet->erase(itBox);
        }
    }
    return true;
}

// A list as text: "80-82, 90"; a run may also fall. A text that is too long is cut, and that is success.
int ToPorts(char* szOutPorts, int nOutPorts, const PortList& ports);

// A PORTMAP_PROTOCOL, or -1 for a text other than "tcp", "udp", "all".
int ToProtocolEnum(const char* szProtocol);
// The reverse; empty for another value.
const char* ToProtocolString(PORTMAP_PROTOCOL protocol);

// The builders answer 0 or -1. The output array must be NULL on entry; it is the caller's.

// From a service's requests: the same ports on the router and on the box.
int CreateOperationRulesArray(OPERATION_RULE** pRgOutRules, int* pnOutRules, const char* szServiceName,
                              const __tag_TAVO_PORTMAP_RULE* rgRules, int nRules);
// From the rules of rule.conf. Whether both lists of a rule are of one length is not looked at.
int CreateOperationRulesArray(OPERATION_RULE** pRgOutRules, int* pnOutRules, const __tag_TAVO_ROUTER_RULE* rgRules,
                              int nRules);
// Back to public records: what is not deleted of the first array, then of the second, numbered from 1.
int CreateRulesArray(__tag_TAVO_ROUTER_RULE** pRgRules, int* pnRules, const OPERATION_RULE* rgRuleConfOpRules,
                     int nRuleConfOpRules, const OPERATION_RULE* rgOpRules, int nOpRules);
// Its worker: appends one array to rgRules, which has room for nRules and holds *pcRules.
int WriteRouterRules(int* pcRules, __tag_TAVO_ROUTER_RULE* rgRules, int nRules, const OPERATION_RULE* rgOpRules,
                     int nOpRules);

}  // namespace tavo::lib
