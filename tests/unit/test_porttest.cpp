// The port tester: verdicts put together, answers of a checker that is none, and the checker's own bookkeeping.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "porttest/RuleVerdict.h"
#include "programs/tavoportcheckd/Limits.h"
#include "programs/tavoportcheckd/Prober.h"
#include "tavo/porttest.h"
#include "webserver.h"
#include "wire/portcheck/Checker.h"
#include "world.h"

namespace {

constexpr char kMarker[] = "/tmp/pfStatusRule";

TEST(RuleVerdict, TheWorstPortDecidesAndEveryPortIsNamed) {
    constexpr int D = TAVO_PORT_DISABLED, U = TAVO_PORT_UNKNOWN, O = TAVO_PORT_OPEN, R = TAVO_PORT_REFUSED,
                  T = TAVO_PORT_TIMEOUT, N = TAVO_PORT_NOLISTEN;
    const std::tuple<std::vector<std::pair<int, const char*>>, size_t, int, const char*> rgCases[] = {
        {{}, 0, U, ""},
        {{}, 2, U, "2 more ports: not tested"},
        {{{O, "o"}}, 0, O, "1: o"},
        {{{O, "o"}, {O, "o"}}, 0, O, "1, 2: o"},
        {{{O, "o"}}, 5, U, "1: o; 5 more ports: not tested"},
        {{{R, "r"}}, 5, R, "1: r; 5 more ports: not tested"},
        {{{O, "o"}, {U, "u"}}, 0, U, "2: u; 1: o"},
        {{{U, "u"}, {N, "n"}}, 0, N, "2: n; 1: u"},
        {{{N, "n"}, {R, "r"}, {O, "o"}}, 0, R, "2: r; 1: n; 3: o"},
        {{{R, "r"}, {T, "t"}}, 0, T, "2: t; 1: r"},
        {{{D, "d"}, {O, "o"}}, 0, O, "2: o; 1: d"},
        {{{R, "b"}, {R, "a"}, {R, "b"}}, 0, R, "2: a; 1, 3: b"},
        {std::vector<std::pair<int, const char*>>(9, {O, "o"}), 0, O, "1, 2, 3, 4, 5, 6 and 3 more: o"}};
    for (const auto& [rgPorts, nLeftOut, enMerged, szText] : rgCases) {
        std::vector<tavo::NamedVerdict> rgNamed;
        for (const auto& [enStatus, szReason] : rgPorts) {
            rgNamed.push_back({std::to_string(rgNamed.size() + 1), {enStatus, szReason}});
        }
        const tavo::PortVerdict merged = tavo::MergeVerdicts(rgNamed, nLeftOut);
        EXPECT_EQ(merged.enStatus, enMerged) << szText;
        EXPECT_EQ(merged.szReason, szText);
    }
}

TEST(Checker, OnlyAWholeAndFittingAnswerIsOne) {
    const std::vector<tavo::CheckedPort> rgPorts = {{true, 80}, {false, 81}};
    const std::string szTcp = R"({"protocol":"tcp","port":80,"state":"open","answered":false,"source":4711})";
    const std::string szUdp = R"({"protocol":"udp","port":81,"state":"timeout","answered":false,"source":0})";
    const auto fnAnswer = [](const std::string& szResults, const char* szVersion = "1",
                             const char* szAddress = "\"203.0.113.2\"") {
        return std::string("{\"version\":") + szVersion + ",\"address\":" + szAddress + ",\"results\":" + szResults +
               "}";
    };
    const auto fnWith = [&](const std::string& szOld, const std::string& szNew) {
        std::string szChanged = szTcp;
        szChanged.replace(szChanged.find(szOld), szOld.size(), szNew);
        return fnAnswer("[" + szChanged + "," + szUdp + "]");
    };
    const std::string szGood = fnAnswer("[" + szTcp + "," + szUdp + "]");
    const tavo::CheckerAnswer good = tavo::ReadCheckerAnswer(szGood, rgPorts);
    ASSERT_EQ(good.rgFindings.size(), 2U) << good.szReason;
    EXPECT_EQ(good.rgFindings[0].enState, tavo::PortState::kOpen);
    EXPECT_EQ(good.rgFindings[0].nSource, 4711);
    EXPECT_EQ(good.rgFindings[1].enState, tavo::PortState::kTimeout);

    const std::string szBoth = "[" + szTcp + "," + szUdp + "]";
    const std::string rgBad[] = {"",
                                 "null",
                                 "[]",
                                 "{}",
                                 "<html/>",
                                 szGood + "x",
                                 szGood.substr(0, szGood.size() - 1),
                                 std::string(100000, '['),
                                 "{\"a\":" + std::string(100000, '['),
                                 "{\"version\":1," + szGood.substr(1),
                                 fnAnswer(szBoth, "2"),
                                 fnAnswer(szBoth, "\"1\""),
                                 fnAnswer(szBoth, "1e99"),
                                 fnAnswer(szBoth, "1", "\"2001:db8::1\""),
                                 fnAnswer(szBoth, "1", "null"),
                                 fnAnswer(szBoth, "1", "\"1.2.3\""),
                                 fnAnswer("{}"),
                                 fnAnswer("[]"),
                                 fnAnswer("[" + szTcp + "]"),
                                 fnAnswer("[" + szUdp + "," + szTcp + "]"),
                                 fnAnswer("[" + szBoth + "," + szUdp + "]"),
                                 fnAnswer("[null,null]"),
                                 fnAnswer("[1,2]"),
                                 fnWith("80", "81"),
                                 fnWith("80", "80.5"),
                                 fnWith("80", "\"80\""),
                                 fnWith("80", "65616"),
                                 fnWith("tcp", "udp"),
                                 fnWith("\"open\"", "\"OPEN\""),
                                 fnWith("\"open\"", "\"\""),
                                 fnWith("\"open\"", "0"),
                                 fnWith("\"open\"", "{}"),
                                 fnWith("false", "0"),
                                 fnWith("4711", "-1"),
                                 fnWith("4711", "65536"),
                                 fnWith("4711", "99999999999999999999")};
    for (const std::string& szBody : rgBad) {
        const tavo::CheckerAnswer answer = tavo::ReadCheckerAnswer(szBody, rgPorts);
        EXPECT_TRUE(answer.rgFindings.empty() && !answer.szReason.empty()) << szBody.substr(0, 200);
    }
}

TEST(Checker, SettingsThatMakeNoSenseAreTheDefaults) {
    const std::tuple<const char*, size_t, size_t> rgCases[] = {
        {"", 64, 256},  {"1", 1, 1},     {"1024", 1024, 1024}, {"1025", 1024, 1024},
        {"0", 64, 256}, {"-1", 64, 256}, {"7x", 64, 256},      {"x", 64, 256}};
    for (const auto& [szNumber, nPerRequest, nMost] : rgCases) {
        Write("/etc/tavo/platform.conf", std::string("[portcheck]\nurl=http://h\ntoken=t\nports_per_request=\"") +
                                             szNumber + "\"\nmax_ports=\"" + szNumber + "\"\n");
        const tavo::CheckerSettings settings = tavo::ReadCheckerSettings();
        EXPECT_EQ(std::pair(settings.nPortsPerRequest, settings.nMaxPorts), std::pair(nPerRequest, nMost)) << szNumber;
        EXPECT_EQ(settings.szUrl + settings.szToken, "http://ht");
    }
    std::filesystem::remove("/etc/tavo/platform.conf");
    const std::string szNonce = tavo::MakeNonce();
    EXPECT_TRUE(szNonce.size() == 32 && szNonce.find_first_not_of("0123456789abcdef") == szNonce.npos) << szNonce;
    EXPECT_NE(szNonce, tavo::MakeNonce());
}

TEST(Checker, IsAskedAndItsAnswerReadOrTheReasonGiven) {
    const std::string szBody = R"({"version":1,"address":"203.0.113.2","results":[)"
                               R"({"protocol":"tcp","port":80,"state":"open","answered":true,"source":65535}]})";
    const auto fnAnswer = [&](int nCode) {
        return "HTTP/1.1 " + std::to_string(nCode) + " x\r\nContent-Length: " + std::to_string(szBody.size()) +
               "\r\n\r\n" + szBody;
    };
    const std::tuple<std::string, const char*, int, const char*> rgCases[] = {
        {fnAnswer(200), "t", 1, ""},
        {fnAnswer(401), "t", 0, "does not accept the token"},
        {fnAnswer(403), "t", 0, "does not accept the token"},
        {fnAnswer(429), "t", 0, "is busy"},
        {fnAnswer(503), "t", 0, "is busy"},
        {fnAnswer(500), "t", 0, "(HTTP 500)"},
        {fnAnswer(201), "t", 0, "(HTTP 201)"},
        {"HTTP/1.1 302 x\r\nLocation: http://127.0.0.1/\r\nContent-Length: 0\r\n\r\n", "t", 0, "(HTTP 302)"},
        {"hello\r\n", "t", 0, "did not answer as one"},
        {"", "t", 0, "did not answer in time"},
        {"", "t\n", 0, "url or token cannot be used"},
        {"", "t x", 0, "url or token cannot be used"}};
    for (const auto& [szAnswer, szToken, nFindings, szReason] : rgCases) {
        WebServer server(szAnswer);
        tavo::Checker checker({"http://127.0.0.1:" + std::to_string(server.Port()) + "/base/", szToken, 1, 1});
        const auto start = std::chrono::steady_clock::now();
        const tavo::CheckerAnswer answer = checker.Ask({{true, 80, true}}, "p", "a", 400);
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
        EXPECT_EQ(answer.rgFindings.size(), static_cast<size_t>(nFindings)) << szReason;
        EXPECT_TRUE(*szReason == '\0' ? answer.szReason.empty() : answer.szReason.find(szReason) != std::string::npos)
            << answer.szReason << " for " << szReason;
        if (nFindings > 0) {
            EXPECT_TRUE(answer.rgFindings[0].blAnswered && answer.rgFindings[0].nSource == 65535);
            for (const char* szPart : {"POST /base/v1/ports HTTP/1.1\r\n", "\r\nAuthorization: Bearer t\r\n"}) {
                EXPECT_NE(server.Request().find(szPart), std::string::npos) << server.Request();
            }
        } else if (std::string(szToken) != "t") {
            tavo::HttpClient(300).Get({"127.0.0.1", server.Port(), "/"});  // nobody else has asked it
        }
    }
    EXPECT_NE(tavo::Checker({"ftp://h", "t", 1, 1}).Ask({}, "p", "a", 400).szReason, "");
    EXPECT_EQ(tavo::Checker({"http://127.0.0.1:1", "t", 1, 1}).Ask({}, "p", "a", 400).szReason,
              "the port checker cannot be reached by IPv4");
}

// On loopback: who answers, who only listens, and nobody.
TEST(Prober, SaysOfEachPortWhatCameBack) {
    struct Listener {
        explicit Listener(int nKind) : fd(SocketAt("127.0.0.1", 0, nKind)), nPort(PortOf(fd)) { listen(fd.Get(), 1); }
        // One challenge, by whoever sends it, on a socket of its own or on this one.
        void Answer(int fdHere) const {
            char szText[64] = {};
            sockaddr_in peer = {};
            Receive(fdHere, std::span(szText).first(63), peer);
            EXPECT_EQ(szText, "ask:" + std::to_string(nPort) + "\n");
            Send(fdHere, "answer:" + std::to_string(nPort) + "\n", peer);
        }
        tavo::Descriptor fd;
        uint16_t nPort;
    };
    const Listener tcp(SOCK_STREAM), quiet(SOCK_STREAM), udp(SOCK_DGRAM), mute(SOCK_DGRAM);
    std::thread answers([&] {
        udp.Answer(udp.fd.Get());
        tcp.Answer(tavo::Descriptor(accept(tcp.fd.Get(), nullptr, nullptr)).Get());
    });
    const auto fnProbe = [](const std::vector<tavo::CheckedPort>& rgPorts, int fdStop) {
        const auto result = tavo::ProbePorts(*tavo::Address::Parse("127.0.0.1"), rgPorts, "ask", "answer", fdStop);
        std::string szFound;
        for (size_t i = 0; i < result.rgFindings.size(); ++i) {
            const tavo::PortFinding& finding = result.rgFindings[i];
            szFound += tavo::kPortStateWords[static_cast<size_t>(finding.enState)];
            szFound += std::string(finding.blAnswered ? " answered" : "") + (finding.nSource != 0 ? " from" : "") +
                       (result.rgHeld[i].Get() >= 0 ? " held" : "") + "; ";
        }
        return szFound;
    };
    int rgStop[2] = {};
    ASSERT_EQ(pipe(rgStop), 0);
    const tavo::Descriptor fdStop(rgStop[0]);
    tavo::Descriptor fdStopper(rgStop[1]);
    EXPECT_EQ(fnProbe({{true, tcp.nPort, true}, {true, quiet.nPort}, {true, 1}, {false, udp.nPort}, {false, 1}},
                      fdStop.Get()),
              "open answered from held; open from held; refused from; open answered from; refused from; ");
    answers.join();
    fdStopper.Reset();
    EXPECT_EQ(fnProbe({{false, mute.nPort}}, fdStop.Get()), "untold from; ") << "there was no time";
}

TEST(PortTester, TheMarkerIsOursWhateverStoodThere) {
    Write("/tmp/victim", "precious");
    for (const auto& fnPlant : std::vector<std::function<void()>>{
             [] {}, [] { std::filesystem::create_symlink("/tmp/victim", kMarker); },
             [] { std::filesystem::create_symlink("/nowhere/at/all", kMarker); }, [] { Write(kMarker, ""); }}) {
        unlink(kMarker);
        fnPlant();
        EXPECT_EQ(TavoPortConnTestInit(), 0);
        EXPECT_TRUE(std::filesystem::is_regular_file(std::filesystem::symlink_status(kMarker)));
    }
    EXPECT_EQ(Read("/tmp/victim"), "precious");
    unlink(kMarker);
    std::filesystem::create_directories(std::string(kMarker) + "/x");
    EXPECT_LT(TavoPortConnTestInit(), 0);
    std::filesystem::remove_all(kMarker);
}

TEST(PortTester, BadInputLeavesTheEntriesAsTheyAre) {
    TAVO_PORT_STATUS status = {"as it was", 77};
    EXPECT_LT(TavoPortConnTest(nullptr, 0, &status, 1), 0);
    EXPECT_LT(TavoPortConnTest(nullptr, 1, &status, -1), 0);
    EXPECT_LT(TavoPortConnTest(nullptr, 1, nullptr, 1), 0);
    EXPECT_EQ(TavoPortConnTest(nullptr, 1, nullptr, 0), 0);
    EXPECT_STREQ(status.szText, "as it was");
    EXPECT_EQ(TavoPortConnTest(nullptr, 1, &status, 1), 0);
    EXPECT_EQ(status.enStatus, TAVO_PORT_UNKNOWN);
}

TEST(Limits, OneAddressCannotUseUpWhatIsTheOthersAndTimeHeals) {
    const auto fnAddress = [](const std::string& szText) { return *tavo::Address::Parse(szText); };
    const auto fnServed = [](tavo::Limits& limits, const tavo::Address& address, tavo::Limits::Clock::time_point now) {
        int nServed = 0;
        while (nServed < 1000 && limits.Take(address, now)) {
            ++nServed;
        }
        return nServed;
    };
    tavo::Limits limits(3, 7);
    const tavo::Limits::Clock::time_point start = tavo::Limits::Clock::now();
    EXPECT_EQ(fnServed(limits, fnAddress("203.0.113.1"), start), 3);
    EXPECT_EQ(fnServed(limits, fnAddress("::ffff:203.0.113.1"), start), 0);
    EXPECT_EQ(fnServed(limits, fnAddress("2001:db8::1"), start), 3);
    EXPECT_EQ(fnServed(limits, fnAddress("2001:db8::ffff:1:2:3"), start), 0);
    EXPECT_EQ(fnServed(limits, fnAddress("2001:db8:0:1::1"), start), 1);  // all together: 7
    EXPECT_EQ(fnServed(limits, fnAddress("203.0.113.1"), start + std::chrono::seconds(21)), 1);
    EXPECT_EQ(fnServed(limits, fnAddress("203.0.113.1"), start + std::chrono::hours(9)), 3);

    tavo::Limits crowded(2, 100000);
    int nServed = 0;
    for (int i = 0; i < 5000; ++i) {
        nServed += crowded.Take(fnAddress("10.0." + std::to_string(i / 256) + "." + std::to_string(i % 256)), start);
    }
    EXPECT_EQ(nServed, 4096);  // whom it cannot remember it does not serve
    EXPECT_TRUE(crowded.Take(fnAddress("10.9.9.9"), start + std::chrono::minutes(1)));
}

}  // namespace
