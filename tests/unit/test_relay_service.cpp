// The relay service's entry points over real files: who keeps a port in rule.conf, every way to fail, the
// classification of the router, and the diagnostics' printed forms. The router's table, its answers and the
// port tester are stand-ins; daemons are played on the stage.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <set>

#include "HopLink.h"
#include "Text.h"
#include "network.h"
#include "programs/common/RuleFile.h"
#include "stage.h"
#include "tavo/core.h"
#include "world.h"

namespace {

using Lines = std::vector<std::string>;
using Request = __tag_TAVO_PORTMAP_RULE;
using Requests = std::vector<Request>;

constexpr char kRuleConf[] = "/etc/portforward/rule.conf";
constexpr char kRouterConf[] = "/etc/portforward/router.conf";
constexpr char kUserDb[] = "/etc/portforward/router_upnp.db.user";
constexpr char kSystemConf[] = "/etc/tavoinfo.conf";
constexpr char kTool[] = "/usr/tavo/bin/tavoportforward";
constexpr int kUntouched = 9;

std::string Conf(const std::string& szModel, const char* szUpnp, const char* szNatpmp) {
    return "[192.168.1.1]\nbrand=\"Acme\"\nmodel=\"" + szModel + "\"\nversion=\"1.0\"\nsupport_router_upnp=\"" +
           szUpnp + "\"\nsupport_router_natpmp=\"" + szNatpmp + "\"\n";
}

// "E tcp 80 80 hop HopLink; D all 5 5": enabled or not, protocol, router and box ports, service and its id.
std::string Stored(const std::string& szRules) {
    std::string szText;
    std::istringstream rules(szRules);
    int nId = 7;
    for (std::string szRule; std::getline(rules, szRule, ';'); ++nId) {
        std::istringstream fields(szRule);
        std::string szEnable, szProtocol, szRouter, szBox, szService, szId;
        fields >> szEnable >> szProtocol >> szRouter >> szBox >> szService >> szId;
        szText += "[" + std::to_string(nId) + "]\nenabled=\"" + (szEnable == "E" ? "1" : "0") + "\"\ns_port=\"" +
                  szBox + "\"\nr_port=\"" + szRouter + "\"\nprotocol name=\"" + szProtocol + "\"\nservice_id=\"" +
                  szId + "\"\nservice=\"" + szService + "\"\n\n";
    }
    return szText;
}

// What stands in rule.conf, in the same form with the numbers before it.
std::string Kept() {
    tavo::lib::RouterRules rules;
    TLibGetRulesArrFromRuleConf(&rules.nRules, &rules.rgRules, nullptr, false, nullptr);
    std::string szKept;
    for (int i = 0; i < rules.nRules; ++i) {
        const __tag_TAVO_ROUTER_RULE& rule = rules.rgRules[i];
        szKept += szKept.empty() ? "" : "; ";
        szKept += std::string(rule.szRuleID) + (rule.blEnable ? " E " : " D ") + rule.szProtocol;
        for (const char* szField : {rule.szRouterPort, rule.szSrcPort, rule.szServiceName, rule.szServiceID}) {
            szKept += *szField == '\0' ? "" : " ";
            for (const char* pChar = szField; *pChar != '\0'; ++pChar) {
                szKept += *pChar == ' ' ? "" : std::string(1, *pChar);
            }
        }
    }
    return szKept;
}

// "80,443/tcp 5/all"
Requests Ask(const std::string& szRequests) {
    Requests rgRequests;
    std::istringstream words(szRequests);
    for (std::string szWord; words >> szWord;) {
        const size_t nSlash = szWord.find('/');
        Request request = {kUntouched, "",
                           tavo::lib::ToProtocolEnum(tavo::lib::Host(), szWord.substr(nSlash + 1).c_str())};
        tavo::lib::FillText(request.szPorts, szWord.substr(0, nSlash));
        rgRequests.push_back(request);
    }
    return rgRequests;
}

std::string Statuses(const Requests& rgRequests) {
    std::string szStatuses;
    for (const Request& request : rgRequests) {
        szStatuses += std::to_string(request.nTestConnStatus);
    }
    return szStatuses;
}

int Set(const char* szService, Requests& rgRequests, bool blTest = false) {
    return TLibTavoPortMapRulesSet(szService, rgRequests.empty() ? nullptr : rgRequests.data(),
                                   static_cast<int>(rgRequests.size()), blTest);
}

bool LockIsFree() {
    return IsLockFree("/tmp/routerconf.lock");
}

// One after the other.
template <typename... Steps>
std::function<void()> All(Steps... fnSteps) {
    return [=] { (fnSteps(), ...); };
}

std::function<void()> Settings(const char* szUpnp, const char* szNatpmp) {
    return [=] { Write(kRouterConf, Conf("R1", szUpnp, szNatpmp)); };
}

void CacheUnknown() {
    std::filesystem::remove(kRouterConf);
    Write(SZF_DETECT_MANUAL_CACHE, "[192.168.1.1]\nrouter_detect=\"unknown\"\n");
}

class RelayService : public StagedTest {
protected:
    void SetUp() override {
        for (const char* szPath : {"/etc/portforward", "/var/lib/tavo/tasks", "/etc.defaults/portforward", kSystemConf,
                                   "/tmp/pfStatusRule", "/tmp/airport.tcp.local", "/tmp/pfProgress"}) {
            std::filesystem::remove_all(szPath);
        }
        Write("/etc/portforward/router_upnp.db",
              "[Acme/R1/1.0]\nsupport=yes\nmax=32\n[AirPort//]\nsupport=yes\nmax=5\n[Acme/No/1.0]\nsupport=no\n");
        Write(kRouterConf, Conf("R1", "yes", "no"));
        Write("/var/tmp/upnp_portmap.status", "80/tcp=1\n");
        WriteProgram(kTool, "");
        mNetwork = Network();
        mHome = Home();
        mHome.mappings = {{5000, 80, "TCP", "192.168.1.9", "", 1, 0}, {5002, 80, "TCP", "192.168.1.7", "", 1, 0}};
        mClient = TestClient();
        mClient.nWanted = 60;
        mClient.rgVerdicts = {2, 3, 0};
        StagedTest::SetUp();
        gPNetwork = &mNetwork;
        gPHome = &mHome;
        gPClient = &mClient;
        gStage.blOn = true;
        gFnOnSleep = [] { unlink("/tmp/pfProgress"); };
    }
    Network mNetwork;
    Home mHome;
    TestClient mClient;
};

// ---- the merge --------------------------------------------------------------------------------------------

TEST_F(RelayService, WhoKeepsAPort) {
    const std::string szPartial = "failed, port is partial matched";
    const struct {
        const char* szStored;
        const char* szRequest;
        const char* szKept;         // null: refused, nothing changes
        const char* szPass = "";    // at which it is refused
        std::string szReason = {};  // and why
    } rgCases[] = {
        // the service's own enabled rules are replaced whole, its name taken to the letter
        {"E tcp 80 80 hop; E tcp 81 81 Hop", "82/tcp", "1 E tcp 81 81 Hop; 2 E tcp 82 82 hop"},
        // its disabled rules keep what it still asks for, and it goes without that
        {"D tcp 80,443 80,443 hop", "443,8080/tcp", "1 D tcp 443 443 hop; 2 E tcp 8080 8080 hop"},
        {"D tcp 80 80 hop", "80/tcp", "1 D tcp 80 80 hop"},
        {"D tcp 80 80 hop", "81/tcp", "1 E tcp 81 81 hop"},
        {"D tcp 80 80 hop", "80/all", "1 D tcp 80 80 hop; 2 E all 80 80 hop"},
        // whoever maps a port already keeps it
        {"E tcp 80 80", "80/tcp", "1 E tcp 80 80"},
        {"E tcp 81 81", "80-82,80/tcp 81/udp", "1 E tcp 81 81; 2 E tcp 80,82,80 80,82,80 hop; 3 E udp 81 81 hop"},
        {"E tcp 80 80 web W", "80/tcp 81/tcp", "1 E tcp 80 80 web W; 2 E tcp 81 81 hop"},
        {"E all 80 80", "80/tcp 80/udp 80/all", "1 E all 80 80"},
        {"E tcp 80 80", "80/all", "1 E tcp 80 80; 2 E all 80 80 hop"},
        {"D tcp 80 80", "80/tcp", "1 D tcp 80 80; 2 E tcp 80 80 hop"},
        {"E tcp 80-81 90-91", "82-83/tcp", "1 E tcp 80-81 90-91; 2 E tcp 82-83 82-83 hop"},
        // and so do other hosts, against the service only
        {"E tcp 5000 5000", "5001/tcp", "1 E tcp 5000 5000; 2 E tcp 5001 5001 hop"},
        {"D tcp 5000 5000 hop", "5000,5002/tcp 5000/all 5000/udp", "1 E tcp 5002 5002 hop; 2 E udp 5000 5000 hop"},
        // an empty request takes all of the service's rules away; what is left keeps its ports
        {"E tcp 80 80 hop; E udp 9,10 9,10; D tcp 81 81 hop; D all 5 5 web", "", "1 E udp 9-10 9-10; 2 D all 5 5 web"},
        {"E tcp 80 80 hop", "", ""},
        {"", "82-80/tcp", "1 E tcp 80-82 80-82 hop"},
        // the first rule that has either port decides
        {"E tcp 80 80; E tcp 80 81", "80/tcp", "1 E tcp 80 80; 2 E tcp 80 81"},
        // half an overlap decides nothing
        {"E tcp 80,81 81,80", "80/tcp", nullptr, "C->A", szPartial},
        {"E tcp 8080 80", "80/tcp", nullptr, "C->A", szPartial},
        {"E tcp 80 8080", "81/udp 80/tcp", nullptr, "C->A", szPartial},
        {"D tcp 80 81 hop", "80/tcp", nullptr, "B->C", szPartial},
        {"D tcp 80,81 80 hop", "80/tcp", nullptr, "B->C", "begin, router port numbers=2 != box port numbers=1"},
    };
    for (const auto& c : rgCases) {
        SCOPED_TRACE(std::string(c.szStored) + " <- " + c.szRequest);
        SetUp();
        Write(kRuleConf, Stored(c.szStored));
        Requests rgRequests = Ask(c.szRequest);
        EXPECT_EQ(Set("hop", rgRequests), c.szKept == nullptr ? -1 : 0);
        if (c.szKept == nullptr) {
            EXPECT_EQ(Read(kRuleConf), Stored(c.szStored));
            EXPECT_EQ(gLog,
                      Lines({c.szReason, std::string("DeletePortsFromRules1(") + c.szPass + ") failed",
                             "DeletePortsFromRuleConf(input rules=" + std::to_string(rgRequests.size()) + ") failed"}));
            EXPECT_FALSE(std::filesystem::exists(kSystemConf));
        } else {
            EXPECT_EQ(Kept(), c.szKept);
            EXPECT_EQ(gLog.back(), "> reload tavorelayd");
        }
        EXPECT_EQ(Statuses(rgRequests), std::string(rgRequests.size(), '9'));
        EXPECT_TRUE(LockIsFree());
    }
}

// The merge writes a user's list with a blank behind each comma, and what its record does not hold is lost.
TEST_F(RelayService, WhatTheMergeCutsOpensNoPortThatNobodyWrote) {
    for (const std::string szFirst :
         {"1", "22", "333", "4444", "55555", "100-109"}) {  // the cut wanders through a number
        SetUp();
        std::string szPorts = szFirst;
        for (int nPort = 20001; szPorts.size() + 6 < 1000; nPort += 2) {
            szPorts += "," + std::to_string(nPort);
        }
        Write(kRuleConf, Stored("E tcp " + szPorts + " " + szPorts));
        Write(kSystemConf, "runupnpportmapping=\"yes\"\n");
        const auto fnWanted = [] {
            std::set<int> wanted;
            for (const auto& mapping : tavo::ReadWanted("runupnpportmapping").rgMappings) {
                wanted.insert(mapping.nRouterPort);
            }
            return wanted;
        };
        const std::set<int> written = fnWanted();
        Requests rgRequests = Ask("9/udp");
        ASSERT_EQ(Set("hop", rgRequests), 0);
        std::set<int> wanted = fnWanted();
        EXPECT_EQ(wanted.erase(9), 1U);
        EXPECT_GT(wanted.size(), 140U) << szFirst;
        EXPECT_TRUE(std::includes(written.begin(), written.end(), wanted.begin(), wanted.end())) << szFirst;
        ASSERT_EQ(tavo::ReadWanted("runupnpportmapping").rgRefused.size(), 1U);
    }
}

TEST_F(RelayService, ANatpmpRouterIsNotAskedForItsTable) {
    Write(kRouterConf, Conf("R1", "no", "yes"));
    Write("/var/tmp/natpmp_portmap.remap", "");
    Requests rgRequests = Ask("5000/tcp");
    EXPECT_EQ(Set("hoplink", rgRequests), 0);
    EXPECT_EQ(Kept(), "1 E tcp 5000 5000 hoplink HopLink");
    EXPECT_EQ(mNetwork.nUpnpPort, 0);
}

// ---- saving and testing -------------------------------------------------------------------------------------

TEST_F(RelayService, SavesUnderItsLockThenTestsAllThatWasAskedFor) {
    Write(kRuleConf, Stored("E tcp 80 80"));
    Requests rgRequests = Ask("80/tcp 5000/tcp 6000/udp");
    EXPECT_EQ(Set("hop", rgRequests, true), 0);
    EXPECT_EQ(Kept(), "1 E tcp 80 80; 2 E udp 6000 6000 hop");
    EXPECT_EQ(Statuses(rgRequests), "231");
    EXPECT_EQ(gLog, Lines({"> runnatpmpportmapping=no", "> runupnpportmapping=no", "> write /etc/portforward/rule.conf",
                           "> runupnpportmapping=yes", "> exec /usr/tavo/sbin/upnpd", "upnp daemon is alive now",
                           "upnpd checking is done", "> ask tavorelayd, still locked", "> reload tavorelayd"}));
    EXPECT_EQ(mClient.rgszCalls, Lines({"init", "test"}));
    mClient.rgszCalls.clear();
    Requests rgNone;
    EXPECT_EQ(Set("hop", rgNone, true), 0);
    EXPECT_EQ(mClient.rgszCalls, Lines());
}

TEST_F(RelayService, EachStepThatFails) {
    const std::string szOld = Stored("E tcp 80 80; E tcp 81 81 hop");
    const std::string szLong = std::string("10000-10001") + std::string(1002, ',') + "12,443,4433";
    Requests rgRequests;
    const auto fnRule = [](const std::string& szRule) { return [=] { Write(kRuleConf, Stored(szRule)); }; };
    const auto fnFail = [](const char* szFail) { return [=] { gStage.szFail = szFail; }; };
    const struct {
        const char* szWhat;
        std::function<void()> fnSpoil;
        int nResult;
        const char* szLines;  // the last ones
        bool blSaved = false;
    } rgFaults[] = {
        {"lock held", [] { TLibTavoPortMapLock(); }, 2,
         "PortForwarding conflict = /tmp/routerconf.lock, other user is doing portforwarding"},
        {"no gateway", [] { gSzGateway.clear(); }, -1,
         "cannot get gateway router ip\nget gateway ip failed\nGetInitState() failed"},
        {"never detected", [] { std::filesystem::remove(kRouterConf); }, 1,
         "file=/etc/portforward/router.conf not exists\nNot initialized portforwarding"},
        {"a cache of the unknown", CacheUnknown, -1, "failed, state is unknown"},
        {"a manual router", Settings("no", "no"), -1, "Can not set rules for manual router"},
        {"a rule of another protocol", fnRule("E TCP 80 80"), -1,
         "Bad parameter, szProtocol=TCP\nToProtocolEnum([0]=-1) failed\nCreateOperationRulesArray(ruleConf) failed"},
        {"a list that a record would cut", fnRule("E tcp " + szLong + " " + szLong), -1,
         "TAVOPFRuleGetByIdList() failed\nTLibGetRulesArrFromRuleConf() failed"},
        {"no port asked for", [&] { rgRequests = Ask("0/tcp"); }, -1,
         "invalid port no [0]\nTLibParsePorts() for routerPort failed\nCreateOperationRulesArray(rgRules) fail"},
        {"a router that is gone", [this] { mNetwork.nUpnpInit = 1; }, -1,
         "GetUsedRouterPortList() failed\nDeleteConflictPortsForUPnPRouter() failed"},
        {"a gateway that goes", [this] { mHome.fnOnListing = [] { gSzGateway.clear(); }; }, -1,
         "GetGatewayIP() failed\nget gateway ip failed"},
        {"rule.conf cannot be written", fnFail("write"), -1, "can not sync rules to file\nsave rule failed"},
        {"no daemon", fnFail("exec"), -1, "upnp daemon start failed\nsave rule failed", true},
        {"no tester", [this] { mClient.mapAnswers["init"] = -1; }, -1,
         "TavoPortConnTestInit() failed\ntest rule init failed", true},
        {"no answer", [this] { mClient.nTester = -1; }, -1, "TavoPortConnTest() failed\ntest port connection failed",
         true},
    };
    for (const auto& fault : rgFaults) {
        SCOPED_TRACE(fault.szWhat);
        SetUp();
        Write(kRuleConf, szOld);
        rgRequests = Ask("82/tcp");
        fault.fnSpoil();
        const std::string szBefore = Read(kRuleConf);
        EXPECT_EQ(Set("hop", rgRequests, true), fault.nResult);
        EXPECT_EQ(LastLines(fault.szLines), fault.szLines);
        if (fault.blSaved) {
            EXPECT_EQ(Kept(), "1 E tcp 80 80; 2 E tcp 82 82 hop");
        } else {
            EXPECT_EQ(Read(kRuleConf), szBefore);
        }
        EXPECT_EQ(Statuses(rgRequests), "9");
        if (fault.nResult == 2) {
            EXPECT_FALSE(LockIsFree());
            TLibTavoPortMapUnLock();
        }
        EXPECT_TRUE(LockIsFree());
    }
}

TEST_F(RelayService, RefusesArgumentsBeforeTheLock) {
    ASSERT_EQ(TLibTavoPortMapLock(), 0);
    Request request = {};
    EXPECT_EQ(TLibTavoPortMapRulesSet(nullptr, nullptr, -1, true), -1);
    EXPECT_EQ(TLibTavoPortMapRulesSet("", nullptr, -1, true), -1);
    EXPECT_EQ(TLibTavoPortMapRulesSet("hop", &request, -1, true), -1);
    EXPECT_EQ(TLibTavoPortMapRulesSet("hop", nullptr, 1, true), -1);
    EXPECT_EQ(gLog, Lines({"Bad parameter, szServiceName is NULL", "Bad parameter, szServiceName is empty",
                           "Bad parameter, 0 > nRules=-1", "Bad parameter, nRules=1, but rgRules is NULL"}));
    TLibTavoPortMapUnLock();
}

TEST_F(RelayService, MemoryThatRunsOutLosesNoRule) {
    const std::string szOld = Stored("E tcp 80 80; D tcp 82 82 hop");
    const std::string szConf = Read(kRouterConf);
    std::set<std::string> said;
    RunOutOfMemory([&](const auto& fnArm) {
        gStage = Stage();
        gStage.blOn = true;
        gLog.clear();
        Write(kRuleConf, szOld);
        Requests rgRequests = Ask("82,83/tcp");
        fnArm();
        const int nResult = Set("hop", rgRequests, true);
        gNGoodAllocations = -1;
        EXPECT_TRUE(nResult == 0 || (nResult == -1 && gBlAllocationFailed && !gLog.empty())) << nResult;
        EXPECT_TRUE((nResult != 0 && Read(kRuleConf) == szOld) ||
                    Kept() == "1 E tcp 80 80; 2 D tcp 82 82 hop; 3 E tcp 83 83 hop")
            << Read(kRuleConf);
        EXPECT_EQ(Statuses(rgRequests), nResult == 0 ? "2" : "9");
        EXPECT_EQ(Read(kRouterConf), szConf);
        EXPECT_TRUE(LockIsFree());
        said.insert(gLog.begin(), gLog.end());
    });
    for (const char* szLine :
         {"GetInitState() failed", "CreateOperationRulesArray(ruleConf) failed", "new set<int> failed",
          "save rule failed", "test port connection failed", "TLibGetRouterConf() failed", "can not get router conf",
          "TLibParsePorts() for boxPort failed",
#ifndef __SANITIZE_ADDRESS__  // where only C++ memory runs out
          "CreateRulesArray() failed", "pArr is NULL", "malloc() failed"
#endif
         }) {
        EXPECT_TRUE(said.contains(szLine)) << szLine;
    }
}

// ---- the router classified ------------------------------------------------------------------------------------

// What is kept of the router: "settings UPNP NATPMP", "manual BRAND/MODEL/VERSION", "tested SUPPORT MAX".
std::string Known() {
    std::string szKnown;
    const auto fnRead = [](const char* szPath, const char* szSection, const char* szKey) {
        char szValue[64] = {};
        TLIBCFileGetSectionValue(szPath, szSection, szKey, szValue, sizeof(szValue));
        return std::string(szValue);
    };
    const std::string szCache = SZF_DETECT_MANUAL_CACHE;
    if (std::filesystem::exists(kRouterConf)) {
        szKnown += "settings " + fnRead(kRouterConf, "192.168.1.1", "support_router_upnp") + " " +
                   fnRead(kRouterConf, "192.168.1.1", "support_router_natpmp") + ";";
    }
    if (fnRead(szCache.c_str(), "192.168.1.1", "router_detect") == "manual") {
        szKnown += "manual " + fnRead(szCache.c_str(), "192.168.1.1", "brand") + "/" +
                   fnRead(szCache.c_str(), "192.168.1.1", "model") + "/" +
                   fnRead(szCache.c_str(), "192.168.1.1", "version") + ";";
    }
    if (!Read(kUserDb).empty()) {
        szKnown += "tested " + fnRead(kUserDb, "Acme/New/2", "support") + " " + fnRead(kUserDb, "Acme/New/2", "max");
    }
    return szKnown;
}

TEST_F(RelayService, ClassifiesTheRouterOnce) {
    const std::string szDone = "TLibTavoPortMapRouterDetect() success: ";
    const std::string szManual = szDone + "manual";
    const std::string szNoDb = "can not read router sdk version\nupgrade db fail";
    const std::string szNotStored = "TLibSetRouterConf(192.168.1.1) failed";
    const auto fnUnknown = [this] { mNetwork.model = TAVO_UPNP_GATEWAY_MODEL{"Acme", "New", "2"}; };
    const auto fnKnownBad = [this] { mNetwork.model = TAVO_UPNP_GATEWAY_MODEL{"Acme", "No", "1.0"}; };
    const auto fnBroken = [this] { mClient.mapAnswers["modify"] = -1; };
    const auto fnNoSettings = [] { gFnOnConfSet = [] { return -1; }; };
    const auto fnCache = [](const char* szPair) {
        return [=] { Write(SZF_DETECT_MANUAL_CACHE, std::string("[192.168.1.1]\n") + szPair + "\n"); };
    };
    const auto fnInTheWay = [](const std::string& szPath) {
        return [=] { std::filesystem::create_directories(szPath + "/x"); };
    };
    // With the last lines of the log.
    const std::tuple<const char*, std::function<void()>, int, std::string, const char*> rgCases[] = {
        {"known by its settings", Settings("no", "yes"), 0, szDone + "upnp/natpmp", "settings no yes;"},
        {"manual by its settings", Settings("no", "no"), 1, szManual, "settings no no;"},
        {"manual by the cache", [] { SetDetectManualCache("192.168.1.1", "a", "b", "c"); }, 1, szManual,
         "manual a/b/c;"},
        {"an odd cache", fnCache("brand=\"a\""), 0, szNoDb, "settings yes no;"},
        {"a cache of the unknown", CacheUnknown, -1, "TLibTavoPortMapRouterDetect() failed, state=0", ""},
        {"odd settings", Settings("Yes", "no"), -1, "GetInitState() failed", "settings Yes no;"},
        {"no gateway", [] { gSzGateway.clear(); }, -1, "cannot get gateway router ip\nget gateway ip failed", ""},
        {"lock held", [] { TLibTavoPortMapLock(); }, 2, "TLibTavoPortMapRouterDetect() is busy", ""},
        {"UPnP", [] {}, 0, szNoDb, "settings yes no;"},
        {"NAT-PMP",
         All([this] { mNetwork.nUpnpInit = 1; }, [this] { mNetwork.szAnnounced = "[192.168.1.1]\nname=\"Den\"\n"; }), 0,
         "upgrade db fail\ninit UPnP faild", "settings no yes;"},
        {"neither", [this] { mNetwork.model.reset(); }, 1, szManual, "manual //;"},
        {"UPnP that is known not to work", fnKnownBad, 1, szManual, "manual Acme/No/1.0;"},
        {"no detection", [this] { mNetwork.nWan = -1; }, -1, "Can not connect to WAN\nTLibDetectRouter failed", ""},
        {"no settings written", fnNoSettings, -1, "sync config failed\n" + szNotStored, ""},
        {"it works", fnUnknown, 0, szDone + "(comp) upnp/natpmp", "settings yes no;tested yes 10"},
        {"nobody had tested it", All(fnUnknown, Settings("unknown", "no")), 0, szDone + "(comp) upnp/natpmp",
         "settings yes no;tested yes 10"},
        {"it does not work", All(fnUnknown, fnBroken), 1, szDone + "(comp) manual", "manual Acme/New/2;tested no -1"},
        {"another test runs", All(fnUnknown, [] { gStage.alive.insert("/usr/tavo/sbin/upnpd --debug -p"); }), -1,
         "TLibTestUpnpCompatibility() failed", ""},
        {"it works, no settings written", All(fnUnknown, fnNoSettings), -1, szNotStored, "tested yes 10"},
        {"no record written", All(fnUnknown, fnInTheWay(kUserDb)), -1, "TLibWriteRecordIntoUpnpDB() failed", ""},
        {"no cache written", All(fnUnknown, fnBroken, fnInTheWay(SZF_DETECT_MANUAL_CACHE)), -1,
         "Sync() failed\nset detect cache failed", "tested no -1"},
    };
    for (const auto& [szWhat, fnSetUp, nWanted, szLines, szKnown] : rgCases) {
        SCOPED_TRACE(szWhat);
        TearDown();
        SetUp();
        std::filesystem::remove(kRouterConf);
        fnSetUp();
        gLog.clear();
        const int nResult = TLibTavoPortMapRouterDetect();
        EXPECT_EQ(nResult, nWanted);
        std::erase_if(gLog, [](const std::string& szLine) { return szLine.starts_with("> "); });
        EXPECT_EQ(LastLines(szLines), szLines);
        EXPECT_EQ(Known(), szKnown);
        EXPECT_EQ(LockIsFree(), nResult != 2);
        if (nResult == 2) {
            TLibTavoPortMapUnLock();
        }
        // The verdict stands: the next call asks nobody.
        if (nResult == 0 || nResult == 1) {
            mNetwork.nWan = -1;
            EXPECT_EQ(TLibTavoPortMapRouterDetect(), nResult);
        }
    }
}

TEST_F(RelayService, TheDetectionsChildComesBackWithoutTheLock) {
    std::filesystem::remove(kRouterConf);
    std::filesystem::remove("/tmp/child_result");
    const pid_t pidSelf = getpid();
    bool blLocked = false;
    gFnOnConfSet = [&] {
        blLocked = !LockIsFree();
        return 1;
    };
    mNetwork.fnChild = [] { gSzGateway.clear(); };
    const int nResult = TLibTavoPortMapRouterDetect();
    if (getpid() != pidSelf) {
        Write("/tmp/child_result", std::to_string(nResult) + gLog.back());
        _exit(0);
    }
    EXPECT_EQ(nResult, 0);
    EXPECT_EQ(Read("/tmp/child_result"), "-1TLibDetectRouter failed");
    EXPECT_TRUE(blLocked);
    EXPECT_TRUE(LockIsFree());
}

// ---- the printed forms ------------------------------------------------------------------------------------------

TEST_F(RelayService, PrintedTestsAndSets) {
    const std::string szRead = "service name=hop\nports:80 szProtocol:tcp\nports:81-82 szProtocol:udp\n";
    const std::tuple<const char*, std::function<void()>, decltype(&TestFuncTestRules), const char*, int, std::string,
                     const char*>
        rgCases[] = {
            {"test", [] {}, &TestFuncTestRules, "hop;80;tcp;81-82;udp", 0,
             szRead + "router_ports [80]=ok\nrouter_ports [81-82]=fail\n", ""},
            {"no tester", [this] { mClient.mapAnswers["init"] = -1; }, &TestFuncTestRules, "hop;80;tcp;81-82;udp", -1,
             szRead, ""},
            {"no port", [] {}, &TestFuncTestRules, "hop;x;tcp", -1,
             "service name=hop\nports:x szProtocol:tcp\nCreateOperationRulesArray(rgRules) failed\n", ""},
            {"nothing to test", [] {}, &TestFuncTestRules, "hop", -1, "service name=hop\n", ""},
            {"set", [] {}, &TestFuncSetRules, "hop;80;tcp;81-82;udp", 0,
             szRead + "router_ports [80]=ok\nrouter_ports [81-82]=fail\n",
             "1 E tcp 80 80 hop; 2 E udp 81-82 81-82 hop"},
            {"never detected", [] { std::filesystem::remove(kRouterConf); }, &TestFuncSetRules, "hop;80;tcp;81-82;udp",
             0, szRead + "router_ports [80]=not test\nrouter_ports [81-82]=not test\n", ""},
            {"refused", [this] { mNetwork.nUpnpInit = 1; }, &TestFuncSetRules, "hop;80;tcp;81-82;udp", -1,
             szRead + "TLibTavoPortMapRulesSet() failed\n", ""},
            {"no protocol", [] {}, &TestFuncSetRules, "hop;80", -1, "service name=hop\nports:80 szProtocol:NULL\n", ""},
        };
    for (const auto& [szWhat, fnSpoil, pfnCall, szRequest, nResult, szPrinted, szKept] : rgCases) {
        SCOPED_TRACE(szWhat);
        SetUp();
        fnSpoil();
        testing::internal::CaptureStdout();
        EXPECT_EQ(pfnCall(szRequest), nResult);
        EXPECT_EQ(testing::internal::GetCapturedStdout(), szPrinted);
        EXPECT_EQ(Kept(), szKept);
    }
    EXPECT_EQ(TestFuncTestRules(nullptr), -1);
    EXPECT_EQ(TestFuncSetRules(nullptr), -1);
}

}  // namespace
