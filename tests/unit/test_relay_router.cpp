// What the relay service's part asks the router: who holds which port, and what the gateway is; and the
// diagnostics' printed forms. The router's table and the box's interfaces are stand-ins.
#include <gtest/gtest.h>

#include "Border.h"
#include "HopLink.h"
#include "InitState.h"
#include "RouterConflicts.h"
#include "Text.h"
#include "network.h"
#include "stage.h"
#include "world.h"

Home* gPHome = nullptr;

namespace {

using Lines = std::vector<std::string>;

std::string Conf(const std::string& szBrand, const char* szModel, const char* szUpnp, const char* szNatpmp) {
    return "[192.168.1.1]\nbrand=" + szBrand + "\nmodel=" + szModel + "\nversion=1\nsupport_router_upnp=" + szUpnp +
           "\nsupport_router_natpmp=" + szNatpmp + "\n";
}

constexpr char kUpnpConf[] =
    "[192.168.1.1]\nbrand=Acme\nmodel=R1\nversion=1.0\nsupport_router_upnp=yes\nsupport_router_natpmp=no\n";

}  // namespace

extern "C" {
int TLIBNetGetInterfaceInfo(TAVO_NET_CARD* rgCards, int nRoom, int nKind) {
    if (gPHome == nullptr) {
        return Real("TLIBNetGetInterfaceInfo", &TLIBNetGetInterfaceInfo)(rgCards, nRoom, nKind);
    }
    return nRoom == 32 && nKind == 2 ? static_cast<int>(gPHome->cards.size()) : -1;
}
int TAVONetGetCard1(int nIndex, TAVO_NET_CARD* pCard) {
    if (gPHome == nullptr) {
        return Real("TAVONetGetCard1", &TAVONetGetCard1)(nIndex, pCard);
    }
    *pCard = gPHome->cards.at(static_cast<size_t>(nIndex));
    return 1;
}
int TAVOUpnpPortMappingGet(int nIndex, TAVO_UPNP_PORT_MAPPING* pMapping) {
    if (gPHome == nullptr) {
        return Real("TAVOUpnpPortMappingGet", &TAVOUpnpPortMappingGet)(nIndex, pMapping);
    }
    if (nIndex == 0 && gPHome->fnOnListing) {
        gPHome->fnOnListing();
    }
    if (static_cast<size_t>(nIndex) >= gPHome->mappings.size()) {
        return 713;
    }
    // A listing that says less than the entry itself: the client and the flag come with the look-up.
    *pMapping = gPHome->mappings[static_cast<size_t>(nIndex)];
    pMapping->szInternalClient[0] = '\0';
    pMapping->nEnabled = 1;
    return 0;
}
int TAVOUpnpPortMappingFind(int nPort, const char* szProtocol, TAVO_UPNP_PORT_MAPPING* pMapping) {
    if (gPHome == nullptr) {
        return Real("TAVOUpnpPortMappingFind", &TAVOUpnpPortMappingFind)(nPort, szProtocol, pMapping);
    }
    for (const TAVO_UPNP_PORT_MAPPING& mapping : gPHome->mappings) {
        if (mapping.nExternalPort == nPort && strcmp(mapping.szProtocol, szProtocol) == 0) {
            *pMapping = mapping;
            return 0;
        }
    }
    return 714;
}
}

namespace {

using namespace tavo::lib;

class RelayRouter : public StagedTest {
protected:
    void SetUp() override {
        std::filesystem::remove_all("/etc/portforward");
        Write("/etc/portforward/router_upnp.db",
              "[Acme/R1/1.0]\nsupport=yes\nmax=32\n[AirPort//]\nsupport=yes\nmax=5\n[Acme/R2/1]\nsupport=no\n");
        Write("/etc/portforward/router.conf", kUpnpConf);
        mHome.mappings = {{5000, 80, "TCP", "192.168.1.9", "", 1, 0}, {5001, 80, "TCP", "192.168.1.9", "", 0, 0},
                          {5002, 80, "TCP", "192.168.1.7", "", 1, 0}, {5003, 80, "UDP", "192.168.1.9", "", 1, 0},
                          {5004, 80, "GRE", "192.168.1.9", "", 1, 0}, {5005, 80, "TCP", "192.168.1.70", "", 1, 0}};
        StagedTest::SetUp();
        gPHome = &mHome;
        gPNetwork = &mNetwork;
    }
    // One request, and what is left of its ports.
    static std::string After(const char* szPorts, int nProtocol, int nExpected = 0) {
        __tag_TAVO_PORTMAP_RULE request = {};
        FillText(request.szPorts, szPorts);
        request.enProtocol = nProtocol;
        OperationRules rules;
        CreateOperationRulesArray(Host(), &rules.rgRules, &rules.nRules, "hop", &request, 1);
        EXPECT_EQ(DeleteConflictPortsForUPnPRouter(nullptr, 0, rules.rgRules, 1, "hop"), nExpected);
        char szLeft[TAVO_TEXT_SIZE] = {};
        ToPorts(Host(), szLeft, TAVO_TEXT_SIZE, *rules.rgRules->routerPortSet);
        EXPECT_EQ(*rules.rgRules->routerPortSet, *rules.rgRules->boxPortSet);
        EXPECT_EQ(rules.rgRules->blDeleted, rules.rgRules->routerPortSet->empty());
        return szLeft;
    }
    Home mHome;
    Network mNetwork;
};

TEST_F(RelayRouter, OtherHostsMappingsWin) {
    EXPECT_EQ(After("5000-5006", 0), "5001-5004, 5006");  // off, the box's own, another protocol: no conflict
    EXPECT_EQ(After("5000-5006", 1), "5000-5002, 5004-5006");
    EXPECT_EQ(After("5000-5006", 2), "5001-5004, 5006");
    EXPECT_EQ(After("5000", 7), "5000");
    EXPECT_EQ(After("5000,5000", 0), "");
    EXPECT_EQ(gLog, Lines(5, "unknown protocol=GRE"));
    EXPECT_EQ(mNetwork.nUpnpPort, 55002);
    std::list<int> tcpPorts = {1};
    std::list<int> udpPorts;
    EXPECT_EQ(TestFuncGetUsedRouterPortList(tcpPorts, udpPorts), 0);
    EXPECT_EQ(tcpPorts, std::list<int>({1, 5000, 5005}));
    EXPECT_EQ(udpPorts, std::list<int>({5003}));
}

TEST_F(RelayRouter, OnlyTheServicesRulesAndDeletedOnesToo) {
    __tag_TAVO_PORTMAP_RULE request = {0, "5000,5001", 0};
    OperationRules mine, others;
    CreateOperationRulesArray(Host(), &mine.rgRules, &mine.nRules, "hop", &request, 1);
    CreateOperationRulesArray(Host(), &others.rgRules, &others.nRules, "web", &request, 1);
    mine.rgRules->blDeleted = true;
    EXPECT_EQ(DeleteConflictPortsForUPnPRouter(mine.rgRules, 1, others.rgRules, 1, "hop"), 0);
    EXPECT_EQ(mine.rgRules->routerPortSet->size(), 1U);
    EXPECT_EQ(others.rgRules->routerPortSet->size(), 2U);
    EXPECT_EQ(DeleteConflictPortsForUPnPRouter(mine.rgRules, 1, others.rgRules, 1, nullptr), 0);
    EXPECT_EQ(others.rgRules->routerPortSet->size(), 1U);
    gLog.clear();
    others.rgRules->boxPortSet->push_back(9);
    EXPECT_EQ(DeleteConflictPortsForUPnPRouter(mine.rgRules, 1, others.rgRules, 1, nullptr), -1);
    EXPECT_EQ(gLog, Lines({"unknown protocol=GRE", "router port number = 1 != box port number =2",
                           "DeleteConflictPortsForUPnPRouter(rgOpConfRules[0]) failed"}));
}

TEST_F(RelayRouter, WhenTheRouterIsNotAskedAndWhenThatFails) {
    const std::string szNoMore = "GetDefaultGatewayInterfaceIp() failed\nGetUsedRouterPortList() failed";
    const auto fnConf = [](const char* szUpnp) {
        return [=] { Write("/etc/portforward/router.conf", Conf("A", "B", szUpnp, "no")); };
    };
    const std::tuple<const char*, std::function<void()>, int, std::string> rgCases[] = {
        {"no settings", [] { std::filesystem::remove("/etc/portforward/router.conf"); }, 0,
         "file=/etc/portforward/router.conf not exists"},
        {"a manual router", fnConf("no"), 0, ""},
        {"an odd word", fnConf("Yes"), -1, "non-support szSupport=Yes\nTLibSupportStringToEnum(Yes) failed"},
        {"no gateway", [] { gSzGateway.clear(); }, -1, "cannot get gateway router ip\nget gateway ip failed"},
        {"no interface", [this] { mHome.cards.clear(); }, -1, szNoMore},
        {"none on the gateway's side", [this] { mHome.cards.pop_back(); }, -1,
         "can not find default gateway correspond interface ip\n" + szNoMore},
        {"no router", [this] { mNetwork.nUpnpInit = 1; }, -1,
         "Cannot initialize upnp lib, ret = 1\n\nGetUsedRouterPortList() failed"},
        {"an empty table", [this] { mHome.mappings.clear(); }, 0, ""},
    };
    for (const auto& [szWhat, fnSpoil, nResult, szLines] : rgCases) {
        SetUp();
        mHome.cards = Home().cards;
        mNetwork = Network();
        fnSpoil();
        EXPECT_EQ(After("5000", 0, nResult), "5000") << szWhat;
        EXPECT_EQ(LastLines(szLines + "\n"), szLines) << szWhat << ", and nothing before it";
    }
    gLog.clear();
    EXPECT_EQ(DeleteConflictPortsForUPnPRouter(nullptr, 0, nullptr, 0, "hop"), 0);
    EXPECT_EQ(DeleteConflictPortsForUPnPRouter(nullptr, -1, nullptr, -1, "hop"), -1);
    EXPECT_EQ(DeleteConflictPortsForUPnPRouter(nullptr, 0, nullptr, -1, "hop"), -1);
    EXPECT_EQ(DeleteConflictPortsForUPnPRouter(nullptr, 1, nullptr, 1, "hop"), -1);
    EXPECT_EQ(DeleteConflictPortsForUPnPRouter(nullptr, 0, nullptr, 1, "hop"), -1);
    EXPECT_EQ(gLog, Lines({"0 > nOpRules=-1", "0 > nOpConfRules=-1", "rgOpRules == NULL", "rgOpConfRules == NULL"}));
}

// ---- what the gateway is ---------------------------------------------------------------------------------

TEST_F(RelayRouter, InitState) {
    const std::string szNoUserDb =
        "file not exist=/etc/portforward/router_upnp.db.user, this is case of compatibility fail";
    // Where the settings are empty, nothing is stored.
    const std::tuple<std::string, std::string, bool, int, int, std::string> rgCases[] = {
        {kUpnpConf, "", false, 0, 2, {}},
        {Conf("AirPort", "x", "no", "yes"), "", false, 0, 2, {}},
        {Conf("A", "B", "no", "no"), "[192.168.1.1]\nrouter_detect=upnp_natpmp\n", false, 0, 3, {}},
        {Conf("A", "B", "unknown", "no"), "", false, 0, 1, szNoUserDb},
        {Conf("Acme", "R2", "unknown", "no"), "", true, 0, 3, {}},
        {Conf("AirPort", "any", "unknown", "no"), "", true, 0, 2, {}},
        {Conf("A", "B", "no", "No"), "", false, -1, 0, "non-support szSupport=No\nTLibSupportStringToEnum(No) failed"},
        {"", "", false, 0, 1, {}},
        {"", "[10.0.0.1]\nrouter_detect=manual\n", false, 0, 1, {}},
        {"", "[192.168.1.1]\nrouter_detect=manual\n", false, 0, 3, {}},
        {"", "[192.168.1.1]\nrouter_detect=Manual\n", false, 0, 1, "invalid szValue=Manual"},
    };
    for (const auto& [szConf, szCache, blUserDb, nResult, nState, szLines] : rgCases) {
        SetUp();
        std::filesystem::remove("/etc/portforward/router.conf");
        if (!szConf.empty()) {
            Write("/etc/portforward/router.conf", szConf);
        }
        if (!szCache.empty()) {
            Write(SZF_DETECT_MANUAL_CACHE, szCache);
        }
        if (blUserDb) {
            Write("/etc/portforward/router_upnp.db.user", "");
        }
        auto enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
        EXPECT_EQ(GetInitState(&enState), nResult) << szConf << szCache;
        EXPECT_EQ(enState, nState) << szConf << szCache;
        std::erase(gLog, "file=/etc/portforward/router.conf not exists");
        EXPECT_EQ(LastLines(szLines + "\n"), szLines);
    }
    SetUp();
    auto enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
    RunOutOfMemory([&](const auto& fnArm) {
        enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
        fnArm();
        const int nResult = AtBorder(-1, [&] { return GetInitState(&enState); });
        gNGoodAllocations = -1;
        EXPECT_EQ(enState, nResult == 0 ? TAVO_ROUTER_INIT_STATE_UPNP_NATPMP : TAVO_ROUTER_INIT_STATE_UNKNOWN);
    });
    gSzGateway.clear();
    EXPECT_EQ(GetInitState(&enState), -1);
    EXPECT_TRUE(Logged("get gateway ip failed"));
}

// ---- the printed forms -------------------------------------------------------------------------------------

TEST_F(RelayRouter, PrintedRequestsAndConflicts) {
    std::string szNine = "hop";
    for (int i = 0; i < 9; ++i) {
        szNine += ";80;udp";
    }
    const std::tuple<std::string, int, std::string> rgCases[] = {
        {"hoplink;5000-5001,5005;tcp;;5000;udp", 0,
         "service name=hoplink\nports:5000-5001,5005 szProtocol:tcp\nports:5000 szProtocol:udp\n"
         "---- Begin to dump: before delete ----\n"
         "[0]: \nblEnable=1\nrouter_ports=5000-5001, 5005\nbox_ports=5000-5001, 5005\nprotocol=tcp\n\n"
         "[1]: \nblEnable=1\nrouter_ports=5000\nbox_ports=5000\nprotocol=udp\n\n"
         "---- Begin to dump: after delete ----\n"
         "[0]: \nblEnable=1\nrouter_ports=5001\nbox_ports=5001\nprotocol=tcp\n\n"
         "[1]: \nblEnable=1\nrouter_ports=5000\nbox_ports=5000\nprotocol=udp\n\n"},
        {"hop", 0, "service name=hop\n---- Begin to dump: before delete ----\n---- Begin to dump: after delete ----\n"},
        {"hop;5000", -1, "service name=hop\nports:5000 szProtocol:NULL\n"},
        {"hop;5000;TCP", -1, "service name=hop\nports:5000 szProtocol:TCP\nerr: unknown protocol=TCP"},
        {"hop;0;tcp", -1, "service name=hop\nports:0 szProtocol:tcp\nCreateOperationRulesArray(rgRules) failed\n"},
        {";;", -1, "Wrong format: ;;"},
    };
    for (const auto& [szRequest, nResult, szPrinted] : rgCases) {
        testing::internal::CaptureStdout();
        EXPECT_EQ(TestFuncDeleteConflictPortsForUPnPRouter(szRequest.c_str()), nResult);
        EXPECT_EQ(testing::internal::GetCapturedStdout(), szPrinted) << szRequest;
    }
    EXPECT_EQ(TestFuncDeleteConflictPortsForUPnPRouter(nullptr), -1);
    for (const auto& [szRequest, nResult, szLast] :
         {std::tuple(szNine, 0, "\n\n"), std::tuple(szNine + ";80;tcp", -1, "out of buf size\n"),
          std::tuple(std::string("hop;5000;all"), 0,
                     "[0]: (D)\nblEnable=1\nrouter_ports=\nbox_ports=\nprotocol=all\n\n")}) {
        testing::internal::CaptureStdout();
        EXPECT_EQ(TestFuncDeleteConflictPortsForUPnPRouter(szRequest.c_str()), nResult);
        EXPECT_TRUE(testing::internal::GetCapturedStdout().ends_with(szLast)) << szRequest;
    }
}

TEST_F(RelayRouter, PrintedRuleConf) {
    Write("/etc/portforward/rule.conf",
          "[1]\nenabled=1\ns_port=80-81\nr_port=90,91\nprotocol name=all\nservice=web\nservice_id=W\n");
    testing::internal::CaptureStdout();
    EXPECT_EQ(TestFuncCreateOpRulesByRuleConf(), 0);
    EXPECT_EQ(testing::internal::GetCapturedStdout(),
              "[0]\nenable=1\nprotocol=all\nrouter ports=90 ,91 \nbox ports=80 ,81 \nservice id=W\n"
              "service name=web\ntest conn status=0\ndeleted=0\n");
    Write("/etc/portforward/rule.conf", "[1]\nenabled=1\ns_port=x\nr_port=1\nprotocol name=all\n");
    EXPECT_EQ(TestFuncCreateOpRulesByRuleConf(), -1);
    EXPECT_TRUE(Logged("CreateOperationRulesArray(ruleConf) failed"));
}

}  // namespace
