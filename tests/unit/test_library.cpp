// The library over the real platform: stores, knowledge base, locks and the saving of rules.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <cstring>
#include <functional>
#include <set>

#include "libtavoportmap.h"
#include "stage.h"
#include "tavo/core.h"
#include "tavo/portforward.h"
#include "world.h"

namespace {

constexpr char kRouterConf[] = "/etc/portforward/router.conf";
constexpr char kRuleConf[] = "/etc/portforward/rule.conf";
constexpr char kTool[] = "/usr/tavo/bin/tavoportforward";
using Rule = __tag_TAVO_ROUTER_RULE;
using SaveResult = __tag_TAVO_ROUTER_SAVE_RULE_RESULT;

class Library : public testing::Test {
protected:
    void SetUp() override {
        MakeEmpty({"/etc/portforward", "/etc.defaults/portforward", "/usr/tavo"});
        std::filesystem::remove("/etc/tavoinfo.conf");
        gLog.clear();
        gSzGateway = "192.168.1.1";
        gNSlept = 0;
    }
    static Rule MakeRule(const char* szId, const char* szPorts) {
        Rule rule = {};
        rule.blEnable = true;
        snprintf(rule.szRuleID, sizeof(rule.szRuleID), "%s", szId);
        snprintf(rule.szProtocol, sizeof(rule.szProtocol), "tcp");
        snprintf(rule.szRouterPort, sizeof(rule.szRouterPort), "%s", szPorts);
        snprintf(rule.szSrcPort, sizeof(rule.szSrcPort), "%s", szPorts);
        return rule;
    }
    // A router driven by a script, and a script that takes note of having run.
    static void MakeManual(const std::string& szPages) {
        Write(kRouterConf,
              "[192.168.1.1]\nbrand=B\nmodel=M\nversion=1\nsupport_router_upnp=no\n"
              "support_router_natpmp=no\n");
        Write("/etc.defaults/portforward/routerdb/B/M/1/router.des", szPages);
        WriteProgram(kTool, "touch /tmp/ran\n");
        std::filesystem::remove("/tmp/ran");
    }
};

TEST_F(Library, SupportWords) {
    char szOut[8] = "kept";
    EXPECT_EQ(TLibSupportEnumToString(szOut, 8, static_cast<__tag_TAVO_ROUTER_SUPPORT>(3)), 0);
    EXPECT_STREQ(szOut, "kept");
    EXPECT_TRUE(Logged("non-support enum case"));
    EXPECT_EQ(TLibSupportStringToEnum(nullptr, nullptr), -1);
    EXPECT_TRUE(Logged("szSupport is NULL"));
    auto enSupport = TAVO_ROUTER_SUPPORT_YES;
    EXPECT_EQ(TLibSupportStringToEnum(&enSupport, "Yes"), -1);
    EXPECT_TRUE(Logged("non-support szSupport=Yes"));
    EXPECT_EQ(TLibSupportStringToEnum(&enSupport, "unknown"), 0);
    EXPECT_EQ(enSupport, TAVO_ROUTER_SUPPORT_UNKNOWN);
}

TEST_F(Library, RuleArrays) {
    int nRules = 7;
    Rule* pRules = nullptr;
    auto enErr = TAVO_LIBTAVOPORTMAP_ERR_FAILED;
    EXPECT_EQ(TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, true, &enErr), 0);
    EXPECT_EQ(nRules, 0);
    EXPECT_EQ(enErr, 0);
    Write(kRuleConf,
          "[1]\nenabled=1\ns_port=1\nr_port=2\nprotocol name=tcp\nservice=web\nservice_id=W\n"
          "[2]\nenabled=yes\ns_port=3\nr_port=4\nprotocol name=udp\n");
    ASSERT_EQ(TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, true, nullptr), 0);
    ASSERT_EQ(nRules, 2);
    EXPECT_TRUE(pRules[0].blEnable);
    EXPECT_FALSE(pRules[1].blEnable);
    EXPECT_STREQ(pRules[1].szServiceName, "web");  // carried over
    EXPECT_STREQ(pRules[1].szServiceID, "");
    EXPECT_STREQ(pRules[1].szRouterPort, "4");
    Write("/etc/portforward/testrule.conf", "[9]\nenabled=1\ns_port=5\nr_port=6\nprotocol name=tcp\n");
    Rule* pTestRules = nullptr;
    ASSERT_EQ(TLibGetRulesArrFromTestRuleConf(&nRules, &pTestRules, nullptr, true, nullptr), 0);
    EXPECT_EQ(std::to_string(nRules) + pTestRules[0].szRuleID, "19");
    TLibFreeRulesArr(pTestRules);
    std::filesystem::remove("/etc/portforward/testrule.conf");
    EXPECT_EQ(TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, false, nullptr), -1);
    EXPECT_TRUE(Logged("pRgRules is NULL or *pRgRules is not NULL"));
    TLibFreeRulesArr(pRules);
    pRules = nullptr;
    ASSERT_EQ(TLibTavoPortMapLock(), 0);
    EXPECT_EQ(TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, true, &enErr), -1);
    EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_CONFLICT);
    EXPECT_TRUE(Logged("PortForward conflict = /tmp/routerconf.lock"));
    TLibTavoPortMapUnLock();
}

TEST_F(Library, RuleFilesThatCannotBeConverted) {
    const std::string szPorts = "s_port=1\nr_port=2\n";
    // On failure the count keeps the number of sections.
    const std::tuple<std::string, int, std::vector<std::string>> rgCases[] = {
        {"[1]\n" + szPorts + "protocol name=tcp\n", 1, {"get rule enable failed", "IsRuleEnable() failed"}},
        {"[1]\n[2]\n[3]\n", 3, {"section shall not be empty", "IsRuleEnable() failed"}},
        {"[1]\nenabled=1\nr_port=2\n", 1, {"get rule src port failed", "GetRulePort() failed"}},
        {"[1]\nenabled=1\ns_port=2\n", 1, {"get rule router port failed", "GetRulePort() failed"}},
        {"[1]\nenabled=1\n" + szPorts, 1, {"get protocol failed", "GetRuleProtocol() failed"}},
        {"# nothing\n", 7, {"TAVOPFRuleGetByIdList() failed"}},
    };
    for (const auto& [szText, nTold, rgszSaid] : rgCases) {
        Write(kRuleConf, szText);
        std::vector<std::string> rgszLines = rgszSaid;
        if (rgszLines.size() > 1) {
            rgszLines.push_back("PF_CONF::ToArray() failed");
        }
        int nRules = 7;
        Rule* pRules = nullptr;
        gLog.clear();
        EXPECT_EQ(TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, false, nullptr), -1);
        EXPECT_EQ(gLog, rgszLines);
        EXPECT_EQ(nRules, nTold) << szText;
        EXPECT_EQ(pRules, nullptr);
    }
    int nRules = 7;
    Rule* pRules = nullptr;
    EXPECT_EQ(TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, false, nullptr), 0) << "no longer broken";
    EXPECT_EQ(nRules, 0);
    auto enErr = TAVO_LIBTAVOPORTMAP_ERR_FAILED;
    gLog.clear();
    EXPECT_EQ(TLibGetRulesArrFromTestRuleConf(nullptr, nullptr, nullptr, true, &enErr), -1);
    EXPECT_EQ(gLog, std::vector<std::string>{"ppRgRules is NULL"});
    EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_FAILED);
}

// One rule in one call, from the reader and from the section.
TEST_F(Library, ARuleIsToldWholeOrNotAtAll) {
    const std::pair<const char*, const char*> rgCases[] = {
        {"enabled=1\ns_port=1\nr_port=2\nprotocol name=tcp\nservice_id=W\n", "1 2 1 tcp W"},
        {"enabled=0\ns_port=1\nr_port=2\nprotocol name=udp\n", "0 2 1 udp "},
        {"s_port=1\nr_port=2\nprotocol name=tcp\n", "get rule protocol failed"},
        {"enabled=1\ns_port=1\nr_port=2\n", "get rule protocol failed"},
        {"enabled=1\ns_port=1\nprotocol name=tcp\n", "get rule port failed"},
        {"enabled=1\nr_port=1\nprotocol name=tcp\n", "get rule port failed"}};
    for (const auto& [szText, szTold] : rgCases) {
        Write(kRuleConf, std::string("[7]\nservice=web\n") + szText);
        RouterRuleConfReader reader(false);
        ASSERT_EQ(reader.StartNextRule(), 1);
        TAVO_PF_CONF* pConf = TAVOPFRuleGet();
        for (const bool blReader : {true, false}) {
            std::string szId, szRouter, szBox, szProtocol, szService, szExtra;
            bool blEnabled = false;
            gLog.clear();
            const int nResult = blReader ? reader.GetRuleInfo(blEnabled, szRouter, szBox, szProtocol, szService)
                                         : PF_CONF::GetRuleInfo(szId, blEnabled, szRouter, szBox, szProtocol, szService,
                                                                szExtra, pConf);
            EXPECT_EQ(nResult == 1 ? std::to_string(blEnabled) + " " + szRouter + " " + szBox + " " + szProtocol + " " +
                                         szService
                                   : gLog.back(),
                      szTold);
            EXPECT_EQ(nResult, gLog.empty() ? 1 : 0);
            EXPECT_EQ(reader.GetRuleID(szId) + reader.GetRuleServiceName(szExtra), 2);
            EXPECT_EQ(szId + szExtra, "7web");
        }
        TAVOPFConfFree(pConf);
        int nRules = 7;
        EXPECT_EQ(reader.GetRulesNumber(nRules), 1);
        EXPECT_EQ(nRules, 1);
        EXPECT_EQ(reader.NextRule(), 0);
        EXPECT_EQ(reader.NextRule(), 0);
        EXPECT_TRUE(Logged("next rule failed"));
    }
    std::filesystem::remove(kRuleConf);
    EXPECT_EQ(RouterRuleConfReader(false).StartNextRule(), 0);
    std::string szText;
    bool blEnabled = false;
    gLog.clear();
    EXPECT_EQ(PF_CONF::GetRuleInfo(szText, blEnabled, szText, szText, szText, szText, szText, nullptr), 0);
    EXPECT_EQ(gLog, std::vector<std::string>{"pConf is NULL"});
}

TEST_F(Library, WhatIsMissingIsRefusedAndNamed) {
    int nNumber = 0;
    bool blAnswer = false;
    char szNoName[] = "no separator";
    std::string szA, szB, szC;
    Rule* pRules = nullptr;
    __tag_TAVO_ROUTER_CONF conf = {};
    RouterDB db("192.168.1.1");
    const std::tuple<std::function<int()>, int, const char*> rgCases[] = {
        {[] { return TLibSupportEnumToString(nullptr, 8, TAVO_ROUTER_SUPPORT_NO); }, -1, "szOut is NULL"},
        {[] { return TLibSupportStringToEnum(nullptr, "yes"); }, -1, "pEnSupport is NULL"},
        {[] { return TLibGetLibTavoPortMapRunningTask(nullptr); }, -1, "enTask is NULL"},
        {[] { return TLibGetGatewayIP(nullptr, 8); }, -1, "szOutGatewayIP is NULL"},
        {[] { return TLibGetRouterDBList(nullptr); }, -1, "pplRouterDBList is NULL"},
        {[] { return TLibFreeRouterDBList(nullptr); }, -1, "plRouterDBList is NULL"},
        {[] { return TLibUpdateRouterDBList(nullptr); }, -1, "pnVersion is NULL"},
        {[&] { return db.List(nullptr); }, 0, "pplRouterDBList is NULL"},
        {[&] { return db.FreeList(nullptr); }, 0, "plRouterDBList is NULL"},
        {[&] { return TLibGetRulesArrFromRuleConf(nullptr, &pRules, nullptr, false, nullptr); }, -1, "nPRules is NULL"},
        {[&] { return TLibSetRouterConf("192.168.1.1", nullptr, nullptr, false); }, -1, "routerConf is NULL"},
        {[&] { return TLibGetRouterConf("192.168.1.1", nullptr, nullptr, false); }, -1, "routerConf is NULL"},
        {[&] { return TLibSetRouterConf("192.168.1.1", &conf, nullptr, false); }, -1,
         "support_upnp shall not be empty"},
        {[&] { return DETECT_INFO::fillRouterDetectResult(nullptr); }, -1, "detectResult is NULL"},
        {[&] { return IsGenericRouterName(blAnswer, szNoName); }, 0, "incorrect information"},
        {[&] { return IsGenericRouterName(blAnswer, nullptr); }, 0, "incorrect information"},
        {[&] { return SplitRouterName(szNoName, szA, szB, szC); }, 0, "incorrect information"},
        {[&] { return SplitRouterName(nullptr, szA, szB, szC); }, 0, "incorrect information"},
        {[&] { return PF_CONF::IsRuleEnable(blAnswer, nullptr); }, 0, "pConf shall not be NULL"},
        {[&] { return PF_CONF::GetRuleID(szA, nullptr); }, 0, "pConf shall not be NULL"},
        {[&] { return PF_CONF::GetRuleProtocol(szA, nullptr); }, 0, "pConf shall not be NULL"},
        {[&] { return PF_CONF::GetRulePort(szA, szB, nullptr); }, 0, "pConf shall not be NULL"},
        {[&] { return PF_CONF::GetRuleServiceName(szA, nullptr); }, 0, "pConf shall not be NULL"},
        {[&] { return PF_CONF::GetRuleServiceID(szA, nullptr); }, 0, "pConf shall not be NULL"},
        {[&] { return PF_CONF::ToArray(nNumber, nullptr, nullptr); }, 0, "pRgRules is NULL or *pRgRules is not NULL"},
        {[&] { return PF_CONF::FreeArray(nullptr); }, 0, "pConfHead is NULL"},
        {[] { return RouterRuleConfWriter().GetRuleConf(nullptr); }, 0, "pRuleConfHead is NULL"},
        {[] { return TestFuncToPorts(nullptr, 8, nullptr); }, -1, "szNumbers is NULL"},
        {[] { return TestFuncToPorts(nullptr, 8, "10"); }, -1, "ToPorts() failed"},
    };
    for (const auto& [fnCall, nResult, szLine] : rgCases) {
        gLog.clear();
        EXPECT_EQ(fnCall(), nResult) << szLine;
        EXPECT_TRUE(Logged(szLine)) << szLine;
    }
    EXPECT_EQ(szA + szB + szC, "");
    nNumber = 7;
    EXPECT_EQ(PF_CONF::ToArray(nNumber, &pRules, nullptr), 1);
    EXPECT_EQ(nNumber, 0);
    char szNamed[] = "N: M (1)";
    char szGeneric[] = "N: M";
    EXPECT_TRUE(IsGenericRouterName(blAnswer, szGeneric) && blAnswer);
    EXPECT_TRUE(IsGenericRouterName(blAnswer, szNamed) && !blAnswer);
    char szGateway[8] = "kept";
    EXPECT_EQ(TLibGetGatewayIP(szGateway, 0), 0);
    EXPECT_STREQ(szGateway, "kept");
    EXPECT_EQ(TLibGetGatewayIP(szGateway, 8), 0);
    EXPECT_STREQ(szGateway, "192.168");
    gSzGateway = "";
    EXPECT_EQ(TLibGetGatewayIP(szGateway, 8), -1);
    EXPECT_TRUE(Logged("GetGatewayIP() failed"));
    for (const char* szModel : {"A/B/1/router.des", "A/C/2/router.des"}) {
        Write(std::string("/etc.defaults/portforward/routerdb/") + szModel, "[global]\n");
    }
    __tag_TAVO_ROUTERDB_LIST* pModels = nullptr;
    EXPECT_EQ(TLibGetRouterDBList(&pModels), 1);
    ASSERT_TRUE(pModels != nullptr && pModels->pNext != nullptr);
    EXPECT_EQ(std::string(pModels->szBrand) + pModels->pNext->szBrand, "AA");
    EXPECT_EQ(pModels->pNext->pNext, nullptr);
    EXPECT_EQ(TLibFreeRouterDBList(pModels), 1);
}

// A test goes before a save; a daemon saves while its progress is marked, and only where it is not under test.
TEST_F(Library, WhatRunsIsToldByWhoIsAliveAndWhatIsMarked) {
    constexpr char kUnderTest[] = "/usr/tavo/sbin/upnpd --debug -p";
    const std::tuple<std::set<std::string>, bool, int, int> rgCases[] = {
        {{}, true, TAVO_LIBTAVOPORTMAP_TASK_IDLE, 0},
        {{"tavoportforward"}, false, TAVO_LIBTAVOPORTMAP_TASK_SAVING, 1},
        {{"upnpd"}, false, TAVO_LIBTAVOPORTMAP_TASK_IDLE, 0},
        {{"upnpd"}, true, TAVO_LIBTAVOPORTMAP_TASK_SAVING, 1},
        {{"natpmpd"}, false, TAVO_LIBTAVOPORTMAP_TASK_IDLE, 0},
        {{"natpmpd"}, true, TAVO_LIBTAVOPORTMAP_TASK_SAVING, 1},
        {{"upnpd", kUnderTest}, true, TAVO_LIBTAVOPORTMAP_TASK_TESTING, 0},
        {{"testupnp.sh"}, true, TAVO_LIBTAVOPORTMAP_TASK_TESTING, 0},
        {{"testupnp.sh", "tavoportforward"}, false, TAVO_LIBTAVOPORTMAP_TASK_TESTING, 1}};
    for (const auto& [setAlive, blMarked, enTask, nSaving] : rgCases) {
        gStage = Stage();
        gStage.blOn = true;
        gStage.alive = setAlive;
        std::filesystem::remove("/tmp/pfProgress");
        if (blMarked) {
            Write("/tmp/pfProgress", "");
        }
        auto enFound = static_cast<__tag_TAVO_LIBTAVOPORTMAP_TASK>(7);
        EXPECT_EQ(TLibGetLibTavoPortMapRunningTask(&enFound), 0);
        EXPECT_EQ(enFound, enTask) << testing::PrintToString(setAlive);
        EXPECT_EQ(IsSavingRules(), nSaving) << testing::PrintToString(setAlive);
    }
    gStage = Stage();
    std::filesystem::remove("/tmp/pfProgress");
}

// Each call by itself, from the first allocation that fails on: it fails, and says so.
TEST_F(Library, MemoryThatRunsOutIsNoSuccess) {
    const std::string szLong = "longer than a small string, so that it needs memory";
    Write(kRouterConf, "[192.168.1.1]\nsupport_router_upnp=no\nsupport_router_natpmp=no\nbrand=" + szLong +
                           "\nmodel=M\nversion=1\n");
    Write("/etc/portforward/router_upnp.db", "[" + szLong + "/M/1]\nsupport=yes\nmax=5\npfpath=" + szLong + "\n");
    Write(kRuleConf, "[" + szLong + "]\nenabled=1\ns_port=" + std::string(50, '1') +
                         "\nr_port=" + std::string(50, '2') + "\nprotocol name=" + szLong + "\nservice_id=" + szLong +
                         "\nservice=" + szLong + "\n");
    TAVO_PF_CONF* pConf = TAVOPFRuleGet();
    RouterConfReader reader("192.168.1.1");
    RouterUpnpDB upnp(szLong, "M", "1");
    std::string szName = szLong + ": Model (" + szLong + ")";
    // With texts of its own, which need memory.
    const auto fnAnew = [](const auto& fnCall) {
        return [fnCall] {
            std::string szA, szB, szC;
            return fnCall(szA, szB, szC);
        };
    };
    const auto fnOfRule = [&](int (*pfnGet)(std::string&, const TAVO_PF_CONF*)) {
        return fnAnew([pfnGet, pConf](auto& szText, auto&, auto&) { return pfnGet(szText, pConf); });
    };
    char szPorts[8] = {};
    Write("/etc.defaults/portforward/routerdb/" + szLong + "/M/1/router.des",
          "[global]\nsyntax version=3\n[PF port page]\nmax rule=7\nchange router port=yes\nsupport range=multi\n"
          "[PF range page]\nmax rule=8\nchange router port=yes\n");
    const struct {
        const char* szWhat;
        std::function<int()> fnCall;
        int nGood;
        int nBad;
    } rgCases[] = {
        {"a text of the settings", fnAnew([&](auto& szText, auto&, auto&) { return reader.GetBrand(szText); }), 1, 0},
        {"a rule's name", fnOfRule(&PF_CONF::GetRuleID), 1, 0},
        {"its protocol", fnOfRule(&PF_CONF::GetRuleProtocol), 1, 0},
        {"its service", fnOfRule(&PF_CONF::GetRuleServiceID), 1, 0},
        {"its service's name", fnOfRule(&PF_CONF::GetRuleServiceName), 1, 0},
        {"its ports",
         fnAnew([&](auto& szRouter, auto& szBox, auto&) { return PF_CONF::GetRulePort(szRouter, szBox, pConf); }), 1,
         0},
        {"a router's name",
         fnAnew([&](auto& szA, auto& szB, auto& szC) { return SplitRouterName(szName.data(), szA, szB, szC); }), 1, 0},
        {"settings that begin", [] { return RouterConfWriter(false).Init(); }, 1, 0},
        {"a number among them", [] { return RouterConfWriter(false).SetMaxRule(5); }, 1, 0},
        {"a rule added", [&] { return RouterRuleConfWriter().AddRule(7, true, "1", "2", "tcp", "", "w"); }, 1, 0},
        {"what is known of UPnP", fnAnew([&](auto& szText, auto&, auto&) { return upnp.GetPfpath(szText); }), 1, 0},
        {"ports read",
         [] {
             std::list<int> ports;
             return TLibParsePorts(ports, "1,2");
         },
         0, -1},
        {"ports written", [&] { return TestFuncToPorts(szPorts, 8, "1,2"); }, 0, -1},
    };
    for (const auto& one : rgCases) {
        int nFailures = 0;
        RunOutOfMemory([&](const auto& fnArm) {
            gLog.clear();
            fnArm();
            const int nResult = one.fnCall();
            gNGoodAllocations = -1;
            EXPECT_EQ(nResult, gBlAllocationFailed ? one.nBad : one.nGood) << one.szWhat;
            EXPECT_EQ(gLog.empty(), !gBlAllocationFailed) << one.szWhat;
            nFailures += gBlAllocationFailed ? 1 : 0;
        });
        EXPECT_GT(nFailures, 0) << one.szWhat;
    }
    TAVOPFConfFree(pConf);
    // Of these some can do without: what they say is true, or they say nothing.
    int nNumber = 0;
    bool blAnswer = false;
    const std::tuple<std::function<bool()>, std::function<bool()>> rgAccessors[] = {
        {[&] { return RouterDB("192.168.1.1").GetSyntaxVersion(nNumber); }, [&] { return nNumber == 3; }},
        {[&] { return RouterDB("192.168.1.1").GetMaxPorts(nNumber); }, [&] { return nNumber == 7; }},
        {[&] { return RouterDB("192.168.1.1").GetMaxRange(nNumber); }, [&] { return nNumber == 8; }},
        {[&] { return RouterDB("192.168.1.1").IsSupportPageRange(blAnswer); }, [&] { return blAnswer; }},
        {[&] { return upnp.GetMaxRule(nNumber); }, [&] { return nNumber == 5; }}};
    for (const auto& [fnAsk, fnTrue] : rgAccessors) {
        int nRefused = 0;
        RunOutOfMemory([&, &fnAsk = fnAsk, &fnTrue = fnTrue](const auto& fnArm) {
            nNumber = 0;
            blAnswer = false;
            fnArm();
            const bool blTold = fnAsk();
            gNGoodAllocations = -1;
            EXPECT_TRUE(blTold ? fnTrue() : gBlAllocationFailed) << &fnAsk - &std::get<0>(rgAccessors[0]);
            nRefused += blTold ? 0 : 1;
        });
        EXPECT_GT(nRefused, 0);
    }
}

long OpenDescriptors() {
    return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
}

#ifndef __SANITIZE_ADDRESS__  // which sees that by itself
// A daemon calls these for years.
TEST_F(Library, WhatIsCalledAgainAndAgainCostsNoMemory) {
    const std::string szConf =
        "[10.0.0.1]\nbrand=x\n[192.168.1.1]\nbrand=B\nmodel=M\nversion=1\nmax=5\n"
        "support_router_upnp=no\nsupport_router_natpmp=no\n";
    MakeManual("[global]\nsyntax version=1\n[PF port page]\nmax rule=9\n");
    Write(kTool, "#!/bin/sh\necho syntax version=1\n");
    Write(kRouterConf, szConf);
    Write(kRuleConf, "[1]\nenabled=1\ns_port=1\nr_port=2\nprotocol name=tcp\n[2]\nenabled=x\n");
    Write("/etc/portforward/router_upnp.db", "[B/M/1]\nsupport=yes\nmax=5\n");
    SetDetectManualCache("192.168.1.1", "B", "M", "1");
    std::string szText;
    int nNumber = 0;
    bool blAnswer = false;
    const std::pair<const char*, std::function<void()>> rgCalls[] = {
        {"settings written",
         [&] {
             for (const bool blReload : {true, false}) {
                 RouterConfWriter writer(blReload);
                 writer.ReloadOldSection("192.168.1.1");
                 writer.ReloadOldSection("10.9.9.9");
                 writer.ReloadOldSection("192.168.1.1");
                 writer.CreateNewSection("192.168.1.1");
                 writer.CreateNewSection("192.168.1.1");
                 writer.SetBrandModelVersion("B", "M", "1");
             }
         }},
        {"settings read",
         [&] {
             for (const char* szAddress : {"192.168.1.1", "10.9.9.9"}) {
                 RouterConfReader(szAddress).GetBrand(szText);
                 RouterDB(szAddress).GetMaxPorts(nNumber);
                 __tag_TAVO_ROUTER_CONF conf = {};
                 TLibGetRouterConf(szAddress, &conf, nullptr, true);
                 TLibSetRouterConf(szAddress, &conf, nullptr, true);
             }
             RouterConfReader reader;
         }},
        {"settings replaced",
         [&] {
             __tag_TAVO_ROUTER_CONF conf = {};
             TLibGetRouterConf("192.168.1.1", &conf, nullptr, true);
             snprintf(conf.szConnType, sizeof(conf.szConnType), "http");
             snprintf(conf.szConnPort, sizeof(conf.szConnPort), "80");
             EXPECT_EQ(TLibSetRouterConf("192.168.1.1", &conf, nullptr, true), 0);
         }},
        {"rules",
         [&] {
             RouterRuleConfReader reader(false);
             reader.StartNextRule();
             reader.GetRulesNumber(nNumber);
             RouterRuleConfWriter writer;
             writer.AddRule(7, true, "1", "2", "tcp", "", "w");
             Rule* pRules = nullptr;
             writer.ToArray(nNumber, &pRules);
             TLibFreeRulesArr(pRules);
             writer.Sync("/etc/portforward/other.conf");
             TAVO_PF_CONF* pConf = TAVOPFRuleGet();
             pRules = nullptr;
             EXPECT_EQ(PF_CONF::ToArray(nNumber, &pRules, pConf), 0);
             TAVOPFConfFree(pConf);
         }},
        {"the cache",
         [&] {
             DetectCacheReader reader("192.168.1.1");
             reader.IsSectionExisted(blAnswer);
             SetDetectManualCache("192.168.1.1", "B", "M", "1");
         }},
        {"what is known of models",
         [&] {
             RouterUpnpDB("B", "M", "1").GetSupport(szText);
             RouterUpnpDBUserWriter writer("B/M/1");
             EXPECT_TRUE(writer.SetMaxRule(5) && writer.SetSupport("yes") && writer.Sync());
             __tag_TAVO_ROUTERDB_LIST* pModels = nullptr;
             EXPECT_EQ(TLibGetRouterDBList(&pModels), 1);
             TLibFreeRouterDBList(pModels);
             IGetCurrSyntaxVersion();
         }},
        {"locks", [] { TLibTavoPortMapLock(), TLibTavoPortMapUnLock(); }},
    };
    for (const auto& [szWhat, fnCall] : rgCalls) {
        size_t nUsed = 0;
        long nOpen = 0;
        for (int i = 0; i < 60; ++i) {
            if (i == 10) {
                nUsed = mallinfo2().uordblks;
                nOpen = OpenDescriptors();
            }
            fnCall();
            gLog.clear();
        }
        EXPECT_LT(mallinfo2().uordblks, nUsed + 2000) << szWhat;
        EXPECT_EQ(OpenDescriptors(), nOpen) << szWhat;
    }
    std::filesystem::remove("/etc/portforward/router_upnp.db.user");
}
#endif

TEST_F(Library, ALockHeldElsewhereCostsNoDescriptors) {
    const auto fnOpen = &OpenDescriptors;
    int fd = -1;
    ASSERT_EQ(lock_file("/tmp/routerconf.lock", fd), 1);
    const auto nOpen = fnOpen();
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(TLibTavoPortMapLock(), -1);
    }
    EXPECT_EQ(fnOpen(), nOpen);
    EXPECT_EQ(TLibTavoPortMapUnLock(), 0);
    EXPECT_EQ(fnOpen(), nOpen);
    unlock_file(fd);
    EXPECT_EQ(TLibTavoPortMapLock(), 0);
    EXPECT_EQ(TLibTavoPortMapUnLock(), 0);
}

TEST_F(Library, RuleFileIsPutBackWhenTheWriteFails) {
    Write(kRuleConf, "[9]\nenabled=1\n");
    RouterRuleConfWriter writer;
    ASSERT_EQ(writer.AddRule(7, true, "1", "2", "tcp", "", "web"), 1);
    mkdir("/etc/portforward/dir", 0755);
    EXPECT_EQ(writer.Sync("/etc/portforward/dir"), 0) << "the new file cannot take its name";
    std::filesystem::remove("/etc/portforward/dir");
    gSzFailRename = kRuleConf;
    EXPECT_EQ(writer.Sync(), 0);
    EXPECT_TRUE(LoggedFrom("rename(/etc/portforward/rule.conf, /etc/portforward/rule.conf"));
    EXPECT_EQ(Read(kRuleConf), "[9]\nenabled=1\n");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator("/etc/portforward"), {}), 1);
    int nRules = 0;
    Rule* pRules = nullptr;
    ASSERT_EQ(writer.ToArray(nRules, &pRules), 1);
    EXPECT_EQ(std::to_string(nRules) + pRules->szRuleID + pRules->szServiceName, "17web");
    TLibFreeRulesArr(pRules);
    EXPECT_EQ(writer.Sync(), 1);
    EXPECT_NE(Read(kRuleConf).find("[7]\nenabled=\"1\"\ns_port=\"2\"\nr_port=\"1\"\n"), std::string::npos);
}

TEST_F(Library, RouterConfWriterKeepsOrDropsOtherGateways) {
    Write(kRouterConf, "[10.0.0.1]\nbrand=\"old\"\n\n[192.168.1.1]\nbrand=\"mine\"\nuser=\"u\"\n");
    {
        RouterConfWriter writer(true);
        EXPECT_EQ(writer.SetSupportUpnp("unknown"), 1);
        EXPECT_EQ(writer.SetSupportNatpmp("unknown"), 1);
        EXPECT_EQ(writer.SetUserPass("", "p"), 1);
        EXPECT_EQ(writer.Sync(), 1);
    }
    EXPECT_EQ(Read(kRouterConf),
              "[10.0.0.1]\nbrand=\"old\"\n\n[192.168.1.1]\nbrand=\"mine\"\nuser=\"\"\nsupport_router_upnp=\"unknown\"\n"
              "router_type=\"upnp\"\nsupport_router_natpmp=\"unknown\"\npass=\"p\"\n\n");
    {
        RouterConfWriter writer(false);
        EXPECT_EQ(writer.SetBrandModelVersion("x\"\n[evil]\nk=\"v", "m", "1"), 1);
        EXPECT_EQ(writer.Sync(), 1);
    }
    RouterConfReader reader("192.168.1.1");
    std::string szBrand;
    EXPECT_EQ(reader.GetBrand(szBrand), 1);
    EXPECT_EQ(szBrand, "x\"\n[evil]\nk=\"v");
    bool blExist = true;
    EXPECT_EQ(RouterConfReader("10.0.0.1").IsSectionExist(blExist), 1);
    EXPECT_FALSE(blExist);
    EXPECT_TRUE(Logged("User router changed new gatway ip = 10.0.0.1"));
    gSzGateway = "0.0.0.0";
    EXPECT_EQ(RouterConfWriter(false).SetUser("u"), 0);
    EXPECT_TRUE(Logged("error gateway router ip: 0.0.0.0"));
    EXPECT_TRUE(Logged("init failed"));
}

// Where no section of the gateway's can be gone on with, one begins; what stood in the way is said.
TEST_F(Library, SettingsThatCannotBeGoneOnWithBeginAnew) {
    const std::string szAnew = "reload previous section failed, and try to create a new section.";
    const std::tuple<const char*, const char*, std::vector<std::string>> rgCases[] = {
        {nullptr, "192.168.1.1", {"get router conf failed", szAnew}},
        {"[10.0.0.1]\nbrand=x\n",
         "192.168.1.1",
         {"can not find gatway ip = 192.168.1.1 session in router.conf", szAnew}},
        {"[192.168.1.1]\n", "192.168.1.1", {}},
        {"[192.168.1.1]\n", "", {"cannot get gateway router ip", "can not get gateway ip"}}};
    for (const auto& [szStored, szGateway, rgszLines] : rgCases) {
        std::filesystem::remove(kRouterConf);
        if (szStored != nullptr) {
            Write(kRouterConf, szStored);
        }
        gSzGateway = szGateway;
        gLog.clear();
        RouterConfWriter writer(true);
        EXPECT_EQ(writer.SetBrand("new"), gSzGateway.empty() ? 0 : 1);
        gLog.resize(std::min(gLog.size(), rgszLines.size()));
        EXPECT_EQ(gLog, rgszLines);
    }
    gSzGateway = "192.168.1.1";
    std::set<std::vector<std::string>> said;
    RunOutOfMemory([&](const auto& fnArm) {
        gLog.clear();
        fnArm();
        RouterConfWriter(true).Init();
        RouterConfWriter(false).Init();
        gNGoodAllocations = -1;
        said.insert(gLog);
    });
    EXPECT_TRUE(said.contains({"has run out in TLIBCSzHashAlloc()", "hash malloc failed", szAnew}));
    EXPECT_TRUE(
        said.contains({"has run out in TLIBCSzHashAlloc()", "hash malloc failed", "create a new section failed"}));
}

TEST_F(Library, RouterNames) {
    std::string szBrand, szModel, szVersion;
    char szName[] = "N: W (1.0(2))";
    EXPECT_TRUE(SplitRouterName(szName, szBrand, szModel, szVersion));
    EXPECT_EQ(szBrand + "|" + szModel + "|" + szVersion, "N|W |1.0(2)");
    char szGeneric[] = "N: G";
    EXPECT_FALSE(SplitRouterName(szGeneric, szBrand, szModel, szVersion));
    Write("/etc.defaults/portforward/routerdb/N/G/generic", "version=\"5\"\n");
    EXPECT_TRUE(SplitRouterName(szGeneric, szBrand, szModel, szVersion));
    EXPECT_EQ(szVersion, "5");
}

TEST_F(Library, CompatibilityDatabaseOfTwoFiles) {
    Write("/etc/portforward/router_upnp.db", "[a/b/1]\nsupport=No\n[AirPort//]\nsupport=YES\nmax=5\n");
    Write("/etc/portforward/router_upnp.db.user",
          "[a/b/2]\nsupport=no\nmax=7\n[a/b/3]\nsupport=YES\n[a/b/1]\nsupport=yes\n");
    const char* rgszCases[][4] = {
        {"a", "b", "1", "no"}, {"AirPort", "x", "y", "yes"}, {"a", "b", "2", "unknown"}, {"a", "b", "3", "yes"}};
    for (const auto& rgszCase : rgszCases) {
        std::string szSupport;
        EXPECT_TRUE(RouterUpnpDB(rgszCase[0], rgszCase[1], rgszCase[2]).GetSupport(szSupport));
        EXPECT_EQ(szSupport, rgszCase[3]) << rgszCase[2];
    }
    int nMax = 0;
    EXPECT_FALSE(RouterUpnpDB("a", "b", "1").GetMaxRule(nMax));
    EXPECT_EQ(nMax, -1);
    EXPECT_TRUE(RouterUpnpDB("a", "b", "2").GetMaxRule(nMax));
    EXPECT_EQ(nMax, 7);
    EXPECT_FALSE(RouterUpnpDB("", "", "").IsValid());
    EXPECT_TRUE(Logged("query brand, model, version shall not empty"));
    std::filesystem::remove("/etc/portforward/router_upnp.db");
    EXPECT_TRUE(RouterUpnpDB("a", "b", "2").IsValid());
    EXPECT_TRUE(Logged("/etc/portforward/router_upnp.db is lost, try to recover ..."));
    EXPECT_TRUE(Logged("/etc/portforward/router_upnp.db recover failed"));
}

// What the settings of a router say, as each of its readers tells it: the words, "yes" or not, and what it can do.
TEST_F(Library, SettingsThatAreThereAndThatAreNot) {
    // Told are UPnP, NAT-PMP, whether each is "yes", and the limit; "-" is what is not told.
    const std::tuple<const char*, const char*, const char*, int> rgCases[] = {
        {"192.168.1.1", "support_router_upnp=yes\nsupport_router_natpmp=no\nmax=5\n", "yes no 1 0 5", 0},
        {"192.168.1.1", "support_router_upnp=no\nsupport_router_natpmp=unknown\n", "no unknown 0 0 -", 0},
        {"192.168.1.1", "support_router_upnp=no\nsupport_router_natpmp=no\nmax=x\n", "no no 0 0 0", -1},
        {"192.168.1.9", "support_router_upnp=yes\nsupport_router_natpmp=yes\nmax=5\n", "- - - - -", 0},
        {"no address", "support_router_upnp=no\nsupport_router_natpmp=no\n", "- - - - -", -1},
        {"192.168.1.1", "brand=x\n", "  0 0 -", 0},
    };
    for (const auto& [szAddress, szStored, szTold, nDescribed] : rgCases) {
        Write(kRouterConf, std::string("[192.168.1.1]\n") + szStored);
        RouterConfReader reader(szAddress);
        std::string szUpnp, szNatpmp;
        bool blUpnp = false, blNatpmp = false;
        int nMax = 0;
        gLog.clear();
        const int rgAnswers[] = {reader.GetSupportUpnp(szUpnp), reader.GetSupportNatpmp(szNatpmp),
                                 reader.GetSupportUpnp(blUpnp), reader.GetSupportNatpmp(blNatpmp),
                                 reader.GetMaxRule(nMax)};
        const std::string rgszTold[] = {szUpnp, szNatpmp, blUpnp ? "1" : "0", blNatpmp ? "1" : "0",
                                        std::to_string(nMax)};
        std::string szWords;
        for (size_t i = 0; i < std::size(rgAnswers); ++i) {
            szWords += (i == 0 ? "" : " ") + (rgAnswers[i] == 1 ? rgszTold[i] : "-");
        }
        EXPECT_EQ(szWords, szTold) << szStored;
        std::string szName;
        const bool blFound = reader.GetSectionName(szName) == 1;
        EXPECT_EQ(szName, blFound ? "192.168.1.1" : "");
        EXPECT_EQ(blFound, szName == szAddress);
        for (const char* szLine : {"get support upnp fail", "get support natpmp fail"}) {
            EXPECT_EQ(Logged(szLine), szWords == "- - - - -") << szLine;
        }
        __tag_TAVO_ROUTER_DESC desc = {true};
        auto enErr = TAVO_LIBTAVOPORTMAP_ERR_NONE;
        EXPECT_EQ(TLibGetRouterDesc(szAddress, &desc, &enErr, true), nDescribed) << szStored;
        EXPECT_EQ(Logged("get support change port failed") && Logged("pRouterConf shall not be NULL"),
                  szWords == "no no 0 0 0");
        EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_FAILED);
        EXPECT_FALSE(desc.blSupportChangePort);
        EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
    }
    Write(kRouterConf,
          "[192.168.1.1]\nsupport_router_upnp=no\nsupport_router_natpmp=no\n[]\nbrand=B\nmodel=M\nversion=1\n");
    for (const bool blChange : {true, false}) {
        Write("/etc.defaults/portforward/routerdb/B/M/1/router.des",
              std::string("[PF port page]\nchange router port=") + (blChange ? "yes" : "no") + "\n");
        __tag_TAVO_ROUTER_DESC desc = {!blChange};
        EXPECT_EQ(TLibGetRouterDesc("192.168.1.1", &desc, nullptr, true), 0);
        EXPECT_EQ(desc.blSupportChangePort, blChange);
    }
    auto enErr = TAVO_LIBTAVOPORTMAP_ERR_NONE;
    EXPECT_EQ(TLibGetRouterDesc("192.168.1.1", nullptr, &enErr, false), -1);
    EXPECT_TRUE(Logged("routerDesc is NULL"));
    ASSERT_EQ(TLibTavoPortMapLock(), 0);
    __tag_TAVO_ROUTER_DESC desc = {true};
    EXPECT_EQ(TLibGetRouterDesc("192.168.1.1", &desc, &enErr, true), -1);
    EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_CONFLICT);
    EXPECT_EQ(TLibGetRouterDesc("192.168.1.9", &desc, nullptr, false), 0) << "it is not asked for the lock";
    TLibTavoPortMapUnLock();
}

TEST_F(Library, ManualRouterLimits) {
    const std::string szAll = "tcp=1\nudp=1\ntcp_udp=1\nchange router port=yes\n";
    const std::tuple<const char*, const char*, int, int, int, const char*> rgCases[] = {
        {"support range=single\nmax rule=10\n", "1,2,3,5-6", 11, 10, 0, "get max range == 0"},
        {"max rule=10\n", "1,2,3,5-6", 10, 10, 0, "get bl is support page range == 0"},
        {"max rule=10\n[PF range page]\nmax rule=4\n", "1,2,3,4,5,6,7,8,9,10,11", 12, 10, 4, "exceed range max port"},
        {"max rule=0\n[PF range page]\nmax rule=4\n", "1", 10, -1, 0, "exceed max rule, unknown err, nMaxPort=0 "},
        {"max rule=10\n[PF range page]\nmax rule=4\n", "1,2,5-6", 0, 0, 0, ""},
    };
    for (const auto& [szPages, szPorts, nStatus, nLimit, nLimit2, szLine] : rgCases) {
        MakeManual("[PF port page]\n" + szAll + szPages);
        std::filesystem::remove(kRuleConf);
        Rule rule = MakeRule("1", szPorts);
        gLog.clear();
        SaveResult result = {};
        const int nResult = TLibSaveRules("192.168.1.1", 1, &rule, true, &result, nullptr, nullptr);
        EXPECT_EQ(nResult, nStatus == 0 ? 0 : -1) << szPages;
        EXPECT_EQ(result.nStatus, nStatus) << szPages;
        EXPECT_EQ(result.nLimit, nLimit);
        EXPECT_EQ(result.nLimit2, nLimit2);
        EXPECT_EQ(LoggedFrom(szLine), nStatus != 0) << szLine;
        EXPECT_EQ(std::filesystem::exists("/tmp/ran"), nResult == 0);
        EXPECT_EQ(std::filesystem::exists(kRuleConf), nResult == 0);
    }
}

TEST_F(Library, SaveRefusesBadArgumentsBeforeAnyWork) {
    MakeManual("[PF port page]\nmax rule=1\n");
    Rule rule = MakeRule("1", "1");
    SaveResult result = {};
    const auto fnNote = [](const SaveResult*, void*) { FAIL(); };
    const std::tuple<const char*, int, Rule*, SaveResult*, bool, const char*> rgCases[] = {
        {nullptr, -1, nullptr, nullptr, true, "szGwRouterIP is NULL"},
        {"x", -1, nullptr, nullptr, true, "szGwRouterIP=x is not IP format"},
        {"1.2.3.4", -1, nullptr, nullptr, true, "saveResult is NULL"},
        {"1.2.3.4", -1, nullptr, &result, true, "fail: 0 > nRules=-1"},
        {"1.2.3.4", 1, nullptr, &result, true, "rgRules is NULL"}};
    for (const auto& [szIP, nRules, pRules, pResult, blCallback, szLine] : rgCases) {
        gLog.clear();
        EXPECT_EQ(TLibSaveRules(szIP, nRules, pRules, true, pResult, blCallback ? +fnNote : nullptr, nullptr), -1);
        EXPECT_EQ(gLog, std::vector<std::string>{szLine});
    }
    EXPECT_FALSE(std::filesystem::exists("/etc/tavoinfo.conf"));
    ASSERT_EQ(TLibTavoPortMapLock(), 0);
    EXPECT_EQ(TLibSaveRules("192.168.1.1", 1, &rule, true, &result, nullptr, nullptr), -1);
    EXPECT_EQ(result.nStatus, 2);
    EXPECT_EQ(result.nProgress, 20);
    TLibTavoPortMapUnLock();
    rule.szRouterPort[0] = rule.szSrcPort[0] = '\0';
    RouterRuleConfWriter writer;
    EXPECT_FALSE(std::filesystem::exists("/etc/tavoinfo.conf"));
    rule.szProtocol[0] = '\0';
    EXPECT_EQ(TLibSaveRules("192.168.1.1", 1, &rule, true, &result, nullptr, nullptr), -1);
    EXPECT_TRUE(Logged("protocol, and port should not be empty"));
}

TEST_F(Library, DaemonStatusIsReadBack) {
    WriteProgram("/usr/tavo/sbin/upnpd", "while :; do /bin/sleep 1; done\n");
    UpnpDaemon daemon;
    bool blConflict = true, blError = true;
    std::string szConflict, szError;
    EXPECT_FALSE(daemon.CheckDaemon(blConflict, blError, szConflict, szError));
    EXPECT_TRUE(Logged("upnpd is not ready"));
    ASSERT_TRUE(daemon.Start());
    EXPECT_TRUE(std::filesystem::exists("/tmp/pfProgress"));
    EXPECT_EQ(IsSavingRules(), 1);
    Write("/var/tmp/upnp_portmap.status", "a=1\nb=718\nno value\nc=501\nd=718\n");
    EXPECT_TRUE(daemon.CheckDaemon(blConflict, blError, szConflict, szError));
    EXPECT_EQ(szConflict + "|" + szError, "b, d|c");
    std::filesystem::remove("/var/tmp/upnp_portmap.status");
    EXPECT_FALSE(daemon.CheckDaemon(blConflict, blError, szConflict, szError));
    EXPECT_EQ(gNSlept, 22);
    TLIBCKill("upnpd", SIGKILL);
    std::filesystem::remove("/tmp/pfProgress");
}

}  // namespace
