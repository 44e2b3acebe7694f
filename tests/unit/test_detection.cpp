// Detection, the detection cache and the router's settings, over the real files and task records; the
// network and the router are stand-ins that each test scripts.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <optional>

#include "libtavoportmap.h"
#include "network.h"
#include "stage.h"
#include "tavo/core.h"
#include "tavo/net.h"
#include "tavo/portforward.h"
#include "world.h"

namespace {

using DetectResult = __tag_TAVO_ROUTER_DETECT_RESULT;
using RouterConf = __tag_TAVO_ROUTER_CONF;

constexpr char kRouterConf[] = "/etc/portforward/router.conf";
constexpr char kRouterConfBak[] = "/etc/portforward/router.conf.bak";
constexpr char kTool[] = "/usr/tavo/bin/tavoportforward";
constexpr char kAnnounced[] = "/tmp/airport.tcp.local";

class Detection : public StagedTest {
protected:
    void SetUp() override {
        MakeEmpty({"/etc/portforward", "/etc.defaults/portforward/routerdb", "/usr/tavo/bin"});
        std::filesystem::remove_all("/var/lib/tavo/tasks");
        for (const char* szFile : {"/etc/tavoinfo.conf", kAnnounced}) {
            std::filesystem::remove(szFile);
        }
        Write("/etc/portforward/router_upnp.db",
              "[Acme/R1/1.0]\nsupport=yes\nmax=32\npfpath=Acme: R1(1.0)\n[AirPort//]\nsupport=yes\nmax=5\n"
              "[Bad/R/1]\nsupport=yes\npfpath=../..: etc(x)\n");
        Write("/etc.defaults/portforward/routerdb/Acme/R1/1.0/router.des", "[global]\nsyntax version=1\n");
        SetTool("syntax version=1");
        StagedTest::SetUp();
        gPNetwork = &mNetwork;
    }
    static void SetTool(const std::string& szLine) { WriteProgram(kTool, "echo '" + szLine + "'\n"); }
    Network mNetwork;
};

// ---- the cache -----------------------------------------------------------------------------------------

TEST_F(Detection, CacheHoldsOneGatewayAndItsReaderSaysWhatItLacks) {
    EXPECT_EQ(DetectCache::ToString(static_cast<__TAG_TAVO_ROUTER_INIT_STATE>(4)), "");
    EXPECT_TRUE(Logged("non supported enState=4"));
    EXPECT_EQ(DetectCache::ToString(TAVO_ROUTER_INIT_STATE_UNKNOWN) +
                  DetectCache::ToString(TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED) +
                  DetectCache::ToString(TAVO_ROUTER_INIT_STATE_UPNP_NATPMP) +
                  DetectCache::ToString(TAVO_ROUTER_INIT_STATE_MANUAL),
              "unknownnot_initializedupnp_natpmpmanual");
    EXPECT_EQ(CleanDetectManualCache(), 1);
    ASSERT_EQ(SetDetectManualCache("10.0.0.1", "A", "B", "C"), 1);
    ASSERT_EQ(SetDetectManualCache("192.168.1.1", "x\"; [10.0.0.1]\n", "R1", "2"), 1);
    EXPECT_EQ(Read(SZF_DETECT_MANUAL_CACHE).find("\n["), std::string::npos);

    auto enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
    std::string szText = "kept";
    DetectCacheReader reader("192.168.1.1");
    EXPECT_EQ(reader.GetBrand(szText), 0);
    EXPECT_TRUE(Logged("can not GetBrand(), mEnReaderState=not initialized"));
    bool blExisted = false;
    ASSERT_EQ(reader.IsSectionExisted(blExisted), 1);
    EXPECT_TRUE(blExisted);
    EXPECT_EQ(reader.GetType(enState), 1);
    EXPECT_EQ(enState, TAVO_ROUTER_INIT_STATE_MANUAL);
    EXPECT_EQ(reader.GetBrand(szText), 1);
    EXPECT_EQ(szText, "x\"; [10.0.0.1]\n");

    EXPECT_EQ(reader.GetModel(szText), 1);
    EXPECT_EQ(szText, "R1");
    EXPECT_EQ(reader.GetVersion(szText), 1);
    EXPECT_EQ(szText, "2");
    EXPECT_EQ(DetectCacheReader("192.168.1.1").GetType(enState), 0);
    EXPECT_EQ(DetectCacheWriter("192.168.1.1").SetType(static_cast<__TAG_TAVO_ROUTER_INIT_STATE>(4)), 0);
    EXPECT_EQ(DetectCacheWriter("192.168.1.1").SetType(static_cast<__TAG_TAVO_ROUTER_INIT_STATE>(-1)), 0);
    EXPECT_TRUE(Logged("error: invalid enume type enState=4"));
    gStage.blOn = true;
    for (const auto& [szFail, szLine] : {std::pair{"brand", "set brand failed"},
                                         {"model", "set model failed"},
                                         {"version", "set version failed"},
                                         {"router_detect", "set type failed"},
                                         {"hash", "hash malloc failed"}}) {
        gLog.clear();
        gStage.szFail = szFail;
        gStage.nWorks = 0;
        EXPECT_EQ(SetDetectManualCache("192.168.1.1", "never", "kept", "3"), 0) << szFail;
        EXPECT_TRUE(Logged(szLine)) << szLine;
    }
    gLog.clear();
    EXPECT_EQ(DetectCacheReader("192.168.1.1").IsSectionExisted(blExisted), 0);
    EXPECT_EQ(gLog, (std::vector<std::string>{"hash malloc failed", "Init() failed"}));
    gStage = Stage();
    EXPECT_EQ(Read(SZF_DETECT_MANUAL_CACHE).find("never"), std::string::npos);

    DetectCacheReader other("10.0.0.1");
    EXPECT_EQ(other.IsSectionExisted(blExisted), 1);
    EXPECT_FALSE(blExisted);
    EXPECT_EQ(other.GetType(enState), 0);
    EXPECT_TRUE(Logged("can not GetVersion(), mEnReaderState=section not existed"));
    Write(SZF_DETECT_MANUAL_CACHE, "[192.168.1.1]\nrouter_detect=Manual\n");
    DetectCacheReader odd("192.168.1.1");
    ASSERT_EQ(odd.Init(), 1);
    EXPECT_EQ(odd.Init(), 1) << "loaded already";
    EXPECT_EQ(odd.GetType(enState), 0);
    EXPECT_TRUE(Logged("invalid szValue=Manual"));
    EXPECT_EQ(odd.GetModel(szText), 0);
    EXPECT_TRUE(Logged("TLIBCSzHashGetValue(model) failed"));

    Write(SZF_DETECT_MANUAL_CACHE, "nonsense\n");
    DetectCacheReader broken("192.168.1.1");
    EXPECT_EQ(broken.IsSectionExisted(blExisted), 0);
    EXPECT_TRUE(Logged("Init() failed") && LoggedFrom("TLIBCFileGetSection(" + SZF_DETECT_MANUAL_CACHE));
    EXPECT_EQ(broken.IsSectionExisted(blExisted), 0);  // loaded once, and for good
    EXPECT_TRUE(Logged("initialize failed"));
    EXPECT_EQ(broken.GetBrand(szText), 0);
    EXPECT_TRUE(Logged("can not GetBrand(), mEnReaderState=failed"));
}

// ---- the detectors ---------------------------------------------------------------------------------------

TEST_F(Detection, UpnpVerdicts) {
    std::filesystem::create_directories("/etc.defaults/portforward/routerdb/x");
    const std::tuple<const char*, int, std::optional<TAVO_UPNP_GATEWAY_MODEL>, bool, const char*, const char*, int,
                     const char*>
        rgCases[] = {
            {"known model", 0, TAVO_UPNP_GATEWAY_MODEL{"Acme", "R1", "1.0"}, true, "yes", "Acme: R1(1.0)", 0, ""},
            {"no router", 1, {}, true, "no", "", 0, "init UPnP faild"},
            {"no model", 0, {}, true, "no", "", 0, ""},
            {"brand for all models", 0, TAVO_UPNP_GATEWAY_MODEL{"AirPort", "x", "y"}, true, "yes", "", 0, ""},
            {"unknown model", 0, TAVO_UPNP_GATEWAY_MODEL{"Acme", "R2", "1.0"}, true, "unknown", "", 0, ""},
            {"no name at all", 0, TAVO_UPNP_GATEWAY_MODEL{}, false, "no", "", 0, "query router upnp db failed"},
            {"path out of the database", 0, TAVO_UPNP_GATEWAY_MODEL{"Bad", "R", "1"}, true, "yes", "", 1,
             "pfPath does not exist"},
        };
    Write("/etc.defaults/etc/x/router.des", "");
    for (const auto& [szWhat, nInit, model, blResult, szSupport, szPfPath, nUpdates, szLine] : rgCases) {
        SCOPED_TRACE(szWhat);
        mNetwork = Network();
        mNetwork.nUpnpInit = nInit;
        mNetwork.model = model;
        gLog.clear();
        UpnpDetector detector;
        EXPECT_EQ(detector.Start(), blResult);
        EXPECT_EQ(mNetwork.nUpnpPort, 55002);
        EXPECT_EQ(detector.GetSupportUpnp(), szSupport);
        EXPECT_EQ(detector.GetPfPath(), szPfPath);
        EXPECT_EQ(detector.IsAbleToGetBrandModelVersion(), model.has_value());
        EXPECT_EQ(detector.GetBrand(), model ? model->szBrand : "");
        EXPECT_EQ(mNetwork.nRouterDbUpdates, nUpdates);
        EXPECT_TRUE(*szLine == '\0' || Logged(szLine));
        EXPECT_TRUE(IsLockFree("/tmp/upnp_detector.lock"));
        EXPECT_EQ(Read("/etc/tavoinfo.conf") == "runupnpportmapping=\"no\"\n", nInit == 1);
        std::filesystem::remove("/etc/tavoinfo.conf");
    }
}

TEST_F(Detection, MissingDescriptionIsFetchedOnceAndALockedDetectionChangesNothing) {
    std::filesystem::remove_all("/etc.defaults/portforward/routerdb/Acme");
    UpnpDetector detector;
    EXPECT_TRUE(detector.Start());
    EXPECT_EQ(detector.GetPfPath(), "");
    mNetwork.fnRouterDbUpdate = [] { Write("/etc.defaults/portforward/routerdb/Acme/R1/1.0/router.des", ""); };
    EXPECT_TRUE(detector.Start());
    EXPECT_EQ(detector.GetPfPath(), "Acme: R1(1.0)");
    EXPECT_EQ(mNetwork.nRouterDbUpdates, 2);
    for (const int nUpdated : {0, 7, -1}) {
        mNetwork.nRouterDbUpdate = nUpdated;
        int nVersion = 5;
        EXPECT_EQ(TLibUpdateRouterDBList(&nVersion), nUpdated < 0 ? 0 : 1);
        EXPECT_EQ(nVersion, nUpdated);
    }
    mNetwork.fnRouterDbUpdate = [] {};
    std::filesystem::remove_all("/etc.defaults/portforward/routerdb/Acme");
    EXPECT_TRUE(detector.Start());
    EXPECT_EQ(detector.GetPfPath(), "");
    EXPECT_TRUE(Logged("update router db failed") && Logged("pfPath does not exist"));

    int fd = -1;
    ASSERT_EQ(lock_file("/tmp/upnp_detector.lock", fd), 1);
    mNetwork.model = TAVO_UPNP_GATEWAY_MODEL{"Other", "R2", "2"};
    EXPECT_FALSE(detector.Start());
    EXPECT_TRUE(Logged("another upnp detector is running"));
    EXPECT_EQ(detector.GetBrand(), "Acme");
    unlock_file(fd);
}

TEST_F(Detection, AirPortPolls) {
    const struct {
        const char* szWhat;
        int nCreated;  // poll before which the file appears; 0: never
        int nGone;     // poll before which it vanishes
        const char* szText;
        const char* szSupport;
        const char* szName;
        int nSleeps;
    } rgCases[] = {
        {"seen in poll 3, confirmed in 4", 3, 0, "[192.168.1.1]\nname=Den\n", "yes", "Den", 3},
        {"first seen in the last poll", 6, 0, "[192.168.1.1]\nname=Den\n", "yes", "Den", 6},
        {"never there", 0, 0, "", "no", "", 6},
        {"gone again", 5, 6, "[192.168.1.1]\nname=Den\n", "no", "", 6},
        {"another base station", 1, 0, "[192.168.1.9]\nname=Den\n", "no", "", 1},
        {"no name", 1, 0, "[192.168.1.1]\nkind=x\n", "yes", "", 1},
        {"no list", 1, 0, "garbage\n", "no", "", 1},
    };
    for (const auto& airPort : rgCases) {
        SCOPED_TRACE(airPort.szWhat);
        Write(kAnnounced, "[192.168.1.1]\nname=stale\n");
        std::filesystem::remove("/etc/tavoinfo.conf");
        gNSlept = 0;
        const auto fnBefore = [&](int nPoll) {
            if (nPoll == airPort.nCreated) {
                Write(kAnnounced, airPort.szText);
            } else if (nPoll == airPort.nGone) {
                std::filesystem::remove(kAnnounced);
            }
        };
        gFnOnSleep = [&] { fnBefore(gNSlept + 2); };  // the poll that follows
        mNetwork.szAnnounced = airPort.nCreated == 1 ? std::optional<std::string>(airPort.szText) : std::nullopt;
        NatpmpDetector detector;
        gLog.clear();
        EXPECT_TRUE(detector.Start("192.168.1.1"));
        EXPECT_EQ(Logged("Failed to Get Section [192.168.1.1], so that target router is not natpmp"),
                  airPort.nCreated == 1 && std::string(airPort.szSupport) == "no");
        EXPECT_EQ(detector.GetSupportNatpmp(), airPort.szSupport);
        EXPECT_EQ(detector.GetUserSettingName(), airPort.szName);
        EXPECT_EQ(detector.GetBrand(), std::string(airPort.szSupport) == "yes" ? "AirPort" : "");
        EXPECT_EQ(gNSlept, airPort.nSleeps);
        EXPECT_EQ(Read("/etc/tavoinfo.conf"),
                  std::string(airPort.szSupport) == "no" ? "runnatpmpportmapping=\"no\"\n" : "");
        EXPECT_TRUE(IsLockFree("/tmp/natpmp_detector.lock"));
    }
}

TEST_F(Detection, NatpmpRefusals) {
    NatpmpDetector detector;
    EXPECT_FALSE(detector.Start(nullptr));
    EXPECT_FALSE(detector.Start(""));
    EXPECT_TRUE(Logged("szGatewayIP is NULL or empty"));
    mNetwork.szAnnounced = "[192.168.1.1]\nname=Den\n";
    ASSERT_TRUE(detector.Start("192.168.1.1"));
    mNetwork.nServiceRestart = -1;
    EXPECT_FALSE(detector.Start("192.168.1.1"));
    EXPECT_TRUE(Logged("call TLIBNetService() error"));
    EXPECT_EQ(detector.GetSupportNatpmp(), "");  // the emptied record was published
    EXPECT_TRUE(IsLockFree("/tmp/natpmp_detector.lock"));
}

TEST_F(Detection, FilesThatOthersPlantedInTmpHoldNobody) {
    const std::string szLong(3000, 'n');
    std::string szMany;
    for (int i = 0; i < 10000; ++i) {
        szMany += "[10.0." + std::to_string(i / 250) + "." + std::to_string(i % 250) +
                  "]\nname=" + szLong.substr(0, 99) + "\n";
    }
    Write("/tmp/elsewhere", "not for everybody");
    const std::pair<std::function<void()>, std::string> rgCases[] = {
        {[] { mkfifo(kAnnounced, 0666); }, "no"},
        {[] { std::filesystem::create_directory(kAnnounced); }, "no"},
        {[] { symlink("/tmp/elsewhere", kAnnounced); }, "no"},
        {[] { symlink("/dev/zero", kAnnounced); }, "no"},
        {[&] { Write(kAnnounced, szMany + "[192.168.1.1]\nname=" + szLong + "\n"); }, "yes"},
    };
    NatpmpDetector detector;
    for (const auto& [fnPlant, szSupport] : rgCases) {
        mNetwork.fnAnnounce = fnPlant;
        EXPECT_TRUE(detector.Start("192.168.1.1"));
        EXPECT_EQ(detector.GetSupportNatpmp(), szSupport) << &szSupport - &rgCases[0].second;
        std::filesystem::remove(kAnnounced);
    }
    EXPECT_EQ(detector.GetUserSettingName(), szLong);
    EXPECT_EQ(Read("/tmp/elsewhere"), "not for everybody");
    for (const bool blPipe : {true, false}) {
        for (const char* szLock : {"/tmp/upnp_detector.lock", "/tmp/natpmp_detector.lock"}) {
            std::filesystem::remove(szLock);
            EXPECT_EQ(blPipe ? mkfifo(szLock, 0666) : mkdir(szLock, 0777), 0);
        }
        EXPECT_EQ(UpnpDetector().Start(), blPipe);
        EXPECT_EQ(detector.Start("192.168.1.1"), blPipe);
        EXPECT_EQ(Logged("another natpmp detector is running"), !blPipe);
    }
    std::filesystem::remove("/tmp/upnp_detector.lock");
    std::filesystem::remove("/tmp/natpmp_detector.lock");
}

TEST_F(Detection, AResultThatCannotBeStoredIsNoSuccess) {
    mNetwork.fnInit = [] {
        std::filesystem::remove_all("/var/lib/tavo/tasks");
        Write("/var/lib/tavo/tasks", "");
    };
    EXPECT_FALSE(UpnpDetector().Start());
    EXPECT_NE(gLog.back().find("the result of the detection could not be stored["), std::string::npos);
    EXPECT_TRUE(IsLockFree("/tmp/upnp_detector.lock"));
}

// ---- the driver ------------------------------------------------------------------------------------------

void NoteProgress(const DetectResult* pResult, void* pData) {
    static_cast<std::vector<int>*>(pData)->push_back(pResult == nullptr ? -1 : pResult->nProgress);
}

TEST_F(Detection, DriverInEachNetwork) {
    const auto fnBadModel = [this] { mNetwork.model = TAVO_UPNP_GATEWAY_MODEL{"Bad", "R", "1"}; };
    const std::vector<int> rgAll = {10, 20, 30, 40, 70, 50, 80, 80};
    // With how many of those there are: where it ends before, the last one is told twice.
    const std::tuple<const char*, std::function<void()>, size_t, int, int, int, int, const char*> rgCases[] = {
        {"all is well", [] {}, 8, 0, 0, 0, 32, "All network env checks are pass"},
        {"no interface", [this] { mNetwork.nInterface = -1; }, 2, -1, 0, 0, 0, "Network interface is not enabled"},
        {"no WAN", [this] { mNetwork.nWan = -1; }, 4, -1, 3, 0, 0, "Can not connect to WAN"},
        {"no DNS", [this] { mNetwork.nDns = -1; }, 6, -1, 4, 0, 0, "DNS setting may be not correct"},
        {"odd gateway and two routers", [this] { mNetwork.nGateway = -1, mNetwork.nLevel = 2; }, 8, 0, 0, 1 | 4, 32,
         "nPublicIPLevel=2 > 1, can not do portforwarding"},
        {"level unknown", [this] { mNetwork.nLevel.reset(); }, 8, 0, 0, 2, 32, "Unable to get public ip level"},
        {"neither protocol", [this] { mNetwork.nUpnpInit = 1; }, 8, 0, 0, 0, -1, "upgrade db fail"},
        {"no process", [this] { mNetwork.blForkFails = true; }, 8, -1, 0, 0, 0,
         "upnp fork error, errno=Resource temporarily unavailable"},
        {"supported, but nobody knows its maximum", fnBadModel, 8, -1, 0, 0, 0, "fillRouterDetectResult failed"},
    };
    for (const auto& [szWhat, fnChange, nSteps, nResult, nErr, nFlags, nMaxRule, szLine] : rgCases) {
        SCOPED_TRACE(szWhat);
        mNetwork = Network();
        fnChange();
        gLog.clear();
        ASSERT_EQ(SetDetectManualCache("192.168.1.1", "a", "b", "c"), 1);
        DetectResult result = {};
        std::vector<int> rgProgress;
        std::vector<int> rgWanted(rgAll.begin(), rgAll.begin() + static_cast<std::ptrdiff_t>(nSteps));
        if (nSteps < rgAll.size()) {
            rgWanted.push_back(rgWanted.back());
        }
        EXPECT_EQ(TLibDetectRouter(&result, &NoteProgress, &rgProgress, true), nResult);
        EXPECT_EQ(rgProgress, rgWanted);
        EXPECT_EQ(result.nProgress, nResult == 0 ? 100 : rgWanted.back());
        EXPECT_EQ(result.errCode, nErr);
        EXPECT_EQ(result.nEnvFlags, nFlags);
        EXPECT_EQ(result.nMaxRule, nMaxRule);
        EXPECT_TRUE(Logged(szLine));
        EXPECT_EQ(Logged("Gateway setting is not correct"), mNetwork.nGateway == -1);
        EXPECT_EQ(Logged("can not get max rule, this router may not in routerdb"),
                  std::string(szLine) == "fillRouterDetectResult failed");
        EXPECT_FALSE(DetectCache::IsCacheExisted());
        EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
    }
}

TEST_F(Detection, DriverFillsTheRecordFromBothDetectors) {
    DetectResult result = {};
    ASSERT_EQ(TLibDetectRouter(&result, nullptr, nullptr, false), 0);
    EXPECT_STREQ(result.szInterface, "eth0");
    EXPECT_STREQ(result.szGateway, "192.168.1.1");
    EXPECT_EQ(result.enSupportUpnp, TAVO_ROUTER_SUPPORT_YES);
    EXPECT_EQ(result.enSupportNatpmp, TAVO_ROUTER_SUPPORT_NO);
    EXPECT_STREQ(result.szUpnpPfPath, "Acme: R1(1.0)");
    EXPECT_STREQ(result.szModel, "R1");

    mNetwork.nUpnpInit = 1;
    mNetwork.szAnnounced = "[192.168.1.1]\nname=\"x\\\"; [192.168.1.1]\"\n";
    result = {};
    ASSERT_EQ(TLibDetectRouter(&result, nullptr, nullptr, false), 0);
    EXPECT_EQ(result.enSupportUpnp, TAVO_ROUTER_SUPPORT_NO);
    EXPECT_EQ(result.enSupportNatpmp, TAVO_ROUTER_SUPPORT_YES);
    EXPECT_STREQ(result.szBrand, "AirPort");
    EXPECT_STREQ(result.szUserSettingName, "x\"; [192.168.1.1]");
    EXPECT_EQ(result.nMaxRule, 5);
    DetectResult later = {};
    EXPECT_EQ(TLibGetRouterDetectResult(&later), 0);
    EXPECT_STREQ(later.szUserSettingName, result.szUserSettingName);
    EXPECT_EQ(TLibGetRouterDetectResult(nullptr), -1);
    EXPECT_TRUE(Logged("Bad parameter, detectResult is NULL"));
}

TEST_F(Detection, DriverRefusals) {
    std::vector<int> rgProgress;
    EXPECT_EQ(TLibDetectRouter(nullptr, &NoteProgress, &rgProgress, true), -1);
    EXPECT_EQ(rgProgress, std::vector<int>{-1});
    EXPECT_EQ(gLog, std::vector<std::string>{"detectResult is NULL"});
    ASSERT_EQ(TLibTavoPortMapLock(), 0);
    ASSERT_EQ(SetDetectManualCache("192.168.1.1", "a", "b", "c"), 1);
    DetectResult result = {};
    rgProgress.clear();
    EXPECT_EQ(TLibDetectRouter(&result, &NoteProgress, &rgProgress, true), -1);
    EXPECT_EQ(rgProgress, (std::vector<int>{10, 10}));
    EXPECT_EQ(result.errCode, 2);
    EXPECT_TRUE(DetectCache::IsCacheExisted());
    TLibTavoPortMapUnLock();
}

TEST_F(Detection, ChildWithoutGatewayReturnsAndLeavesTheLockToItsParent) {
    gSzGateway.clear();
    const pid_t pidSelf = getpid();
    DetectResult result = {};
    const auto fnNote = [](const DetectResult* pResult, void* pData) {
        if (getpid() != *static_cast<const pid_t*>(pData)) {
            Write("/tmp/child_progress", std::to_string(pResult->nProgress));
        }
    };
    std::filesystem::remove("/tmp/child_progress");
    bool blLockedAfterChild = false;
    mNetwork.fnInit = [&] {
        SoonTrue([] { return std::filesystem::exists("/tmp/child_done"); });
        blLockedAfterChild = !IsLockFree("/tmp/routerconf.lock");
    };
    std::filesystem::remove("/tmp/child_done");
    pid_t pidArgument = pidSelf;
    const int nResult = TLibDetectRouter(&result, +fnNote, &pidArgument, true);
    if (getpid() != pidSelf) {
        Write("/tmp/child_done", std::to_string(nResult));
        _exit(0);
    }
    mNetwork.fnInit = nullptr;
    EXPECT_EQ(Read("/tmp/child_done"), "-1");
    EXPECT_EQ(Read("/tmp/child_progress"), "80");
    EXPECT_TRUE(blLockedAfterChild);
    EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
}

TEST_F(Detection, CallerWithChildrenOfItsOwnAndOneThatIgnoresTheirEnds) {
    const pid_t pidOther = fork();
    if (pidOther == 0) {
        pause();
        _exit(7);
    }
    mNetwork.nUpnpInit = 1;
    mNetwork.szAnnounced = "[192.168.1.1]\nname=Den\n";
    for (const auto pfnHandler : {SIG_DFL, SIG_IGN, +[](int) { waitpid(-1, nullptr, WNOHANG); }}) {
        std::filesystem::remove_all("/var/lib/tavo/tasks");
        signal(SIGCHLD, pfnHandler);
        // Only a status that arrives says that the service has restarted.
        mNetwork.fnAnnounce = [this] { mNetwork.nServiceRestart = TLIBCSystem("exit 0") == 0 ? 0 : -1; };
        DetectResult result = {};
        EXPECT_EQ(TLibDetectRouter(&result, nullptr, nullptr, true), 0);
        EXPECT_EQ(result.enSupportNatpmp, TAVO_ROUTER_SUPPORT_YES);
        EXPECT_EQ(kill(pidOther, 0), 0);
    }
    signal(SIGCHLD, SIG_DFL);
    kill(pidOther, SIGKILL);
    EXPECT_EQ(waitpid(pidOther, nullptr, 0), pidOther);
}

// ---- the router's settings -------------------------------------------------------------------------------

RouterConf MakeConf(const char* szUpnp, const char* szNatpmp) {
    return *NewSettings(szUpnp, szNatpmp, "admin", "p\"w");
}

TEST_F(Detection, SettingsRoundTrip) {
    RouterConf conf = MakeConf("no", "no");
    auto enErr = TAVO_LIBTAVOPORTMAP_ERR_NONE;
    EXPECT_EQ(TLibGetRouterConf("192.168.1.1", &conf, &enErr, true), 1);
    EXPECT_TRUE(Logged(std::string("file=") + kRouterConf + " not exists"));
    Write(kRouterConf, "[10.0.0.1]\nbrand=old\n");
    EXPECT_EQ(TLibSetRouterConf("192.168.1.1", &conf, &enErr, true), 0);
    EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_FAILED);  // stays so after success
    EXPECT_FALSE(std::filesystem::exists(kRouterConfBak));
    EXPECT_EQ(Read(kRouterConf).rfind('['), 0U);  // one section, named by the current gateway
    RouterConf read = {};
    EXPECT_EQ(TLibGetRouterConf("10.9.9.9", &read, &enErr, true), 1);
    snprintf(read.szMaxRule, sizeof(read.szMaxRule), "kept");
    ASSERT_EQ(TLibGetRouterConf("192.168.1.1", &read, &enErr, true), 0);
    EXPECT_EQ(enErr, TAVO_LIBTAVOPORTMAP_ERR_NONE);
    EXPECT_STREQ(read.szPass, "p\"w");
    EXPECT_STREQ(read.szConnPort, "80");
    EXPECT_STREQ(read.szMaxRule, "kept");

    conf = MakeConf("yes", "no");
    ASSERT_EQ(TLibSetRouterConf("10.9.9.9", &conf, nullptr, true), 0);  // the gateway names the section
    read = {};
    snprintf(read.szUser, sizeof(read.szUser), "kept");
    ASSERT_EQ(TLibGetRouterConf("192.168.1.1", &read, nullptr, true), 0);
    EXPECT_STREQ(read.szMaxRule, "32");
    EXPECT_STREQ(read.szUser, "kept");
    EXPECT_EQ(Read(kRouterConf).find("admin"), std::string::npos);

    Write(kRouterConf, "this is no router file\n");
    EXPECT_EQ(TLibGetRouterConf("192.168.1.1", &read, nullptr, true), 1);
    EXPECT_FALSE(std::filesystem::exists(kRouterConf));
}

TEST_F(Detection, SettingsAfterEachFault) {
    const std::string szOld = "[192.168.1.1]\nbrand=old\n";
    const auto fnFail = [](const char* szFail) {
        return [=](RouterConf&) { gStage.blOn = true, gStage.szFail = szFail; };
    };
    const auto fnNoWrite = [](RouterConf&) { gFnOnConfSet = [] { return -1; }; };
    const auto fnNoUpnpWrite = [&](RouterConf& conf) { conf = MakeConf("yes", "no"), fnNoWrite(conf); };
    const std::tuple<const char*, std::function<void(RouterConf&)>, const char*, int> rgFaults[] = {
        {"no support word", [](RouterConf& conf) { conf.szSupportNatpmp[0] = '\0'; },
         "support_natpmp shall not be empty", 1},
        {"no connection type", [](RouterConf& conf) { conf.szConnType[0] = '\0'; }, "conntype shall not be empty", 1},
        {"no port", [](RouterConf& conf) { conf.szConnPort[0] = '\0'; }, "connport shall not be empty", 1},
        {"no gateway", [](RouterConf&) { gSzGateway.clear(); }, "save config failed", 1},
        {"a type that cannot be kept", fnFail("conn_type"), "save config failed", 1},
        {"a port that cannot be kept", fnFail("conn_port"), "save config failed", 1},
        {"a word of UPnP that cannot be kept", fnFail("support_router_upnp"), "save support upnp failed", 1},
        {"a word of NAT-PMP that cannot be kept", fnFail("support_router_natpmp"), "save support natpmp failed", 1},
        {"no backup copy", [](RouterConf&) { gSzFailRename = kRouterConf; },
         "can not save backup file of '/etc/portforward/router.conf.bak'", 1},
        {"failed write", fnNoWrite, "sync config failed", 1},
        {"no description", [](RouterConf&) { std::filesystem::remove_all("/etc.defaults/portforward/routerdb/Acme"); },
         "can not get router syntax version", 1},
        {"old tool", [](RouterConf&) { SetTool("syntax version=0"); },
         "syntax version and routerdb version is mis-mtached", 6},
        {"UPnP router, failed write", fnNoUpnpWrite, "sync config failed", 1},
        {"lock held", [](RouterConf&) { TLibTavoPortMapLock(); }, "PortForward conflict = /tmp/routerconf.lock", 2},
    };
    for (const auto& [szWhat, fnBreak, szLine, nErr] : rgFaults) {
        SCOPED_TRACE(szWhat);
        SetUp();
        Write(kRouterConf, szOld);
        RouterConf conf = MakeConf("no", "no");
        fnBreak(conf);
        auto enErr = TAVO_LIBTAVOPORTMAP_ERR_NONE;
        EXPECT_EQ(TLibSetRouterConf("192.168.1.1", &conf, &enErr, true), -1);
        EXPECT_TRUE(Logged(szLine));
        EXPECT_EQ(Logged("can not get gateway ip"), gSzGateway.empty());
        EXPECT_EQ(Read(kRouterConf), *conf.szSupportUpnp == 'y' ? "" : szOld);
        EXPECT_FALSE(std::filesystem::exists(kRouterConfBak));
        EXPECT_EQ(enErr, nErr);
        EXPECT_TRUE(gSzFailRename.empty());
        if (nErr == 2) {
            TLibTavoPortMapUnLock();
        }
        EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
        gStage = Stage();
        TearDown();
    }
    // What an earlier failed restore left comes back after a failed write of a UPnP router.
    SetUp();
    Write(kRouterConf, szOld);
    Write(kRouterConfBak, "[192.168.1.1]\nbrand=older\n");
    RouterConf conf = MakeConf("yes", "no");
    gFnOnConfSet = [] { return -1; };
    EXPECT_EQ(TLibSetRouterConf("192.168.1.1", &conf, nullptr, true), -1);
    EXPECT_EQ(Read(kRouterConf), "[192.168.1.1]\nbrand=older\n");
    // The restore itself fails: the copy stays for the next one.
    SetUp();
    Write(kRouterConf, szOld);
    conf = MakeConf("no", "no");
    SetTool("");
    gSzFailRename = kRouterConfBak;
    EXPECT_EQ(TLibSetRouterConf("192.168.1.1", &conf, nullptr, true), -1);
    EXPECT_EQ(gLog.back(), "can not save backup file of '/etc/portforward/router.conf.bak'");
    EXPECT_FALSE(std::filesystem::exists(kRouterConf));
    EXPECT_EQ(Read(kRouterConfBak), szOld);
}

// ---- memory that runs out ----------------------------------------------------------------------------------

TEST_F(Detection, MemoryThatRunsOutLosesNoSettings) {
    const std::string szOld = "[192.168.1.1]\nbrand=\"a brand of some length\"\nuser=me\n";
    for (const bool blManual : {true, false}) {
        RouterConf conf = MakeConf(blManual ? "no" : "yes", "no");
        RunOutOfMemory([&](const auto& fnArm) {
            Write(kRouterConf, szOld);
            gLog.clear();
            fnArm();
            const int nStored = TLibSetRouterConf("192.168.1.1", &conf, nullptr, true);
            gNGoodAllocations = -1;
            EXPECT_TRUE(nStored == 0 || !gLog.empty());
            const std::string szNow = Read(kRouterConf);
            EXPECT_TRUE(szNow == szOld || nStored == 0 || (!blManual && szNow.empty())) << szNow;
            EXPECT_EQ(szNow.find("Acme") != std::string::npos, nStored == 0);
            EXPECT_FALSE(std::filesystem::exists(kRouterConfBak));
            RouterConf read = {};
            gLog.clear();
            fnArm();
            const int nRead = TLibGetRouterConf("192.168.1.1", &read, nullptr, true);
            gNGoodAllocations = -1;
            EXPECT_TRUE(nRead == 0 || !gLog.empty());
            EXPECT_TRUE(nRead == (szNow.empty() ? 1 : 0) || (gBlAllocationFailed && nRead == -1)) << nRead;
            EXPECT_EQ(Read(kRouterConf), szNow);
            EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
        });
    }
}

TEST_F(Detection, MemoryThatRunsOutHalvesNoResult) {
    gStage.blOn = true;
    gStage.szFail = "run";
    mNetwork.szAnnounced = "[192.168.1.1]\nname=\"a name of some length\"\n";
    std::set<std::string> said;
    const auto fnCheckRecords = [&said] {
        said.insert(gLog.begin(), gLog.end());
        gLog.clear();
        UpnpDetector upnp;
        NatpmpDetector natpmp;
        const std::string szUpnp = upnp.GetBrand() + upnp.GetModel() + upnp.GetVersion();
        const std::string szNatpmp = natpmp.GetBrand() + natpmp.GetUserSettingName();
        EXPECT_EQ(szUpnp, upnp.IsAbleToGetBrandModelVersion() ? "AcmeR11.0" : "");
        EXPECT_TRUE(szNatpmp == "AirPorta name of some length" || szNatpmp.empty()) << szNatpmp;
        EXPECT_TRUE(IsLockFree("/tmp/upnp_detector.lock") && IsLockFree("/tmp/natpmp_detector.lock"));
        std::filesystem::remove_all("/var/lib/tavo/tasks");
    };
    RunOutOfMemory([&](const auto& fnArm) {
        fnArm();
        const bool blUpnp = UpnpDetector().Start();
        const bool blNatpmp = NatpmpDetector().Start("192.168.1.1");
        gNGoodAllocations = -1;
        EXPECT_EQ(blUpnp, !UpnpDetector().GetSupportUpnp().empty());
        EXPECT_EQ(blNatpmp, !NatpmpDetector().GetSupportNatpmp().empty());
        fnCheckRecords();
    });
    // The child has nothing that was not swept above, and each costs a fork.
    mNetwork.blForkFails = true;
    RunOutOfMemory([&](const auto& fnArm) {
        DetectResult result = {};
        fnArm();
        EXPECT_EQ(TLibDetectRouter(&result, nullptr, nullptr, true), -1);
        TLibGetRouterDetectResult(&result);
        gNGoodAllocations = -1;
        EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
        said.insert(gLog.begin(), gLog.end());
        gLog.clear();
    });
    for (const char* szLine : {"fillRouterDetectResult() failed", "memory is not enough", "Failed to alloc hash"}) {
        EXPECT_TRUE(said.contains(szLine)) << szLine;
    }
}

}  // namespace
