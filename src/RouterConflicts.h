// What other hosts already hold on a UPnP router. Relies on the operation rules. Promises: a router that is not known
// to speak UPnP is not asked, and takes nothing away; none of these names is exported.
#pragma once

#include <list>

#include "src/merge/OperationRules.h"

namespace tavo::lib {

// Appends the router's outside ports that enabled mappings of other hosts hold; asks a UPnP router.
int GetUsedRouterPortList(std::list<int>& tcpPorts, std::list<int>& udpPorts);

// Takes such ports out of the rules of the service (null: of all rules) in both arrays; a rule for both
// protocols loses those that are taken for TCP. Nothing happens without the settings of a UPnP router.
int DeleteConflictPortsForUPnPRouter(OPERATION_RULE* rgOpRules, int nOpRules, OPERATION_RULE* rgOpConfRules,
                                     int nOpConfRules, const char* szServiceName);

}  // namespace tavo::lib
