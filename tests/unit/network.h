// A network that a test scripts: what the checks, the router and the services answer. The stand-ins are in
// test_network.cpp; while gPNetwork is null, the real platform answers.
#pragma once

#include <dlfcn.h>

#include <functional>
#include <optional>
#include <string>

#include "tavo/upnp.h"

// What the network answers while a test has one; without one the real platform answers.
struct Network {
    int nInterface = 0;
    int nGateway = 0;
    int nWan = 0;
    std::optional<int> nLevel = 1;
    int nDns = 0;
    int nUpnpInit = 0;
    std::function<void()> fnInit;  // when a detection begins to look for UPnP
    int nUpnpPort = 0;             // the one last asked for
    std::optional<TAVO_UPNP_GATEWAY_MODEL> model = TAVO_UPNP_GATEWAY_MODEL{"Acme", "R1", "1.0"};
    int nServiceRestart = 0;
    int nRouterDbUpdates = 0;
    std::function<void()> fnRouterDbUpdate = [] {};
    std::optional<std::string> szAnnounced;
    std::function<void()> fnAnnounce;  // what else happens when avahi restarts
};
extern Network* gPNetwork;

// The platform's own function behind a stand-in.
template <typename Function>
Function* Real(const char* szName, Function*) {
    return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, szName));
}
