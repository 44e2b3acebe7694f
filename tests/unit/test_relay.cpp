// The relay service's part: port lists as text, operation rules, and who keeps a port in a merge.
#include <gtest/gtest.h>

#include <algorithm>
#include <climits>
#include <functional>
#include <numeric>
#include <random>
#include <set>

#include "Text.h"
#include "naive_conflicts.h"
#include "src/merge/UsedPorts.h"
#include "stage.h"
#include "world.h"

namespace {

using namespace tavo::lib;
using Ports = PortList;
using Lines = std::vector<std::string>;

using Relay = StagedTest;

// ---- port lists ---------------------------------------------------------------------------------------

TEST_F(Relay, PortListsAreReadInTheirOrder) {
    // With the line that a failure logs.
    const std::tuple<const char*, Ports, const char*> rgCases[] = {
        {"80", {80}, ""},
        {"80,443", {80, 443}, ""},
        {",80,,", {80}, ""},
        {"8000-8002", {8000, 8001, 8002}, ""},
        {"8002-8000", {8000, 8001, 8002}, ""},
        {"80,80", {80, 80}, ""},
        {"443, 80", {443, 80}, ""},
        {"80abc", {80}, ""},
        {"5-6-9", {5, 6}, ""},
        {"65535-65535", {65535}, ""},
        {"", {}, "invalid port format"},
        {",", {}, "invalid port format"},
        {"abc", {}, "invalid port no [abc]"},
        {"7,0,8", {7}, "invalid port no [0]"},
        {"70000", {}, "invalid port no [70000]"},
        {"4294967376", {}, "invalid port no [4294967376]"},
        {"5-", {}, "invalid port range [5-0]"},
        {"-5", {}, "invalid port range [-5-0]"},
        {"9,8-65536", {9}, "invalid port range [8-65536]"},
        {"4294967376-4294967377", {}, "invalid port range [2147483647-2147483647]"},
    };
    for (const auto& [szText, rgRead, szLine] : rgCases) {
        gLog.clear();
        std::list<int> ports = {1};
        EXPECT_EQ(TLibParsePorts(ports, szText), *szLine == '\0' ? 0 : -1) << szText;
        EXPECT_EQ(ports.front(), 1);
        ports.pop_front();
        EXPECT_EQ(Ports(ports.begin(), ports.end()), rgRead) << szText;
        EXPECT_EQ(gLog, *szLine == '\0' ? Lines{} : Lines{szLine});
    }
    std::list<int> ports;
    EXPECT_EQ(TLibParsePorts(ports, nullptr), -1);
    EXPECT_TRUE(Logged("Bad parameter, NULL == szPort"));
    EXPECT_EQ(TLibParsePorts(ports, "1-65535"), 0);
    EXPECT_EQ(ports.size(), 65535U);
}

TEST_F(Relay, PortListsAreWrittenAsRuns) {
    const std::tuple<Ports, int, const char*, const char*> rgCases[] = {
        {{80, 81, 82, 90}, 1024, "80-82, 90", ""},
        {{80, 81, 82, 90}, 4, "80-", ""},
        {{5, 4, 3}, 1024, "5-3", ""},
        {{1, 2, 1, 2}, 1024, "1-2", ""},
        {{1, 2, 9, 10, 20}, 1024, "1-2, 9-10, 20", ""},
        {{80, 80}, 1024, "80, 80", ""},
        {{}, 1024, "", ""},
        {{80, 0}, 1024, "kept", "TAVOPFIsValidPortNo(0) failed"},
        {{80}, 0, "kept", "Bad parameter, nOutPorts=0"},
    };
    for (const auto& [ports, nSize, szText, szLine] : rgCases) {
        gLog.clear();
        char szOut[1024] = "kept";
        EXPECT_EQ(ToPorts(Host(), szOut, nSize, ports), *szLine == '\0' ? 0 : -1) << szText;
        EXPECT_STREQ(szOut, szText);
        EXPECT_EQ(gLog, *szLine == '\0' ? Lines{} : Lines{szLine});
    }
    EXPECT_EQ(ToPorts(Host(), nullptr, 5, {}), -1);
    EXPECT_TRUE(Logged("Bad parameter, szOutPorts is NULL"));
    char szOut[8] = "kept";
    EXPECT_EQ(TestFuncToPorts(szOut, 8, "1,2,3,7"), 0);
    EXPECT_STREQ(szOut, "1-3, 7");
    EXPECT_EQ(TestFuncToPorts(szOut, 8, "1,2,3,4,5,6,7,8,9,10,11"), -1);
    EXPECT_EQ(TestFuncToPorts(szOut, 8, ""), 0);
    EXPECT_STREQ(szOut, "");
}

// ---- operation rules ------------------------------------------------------------------------------------

__tag_TAVO_PORTMAP_RULE Request(const char* szPorts, int nProtocol) {
    __tag_TAVO_PORTMAP_RULE request = {};
    FillText(request.szPorts, szPorts);
    request.enProtocol = nProtocol;
    return request;
}

TEST_F(Relay, RequestsBecomeRules) {
    const __tag_TAVO_PORTMAP_RULE rgRequests[] = {Request("5000-5001", 0), Request("7,6", 9)};
    for (const auto& [szName, szId] : {std::pair("hoplink", "HopLink"), std::pair("HopLink", "")}) {
        OperationRules rules;
        ASSERT_EQ(CreateOperationRulesArray(Host(), &rules.rgRules, &rules.nRules, szName, rgRequests, 2), 0);
        ASSERT_EQ(rules.nRules, 2);
        EXPECT_TRUE(rules.rgRules[0].blEnable);
        EXPECT_EQ(*rules.rgRules[0].routerPortSet, Ports({5000, 5001}));
        EXPECT_EQ(*rules.rgRules[1].boxPortSet, Ports({7, 6}));
        EXPECT_EQ(rules.rgRules[1].protocol, 9);
        EXPECT_STREQ(rules.rgRules[1].szServiceId, szId);
        EXPECT_STREQ(rules.rgRules[1].szServiceName, szName);
    }
    OPERATION_RULE* pOut = nullptr;
    int nOut = 7;
    const __tag_TAVO_PORTMAP_RULE rgBad[] = {Request("1", 0), Request("0", 0)};
    EXPECT_EQ(CreateOperationRulesArray(Host(), &pOut, &nOut, "x", rgBad, 2), -1);
    EXPECT_EQ(CreateOperationRulesArray(Host(), &pOut, &nOut, nullptr, rgBad, 2), -1);
    EXPECT_EQ(CreateOperationRulesArray(Host(), &pOut, &nOut, "x", rgBad, -1), -1);
    EXPECT_EQ(CreateOperationRulesArray(Host(), &pOut, &nOut, "x", nullptr, 1), -1);
    EXPECT_EQ(pOut, nullptr);
    EXPECT_EQ(nOut, 0);
    EXPECT_EQ(gLog, Lines({"invalid port no [0]", "TLibParsePorts() for routerPort failed",
                           "Bad parameter, szServiceName is NULL", "Bad parameter, 0 > nRules=-1",
                           "Bad parameter, nRules=1 >0, but rgRules is NULL"}));
    EXPECT_EQ(CreateOperationRulesArray(Host(), &pOut, &nOut, "x", nullptr, 0), 0);
}

__tag_TAVO_ROUTER_RULE Stored(const char* szProtocol, const char* szRouter, const char* szBox, const char* szService,
                              bool blEnable) {
    __tag_TAVO_ROUTER_RULE rule = {};
    rule.blEnable = blEnable;
    FillText(rule.szProtocol, szProtocol);
    FillText(rule.szRouterPort, szRouter);
    FillText(rule.szSrcPort, szBox);
    FillText(rule.szServiceID, "id");
    FillText(rule.szServiceName, szService);
    return rule;
}

TEST_F(Relay, StoredRulesComeBackRenumbered) {
    const __tag_TAVO_ROUTER_RULE rgStored[] = {Stored("udp", "1,2,3", "7,8,9", "web", false),
                                               Stored("all", "5", "5", "", true), Stored("tcp", "6", "6", "", true)};
    OperationRules rules;
    ASSERT_EQ(CreateOperationRulesArray(Host(), &rules.rgRules, &rules.nRules, rgStored, 3), 0);
    rules.rgRules[1].blDeleted = true;
    {
        RouterRules back;
        ASSERT_EQ(CreateRulesArray(Host(), &back.rgRules, &back.nRules, rules.rgRules, 3, rules.rgRules, 1), 0);
        ASSERT_EQ(back.nRules, 3);
        EXPECT_STREQ(back.rgRules[0].szRouterPort, "1-3");
        EXPECT_STREQ(back.rgRules[0].szSrcPort, "7-9");
        EXPECT_STREQ(back.rgRules[0].szProtocol, "udp");
        EXPECT_STREQ(back.rgRules[0].szServiceID, "id");
        EXPECT_STREQ(back.rgRules[0].szServiceName, "web");
        EXPECT_FALSE(back.rgRules[0].blEnable);
        EXPECT_STREQ(back.rgRules[1].szRuleID, "2");
        EXPECT_STREQ(back.rgRules[1].szSrcPort, "6");
        EXPECT_STREQ(back.rgRules[2].szRuleID, "3");
    }
    RouterRules none;
    EXPECT_EQ(CreateRulesArray(Host(), &none.rgRules, &none.nRules, nullptr, 0, rules.rgRules + 1, 1), 0);
    EXPECT_EQ(none.rgRules, nullptr);
    EXPECT_EQ(CreateRulesArray(Host(), &none.rgRules, &none.nRules, nullptr, 1, nullptr, 0), -1);
    EXPECT_EQ(CreateRulesArray(Host(), &none.rgRules, &none.nRules, nullptr, 0, nullptr, 1), -1);
    rules.rgRules[2].routerPortSet->push_back(0);
    EXPECT_EQ(CreateRulesArray(Host(), &none.rgRules, &none.nRules, rules.rgRules, 3, nullptr, 0), -1);
    EXPECT_EQ(none.nRules, 0);
    int cRules = 1;
    __tag_TAVO_ROUTER_RULE rgRoom[1];
    EXPECT_EQ(WriteRouterRules(Host(), &cRules, rgRoom, 1, rules.rgRules, 1), -1);
    EXPECT_EQ(gLog, Lines({"Bad parameter, 0 < nRuleConfOpRules=1, but rgRuleConfOpRules is NULL",
                           "Bad parameter, 0 < nOpRules=1, but rgOpRules is NULL", "TAVOPFIsValidPortNo(0) failed",
                           "ToPorts() failed", "WriteRouterRules() failed", "out of range, cRules=1 >= nRules=1"}));
}

TEST_F(Relay, StoredRulesThatCannotBeRead) {
    const std::pair<__tag_TAVO_ROUTER_RULE, Lines> rgCases[] = {
        {Stored("TCP", "1", "1", "", true), {"Bad parameter, szProtocol=TCP", "ToProtocolEnum([0]=-1) failed"}},
        {Stored("tcp", "x", "1", "", true), {"invalid port no [x]", "TLibParsePorts(x) failed"}},
        {Stored("tcp", "1", "2-", "", true), {"invalid port range [2-0]", "TLibParsePorts(2-) failed"}},
    };
    for (const auto& [rule, lines] : rgCases) {
        gLog.clear();
        OPERATION_RULE* pOut = nullptr;
        int nOut = 7;
        EXPECT_EQ(CreateOperationRulesArray(Host(), &pOut, &nOut, &rule, 1), -1);
        EXPECT_EQ(gLog, lines);
        EXPECT_EQ(pOut, nullptr);
        EXPECT_EQ(nOut, 0);
    }
}

TEST_F(Relay, WhatABuilderCannotWorkWithIsRefusedAndNamed) {
    OPERATION_RULE opRule = {};
    PortList ports;
    PortList noPort = {0};
    __tag_TAVO_ROUTER_RULE stored = Stored("tcp", "1", "1", "", true);
    const __tag_TAVO_PORTMAP_RULE request = Request("1", 0);
    OPERATION_RULE* pHeld = &opRule;
    __tag_TAVO_ROUTER_RULE* pHeldRules = &stored;
    OPERATION_RULE* pOut = nullptr;
    __tag_TAVO_ROUTER_RULE rgRoom[1] = {};
    int nOut = 7, nWritten = 0;
    const std::pair<std::function<int()>, const char*> rgCases[] = {
        {[&] { return CreateOperationRulesArray(Host(), &pHeld, &nOut, "hop", &request, 1); },
         "Bad parameter, rgOutRules is not NULL"},
        {[&] { return CreateRulesArray(Host(), &pHeldRules, &nOut, nullptr, 0, nullptr, 0); },
         "Bad parameter, rgRules is not NULL"},
        {[&] { return CreateOperationRulesArray(Host(), &pOut, &nOut, &stored, -1); }, "0 > nRules=-1"},
        {[&] {
             return CreateOperationRulesArray(Host(), &pOut, &nOut, static_cast<__tag_TAVO_ROUTER_RULE*>(nullptr), 1);
         },
         "Bad parameter, rgRules is NULL"},
        {[&] { return CreateOperationRulesArray(Host(), &pHeld, &nOut, &stored, 1); },
         "Bad parameter, *pRgOutRules is not NULL"},
        {[&] { return WriteRouterRules(Host(), &nWritten, rgRoom, 1, &opRule, 1); },
         "rgOpRules[i].routerPortSet is NULL"},
        {[&] { return opRule.routerPortSet = &ports, WriteRouterRules(Host(), &nWritten, rgRoom, 1, &opRule, 1); },
         "rgOpRules[i].boxPortSet is NULL"},
        {[&] { return opRule.boxPortSet = &noPort, WriteRouterRules(Host(), &nWritten, rgRoom, 1, &opRule, 1); },
         "TAVOPFIsValidPortNo(0) failed"}};
    for (const auto& [fnCall, szLine] : rgCases) {
        gLog.clear();
        EXPECT_EQ(fnCall(), -1) << szLine;
        EXPECT_TRUE(Logged(szLine)) << szLine;
    }
    EXPECT_EQ(nOut, 0) << "the last one clears its outputs";
    EXPECT_STREQ(ToProtocolString(Host(), static_cast<PORTMAP_PROTOCOL>(3)), "");
    EXPECT_TRUE(Logged("non support protocol enum"));
    // Lists whose text leaves a byte free, fills a record, and goes beyond it.
    for (const auto& [nLast, blFits] : {std::pair(20, true), {200, false}, {2000, false}}) {
        PortList one;
        for (int nPort = 10000; nPort < 10000 + 2 * 144; nPort += 2) {  // "10000, 10002, ...": 7 bytes for each
            one.push_back(nPort);
        }
        one.push_back(60000);
        one.push_back(600);
        one.push_back(nLast);
        OPERATION_RULE rule = {};
        rule.routerPortSet = rule.boxPortSet = &one;
        EXPECT_EQ(ToText(Host(), one)->size(), 1020U + std::to_string(nLast).size());
        EXPECT_EQ(FitsRecord(Host(), rule), blFits) << nLast;
    }
}

TEST_F(Relay, WhatDoesNotFitARule) {
    std::string szPorts = "10000";
    for (int nPort = 10002; szPorts.size() + 6 < 1024; nPort += 2) {
        szPorts += "," + std::to_string(nPort);
    }
    const std::string szName(1100, 'n');
    for (const auto& [szText, nWritten, lines] :
         {std::tuple(std::string("10000,10002-10003"), 18U, Lines{}),
          std::tuple(szPorts, 1023U, Lines(2, "ports of rule 1 do not fit, cut at 1023 characters"))}) {
        gLog.clear();
        const __tag_TAVO_PORTMAP_RULE request = Request(szText.c_str(), 0);
        OperationRules rules;
        RouterRules back;
        ASSERT_EQ(CreateOperationRulesArray(Host(), &rules.rgRules, &rules.nRules, szName.c_str(), &request, 1), 0);
        ASSERT_EQ(CreateRulesArray(Host(), &back.rgRules, &back.nRules, rules.rgRules, 1, nullptr, 0), 0);
        EXPECT_EQ(strlen(back.rgRules->szRouterPort), nWritten);
        EXPECT_STREQ(back.rgRules->szSrcPort, back.rgRules->szRouterPort);
        EXPECT_EQ(gLog, lines);
        // Under the same long name the service still finds its rules.
        EXPECT_EQ(DeletePortsFromRuleConf(Host(), rules.rgRules, 1, szName.substr(0, 1022).c_str()), 0);
        EXPECT_FALSE(rules.rgRules->blDeleted);
        EXPECT_EQ(DeletePortsFromRuleConf(Host(), rules.rgRules, 1, szName.c_str()), 0);
        EXPECT_TRUE(rules.rgRules->blDeleted);
    }
}

// ---- the merge --------------------------------------------------------------------------------------------

// "D tcp hop 80,443>80,443; E all - 5>5": disabled or enabled, protocol, service, router>box ports.
struct Set : OperationRules {
    explicit Set(const std::string& szRules) {
        std::istringstream rules(szRules);
        std::vector<__tag_TAVO_ROUTER_RULE> rgStored;
        for (std::string szRule; std::getline(rules, szRule, ';');) {
            std::istringstream fields(szRule);
            std::string szEnable, szProtocol, szService, szPorts;
            fields >> szEnable >> szProtocol >> szService >> szPorts;
            const size_t nArrow = szPorts.find('>');
            rgStored.push_back(Stored(szProtocol.c_str(), szPorts.substr(0, nArrow).c_str(),
                                      szPorts.substr(nArrow + 1).c_str(), szService == "-" ? "" : szService.c_str(),
                                      szEnable == "E"));
        }
        CreateOperationRulesArray(Host(), &rgRules, &nRules, rgStored.data(), static_cast<int>(rgStored.size()));
    }
};

TEST_F(Relay, RefusedArgumentsOfAPass) {
    OPERATION_RULE rule = {};
    const std::tuple<int, OPERATION_RULE*, int, const char*> rgCases[] = {
        {-1, &rule, 0, "Bad parameter, 0 > nOpRules1=-1"},
        {1, nullptr, 0, "Bad parameter, 0 < nOpRules1=1, but rgOpRules1 is NULL"},
        {0, nullptr, -2, "Bad parameter, 0 > nOpRules=-2"},
        {0, nullptr, 2, "Bad parameter, 0 < nOpRules=2, but rgOpRules is NULL"},
    };
    for (const auto& [nRules1, pRules1, nRules, szLine] : rgCases) {
        gLog.clear();
        EXPECT_EQ(DeletePortsFromRules1(Host(), pRules1, nRules1, nullptr, nRules, true, nullptr, nullptr), -1);
        EXPECT_EQ(gLog, Lines({szLine}));
    }
    gLog.clear();
    EXPECT_EQ(DeletePortsFromRules1(Host(), nullptr, 0, nullptr, 0, true, nullptr, nullptr), 0);
    EXPECT_TRUE(gLog.empty());
    EXPECT_EQ(DeletePortsFromRuleConf(Host(), nullptr, 0, ""), -1);
    EXPECT_EQ(DeletePortsFromRuleConf(Host(), nullptr, 1, "hop"), -1);
    EXPECT_EQ(gLog, Lines({"Bad parameter, szServiceName shall not be empty",
                           "Bad parameter, 0 < nRuleConfOpRules=1 but rgRuleConfOpRules is NULL"}));
}

// "E tcp hop 1>3": told in one line what goes, for whose sake, and what a merge fails at.
TEST_F(Relay, AnObserverIsToldOfEachPairThatGoesAndOfWhatFails) {
    class Recorder : public MergeObserver {
    public:
        static std::string Name(const OPERATION_RULE* pRule) { return pRule == nullptr ? "-" : pRule->szServiceName; }
        void OnRemoved(const OPERATION_RULE& rule, int nRouterPort, int nBoxPort,
                       const OPERATION_RULE* pDecider) override {
            mSzTold += Name(&rule) + " " + std::to_string(nRouterPort) + ">" + std::to_string(nBoxPort) + " " +
                       Name(pDecider) + "; ";
        }
        void OnTorn(const OPERATION_RULE& rule, int nRouterPort, int nBoxPort, const OPERATION_RULE& decider) override {
            OnRemoved(rule, nRouterPort, nBoxPort, &decider);
            mSzTold += "torn";
        }
        void OnUneven(const OPERATION_RULE& rule) override { mSzTold += Name(&rule) + " uneven"; }
        std::string mSzTold;
    };
    const UsedPorts used{{2}, {3}};
    // Against rules of others, or against the ports that other hosts hold.
    const std::tuple<const char*, const char*, int, const char*> rgCases[] = {
        {"E tcp hop 1-3>5-7", nullptr, 0, "hop 2>6 -; "},
        {"E udp hop 1-3>5-7;E all web 2,3,2>7-9", nullptr, 0, "hop 3>7 -; web 2>9 -; web 2>7 -; "},
        {"E tcp hop 1>5", nullptr, 0, ""},
        {"E tcp hop 2>5;E tcp web 1,2>5;E tcp hop 2>5", nullptr, -1, "hop 2>5 -; web uneven"},
        {"E tcp hop 1-3>1-3", "E tcp web 2-3>2-3;E all any 1>1", 0, "hop 3>3 web; hop 2>2 web; hop 1>1 any; "},
        {"E tcp hop 1>1", "E udp web 1>1", 0, ""},
        {"E tcp hop 1-2>1-2", "E tcp web 1>2", -1, "hop 2>2 web; torn"},
        {"E tcp hop 1>1;E tcp any 1>1-2;E tcp hop 1>1", "E tcp web 1>1", -1, "hop 1>1 web; any uneven"}};
    for (const auto& [szRules, szOthers, nResult, szTold] : rgCases) {
        const Set others(szOthers == nullptr ? "" : szOthers);
        for (const bool blTold : {true, false}) {  // who is not told is refused all the same
            Recorder recorder;
            MergeObserver* pObserver = blTold ? &recorder : nullptr;
            const Set mine(szRules);
            EXPECT_EQ(szOthers == nullptr
                          ? DeleteUsedPorts(Host(), mine.rgRules, mine.nRules, nullptr, 0, nullptr, used, pObserver)
                          : DeletePortsFromRules1(Host(), mine.rgRules, mine.nRules, others.rgRules, others.nRules,
                                                  true, nullptr, nullptr, pObserver),
                      nResult);
            EXPECT_EQ(recorder.mSzTold, blTold ? szTold : "") << szRules;
        }
    }
}

// Each of the three passes over a request, and the lists of the ports that other hosts hold.
TEST_F(Relay, APassThatFailsEndsTheMerge) {
    const std::tuple<const char*, const char*, const char*> rgCases[] = {
        {"E tcp hop 1>1", "D tcp hop 1>2", "DeletePortsFromRules1(B->C) failed"},
        {"E tcp hop 1>1", "E tcp web 1>2", "DeletePortsFromRules1(C->A) failed"},
        {"E tcp hop 1>5;E tcp hop 2>5", "D tcp hop 1>5", "DeletePortsFromRules1(C->B) failed"},
        {"E tcp hop 1>5;E tcp hop 2>6", "D tcp hop 1>5", nullptr}};
    for (const auto& [szAsked, szStored, szLine] : rgCases) {
        const Set asked(szAsked);
        const Set stored(szStored);
        gLog.clear();
        EXPECT_EQ(DeletePortsFromInputRules(Host(), asked.rgRules, asked.nRules, stored.rgRules, stored.nRules, "hop"),
                  szLine == nullptr ? 0 : -1);
        EXPECT_EQ(gLog.empty() ? "" : gLog.back(), szLine == nullptr ? "" : szLine);
    }
    PortList ports;
    OPERATION_RULE rule = {};
    EXPECT_EQ(DeleteConflictPortsFromOpRule(Host(), rule, {}), -1);
    EXPECT_EQ(gLog.back(), "opRule.routerPortSet == NULL");
    rule.routerPortSet = &ports;
    EXPECT_EQ(DeleteConflictPortsFromOpRule(Host(), rule, {}), -1);
    EXPECT_EQ(gLog.back(), "opRule.boxPortSet == NULL");
}

// What the passes never ask: the name turns rules away before a filter that wants nothing is met.
TEST_F(Relay, AFilterThatWantsNothing) {
    // Of "E hop", "D hop", "E web", "D web": '1' is out, '0' is in, 'x' cannot be judged.
    const std::pair<RULE_FILTER, const char*> rgCases[] = {
        {{nullptr, true, false, false}, "xxxx"},
        {{"hop", true, false, false}, "xx11"},
        {{"hop", false, false, false}, "11xx"},
        {{"Hop", true, true, true}, "1111"},
    };
    const Set rules("E tcp hop 1>1;D tcp hop 1>1;E tcp web 1>1;D tcp web 1>1");
    for (const auto& [filter, szWanted] : rgCases) {
        gLog.clear();
        std::string szOut;
        for (int i = 0; i < rules.nRules; ++i) {
            bool blOut = false;
            const int nResult = IsNeedToFilterOut(Host(), &blOut, rules.rgRules[i], &filter);
            szOut += nResult == -1 ? 'x' : blOut ? '1' : '0';
        }
        EXPECT_EQ(szOut, szWanted);
        const auto nLines = static_cast<size_t>(std::count(szOut.begin(), szOut.end(), 'x'));
        EXPECT_EQ(gLog, Lines(nLines,
                              "Bad parameter, blMatchEnabledRules and blMatchDisabledRules shall not both be "
                              "false"));
    }
    bool blOut = true;
    EXPECT_EQ(IsNeedToFilterOut(Host(), &blOut, rules.rgRules[0], nullptr), 0);
    EXPECT_FALSE(blOut);
}

// Rules of a few ports out of a few, so that everything overlaps; broken ones and odd protocols among them.
class RandomRules {
public:
    explicit RandomRules(unsigned nSeed) : mEngine(nSeed) {}

    bool OneIn(int n) { return Below(n) == 0; }
    int Below(int n) { return static_cast<int>(mEngine() % static_cast<unsigned>(n)); }
    RULE_FILTER Filter() { return {OneIn(3) ? nullptr : Name(), OneIn(2), !OneIn(3), !OneIn(3)}; }
    void Fill(OperationRules& one, OperationRules& copy) {
        one.nRules = copy.nRules = Below(5);
        const auto nRoom = static_cast<size_t>(one.nRules) + 1;
        one.rgRules = static_cast<OPERATION_RULE*>(calloc(nRoom, sizeof(OPERATION_RULE)));
        copy.rgRules = static_cast<OPERATION_RULE*>(calloc(nRoom, sizeof(OPERATION_RULE)));
        const bool blPairs = OneIn(2);  // the same port on both sides: few partial matches
        for (int i = 0; i < one.nRules; ++i) {
            OPERATION_RULE& rule = one.rgRules[i];
            rule.blEnable = OneIn(2);
            rule.blDeleted = OneIn(8);
            rule.protocol = static_cast<PORTMAP_PROTOCOL>(OneIn(20) ? 7 : Below(3));
            FillText(rule.szServiceName, Name());
            const int nPorts = OneIn(30) ? 0 : 1 + Below(6);
            rule.routerPortSet = OneIn(25) ? nullptr : Ports(nPorts);
            rule.boxPortSet = OneIn(25) ? nullptr : Ports(OneIn(30) ? Below(8) : nPorts);
            if (blPairs && rule.boxPortSet != nullptr && rule.routerPortSet != nullptr) {
                *rule.boxPortSet = *rule.routerPortSet;
            }
            copy.rgRules[i] = rule;
            copy.rgRules[i].routerPortSet = rule.routerPortSet == nullptr ? nullptr : new PortList(*rule.routerPortSet);
            copy.rgRules[i].boxPortSet = rule.boxPortSet == nullptr ? nullptr : new PortList(*rule.boxPortSet);
        }
    }

private:
    const char* Name() { return OneIn(2) ? "hop" : ""; }
    PortList* Ports(int nPorts) {
        auto pPorts = std::make_unique<PortList>();
        for (int i = 0; i < nPorts; ++i) {
            pPorts->push_back(OneIn(200) ? 0 : 1 + Below(8) + (OneIn(4) ? 65527 : 0));
        }
        return pPorts.release();
    }

    std::mt19937 mEngine;
};

bool SameLists(const PortList* pOne, const PortList* pOther) {
    return pOne == nullptr || pOther == nullptr ? pOne == pOther : *pOne == *pOther;
}

// How a pass ended, without the numbers; and whether it took something away.
std::string Outcome(const Lines& lines, size_t nBefore, size_t nAfter) {
    std::string szOutcome = nAfter < nBefore ? "less" : "same";
    for (const std::string& szLine : lines) {
        szOutcome += "; " + szLine;
    }
    std::erase_if(szOutcome, [](char c) { return (c >= '0' && c <= '9') || c == '-'; });
    return szOutcome;
}

size_t CountPorts(const OperationRules& rules) {
    return std::accumulate(rules.rgRules, rules.rgRules + rules.nRules, size_t{0}, [](size_t n, const auto& rule) {
        return n + (rule.routerPortSet == nullptr ? 0 : rule.routerPortSet->size());
    });
}

TEST_F(Relay, TheIndexedSearchAnswersAsTheWalkDoes) {
    std::map<std::string, int> seen;
    for (unsigned nSeed = 1; nSeed <= 40000; ++nSeed) {
        RandomRules random(nSeed);
        OperationRules rules1, rules1Copy, rules, rulesCopy;
        random.Fill(rules1, rules1Copy);
        random.Fill(rules, rulesCopy);
        const RULE_FILTER filter1 = random.Filter();
        const RULE_FILTER filter2 = random.Filter();
        const RULE_FILTER* pFilter1 = random.OneIn(3) ? nullptr : &filter1;
        const RULE_FILTER* pFilter2 = random.OneIn(3) ? nullptr : &filter2;
        const bool blDeleteFound = random.OneIn(2);
        gLog.clear();
        const size_t nBefore = CountPorts(rules1);
        const int nExpected =
            naive::DeletePortsFromRules1(Host(), rules1Copy.rgRules, rules1Copy.nRules, rulesCopy.rgRules,
                                         rulesCopy.nRules, blDeleteFound, pFilter1, pFilter2);
        const Lines expected = gLog;
        gLog.clear();
        ASSERT_EQ(tavo::lib::DeletePortsFromRules1(Host(), rules1.rgRules, rules1.nRules, rules.rgRules, rules.nRules,
                                                   blDeleteFound, pFilter1, pFilter2),
                  nExpected)
            << nSeed;
        ASSERT_EQ(gLog, expected) << nSeed;
        for (int i = 0; i < rules1.nRules; ++i) {
            const OPERATION_RULE& one = rules1.rgRules[i];
            const OPERATION_RULE& other = rules1Copy.rgRules[i];
            ASSERT_EQ(one.blDeleted, other.blDeleted) << nSeed;
            ASSERT_TRUE(SameLists(one.routerPortSet, other.routerPortSet)) << nSeed;
            ASSERT_TRUE(SameLists(one.boxPortSet, other.boxPortSet)) << nSeed;
        }
        ++seen[Outcome(expected, nBefore, CountPorts(rules1))];
    }
    // Every way to end has been met, often enough to mean something: ten, each before and after something was removed,
    // and a filter of the first array that wants nothing, which ends a pass before that.
    EXPECT_EQ(seen.size(), 23U);
    for (const auto& [szWay, nTimes] : seen) {
        EXPECT_GT(nTimes, 4) << szWay;
    }
}

}  // namespace
