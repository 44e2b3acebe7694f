// Asks a UPnP router what other hosts hold, and takes it away. Relies on the router's settings, on the platform's UPnP
// client and network library, and on the merge. Promises: see RouterConflicts.h.

#include "RouterConflicts.h"

#include <cstring>
#include <memory>

#include "HopLink.h"
#include "Log.h"
#include "src/merge/UsedPorts.h"
#include "tavo/net.h"
#include "tavo/upnp.h"

namespace tavo::lib {

namespace {

constexpr int kMaxInterfaces = 32;
constexpr int kInterfacesWithAddress = 2;  // the network library's kind: up, with an address, no loopback
constexpr size_t kGatewaySize = 20;
constexpr int kSearchLimitSeconds = 30;
constexpr int kSearchLocalPort = 55002;

// The box's address on the gateway's subnet.
bool GetDefaultGatewayInterfaceIp(std::string& szLocal) {
    TAVO_NET_CARD rgCards[kMaxInterfaces] = {};
    const int nCards = TLIBNetGetInterfaceInfo(rgCards, kMaxInterfaces, kInterfacesWithAddress);
    if (nCards < 1) {
        return false;
    }
    char szGateway[kGatewaySize] = {};
    if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) == -1) {
        return Refuse("%s:%d TAVONetDefaultGatewayGet() failed", kHopLinkFile, __LINE__);
    }
    for (int i = 0; i < nCards; ++i) {
        TAVO_NET_CARD card = {};
        if (TAVONetGetCard1(i, &card) > 0 && TAVONetIsSameSubnet(szGateway, card.szAddress, card.szMask) == 1) {
            szLocal = card.szAddress;
            return true;
        }
    }
    return Refuse("%s:%d can not find default gateway correspond interface ip", kHopLinkFile, __LINE__);
}

// One mapping of the router's table that is in force and not the box's own.
void AppendUsedPort(std::list<int>& tcpPorts, std::list<int>& udpPorts, const TAVO_UPNP_PORT_MAPPING& mapping) {
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
        return Refuse("%s:%d TLibSupportStringToEnum(%s) failed", kHopLinkFile, __LINE__, pConf->szSupportUpnp);
    }
    blUpnp = enSupport == TAVO_ROUTER_SUPPORT_YES;
    return true;
}

bool CheckArguments(const OPERATION_RULE* rgOpRules, int nOpRules, const OPERATION_RULE* rgOpConfRules,
                    int nOpConfRules) {
    if (nOpRules < 0) {
        return Refuse("%s:%d 0 > nOpRules=%d", kHopLinkFile, __LINE__, nOpRules);
    }
    if (nOpConfRules < 0) {
        return Refuse("%s:%d 0 > nOpConfRules=%d", kHopLinkFile, __LINE__, nOpConfRules);
    }
    if (nOpRules > 0 && rgOpRules == nullptr) {
        return Refuse("%s:%d rgOpRules == NULL", kHopLinkFile, __LINE__);
    }
    if (nOpConfRules > 0 && rgOpConfRules == nullptr) {
        return Refuse("%s:%d rgOpConfRules == NULL", kHopLinkFile, __LINE__);
    }
    return true;
}

}  // namespace

int GetUsedRouterPortList(std::list<int>& tcpPorts, std::list<int>& udpPorts) {
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
    std::list<int> tcpPorts;
    std::list<int> udpPorts;
    if (GetUsedRouterPortList(tcpPorts, udpPorts) != 0) {
        LogError("%s:%d GetUsedRouterPortList() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    return DeleteUsedPorts(Host(), rgOpRules, nOpRules, rgOpConfRules, nOpConfRules, szServiceName,
                           {{tcpPorts.begin(), tcpPorts.end()}, {udpPorts.begin(), udpPorts.end()}});
}

}  // namespace tavo::lib
