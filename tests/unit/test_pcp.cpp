// NAT-PMP's datagrams, good and bad, and the exchange of them with a gateway on loopback.
#include <gtest/gtest.h>
#include <poll.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "loopback.h"
#include "wire/pcp/Announcements.h"
#include "wire/pcp/Client.h"
#include "wire/pcp/Exchange.h"

namespace {

using namespace std::chrono_literals;
using Bytes = std::vector<uint8_t>;
using Clock = std::chrono::steady_clock;

constexpr tavo::NatpmpQuestion kAddress;
constexpr tavo::NatpmpQuestion kMapping{tavo::kMapTcp, 0x1389, 0x1F90, 3600};
constexpr tavo::NatpmpQuestion kEnding{tavo::kMapTcp, 0x1389, 0, 0};

constexpr char kGateway[] = "127.0.0.1";
constexpr char kNeighbour[] = "127.0.0.2";

TEST(NatpmpPacket, QuestionsAreAsTheProtocolHasThem) {
    EXPECT_EQ(tavo::BytesOf(kAddress), (Bytes{0, 0}));
    EXPECT_EQ(tavo::BytesOf(kMapping), (Bytes{0, 2, 0, 0, 0x13, 0x89, 0x1F, 0x90, 0, 0, 0x0E, 0x10}));
    EXPECT_EQ(tavo::BytesOf({tavo::kMapUdp, 1, 2, 0x01020304}), (Bytes{0, 1, 0, 0, 0, 1, 0, 2, 1, 2, 3, 4}));
}

TEST(NatpmpPacket, OnlyWhatAnswersTheQuestionCounts) {
    enum Kind { kNone, kOther, kRefused, kGood };
    struct Case {
        const char* szWhat;
        tavo::NatpmpQuestion question;
        Bytes rgDatagram;
        Kind enKind;
    };
    const Case rgCases[] = {
        {"nothing", kAddress, {}, kNone},
        {"less than a header", kAddress, {0, 128, 0, 0, 0, 0, 0}, kNone},
        {"an address", kAddress, {0, 128, 0, 0, 0, 0, 1, 2, 198, 41, 0, 4}, kGood},
        {"an address cut short", kAddress, {0, 128, 0, 0, 0, 0, 1, 2, 198, 41, 0}, kNone},
        {"a question", kAddress, {0, 0, 0, 0, 0, 0, 1, 2, 198, 41, 0, 4}, kNone},
        {"a refused address, without it", kAddress, {0, 128, 0, 3, 0, 0, 1, 2}, kRefused},
        {"an address where a mapping was asked for", kMapping, {0, 128, 0, 0, 0, 0, 1, 2, 198, 41, 0, 4}, kNone},
        {"another version", kAddress, {2, 128, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0}, kOther},
        {"another version, of another question", kAddress, {2, 130, 0, 1, 0, 0, 0, 0}, kNone},
        {"a mapping", kMapping, {0, 130, 0, 0, 0, 0, 1, 2, 0x13, 0x89, 0x1F, 0x90, 0, 1, 0, 2}, kGood},
        {"of UDP", kMapping, {0, 129, 0, 0, 0, 0, 1, 2, 0x13, 0x89, 0x1F, 0x90, 0, 0, 0, 9}, kNone},
        {"of another port", kMapping, {0, 130, 0, 0, 0, 0, 1, 2, 0x13, 0x88, 0x1F, 0x90, 0, 0, 0, 9}, kNone},
        {"cut short", kMapping, {0, 130, 0, 0, 0, 0, 1, 2, 0x13, 0x89, 0x1F, 0x90, 0, 0, 0}, kNone},
        {"to router port 0", kMapping, {0, 130, 0, 0, 0, 0, 1, 2, 0x13, 0x89, 0, 0, 0, 0, 0, 9}, kNone},
        {"the end, where one was to begin", kMapping, {0, 130, 0, 0, 0, 0, 1, 2, 0x13, 0x89, 1, 2, 0, 0, 0, 0}, kNone},
        {"the end", kEnding, {0, 130, 0, 0, 0, 0, 1, 2, 0x13, 0x89, 0, 0, 0, 0, 0, 0}, kGood},
        {"a grant, where one was to end", kEnding, {0, 130, 0, 0, 0, 0, 1, 2, 0x13, 0x89, 1, 2, 1, 0, 0, 0}, kNone},
        {"refused", kMapping, {0, 130, 0, 2, 0, 0, 1, 2, 0x13, 0x89, 0, 0, 0, 0, 0, 0}, kRefused},
        {"refused, the port left empty", kMapping, {0, 130, 0, 2, 0, 0, 1, 2, 0, 0, 0, 0, 0, 0, 0, 0}, kRefused},
        {"refused, the port left out", kMapping, {0, 130, 0, 2, 0, 0, 1, 2}, kRefused},
        {"another port refused", kMapping, {0, 130, 0, 2, 0, 0, 1, 2, 0x13, 0x88, 0, 0, 0, 0, 0, 0}, kNone},
        {"the same, cut behind the ports", kMapping, {0, 130, 0, 2, 0, 0, 1, 2, 0x13, 0x88, 0, 0}, kNone},
        {"cut within them", kMapping, {0, 130, 0, 2, 0, 0, 1, 2, 0x13, 0x88, 0}, kRefused},
        {"an address refused, with one that is no port of ours",
         kAddress,
         {0, 128, 0, 3, 0, 0, 1, 2, 198, 41, 0, 4},
         kRefused}};
    for (const Case& one : rgCases) {
        const auto answer = tavo::ReadAnswer(one.rgDatagram, one.question);
        ASSERT_EQ(answer.has_value(), one.enKind != kNone) << one.szWhat;
        if (answer) {
            EXPECT_EQ(answer->blOtherVersion, one.enKind == kOther) << one.szWhat;
            EXPECT_EQ(answer->nResult, one.enKind == kRefused ? one.rgDatagram[3] : 0) << one.szWhat;
            EXPECT_EQ(answer->nEpoch, one.enKind == kGood ? 0x102U : 0U) << one.szWhat;
        }
    }
    const auto granted = tavo::ReadAnswer(rgCases[9].rgDatagram, kMapping);
    ASSERT_TRUE(granted);
    EXPECT_EQ(granted->nRouterPort, 0x1F90);
    EXPECT_EQ(granted->nLifetime, 0x10002U);
}

TEST(NatpmpPacket, AnnouncementsOfBothProtocols) {
    const auto fnPcp = [](uint8_t nVersion, uint8_t nOpcode, uint8_t nResult, size_t nSize) {
        Bytes rgBytes(nSize);
        rgBytes[0] = nVersion;
        rgBytes[1] = nOpcode;
        rgBytes[3] = nResult;
        rgBytes[10] = 1;
        rgBytes[11] = 2;
        return rgBytes;
    };
    const std::pair<Bytes, std::string> rgCases[] = {{{0, 128, 0, 0, 0, 0, 1, 2, 198, 41, 0, 4}, "NAT-PMP 258"},
                                                     {{0, 128, 0, 0, 0, 0, 1, 2, 198, 41, 0}, ""},
                                                     {{0, 128, 0, 3, 0, 0, 1, 2, 198, 41, 0, 4}, ""},
                                                     {{0, 129, 0, 0, 0, 0, 1, 2, 198, 41, 0, 4}, ""},
                                                     {{1, 128, 0, 0, 0, 0, 1, 2, 198, 41, 0, 4}, ""},
                                                     {{}, ""},
                                                     {fnPcp(2, 0x80, 0, 24), "PCP 258"},
                                                     {fnPcp(2, 0x80, 0, 28), "PCP 258"},
                                                     {fnPcp(2, 0x80, 0, 23), ""},
                                                     {fnPcp(2, 0x00, 0, 24), ""},
                                                     {fnPcp(2, 0x81, 0, 24), ""},
                                                     {fnPcp(2, 0x80, 1, 24), ""},
                                                     {fnPcp(3, 0x80, 0, 24), ""}};
    for (const auto& [rgDatagram, szRead] : rgCases) {
        const auto read = tavo::ReadAnnouncement(rgDatagram);
        EXPECT_EQ(read ? (read->blPcp ? "PCP " : "NAT-PMP ") + std::to_string(read->nEpoch) : "", szRead)
            << testing::PrintToString(rgDatagram);
    }
}

// A gateway, and a neighbour who speaks at the same time; what they say is given for each question, by its number.
class Peer {
public:
    using Says = std::function<std::vector<Bytes>(int)>;
    explicit Peer(Says fnGateway, Says fnNeighbour = {})
        : mFnGateway(std::move(fnGateway)), mFnNeighbour(std::move(fnNeighbour)), mThread([this] { Serve(); }) {}
    ~Peer() {
        mBlEnd = true;
        mThread.join();
    }
    int Questions() const { return mNQuestions; }

private:
    void Serve() {
        for (pollfd waiting = {mFd.Get(), POLLIN, 0}; !mBlEnd;) {
            char rgQuestion[64];
            sockaddr_in from = {};
            if (poll(&waiting, 1, 10) <= 0 || Receive(mFd.Get(), rgQuestion, from) < 0) {
                continue;
            }
            const int nQuestion = ++mNQuestions;
            Say(mFdNeighbour.Get(), mFnNeighbour, nQuestion, from);
            Say(mFd.Get(), mFnGateway, nQuestion, from);
        }
    }
    static void Say(int fd, const Says& fnSays, int nQuestion, const sockaddr_in& to) {
        for (const Bytes& rgBytes : fnSays ? fnSays(nQuestion) : std::vector<Bytes>()) {
            Send(fd, rgBytes, to);
        }
    }

    tavo::Descriptor mFd = SocketAt(kGateway, tavo::kGatewayPort);
    tavo::Descriptor mFdNeighbour = SocketAt(kNeighbour, tavo::kGatewayPort);
    Says mFnGateway;
    Says mFnNeighbour;
    std::atomic<int> mNQuestions = 0;
    std::atomic<bool> mBlEnd = false;
    std::thread mThread;
};

TEST(NatpmpExchange, EndsAsItMustAndInTime) {
    using End = tavo::ExchangeEnd;
    const Bytes rgGood{1};
    const Bytes rgBad{9, 9};
    struct Case {
        const char* szWhat;
        Peer::Says fnGateway;
        Peer::Says fnNeighbour;
        End enEnd;
        int nQuestions;
        Clock::duration least;
        Clock::duration most;
        Clock::duration stop = 1h;
    };
    const Peer::Says fnGood = [&](int) { return std::vector<Bytes>{rgGood}; };
    const Peer::Says fnSilent = [](int) { return std::vector<Bytes>(); };
    const Peer::Says fnLost = [&](int n) { return n < 3 ? fnSilent(n) : fnGood(n); };
    const Peer::Says fnGarbage = [&](int) { return std::vector<Bytes>{rgBad, {}, Bytes(2000, 1)}; };
    const Peer::Says fnGarbageFirst = [&](int) { return std::vector<Bytes>{rgBad, {}, rgGood}; };
    const Case rgCases[] = {{"good", fnGood, {}, End::kAnswered, 1, 0ms, 1s},
                            {"lost twice", fnLost, {}, End::kAnswered, 3, 750ms, 1200ms},
                            {"garbage first", fnGarbageFirst, {}, End::kAnswered, 1, 0ms, 1s},
                            {"garbage only", fnGarbage, {}, End::kGarbage, 3, 1200ms, 2s},
                            {"silent", fnSilent, {}, End::kSilent, 3, 1200ms, 2s},
                            {"a neighbour's word", fnSilent, fnGood, End::kSilent, 3, 1200ms, 2s},
                            {"stopped", fnSilent, {}, End::kSilent, 1, 50ms, 1s, 50ms}};
    const auto fnTake = [&](std::span<const uint8_t> rgRead) {
        return std::equal(rgRead.begin(), rgRead.end(), rgGood.begin(), rgGood.end());
    };
    for (const Case& one : rgCases) {
        const Peer peer(one.fnGateway, one.fnNeighbour);
        const auto start = Clock::now();
        const auto fnStop = [&] { return Clock::now() - start > one.stop; };
        EXPECT_EQ(tavo::Exchange({}, AddressOf(kGateway).sin_addr, rgGood, 1200ms, fnTake, fnStop), one.enEnd)
            << one.szWhat;
        const auto took = Clock::now() - start;
        EXPECT_TRUE(took >= one.least && took < one.most) << one.szWhat << " " << took / 1ms;
        EXPECT_EQ(peer.Questions(), one.nQuestions) << one.szWhat;
    }
    const auto start = Clock::now();
    EXPECT_EQ(tavo::Exchange({}, AddressOf(kGateway).sin_addr, rgGood, 5s, fnTake, {}), End::kUnreachable)
        << "nobody listens";
    EXPECT_LT(Clock::now() - start, 1s);
}

TEST(NatpmpClient, AnAnswerThatComesTooLateIsNotTakenForTheNext) {
    uint32_t nEpoch = 0;
    tavo::NatpmpClient client(
        kGateway, {}, [&nEpoch](uint32_t nSaid) { nEpoch = nSaid; }, 300ms);
    std::string szAddress = "as it was";
    {
        const Peer peer([](int) { return std::vector<Bytes>{{0, 128, 0, 3, 0, 0, 1, 2, 198, 41, 0, 4}}; });
        EXPECT_EQ(client.AskAddress(szAddress), tavo::kNatpmpNetworkFailure);
        EXPECT_EQ(szAddress, "as it was");
        EXPECT_EQ(nEpoch, 0U) << "a refusal's clock is not believed";
    }
    // It says everything twice, the second time with an older clock.
    const Peer peer([](int nQuestion) {
        const auto nLow = static_cast<uint8_t>(nQuestion);
        return std::vector<Bytes>{{0, 128, 0, 0, 0, 0, 1, nLow, 198, 41, 0, nLow},
                                  {0, 128, 0, 0, 0, 0, 0, 0, 9, 9, 9, 9}};
    });
    for (uint32_t i = 1; i <= 2; ++i) {
        EXPECT_EQ(client.AskAddress(szAddress), tavo::kWireOk);
        EXPECT_EQ(szAddress, "198.41.0." + std::to_string(i));
        EXPECT_EQ(nEpoch, 256 + i);
    }
}

TEST(NatpmpClient, WhetherAGatewaySpeaksIt) {
    struct Case {
        const char* szWhat;
        std::vector<Bytes> rgSaid;
        int nCode;  // -1: it does not
        bool blAddress;
    };
    const Case rgCases[] = {{"an address", {{0, 128, 0, 0, 0, 0, 1, 2, 198, 41, 0, 4}}, 0, true},
                            {"none now", {{0, 128, 0, 0, 0, 0, 1, 2, 0, 0, 0, 0}}, 0, false},
                            {"refused", {{0, 128, 0, 2, 0, 0, 1, 2}}, 2, false},
                            {"noise before it", {{7}, {0, 128, 0, 3, 0, 0, 1, 2}}, 3, false},
                            {"PCP alone", {{2, 128, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0}}, -1, false},
                            {"silent", {}, -1, false}};
    for (const Case& one : rgCases) {
        const Peer peer([&one](int) { return one.rgSaid; });
        const auto start = Clock::now();
        const tavo::NatPmpWord word = tavo::AskNatPmp(kGateway);
        EXPECT_EQ(word.nCode.value_or(-1), one.nCode) << one.szWhat;
        EXPECT_EQ(word.address.has_value(), one.blAddress) << one.szWhat;
        const auto took = Clock::now() - start;
        EXPECT_TRUE(took < 1s && (!one.rgSaid.empty() || took >= 740ms)) << one.szWhat << " " << took / 1ms;
    }
}

// What is said to all hosts, by whom: the gateway's word counts, as often as it comes, and nobody else's.
TEST(GatewayAnnouncements, AreTheGatewaysOwn) {
    tavo::GatewayAnnouncements announcements;
    ASSERT_GE(announcements.Fd(), 0);
    const sockaddr_in all = AddressOf("224.0.0.1", 5350);
    const Bytes rgStarted{0, 128, 0, 0, 0, 0, 0, 7, 198, 41, 0, 4};
    const Bytes rgGarbage{0, 128};
    for (const auto& [szFrom, rgSaid] :
         {std::pair(kNeighbour, rgStarted), {kGateway, rgGarbage}, {kGateway, rgStarted}, {kGateway, rgStarted}}) {
        const tavo::Descriptor fd = SocketAt(szFrom, tavo::kGatewayPort);
        Send(ToAll(fd, "127.0.0.1").Get(), rgSaid, all);
    }
    const auto rgHeard = announcements.Take(kGateway);
    ASSERT_EQ(rgHeard.size(), 2U);
    EXPECT_EQ(std::pair(rgHeard[0].blPcp, rgHeard[0].nEpoch), std::pair(false, 7U));
    EXPECT_TRUE(announcements.Take(kGateway).empty());
    const tavo::Descriptor fd = SocketAt(kGateway, tavo::kGatewayPort);
    for (int i = 0; i < 65; ++i) {
        Send(ToAll(fd, "127.0.0.1").Get(), rgStarted, all);
    }
    EXPECT_EQ(announcements.Take(kGateway).size(), 64U) << "of a flood, so many at once";
    EXPECT_EQ(announcements.Take(kGateway).size(), 1U);
}

TEST(NatpmpClient, AsksForWhatItIsToldTo) {
    EXPECT_EQ(tavo::NatpmpClient(kGateway, {}, {}, 300ms).Unmap("UDP", 1), tavo::kWireUnreachable) << "nobody listens";
    {
        const Peer peer([](int) {
            return std::vector<Bytes>{{0, 130, 0, 0, 0, 0, 0, 9, 0x13, 0x89, 0x13, 0x8A, 0, 0, 0, 60}};
        });
        tavo::NatpmpGrant grant;
        EXPECT_EQ(tavo::NatpmpClient(kGateway, {}, {}, 300ms).Map("TCP", 0x1389, 0x1388, 3600, grant), tavo::kWireOk);
        EXPECT_EQ(std::pair(grant.nRouterPort, grant.nLifetime), std::pair(uint16_t{0x138A}, 60U));
        EXPECT_EQ(tavo::NatpmpClient(kGateway, {}, {}, 300ms).Map("UDP", 0x1389, 0x1388, 3600, grant),
                  tavo::kWireGarbage);
    }
    const Peer peer([](int) { return std::vector<Bytes>{{0, 129, 0, 0, 0, 0, 0, 9, 0x13, 0x89, 0, 0, 0, 0, 0, 0}}; });
    EXPECT_EQ(tavo::NatpmpClient(kGateway, {}, {}, 300ms).Unmap("UDP", 0x1389), tavo::kWireOk);
    EXPECT_EQ(tavo::NatpmpClient("no address", {}, {}, 300ms).Unmap("UDP", 0x1389), tavo::kWireUnreachable);
    EXPECT_EQ(tavo::NatpmpWords(2) + "; " + tavo::NatpmpWords(-1) + "; " + tavo::NatpmpWords(6),
              "refused: not authorised; no answer from the gateway; refused: code 6");
}

}  // namespace
