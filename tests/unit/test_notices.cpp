// What is told to a user, and what is not: whole stories of passes, with the memory written and read between them.
#include <gtest/gtest.h>
#include <json/json.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <sstream>

#include "programs/common/Teller.h"
#include "programs/common/ToldFile.h"
#include "world.h"

namespace {

using tavo::Outcome;
using tavo::PortState;
using tavo::RouterState;

constexpr time_t kStart = 1700000000;

// "80 open", "80 anew", "80 718 192.168.1.7 console", "80 unknown"; the rule is "web".
Outcome Port(const std::string& szText) {
    std::istringstream stream(szText);
    Outcome outcome;
    std::string szWord;
    tavo::Holder holder;
    stream >> outcome.nRouterPort >> szWord >> holder.szAddress >> holder.szDescription;
    outcome.szName = std::to_string(outcome.nRouterPort) + "/tcp";
    outcome.szProtocol = "TCP";
    outcome.szRule = "web";
    outcome.nBoxPort = outcome.nRouterPort;
    outcome.verdict.blAnew = szWord == "anew";
    const bool blOpen = szWord == "open" || szWord == "anew" || szWord == "moved";
    outcome.nBoxPort = szWord == "moved" ? 1 : outcome.nBoxPort;
    outcome.verdict.enState = blOpen                ? PortState::kOpen
                              : szWord == "unknown" ? PortState::kUnknown
                                                    : PortState::kRefused;
    outcome.verdict.szWord = blOpen ? "1" : szWord;
    if (!holder.szAddress.empty()) {
        outcome.verdict.holder = holder;
    }
    return outcome;
}

struct Pass {
    RouterState enRouter = RouterState::kOk;
    std::vector<std::string> rgszPorts = {};
    bool blRequested = false;
    std::string szGateway = "192.168.1.1";
    std::string szHardware = "00:00:00:00:00:01";
    std::string szOutside = "198.51.100.1";
    time_t nAfter = 120;
    bool blWithdrawn = false;  // by the daemon itself, before this pass
};

class Story {
public:
    // The events of a pass, each with its text.
    std::vector<std::string> Tell(const Pass& pass) {
        tavo::Published now{"upnpd", "UPnP"};
        now.nAt = mNNow += pass.nAfter;
        now.szGateway = pass.szGateway;
        now.szHardware = pass.szHardware;
        now.szOutside = pass.szOutside;
        now.enRouter = pass.enRouter;
        now.szRouterWhy = WhyOf(pass.enRouter, "UPnP");
        for (const std::string& szPort : pass.rgszPorts) {
            now.rgOutcomes.push_back(Port(szPort));
        }
        mTold = tavo::ParseTold(tavo::FormatTold(mTold));  // as over a restart
        mTold.blWithdrawn = mTold.blWithdrawn || pass.blWithdrawn;
        NoteSince(mTold, now);
        std::vector<std::string> rgszNews;
        for (const tavo::Notice& notice : Compare(mTold, now, pass.blRequested)) {
            rgszNews.push_back(HookFacts(notice, now).front().substr(sizeof("TAVO_EVENT=") - 1) + ": " + notice.szText);
        }
        mRgLast = now.rgOutcomes;
        return rgszNews;
    }

    tavo::OutcomeList mRgLast;

private:
    tavo::Told mTold;
    time_t mNNow = kStart;
};

using News = std::vector<std::string>;

TEST(Notices, ATroubleIsToldOnceAndItsEndOnce) {
    const std::string szTaken = "80 718 192.168.1.7 console";
    const std::string szWhy = "80/tcp (web): another device has this port on the router, 192.168.1.7 (console)";
    const std::string szSilent = "192.168.1.1: the router does not answer by UPnP";
    struct Step {
        Pass pass;
        News rgNews;
    };
    const std::pair<const char*, std::vector<Step>> rgStories[] = {
        {"another device takes a port and gives it back",
         {{{.rgszPorts = {"80 open"}, .blRequested = true}, {}},
          {{.rgszPorts = {szTaken}}, {"port-lost: " + szWhy}},
          {{.rgszPorts = {szTaken}}, {}},
          {{.rgszPorts = {szTaken}, .blRequested = true}, {}},
          {{.rgszPorts = {"80 anew"}}, {"port-back: 80/tcp (web)"}},
          {{.rgszPorts = {"80 open"}}, {}}}},
        {"what a save has told is not told again, its end is",
         {{{.rgszPorts = {szTaken}, .blRequested = true}, {}},
          {{.rgszPorts = {szTaken}}, {}},
          {{.rgszPorts = {"80 anew"}}, {"port-back: 80/tcp (web)"}}}},
        {"a port that never was open is refused and not lost",
         {{{.enRouter = RouterState::kSilent, .rgszPorts = {"80 unknown"}, .blRequested = true}, {}},
          {{.rgszPorts = {szTaken}}, {"port-refused: " + szWhy}},
          {{.rgszPorts = {szTaken}}, {}}}},
        {"a router is gone, whatever is wrong with it, and restarts empty",
         {{{.rgszPorts = {"80 open"}, .blRequested = true}, {}},
          {{.enRouter = RouterState::kSilent, .rgszPorts = {"80 unknown"}}, {}},
          {{.enRouter = RouterState::kSilent, .rgszPorts = {"80 unknown"}}, {"router-gone: " + szSilent}},
          {{.enRouter = RouterState::kNoService, .rgszPorts = {"80 unknown"}}, {}},
          {{.enRouter = RouterState::kNoGateway, .rgszPorts = {"80 unknown"}, .szGateway = ""}, {}},
          {{.rgszPorts = {"80 anew"}}, {"router-back: 192.168.1.1 answers by UPnP", "renewed: 80/tcp (web)"}},
          {{.rgszPorts = {"80 open"}}, {}}}},
        {"a router that does not answer once is no news, one that lost a port in between is",
         {{{.rgszPorts = {"80 open"}}, {}},
          {{.enRouter = RouterState::kSilent, .rgszPorts = {"80 unknown"}}, {}},
          {{.enRouter = RouterState::kBusy, .rgszPorts = {"80 unknown"}}, {}},
          {{.rgszPorts = {"80 open"}}, {}},
          {{.rgszPorts = {"80 anew"}}, {"renewed: 80/tcp (web)"}}}},
        {"what a user or the daemon itself did is no news",
         {{{.rgszPorts = {"80 open", "81 open"}}, {}},
          {{.rgszPorts = {"80 anew", "81 open"}, .blRequested = true, .blWithdrawn = true}, {}},
          {{.rgszPorts = {"80 moved"}, .blRequested = true}, {}},
          {{.rgszPorts = {}, .blRequested = true}, {}},
          {{.rgszPorts = {"80 anew"}, .blRequested = true}, {}}}},
        {"the outside address",
         {{{.szOutside = ""}, {}},
          {{}, {}},
          {{.szOutside = ""}, {}},
          {{}, {}},
          {{.szOutside = "198.51.100.2"}, {"address-changed: 198.51.100.2, before 198.51.100.1"}},
          {{.szOutside = "198.51.100.2"}, {}}}},
        {"another router, by its address and by itself",
         {{{}, {}},
          {{.enRouter = RouterState::kNoService, .szGateway = "192.168.1.9"}, {}},
          {{.szGateway = "192.168.1.9", .szHardware = "00:00:00:00:00:02"},
           {"router-replaced: its address is 192.168.1.9, before 192.168.1.1"}},
          {{.szGateway = "192.168.1.9", .szHardware = ""}, {}},
          {{.szGateway = "192.168.1.9", .szHardware = "00:00:00:00:00:03"},
           {"router-replaced: another device answers at 192.168.1.9, with the hardware address 00:00:00:00:00:03, "
            "before 00:00:00:00:00:02"}}}}};
    for (const auto& [szStory, rgSteps] : rgStories) {
        Story story;
        for (size_t i = 0; i < rgSteps.size(); ++i) {
            EXPECT_EQ(story.Tell(rgSteps[i].pass), rgSteps[i].rgNews) << szStory << ", step " << i;
        }
    }
}

TEST(Notices, WhatChangesAllTheTimeIsToldAFewTimesAndItsOutcomeInTheEnd) {
    Story story;
    News rgAll;
    for (int i = 0; i < 25; ++i) {  // ten minutes short of an hour; it ends as lost
        const News rgNews = story.Tell({.rgszPorts = {i % 2 == 0 ? "80 open" : "80 728"}});
        rgAll.insert(rgAll.end(), rgNews.begin(), rgNews.end());
    }
    ASSERT_EQ(rgAll.size(), 4U);
    EXPECT_EQ(rgAll[3], "port-back: 80/tcp (web) (it changes often, and is not told again for a while)");
    EXPECT_EQ(story.Tell({.rgszPorts = {"80 728"}}), News{}) << "still too often";
    EXPECT_EQ(story.Tell({.rgszPorts = {"80 728"}, .nAfter = 3600}),
              News{"port-lost: 80/tcp (web): the router's table of ports is full"});
    Story other;
    size_t nTold = 0;
    for (int i = 0; i < 9; ++i) {
        nTold += other.Tell({.szOutside = i % 2 == 0 ? "198.51.100.1" : "198.51.100.2"}).size();
    }
    EXPECT_EQ(nTold, 4U) << "of an address alike";
}

// At the edges of the hour within which four are enough; a clock that was set back has told of nothing yet.
TEST(Notices, WhatHasBeenToldOftenIsToldAgainAfterAnHour) {
    for (const auto& [nAfter, nTold] : {std::pair<time_t, size_t>{3599, 0}, {3600, 1}, {-10, 1}}) {
        Story story;
        for (int i = 0; i < 5; ++i) {  // the first is what was asked for
            story.Tell({.rgszPorts = {i % 2 == 0 ? "80 open" : "80 728"}, .nAfter = i == 0 ? 120 : 0});
        }
        EXPECT_EQ(story.Tell({.rgszPorts = {"80 728"}, .nAfter = nAfter}).size(), nTold) << nAfter;
    }
}

TEST(Notices, ManyPortsWithOneFateAreToldOfInOneLine) {
    for (const auto& [nPorts, nLines, szEnd] :
         {std::tuple{8, 8U, "8007/tcp (web): the router's table of ports is full"},
          {9, 1U, ", 8008/tcp (web); the first: the router's table of ports is full"},
          {33, 1U, ", 8032/tcp (web); the first: the router's table of ports is full"},  // 33 take 526 bytes
          {34, 1U, ", 8032/tcp (web) and 1 more; the first: the router's table of ports is full"}}) {
        Pass before;
        Pass after;
        for (int i = 0; i < nPorts; ++i) {
            before.rgszPorts.push_back(std::to_string(8000 + i) + " open");
            after.rgszPorts.push_back(std::to_string(8000 + i) + " 728");
        }
        Story story;
        EXPECT_EQ(story.Tell(before), News{});
        const News rgNews = story.Tell(after);
        ASSERT_EQ(rgNews.size(), nLines);
        EXPECT_TRUE(rgNews[0].starts_with("port-lost: 8000/tcp (web)")) << rgNews[0];
        EXPECT_TRUE(rgNews.back().ends_with(szEnd)) << rgNews.back();
        EXPECT_EQ(story.Tell(after), News{});
        EXPECT_EQ(story.Tell(before).size(), nLines);
    }
}

TEST(Notices, SinceSaysWhenAThingBecameAsItIs) {
    Story story;
    const std::pair<const char*, time_t> rgPasses[] = {
        {"80 open", 120}, {"80 open", 120}, {"80 718 1.1.1.1 x", 360}, {"80 718 1.1.1.2 y", 360}, {"80 open", 600}};
    for (const auto& [szPort, nSince] : rgPasses) {
        story.Tell({.rgszPorts = {szPort}});
        EXPECT_EQ(story.mRgLast[0].nSince, kStart + nSince) << szPort;
    }
}

TEST(Notices, EachOutcomeHasItsReason) {
    const std::tuple<const char*, PortState, std::string> rgCases[] = {
        {"1", PortState::kOpen, ""},
        {"728", PortState::kRefused, "the router's table of ports is full"},
        {"999", PortState::kRefused, "the router refuses it with error 999"},
        {"9x", PortState::kRefused, "9x"},
        {"", PortState::kRefused, ""}};
    for (const auto& [szWord, enState, szWhy] : rgCases) {
        tavo::Verdict verdict{enState, szWord};
        EXPECT_EQ(tavo::WhyOf(verdict), szWhy) << szWord;
        verdict.szWhy = "as it was";
        EXPECT_EQ(tavo::WhyOf(verdict), "as it was");
    }
    EXPECT_EQ(WhyOf(tavo::RouterState::kUnreachable, "UPnP"), "nobody answers at the router's address");
    tavo::RouterMapping mapping{"UDP", 65000, 1, "", "", 0, true};
    EXPECT_EQ(tavo::MappingName(mapping), "65000/udp");
    mapping.nMore = 535;
    mapping.szProtocol = "BOTH";
    EXPECT_EQ(tavo::MappingName(mapping), "65000-65535/both");
}

TEST(Notices, AHostileTextStaysAText) {
    const std::pair<std::string, std::string> rgTexts[] = {
        {"a\n\x1b[31m\x7f\"'$(x)\\", "a[31m\"'$(x)\\"},
        {"gr\xc3\xbc\xc3\x9f \xe2\x82\xac \xf0\x9f\x8f\xa0", "gr\xc3\xbc\xc3\x9f \xe2\x82\xac \xf0\x9f\x8f\xa0"},
        {"\xff\xc3+\xe2\x82", "??+??"},
        {"\xc0\xaf\xed\xa0\x80\xc2\x9b"
         "1m",
         "??????"
         "?1m"},
        {std::string(63, 'x') + "\xc3\xbc", std::string(63, 'x')},
        {std::string("a\0b", 3), "ab"},
        {"\xc2\x9f\xc2\xa0\xed\x9f\xbf\xf4\x8f\xbf\xbf", "??\xc2\xa0\xed\x9f\xbf\xf4\x8f\xbf\xbf"}};
    for (const auto& [szRaw, szHarmless] : rgTexts) {
        EXPECT_EQ(tavo::HarmlessText(szRaw, 64), szHarmless);
    }
    tavo::Published state{"upnpd", "UPnP"};
    Outcome outcome = Port("80 718");
    outcome.verdict.holder = tavo::Holder{"192.168.1.7", "\"},{\"state\":\"open\"} \\"};
    state.rgOutcomes = {outcome};
    Json::Value js;
    std::istringstream(tavo::ToJson(state)) >> js;
    EXPECT_EQ(js["rules"].size(), 1U);
    EXPECT_EQ(js["rules"][0]["holder"]["description"].asString(), outcome.verdict.holder->szDescription);
    EXPECT_TRUE(js["router"].isNull());
}

// Numbers and words that no daemon can have written, in the place of those that are there.
TEST(Notices, TheMemoryIsReadAsItWasWrittenAndWithinItsBounds) {
    const std::string szWhole =
        "[router]\ngateway=\"192.168.1.1\"\nhardware=\"00:00:00:00:00:01\"\noutside=\"198.51.100.1\"\n"
        "state=\"silent\"\nsince=\"1700000000\"\nfailing=\"1\"\ngone=\"yes\"\nwithdrawn=\"yes\"\n\n"
        "[port 80/tcp]\nbox_port=\"8080\"\nstate=\"waiting\"\nword=\"718\"\nsince=\"1700000001\"\ntold=\"open\"\n\n"
        "[told 80/tcp]\ntimes=\"1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16\"\n\n";
    using Change = std::tuple<const char*, const char*, const char*>;
    const Change rgChanges[] = {{"", "", ""},
                                {"=\"1\"", "=\"1001\"", "=\"1000\""},
                                {"=\"1\"", "=\"-1\"", "=\"0\""},
                                {"8080", "65536", "65535"},
                                {"8080", "-1", "0"},
                                {" 16", " 16 17", " 16"},
                                {" 16", " x 17", ""},
                                {"waiting", "x", "unknown"}};
    for (const auto& [szOld, szOdd, szRead] : rgChanges) {
        std::string szChanged = szWhole;
        std::string szWanted = szWhole;
        szChanged.replace(szChanged.find(szOld), strlen(szOld), szOdd);
        szWanted.replace(szWanted.find(szOld), strlen(szOld), szRead);
        EXPECT_EQ(FormatTold(tavo::ParseTold(szChanged)), szWanted) << szOdd;
    }
}

TEST(Teller, TellsTheLogsOfEachChangeAsTroubleOrNot) {
    constexpr char kEvents[] = "/var/log/tavo/event.log";
    std::string szLevels;
    for (int i = 0; i <= static_cast<int>(tavo::Change::kRenewed); ++i) {
        std::filesystem::remove(kEvents);
        gLog.clear();
        tavo::Teller().Tell({static_cast<tavo::Change>(i), "the text"}, {"upnpd", "UPnP"});
        const std::string szEvent = Read(kEvents);
        szLevels += szEvent.substr(szEvent.find(" 0x") - 4, 4) + " ";
        EXPECT_TRUE(gLog.size() == 1 && gLog[0].ends_with(": the text") && szEvent.ends_with(gLog[0] + "\n"))
            << szEvent;
    }
    EXPECT_EQ(szLevels, "ning ning info ning info info info info ");
    std::filesystem::remove_all("/var/log/tavo");
}

// What reaches the runner, and when there is none, one that has ended, or one that does not keep up.
TEST(HookQueue, PassesOnWhatFitsAndSaysWhatDoesNot) {
    static constexpr char kRunner[] = "/usr/tavo/bin/tavohook";
    const std::string szLost = "notice was not passed on to the hooks in /etc/tavo/hooks.d";
    const auto fnRunner = [](const char* szDoes) {
        WriteProgram(kRunner, std::string("echo $$ > /tmp/t/runner\n") + szDoes);
    };
    for (const char* szPath : {"/etc/tavo/hooks.d", "/tmp/t"}) {
        std::filesystem::remove_all(szPath);
    }
    fnRunner("exec cat >> /tmp/t/facts");
    gLog.clear();
    const std::string szMost(16384 - 3, 'x');
    {
        tavo::HookQueue queue;
        queue.Run({"A=0"});  // no hook, no runner
        Write("/etc/tavo/hooks.d/10-a", "");
        std::filesystem::create_directories("/tmp/t");
        queue.Run({"A=1", "B=2"});
        queue.Run({"A=" + szMost});
        EXPECT_EQ(gLog, std::vector<std::string>());
        queue.Run({"A=" + szMost + "x"});
        EXPECT_EQ(gLog, std::vector<std::string>{szLost});
        const std::string szFacts = std::string("A=1\0B=2\0A=", 10) + szMost + '\0';
        EXPECT_TRUE(SoonTrue([&] { return Read("/tmp/t/facts") == szFacts; }));
        kill(std::stoi(Read("/tmp/t/runner")), SIGKILL);
        usleep(100000);
        std::filesystem::remove("/tmp/t/facts");
        fnRunner("exec sleep 5");
        int nTaken = -1;
        for (gLog.clear(); gLog.empty(); ++nTaken) {
            queue.Run({"C=" + std::string(1000, 'x')});  // it never waits
        }
        EXPECT_LE(nTaken, 64) << "and keeps little";
        EXPECT_EQ(gLog, std::vector<std::string>{szLost});
    }
    std::filesystem::remove(kRunner);
    gLog.clear();
    tavo::HookQueue().Run({"A=1"});
    EXPECT_EQ(gLog, (std::vector<std::string>{"run /usr/tavo/bin/tavohook: No such file or directory", szLost}));
    std::filesystem::remove_all("/etc/tavo/hooks.d");
}

TEST(Notices, ADamagedMemoryIsNothingTold) {
    for (const char* szText :
         {"", "no section", "[router]\nfailing=\"-9999999999999999999\"\nstate=\"mad\"\n",
          "[port 80/tcp]\nbox_port=\"99999999\"\ntold=\"x\"\nstate=\"\"\n[told router]\ntimes=\"1 x\"\n"}) {
        tavo::Told told = tavo::ParseTold(szText);
        EXPECT_FALSE(told.blGone);
        EXPECT_EQ(told.enRouter, RouterState::kNotAsked);
        EXPECT_GE(told.nFailing, 0);
        for (const auto& [szName, port] : told.mapPorts) {
            EXPECT_EQ(port.enTold, tavo::Told::Word::kNothing);
        }
    }
}

}  // namespace
