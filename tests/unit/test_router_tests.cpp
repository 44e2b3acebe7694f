// The compatibility test, its record and report, and the port test, with a test client that each test
// scripts: what it answers and what it writes into the progress file.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <set>

#include "ground/TextFile.h"
#include "libtavoportmap.h"
#include "network.h"
#include "stage.h"
#include "tavo/core.h"
#include "tavo/porttest.h"
#include "tavo/task.h"
#include "tavo/upnptest.h"
#include "world.h"

TestClient* gPClient = nullptr;

namespace {

using TestResult = __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT;

constexpr char kDaemon[] = "/usr/tavo/sbin/upnpd --debug -p";
constexpr char kProgress[] = "/tmp/upnp_test.progress";

void Put(const char* szStep, const std::string& szWord) {
    const OwnMemory own;
    TLIBCFileSetKeyValue(kProgress, szStep, szWord.c_str(), nullptr);
}

// The tool has worked on these steps, and answers.
int Worked(std::initializer_list<const char*> rgszSteps, const char* szCall, int nAnswer) {
    for (const char* szStep : rgszSteps) {
        const auto it = gPClient->mapWords.find(szStep);
        Put(szStep, it == gPClient->mapWords.end() ? "finished" : it->second);
    }
    return gPClient->Call(szCall, nAnswer);
}

}  // namespace

extern "C" {
int TAVOUPnPAddTest(int nRules) {
    return gPClient == nullptr ? Real("TAVOUPnPAddTest", &TAVOUPnPAddTest)(nRules)
                               : Worked({"upnp_add"}, "add", nRules == gPClient->nWanted ? 0 : -1);
}
int TAVOUPnPCountMaxRule() {
    return gPClient == nullptr ? Real("TAVOUPnPCountMaxRule", &TAVOUPnPCountMaxRule)() : gPClient->Call("count", 10);
}
int TAVOUPnPDeletetest() {
    return gPClient == nullptr ? Real("TAVOUPnPDeletetest", &TAVOUPnPDeletetest)()
                               : Worked({"upnp_delete"}, "delete", 0);
}
int TAVOUPnPSetupTest(int nLimit, int nFlags) {
    return gPClient == nullptr ? Real("TAVOUPnPSetupTest", &TAVOUPnPSetupTest)(nLimit, nFlags)
                               : gPClient->Call("setup", nLimit == 60 && nFlags == 0 ? 0 : -1);
}
int TAVOUPnPPortTest(int blAdded) {
    return gPClient == nullptr ? Real("TAVOUPnPPortTest", &TAVOUPnPPortTest)(blAdded)
                               : gPClient->Call(blAdded == 1 ? "open" : "closed", 0);
}
int TAVOUPnPModifyRule() {
    return gPClient == nullptr ? Real("TAVOUPnPModifyRule", &TAVOUPnPModifyRule)()
                               : Worked({"upnp_readd1", "upnp_readd2"}, "modify", 0);
}
int TAVOUpnpRemoveTestRulePath() {
    return gPClient == nullptr ? Real("TAVOUpnpRemoveTestRulePath", &TAVOUpnpRemoveTestRulePath)()
                               : gPClient->Call("end", 0);
}
int TAVOUpnpReportTestProgress(const char* szStep, const char* szValue, int nFlags) {
    if (gPClient == nullptr) {
        return Real("TAVOUpnpReportTestProgress", &TAVOUpnpReportTestProgress)(szStep, szValue, nFlags);
    }
    const OwnMemory own;
    gPClient->rgszReported.push_back(std::string(szStep) + "=" + szValue);
    const auto it = gPClient->mapWords.find(szStep);
    if (it == gPClient->mapWords.end() || strcmp(szStep, "upnp_max") != 0 || strcmp(szValue, "processing") == 0) {
        Put(szStep, szValue);
    } else if (it->second.empty()) {
        std::filesystem::remove(kProgress);
    } else {
        Put(szStep, it->second);
    }
    return 0;
}
int TAVOWriteLog(const char* szText, int nKind, int nLevel) {
    if (gPClient == nullptr) {
        return Real("TAVOWriteLog", &TAVOWriteLog)(szText, nKind, nLevel);
    }
    const OwnMemory own;
    gPClient->rgszRouterLog.push_back(std::string(szText).substr(std::string(szText).find(' ') + 1));
    return 0;
}
int TavoPortConnTestInit() {
    if (gPClient == nullptr) {
        return Real("TavoPortConnTestInit", &TavoPortConnTestInit)();
    }
    Write("/tmp/pfStatusRule", "");
    return gPClient->Call("init", 0);
}
int TavoPortConnTest(const TAVO_PF_CONF* pRules, int nFlags, TAVO_PORT_STATUS* rgStatus, int nRules) {
    if (gPClient == nullptr) {
        return Real("TavoPortConnTest", &TavoPortConnTest)(pRules, nFlags, rgStatus, nRules);
    }
    for (int i = 0; gPClient->nTester == 0 && i < nRules; ++i) {
        rgStatus[i].enStatus = gPClient->rgVerdicts[static_cast<size_t>(i)];
    }
    return gPClient->Call(nFlags == 1 ? "test" : "?", gPClient->nTester);
}
}

namespace {

class RouterTests : public StagedTest {
protected:
    void SetUp() override {
        MakeEmpty({"/etc/portforward", "/usr/tavo/bin", "/var/lib/tavo/tasks"});
        Write("/etc/portforward/router_upnp.db", "[x/y/1]\nsupport=yes\n");
        for (const char* szFile : {kProgress, "/tmp/pfStatusRule"}) {
            std::filesystem::remove(szFile);
        }
        StagedTest::SetUp();
        gPNetwork = &mNetwork;
        gPClient = &mClient;
    }
    void TearDown() override {
        StagedTest::TearDown();
        TLIBCKill(kDaemon, SIGKILL);
    }
    Network mNetwork;
    TestClient mClient;
};

struct StepCase {
    const char* szWhat;
    std::map<std::string, int> mapAnswers;
    std::map<std::string, std::string> mapWords;
    int nResult;
    int nStatusWithoutModel;
    int nLastPercent;  // before the record is filled
    const char* szLine;
};

void Note(const TestResult* pResult, void* pData) {
    static_cast<std::vector<int>*>(pData)->push_back(pResult->nProgress);
}

TEST_F(RouterTests, EachStepThatFails) {
    const StepCase rgCases[] = {
        {"all pass", {}, {}, 0, 0, 90, ""},
        {"add", {{"add", -1}}, {}, 1, 14, 30, "TavoUpnpTestAdd() failed"},
        {"add fails later", {}, {{"upnp_add", "failed"}}, 1, 14, 30, "TavoUpnpTestWaitMessage(upnp_add) failed"},
        {"odd word", {}, {{"upnp_add", "done"}}, 1, 14, 30, "unknown error szValue=done"},
        {"count", {{"count", 0}}, {}, 1, 15, 60, "TavoUpnpTestMaxRuleGet() failed"},
        {"count lost", {}, {{"upnp_max", ""}}, 1, 0, 60, "max empty[0x"},
        {"delete", {{"delete", -1}}, {}, 1, 16, 40, "TavoUpnpTestDeleteRules() failed"},
        {"setup", {{"setup", -1}}, {}, 1, 18, 50, "TavoUpnpTestConnForDeletedPorts() failed"},
        {"deleted ports stay open", {{"closed", 1}}, {}, 1, 18, 50, "TavoUpnpTestConnForDeletedPorts() failed"},
        {"re-add", {{"modify", -1}}, {}, 1, 19, 70, "TavoUpnpTestReAdd() failed"},
        {"second re-add", {}, {{"upnp_readd2", "failed"}}, 1, 19, 70, "TavoUpnpTestWaitMessage(upnp_readd2) failed"},
        {"ports stay closed", {{"open", 1}}, {}, 1, 17, 80, "TavoUpnpTestConnForAddedPorts() failed"},
        {"no end", {{"end", -1}}, {}, 1, 20, 90, "TavoUpnpTestTerminate() failed"},
    };
    // What a user is shown of the steps that the library itself ends.
    const std::map<std::string, std::vector<std::string>> mapShown = {
        {"all pass", {"upnp_terminal=processing", "upnp_terminal=finished"}},
        {"add", {"upnp_add=failed"}},
        {"count", {"upnp_max=-1"}},
        {"delete", {"upnp_delete=failed"}},
        {"setup", {"upnp_connection_failed=failed"}},
        {"deleted ports stay open", {"upnp_connection_failed=failed"}},
        {"re-add", {"upnp_readd1=failed", "upnp_readd2=failed"}},
        {"ports stay closed", {"upnp_connection_success=failed"}}};
    const std::vector<int> rgOrder = {10, 20, 30, 60, 40, 50, 70, 80, 90};
    for (const bool blNamed : {true, false}) {
        for (const StepCase& step : rgCases) {
            SCOPED_TRACE(step.szWhat);
            gLog.clear();
            mClient = TestClient();
            mClient.mapAnswers = step.mapAnswers;
            mClient.mapWords = step.mapWords;
            mNetwork.model = blNamed ? TAVO_UPNP_GATEWAY_MODEL{"Acme", "R1", "1.0"} : TAVO_UPNP_GATEWAY_MODEL{};
            TestResult result = {};
            result.nStatus = 77;
            std::vector<int> rgProgress;
            EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, &Note, &rgProgress, true), step.nResult);
            std::vector<int> rgWanted(rgOrder.begin(),
                                      std::find(rgOrder.begin(), rgOrder.end(), step.nLastPercent) + 1);
            if (blNamed) {
                rgWanted.push_back(100);
            }
            EXPECT_EQ(mNetwork.nUpnpPort, 55001);
            EXPECT_EQ(rgProgress, rgWanted);
            EXPECT_EQ(result.nStatus, blNamed ? 0 : step.nStatusWithoutModel);
            EXPECT_STREQ(result.szSupport, !blNamed ? "" : step.nResult == 0 ? "yes" : "no");
            EXPECT_EQ(result.nMaxRule, !blNamed ? 0 : step.nResult == 0 ? 10 : -1);
            EXPECT_TRUE(*step.szLine == '\0' || LoggedFrom(step.szLine));
            EXPECT_EQ(Logged("fillTestCompResult() failed"), !blNamed);
            EXPECT_EQ(Logged("brand & model & version shall not be all empty"), !blNamed);
            if (const auto shown = mapShown.find(step.szWhat); shown != mapShown.end()) {
                const auto& rgszReported = mClient.rgszReported;
                const auto nLast = static_cast<std::ptrdiff_t>(shown->second.size());
                EXPECT_EQ(std::vector<std::string>(rgszReported.end() - nLast, rgszReported.end()), shown->second);
            }
        }
    }
}

TEST_F(RouterTests, APassedTestInItsOrder) {
    using Lines = std::vector<std::string>;
    mClient.mapWords["upnp_max"] = "7";  // the count kept is the one that stands in the file
    gNSlept = 0;
    TestResult result = {};
    EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true), 0);
    EXPECT_EQ(result.nMaxRule, 7);
    EXPECT_EQ(mClient.rgszRouterLog,
              (Lines{"=====init upnp start=====", "=====add port test start=====", "=====count max rule start=====",
                     "=====delete port test start=====", "=====test ports connection status(del) start=====",
                     "=====re-add port test start=====", "=====test ports connection status(add) start=====",
                     "=====terminal daemon====="}));
    EXPECT_EQ(mClient.rgszCalls, (Lines{"add", "count", "delete", "setup", "closed", "modify", "open", "end"}));
    EXPECT_EQ(
        mClient.rgszReported,
        (Lines{"upnp_init=processing", "upnp_add=processing", "upnp_init=success", "upnp_add=processing",
               "upnp_max=processing", "upnp_max=10", "upnp_delete=processing", "upnp_connection_failed=processing",
               "upnp_connection_failed=success", "upnp_readd1=processing", "upnp_connection_success=processing",
               "upnp_connection_success=success", "upnp_terminal=processing", "upnp_terminal=finished"}));
    EXPECT_EQ(gNSlept, 7 * 4);  // seven steps are waited for
    EXPECT_EQ(gLog, Lines());
    // A step that is worked on is looked at each second, and an end is waited for.
    mClient.mapWords["upnp_add"] = "processing";
    gFnOnSleep = [] {
        if (gNSlept >= 5) {
            TLIBCFileSetKeyValue("/tmp/upnp_test.progress", "upnp_add", "finished", nullptr);
        }
    };
    gNSlept = 0;
    EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true), 0);
    EXPECT_EQ(gNSlept, 7 * 4 + 4);
    // And one whose word is lost, whenever that is, is not done.
    for (const int nLost : {0, 1, 2}) {
        int nSleeps = 0;
        gFnOnSleep = [&] {
            if (nSleeps == nLost) {
                std::filesystem::remove(kProgress);
            } else if (nSleeps == 1) {
                TLIBCFileSetKeyValue(kProgress, "upnp_add", "finished", nullptr);
            }
            ++nSleeps;
        };
        gLog.clear();
        EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true), 1) << nLost;
        EXPECT_EQ(gLog, (Lines{"TLIBCFileGetKeyValue() failed", "TavoUpnpTestWaitMessage(upnp_add) failed"}));
        EXPECT_EQ(nSleeps, nLost + 1);
    }
    gFnOnSleep = nullptr;
    mClient.mapWords.erase("upnp_add");
    for (const TAVO_UPNP_GATEWAY_MODEL& model :
         {TAVO_UPNP_GATEWAY_MODEL{"A", "", ""}, TAVO_UPNP_GATEWAY_MODEL{"", "B", ""},
          TAVO_UPNP_GATEWAY_MODEL{"", "", "C"}}) {
        mNetwork.model = model;
        result.szSupport[0] = '\0';
        EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true), 0);
        EXPECT_STREQ(result.szSupport, "yes") << "one word names it well enough";
    }
}

TEST_F(RouterTests, RefusedStartsEndTheRunningTest) {
    EXPECT_EQ(TLibTestUpnpCompatibility(2, nullptr, nullptr, nullptr, false), -1);
    EXPECT_TRUE(Logged("nMaxRule=2 < 3 is out of range"));
    EXPECT_EQ(TLibTestUpnpCompatibility(3, nullptr, nullptr, nullptr, false), -1);
    EXPECT_TRUE(Logged("testCompResult is NULL"));
    EXPECT_EQ(mClient.rgszCalls, (std::vector<std::string>{"end", "end"}));
    EXPECT_FALSE(Logged("final release:TavoUpnpTestTerminate() failed"));

    TestResult result = {};
    ASSERT_EQ(TLibTavoPortMapLock(), 0);
    EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true), -1);
    EXPECT_EQ(result.nStatus, 2);
    TLibTavoPortMapUnLock();
    mNetwork.nUpnpInit = 1;
    EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true), -1);
    EXPECT_EQ(result.nStatus, 13);
    EXPECT_TRUE(Logged("TavoUpnpTestInit() failed"));
    EXPECT_EQ(result.nProgress, 20);
    EXPECT_EQ(mClient.rgszCalls.back(), "end");
    const auto fnWord = [](const char* szStep) {
        char szWord[20] = {};
        TLIBCFileGetKeyValue(kProgress, szStep, szWord, sizeof(szWord), 0);
        return std::string(szWord);
    };
    EXPECT_EQ(fnWord("upnp_init"), "failed");
    EXPECT_EQ(mClient.rgszRouterLog.end()[-2], "init fail, try again later");
    mNetwork.nUpnpInit = 0;
    mNetwork.model.reset();
    result = {};
    EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true), -1);
    EXPECT_EQ(result.nStatus, 13);
    EXPECT_EQ(fnWord("upnp_init"), "failed");
    EXPECT_EQ(mClient.rgszRouterLog.end()[-2], "Failed to get model information from gateway");
    mNetwork.model = TAVO_UPNP_GATEWAY_MODEL{"Acme", "R1", "1.0"};
    // The end itself fails, with a daemon and without one.
    gStage.blOn = true;
    for (const char* szStep : {"end", "delete"}) {
        gLog.clear();
        mClient.mapAnswers = {{szStep, -1}};
        EXPECT_EQ(TLibTestUpnpCompatibility(2, &result, nullptr, nullptr, true), -1);
        EXPECT_TRUE(Logged("final release:TavoUpnpTestTerminate() failed"));
        EXPECT_EQ(Logged("TAVOUPnPDeletetest() failed"), !gStage.alive.empty());
        EXPECT_EQ(fnWord("upnp_terminal"), gStage.alive.empty() ? "finished" : "failed");
        gStage.alive.insert("/usr/tavo/sbin/upnpd --debug -p");
    }
    gStage = Stage();
    mClient.mapAnswers.clear();

    // A daemon in test mode, by its command line.
    ASSERT_EQ(TLIBCSystem("perl -e '$0 = \"/usr/tavo/sbin/upnpd --debug -p\"; sleep 60' >/dev/null 2>&1 &"), 0);
    ASSERT_TRUE(SoonTrue([] { return TLIBCIsProcAlive(kDaemon) == 1; }));
    EXPECT_EQ(TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true), -1);
    EXPECT_TRUE(Logged("upnp compatibility test process:/usr/tavo/sbin/upnpd --debug -p is running"));
    EXPECT_EQ(mClient.rgszCalls.back(), "delete");
    Write(kProgress, "x=\"y\"\n");
    EXPECT_EQ(TLibStopTestUpnpCompatibility(), 0);
    EXPECT_TRUE(SoonTrue([] { return TLIBCIsProcAlive(kDaemon) == 0; })) << "SIGHUP ends it";
    EXPECT_FALSE(std::filesystem::exists(kProgress));
}

// The test client itself, without a router: what it answers while no daemon runs, and what one that runs is told.
TEST_F(RouterTests, TheClientOrdersWhatIsAskedOfItAndEndsTheDaemonWhenItGivesUp) {
    gPNetwork = nullptr;
    gPClient = nullptr;
    static constexpr char kRules[] = "/var/lib/tavo/upnp_test.conf";
    std::filesystem::remove(kRules);
    std::error_code error;
    std::filesystem::rename("/usr/tavo/sbin/upnpd", "/usr/tavo/sbin/aside", error);  // another test's
    for (const auto& [szFirst, nRules, szWanted, nWanted] : {std::tuple{"", 3, "24500", 3},
                                                             {"1023", 1, "1024", 1},
                                                             {"1025", 1, "1025", 1},
                                                             {"60001", 1, "60000", 1},
                                                             {"59999", 1001, "59999", 1000},
                                                             {"", 1, "24500", 1},
                                                             {"", 0, "24500", 1}}) {
        Write("/etc/tavo/platform.conf",
              *szFirst == '\0' ? "" : std::string("[upnptest]\nfirst_port=\"") + szFirst + "\"\n");
        EXPECT_EQ(TAVOUPnPAddTest(nRules), -1) << "there is no program to do it";
        EXPECT_EQ(TLIBCErrGet(), nRules < 1 ? TLIBC_ERR_BAD_PARAMETER : TLIBC_ERR_EXEC);
        const auto rgSections = *tavo::ParseSections(Read(kRules));
        EXPECT_EQ(rgSections.size(), static_cast<size_t>(nWanted)) << szFirst << nRules;
        EXPECT_EQ(rgSections[0].rgPairs[0].szValue + rgSections[0].rgPairs[1].szValue,
                  std::string(szWanted) + szWanted);
    }
    std::filesystem::remove("/etc/tavo/platform.conf");
    EXPECT_TRUE(std::filesystem::exists("/var/tmp/upnp_portmap.status") &&
                std::filesystem::exists("/tmp/pfStatusRule"));
    const auto fnKept = [](bool blKept) {
        Write(kRules, std::string("[1]\nr_port=7\ns_port=8\nenabled=") + (blKept ? "1" : "0") + "\nresult=1\n");
    };
    using Ask = std::function<int()>;
    const auto fnMarker = [](const char* szWanted) {
        return std::string("wanted=\"") + szWanted + "\"\n7/tcp=\"8\"\nresult=\"failed\"\n";
    };
    for (const auto& [szWhat, fnAsk, nAlone, nAnswer, szOrder, szMarker] :  // without a daemon, and with one
         {std::tuple<const char*, Ask, int, int, std::string, std::string>{
              "modify", [] { return TAVOUPnPModifyRule(); }, -1, 0, "modify", ""},
          {"end", [] { return Put("upnp_terminal", "processing"), TAVOUPnPDeletetest(); }, -1, 0, "end", ""},
          {"delete", [] { return Put("upnp_terminal", "finished"), TAVOUPnPDeletetest(); }, -1, 0, "delete", ""},
          {"a second test", [] { return TAVOUPnPAddTest(1); }, -1, -1, "", ""},
          {"no limit", [] { return TAVOUPnPSetupTest(0, 0); }, -1, -1, "end", ""},
          {"flags", [] { return TAVOUPnPSetupTest(60, 1); }, -1, -1, "end", ""},
          {"a limit", [] { return TAVOUPnPSetupTest(1, 0); }, -1, 0, "", ""},
          {"none held", [&] { return fnKept(false), TAVOUPnPCountMaxRule(); }, 0, 0, "end", ""},
          {"no router", [&] { return fnKept(true), TAVOUPnPCountMaxRule(); }, -1, -1, "end", ""},
          {"no ports", [&] { return fnKept(false), TAVOUPnPPortTest(1); }, -1, -1, "end", ""},
          {"open", [&] { return fnKept(true), TAVOUPnPPortTest(1); }, -1, -1, "end", fnMarker("open")},
          {"closed", [&] { return fnKept(true), TAVOUPnPPortTest(0); }, -1, -1, "end", fnMarker("closed")}}) {
        std::filesystem::remove("/tmp/pfStatusRule");
        std::filesystem::remove("/tmp/orders");
        EXPECT_EQ(fnAsk(), nAlone) << szWhat;
        Write("/tmp/daemon",
              "$0 = '/usr/tavo/sbin/upnpd --debug -p'; use Socket; socket(S, AF_UNIX, SOCK_DGRAM, 0);"
              "bind(S, sockaddr_un('/var/run/upnpd_test.sock')); alarm(60); while (recv(S, $m, 99, 0), $m) {"
              "open(F, '>>/tmp/orders'); print F $m; close(F); exit if $m eq 'end' }");
        ASSERT_EQ(TLIBCSystem("perl /tmp/daemon >/dev/null 2>&1 &"), 0);
        SoonTrue([] { return std::filesystem::exists("/var/run/upnpd_test.sock"); });
        EXPECT_EQ(fnAsk(), nAnswer) << szWhat;
        const bool blEnded = TLIBCIsProcAlive(kDaemon) == 0;
        EXPECT_TRUE(std::string(szWhat) == "end" || blEnded == (szOrder == "end"))
            << szWhat << ": its end is waited for";
        SoonTrue([&szOrder = szOrder] { return Read("/tmp/orders") == szOrder; });
        TLIBCKill(kDaemon, SIGKILL);
        SoonTrue([] { return TLIBCIsProcAlive(kDaemon) == 0; });
        EXPECT_EQ(Read("/tmp/orders"), szOrder) << szWhat;
        EXPECT_EQ(Read("/tmp/pfStatusRule"), szMarker) << szWhat;
        std::filesystem::remove("/var/run/upnpd_test.sock");
    }
    EXPECT_EQ(TAVOUpnpRemoveTestRulePath(), 0);
    EXPECT_FALSE(std::filesystem::exists(kRules));
    std::filesystem::create_directories(kRules);
    EXPECT_EQ(TAVOUpnpRemoveTestRulePath(), -1);
    std::filesystem::remove_all(kRules);
    EXPECT_EQ(TAVOUpnpReportTestProgress("s", "v", 0), 0);
    EXPECT_EQ(TAVOUpnpReportTestProgress("", "v", 0), -1);
    EXPECT_STREQ(GetUPnPReportServer(), "");
    std::filesystem::rename("/usr/tavo/sbin/aside", "/usr/tavo/sbin/upnpd", error);
}

TEST_F(RouterTests, RecordIsTheOnlyOne) {
    __tag_TAVO_ROUTER_RECORD record = {};
    EXPECT_EQ(TLibWriteRecordIntoUpnpDB(nullptr), -1);
    EXPECT_TRUE(Logged("record is NULL"));
    snprintf(record.szSupport, sizeof(record.szSupport), "yes");
    record.nMaxRule = 32;
    EXPECT_EQ(TLibWriteRecordIntoUpnpDB(&record), 0);
    EXPECT_EQ(Read("/etc/portforward/router_upnp.db.user"), "[//]\nsupport=\"yes\"\nmax=\"32\"\n\n");
    snprintf(record.szBrand, sizeof(record.szBrand), "a\"]\n[b");
    EXPECT_EQ(TLibWriteRecordIntoUpnpDB(&record), 0);
    int nMax = 0;
    EXPECT_TRUE(RouterUpnpDB("a\"]\n[b", "", "").GetMaxRule(nMax));
    EXPECT_EQ(nMax, 32);
    EXPECT_EQ(Read("/etc/portforward/router_upnp.db.user").find("[//]"), std::string::npos) << "the last one went";
    // Two makers have one record for all their models, wherever it is looked for.
    for (const auto& [szMaker, szKey] :
         {std::pair{"AirPort", "AirPort//"}, {"Tavo Inc.", "Tavo Inc.//"}, {"airport", "airport/m/1"}}) {
        record = {"", "m", "1", "yes", 9};
        snprintf(record.szBrand, sizeof(record.szBrand), "%s", szMaker);
        EXPECT_EQ(TLibWriteRecordIntoUpnpDB(&record), 0);
        EXPECT_TRUE(Read("/etc/portforward/router_upnp.db.user").starts_with("[" + std::string(szKey) + "]\n"))
            << szKey;
        EXPECT_TRUE(RouterUpnpDB(szMaker, "m", "1").GetMaxRule(nMax)) << szKey;
    }
}

void SetDetected(const char* szBrand) {
    NOS::Task task("@system", ".upnp_detector");
    task.beginUpdate();
    task.setProperty("router_brand", szBrand);
    task.setProperty("router_model", "m");
    task.setProperty("support_upnp", "yes");
    task.setProperty("able_get_brand_model_version", "yes");
    ASSERT_EQ(task.endUpdate(), 1);
    RouterUpnpDBUserWriter writer(std::string(szBrand) + "/m/");
    ASSERT_TRUE(writer.SetMaxRule(5) && writer.Sync());
}

std::string gSzAtSignal;  // the router settings when the signal came

TEST_F(RouterTests, ReportArchivesAndPutsTheSettingsBack) {
    // Brand, archive before "_SECONDS.tgz", whether there are settings, and what the upload ends with.
    const std::tuple<const char*, const char*, bool, int> rgCases[] = {
        {"Acme (EU) R-1+", "Acme (EU) R-1+", true, 0},
        {"x'; touch /tmp/owned; '", "x__ touch _tmp_owned_ _", true, 0},
        {"../../etc/x", ".._.._etc_x", false, 0},
        {"..", "upnpresult", true, 0},
        {"", "upnpresult", true, 1}};
    for (const char* szFile : {kProgress, "/var/tmp/upnp_portmap.status", "/var/log/router.log", "/tmp/pfStatusRule"}) {
        Write(szFile, "a=\"b\"\n");
    }
    for (const auto& [szBrand, szName, blSettings, nCurl] : rgCases) {
        SCOPED_TRACE(szBrand);
        SetDetected(szBrand);
        std::filesystem::remove("/etc/portforward/router.conf");
        if (blSettings) {
            Write("/etc/portforward/router.conf", "[10.0.0.1]\nbrand=mine\n");
        }
        WriteProgram("/usr/tavo/bin/curl",
                     "printf '%s\\n' \"$@\" > /tmp/curl.args\nexit " + std::to_string(nCurl) + "\n");
        std::filesystem::remove("/tmp/curl.args");
        EXPECT_EQ(TLibUploadTestUpnpCompatibilityFailResult(), nCurl == 0 ? 0 : -1);
        EXPECT_EQ(Logged("update upnp router info failed"), nCurl != 0);

        const std::string szArgs = Read("/tmp/curl.args");
        const size_t nStart = szArgs.find("uploadedfile=@") + 14;
        const std::string szArchive = szArgs.substr(nStart, szArgs.find(';', nStart) - nStart);
        const std::string szStem = std::string("/tmp/") + szName + "_";
        EXPECT_TRUE(szArchive.starts_with(szStem) && szArchive.ends_with(".tgz")) << szArchive;
        EXPECT_EQ(szArchive.find_first_not_of("0123456789", szStem.size()), szArchive.size() - 4) << szArchive;
        EXPECT_TRUE(szArgs.starts_with("--digest\n-u\ntavoreportuser:rtrsubmit417\n-F\n"));
        EXPECT_TRUE(szArgs.ends_with(";filename=" + szArchive + "\n" + GetUPnPReportServer() + "\n")) << szArgs;
        ASSERT_EQ(TLIBCSystem(("tar -tzf '" + szArchive + "' > /tmp/names && tar -xOzf '" + szArchive +
                               "' etc/portforward/router.conf > /tmp/sent")
                                  .c_str()),
                  0);
        EXPECT_EQ(Read("/tmp/names"),
                  "etc/portforward/router.conf\ntmp/upnp_test.progress\nvar/tmp/upnp_portmap.status\n"
                  "var/log/router.log\ntmp/pfStatusRule\n");
        EXPECT_NE(Read("/tmp/sent").find("support_router_upnp=\"yes\""), std::string::npos);
        EXPECT_EQ(Read("/etc/portforward/router.conf"), blSettings ? "[10.0.0.1]\nbrand=mine\n" : Read("/tmp/sent"));
        EXPECT_FALSE(std::filesystem::exists("/tmp/owned"));
        std::filesystem::remove(szArchive);
    }
    // Who is told to end in the middle of an upload ends with the settings in place.
    Write("/etc/portforward/router.conf", "[10.0.0.1]\nbrand=mine\n");
    Write("/usr/tavo/bin/curl", "#!/bin/sh\nkill -TERM " + std::to_string(getpid()) + "\n");
    gSzAtSignal.clear();
    const auto pfnBefore = signal(SIGTERM, [](int) { gSzAtSignal = Read("/etc/portforward/router.conf"); });
    EXPECT_EQ(TLibUploadTestUpnpCompatibilityFailResult(), 0);
    signal(SIGTERM, pfnBefore);
    EXPECT_EQ(gSzAtSignal, "[10.0.0.1]\nbrand=mine\n");

    gStage.blOn = true;  // where the commands only say what they are
    for (const auto& [szFail, szLine] :
         {std::pair("run", "failed to tar test upnp router result!["), {"", "can't found result file [/tmp/other_"}}) {
        SetDetected("other");
        gStage.szFail = szFail;
        gStage.nWorks = 0;
        EXPECT_EQ(TLibUploadTestUpnpCompatibilityFailResult(), -1);
        EXPECT_TRUE(LoggedFrom(szLine)) << szLine;
        EXPECT_EQ(Read("/etc/portforward/router.conf"), "[10.0.0.1]\nbrand=mine\n");
    }
    gStage = Stage();
    gSzGateway.clear();
    EXPECT_EQ(TLibUploadTestUpnpCompatibilityFailResult(), -1);
    EXPECT_TRUE(Logged("TLibGetGatewayIP() failed"));
    EXPECT_EQ(Read("/etc/portforward/router.conf"), "[10.0.0.1]\nbrand=mine\n");
}

TEST_F(RouterTests, PortVerdicts) {
    __tag_TAVO_ROUTER_RULE rgRules[7] = {};
    for (int i = 0; i < 7; ++i) {
        rgRules[i].enTestStatus = 9;
        snprintf(rgRules[i].szRouterPort, sizeof(rgRules[i].szRouterPort), "%d", 5000 + i);
    }
    auto enErr = TAVO_LIBTAVOPORTMAP_ERR_FAILED;
    EXPECT_EQ(TLibTestRules(1, nullptr, &enErr, true), -1);
    EXPECT_EQ(TLibTestRules(-1, rgRules, &enErr, true), -1);
    EXPECT_TRUE(Logged("Bad parameter, 0 > nRules=-1"));
    EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_FAILED);
    EXPECT_EQ(TLibTestRules(7, rgRules, &enErr, true), -1);
    EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_NONE);
    EXPECT_TRUE(Logged("TLibTestRules() has not been initialized, call TLibTestRulesInit() before TLibTestRules()"));
    Write("/tmp/pfStatusRule", "");
    mClient.nTester = -1;
    EXPECT_EQ(TLibTestRules(7, rgRules, &enErr, true), -1);
    EXPECT_EQ(rgRules[0].enTestStatus, 9);
    mClient.nTester = 0;
    mClient.rgVerdicts = {0, 1, 2, 3, 4, 5, 9};
    EXPECT_EQ(TLibTestRules(7, rgRules, &enErr, true), 0);
    const int rgWanted[] = {1, 0, 2, 3, 3, 0, 1};
    for (int i = 0; i < 7; ++i) {
        EXPECT_EQ(rgRules[i].enTestStatus, rgWanted[i]) << i;
    }
    EXPECT_TRUE(Logged("router_prots [5001] = UNKNOWN"));
    EXPECT_TRUE(Logged("router_prots [5005] = NOLISTEN"));
    EXPECT_TRUE(Logged("[6] enStatus=9 is non-support enum case"));
    EXPECT_EQ(TLibTestRules(0, rgRules, &enErr, true), 0);
    ASSERT_EQ(TLibTavoPortMapLock(), 0);
    EXPECT_EQ(TLibTestRules(7, rgRules, &enErr, true), -1);
    EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_CONFLICT);
    TLibTavoPortMapUnLock();
}

// What ran out anywhere is a failure, never half of a success.
TEST_F(RouterTests, SurviveMemoryThatRunsOut) {
    constexpr char kSettings[] = "[10.0.0.1]\nbrand=mine\n";
    constexpr char kUserDb[] = "/etc/portforward/router_upnp.db.user";
    gStage.blOn = true;  // no daemon, and commands that only say what they are
    gStage.fnRun = PackNothing;
    SetDetected("a brand longer than a small string");
    mNetwork.model = TAVO_UPNP_GATEWAY_MODEL{"a brand longer than a small string", "R1", "1.0"};
    const std::string szKnown = Read(kUserDb);
    mClient.rgVerdicts = {2, 2};
    std::set<int> ends;
    std::string szSaid;
    RunOutOfMemory([&](const auto& fnArm) {
        TestResult result = {};
        gLog.clear();
        fnArm();
        const int nResult = TLibTestUpnpCompatibility(10, &result, nullptr, nullptr, true);
        gNGoodAllocations = -1;
        EXPECT_STREQ(result.szSupport, nResult == 0 ? "yes" : nResult == 1 ? "no" : "");
        EXPECT_EQ(result.nMaxRule, nResult == 0 ? 10 : nResult == 1 ? -1 : 0);
        ends.insert(nResult);

        __tag_TAVO_ROUTER_RULE rgRules[2] = {};
        Write("/tmp/pfStatusRule", "");
        fnArm();
        const int nWanted = TLibTestRules(2, rgRules, nullptr, true) == 0 ? 2 : 0;
        gNGoodAllocations = -1;
        EXPECT_EQ(rgRules[0].enTestStatus + rgRules[1].enTestStatus, 2 * nWanted);

        Write("/etc/portforward/router.conf", kSettings);
        fnArm();
        const int nReported = TLibUploadTestUpnpCompatibilityFailResult();
        gNGoodAllocations = -1;
        EXPECT_EQ(Read("/etc/portforward/router.conf"), kSettings);
        EXPECT_TRUE(nReported == 0 || gBlAllocationFailed);
        EXPECT_EQ(TLibTavoPortMapLock(), 0);
        TLibTavoPortMapUnLock();

        __tag_TAVO_ROUTER_RECORD record = {"a brand longer than a small string", "m", "", "yes", 5};
        std::filesystem::remove(kUserDb);
        fnArm();
        const bool blKept = TLibWriteRecordIntoUpnpDB(&record) == 0;
        gNGoodAllocations = -1;
        EXPECT_EQ(std::filesystem::exists(kUserDb), blKept);
        Write(kUserDb, szKnown);
        for (const std::string& szLine : gLog) {
            szSaid += szSaid.find(szLine) == std::string::npos ? szLine + "\n" : "";
        }
    });
    for (const char* szLine :
         {"TLIBCFileGetKeyValue() failed\n", "TLibGetRouterDetectResult() failed\n", "set support failed\n",
          "set max rule failed\n", "fail add section into [/etc/portforward/router_upnp.db.user]",
          "fail set section into [", "set router.conf failed\n"}) {
        EXPECT_NE(szSaid.find(szLine), std::string::npos) << szLine;
    }
    EXPECT_EQ(ends, (std::set<int>{-1, 0, 1}));
}

}  // namespace
