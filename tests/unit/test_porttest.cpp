// The port tester: verdicts put together, answers of a checker that is none, and the checker's own bookkeeping.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "porttest/RuleVerdict.h"
#include "programs/tavoportcheckd/Limits.h"
#include "tavo/porttest.h"
#include "wire/portcheck/Checker.h"
#include "world.h"

namespace {

constexpr char kMarker[] = "/tmp/pfStatusRule";

TEST(RuleVerdict, TheWorstPortDecidesAndEveryPortIsNamed) {
    constexpr int D = TAVO_PORT_DISABLED, U = TAVO_PORT_UNKNOWN, O = TAVO_PORT_OPEN, R = TAVO_PORT_REFUSED,
                  T = TAVO_PORT_TIMEOUT, N = TAVO_PORT_NOLISTEN;
    struct Case {
        std::vector<std::pair<int, const char*>> rgPorts;
        size_t nLeftOut;
        int enStatus;
        const char* szText;
    };
    const Case rgCases[] = {
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
    for (const Case& check : rgCases) {
        std::vector<tavo::NamedVerdict> rgNamed;
        for (const auto& [enStatus, szReason] : check.rgPorts) {
            rgNamed.push_back({std::to_string(rgNamed.size() + 1), {enStatus, szReason}});
        }
        const tavo::PortVerdict merged = tavo::MergeVerdicts(rgNamed, check.nLeftOut);
        EXPECT_EQ(merged.enStatus, check.enStatus) << check.szText;
        EXPECT_EQ(merged.szReason, check.szText);
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
