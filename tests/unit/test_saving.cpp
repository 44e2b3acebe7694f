// Saving rules on a played stage: the order of every step, each step failing in turn, what the router
// refused, memory that runs out anywhere; and the tools that the library runs, well behaved and not.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>

#include "libtavoportmap.h"
#include "stage.h"
#include "tavo/portforward.h"
#include "world.h"

namespace {

constexpr char kRuleConf[] = "/etc/portforward/rule.conf";
constexpr char kOldRules[] = "[9]\nenabled=\"1\"\n";
constexpr char kMarker[] = "/tmp/pfProgress";
constexpr char kTool[] = "/usr/tavo/bin/tavoportforward";
const std::string kToolRun = "> run /usr/tavo/bin/tavoportforward >/dev/null 2>&1";
const std::string kWrite = "> write /etc/portforward/rule.conf";
const std::string kNatpmpOn = "> runnatpmpportmapping=yes";
const std::string kUpnpOn = "> runupnpportmapping=yes";
constexpr int kNeverDone = 0;
using Rule = __tag_TAVO_ROUTER_RULE;
using SaveResult = __tag_TAVO_ROUTER_SAVE_RULE_RESULT;
using Story = std::vector<std::string>;

class Saving : public StagedTest {
protected:
    void SetUp() override {
        MakeEmpty({"/etc/portforward", "/etc.defaults/portforward", "/usr/tavo"});
        Write("/etc/portforward/router_upnp.db",
              "[B/M/1]\nmax=2\n[" + kLong + " brand/" + kLong + " model/" + kLong + " version]\nmax=2\n");
        Write("/etc.defaults/portforward/routerdb/B/M/1/router.des", "[PF port page]\nmax rule=10\n");
        Reset();
    }
    void TearDown() override {
        StagedTest::TearDown();
        std::filesystem::remove(kMarker);
    }
    // A fresh stage on which whoever applies the rules is done after so many sleeps.
    void Reset(int nBusySleeps = 1) {
        for (const char* szFile : {"/etc/tavoinfo.conf", "/var/run/upnpd.pid", "/var/run/natpmpd.pid", kMarker,
                                   "/var/tmp/upnp_portmap.status", "/var/tmp/natpmp_portmap.remap"}) {
            std::filesystem::remove(szFile);
        }
        Write(kRuleConf, kOldRules);
        StagedTest::SetUp();
        gStage.blOn = true;
        gStage.fnRun = [](const std::string&) { gStage.alive.insert("tavoportforward"); };
        gFnOnSleep = [nBusySleeps, nSleep = 0]() mutable {
            if (++nSleep == nBusySleeps) {
                unlink(kMarker);
                gStage.alive.erase("tavoportforward");
            }
        };
    }
    static inline const std::string kLong = "longer than a small string:";
    static void Router(const std::string& szNatpmp, const std::string& szUpnp, const std::string& szBrand = "B",
                       const std::string& szModel = "M", const std::string& szVersion = "1") {
        Write("/etc/portforward/router.conf", "[192.168.1.1]\nbrand=" + szBrand + "\nmodel=" + szModel +
                                                  "\nversion=" + szVersion + "\nsupport_router_natpmp=" + szNatpmp +
                                                  "\nsupport_router_upnp=" + szUpnp + "\n");
    }
    static void Router(const std::string& szWay) {
        Router(szWay == "natpmp" ? "yes" : "no", szWay == "upnp" ? "yes" : "no");
        if (szWay.empty()) {
            std::filesystem::remove("/etc/portforward/router.conf");
        }
    }
    int Save(int nRules = 1) {
        mResult = {};
        const auto fnNote = [](const SaveResult* pResult, void*) {
            const OwnMemory own;
            Tell(std::to_string(pResult->nProgress));
        };
        return TLibSaveRules("192.168.1.1", nRules, nRules == 0 ? nullptr : mRgRules, true, &mResult, fnNote, nullptr);
    }
    SaveResult mResult = {};
    Rule mRgRules[3] = {{"1", true, "tcp", "80", "8080", "web", "Web", {}},
                        {"2", true, "udp", "", "", "", "", {}},
                        {"3", true, "tcp", "81", "81", "", "", {}}};
};

TEST_F(Saving, TakesEveryStepInItsOrder) {
    const std::string szBegin =
        "> 20\n> 40\n> runnatpmpportmapping=no\n> runupnpportmapping=no\n> 60\n" + kWrite + "\n> 80\n";
    const std::string szEnd = "\n> 100\n> ask tavorelayd\n> reload tavorelayd";
    const std::string szUpnp = "> exec /usr/tavo/sbin/upnpd";
    const std::string szNatpmp = "> exec /usr/tavo/sbin/natpmpd";
    const std::string szAlive = "\nupnp daemon is alive now\n> 90\nupnpd checking is done";
    const std::tuple<const char*, const char*, std::set<std::string>, const char*, int, std::string, int> rgFlows[] = {
        {"yes",
         "yes",
         {"upnpd"},
         "",
         2,
         kNatpmpOn + "\n> signal upnpd 1\n" + szNatpmp +
             "\nnatpmp daemon is alive now\n> 90\n> remap\nnatpmpd checking is done",
         3},
        {"no", "yes", {"upnpd", "natpmpd"}, "4711", 1, kUpnpOn + "\n> signal natpmpd 1\n> kill 4711 1" + szAlive, 3},
        {"no", "yes", {"upnpd"}, "junk", 1, kUpnpOn + "\n> signal upnpd 1\n" + szUpnp + szAlive, 3},
        {"no", "yes", {}, "", 0, kUpnpOn + "\n" + szUpnp, 0},
        {"yes", "no", {}, "", 0, kNatpmpOn + "\n" + szNatpmp, 0},
        {"Yes", "YES", {}, "", 1, kToolRun, 3},
        {"no", "unknown", {}, "", 0, kToolRun, 3},
    };
    for (const auto& [szNatpmpWord, szUpnpWord, alive, szPid, nRules, szSteps, nSlept] : rgFlows) {
        Reset(3);
        Router(szNatpmpWord, szUpnpWord);
        Write("/var/tmp/upnp_portmap.status", "80/tcp=1\n");
        Write("/var/tmp/natpmp_portmap.remap", "");
        Write("/var/run/upnpd.pid", szPid);
        gStage.alive = alive;
        mResult.nStatus = 77;
        EXPECT_EQ(Save(nRules), 0);
        const std::string szStory = szBegin + szSteps + szEnd;
        EXPECT_EQ(LastLines(szStory + "\n"), szStory) << "and nothing before it";
        EXPECT_EQ(gNSlept, nSlept);
        EXPECT_EQ(mResult.nStatus, 0);
        EXPECT_EQ(RouterRuleConfReader(false).StartNextRule(), nRules == 0 ? 0 : 1);
    }
    Reset();
    gStage.blRelay = false;
    EXPECT_EQ(Save(), 0);
    EXPECT_EQ(gLog.back(), "> ask tavorelayd");
}

TEST_F(Saving, EndsAtTheStepThatFails) {
    const std::string szNoLimit = "get max rule fail\ncheck exceed max rule fail";
    const std::string szNoWrite = "> 60\n" + kWrite + "\nsave config failed\n";
    const std::string szNoKey = "\nFailed to Set run key [/etc/tavoinfo.conf]";
    const std::tuple<const char*, const char*, int, std::string, bool, int> rgFailures[] = {
        {"upnp", "hash", 1, "> 40\nhash malloc failed\nadd rule failed", false, 0},
        {"upnp", "service", 0, "> 40\nset service name=Web\nadd rule failed", false, 0},
        {"", "", 0, "> 40\ncan not get support upnp", false, 0},
        {"upnp", "run key", 0, "> 40\n> runnatpmpportmapping=no" + szNoKey, false, 0},
        {"upnp", "run key", 1, "> 40\n> runnatpmpportmapping=no\n> runupnpportmapping=no" + szNoKey, false, 0},
        {"natpmp", "look-up", 0, szNoLimit, false, 0},
        {"upnp", "look-up", 0, szNoLimit, false, 0},
        {"natpmp", "count", 0, "TLIBPFCountRuleConf fail\nget setting rules fail\ncheck exceed max rule fail", false,
         0},
        {"natpmp", "write", 0, szNoWrite + "sync rule to file fail", false, 0},
        {"upnp", "write", 0, szNoWrite + "can not sync rules to file", false, 0},
        {"natpmp", "run key", 2, "> 80\n" + kNatpmpOn + "\nFailed to Set natpmp run key!", true, 0},
        {"upnp", "run key", 2, "> 80\n" + kUpnpOn + "\nFailed to Set upnp run key!", true, 0},
        {"natpmp", "exec", 0,
         "> exec /usr/tavo/sbin/natpmpd\nexec natpmpd daemon failed\nStartDaemon() natpmpd failed\n"
         "upnp daemon start failed",
         true, 0},
        {"upnp", "exec", 0,
         "> exec /usr/tavo/sbin/upnpd\nexec upnpd daemon failed\nStartDaemon() upnpd failed\n"
         "upnp daemon start failed",
         true, 0},
        {"natpmp", "remap", 0, "> remap\n> remap\ncheck natpmp daemon failed", true, 22},
        {"upnp", "status", 0,
         "> 90\nfailed to read key-value pairs from /var/tmp/upnp_portmap.status\ncheck daemon failed", true, 23},
        {"upnp", "hash", 2, "> 90\nfailed to allocate list\ncheck daemon failed", true, 1},
        {"manual", "description", 0, "> 60\nget desc and script failed\ncan not get router desc\ncan not get max ports",
         false, 0},
        {"manual", "PF add port", 0, "> 60\nfailed to count port job of rules", false, 0},
        {"manual", "PF add range", 0, "> 60\nfailed to count range job of rules", false, 0},
        {"manual", "write", 0, szNoWrite + "can not sync rules to file", false, 0},
        {"manual", "run", 0, "> 80\n" + kToolRun + "\nexecute tavoportforward failed\ntavoportforward start failed",
         true, 0},
    };
    for (const auto& [szWay, szFail, nWorks, szEnd, blWritten, nSlept] : rgFailures) {
        SetUp();
        Router(szWay);
        if (std::string(szFail) == "description") {
            std::filesystem::remove_all("/etc.defaults/portforward/routerdb");
        }
        Write("/var/tmp/upnp_portmap.status", "80/tcp=1\n");
        gStage.szFail = szFail;
        gStage.nWorks = nWorks;
        EXPECT_EQ(Save(), -1) << szWay << " " << szFail;
        EXPECT_EQ(LastLines(szEnd), szEnd) << szWay << " " << szFail;
        EXPECT_EQ(mResult.nStatus, 0);
        EXPECT_EQ(gNSlept, nSlept) << szWay << " " << szFail;
        EXPECT_EQ(std::count(gLog.begin(), gLog.end(), "> remap"), std::string(szFail) == "remap" ? 22 : 0);
        EXPECT_EQ(Read(kRuleConf) != kOldRules, blWritten) << szWay << " " << szFail;
        EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
    }
}

TEST_F(Saving, WaitsFiveMinutesAndNoLonger) {
    const std::tuple<const char*, bool, const char*> rgWaits[] = {
        {"natpmp", false, "wait natpmp daemon alive time out"},
        {"natpmp", true, "wait natpmp daemon alive time out"},
        {"upnp", false, "wait upnp daemon alive time out"},
        {"upnp", true, "wait upnp daemon alive time out"},
        {"manual", false, "wait manual pf process finish time out"}};
    for (const auto& [szWay, blStillborn, szLine] : rgWaits) {
        Reset(blStillborn ? 1 : kNeverDone);
        Router(szWay);
        gStage.blStillborn = blStillborn;
        EXPECT_EQ(Save(), -1);
        EXPECT_EQ(gLog.back(), szLine);
        EXPECT_EQ(gNSlept, 302);
    }
}

TEST_F(Saving, FailsInADaemonThatRunsWithTheWordsOfTheWayItTook) {
    const std::tuple<const char*, const char*, std::string> rgFailures[] = {
        {"4711", "kill", "send SIGHUP to upnpd failed errno=No such process\nHupDaemon() upnpd failed"},
        {"", "exec", "exec upnpd daemon failed\nStartDaemon() failed\nRestartDaemon() upnpd failed"}};
    Router("upnp");
    for (const auto& [szPid, szFail, szEnd] : rgFailures) {
        Reset();
        Write("/var/run/upnpd.pid", szPid);
        Write(kMarker, "");
        gStage.alive = {"upnpd"};
        gStage.szFail = szFail;
        EXPECT_EQ(Save(), -1);
        EXPECT_EQ(LastLines(szEnd + "\n"), szEnd + "\nupnp daemon start failed");
        EXPECT_FALSE(std::filesystem::exists(kMarker));
    }
}

TEST_F(Saving, ReportsWhatTheRouterRefused) {
    const std::string szLong(3000, 'p');
    const std::string szDone = "upnpd checking is done\n> event 1 ";
    const std::tuple<const char*, int, std::string, int, std::string, std::string> rgAnswers[] = {
        {"upnp", 3, "", 7, "\x02", "> 60\nexceed max rule"},
        {"natpmp", 3, "", 7, "\x02", "> 60\nexceed max rule"},
        {"upnp", 1, "a=1\nb=718\nc=501\nd=718\n", 8, "b, d", szDone + "2 13100022 b, d|||\nupnp port conflict"},
        {"upnp", 1, "a=1\nc=501\n", 9, "c", szDone + "3 13100020 c|||\nupnp add port fail"},
        {"upnp", 1, "# x=718\n\n=718\nno value\na=1\r\n b = \"1\" \nc=\nd=1x\ne=\"718\nf=1=2\n", 9, "c, d, e, f",
         szDone + "3 13100020 c, d, e, f|||\nupnp add port fail"},
        {"upnp", 1, szLong + "=718\n", 8, szLong.substr(0, 1023),
         szDone + "2 13100022 " + szLong + "|||\nupnp port conflict"},
        {"natpmp", 1, "80 -> 81", 8, "80 -> 81", "natpmpd checking is done\nnatpmp port conflict"},
        {"natpmp", 1, szLong, 8, szLong.substr(0, 1023), "natpmpd checking is done\nnatpmp port conflict"},
    };
    for (const auto& [szWay, nRules, szAnswer, nStatus, szPorts, szEnd] : rgAnswers) {
        Reset();
        Router(szWay);
        Write("/var/tmp/upnp_portmap.status", szAnswer);
        Write("/var/tmp/natpmp_portmap.remap", szAnswer);
        EXPECT_EQ(Save(nRules), -1);
        EXPECT_EQ(mResult.nStatus, nStatus);
        EXPECT_EQ(std::string(mResult.szPortList), szPorts);
        EXPECT_EQ(LastLines(szEnd), szEnd);
    }
    bool blRemap = false;
    std::string szRemap;
    EXPECT_TRUE(NatpmpDaemon().CheckDaemon(blRemap, szRemap));
    EXPECT_EQ(szRemap, szLong);
}

TEST_F(Saving, SurvivesMemoryThatRunsOutAnywhere) {
    std::set<std::string> said;
    std::string szNewRules;
    for (const char* szWay : {"manual", "natpmp", "upnp"}) {
        RunOutOfMemory([&](const auto& fnArm) {
            Reset();
            const bool blManual = std::string(szWay) == "manual";
            Router(szWay[0] == 'n' ? "yes" : "no", szWay[0] == 'u' ? "yes" : "no", blManual ? "B" : kLong + " brand",
                   blManual ? "M" : kLong + " model", blManual ? "1" : kLong + " version");
            Write("/var/tmp/upnp_portmap.status", "80/tcp=1\n");
            Write("/var/tmp/natpmp_portmap.remap", "");
            fnArm();
            const int nResult = Save();
            gNGoodAllocations = -1;
            szNewRules = nResult == 0 ? Read(kRuleConf) : szNewRules;
            EXPECT_TRUE(nResult == 0 || !gLog.empty());
            EXPECT_NE(szNewRules, kOldRules);
            EXPECT_TRUE(Read(kRuleConf) == kOldRules || Read(kRuleConf).find("[1]\n") == 0) << Read(kRuleConf);
            EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
            said.insert(gLog.begin(), gLog.end());
        });
    }
    for (const char* szLine :
         {"fail to get brand", "fail to get model", "fail to get version", "get max rule fail", "add rule failed",
          "can not get max ports", "sync rule to file fail", "failed to allocate list", "get router conf failed",
#ifndef __SANITIZE_ADDRESS__  // where only C++ memory runs out
          "malloc fail: szRemap"
#endif
         }) {
        EXPECT_TRUE(said.contains(szLine)) << szLine;
    }
}

TEST_F(Saving, AHashWithoutMemoryKeepsWhatItHas) {
    RunOutOfMemory([](const auto& fnArm) {
        TLIBCSzHash* pHash = TLIBCSzHashAlloc(0);
        fnArm();
        const bool blSet = TLIBCSzHashSetValue(pHash, "a key longer than a small string", "1") == 1;
        gNGoodAllocations = -1;
        EXPECT_EQ(TLIBCSzHashSetValue(pHash, "other", "2"), 1);
        EXPECT_EQ(TLIBCSzHashCount(pHash), blSet ? 2 : 1);
        EXPECT_STREQ(TLIBCSzHashGetValue(pHash, "other"), "2");
        EXPECT_STREQ(TLIBCSzHashGetValue(pHash, "a key longer than a small string"), blSet ? "1" : nullptr);
        TLIBCSzHashFree(pHash);
    });
}

TEST_F(Saving, ReadsTheVersionOfTheTool) {
    gStage.blOn = false;
    const std::pair<const char*, int> rgOutputs[] = {{"x\\nsyntax version = 3\\nsyntax version=4\\n", 4},
                                                     {"syntax version = 5", 5},
                                                     {"syntax versions of rules: = 6 \\n", 6},
                                                     {" syntax version=1\\nSyntax version=2\\nsyntax version 3\\n", -1},
                                                     {"syntax version=99999999999999999999\\n", INT32_MAX},
                                                     {"syntax version=junk\\n", 0},
                                                     {"", -1}};
    for (const auto& [szOutput, nVersion] : rgOutputs) {
        WriteProgram(kTool, "printf '" + std::string(szOutput) + "'\nexit 3\n");
        EXPECT_EQ(IGetCurrSyntaxVersion(), nVersion) << szOutput;
    }
    WriteProgram(kTool, "/usr/bin/head -c 200000 /dev/zero | /usr/bin/tr '\\0' x; printf '\\nsyntax version=7\\n'\n");
    EXPECT_EQ(IGetCurrSyntaxVersion(), 7);
    std::filesystem::remove(kTool);
    EXPECT_EQ(IGetCurrSyntaxVersion(), -1);
}

TEST_F(Saving, GivesUpAToolThatHangs) {
    gStage.blOn = false;
    for (const char* szScript : {"while :; do /bin/sleep 1; done\n", "exec >&-\nwhile :; do /bin/sleep 1; done\n",
                                 "while :; do echo x; done\n"}) {
        WriteProgram(kTool, szScript);
        gNClockStep = 1;
        EXPECT_EQ(IGetCurrSyntaxVersion(), -1);
        gNClockStep = 0;
        EXPECT_TRUE(SoonTrue([] { return TLIBCIsProcAlive("tavoportforward") == 0; })) << szScript;
    }
}

TEST_F(Saving, NoToolThatStaysAliveKeepsTheLock) {
    gStage.blOn = false;
    WriteProgram(kTool, "/bin/sleep 20 &\necho syntax version=3\n");
    // A process that dies with the lock leaves it to nobody: neither to the tool's child nor to its own.
    const pid_t pid = fork();
    if (pid == 0) {
        const bool blGood = TLibTavoPortMapLock() == 0 && IGetCurrSyntaxVersion() == 3 &&
                            TLIBCExec("/bin/sleep", "20", nullptr, nullptr, nullptr) == 0 &&
                            TLIBCSystem("/bin/sleep 20 &") == 0 && std::system("/bin/sleep 20 &") == 0;
        _exit(blGood ? 0 : 1);
    }
    int nStatus = -1;
    waitpid(pid, &nStatus, 0);
    EXPECT_EQ(nStatus, 0);
    EXPECT_TRUE(IsLockFree("/tmp/routerconf.lock"));
    int nKilled = 0;
    EXPECT_TRUE(SoonTrue([&] { return (nKilled += TLIBCKill("/bin/sleep 20", SIGKILL)) >= 4; }));
}

TEST_F(Saving, RefreshesTheDatabaseOfItsOwnVersionOnly) {
    const std::string szFetch = "> run /usr/tavo/bin/wget 'http://h/d/";
    const std::string szTo = "' -O /etc/portforward/";
    const std::string szVersion = szFetch + "routersdk_version" + szTo + "routersdk_version >/dev/null 2>&1";
    const std::string szDb = szFetch + "router_upnp.db" + szTo + "router_upnp.db >/dev/null 2>&1";
    WriteProgram(kTool, "echo syntax version = 3\n");
    const struct {
        const char* szServed;  // the version file as it comes
        const char* szFail;
        int nWorks;
        bool blUpdated;
        int nVersion;
        Story story;
    } rgUpdates[] = {
        {"version=3\n", "", 0, true, 3, {szVersion, szDb}},
        {"version=\"4\"\n", "", 0, true, 4, {szVersion}},
        {"version=junk\n", "", 0, true, 0, {szVersion}},
        {"version=12345678901\n", "", 0, true, 1234567, {szVersion}},
        {"\x01[x]\n", "", 0, false, -5, {szVersion, "can not read router sdk version"}},
        {"", "run", 0, false, -5, {szVersion, "update upnp router info failed"}},
        {"version=3\n", "run", 1, false, -5, {szVersion, szDb, "update upnp router info failed"}},
    };
    for (const auto& update : rgUpdates) {
        Reset();
        gStage.fnRun = [&](const std::string&) { Write("/etc/portforward/routersdk_version", update.szServed); };
        gStage.szFail = update.szFail;
        gStage.nWorks = update.nWorks;
        int nVersion = -5;
        EXPECT_EQ(RouterUpnpDB::Update(nVersion), update.blUpdated) << update.szServed;
        EXPECT_EQ(nVersion, update.nVersion);
        EXPECT_EQ(gLog, update.story);
    }
}

TEST_F(Saving, NoDownloadLocationLeavesItsQuotes) {
    int nVersion = 0;
    gStage.szLocation = "http://h/a'; touch /tmp/trap; '";
    RouterUpnpDB::Update(nVersion);
    EXPECT_EQ(gLog[0],
              "> run /usr/tavo/bin/wget 'http://h/a'\\''; touch /tmp/trap; '\\''/routersdk_version' -O "
              "/etc/portforward/routersdk_version >/dev/null 2>&1");
    gLog.clear();
    gStage.szLocation = std::string(4090, 'x');
    EXPECT_FALSE(RouterUpnpDB::Update(nVersion));
    EXPECT_EQ(gLog, Story{"update upnp router info failed"});
    gStage.blOn = false;
    const std::string szEndless(2000, 'x');
    for (const char* szSetting :
         {"http://h/'x", "http://h/\\nx", "-O/etc/passwd", "http://h/\\\\x", szEndless.c_str()}) {
        Write("/etc/tavo/platform.conf", "[download]\ndatabase_url=\"" + std::string(szSetting) + "\"\n");
        EXPECT_STREQ(GetRouterDBPath(), "") << szSetting;
    }
    std::filesystem::remove("/etc/tavo/platform.conf");
}

TEST_F(Saving, ReadsAnyDescriptionAndNoNameOutsideTheDatabase) {
    std::string szPages = "[global]\nsyntax version=2\n[pf port page]\nmax rule=1\n";
    for (int i = 0; i < 5000; ++i) {
        szPages += "[PF port page]\nmax rule=" + std::to_string(i) +
                   "\nchange router port=YES\nsupport range=Multi\n[PF range page]\n[other]\nudp=1\n";
    }
    Write("/etc.defaults/portforward/routerdb/B/M/1/router.des", szPages);
    Router("manual");
    RouterDB db("192.168.1.1");
    int nPorts = 0, nRange = -1, nSyntax = 0;
    bool blPageRange = false, blChangePort = false;
    EXPECT_TRUE(db.GetMaxPorts(nPorts) && db.GetMaxRange(nRange) && db.GetSyntaxVersion(nSyntax));
    EXPECT_TRUE(db.IsSupportPageRange(blPageRange) && db.IsSupportChangePort(blChangePort));
    EXPECT_EQ(nPorts, 4999);
    EXPECT_EQ(nRange, 0);
    EXPECT_EQ(nSyntax, 2);
    EXPECT_TRUE(blPageRange && blChangePort);
    Write("/etc.defaults/portforward/generic", "version=\"5\"\n");
    Write("/etc.defaults/portforward/routerdb/B/generic", "version=\"5\"\n");
    for (std::string szName : {"..: routerdb/..", "B: .", "B: ..", "B: M/..", ": M", "B: "}) {
        std::string szBrand = "kept", szModel, szVersion;
        EXPECT_FALSE(SplitRouterName(szName.data(), szBrand, szModel, szVersion)) << szName;
        EXPECT_EQ(szBrand, "kept");
    }
}

}  // namespace
