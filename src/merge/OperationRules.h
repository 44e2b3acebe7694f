// The working form of port rules while a service's request is merged: every rule with its ports as
// lists. Relies on the public records that rules come in and go out as. Promises: none of these names is exported; an
// OperationRules releases its block and every list in it on every path.
#pragma once

#include <cstring>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "MergeHost.h"
#include "PortList.h"
#include "libtavoportmap.h"

namespace tavo::lib {

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
    ~OwnedArray() { pfnFree(rgRules, nRules); }
    OwnedArray(const OwnedArray&) = delete;
    OwnedArray& operator=(const OwnedArray&) = delete;

    void MoveTo(Record** pRgOutRules, int* pnOutRules) {
        *pRgOutRules = std::exchange(rgRules, nullptr);
        *pnOutRules = std::exchange(nRules, 0);
    }

    Record* rgRules = nullptr;
    int nRules = 0;
};
using OperationRules = OwnedArray<OPERATION_RULE, FreeOperationRulesArray>;

// Frees a block of public records. NULL is ignored.
void FreeRouterRulesArray(__tag_TAVO_ROUTER_RULE* rgRules, int nRules);
using RouterRules = OwnedArray<__tag_TAVO_ROUTER_RULE, FreeRouterRulesArray>;

// Whether the rule is the service's. A name that does not fit a rule is that of the rules made under it.
inline bool IsOf(const OPERATION_RULE& rule, const char* szServiceName) {
    return std::strncmp(rule.szServiceName, szServiceName, TAVO_TEXT_SIZE - 1) == 0;
}

// Walks the pairs of a rule whose lists are there and of one length, from the last to the first, and takes
// out those that fnIsToGo(router port, box port) says; false, and no further, where it says nothing.
template <typename Judge>
bool RemovePairs(OPERATION_RULE& rule, Judge fnIsToGo) {
    std::vector<int> rgRouter(rule.routerPortSet->begin(), rule.routerPortSet->end());
    std::vector<int> rgBox(rule.boxPortSet->begin(), rule.boxPortSet->end());
    size_t nWalked = rgRouter.size();  // from here on, all pairs have been looked at;
    size_t nKept = nWalked;            // and from here on stand those that stay
    std::optional<bool> blToGo = false;
    while (nWalked > 0 && (blToGo = fnIsToGo(rgRouter[nWalked - 1], rgBox[nWalked - 1]))) {
        --nWalked;
        if (!*blToGo) {
            --nKept;
            rgRouter[nKept] = rgRouter[nWalked];
            rgBox[nKept] = rgBox[nWalked];
        }
    }
    if (nWalked < nKept) {
        for (auto& [pList, rgPorts] : {std::pair(rule.routerPortSet, &rgRouter), std::pair(rule.boxPortSet, &rgBox)}) {
            rgPorts->erase(rgPorts->begin() + static_cast<std::ptrdiff_t>(nWalked),
                           rgPorts->begin() + static_cast<std::ptrdiff_t>(nKept));
            *pList = PortList(rgPorts->begin(), rgPorts->end());
        }
    }
    return blToGo.has_value();
}

// Appends the ports of a text such as "80,443,5000-5010". 0 or -1; what stands before a bad token stays appended.
int ParsePorts(const MergeHost& host, PortList& ports, const char* szPort);

// A list as text: "80-82, 90"; a run may also fall. A text that is too long is cut, and that is success.
int ToPorts(const MergeHost& host, char* szOutPorts, int nOutPorts, const PortList& ports);
// The whole text; nothing for a list with an invalid port.
std::optional<std::string> ToText(const MergeHost& host, const PortList& ports);
// Whether a record holds the whole text of both lists with room to spare: one that fills it is taken for a cut one.
bool FitsRecord(const MergeHost& host, const OPERATION_RULE& rule);

// A PORTMAP_PROTOCOL, or -1 for a text other than "tcp", "udp", "all".
int ToProtocolEnum(const MergeHost& host, const char* szProtocol);
// The reverse; empty for another value.
const char* ToProtocolString(const MergeHost& host, PORTMAP_PROTOCOL protocol);

// The builders answer 0 or -1. The output array must be NULL on entry; it is the caller's.

// From a service's requests: the same ports on the router and on the box.
int CreateOperationRulesArray(const MergeHost& host, OPERATION_RULE** pRgOutRules, int* pnOutRules,
                              const char* szServiceName, const __tag_TAVO_PORTMAP_RULE* rgRules, int nRules);
// From the rules of rule.conf. Whether both lists of a rule are of one length is not looked at.
int CreateOperationRulesArray(const MergeHost& host, OPERATION_RULE** pRgOutRules, int* pnOutRules,
                              const __tag_TAVO_ROUTER_RULE* rgRules, int nRules);
// Back to public records: what is not deleted of the first array, then of the second, numbered from 1.
int CreateRulesArray(const MergeHost& host, __tag_TAVO_ROUTER_RULE** pRgRules, int* pnRules,
                     const OPERATION_RULE* rgRuleConfOpRules, int nRuleConfOpRules, const OPERATION_RULE* rgOpRules,
                     int nOpRules);
// Its worker: appends one array to rgRules, which has room for nRules and holds *pcRules.
int WriteRouterRules(const MergeHost& host, int* pcRules, __tag_TAVO_ROUTER_RULE* rgRules, int nRules,
                     const OPERATION_RULE* rgOpRules, int nOpRules);

}  // namespace tavo::lib
