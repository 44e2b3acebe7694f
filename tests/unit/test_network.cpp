// The stand-ins behind a scripted network; without one they pass on to the platform.
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "network.h"
#include "tavo/core.h"
#include "tavo/net.h"
#include "tavo/portforward.h"
#include "world.h"

Network* gPNetwork = nullptr;

extern "C" {
int checkGwIfEnable(char* szInterface, int nSize) {
    if (gPNetwork == nullptr) {
        return Real("checkGwIfEnable", &checkGwIfEnable)(szInterface, nSize);
    }
    snprintf(szInterface, static_cast<size_t>(nSize), "eth0");
    return gPNetwork->nInterface;
}
int checkDefaultGatewaySetting(char* szGateway, int nSize) {
    if (gPNetwork == nullptr) {
        return Real("checkDefaultGatewaySetting", &checkDefaultGatewaySetting)(szGateway, nSize);
    }
    snprintf(szGateway, static_cast<size_t>(nSize), "192.168.1.1");
    return gPNetwork->nGateway;
}
int checkConnectToWAN() {
    return gPNetwork == nullptr ? Real("checkConnectToWAN", &checkConnectToWAN)() : gPNetwork->nWan;
}
int checkDNSSetting() {
    return gPNetwork == nullptr ? Real("checkDNSSetting", &checkDNSSetting)() : gPNetwork->nDns;
}
int TAVOUpnpInit(int nLimit, int nPort) {
    if (gPNetwork == nullptr) {
        return Real("TAVOUpnpInit", &TAVOUpnpInit)(nLimit, nPort);
    }
    if (gPNetwork->fnInit) {
        gPNetwork->fnInit();
    }
    gPNetwork->nUpnpPort = nPort;
    return nLimit == 30 ? gPNetwork->nUpnpInit : 1;
}
int TAVOUpnpGatewayModelGet(TAVO_UPNP_GATEWAY_MODEL* pModel) {
    if (gPNetwork == nullptr) {
        return Real("TAVOUpnpGatewayModelGet", &TAVOUpnpGatewayModelGet)(pModel);
    }
    *pModel = gPNetwork->model.value_or(TAVO_UPNP_GATEWAY_MODEL{});
    return gPNetwork->model ? 0 : -1;
}
pid_t TLIBCProcFork() {
    if (gPNetwork != nullptr && gPNetwork->blForkFails) {
        errno = EAGAIN;
        return -1;
    }
    const pid_t pid = Real("TLIBCProcFork", &TLIBCProcFork)();
    if (pid == 0 && gPNetwork != nullptr) {
        gPNetwork->fnChild();
    }
    return pid;
}
int TLIBServiceRestart(const char* szName) {
    if (gPNetwork == nullptr) {
        return Real("TLIBServiceRestart", &TLIBServiceRestart)(szName);
    }
    const OwnMemory own;
    if (gPNetwork->szAnnounced) {
        Write("/tmp/airport.tcp.local", *gPNetwork->szAnnounced);
    }
    if (gPNetwork->fnAnnounce) {
        gPNetwork->fnAnnounce();
    }
    return strcmp(szName, "avahi") == 0 ? gPNetwork->nServiceRestart : -2;
}
int TAVOPFRouterDBUpdate() {
    if (gPNetwork == nullptr) {
        return Real("TAVOPFRouterDBUpdate", &TAVOPFRouterDBUpdate)();
    }
    ++gPNetwork->nRouterDbUpdates;
    gPNetwork->fnRouterDbUpdate();
    return gPNetwork->nRouterDbUpdate;
}
}

int getPublicIPLevel(int& nLevel, int nHops) {
    if (gPNetwork == nullptr) {
        return Real("_Z16getPublicIPLevelRii", &getPublicIPLevel)(nLevel, nHops);
    }
    nLevel = gPNetwork->nLevel.value_or(nLevel);
    return nHops == 3 && gPNetwork->nLevel ? 0 : -1;
}
