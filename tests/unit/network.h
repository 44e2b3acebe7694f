// A network that a test scripts: what the checks, the router, the services and the test client answer. The
// stand-ins are in test_network.cpp, test_relay_router.cpp (the router's table) and test_router_tests.cpp
// (the test client); while the pointer to one of these is null, the real platform answers.
#pragma once

#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "tavo/net.h"
#include "tavo/upnp.h"
#include "world.h"

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
    bool blForkFails = false;
    std::function<void()> fnChild = [] {};  // first thing that the detection's child does
    int nServiceRestart = 0;
    int nRouterDbUpdates = 0;
    int nRouterDbUpdate = 1;  // what each answers
    std::function<void()> fnRouterDbUpdate = [] {};
    std::optional<std::string> szAnnounced;
    std::function<void()> fnAnnounce;  // what else happens when avahi restarts
};
extern Network* gPNetwork;
// This box's address towards the gateway; empty: the real platform tells.
extern std::string gSzBox;

// The router's table and the box's interfaces, while a test has them.
struct Home {
    std::vector<TAVO_UPNP_PORT_MAPPING> mappings;
    std::vector<TAVO_NET_CARD> cards = {{"tun0", "10.9.9.2", "255.255.255.0"},
                                        {"eth0", "192.168.1.7", "255.255.255.0"}};
    std::function<void()> fnOnListing;  // called when the table is read from its start
};
extern Home* gPHome;

// The answers of the test client; a step's word is what stands in the progress file once it is asked for, and
// for the count what stands there once it is reported.
struct TestClient {
    int nWanted = 10;  // mappings that the caller is to ask for
    std::map<std::string, int> mapAnswers;
    std::map<std::string, std::string> mapWords;
    std::vector<std::string> rgszCalls;
    std::vector<std::string> rgszReported;  // what a user is shown, as "step=word"
    int nTester = 0;
    std::vector<int> rgVerdicts;
    std::vector<std::string> rgszRouterLog;

    int Call(const std::string& szCall, int nDefault) {
        const OwnMemory own;
        rgszCalls.push_back(szCall);
        const auto it = mapAnswers.find(szCall);
        return it == mapAnswers.end() ? nDefault : it->second;
    }
};
extern TestClient* gPClient;
