// Takes away what other hosts already hold on a UPnP router. Relies on the router's settings and on the
// platform's UPnP client and network library. Promises: a router that is not known to speak UPnP is not
// asked, and takes nothing away.
#include <cstring>
#include <unordered_set>

#include "merge/RuleConflicts.h"
#include "tavo/net.h"
#include "tavo/upnp.h"

namespace tavo::lib {

namespace {

constexpr int kMaxInterfaces = 32;
constexpr int kInterfacesWithAddress = 2;  // the network library's kind: up, with an address, no loopback
constexpr size_t kGatewaySize = 20;
constexpr int kSearchLimitSeconds = 30;
constexpr int kSearchLocalPort = 55002;

using PortSet = std::unordered_set<int>;

struct UsedPorts {
    PortSet tcp;
    PortSet udp;
};

// The box's address on the gateway's subnet.
bool GetDefaultGatewayInterfaceIp(std::string& szLocal) {
    TAVO_NET_CARD rgCards[kMaxInterfaces] = {};
    const int nCards = TLIBNetGetInterfaceInfo(rgCards, kMaxInterfaces, kInterfacesWithAddress);
    if (nCards < 1) {
        return false;
    }
    char szGateway[kGatewaySize] = {};
    if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) == -1) {
        LogError("%s:%d TAVONetDefaultGatewayGet() failed", kHopLinkFile, __LINE__);
        return false;
    }
    for (int i = 0; i < nCards; ++i) {
        TAVO_NET_CARD card = {};
        if (TAVONetGetCard1(i, &card) > 0 && TAVONetIsSameSubnet(szGateway, card.szAddress, card.szMask) == 1) {
            szLocal = card.szAddress;
            return true;
        }
    }
    LogError("%s:%d can not find default gateway correspond interface ip", kHopLinkFile, __LINE__);
    return false;
}

// One mapping of the router's table that is in force and not the box's own.
void AppendUsedPort(PortList& tcpPorts, PortList& udpPorts, const TAVO_UPNP_PORT_MAPPING& mapping) {
    if (std::strcmp(mapping.szProtocol, "TCP") == 0) {
        tcpPorts.push_back(mapping.nExternalPort);
    } else if (std::strcmp(mapping.szProtocol, "UDP") == 0) {
        udpPorts.push_back(mapping.nExternalPort);
    } else {
        LogError("%s:%d unknown protocol=%s", kHopLinkFile, __LINE__, mapping.szProtocol);
    }
}

bool IsUpnpRouter(const std::string& szGateway, bool& blUpnp) {
    auto pConf = std::make_unique<__tag_TAVO_ROUTER_CONF>();
    blUpnp = false;
    if (TLibGetRouterConf(szGateway.c_str(), pConf.get(), nullptr, false) != 0) {
        return true;
    }
    auto enSupport = TAVO_ROUTER_SUPPORT_NO;
    if (TLibSupportStringToEnum(&enSupport, pConf->szSupportUpnp) != 0) {
        LogError("%s:%d TLibSupportStringToEnum(%s) failed", kHopLinkFile, __LINE__, pConf->szSupportUpnp);
        return false;
    }
    blUpnp = enSupport == TAVO_ROUTER_SUPPORT_YES;
    return true;
}

bool HasEqualSides(const OPERATION_RULE& opRule) {
    if (opRule.routerPortSet->size() == opRule.boxPortSet->size()) {
        return true;
    }
    LogError("%s:%d router port number = %d != box port number =%d", kHopLinkFile, __LINE__,
             static_cast<int>(opRule.routerPortSet->size()), static_cast<int>(opRule.boxPortSet->size()));
    return false;
}

// A rule for both protocols is held against the TCP mappings alone; that is meant.
const PortSet* UsedBy(PORTMAP_PROTOCOL protocol, const UsedPorts& used) {
    switch (protocol) {
        case PORTMAP_PROTOCOL_TCP:
        case PORTMAP_PROTOCOL_ALL:
            return &used.tcp;
        case PORTMAP_PROTOCOL_UDP:
            return &used.udp;
    }
    return nullptr;
}

int DeleteConflictPortsFromOpRule(OPERATION_RULE& opRule, const UsedPorts& used) {
    if (opRule.routerPortSet == nullptr) {
        LogError("%s:%d opRule.routerPortSet == NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (opRule.boxPortSet == nullptr) {
        LogError("%s:%d opRule.boxPortSet == NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (!HasEqualSides(opRule)) {
        return -1;
    }
    if (opRule.routerPortSet->empty()) {
        return 0;
    }
    const PortSet* pUsed = UsedBy(opRule.protocol, used);
    RemovePairs(opRule, [pUsed](int nRouterPort, int /*nBoxPort*/) {
        return std::optional(pUsed != nullptr && pUsed->count(nRouterPort) != 0);
    });
    if (!HasEqualSides(opRule)) {
        return -1;
    }
    if (opRule.routerPortSet->empty()) {
        opRule.blDeleted = true;
    }
    return 0;
}

bool CheckArguments(const OPERATION_RULE* rgOpRules, int nOpRules, const OPERATION_RULE* rgOpConfRules,
                    int nOpConfRules) {
    if (nOpRules < 0) {
        LogError("%s:%d 0 > nOpRules=%d", kHopLinkFile, __LINE__, nOpRules);
        return false;
    }
    if (nOpConfRules < 0) {
        LogError("%s:%d 0 > nOpConfRules=%d", kHopLinkFile, __LINE__, nOpConfRules);
        return false;
    }
    if (nOpRules > 0 && rgOpRules == nullptr) {
        LogError("%s:%d rgOpRules == NULL", kHopLinkFile, __LINE__);
        return false;
    }
    if (nOpConfRules > 0 && rgOpConfRules == nullptr) {
        LogError("%s:%d rgOpConfRules == NULL", kHopLinkFile, __LINE__);
        return false;
    }
    return true;
}

// The service's rules of one array (all of them for a null name), the deleted ones too. szFailure takes the
// file, the line and the index.
bool DeleteConflictPorts(OPERATION_RULE* rgOpRules, int nOpRules, const char* szServiceName, const UsedPorts& used,
                         const char* szFailure) {
    for (int i = 0; i < nOpRules; ++i) {
        if (szServiceName != nullptr && !IsOf(rgOpRules[i], szServiceName)) {
            continue;
        }
        if (DeleteConflictPortsFromOpRule(rgOpRules[i], used) != 0) {
            LogError(szFailure, kHopLinkFile, __LINE__, i);
            return false;
        }
    }
    return true;
}

}  // namespace

int GetUsedRouterPortList(PortList& tcpPorts, PortList& udpPorts) {
    std::string szLocal;
    if (!GetDefaultGatewayInterfaceIp(szLocal)) {
        LogError("%s:%d GetDefaultGatewayInterfaceIp() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    // The client is left as it is: whoever looks next finds the router known.
    const int nResult = TAVOUpnpInit(kSearchLimitSeconds, kSearchLocalPort);
    if (nResult != 0) {
        LogError("%s:%d Cannot initialize upnp lib, ret = %d\n", kHopLinkFile, __LINE__, nResult);
        return -1;
    }
    TAVO_UPNP_PORT_MAPPING mapping = {};
    if (TAVOUpnpPortMappingGet(0, &mapping) != 0) {
        return 0;  // no mappings
    }
    for (int i = 0; TAVOUpnpPortMappingGet(i, &mapping) == 0; ++i) {
        TAVOUpnpPortMappingFind(mapping.nExternalPort, mapping.szProtocol, &mapping);
        if (mapping.nEnabled != 0 && mapping.szInternalClient != szLocal) {
            AppendUsedPort(tcpPorts, udpPorts, mapping);
        }
    }
    return 0;
}

int DeleteConflictPortsForUPnPRouter(OPERATION_RULE* rgOpRules, int nOpRules, OPERATION_RULE* rgOpConfRules,
                                     int nOpConfRules, const char* szServiceName) {
    if (!CheckArguments(rgOpRules, nOpRules, rgOpConfRules, nOpConfRules)) {
        return -1;
    }
    if (nOpRules == 0 && nOpConfRules == 0) {
        return 0;
    }
    std::string szGateway;
    if (GetGatewayIP(szGateway) == 0) {
        LogError("%s:%d get gateway ip failed", kHopLinkFile, __LINE__);
        return -1;
    }
    bool blUpnp = false;
    if (!IsUpnpRouter(szGateway, blUpnp)) {
        return -1;
    }
    if (!blUpnp) {
        return 0;
    }
    PortList tcpPorts;
    PortList udpPorts;
    if (GetUsedRouterPortList(tcpPorts, udpPorts) != 0) {
        LogError("%s:%d GetUsedRouterPortList() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    const UsedPorts used{PortSet(tcpPorts.begin(), tcpPorts.end()), PortSet(udpPorts.begin(), udpPorts.end())};
    return DeleteConflictPorts(rgOpRules, nOpRules, szServiceName, used,
                               "%s:%d DeleteConflictPortsForUPnPRouter(rgOpRules[%d]) failed") &&
                   DeleteConflictPorts(rgOpConfRules, nOpConfRules, szServiceName, used,
                                       "%s:%d DeleteConflictPortsForUPnPRouter(rgOpConfRules[%d]) failed")
               ? 0
               : -1;
}

}  // namespace tavo::lib
