// What is told to a user, and what is not: whole stories of passes, with the memory written and read between them.
#include <gtest/gtest.h>
#include <json/json.h>

#include <sstream>

#include "programs/common/Teller.h"
#include "programs/common/ToldFile.h"

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
}

TEST(Notices, ManyPortsWithOneFateAreToldOfInOneLine) {
    Pass before;
    Pass after;
    for (int i = 0; i < 60; ++i) {
        before.rgszPorts.push_back(std::to_string(8000 + i) + " open");
        after.rgszPorts.push_back(std::to_string(8000 + i) + " 728");
    }
    Story story;
    EXPECT_EQ(story.Tell(before), News{});
    const News rgNews = story.Tell(after);
    ASSERT_EQ(rgNews.size(), 1U);
    EXPECT_TRUE(rgNews[0].starts_with("port-lost: 8000/tcp (web), 8001/tcp (web), ")) << rgNews[0];
    EXPECT_LT(rgNews[0].size(), 700U);
    EXPECT_EQ(story.Tell(after), News{});
    EXPECT_EQ(story.Tell(before).size(), 1U);
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
