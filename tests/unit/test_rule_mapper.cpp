// What both daemons do alike between the rules and the router, with passes that the test plays: whose turn it is, what
// is written of a pass, and when the next one comes.
#include <dlfcn.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <sys/file.h>

#include <cstdio>

#include "ground/Descriptor.h"
#include "network.h"
#include "programs/common/RuleMapper.h"
#include "tavo/net.h"
#include "world.h"

std::string gSzBox;

extern "C" int TAVONetLocalAddressGet(const char* szPeer, char* szLocal, int nSize, char* szInterface, int nOther) {
    if (gSzBox.empty()) {
        return Real("TAVONetLocalAddressGet", &TAVONetLocalAddressGet)(szPeer, szLocal, nSize, szInterface, nOther);
    }
    snprintf(szLocal, static_cast<size_t>(nSize), "%s", gSzBox.c_str());
    return 0;
}

namespace {

using tavo::OutcomeList;
using tavo::PassResult;
using tavo::RouterMapping;
using Lines = std::vector<std::string>;

constexpr tavo::DaemonNames kNames = {"played",
                                      "UPnP",
                                      "runupnpportmapping",
                                      "/run/played.pid",
                                      "/run/played.lock",
                                      "/tmp/played.out",
                                      "/var/lib/tavo/playe_made.conf"};
constexpr char kRules[] = "/etc/portforward/rule.conf";
constexpr char kRule[] = "[1]\nenabled=1\nprotocol name=tcp\nr_port=80\ns_port=8080\nservice=web\n";
constexpr char kSystem[] = "/etc/tavoinfo.conf";
constexpr char kTurn[] = "/var/run/tavo_router.lock";
constexpr char kPublished[] = "/run/tavo/played.json";

class Played : public tavo::RuleMapper {
public:
    Played() : RuleMapper(kNames) {}
    PassResult Map(const std::vector<RouterMapping>& rgWanted, bool blRequested,
                   const std::function<bool()>&) override {
        mRgszCalls.push_back((blRequested ? "request " : "map ") + std::to_string(rgWanted.size()));
        for (const auto& [key, nBoxPort] : Others()) {
            mRgszCalls.back() += " beside " + key.first + std::to_string(key.second) + " " + std::to_string(nBoxPort);
        }
        mBlMarkedAtMap = std::filesystem::exists(kNames.szResultFile);
        PassResult result = mResult;
        for (const RouterMapping& wanted : rgWanted) {
            const auto enState = mSzWord == "1" ? tavo::PortState::kOpen : tavo::PortState::kRefused;
            result.rgOutcomes.push_back(OutcomeOf(wanted, {enState, mSzWord}));
        }
        return result;
    }
    std::string ResultText(const OutcomeList& rgOutcomes) const override {
        std::string szText;
        for (const tavo::Outcome& outcome : rgOutcomes) {
            szText += outcome.szName + " " + outcome.verdict.szWord + "\n";
        }
        return szText;
    }
    std::string Outside(const std::function<bool()>&) override {
        mRgszCalls.emplace_back("outside");
        return mSzOutside;
    }
    void NewGateway() override { mRgszCalls.push_back("new " + Gateway() + " " + Box()); }
    bool HasMade(const std::function<bool()>&) override { return mBlMade; }
    void LostRouter() override { mRgszCalls.emplace_back("lost"); }

    using RuleMapper::WishedLease;
    Lines TakeCalls() { return std::exchange(mRgszCalls, {}); }
    int Pass(bool blRequested = false) {
        return Run(blRequested, [this] { return ++mNAsked > 0 && mBlStop; });
    }

    PassResult mResult;
    std::string mSzOutside = "198.51.100.1";
    std::string mSzWord = "1";  // of each port
    bool mBlMade = false;       // something is on record
    bool mBlMarkedAtMap = true;
    bool mBlStop = false;
    int mNAsked = 0;  // how often, whether to stop

private:
    Lines mRgszCalls;
};

class RuleMapping : public testing::Test {
protected:
    void SetUp() override {
        gSzGateway = "192.168.1.1";
        gSzBox = "192.168.1.5";
        gPNetwork = &mNetwork;
        Write(kRules, kRule);
        Switch(true);
        std::filesystem::remove("/etc/tavo/platform.conf");
        std::filesystem::remove(kNames.szResultFile);
    }
    void TearDown() override {
        gSzBox.clear();
        gPNetwork = nullptr;
        std::filesystem::remove(kRules);
        std::filesystem::remove(kSystem);
        std::filesystem::remove_all("/run/tavo");
    }
    static void Switch(bool blOn) {
        Write(kSystem, std::string("runupnpportmapping=\"") + (blOn ? "yes" : "no") + "\"\n");
    }
    static std::string Result() { return Read(kNames.szResultFile); }
    Network mNetwork;
};

TEST_F(RuleMapping, TheNextPassComesSoonAfterAChangeAndWhenSomethingIsToBeDone) {
    Write("/etc/tavo/platform.conf", "[played]\ncheck_interval=\"300\"\n");
    Played mapper;
    const auto fnNext = [&](const char* szWord, bool blRequested, int nDue) {
        mapper.mSzWord = szWord;
        mapper.mResult.nNextSeconds = nDue;
        return mapper.Pass(blRequested);
    };
    const std::tuple<const char*, bool, int, int> rgPasses[] = {
        {"1", true, 0, 10},    {"1", false, 0, 20},  {"1", false, 0, 40},  {"718", false, 0, 10},
        {"718", false, 0, 20}, {"718", true, 0, 10}, {"718", false, 7, 7}, {"718", false, 900, 40}};
    for (const auto& [szWord, blRequested, nDue, nSeconds] : rgPasses) {
        EXPECT_EQ(fnNext(szWord, blRequested, nDue), nSeconds) << szWord << " " << nDue;
    }
    Write("/etc/tavo/platform.conf", "[played]\ncheck_interval=\"3\"\n");
    EXPECT_EQ(mapper.Pass(true), 3);
    mapper.TakeCalls();
    mapper.mResult.transport = {tavo::Reply::kUnreachable};
    for (const char* szLast : {"map 1", "map 1", "lost"}) {
        EXPECT_EQ(mapper.Pass(), 3);
        EXPECT_EQ(mapper.TakeCalls().back(), szLast);
    }
}

// The settings within their bounds: seconds of a router that has nothing to be done, and of a lease.
TEST_F(RuleMapping, SettingsOutsideTheirBoundsAreAtThem) {
    for (const auto& [szCheck, szLease, nSeconds, nLease] : {std::tuple{"0", "19", 1, 20U},
                                                             {"1", "20", 1, 20U},
                                                             {"3600", "604800", 3600, 604800U},
                                                             {"3601", "604801", 3600, 604800U},
                                                             {"x", "x", 1, 20U},
                                                             {"", "", 120, 3600U}}) {
        std::filesystem::remove("/etc/tavo/platform.conf");
        if (*szCheck != '\0') {
            Write("/etc/tavo/platform.conf",
                  std::string("[played]\ncheck_interval=\"") + szCheck + "\"\nlease=\"" + szLease + "\"\n");
        }
        Played mapper;
        int nNext = mapper.Pass(true);
        for (int i = 0; i < 12; ++i) {  // it looks more and more seldom
            nNext = mapper.Pass();
        }
        EXPECT_EQ(nNext, nSeconds);
        EXPECT_EQ(mapper.WishedLease(), nLease);
    }
}

// Were one daemon still taking its mappings away while the other makes its own, what was just made would vanish.
TEST_F(RuleMapping, ThereIsOneDaemonAtTheRouter) {
    Played mapper;
    {
        const tavo::Descriptor fdOther(open(kTurn, O_RDWR | O_CREAT | O_CLOEXEC, 0600));
        ASSERT_EQ(flock(fdOther.Get(), LOCK_EX | LOCK_NB), 0);
        mapper.mBlStop = true;
        mapper.Pass(true);
        EXPECT_FALSE(std::filesystem::exists(kNames.szResultFile)) << "a pass that was stopped has no results";
        mapper.mBlStop = false;
        gNClockStep = 20;  // of the minute that it waits
        EXPECT_EQ(mapper.Pass(true), 10);
        EXPECT_EQ(Result(), "80/tcp busy\n");
        EXPECT_EQ(std::exchange(mapper.mNAsked, 0), 6) << "for a minute";
        gNClockStep = 2;
        Switch(false);
        EXPECT_EQ(mapper.Pass(true), 10);
        EXPECT_LE(mapper.mNAsked, 1) << "one that is switched off waits for nobody";
        EXPECT_TRUE(mapper.Withdraw([] { return false; }));
        mapper.TakeCalls();
        mapper.mBlMade = true;
        mapper.mResult.transport = {tavo::Reply::kTimeout};
        EXPECT_EQ(mapper.Pass(), 10);
        EXPECT_EQ(mapper.TakeCalls(), (Lines{"map 0 beside TCP80 8080"}))
            << "its own goes, as soon as the router is back";
        mapper.mResult.transport = {};
        EXPECT_TRUE(mapper.Withdraw([] { return false; }));
        EXPECT_EQ(mapper.TakeCalls(), (Lines{"map 0 beside TCP80 8080"}));
        Write(kRules, "this is no rule file\n");
        mapper.Pass(true);
        EXPECT_FALSE(mapper.Withdraw([] { return false; }));
        EXPECT_EQ(mapper.TakeCalls(), Lines()) << "nobody knows what is the other's";
        Write(kRules, kRule);
        mapper.mBlMade = false;
        gNClockStep = 0;
    }
    Switch(true);
    mapper.Pass(true);
    EXPECT_EQ(Result(), "80/tcp 1\n");
    EXPECT_FALSE(IsLockFree(kTurn)) << "it keeps its turn";
    Switch(false);
    mapper.mBlStop = mapper.mResult.blStopped = true;
    mapper.Pass(true);
    EXPECT_FALSE(IsLockFree(kTurn)) << "what is taken away may be there still";
    mapper.mBlStop = mapper.mResult.blStopped = false;
    mapper.TakeCalls();
    mapper.Pass();
    EXPECT_EQ(mapper.TakeCalls(), (Lines{"map 0"}));
    EXPECT_TRUE(IsLockFree(kTurn));
}

// What is told of a port, while the daemon is switched on: what was told before is known until it is switched off.
TEST_F(RuleMapping, NewsIsToldOfWhatIsMappedAndForgottenWithTheSwitch) {
    std::filesystem::remove("/var/lib/tavo/played.told");
    Played mapper;
    mapper.mResult.enRouter = tavo::RouterState::kOk;
    const std::tuple<bool, bool, const char*, const char*> rgPasses[] = {
        {true, true, "1", ""},
        {true, false, "728", "on the router: 80/tcp (web): the router's table of ports is full"},
        {false, false, "1", ""},  // a save has switched it off for a moment
        {true, false, "1", "on the router now: 80/tcp (web)"},
        {false, true, "1", ""},
        {true, true, "728", ""}};
    for (const auto& [blOn, blRequested, szWord, szTold] : rgPasses) {
        Switch(blOn);
        mapper.mSzWord = szWord;
        gNClockAhead += 120;
        gLog.clear();
        mapper.Pass(blRequested);
        std::erase_if(gLog, [](const std::string& szLine) { return !szLine.starts_with("on the router"); });
        EXPECT_EQ(gLog, *szTold == '\0' ? Lines() : Lines{szTold}) << szWord;
    }
    gNClockAhead = 0;
}

TEST_F(RuleMapping, WhatIsWrittenOfAPassIsThisPass) {
    Played mapper;
    Write(kNames.szResultFile, "old\n");
    Write(kRules, "this is no rule file\n");
    mapper.Pass(true);
    EXPECT_EQ(Result(), "rule.conf unreadable\n");
    EXPECT_TRUE(Logged("rule file cannot be read; the router's mappings stay as they are"));
    EXPECT_EQ(mapper.TakeCalls(), Lines()) << "not knowing the rules is no reason to take anything away";
    Write(kRules, std::string(kRule) + "[2]\nenabled=1\nprotocol name=tcp\nr_port=1-2\ns_port=1\n");
    mapper.mResult.enRouter = tavo::RouterState::kOk;
    for (const char* szOutside : {"outside", "", "", "", "", "outside"}) {
        mapper.Pass(*szOutside != '\0');
        EXPECT_EQ(mapper.TakeCalls().back(), *szOutside == '\0' ? "map 1" : szOutside);
        EXPECT_EQ(mapper.mBlMarkedAtMap, *szOutside == '\0') << "a request's begins with no results";
    }
    EXPECT_EQ(Result(), "80/tcp 1\n1-2/tcp invalid\n");
    EXPECT_EQ(std::filesystem::status(kNames.szResultFile).permissions(), std::filesystem::perms(0644));
    EXPECT_EQ(std::filesystem::status(kPublished).permissions(), std::filesystem::perms(0644));
    Json::Value js;
    std::istringstream(Read(kPublished)) >> js;
    EXPECT_EQ(js["rules"][0]["rule"].asString() + js["rules"][1]["rule"].asString(), "web2");
    EXPECT_EQ(js["gateway"].asString() + js["box"].asString() + js["outside"].asString(),
              "192.168.1.1192.168.1.5198.51.100.1");
    EXPECT_EQ(js["next_look"].asInt64() - js["at"].asInt64(), 10);

    Write(kRules, "this is no rule file any more\n");
    mapper.Pass(true);
    EXPECT_EQ(Result(), "80/tcp 1\n1-2/tcp invalid\nrule.conf unreadable\n") << "the old rules go on";
    gSzGateway.clear();
    mapper.Pass();
    EXPECT_EQ(Result(), "80/tcp nogateway\n1-2/tcp invalid\nrule.conf unreadable\n");
    const ino_t nWritten = InodeOf(kNames.szResultFile);
    mapper.Pass();
    EXPECT_EQ(InodeOf(kNames.szResultFile), nWritten) << "a box that has nothing to do lets its disks sleep";
    gSzGateway = "192.168.1.1";
    gSzBox = "192.168.1.6";
    mapper.TakeCalls();
    mapper.mSzOutside = "0.0.0.0";
    mapper.Pass();
    EXPECT_EQ(mapper.TakeCalls(), (Lines{"new 192.168.1.1 192.168.1.6", "map 1", "outside"}));
    std::istringstream(Read(kPublished)) >> js;
    EXPECT_TRUE(js["outside"].isNull()) << "how a router says that it has none";
    for (const auto& [enRouter, nInterface, szRouter] : {std::tuple{tavo::RouterState::kSilent, -1, "unreachable"},
                                                         {tavo::RouterState::kNoGateway, -1, "no_gateway"},
                                                         {tavo::RouterState::kNoGateway, 0, "no_gateway"}}) {
        mNetwork.nInterface = nInterface;
        mapper.mResult.enRouter = enRouter;
        mapper.Pass();
        std::istringstream(Read(kPublished)) >> js;
        EXPECT_EQ(js["router"], szRouter);
        EXPECT_EQ(js["router_why"].asString().starts_with("the network cable is out"), nInterface != 0) << szRouter;
    }
    std::filesystem::remove(kNames.szResultFile);
    std::filesystem::create_directories(kNames.szResultFile);  // is in the way
    mapper.Pass();
    EXPECT_TRUE(Logged("write /tmp/played.out"));
    EXPECT_FALSE(mapper.OnNetworkChange());
    mNetwork.nInterface = -1;
    EXPECT_TRUE(mapper.OnNetworkChange());
    EXPECT_FALSE(mapper.OnNetworkChange()) << "told once";
    const Lines rgszTries = {"map 0", "map 0", "map 0"};
    mapper.TakeCalls();
    mapper.mResult.transport = {tavo::Reply::kTimeout};
    EXPECT_FALSE(mapper.Withdraw([] { return false; }));
    EXPECT_EQ(mapper.TakeCalls(), rgszTries);
    mapper.mResult.transport = {tavo::Reply::kOk};
    mapper.mResult.rgOutcomes = {tavo::Outcome{"81/tcp", {tavo::PortState::kWaiting, "606"}}};
    mapper.mResult.rgOutcomes[0].blLeftOver = true;
    EXPECT_FALSE(mapper.Withdraw([] { return false; })) << "something is left";
    std::istringstream(Read(kPublished)) >> js;
    EXPECT_EQ(js["left_over"][0]["name"], "81/tcp") << "its last word, where it is left";
    mapper.mResult.rgOutcomes.clear();
    EXPECT_TRUE(mapper.Withdraw([] { return false; }));
    EXPECT_FALSE(std::filesystem::exists(kPublished));
}

}  // namespace
