// The mapping sides of both daemons, each at a router on the loopback device: what they ask it for, and when anew.
#include <gtest/gtest.h>
#include <poll.h>

#include <algorithm>
#include <atomic>
#include <iterator>
#include <map>
#include <mutex>
#include <thread>

#include "loopback.h"
#include "network.h"
#include "programs/natpmpd/NatpmpMapper.h"
#include "programs/upnpd/UpnpMapper.h"
#include "tavo/core.h"
#include "wire/http/Request.h"
#include "wire/upnp/GatewayMemory.h"
#include "world.h"

namespace {

using Lines = std::vector<std::string>;

constexpr char kGateway[] = "192.168.78.1";
constexpr char kBox[] = "192.168.78.5";
constexpr char kNewBox[] = "192.168.78.6";
constexpr char kRules[] = "/etc/portforward/rule.conf";
constexpr char kSystem[] = "/etc/tavoinfo.conf";
constexpr uint16_t kSsdpPort = 1900;

// Of the gateway's, to all that listen.
void SayToAll(const char* szGroup, uint16_t nPort, const std::string& szText) {
    const tavo::Descriptor fd = SocketAt(kGateway);
    Send(ToAll(fd, kGateway).Get(), szText, AddressOf(szGroup, nPort));
}

class MapperTest : public testing::Test {
protected:
    explicit MapperTest(std::string szRunKey) : mSzRunKey(std::move(szRunKey)) {}
    void SetUp() override {
        MakeEmpty({"/var/lib/tavo", "/run/tavo"});
        std::filesystem::remove("/etc/tavo/platform.conf");
        gSzGateway = kGateway;
        gSzBox = kBox;
        gPNetwork = &mNetwork;
        Switch(true);
    }
    void TearDown() override {
        MakeEmpty({"/var/lib/tavo", "/run/tavo"});
        std::filesystem::remove(kRules);
        std::filesystem::remove(kSystem);
        gSzGateway = "192.168.1.1";
        gSzBox.clear();
        gPNetwork = nullptr;
        gNClockAhead = 0;
    }
    void Switch(bool blOn) const { Write(kSystem, mSzRunKey + "=\"" + (blOn ? "yes" : "no") + "\"\n"); }
    // One for each, from the router's port or range to the box's.
    using Rules = std::vector<std::pair<const char*, const char*>>;
    static void SetRules(const Rules& rgRules) {
        std::string szText;
        for (const auto& [szRouter, szBox] : rgRules) {
            szText += std::string("[") + szRouter + "]\nenabled=1\nprotocol name=tcp\nr_port=" + szRouter +
                      "\ns_port=" + szBox + "\nservice=web\n";
        }
        Write(kRules, szText);
    }
    static int Pass(tavo::RuleMapper& mapper, bool blRequested = false) {
        return mapper.Run(blRequested, [] { return false; });
    }

    LoopbackHosts mHosts{kGateway, kBox, kNewBox};
    std::string mSzRunKey;
    Network mNetwork;
    JumpingClock mClock;
};

// Grants what it is asked for, and says how long it has run as the test has it.
class NatpmpGateway {
public:
    ~NatpmpGateway() {
        mBlEnd = true;
        mThread.join();
    }
    // What was asked of it beside its address; what was sent again for want of an answer counts once.
    Lines TakeAsked() {
        const std::lock_guard guard(mMutex);
        mRgszAsked.erase(std::unique(mRgszAsked.begin(), mRgszAsked.end()), mRgszAsked.end());
        return std::exchange(mRgszAsked, {});
    }
    std::atomic<uint32_t> mNEpoch = 1000;
    std::atomic<uint16_t> mNBeside = 0;  // so far from the port that it was asked for

private:
    void Serve() {
        for (pollfd waiting = {mFd.Get(), POLLIN, 0}; !mBlEnd;) {
            char rgAsked[64];
            sockaddr_in from = {};
            if (poll(&waiting, 1, 10) > 0 && Receive(mFd.Get(), rgAsked, from) > 0) {
                Send(mFd.Get(), Answer(reinterpret_cast<const uint8_t*>(rgAsked), from), from);
            }
        }
    }
    static std::string Bytes(uint32_t nNumber, int nBytes) {
        std::string szBytes;
        for (int i = nBytes - 1; i >= 0; --i) {
            szBytes += static_cast<char>(nNumber >> (8 * i));
        }
        return szBytes;
    }
    std::string Answer(const uint8_t* pAsked, const sockaddr_in& from) {
        const std::string szHead = Bytes((128U + pAsked[1]) << 16U, 4);
        if (pAsked[1] == 0) {
            return szHead + Bytes(mNEpoch, 4) + Bytes(0xC6290004, 4);
        }
        const auto fnNumber = [pAsked](int nAt) { return uint32_t{pAsked[nAt]} << 8U | pAsked[nAt + 1]; };
        const uint32_t nLease = fnNumber(8) << 16U | fnNumber(10);
        char szFrom[INET_ADDRSTRLEN] = {};
        inet_ntop(AF_INET, &from.sin_addr, szFrom, sizeof(szFrom));
        const std::lock_guard guard(mMutex);
        std::string szAsked = std::to_string(fnNumber(4));
        szAsked += nLease == 0 ? " ends" : " at " + std::to_string(fnNumber(6)) + " for " + std::to_string(nLease);
        if (std::string(szFrom) != kGateway) {  // which the kernel takes for who does not say
            szAsked += std::string(" by ") + szFrom;
        }
        mRgszAsked.push_back(szAsked);
        return szHead + Bytes(mNEpoch, 4) + Bytes(fnNumber(4), 2) + Bytes(nLease == 0 ? 0 : fnNumber(6) + mNBeside, 2) +
               Bytes(nLease, 4);
    }

    tavo::Descriptor mFd = SocketAt(kGateway, tavo::kGatewayPort);
    std::mutex mMutex;
    Lines mRgszAsked;
    std::atomic<bool> mBlEnd = false;
    std::thread mThread{[this] { Serve(); }};
};

class NatpmpMapping : public MapperTest {
protected:
    NatpmpMapping() : MapperTest("runnatpmpportmapping") { SetRules({{"80", "8080"}}); }
    // So long after the last pass, by every clock but that of the day.
    void After(int nSeconds) {
        gNClockJumped += nSeconds;
        mGateway.mNEpoch += static_cast<uint32_t>(nSeconds);
    }
    static std::string Result() { return Read(tavo::kNatpmpNames.szResultFile); }
    NatpmpGateway mGateway;
};

const Lines kAsked{"8080 at 80 for 3600"};
constexpr char kNatpmpMade[] = "/var/lib/tavo/natpmp_made.conf";

TEST_F(NatpmpMapping, AGatewayThatHasBegunAnewIsAskedForAllAgain) {
    const std::tuple<const char*, int, uint32_t, bool, int> rgCases[] = {
        {"the first", 0, 1000, true, 10},
        {"it goes on", 10, 1010, false, 10},
        {"it goes on", 10, 1020, false, 20},
        {"it has begun anew", 20, 12, true, 10},
        {"it goes on", 10, 22, false, 10},
        {"it has just begun anew", 20, 3, true, 10},
        {"so young that it may have begun once more", 3, 4, true, 10},
        {"and once more", 3, 7, true, 10},
        {"which this looks at for the last time", 10, 17, true, 40},
        {"it goes on", 10, 27, false, 80}};
    tavo::NatpmpMapper mapper;
    for (const auto& [szWhat, nSeconds, nEpoch, blAsked, nNext] : rgCases) {
        gNClockJumped += nSeconds;
        mGateway.mNEpoch = nEpoch;
        EXPECT_EQ(Pass(mapper, nSeconds == 0), nNext) << szWhat << " " << nEpoch;
        EXPECT_EQ(mGateway.TakeAsked(), blAsked ? kAsked : Lines()) << szWhat << " " << nEpoch;
        EXPECT_EQ(Result(), "");
    }
    for (const auto& [cEpoch, blNews] : {std::pair('\36', false), {'\2', true}}) {  // held against its last answer
        SayToAll("224.0.0.1", 5350, std::string("\0\200\0\0\0\0\0", 7) + cEpoch + "addr");
        EXPECT_EQ(mapper.OnWake(), blNews);
    }
}

// Else a neighbour could have the box ask, and its disk write, without end.
TEST_F(NatpmpMapping, WhatAnybodyCanSayMakesAllDoubtfulOnceInTenMinutes) {
    const auto longAgo = std::filesystem::file_time_type::clock::now() - std::chrono::hours(9000);
    tavo::NatpmpMapper mapper;
    Pass(mapper, true);
    mGateway.TakeAsked();
    for (const auto& [nSeconds, szLife, blDoubt] :
         {std::tuple(5, "1", true), {5, "2", false}, {590, "3", false}, {5, "4", true}, {5, "5", false}}) {
        After(nSeconds);
        std::filesystem::last_write_time(kNatpmpMade, longAgo);
        SayToAll("239.255.255.250", kSsdpPort,
                 std::string("NOTIFY * HTTP/1.1\r\nNTS: ssdp:alive\r\nUSN: u\r\nBOOTID.UPNP.ORG: ") + szLife);
        EXPECT_TRUE(mapper.OnWake()) << szLife;
        Pass(mapper);
        EXPECT_EQ(mGateway.TakeAsked(), blDoubt ? kAsked : Lines()) << szLife;
        EXPECT_EQ(std::filesystem::last_write_time(kNatpmpMade) != longAgo, blDoubt) << szLife;
    }
    EXPECT_FALSE(mapper.OnWake());
}

TEST_F(NatpmpMapping, AnotherPortIsGivenBackAndNotAskedForUntilSomebodyWantsIt) {
    mGateway.mNBeside = 1;
    tavo::NatpmpMapper mapper;
    for (const bool blRequested : {true, false, true}) {
        Pass(mapper, blRequested);
        EXPECT_EQ(mGateway.TakeAsked(), blRequested ? (Lines{kAsked[0], "8080 ends"}) : Lines());
        EXPECT_EQ(Result(), "80/tcp (the router offered 81)");
        EXPECT_EQ(Read(kNatpmpMade), "") << "nothing is left of it";
    }
    mGateway.mNBeside = 0;
    Pass(mapper, true);
    EXPECT_EQ(mGateway.TakeAsked(), kAsked);
    EXPECT_EQ(Result(), "");
}

// The gateway knows its clients by their addresses.
TEST_F(NatpmpMapping, WhatLedToAFormerAddressIsTakenAwayFromThereOrWaitedFor) {
    for (const bool blHas : {true, false}) {
        MakeEmpty({"/var/lib/tavo"});
        gSzBox = kBox;
        tavo::NatpmpMapper mapper;
        Pass(mapper, true);
        EXPECT_EQ(mGateway.TakeAsked(), kAsked);
        gSzBox = kNewBox;
        if (!blHas) {
            ASSERT_EQ(TLIBCSystem((std::string("ip address del dev lo ") + kBox + "/32").c_str()), 0);
        }
        Pass(mapper);
        EXPECT_EQ(mGateway.TakeAsked(), blHas ? (Lines{std::string("8080 ends by ") + kBox, kAsked[0]}) : Lines());
        EXPECT_EQ(Result(), blHas ? "" : "80/tcp (the router keeps it for this box's former address 192.168.78.5)");
    }
}

// Leases run by the clock of the boot, as the router's do.
TEST_F(NatpmpMapping, AClockThatIsSetChangesNothing) {
    // With both rules or the first one alone.
    const Lines both{kAsked[0], "8081 at 81 for 3600"};
    const std::tuple<int, bool, bool, Lines> rgCases[] = {{0, true, true, both},
                                                          {7200, true, false, {}},
                                                          {0, true, false, {}},
                                                          {-7200, true, false, {}},
                                                          {7200, true, true, both},
                                                          {0, true, false, {}},
                                                          {0, false, true, {"8081 ends", kAsked[0]}},
                                                          {7200, false, false, {}}};
    tavo::NatpmpMapper mapper;
    for (const auto& [nAhead, blBoth, blRequested, rgszAsked] : rgCases) {
        After(10);
        gNClockAhead = nAhead;
        Rules rgRules{{"80", "8080"}, {"81", "8081"}};
        rgRules.resize(blBoth ? 2 : 1);
        SetRules(rgRules);
        Pass(mapper, blRequested);
        EXPECT_EQ(mGateway.TakeAsked(), rgszAsked) << nAhead << blRequested;
        EXPECT_EQ(Result(), "");
    }
    gNClockAhead = 0;
    Switch(false);
    Pass(mapper, true);
    EXPECT_EQ(mGateway.TakeAsked(), Lines{"8080 ends"});
    EXPECT_EQ(Read(kNatpmpMade), "");
}

// A router with one or more lines, each a service with a table.
class UpnpRouter {
public:
    struct Line {
        std::string szPath;
        std::string szStatus = "Connected";
        std::map<std::string, std::string> mapTable = {};  // by the router's port what an answer says of it
    };
    explicit UpnpRouter(const Lines& rgszPaths) {
        for (const std::string& szPath : rgszPaths) {
            mRgLines.push_back({szPath});
        }
        EXPECT_EQ(listen(mFd.Get(), 8), 0);
        mSzPlace = std::string("http://") + kGateway + ":" + std::to_string(PortOf(mFd)) + "/root.xml";
        mThread = std::thread([this] { Serve(); });
    }
    ~UpnpRouter() {
        mBlEnd = true;
        mThread.join();
    }
    const std::string& Place() const { return mSzPlace; }
    void SetStatus(size_t nLine, const char* szStatus) {
        const std::lock_guard guard(mMutex);
        mRgLines[nLine].szStatus = szStatus;
    }
    void Clear() {
        const std::lock_guard guard(mMutex);
        mRgLines[0].mapTable.clear();
    }
    // What each line has, "80 81,443".
    std::string Ports() {
        const std::lock_guard guard(mMutex);
        std::string szPorts;
        for (const Line& line : mRgLines) {
            szPorts += &line == &mRgLines.front() ? "" : ",";
            for (const auto& [szPort, szEntry] : line.mapTable) {
                szPorts += (szPorts.empty() || szPorts.back() == ',' ? "" : " ") + szPort;
            }
        }
        return szPorts;
    }
    // How often it was asked for what it does not do: a lease, and a range.
    std::pair<int, int> TakeInVain() { return {mNLeases.exchange(0), mNRanges.exchange(0)}; }

private:
    void Serve() {
        for (pollfd waiting = {mFd.Get(), POLLIN, 0}; !mBlEnd;) {
            if (poll(&waiting, 1, 10) <= 0) {
                continue;
            }
            const tavo::Descriptor fd(accept(mFd.Get(), nullptr, nullptr));
            tavo::BoundedSocket bounded(fd.Get(), -1);
            tavo::HttpRequest request;
            if (request.ReadHead(bounded) == tavo::HttpFault::kNone) {
                request.ReadBody(bounded);
                const std::lock_guard guard(mMutex);
                const auto [nStatus, szXml] = Answer(request);
                bounded.Write("HTTP/1.1 " + std::to_string(nStatus) + " x\r\nConnection: close\r\nContent-Length: " +
                              std::to_string(szXml.size()) + "\r\n\r\n" + szXml);
                bounded.Finish();
            }
        }
    }
    static std::string Said(const std::string& szText) {
        return "<Envelope><Body><Answer>" + szText + "</Answer></Body></Envelope>";
    }
    static std::pair<int, std::string> Fault(int nCode) {
        return {500, Said("<Fault><errorCode>" + std::to_string(nCode) + "</errorCode></Fault>")};
    }
    std::pair<int, std::string> Answer(const tavo::HttpRequest& request) {
        if (request.Method() == "GET") {
            std::string szXml = "<root>";
            for (const Line& line : mRgLines) {
                szXml +=
                    "<service><serviceType>urn:schemas-upnp-org:service:WANIPConnection:2</serviceType><controlURL>" +
                    line.szPath + "</controlURL></service>";
            }
            return {200, szXml + "</root>"};
        }
        const auto line = std::find_if(mRgLines.begin(), mRgLines.end(),
                                       [&](const Line& one) { return one.szPath == request.Path(); });
        return line == mRgLines.end() ? Fault(401) : Do(*line, request.Body());
    }
    std::pair<int, std::string> Do(Line& line, const std::string& szBody) {
        const auto fnIs = [&](const std::string& szAction) { return szBody.find(":" + szAction + " ") != szBody.npos; };
        const auto fnValue = [&](const std::string& szName) {
            const size_t nAt = szBody.find("<" + szName + ">") + szName.size() + 2;
            return szBody.substr(nAt, szBody.find('<', nAt) - nAt);
        };
        const std::string szPort = fnValue("NewExternalPort");
        if (fnIs("GetStatusInfo")) {
            return {200, Said("<NewConnectionStatus>" + line.szStatus + "</NewConnectionStatus>")};
        }
        if (fnIs("GetExternalIPAddress")) {
            return {200, Said("<NewExternalIPAddress>198.41.0.4</NewExternalIPAddress>")};
        }
        if (fnIs("GetListOfPortMappings")) {
            ++mNRanges;
            return Fault(401);
        }
        if (fnIs("GetGenericPortMappingEntry")) {
            const auto nIndex = std::stol(fnValue("NewPortMappingIndex"));
            return nIndex < std::ssize(line.mapTable)
                       ? std::pair(200, Said(std::next(line.mapTable.begin(), nIndex)->second))
                       : Fault(713);
        }
        if (fnIs("AddPortMapping")) {
            if (fnValue("NewLeaseDuration") != "0") {
                ++mNLeases;
                return Fault(725);
            }
            const size_t nFrom = szBody.find("<NewRemoteHost>");
            line.mapTable[szPort] = szBody.substr(nFrom, szBody.find("</u:") - nFrom);
            return {200, Said("")};
        }
        const auto it = line.mapTable.find(szPort);
        if (it == line.mapTable.end()) {
            return Fault(714);
        }
        const std::string szEntry = it->second;
        if (fnIs("DeletePortMapping")) {
            line.mapTable.erase(it);
        }
        return {200, Said(szEntry)};
    }

    tavo::Descriptor mFd = SocketAt(kGateway, 0, SOCK_STREAM);
    std::string mSzPlace;
    std::mutex mMutex;
    std::vector<Line> mRgLines;
    std::atomic<int> mNLeases = 0;
    std::atomic<int> mNRanges = 0;
    std::atomic<bool> mBlEnd = false;
    std::thread mThread;
};

class UpnpMapping : public MapperTest {
protected:
    UpnpMapping() : MapperTest("runupnpportmapping") {}
    static std::string Result() { return Read(tavo::kUpnpNames.szResultFile); }
};

TEST_F(UpnpMapping, WhatARouterCannotDoIsRememberedOfItAlone) {
    const auto fnFront = [](const std::string& szHardware) {
        return TLIBCSystem((std::string("ip neigh replace ") + kGateway + " dev v0 lladdr " + szHardware).c_str());
    };
    ASSERT_EQ(TLIBCSystem("ip link add v0 type veth peer name v1"), 0);
    ASSERT_EQ(TLIBCSystem("ip link set v0 up"), 0);
    SetRules({{"5000-5003", "5000-5003"}});
    UpnpRouter router({"/1"});
    tavo::KeepRouter(kGateway, {{router.Place(), ""}});
    const std::tuple<const char*, const char*, int> rgCases[] = {{"new", "00:11:22:aa:bb:01", 1},
                                                                 {"the same", "00:11:22:aa:bb:01", 0},
                                                                 {"another one", "00:11:22:aa:bb:02", 1},
                                                                 {"still there", "00:11:22:aa:bb:02", 0},
                                                                 {"the first again", "00:11:22:aa:bb:01", 1}};
    for (const auto& [szWhat, szHardware, nInVain] : rgCases) {
        ASSERT_EQ(fnFront(szHardware), 0);
        router.Clear();
        tavo::UpnpMapper mapper;  // as a start of the box has it
        Pass(mapper, true);
        EXPECT_EQ(router.TakeInVain(), std::pair(nInVain, nInVain)) << szWhat;
        EXPECT_EQ(router.Ports(), "5000 5001 5002 5003") << szWhat << Result();
    }
    EXPECT_EQ(TLIBCSystem("ip link del v0"), 0);
}

TEST_F(UpnpMapping, WhatIsMappedGoesOverToTheLineThatIsUp) {
    SetRules({{"80", "8080"}});
    UpnpRouter router({"/1", "/2"});
    tavo::KeepRouter(kGateway, {{router.Place(), ""}});
    tavo::UpnpMapper mapper;
    Pass(mapper, true);
    EXPECT_EQ(router.Ports(), "80,");
    router.SetStatus(0, "Disconnected");
    Pass(mapper);
    EXPECT_EQ(router.Ports(), ",80");
    EXPECT_EQ(Result(), "80/tcp=1\n");
    router.SetStatus(0, "Connected");
    Pass(mapper);
    EXPECT_EQ(router.Ports(), ",80") << "the one that is in use stays for as long as it is up";
}

TEST_F(UpnpMapping, ARouterThatAnswersLateIsFoundByThat) {
    SetRules({{"80", "8080"}});
    UpnpRouter router({"/1"});
    const tavo::Descriptor fdSearched = SocketAt(kGateway, kSsdpPort);
    tavo::UpnpMapper mapper;
    mapper.Run(true, [] { return ++gNClockJumped < 0; });
    EXPECT_EQ(Result(), "80/tcp=noigd\n");
    char szQuestion[1000];
    sockaddr_in from = {};
    ASSERT_GT(Receive(fdSearched.Get(), szQuestion, from, MSG_DONTWAIT), 0);
    EXPECT_FALSE(mapper.OnWake());
    Send(fdSearched.Get(), "HTTP/1.1 200 OK\r\nLOCATION: " + router.Place() + "\r\n\r\n", from);
    const auto rgFds = mapper.WakeFds();
    EXPECT_TRUE(std::any_of(rgFds.begin(), rgFds.end(), [](int fd) {
        pollfd waiting = {fd, POLLIN, 0};
        return poll(&waiting, 1, 0) > 0;
    }));
    EXPECT_TRUE(mapper.OnWake());
    Pass(mapper);
    EXPECT_EQ(Result(), "80/tcp=1\n");
    EXPECT_EQ(router.Ports(), "80");
}

}  // namespace
