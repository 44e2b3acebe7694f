// The network checks: what addresses tell, that each check ends where nothing answers, and what the kernel tells.
#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <string>
#include <vector>

#include "ground/net/Level.h"
#include "ground/net/Neighbour.h"
#include "ground/net/NetworkWatch.h"
#include "tavo/core.h"
#include "tavo/net.h"
#include "wire/icmp/HopProbe.h"
#include "world.h"

namespace {

using tavo::AddressKind;

in_addr Address(const char* szText) {
    in_addr address = {};
    EXPECT_EQ(inet_pton(AF_INET, szText, &address), 1) << szText;
    return address;
}

TEST(Level, AddressesAreToldApartAtTheEdgesOfTheirBlocks) {
    const std::pair<AddressKind, std::vector<const char*>> rgCases[] = {
        {AddressKind::kPublic,
         {"1.0.0.0", "9.255.255.255", "11.0.0.0", "100.63.255.255", "100.128.0.0", "172.15.255.255", "172.32.0.0",
          "192.167.255.255", "192.169.0.0", "192.0.2.1", "198.51.100.1", "203.0.113.1", "223.255.255.255"}},
        {AddressKind::kPrivate,
         {"10.0.0.0", "10.255.255.255", "172.16.0.0", "172.31.255.255", "192.168.0.0", "192.168.255.255"}},
        {AddressKind::kCarrier, {"100.64.0.0", "100.127.255.255"}},
        {AddressKind::kNone, {"0.0.0.0", "127.0.0.1", "169.254.0.1", "224.0.0.1", "255.255.255.255"}}};
    for (const auto& [enKind, rgszAddresses] : rgCases) {
        for (const char* szAddress : rgszAddresses) {
            EXPECT_EQ(tavo::KindOf(Address(szAddress)), enKind) << szAddress;
        }
    }
}

TEST(Level, CountsEveryTranslationThatTheEvidenceShowsAndNoOther) {
    constexpr const char* kNone = nullptr;
    constexpr int kUntold = -1;
    const std::tuple<const char*, const char*, bool, std::vector<const char*>, int> rgCases[] = {
        {"203.0.113.5", kNone, false, {}, 0},
        {"192.168.1.5", "198.41.0.4", false, {}, 1},
        {"192.168.1.5", "198.41.0.4", false, {"10.1.1.1", "100.64.0.1"}, 1},  // the provider's own routers
        {"192.168.1.5", "198.41.0.4", true, {"10.1.1.1", "203.0.113.1"}, 2},  // the address of the second router
        {"192.168.1.5", "198.41.0.4", true, {"203.0.113.1"}, 1},
        {"192.168.1.5", "192.168.0.2", false, {}, 2},
        {"192.168.1.5", "100.64.0.2", false, {"203.0.113.1"}, 2},
        {"192.168.1.5", "100.64.0.2", false, {"10.1.1.1", "203.0.113.1"}, 2},
        {"192.168.1.5", "10.0.0.2", false, {"10.0.0.1", "100.64.0.1", "203.0.113.1"}, 3},
        {"192.168.1.5", kNone, false, {"203.0.113.1", "10.0.0.1"}, 1},
        {"192.168.1.5", kNone, false, {kNone, "10.0.0.1"}, 2},
        {"192.168.1.5", kNone, false, {kNone, "100.64.0.1", "10.0.0.1"}, 2},
        {"192.168.1.5", kNone, false, {"192.168.0.1", "10.0.0.1", "203.0.113.1"}, 2},
        {"192.168.1.5", kNone, false, {"169.254.1.1", kNone}, kUntold},
        {"192.168.1.5", kNone, false, {}, kUntold},
        {"192.168.1.5", "169.254.1.1", false, {kNone, "203.0.113.1"}, 1},
        {"100.64.0.5", kNone, false, {}, 2},
        {"169.254.1.5", kNone, false, {}, kUntold}};
    for (const auto& [szOwn, szExternal, blElsewhere, rgszBeyond, nLevel] : rgCases) {
        tavo::LevelEvidence evidence;
        evidence.own = Address(szOwn);
        if (szExternal != nullptr) {
            evidence.external = Address(szExternal);
        }
        evidence.blExternalElsewhere = blElsewhere;
        for (const char* szRouter : rgszBeyond) {
            evidence.rgBeyond.push_back(szRouter == nullptr ? std::nullopt : std::optional<in_addr>(Address(szRouter)));
        }
        EXPECT_EQ(tavo::LevelOf(evidence).value_or(kUntold), nLevel)
            << szOwn << " " << (szExternal == nullptr ? "-" : szExternal) << " " << rgszBeyond.size();
    }
}

TEST(NetworkChecks, FailAtOnceInABoxWithoutANetwork) {
    const auto start = std::chrono::steady_clock::now();
    char szText[1024] = "x";
    gSzGateway.clear();
    EXPECT_EQ(checkDefaultGatewaySetting(szText, sizeof(szText)), -1);
    EXPECT_STREQ(szText, "");
    gSzGateway = "192.168.1.1";
    EXPECT_EQ(checkDefaultGatewaySetting(szText, sizeof(szText)), -1);
    EXPECT_STREQ(szText, "192.168.1.1");
    EXPECT_EQ(checkGwIfEnable(szText, sizeof(szText)), -1);
    EXPECT_EQ(checkConnectToWAN(), -1);
    EXPECT_EQ(checkDNSSetting(), -1);
    int nLevel = 7;
    EXPECT_EQ(getPublicIPLevel(nLevel, 3), -1);
    EXPECT_EQ(nLevel, 7);
    TAVO_NET_CARD card = {};
    EXPECT_EQ(TLIBNetGetInterfaceInfo(&card, 1, 2), 0);
    EXPECT_EQ(TAVONetGetCard1(0, &card), 0);
    EXPECT_EQ(TLIBNetGetInterfaceInfo(&card, 1, 1), 1);
    EXPECT_STREQ(card.szAddress, "127.0.0.1");
    EXPECT_STREQ(card.szMask, "255.0.0.0");
    EXPECT_EQ(TLIBNetGetInterfaceInfo(nullptr, 1, 1) + TLIBNetGetInterfaceInfo(&card, 1, 3), -2);
    // A connection refused is a host reached, and entries that are none are left out.
    Write("/etc/tavo/platform.conf", "[network]\nwan_hosts=\"nonsense 1.2.3.4 1.2.3.4:0 127.0.0.1:9 \"\n");
    EXPECT_EQ(checkConnectToWAN(), 0);
    Write("/etc/tavo/platform.conf", "[network]\nwan_hosts=\" \"\n");
    EXPECT_EQ(checkConnectToWAN(), -1);
    EXPECT_EQ(getPublicIPLevel(nLevel, 3), -1);
    std::filesystem::remove("/etc/tavo/platform.conf");
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(7));
}

// Two cables: the checks are about the one that leads to the gateway, and else about one that is plugged in.
TEST(NetworkChecks, AreAboutTheInterfaceThatLeadsToTheGateway) {
    const auto fnRun = [](const std::string& szCommand) { ASSERT_EQ(TLIBCSystem(szCommand.c_str()), 0) << szCommand; };
    // One end, until the kernel has told the other one.
    const auto fnSet = [&](const std::string& szEnd, const std::string& szState, const std::string& szShown) {
        fnRun("ip link set " + szEnd + " " + szState + " && timeout 9 sh -c 'until ip link show box" + szEnd.back() +
              " | grep -q \"state " + szShown + "\"; do sleep .02; done'");
    };
    for (const std::string szOne : {"0", "1"}) {
        fnRun("ip link add box" + szOne + " up type veth peer name far" + szOne);
        fnRun("ip address add 10.9." + szOne + ".5/24 dev box" + szOne);
        fnSet("far" + szOne, "up", "UP");
    }
    const std::tuple<const char*, const char*, int, const char*, int> rgCases[] = {{"10.9.1.1", "", 0, "box1", 0},
                                                                                   {"10.9.0.1", "", 0, "box0", 0},
                                                                                   {"10.9.0.5", "", 0, "box0", -1},
                                                                                   {"10.8.0.1", "", 0, "box0", -1},
                                                                                   {"", "", 0, "box0", -1},
                                                                                   {"", "far0", 0, "box1", -1},
                                                                                   {"10.9.1.1", "far0", 0, "box1", 0},
                                                                                   {"10.9.0.1", "far0", -1, "box0", 0},
                                                                                   {"10.9.0.1", "box0", 0, "box1", -1}};
    for (const auto& [szGateway, szDown, nEnabled, szName, nSet] : rgCases) {
        SCOPED_TRACE(std::string(szGateway) + " without " + szDown);
        gSzGateway = szGateway;
        *szDown == '\0' ? void() : fnSet(szDown, "down", ".*DOWN");
        char szText[64] = "?";
        EXPECT_EQ(checkGwIfEnable(szText, sizeof(szText)), nEnabled);
        EXPECT_STREQ(szText, szName);
        EXPECT_EQ(checkDefaultGatewaySetting(szText, sizeof(szText)), nSet);
        EXPECT_STREQ(szText, szGateway);
        *szDown == '\0' ? void() : fnSet(szDown, "up", "UP");
    }
    fnRun("ip link del box0 && ip link del box1");
    gSzGateway = "192.168.1.1";
}

TEST(HopProbe, ShowsTheHostItselfAtEveryDistanceAndKeepsItsBounds) {
    const std::tuple<int, int, size_t> rgCases[] = {{1, 1, 1}, {1, 3, 3}, {30, 30, 1}, {29, 31, 2},
                                                    {0, 3, 0}, {3, 2, 0}, {31, 31, 0}};
    std::chrono::duration<double> least = std::chrono::seconds(1);
    for (const auto& [nFirst, nLast, nSteps] : rgCases) {
        const auto start = std::chrono::steady_clock::now();
        const auto rgFound = tavo::WalkTowards(Address("127.0.0.1"), nFirst, nLast, 1000);
        const std::chrono::duration<double> took = std::chrono::steady_clock::now() - start;
        EXPECT_LT(took.count(), 0.9) << "all have answered";
        least = nSteps > 0 ? std::min(least, took) : least;
        EXPECT_EQ(rgFound.size(), nSteps) << nFirst << "-" << nLast;
        for (const auto& who : rgFound) {
            EXPECT_TRUE(who && who->s_addr == Address("127.0.0.1").s_addr) << nFirst << "-" << nLast;
        }
    }
    EXPECT_LT(least.count(), 0.2) << "it asks at once, and not only again";
}

// At the other end of the link there is nobody.
TEST(HopProbe, AsksAgainAndWaitsUntilItsLimit) {
    for (const char* szStep :
         {"ip link add v0 type veth peer name v1", "ip link set v1 up", "ip address add 10.77.0.1/24 dev v0",
          "ip link set v0 up", "ip neigh add 10.77.0.2 lladdr 00:11:22:aa:bb:cc dev v0"}) {
        ASSERT_EQ(TLIBCSystem(szStep), 0) << szStep;
    }
    const auto fnSent = [] {
        std::ifstream counts("/proc/net/snmp");
        std::vector<int> rgSent;
        for (std::string szLine; std::getline(counts, szLine);) {
            int nSent = 0;
            if (std::sscanf(szLine.c_str(), "Udp: %*d %*d %*d %d", &nSent) == 1) {
                rgSent.push_back(nSent);
            }
        }
        return rgSent.at(0);
    };
    for (const auto& [nLimit, nAskings] : {std::pair(50, 1), {450, 2}, {900, 3}}) {
        const int nSent = fnSent();
        const auto start = std::chrono::steady_clock::now();
        const std::clock_t nBusy = std::clock();
        const auto rgFound = tavo::WalkTowards(Address("10.77.0.2"), 2, 3, nLimit);
        EXPECT_LT(std::clock() - nBusy, CLOCKS_PER_SEC / 10) << "it sleeps";
        const auto took = std::chrono::steady_clock::now() - start;
        EXPECT_TRUE(took >= std::chrono::milliseconds(nLimit) && took < std::chrono::milliseconds(nLimit + 1000));
        EXPECT_TRUE(rgFound.size() == 2 && !rgFound[0] && !rgFound[1]);
        EXPECT_EQ(fnSent() - nSent, 2 * nAskings) << nLimit;
    }
    EXPECT_EQ(TLIBCSystem("ip link del v0"), 0);
}

TEST(NetworkWatch, SaysThatSomethingHasChangedAndThenNoMore) {
    tavo::NetworkWatch watch;
    ASSERT_GE(watch.Fd(), 0);
    for (const char* szChange : {"ip address add 192.168.77.1/24 dev lo", "ip address del 192.168.77.1/24 dev lo",
                                 "ip link add v0 type veth peer name v1", "ip link del v0"}) {
        EXPECT_FALSE(watch.TakeChange());
        ASSERT_EQ(TLIBCSystem(szChange), 0) << szChange;
        EXPECT_TRUE(watch.TakeChange()) << szChange;
    }
    EXPECT_FALSE(watch.TakeChange());
}

// The other end of the link takes what it is asked and does not answer.
TEST(Neighbour, IsThereUntilTheKernelKnowsBetter) {
    for (const char* szStep :
         {"ip link add v0 type veth peer name v1", "ip link set v1 up", "ip address add 10.77.0.1/24 dev v0",
          "ip link set v0 up", "ip neigh add 10.77.0.2 lladdr 00:11:22:aa:bb:cc dev v0",
          "echo 100 >/proc/sys/net/ipv4/neigh/v0/retrans_time_ms"}) {
        ASSERT_EQ(TLIBCSystem(szStep), 0) << szStep;
    }
    const std::pair<const char*, const char*> rgAddresses[] = {
        {"10.77.0.2", "00:11:22:aa:bb:cc"}, {"10.77.0.3", ""}, {"127.0.0.1", ""}, {"10.77.0", ""}, {"", ""}};
    for (const auto& [szAddress, szHardware] : rgAddresses) {
        EXPECT_EQ(tavo::HardwareAddress(szAddress), szHardware) << szAddress;
    }
    struct Case {
        const char* szWhat;
        const char* szAddress;
        int nState;  // of the kernel's row, NUD_STALE or none
        bool blStop;
        bool blThere;
    };
    const Case rgCases[] = {
        {"known for good", "10.77.0.2", 0, false, true}, {"nobody", "10.77.0.3", 0, false, false},
        {"gone since", "10.77.0.4", 4, false, false},    {"nobody, and no time to ask", "10.77.0.5", 0, true, true},
        {"this box", "127.0.0.1", 0, false, true},       {"no address", "10.77.0", 0, false, true}};
    for (const Case& one : rgCases) {
        if (one.nState != 0) {
            ASSERT_EQ(
                TLIBCSystem(
                    (std::string("ip neigh add lladdr 00:11:22:aa:bb:cd nud stale dev v0 ") + one.szAddress).c_str()),
                0);
        }
        const auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(tavo::IsNeighbourThere(one.szAddress, [&] { return one.blStop; }), one.blThere) << one.szWhat;
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(3)) << one.szWhat;
    }
    EXPECT_EQ(TLIBCSystem("ip link del v0"), 0);
}

}  // namespace
