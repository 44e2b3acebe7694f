// The stores when something beneath them fails: memory, a full disk, killed writers, several at once.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <thread>

#include "InitState.h"
#include "ground/Descriptor.h"
#include "ground/FileLock.h"
#include "libtavoportmap.h"
#include "programs/common/MadeFile.h"
#include "stage.h"
#include "tavo/core.h"
#include "tavo/portforward.h"
#include "world.h"

time_t gNClockAhead = 0;

extern "C" {

time_t time(time_t* pTime) {
    timespec now = {};
    clock_gettime(CLOCK_REALTIME, &now);
    return pTime == nullptr ? now.tv_sec : *pTime = now.tv_sec;
}
}

namespace {

constexpr char kDir[] = "/etc/portforward";
constexpr char kRuleConf[] = "/etc/portforward/rule.conf";
constexpr char kRouterConf[] = "/etc/portforward/router.conf";
constexpr char kSystemConf[] = "/etc/tavoinfo.conf";
constexpr char kOldRules[] = "[9]\nenabled=1\ns_port=1\nr_port=1\nprotocol name=tcp\n";
using Lines = std::vector<std::string>;

// Number of rules that the library tells of; -1: it says that it could not tell.
int CountRules() {
    int nRules = -7;
    __tag_TAVO_ROUTER_RULE* pRules = nullptr;
    const int nResult = TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, false, nullptr);
    TLibFreeRulesArr(pRules);
    return nResult == 0 ? nRules : -1;
}

// No hash takes this key until the stage is cleared.
void FailToSet(const char* szKey) {
    gStage.blOn = true;
    gStage.szFail = szKey;
}

int Add(RouterRuleConfWriter& writer) {
    return writer.AddRule("7", true, "1", "2", "tcp", "S", "web");
}

Lines Names() {
    Lines rgszNames;
    for (const auto& entry : std::filesystem::directory_iterator(kDir)) {
        rgszNames.push_back(entry.path().filename());
    }
    std::sort(rgszNames.begin(), rgszNames.end());
    return rgszNames;
}

void MakeOlder(const std::string& szPath, int nSeconds) {
    std::filesystem::last_write_time(szPath, std::filesystem::last_write_time(szPath) - std::chrono::seconds(nSeconds));
}

class Faults : public StagedTest {
protected:
    void SetUp() override {
        StagedTest::SetUp();
        MakeEmpty({kDir});
    }
};

TEST_F(Faults, APairThatCannotBeSetStopsTheRule) {
    const char* rgszCases[][2] = {{"enabled", "set enable failed"},     {"s_port", "set src port failed"},
                                  {"r_port", "set router port failed"}, {"protocol name", "set protocol=tcp"},
                                  {"service_id", "set serviceid=S"},    {"service", "set service name=web"}};
    RouterRuleConfWriter writer;
    for (const auto& rgszCase : rgszCases) {
        gLog.clear();
        FailToSet(rgszCase[0]);
        EXPECT_EQ(Add(writer), 0);
        gStage = {};
        EXPECT_EQ(gLog, Lines{rgszCase[1]});
        int nRules = 7;
        EXPECT_EQ(writer.GetRules(nRules), 1);
        EXPECT_EQ(nRules, 0);
        FailToSet("count");
        nRules = 7;
        EXPECT_EQ(writer.GetRules(nRules), 0);
        EXPECT_EQ(nRules, 0);
        gStage = {};
    }
}

TEST_F(Faults, ASettingThatCannotBeSetIsReportedWhereItMatters) {
    using Writer = RouterConfWriter;
    const std::tuple<const char*, std::function<int(Writer&)>, int, Lines> rgCases[] = {
        {"brand", [](Writer& w) { return w.SetBrandModelVersion("b", "m", "v"); }, 0, {}},
        {"max", [](Writer& w) { return w.SetMaxRule(1); }, 0, {}},
        {"pass", [](Writer& w) { return w.SetUserPass("u", "p"); }, 1, {}},
        {"use_custom_account", [](Writer& w) { return w.SetUserPass("u", "p"); }, 1, {}},
        {"support_router_upnp", [](Writer& w) { return w.SetSupportUpnp("unknown"); }, 0, {}},
        {"router_type", [](Writer& w) { return w.SetSupportUpnp("unknown"); }, 1, {"set router type failed"}},
        {"router_type", [](Writer& w) { return w.SetSupportNatpmp("yes"); }, 1, {"set router type failed"}},
    };
    for (const auto& [szFail, fnSet, nResult, rgszLines] : rgCases) {
        Writer writer(false);
        EXPECT_EQ(writer.Init(), 1);
        gLog.clear();
        FailToSet(szFail);
        EXPECT_EQ(fnSet(writer), nResult) << szFail;
        EXPECT_LT(gStage.nWorks, 0) << szFail << " was not reached";
        gStage = {};
        EXPECT_EQ(gLog, rgszLines) << szFail;
    }
}

TEST_F(Faults, AFullDiskLosesNothing) {
    ASSERT_EQ(mount("tmpfs", "/etc", "tmpfs", 0, "size=32k"), 0);
    const std::string szRouter = "[192.168.1.1]\nbrand=old\nsupport_router_upnp=yes\nsupport_router_natpmp=no\n";
    Write(kRuleConf, kOldRules);
    Write(kRouterConf, szRouter);
    Write(kSystemConf, "runupnpportmapping=\"yes\"\n");
    Write("/etc/fill", std::string(100000, 'x'));
    RouterRuleConfWriter rules;
    EXPECT_EQ(Add(rules), 1);
    EXPECT_EQ(rules.Sync(), 0);
    EXPECT_EQ(gLog, Lines{"save config failed"});
    RouterConfWriter router(true);
    EXPECT_EQ(router.SetBrand("new"), 1);
    EXPECT_EQ(router.Sync(), 0);
    __tag_TAVO_ROUTER_RULE rule = {};
    snprintf(rule.szRouterPort, sizeof(rule.szRouterPort), "1");
    EXPECT_EQ(TLibSaveRules("192.168.1.1", 1, &rule, false, nullptr, nullptr, nullptr), -1);
    EXPECT_TRUE(Logged("Failed to Set run key [/etc/tavoinfo.conf]"));
    EXPECT_EQ(Read(kRuleConf), kOldRules);
    EXPECT_EQ(Read(kRouterConf), szRouter);
    EXPECT_EQ(Read(kSystemConf), "runupnpportmapping=\"yes\"\n");
    EXPECT_EQ(Names(), (Lines{"router.conf", "rule.conf"}));
    std::filesystem::remove("/etc/fill");
    EXPECT_EQ(rules.Sync() + router.Sync(), 2);
    EXPECT_NE(Read(kRuleConf), kOldRules);
    EXPECT_EQ(umount("/etc"), 0);
}

TEST_F(Faults, CopiesOfKilledWritersComeBackOrGo) {
    // Name of the copy, its age against the live file in seconds, and whether it goes once it is obsolete.
    const std::tuple<const char*, int, bool> rgCopies[] = {
        {"rule.confaB3dE6", 60, true},  {"rule.confZ0z0Zc", 1, true},    {"rule.conf1a2b3c", 60, false},
        {"rule.confaB3dE7", 60, false}, {"rule.confv1B2c3", 60, false},  {"rule.confN3wEr4", -60, false},
        {"rule.confBackup", 60, false}, {"rule.confOld001", 60, false},  {"rule.confNov25a", 60, false},
        {"rule.conf.aB3dE6", 60, true}, {"rule.conf.Backup", 60, false}, {"rule.confbackup", 60, false},
        {"rule.conf202611", 60, false}, {"rule.conf.saved", 60, false},  {"rule.confaB3dE", 60, false},
        {"rule.confaB3dE67", 60, false}};
    Write(kRuleConf, kOldRules);
    symlink("/etc/portforward/rule.conf.saved", "/etc/portforward/rule.confaBcDe5");
    for (const auto& [szName, nOlder, blGoes] : rgCopies) {
        const std::string szPath = std::string(kDir) + "/" + szName;
        Write(szPath, std::string("[") + szName + "]\nenabled=1\n");
        std::filesystem::last_write_time(szPath,
                                         std::filesystem::last_write_time(kRuleConf) - std::chrono::seconds(nOlder));
    }
    const Lines rgszAll = Names();
    EXPECT_EQ(CountRules(), 1);
    EXPECT_EQ(Names(), rgszAll) << "a writer may be at work";
    gNClockAhead = 3600;
    EXPECT_EQ(CountRules(), 1);
    for (const auto& [szName, nOlder, blGoes] : rgCopies) {
        EXPECT_EQ(std::filesystem::exists(std::string(kDir) + "/" + szName), !blGoes) << szName;
    }
    EXPECT_TRUE(std::filesystem::is_symlink("/etc/portforward/rule.confaBcDe5"));
    EXPECT_EQ(Read(kRuleConf), kOldRules);

    // What a person could have named is not taken for the rules, either.
    std::filesystem::remove(kRuleConf);
    EXPECT_EQ(RouterRuleConfReader(false).StartNextRule(), 1);
    EXPECT_EQ(Read(kRuleConf), "[rule.confN3wEr4]\nenabled=1\n");
}

// What was half written may hold a password; whoever writes the file next, or reads rules or records beside it, takes
// it away.
TEST_F(Faults, WhatWasHalfWrittenGoesBesideEveryFile) {
    constexpr char kAccount[] = "/etc/portforward/router_account.conf";
    constexpr char kUserDb[] = "/etc/portforward/router_upnp.db.user";
    constexpr char kMadeFile[] = "/var/lib/tavo/faults_made.conf";
    const std::unique_ptr<TLIBCSzHash, decltype(&TLIBCSzHashFree)> pHash(TLIBCSzHashAlloc(1), &TLIBCSzHashFree);
    const std::pair<const char*, std::function<void()>> rgCases[] = {
        {kSystemConf, [] { TLIBCFileSetKeyValue(kSystemConf, "k", "v", nullptr); }},
        {kAccount, [&] { TLIBCFileAddSection(kAccount, "192.168.1.1", pHash.get(), 0); }},
        {kAccount, [] { CountRules(); }},
        {kUserDb,
         [] {
             RouterUpnpDBUserWriter writer("a/b/c");
             EXPECT_TRUE(writer.SetMaxRule(1) && writer.Sync());
         }},
        {SZF_DETECT_MANUAL_CACHE.c_str(), [] { SetDetectManualCache("192.168.1.1", "b", "m", "v"); }},
        {kMadeFile, [&] { tavo::MadeFile made(kMadeFile); }},
        {kRuleConf, [] { CountRules(); }},
        {kRouterConf, [] { RouterConfReader reader; }}};
    for (const auto& [szPath, fnUse] : rgCases) {
        const std::string szHalf = std::string(szPath) + ".aB3dE6";
        const std::string szOwn = std::string(szPath) + ".Backup";
        Write(szPath, kOldRules);
        Write(szHalf, kOldRules);
        Write(szOwn, kOldRules);
        for (const time_t nAhead : {0, 3600}) {
            gNClockAhead = nAhead;
            fnUse();
            EXPECT_EQ(std::filesystem::exists(szHalf), nAhead == 0) << szPath;
            EXPECT_TRUE(std::filesystem::exists(szOwn)) << szPath;
        }
        gNClockAhead = 0;
        std::filesystem::remove(szPath);
        std::filesystem::remove(szOwn);
    }
}

using RouterConf = __tag_TAVO_ROUTER_CONF;

constexpr char kOldSettings[] =
    "[192.168.1.1]\nbrand=Old\nsupport_router_upnp=no\nsupport_router_natpmp=no\nuser=me\npass=secret\n";

void SetSettings(const char* szUpnp) {
    TLibSetRouterConf("192.168.1.1", NewSettings(szUpnp, "no", "new", "").get(), nullptr, true);
}

void SendReport() {
    Write("/var/lib/tavo/tasks/@system/.upnp_detector.json",
          R"({"router_brand":"Acme","router_model":"R1","router_version":"1.0","support_upnp":"yes",
              "able_get_brand_model_version":"yes"})");
    gStage.blOn = true;
    gStage.fnRun = [](const std::string& szCommand) {
        rename("/nowhere", "/nowhere");  // one more place to die at
        const auto pConf = std::make_unique<RouterConf>();
        const bool blPacking = szCommand.starts_with("/bin/tar");
        EXPECT_EQ(TLibGetRouterConf("192.168.1.1", pConf.get(), nullptr, false), 0);
        EXPECT_STREQ(pConf->szBrand, blPacking ? "Acme" : "Old");
        EXPECT_STREQ(pConf->szPass, blPacking ? "" : "secret");
        PackNothing(szCommand);
    };
    TLibUploadTestUpnpCompatibilityFailResult();
}

// The router is known, and the tool that carries out its pages is there.
void KnowTheRouter(int nToolVersion = 1) {
    Write("/etc/portforward/router_upnp.db", "[Acme/R1/1.0]\nsupport=yes\nmax=32\n");
    Write("/etc.defaults/portforward/routerdb/Acme/R1/1.0/router.des", "[global]\nsyntax version=1\n");
    WriteProgram("/usr/tavo/bin/tavoportforward", "echo 'syntax version=" + std::to_string(nToolVersion) + "'\n");
}

// What a call does to the settings, wherever in it the process is killed.
TEST_F(Faults, SettingsOutliveAWriterThatIsKilledAnywhere) {
    const auto fnSet = [](const char* szUpnp) { return [=] { SetSettings(szUpnp); }; };
    // With the version of the tool, and whether the new settings may be there.
    const std::tuple<const char*, std::function<void()>, int, bool> rgCalls[] = {
        {"a UPnP router", fnSet("yes"), 1, true},
        {"a router of pages", fnSet("no"), 1, true},
        {"one whose settings cannot be used", fnSet("no"), 0, true},
        {"a report", SendReport, 1, false}};
    for (const auto& [szWhat, fnCall, nToolVersion, blMayBeNew] : rgCalls) {
        int nKilled = 0;
        for (bool blKilled = true; blKilled && nKilled < 100; nKilled += blKilled ? 1 : 0) {
            SetUp();
            KnowTheRouter(nToolVersion);
            Write(kRouterConf, kOldSettings);
            MakeOlder(kRouterConf, 60);
            const pid_t pid = fork();
            if (pid == 0) {
                gNGoodChanges = nKilled;
                fnCall();
                _exit(0);
            }
            int nStatus = 0;
            ASSERT_EQ(waitpid(pid, &nStatus, 0), pid);
            blKilled = WIFEXITED(nStatus) && WEXITSTATUS(nStatus) == kKilled;
            const auto pConf = std::make_unique<RouterConf>();
            for (const time_t nAhead : {0, 3600, 7200}) {
                gNClockAhead = nAhead;
                auto enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
                const bool blRead = TLibGetRouterConf("192.168.1.1", pConf.get(), nullptr, true) == 0;
                const std::string szBrand = blRead ? pConf->szBrand : "nothing";
                EXPECT_TRUE(szBrand == "Old" || (blMayBeNew && szBrand == "Acme"))
                    << szWhat << ", killed at change " << nKilled << ", " << nAhead << " s later: " << szBrand;
                EXPECT_TRUE(tavo::lib::GetInitState(&enState) == 0 && enState >= TAVO_ROUTER_INIT_STATE_UPNP_NATPMP);
            }
            Lines rgszLeft = Names();
            std::erase(rgszLeft, "router.conf.bak");  // a person may have made that
            EXPECT_EQ(rgszLeft, (Lines{"router.conf", "router_upnp.db"})) << szWhat << " " << nKilled;
            gNClockAhead = 0;
        }
        EXPECT_GT(nKilled, 2) << szWhat;
    }
}

TEST_F(Faults, ReadersLeaveToALiveWriterWhatItSetAside) {
    const std::string szKilled = std::string(kRouterConf) + ".bak";  // of one before
    for (const auto& [szSupport, szFile] :
         {std::pair{"no", kRouterConf}, {"no", szKilled.c_str()}, {"yes", kRouterConf}, {"yes", szKilled.c_str()}}) {
        std::filesystem::remove(kRouterConf);
        Write(szFile, kOldSettings);
        gFnOnConfSet = [] {
            const auto pConf = std::make_unique<RouterConf>();
            TLibGetRouterConf("192.168.1.1", pConf.get(), nullptr, false);
            return -1;
        };
        SetSettings(szSupport);
        // A failed write of a UPnP router ends with no settings, but for those that one before had left as ".bak".
        EXPECT_EQ(Read(kRouterConf), *szSupport == 'n' || szFile == szKilled ? kOldSettings : "");
    }
    Write(kRouterConf, kOldSettings);
    gFnOnConfSet = nullptr;
    SendReport();
    EXPECT_EQ(Read(kRouterConf), kOldSettings);
}

// A copy that a killed writer left is the readers' to bring back: a store that fails must not make it its own first.
TEST_F(Faults, AStoreThatFailsLeavesWhatAKilledWriterLeft) {
    gFnOnConfSet = [] { return -1; };
    for (const char* szSupport : {"yes", "no"}) {
        for (const char* szSuffix : {"aB3dE6", ".bak"}) {
            std::filesystem::remove(kRouterConf);
            Write(std::string(kRouterConf) + szSuffix, kOldSettings);
            SetSettings(szSupport);
            const auto pConf = std::make_unique<RouterConf>();
            EXPECT_EQ(TLibGetRouterConf("192.168.1.1", pConf.get(), nullptr, true), 0) << szSupport << szSuffix;
            EXPECT_EQ(Read(kRouterConf), kOldSettings) << szSupport << szSuffix;
        }
    }
    gFnOnConfSet = nullptr;
}

// A save that died between its renaming and its writing: "no rules" would close every port.
TEST_F(Faults, RulesComeBackWhoeverHasThemLocked) {
    const std::string szCopy = std::string(kRuleConf) + "aB3dE6";
    Write(szCopy, kOldRules);
    const tavo::Descriptor fdForeign(open(szCopy.c_str(), O_RDONLY | O_CLOEXEC));
    struct flock lock = {};
    lock.l_type = F_RDLCK;
    ASSERT_EQ(fcntl(fdForeign.Get(), F_OFD_SETLK, &lock), 0);
    EXPECT_EQ(CountRules(), 1);
}

// Whoever may read the settings may lock them too: he is in the way of nobody who stores or reports. Who may write them
// can: what cannot be held could be brought back too soon, and be packed with the password in it.
TEST_F(Faults, AForeignLockOnTheSettingsHindersNobody) {
    KnowTheRouter(0);
    for (const char* szLock : {"flock", "read", "write"}) {
        gLog.clear();
        Write(kRouterConf, kOldSettings);
        const bool blWrite = std::string(szLock) == "write";
        const tavo::Descriptor fdForeign(open(kRouterConf, (blWrite ? O_RDWR : O_RDONLY) | O_CLOEXEC));
        struct flock lock = {};
        lock.l_type = blWrite ? F_WRLCK : F_RDLCK;
        ASSERT_EQ(std::string(szLock) == "flock" ? flock(fdForeign.Get(), LOCK_EX)
                                                 : fcntl(fdForeign.Get(), F_OFD_SETLK, &lock),
                  0);
        SendReport();
        EXPECT_EQ(LoggedFrom("> run /bin/tar"), !blWrite) << szLock;
        SetSettings("no");  // of a newer syntax: they are undone
        EXPECT_EQ(Read(kRouterConf), kOldSettings) << szLock;
        EXPECT_EQ(Names(), (Lines{"router.conf", "router_upnp.db"})) << szLock;
    }
}

TEST_F(Faults, WhatAReportSetAsideComesBackUnlessSomebodyHasWrittenSince) {
    const std::string szHand = "[192.168.1.1]\nbrand=Hand\nsupport_router_upnp=no\nsupport_router_natpmp=no\n";
    // The copy's suffix, seconds from then to what stands in the settings' place now, whose settings are read, and
    // whether the copy goes an hour later.
    const std::tuple<const char*, int, const char*, bool> rgCases[] = {{"3aB4cP", 0, "Old", true},
                                                                       {"3aB4cP", 60, "Hand", true},
                                                                       {"1a2b3c", 0, "Hand", false},
                                                                       {"3aB4cD", 0, "Hand", false}};
    for (const auto& [szSuffix, nLater, szBrand, blGoes] : rgCases) {
        SetUp();
        const std::string szCopy = kRouterConf + std::string(szSuffix);
        Write(szCopy, kOldSettings);
        Write(kRouterConf, szHand);
        std::filesystem::last_write_time(kRouterConf,
                                         std::filesystem::last_write_time(szCopy) + std::chrono::seconds(nLater));
        for (const time_t nAhead : {0, 3600, 7200}) {
            gNClockAhead = nAhead;
            const auto pConf = std::make_unique<RouterConf>();
            EXPECT_EQ(TLibGetRouterConf("192.168.1.1", pConf.get(), nullptr, true), 0);
            EXPECT_STREQ(pConf->szBrand, szBrand) << szSuffix << " " << nLater;
        }
        gNClockAhead = 0;
        EXPECT_EQ(std::filesystem::exists(szCopy), !blGoes) << szSuffix << " " << nLater;
        EXPECT_EQ(std::any_of(gLog.begin(), gLog.end(), [](auto& szLine) { return szLine.find("killed") + 1 != 0; }),
                  blGoes);
    }
}

// The same answer at the first call and at the second, whatever stands there.
TEST_F(Faults, SettingsThatCannotBeReadMakeRoomForThoseOfBefore) {
    const std::tuple<const char*, std::function<void()>, bool> rgCases[] = {
        {"garbage", [] { Write(kRouterConf, "garbage\n"); }, false},
        {"garbage and a copy", [] { Write(kRouterConf, "garbage\n"); }, true},
        {"nothing but a comment", [] { Write(kRouterConf, "# nothing\n"); }, false},
        {"nothing but a comment and a copy", [] { Write(kRouterConf, "# nothing\n"); }, true},
        {"a link to nowhere", [] { symlink("/nowhere", kRouterConf); }, false},
        {"a link to nowhere and a copy", [] { symlink("/nowhere", kRouterConf); }, true}};
    for (const auto& [szWhat, fnMake, blCopy] : rgCases) {
        SetUp();
        fnMake();
        if (blCopy) {
            Write(std::string(kRouterConf) + ".bak", kOldSettings);
            MakeOlder(std::string(kRouterConf) + ".bak", 60);
        }
        gNClockAhead = 3600;
        for (int i = 0; i < 2; ++i) {
            const auto pConf = std::make_unique<RouterConf>();
            EXPECT_EQ(TLibGetRouterConf("192.168.1.1", pConf.get(), nullptr, true), blCopy ? 0 : 1) << szWhat;
            EXPECT_EQ(Read(kRouterConf), blCopy ? kOldSettings : "") << szWhat;
            EXPECT_EQ(Names(), blCopy ? Lines{"router.conf"} : Lines()) << szWhat;
        }
        EXPECT_TRUE(Logged("file=/etc/portforward/router.conf has wrong format, try to unlink it"));
    }
}

TEST_F(Faults, ReadersNeverSeeNoSettingsWhileSomebodyWrites) {
    KnowTheRouter();
    for (const char* szSupport : {"no", "yes"}) {
        Write(kRouterConf, kOldSettings);
        const pid_t pid = fork();
        if (pid == 0) {
            for (int i = 0; i < 100; ++i) {
                SetSettings(szSupport);
            }
            _exit(0);
        }
        const auto pConf = std::make_unique<RouterConf>();
        int nReads = 0;
        int nNothing = 0;
        for (; waitpid(pid, nullptr, WNOHANG) == 0; ++nReads) {
            nNothing += TLibGetRouterConf("192.168.1.1", pConf.get(), nullptr, false) != 0 ? 1 : 0;
        }
        EXPECT_GT(nReads, 10);
        EXPECT_EQ(nNothing, 0) << szSupport << ", of " << nReads;
        EXPECT_EQ(Names(), (Lines{"router.conf", "router_upnp.db"}));
    }
}

TEST_F(Faults, RulesLeftAsideAreNotNoRules) {
    for (const char* szOwn : {"rule.conf.saved", "rule.confbackup", "rule.conf202401", "rule.confOld001",
                              "rule.conf.aB3dE6", "rule.conf.bak"}) {
        Write(std::string(kDir) + "/" + szOwn, kOldRules);
        EXPECT_EQ(CountRules(), 0) << szOwn;
        EXPECT_EQ(Names(), Lines{szOwn});
        std::filesystem::remove_all(kDir);
    }
    Write("/etc/portforward/rule.conf.saved", kOldRules);
    Write("/etc/portforward/rule.confaB3dE6", kOldRules);
    EXPECT_EQ(CountRules(), 1);
    EXPECT_EQ(Names(), (Lines{"rule.conf", "rule.conf.saved"}));
}

TEST_F(Faults, ReadersNeverSeeFewerRulesThanTwoWritersWrite) {
    constexpr int kWrites = 150;
    Write(kRuleConf, std::string(kOldRules) + kOldRules);
    pid_t rgPids[2] = {};
    for (pid_t& pid : rgPids) {
        pid = fork();
        if (pid == 0) {
            RouterRuleConfWriter writer;
            const bool blAdded = Add(writer) + Add(writer) == 2;
            int nWritten = 0;
            for (int i = 0; i < kWrites; ++i) {
                nWritten += writer.Sync();
            }
            _exit(blAdded && nWritten > 0 ? 0 : 1);
        }
    }
    int nSeen = 0;
    for (const pid_t pid : rgPids) {
        int nStatus = 0;
        while (waitpid(pid, &nStatus, WNOHANG) == 0) {
            const int nRules = CountRules();
            nSeen += nRules == 2 ? 1 : 0;
            EXPECT_TRUE(nRules == 2 || nRules == -1) << nRules;
        }
        EXPECT_EQ(nStatus, 0);
    }
    EXPECT_GT(nSeen, 0);
    EXPECT_EQ(Names(), Lines{"rule.conf"});
    EXPECT_EQ(CountRules(), 2);
}

TEST_F(Faults, AReplacedFileKeepsOwnerAndMode) {
    KnowTheRouter();
    const auto fnSet = [](const char* szUpnp) { return [=] { SetSettings(szUpnp); }; };
    const auto fnRule = [] {
        RouterRuleConfWriter writer;
        EXPECT_EQ(Add(writer) + writer.Sync(), 2);
    };
    const auto fnBrand = [] {
        RouterConfWriter writer(true);
        EXPECT_EQ(writer.SetBrand("new") + writer.Sync(), 2);
    };
    const auto fnMost = [] {
        RouterUpnpDBUserWriter writer("a/b/c");
        EXPECT_TRUE(writer.SetMaxRule(5) && writer.Sync());
    };
    const std::pair<std::string, std::function<void()>> rgWrites[] = {
        {kRuleConf, fnRule},
        {kRouterConf, fnBrand},
        {kRouterConf, fnSet("yes")},
        {kRouterConf, fnSet("no")},
        {SZF_DETECT_MANUAL_CACHE, [] { EXPECT_EQ(SetDetectManualCache("192.168.1.1", "a", "b", "c"), 1); }},
        {"/etc/portforward/router_upnp.db.user", fnMost},
        {kSystemConf, [] { EXPECT_EQ(TLIBCFileSetKeyValue(kSystemConf, "k", "v", nullptr), 1); }},
    };
    // Settings that anybody could read are their owner's alone once they hold the password of a router's pages.
    const auto fnSetAccount = [](const char* szPass) {
        return [=] {
            RouterConfWriter writer(true);
            EXPECT_EQ(writer.SetUserPass("me", szPass) + writer.Sync(), 2);
        };
    };
    const std::pair<unsigned, std::function<void()>> rgModes[] = {
        {0644, fnSet("yes")}, {0600, fnSet("no")}, {0644, fnSetAccount("")}, {0600, fnSetAccount("secret")}};
    for (const auto& [nMode, fnStore] : rgModes) {
        Write(kRouterConf, "");
        chmod(kRouterConf, 0644);
        fnStore();
        struct stat status = {};
        stat(kRouterConf, &status);
        EXPECT_EQ(status.st_mode & 07777U, nMode) << Read(kRouterConf);
    }
    for (const auto& [szPath, fnWrite] : rgWrites) {
        SCOPED_TRACE(szPath);
        const char* szFile = szPath.c_str();
        Write(szFile, "");
        chmod(szFile, 0640);
        const bool blOthers = chown(szFile, 1, 1) == 0;  // where there are other users
        fnWrite();
        struct stat status = {};
        stat(szFile, &status);
        EXPECT_GT(status.st_size, 0);
        EXPECT_EQ(status.st_mode & 07777U, 0640U);
        EXPECT_EQ(status.st_uid + status.st_gid, blOthers ? 2U : 0U);
        std::filesystem::remove(szFile);
    }
}

}  // namespace
