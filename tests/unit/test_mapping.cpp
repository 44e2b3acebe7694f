// The mapping core and the test mappings against a router in memory.
#include <gtest/gtest.h>
#include <poll.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <optional>
#include <regex>
#include <set>
#include <tuple>

#include "ground/BootTimer.h"
#include "ground/Marks.h"
#include "ground/PortText.h"
#include "mapping/Carry.h"
#include "mapping/Keeper.h"
#include "mapping/Wanted.h"
#include "programs/common/IgdRouter.h"
#include "programs/common/MadeFile.h"
#include "programs/upnpd/TestMappings.h"
#include "world.h"

namespace {

using tavo::IgdReply;
using tavo::RouterMapping;
using tavo::RouterReply;

constexpr char kNet[] = "192.168.1.";
constexpr char kBox[] = "192.168.1.5";

RouterMapping Entry(uint16_t nPort, uint16_t nBoxPort, const char* szClient, const char* szText) {
    return {"TCP", nPort, nBoxPort, szClient, szText, 100, true};
}

// Mappings as one text: the port on the router, and where they differ "+more" (which has no lease), ">port of the
// box", "@host" and "=text".
std::vector<RouterMapping> Parse(const std::string& szMappings, const std::string& szClient = "") {
    static const std::regex kMapping(R"((\d+)(?:\+(\d+))?(?:>(\d+))?(?:@(\d+))?(?:=(\S+))?)");
    std::vector<RouterMapping> rgMappings;
    for (auto it = std::sregex_iterator(szMappings.begin(), szMappings.end(), kMapping); it != std::sregex_iterator();
         ++it) {
        const auto nOr = [&it](size_t nGroup, const std::string& szElse) {
            return static_cast<uint16_t>(std::stoi((*it)[nGroup].matched ? it->str(nGroup) : szElse));
        };
        RouterMapping mapping = Entry(nOr(1, ""), nOr(3, it->str(1)), szClient.c_str(), ("tavo:" + it->str(1)).c_str());
        mapping.nMore = nOr(2, "0");
        mapping.nLease = (*it)[2].matched ? 0 : mapping.nLease;
        mapping.szClient = (*it)[4].matched ? kNet + it->str(4) : szClient;
        mapping.szDescription = (*it)[5].matched ? it->str(5) : mapping.szDescription;
        rgMappings.push_back(mapping);
    }
    return rgMappings;
}

// And back, without the texts, from a router's table or from the record; the host is named where it is not the box.
template <typename Map>
std::string PlacesIn(const Map& mapEntries) {
    std::string szPlaces;
    for (const auto& [key, entry] : mapEntries) {
        szPlaces += (szPlaces.empty() ? "" : " ") + std::to_string(key.second) +
                    (entry.nMore == 0 ? "" : "+" + std::to_string(entry.nMore)) +
                    (entry.nBoxPort == key.second ? "" : ">" + std::to_string(entry.nBoxPort)) +
                    (entry.szClient == kBox ? "" : "@" + entry.szClient.substr(entry.szClient.rfind('.') + 1));
    }
    return szPlaces;
}

// A table in memory that answers as a UPnP router does. One that says no shows nothing.
class MemoryRouter : public tavo::Router {
public:
    explicit MemoryRouter(const std::string& szThere = "") {
        for (const RouterMapping& mapping : Parse(szThere, kBox)) {
            Put(mapping);
        }
    }
    tavo::Abilities What() const override { return {true, false, false, "718"}; }
    RouterReply List(std::vector<RouterMapping>& rgMappings) override {
        ++mNCalls;
        for (const auto& [key, mapping] : mMapTable) {
            if (!mBlListNothing && (mNListCode == tavo::kWireOk || mNListCode == tavo::kWireTooLong)) {
                rgMappings.push_back(mapping);
            }
        }
        return IgdReply(mNListCode);
    }
    RouterReply ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                          std::vector<RouterMapping>& rgMappings) override {
        ++mNCalls;
        mRgszRanges.push_back(szProtocol + " " + std::to_string(nFirst) + "-" + std::to_string(nLast));
        for (const auto& [key, mapping] : mMapTable) {
            if (mNRangeCode == tavo::kWireOk && key.second >= nFirst && key.second <= nLast && mNHidden >= 0 &&
                key.second != mNHidden) {
                rgMappings.push_back(mapping);
            }
        }
        return IgdReply(mNRangeCode);
    }
    RouterReply Get(const std::string& szProtocol, uint16_t nPort, RouterMapping& mapping) override {
        ++mNCalls;
        if (const auto reply = mFnGet ? mFnGet(nPort) : std::nullopt) {
            return *reply;
        }
        const auto it = mMapTable.find({szProtocol, nPort});
        if (mNGetCode != tavo::kWireOk || it == mMapTable.end()) {
            return IgdReply(mNGetCode != tavo::kWireOk ? mNGetCode : int{tavo::kIgdNoSuchEntry});
        }
        mapping = it->second;
        return {};
    }
    RouterReply Add(RouterMapping& mapping) override {
        ++mNCalls;
        if (const auto reply = mFnAdd ? mFnAdd(mapping) : std::nullopt) {
            return *reply;
        }
        if (mapping.nRouterPort == mNSwallowed || mNAddCode != tavo::kWireOk) {
            return IgdReply(mNAddCode);
        }
        Put(mapping).szDescription = mSzRewritten.empty() ? mapping.szDescription : mSzRewritten;
        return {};
    }
    RouterReply Remove(const RouterMapping& mapping) override {
        ++mNCalls;
        if (mNRemoveCode != tavo::kWireOk) {
            return IgdReply(mNRemoveCode);
        }
        const bool blThere =
            mBlKeepsRemoved ? mMapTable.contains(tavo::KeyOf(mapping)) : mMapTable.erase(tavo::KeyOf(mapping)) == 1;
        return IgdReply(blThere ? int{tavo::kWireOk} : int{tavo::kIgdNoSuchEntry});
    }

    RouterMapping& Put(const RouterMapping& mapping) { return mMapTable[tavo::KeyOf(mapping)] = mapping; }

    std::map<tavo::MappingKey, RouterMapping> mMapTable;
    std::function<std::optional<RouterReply>(RouterMapping&)> mFnAdd;  // these answer in the table's place, if they do
    std::function<std::optional<RouterReply>(uint16_t)> mFnGet;
    int mNListCode = tavo::kWireOk;
    bool mBlListNothing = false;  // with mNListCode
    int mNGetCode = tavo::kWireOk;
    int mNAddCode = tavo::kWireOk;
    std::string mSzRewritten;  // what every description becomes
    int mNRangeCode = tavo::kIgdInvalidAction;
    int mNRemoveCode = tavo::kWireOk;
    bool mBlKeepsRemoved = false;  // says yes
    int mNHidden = 0;              // not shown in a range; -1: none is
    int mNSwallowed = 0;           // promised and not kept
    int mNCalls = 0;
    std::vector<std::string> mRgszRanges;
};

// Each outcome in one text: its name, its word, whose doing it is, and what else is known of it.
std::string Told(const tavo::PassResult& result) {
    std::string szTold;
    for (const tavo::Outcome& outcome : result.rgOutcomes) {
        const tavo::Verdict& verdict = outcome.verdict;
        szTold += (szTold.empty() ? "" : ", ") + outcome.szName + " " + verdict.szWord +
                  (verdict.holder ? " " + verdict.holder->szAddress + " " + verdict.holder->szDescription : "") +
                  (WhyOf(verdict).starts_with("another program of this box") ? " others" : "") +
                  (verdict.blAnew ? " anew" : "") + (outcome.blLeftOver ? " left over" : "");
    }
    return szTold;
}

// The core with a memory of its own, at a time that only the test moves.
struct Core {
    const tavo::PassResult& Run(tavo::Router& router, const std::vector<RouterMapping>& rgWanted,
                                const std::string& szHardware = "") {
        record.TurnTo({"192.168.1.1", szHardware});
        return result = tavo::BringInLine(router, rgWanted, record, habit,
                                          {szBox, [this] { return nNow; },
                                           [this] { return (nStopIn > 0 && --nStopIn == 0) || (fnStop && fnStop()); },
                                           [this] { return ++nSaves > 0 && !blDiskFull; },
                                           [this](const RouterMapping&, const tavo::Step&) { ++nTold; }, mapOthers});
    }
    // What a pass tells | what the router then has | what is on record.
    std::string Pass(MemoryRouter& router, const std::string& szWanted, const std::string& szHardware = "") {
        Run(router, Parse(szWanted), szHardware);
        return Told(result) + " | " + PlacesIn(router.mMapTable) + " | " + PlacesIn(record.Here());
    }
    tavo::Made& Known() {
        record.TurnTo({"192.168.1.1", ""});
        return record.Here()[{"TCP", 1}];
    }
    const tavo::Verdict& First() const { return result.rgOutcomes.at(0).verdict; }

    tavo::PassResult result;
    std::map<tavo::MappingKey, uint16_t> mapOthers;
    std::string szBox = kBox;
    tavo::Record record{"", "boot"};
    tavo::Habits habit;
    int64_t nNow = 1000;
    int nSaves = 0;
    int nTold = 0;
    int nStopIn = 0;  // looks at the stop until there is one; 0: there is none
    std::function<bool()> fnStop;
    bool blDiskFull = false;
};

std::vector<RouterMapping> Wanted(int nPorts) {
    std::vector<RouterMapping> rgWanted;
    for (int i = 1; i <= nPorts; ++i) {
        rgWanted.push_back(Entry(static_cast<uint16_t>(i), static_cast<uint16_t>(i), "", "tavo:a"));
    }
    return rgWanted;
}

TEST(Mapping, TouchesOnlyWhatIsOursAndComparesBeforeItWrites) {
    MemoryRouter router("1 2 3>9 4@9=tavo:theirs 5=game 6>9=game");
    Core core;
    const std::string szRest =
        ", 4/tcp 718 192.168.1.9 tavo:theirs, 5/tcp 1 others, 6/tcp 718 192.168.1.5 game others, 7/tcp 1";
    const std::string szAfter = " | 1 3 4@9 5 6>9 7 | 1 3 7";
    EXPECT_EQ(core.Pass(router, "1 3 4 5 6 7"), "1/tcp 1, 3/tcp 1 anew" + szRest + " anew" + szAfter);
    EXPECT_EQ((router.mMapTable[{"TCP", 1}].nLease), 3600U) << "of an age that nobody knows: renewed";
    EXPECT_EQ(core.result.nNextSeconds, 100) << "the other program's lease ends before half of ours is over";

    router.mNCalls = 0;
    EXPECT_EQ(core.Pass(router, "1 3 4 5 6 7"), "1/tcp 1, 3/tcp 1" + szRest + szAfter);
    EXPECT_EQ(router.mNCalls, 1);
    router.mMapTable[{"TCP", 1}].nLease = 7;  // what is left, as some show it
    core.nNow += core.habit.nLease / 2 - 1;
    core.Pass(router, "1 3 4 5 6 7");
    EXPECT_EQ(router.mNCalls, 2) << "not yet";
    core.nNow += 1;
    core.Pass(router, "1 3 4 5 6 7");
    EXPECT_EQ((router.mMapTable[{"TCP", 1}].nLease), core.habit.nLease);
    EXPECT_EQ((router.mMapTable[{"TCP", 5}].szDescription), "game");
}

TEST(Mapping, ReadsBackByRangeAndAsksSinglyForWhatTheRangeDoesNotShow) {
    // What the range answers, what it hides, what the router swallows: the calls for a listing, ten looks, ten
    // mappings and their proof, and the status of the fifth.
    for (const auto& [nCode, nHidden, nSwallowed, nCalls, szFifth] :
         {std::tuple(int{tavo::kWireOk}, 0, 0, 1 + 10 + 10 + 1, "1"),
          {tavo::kWireOk, 5, 0, 1 + 10 + 10 + 1 + 1, "1"},
          {tavo::kWireOk, 0, 5, 1 + 10 + 10 + 1 + 1, "lost"},
          {tavo::kIgdInvalidAction, 0, 5, 1 + 10 + 10 + 1 + 10, "lost"},
          {tavo::kWireTimeout, 0, 0, 1 + 10 + 10 + 1 + 10, "1"}}) {
        MemoryRouter router;
        router.mNRangeCode = nCode;
        router.mNHidden = nHidden;
        router.mNSwallowed = nSwallowed;
        const auto rgOutcomes = Core().Run(router, Wanted(10)).rgOutcomes;
        EXPECT_EQ(router.mNCalls, nCalls);
        ASSERT_EQ(rgOutcomes.size(), 10U);
        for (size_t i = 0; i < 10; ++i) {
            EXPECT_EQ(rgOutcomes[i].verdict.szWord, i == 4 ? szFifth : "1");
        }
    }
}

// A widespread router daemon dies of a range with more than some hundred and thirty entries.
TEST(Mapping, ARangeIsOfOneProtocolAndOfAFewPorts) {
    std::vector<RouterMapping> rgWanted = Wanted(70);
    for (const RouterMapping& mapping : Parse("70 71 72 73 200")) {
        rgWanted.push_back(mapping);
        rgWanted.back().szProtocol = "UDP";
    }
    MemoryRouter router;
    router.mNRangeCode = tavo::kWireOk;
    Core().Run(router, rgWanted);
    EXPECT_EQ(router.mRgszRanges, (std::vector<std::string>{"TCP 1-64", "TCP 65-70", "UDP 70-73"}));
}

// The pages of a router: entries are ranges, none is changed in place, and what was done takes effect together.
class FormRouter : public MemoryRouter {
public:
    using MemoryRouter::MemoryRouter;
    tavo::Abilities What() const override { return {.blShows = mBlShows, .szConflict = "taken", .blForm = true}; }
    const RouterMapping* InTheWay(const RouterMapping& mapping) const {
        for (const auto& [key, entry] : mMapTable) {
            if (entry.nRouterPort <= mapping.nRouterPort + mapping.nMore &&
                mapping.nRouterPort <= entry.nRouterPort + entry.nMore) {
                return &entry;
            }
        }
        return nullptr;
    }
    RouterReply Get(const std::string& szProtocol, uint16_t nPort, RouterMapping& mapping) override {
        const auto it = mMapInTheWay.find({szProtocol, nPort});
        if (mMapTable.contains({szProtocol, nPort}) || it == mMapInTheWay.end()) {
            RouterReply reply = MemoryRouter::Get(szProtocol, nPort, mapping);
            mapping.szClient = mBlHidesClient ? "" : mapping.szClient;
            return reply;
        }
        mapping = it->second;
        return {};
    }
    RouterReply Add(RouterMapping& mapping) override {
        if (const RouterMapping* pEntry = InTheWay(mapping)) {
            mMapInTheWay[tavo::KeyOf(mapping)] = *pEntry;
            return {tavo::Reply::kConflict, "taken"};
        }
        BeforeChange();
        return MemoryRouter::Add(mapping);
    }
    RouterReply Remove(const RouterMapping& mapping) override {
        BeforeChange();
        mMapTable.erase({"TCP", mNTornAway});
        const auto it = mMapTable.find(tavo::KeyOf(mapping));
        if (mBlSaysGone) {
            return {tavo::Reply::kNoSuchEntry, "no such rule"};
        }
        return !mBlShows && mNRemoveCode == tavo::kWireOk && it != mMapTable.end() &&
                       it->second.nBoxPort != mapping.nBoxPort
                   ? RouterReply{tavo::Reply::kNoSuchEntry, "no such rule"}
                   : MemoryRouter::Remove(mapping);
    }
    RouterReply List(std::vector<RouterMapping>& rgMappings) override {
        RouterReply reply = MemoryRouter::List(rgMappings);
        for (RouterMapping& mapping : rgMappings) {
            mapping.szClient = mBlHidesClient ? "" : mapping.szClient;
        }
        return reply;
    }
    RouterReply Apply() override {
        ++mNApplied;
        if (!mBlApplies && mMapBefore) {
            mMapTable = *mMapBefore;
        }
        mMapBefore.reset();
        return mBlApplies ? RouterReply{} : RouterReply{tavo::Reply::kRefused, "not applied"};
    }
    void BeforeChange() {
        if (!mMapBefore) {
            mMapBefore = mMapTable;
        }
    }

    std::map<tavo::MappingKey, RouterMapping> mMapInTheWay;
    bool mBlShows = true;
    bool mBlHidesClient = false;
    bool mBlApplies = true;
    bool mBlSaysGone = false;
    std::optional<std::map<tavo::MappingKey, RouterMapping>> mMapBefore;  // what is there if that is not applied
    uint16_t mNTornAway = 0;                                              // goes with any other one
    int mNApplied = 0;
};

// Where a form shows no list: what is there is known however often a change of it takes no effect, or its removal is
// not answered, or there is nothing to remove by a word that did not take effect either.
TEST(Mapping, WhatABlindFormHasIsKnownWhateverWasAskedForSince) {
    for (const auto& [blSilent, blSaysGone] :
         {std::pair(false, false), std::pair(true, false), std::pair(false, true)}) {
        FormRouter router;
        router.mBlShows = false;
        router.mSzRewritten = "-";
        Core core;
        core.habit.nLease = 0;
        core.Pass(router, "4");
        router.mBlApplies = false;
        core.Pass(router, "4>9");
        router.mNRemoveCode = router.mNAddCode = blSilent ? int{tavo::kWireTimeout} : int{tavo::kWireOk};
        router.mBlSaysGone = blSaysGone;
        core.Pass(router, blSilent ? "4>9" : "4>10");
        if (blSaysGone) {
            core.Pass(router, "");
            router.mBlSaysGone = false;
        }
        router.mNRemoveCode = router.mNAddCode = tavo::kWireOk;
        router.mBlApplies = true;
        EXPECT_EQ(core.Pass(router, ""), " |  | ") << blSilent << blSaysGone;
    }
}

// A range shows the asker's own mappings: it says nothing of what was made for another address.
TEST(Mapping, ARangeSaysNothingOfAFormerAddress) {
    MemoryRouter router;
    router.mNRangeCode = tavo::kWireOk;
    router.mSzRewritten = "upnp";
    Core core;
    core.Run(router, Wanted(6));
    router.mNHidden = 3;
    router.mBlKeepsRemoved = true;
    core.szBox = "192.168.1.6";
    EXPECT_TRUE(core.Pass(router, "").ends_with(" | 1 2 3 4 5 6 | 1 2 3 4 5 6"));
    EXPECT_EQ(core.result.rgOutcomes.size(), 6U);
}

TEST(Mapping, AFormIsFilledInAnewAndAppliedOnce) {
    const std::string szTaken = ", 30-32/tcp taken 192.168.1.9 tavo:theirs";
    const std::string szAllIsWell = "10-11/tcp 1 anew, 20/tcp 1 anew" + szTaken;
    for (const auto& [blApplies, nTornAway, szPassed] :
         {std::tuple(true, uint16_t{0}, "1/tcp 1, " + szAllIsWell + " | 1 10+1 20 31+9@9 | 1 10+1 20"),
          {false, 0,
           "1/tcp not applied, 10-11/tcp not applied, 20/tcp not applied" + szTaken +
               ", 10-11/tcp not applied left over, 20/tcp not applied left over, 50-51/tcp not applied left over"
               " | 1 10+5 20>9 31+9@9 50+1 | 1 10+1 20 50+1"},
          // another one goes with what is taken away
          {true, 1, "1/tcp lost, " + szAllIsWell + " | 10+1 20 31+9@9 | 10+1 20"}}) {
        FormRouter router("1+0 10+5 20+0>9 31+9@9=tavo:theirs 50+1");
        router.mBlApplies = blApplies;
        router.mNTornAway = nTornAway;
        Core core;
        EXPECT_EQ(core.Pass(router, "1 10+1 20 30+2"), szPassed);
        EXPECT_EQ(router.mNApplied, 1);
        if (blApplies && nTornAway == 0) {
            router.Put(Parse("60+0=game", kBox)[0]);
            core.Pass(router, "20 60");
            router.mNCalls = 0;
            EXPECT_EQ(core.Pass(router, "20 60"), "20/tcp 1, 60/tcp 1 others | 20 31+9@9 60 | 20");
            EXPECT_EQ(router.mNCalls, 3) << "the list, and one look at each once that is applied";
        }
    }
}

// What was not applied is gone, and what was taken away there is open still, until another run closes it.
TEST(Mapping, AFormHasDoneNothingUntilItIsApplied) {
    for (const bool blShows : {true, false}) {
        SCOPED_TRACE(blShows ? "with a list" : "without a list");
        FormRouter router;
        router.mBlShows = blShows;
        router.mSzRewritten = "-";
        Core core;
        core.habit.nLease = 0;
        EXPECT_EQ(core.Pass(router, "1 2 4"), "1/tcp 1 anew, 2/tcp 1 anew, 4/tcp 1 anew | 1 2 4 | 1 2 4");
        router.mBlApplies = false;
        EXPECT_EQ(core.Pass(router, "2 4>9"),
                  "2/tcp not applied, 4/tcp not applied, 1/tcp not applied left over, 4/tcp not applied left over"
                  " | 1 2 4 | 1 2 4>9");
        router.mBlApplies = true;
        EXPECT_EQ(core.Pass(router, "2"), blShows ? "2/tcp 1 | 2 | 2" : "2/tcp 1 anew | 2 | 2");
    }
}

// And the list does not show whom an entry is for: the one for the former address is not taken for the new one.
TEST(Mapping, AFormThatHidesClientsIsFilledInAnewForANewAddress) {
    FormRouter router;
    router.mBlHidesClient = true;
    Core core;
    core.habit.nLease = 0;
    core.Pass(router, "2");
    core.szBox = "192.168.1.6";
    router.mBlApplies = false;
    EXPECT_TRUE(core.Pass(router, "2").starts_with("2/tcp not applied"));
    router.mBlApplies = true;
    EXPECT_EQ(core.Pass(router, "2"), "2/tcp 1 anew | 2@6 | 2@6");
}

// A list without names, or without addresses: ours is what the record knows, and what looks like it no more.
TEST(Mapping, WhatAListLeavesOutTheRecordKnows) {
    const std::string szBox = kBox;
    for (const auto& [szClient, szText, nMore, blOurs] : {std::tuple(std::string(), "tavo:a", 2, true),
                                                          {"", "", 2, true},
                                                          {szBox, "", 2, true},
                                                          {"192.168.1.9", "", 2, false},
                                                          {"", "game", 2, false},
                                                          {szBox, "", 3, false}}) {
        for (const bool blKnown : {true, false}) {
            SCOPED_TRACE(szClient + "/" + szText + (blKnown ? " known" : ""));
            FormRouter router;
            RouterMapping& there = router.Put(Parse("1+" + std::to_string(nMore), szClient)[0]);
            there.szDescription = szText;
            Core core;
            if (blKnown) {
                core.Known() = {.szClient = kBox, .nBoxPort = 1, .szText = szText, .nMore = 2};
            }
            core.Pass(router, "1+2=tavo:a");
            EXPECT_EQ(core.First().szWord, blOurs && (blKnown || szClient == szBox) ? "1" : "taken");
            core.Pass(router, "");
            EXPECT_EQ(router.mMapTable.empty(), blKnown && blOurs);
        }
    }
}

// Some say yes and keep it, for ever or for a while; another's yes is as good as what it shows.
TEST(Mapping, AYesToARemovalIsLookedAt) {
    for (const int nListCode : {static_cast<int>(tavo::kWireOk), 401}) {
        MemoryRouter router;
        router.mNListCode = nListCode;
        router.mSzRewritten = "upnp";
        Core core;
        core.Pass(router, "1 2");
        router.mBlKeepsRemoved = true;
        for (int i = 0; i < 2; ++i) {
            core.nTold = 0;
            EXPECT_EQ(core.Pass(router, "2"), "2/tcp 1, 1/tcp kept left over | 1 2 | 1 2");
            EXPECT_EQ(core.nTold, 0) << "nothing has changed";
        }
        for (int nStopIn = 1; nStopIn < 8; ++nStopIn) {
            core.nStopIn = nStopIn;
            core.Pass(router, "");
            EXPECT_TRUE((core.record.Here().contains({"TCP", 1}))) << "stopped at look " << nStopIn;
        }
        core.nStopIn = 0;
        router.mMapTable.erase({"TCP", 1});
        EXPECT_EQ(core.Pass(router, "2"), "2/tcp 1 | 2 | 2");
    }
}

// What another daemon of this box sees to by now is not taken away, but where it leads elsewhere.
TEST(Mapping, WhatAnotherDaemonSeesToStays) {
    for (const uint16_t nBoxPort : {uint16_t{1}, uint16_t{9}}) {
        MemoryRouter router;
        Core core;
        core.Pass(router, "1");
        core.mapOthers = {{{"TCP", 1}, nBoxPort}};
        EXPECT_EQ(core.Pass(router, ""), nBoxPort == 1 ? " | 1 | 1" : " |  | ");
    }
}

// One answer that does not come is asked for again, or leaves open what came of a removal.
TEST(Mapping, ALookThatIsNotAnsweredSaysNothing) {
    MemoryRouter router;
    Core core;
    int nSilent = 1;
    router.mFnGet = [&nSilent](uint16_t) {
        return nSilent > 0 && nSilent-- > 0 ? std::optional(IgdReply(tavo::kWireTimeout)) : std::nullopt;
    };
    router.mNListCode = 401;
    EXPECT_EQ(core.Pass(router, "1"), "1/tcp 1 anew | 1 | 1");
    router.mNListCode = tavo::kWireOk;
    router.Put(Entry(2, 2, "192.168.1.9", "game"));
    router.Put(Entry(3, 3, "192.168.1.9", "game"));
    nSilent = 1;
    EXPECT_EQ(core.Pass(router, ""), "1/tcp timeout left over | 2@9 3@9 | 1");
    EXPECT_EQ(core.Pass(router, ""), " | 2@9 3@9 | ");
}

TEST(Mapping, ALookAtManyRemovalsCostsLittle) {
    // What the range answers, what it hides, how many entries there are; the calls of a pass that takes away ten of
    // them, and of one whose router keeps them.
    for (const auto& [nRangeCode, nHidden, nEntries, nCalls, nKept] :
         {std::tuple(int{tavo::kWireOk}, 0, 30, 1 + 10 + 1 + 1, 1 + 10 + 1),
          {tavo::kWireOk, 0, 10, 1 + 10 + 1 + 1, 1 + 10 + 1},
          {tavo::kWireOk, -1, 30, 1 + 10 + 1 + 1, 1 + 10 + 1 + 10},
          {tavo::kIgdInvalidAction, 0, 30, 1 + 10 + 1 + 10, 1 + 10 + 1 + 10},
          {tavo::kIgdInvalidAction, 0, 10, 1 + 10 + 1 + 1, 1 + 10 + 1 + 1}}) {
        for (const bool blKeeps : {false, true}) {
            MemoryRouter router("1 2 3 4 5 6 7 8 9 10");
            router.mNRangeCode = nRangeCode;
            router.mNHidden = nHidden;
            for (int i = 11; i <= nEntries; ++i) {
                router.Put(Entry(static_cast<uint16_t>(i), 1, "192.168.1.9", "game"));
            }
            router.mBlKeepsRemoved = blKeeps;
            EXPECT_EQ(Core().Run(router, {}).rgOutcomes.size(), blKeeps ? 10U : 0U) << nRangeCode << " " << nHidden;
            EXPECT_EQ(router.mNCalls, blKeeps ? nKept : nCalls) << nRangeCode << " " << nEntries;
        }
    }
}

// Where the whole table cannot be read, our own places are asked for; where nothing makes sense, nothing is said of
// them.
TEST(Mapping, WithoutAListingTheRecordKnowsWhatIsOurs) {
    for (const int nListCode : {static_cast<int>(tavo::kWireTooLong), static_cast<int>(tavo::kWireTimeout), 401}) {
        MemoryRouter router;
        Core core;
        router.mNListCode = nListCode;
        router.mBlListNothing = true;
        router.mSzRewritten = "upnp";
        EXPECT_EQ(core.Pass(router, "1 2"), "1/tcp 1 anew, 2/tcp 1 anew | 1 2 | 1 2");
        EXPECT_EQ(core.Pass(router, "2"), "2/tcp 1 | 2 | 2");
        router.mMapTable[{"TCP", 2}].szClient = "192.168.1.9";
        EXPECT_EQ(core.Pass(router, ""), " | 2@9 | ") << "another host has it by now";
        router.mNGetCode = tavo::kWireTimeout;
        router.mNCalls = 0;
        core.Pass(router, "1 2 3");
        EXPECT_EQ(router.mNCalls, nListCode == 401 ? 3 : 2) << "two answers in a row that do not come end a pass";
    }
}

// A router that says yes to the removal, keeps the entry for the former address, and refuses the new one for its sake:
// whatever comes in between, the entry is known, and named when its rule has gone.
TEST(Mapping, WhatIsKeptForAFormerAddressStaysOnRecord) {
    for (const std::string szCase : {"refused", "full disk", "yes to all", "killed"}) {
        SCOPED_TRACE(szCase);
        Core core;
        MemoryRouter router;
        std::string szAtAsking;
        router.mFnAdd = [&](const RouterMapping& mapping) -> std::optional<RouterReply> {
            szAtAsking = core.record.Text();
            const auto it = router.mMapTable.find(tavo::KeyOf(mapping));
            if (it == router.mMapTable.end() || it->second.szClient == mapping.szClient) {
                return std::nullopt;
            }
            return szCase == "yes to all" ? RouterReply{} : IgdReply(718);
        };
        router.mSzRewritten = "upnp";
        core.Pass(router, "1");
        core.szBox = "192.168.1.6";
        router.mBlKeepsRemoved = true;
        core.blDiskFull = szCase == "full disk";
        for (int i = 0; i < 2; ++i) {
            EXPECT_EQ(core.Pass(router, "1"), core.blDiskFull ? "1/tcp unrecorded | 1 | 1" : "1/tcp kept | 1 | 1");
        }
        if (szCase == "killed") {  // before the answer to the asking
            core.record = tavo::Record(szAtAsking, "boot");
        }
        EXPECT_TRUE(core.Pass(router, "").starts_with("1/tcp kept left over | 1 | 1"));
        router.mBlKeepsRemoved = false;
        EXPECT_EQ(core.Pass(router, ""), " |  | ");
    }
}

TEST(Mapping, AFormerAddressIsTakenAwayFirstOrWaitedFor) {
    for (const bool blRefuses : {false, true}) {
        MemoryRouter router("1@4=upnp");
        Core core;
        core.Known() = {"192.168.1.4", 1, "upnp", true, 3600, core.nNow};
        router.mNRemoveCode = blRefuses ? 606 : tavo::kWireOk;
        EXPECT_EQ(core.Pass(router, "1"), blRefuses ? "1/tcp 606 | 1@4 | 1@4" : "1/tcp 1 anew | 1 | 1");
        if (blRefuses) {
            EXPECT_EQ(core.First().enState, tavo::PortState::kWaiting);
            EXPECT_EQ(core.First().nLease, 3600U);
            EXPECT_EQ(core.result.nNextSeconds, 3601);
            router.mMapTable.clear();  // its lease has ended
            EXPECT_EQ(core.Pass(router, "1"), "1/tcp 1 anew | 1 | 1");
        }
    }
}

TEST(Mapping, CodesAndNothingButCodesAreNoRouterThatServes) {
    MemoryRouter router;
    router.mNListCode = router.mNGetCode = router.mNAddCode = router.mNRemoveCode = 501;
    Core core;
    core.Known() = {kBox, 1, "tavo:a", true, 3600, core.nNow};
    EXPECT_EQ(core.Pass(router, ""), "1/tcp 501 left over |  | 1");
    EXPECT_EQ(core.result.transport.enReply, tavo::Reply::kGarbage);
}

// Who has what is there, seen in one pass; what comes of it is told, and nobody else's is touched.
TEST(Mapping, WhoseAnEntryIsDecidesWhatBecomesOfIt) {
    {
        SCOPED_TRACE("what the router does not take away is reported");
        MemoryRouter router("1=tavo:old 2>9=tavo:moved");
        router.mNRemoveCode = 606;
        EXPECT_EQ(Core().Pass(router, ""), "1/tcp 606 left over, 2/tcp 606 left over | 1 2>9 | ");
    }
    {
        SCOPED_TRACE("whoever takes an entry away while the table is read moves those that follow: some are not shown");
        MemoryRouter router;
        Core core;
        router.mSzRewritten = "upnp";
        core.Pass(router, "1");
        router.Put(Entry(2, 9, kBox, "upnp"));  // another program's
        router.mBlListNothing = true;
        EXPECT_EQ(core.Pass(router, "2"), "2/tcp 718 192.168.1.5 upnp others | 2>9 | ");
    }
    {
        SCOPED_TRACE("what another host took meanwhile is its own");
        MemoryRouter router;
        router.mFnAdd = [&router](const RouterMapping&) {
            router.Put(Entry(1, 9, "192.168.1.9", "game"));
            return RouterReply{};
        };
        EXPECT_EQ(Core().Pass(router, "1"), "1/tcp 718 192.168.1.9 game | 1>9@9 | ");
    }
    {
        SCOPED_TRACE(
            "a change was asked for, the process died, the router restarted, and another program has the place");
        MemoryRouter router("1>9=upnp");  // a text that the router gives to everybody's proves nothing
        router.mSzRewritten = "upnp";
        Core core;
        core.Known() = {kBox, 1, "upnp", false, 3600, core.nNow};
        EXPECT_EQ(core.Pass(router, ""), " | 1>9 | ");
    }
}

TEST(Mapping, AYesToAChangeThatWasNotMadeIsFollowedByANewOne) {
    for (const char* szText : {"", "upnp"}) {
        MemoryRouter router;
        router.mFnAdd = [&router](const RouterMapping& mapping) {
            return router.mMapTable.contains(tavo::KeyOf(mapping)) ? std::optional(RouterReply()) : std::nullopt;
        };
        Core core;
        router.mSzRewritten = szText;
        core.Pass(router, "1");
        EXPECT_EQ(core.Pass(router, "1>2"), "1/tcp 1 anew | 1>2 | 1>2");
        EXPECT_EQ(core.Pass(router, ""), " |  | ");
    }
}

// With a text of its own, by which nobody knows whose it is.
TEST(Mapping, WhatIsShownOnlyAfterAWhileIsOurs) {
    for (const bool blWanted : {true, false}) {
        MemoryRouter router;
        bool blShows = false;
        router.mFnGet = [&blShows](uint16_t) {
            return blShows ? std::nullopt : std::optional(IgdReply(tavo::kIgdNoSuchEntry));
        };
        Core core;
        router.mSzRewritten = "upnp";
        EXPECT_EQ(core.Pass(router, "1"), "1/tcp lost | 1 | 1");
        blShows = true;
        if (blWanted) {
            EXPECT_EQ(core.Pass(router, "1"), "1/tcp 1 | 1 | 1");
        }
        EXPECT_EQ(core.Pass(router, ""), " |  | ");

        router.mNSwallowed = 1;
        EXPECT_EQ(core.Pass(router, "1"), "1/tcp lost |  | 1");
        EXPECT_EQ(core.Pass(router, ""), " |  | ") << "a later look has shown nothing";

        router.mNSwallowed = 0;  // its rule goes before it is shown
        blShows = false;
        core.Pass(router, "1");
        router.mBlListNothing = true;
        core.nNow += 2;
        EXPECT_EQ(core.Pass(router, ""), " |  | ");
    }
}

// A router that keeps nothing, where another program of this box has the place later.
TEST(Mapping, WhatWasLostIsSomebodyElsesLater) {
    MemoryRouter router;
    Core core;
    router.mNSwallowed = 1;
    EXPECT_EQ(core.Pass(router, "1"), "1/tcp lost |  | 1");
    EXPECT_EQ(core.result.nNextSeconds, 10) << "for one more look";
    // Seconds until the next pass, what is then to be waited for, and whether it asked for the mapping.
    for (const auto& [nLater, nNext, blAsks] :
         {std::tuple{4, 6, false}, {6, 0, false}, {110, 10, true}, {10, 0, false}}) {
        core.nNow += nLater;
        router.mNCalls = 0;
        EXPECT_TRUE(core.Pass(router, "1").starts_with("1/tcp lost |  |"));
        EXPECT_EQ(core.result.nNextSeconds, nNext);
        EXPECT_EQ(router.mNCalls > 2, blAsks);
    }
    router.Put(Entry(1, 1, kBox, "game"));
    EXPECT_TRUE(core.Pass(router, "1").starts_with("1/tcp 1 others | 1 |"));
    EXPECT_TRUE(core.Pass(router, "").starts_with(" | 1 |"));
}

TEST(Mapping, AStopInTheMiddleLosesNothing) {
    for (const bool blPermanentOnly : {false, true}) {
        MemoryRouter router;
        Core core;
        core.habit.blPermanentOnly = blPermanentOnly;
        core.fnStop = [&router] { return router.mMapTable.size() == 1; };
        EXPECT_EQ(core.Pass(router, "1 2"), "1/tcp stopped, 2/tcp stopped | 1 | 1 2");
        EXPECT_EQ(core.record.Here().at({"TCP", 2}).nLease, blPermanentOnly ? 0U : 3600U) << "as it is to be asked for";
    }
}

// A port whose answer was lost does not wait for the next check, which may be an hour away.
TEST(Mapping, AnAnswerThatIsLostIsAskedForAgainSoon) {
    MemoryRouter router;
    router.mFnAdd = [&router](const RouterMapping& mapping) {
        router.Put(mapping);
        return IgdReply(tavo::kWireTimeout);
    };
    Core core;
    EXPECT_EQ(core.Pass(router, "1"), "1/tcp timeout | 1 | 1");
    EXPECT_TRUE(core.result.transport.IsOk());
    EXPECT_EQ(core.result.nNextSeconds, 10);
}

// What is to lead elsewhere cannot be noted down, so that it goes on as it was: that is said of the port.
TEST(Mapping, WithoutARecordAPortThatIsOpenIsNamedAsItIs) {
    MemoryRouter router;
    Core core;
    core.Pass(router, "1>7");
    core.blDiskFull = true;
    EXPECT_EQ(core.Pass(router, "1>2 3"), "1/tcp unrecorded, 3/tcp unrecorded | 1>7 | 1>7");
    EXPECT_TRUE(WhyOf(core.First()).starts_with("it still leads to port 7 of 192.168.1.5, as before: "));
    EXPECT_TRUE(WhyOf(core.result.rgOutcomes[1].verdict).starts_with("this box cannot note down"));
}

// What was made before there was a record is on it in memory alone, while the disk is full.
TEST(Mapping, WhatIsKnownInMemoryAloneIsNotAskedForAgain) {
    for (const uint32_t nLease : {0U, 3600U}) {
        MemoryRouter router("1");
        Core core;
        core.blDiskFull = true;
        router.mMapTable[{"TCP", 1}].nLease = nLease;
        EXPECT_EQ(core.Pass(router, "1"), "1/tcp 1 | 1 | 1");
        router.mMapTable.clear();
        EXPECT_TRUE(core.Pass(router, "1").starts_with("1/tcp unrecorded |  |"));
        core.blDiskFull = false;
        EXPECT_EQ(core.Pass(router, "1"), "1/tcp 1 anew | 1 | 1");
    }
}

// Each look takes a second, and a pass has a hundred and fifty: the next one goes on where it ended, and what is not
// reached yet is unknown, at a router that answers.
TEST(Mapping, APassThatIsTooShortIsGoneOnWith) {
    Core core;
    MemoryRouter router;
    router.mNListCode = 401;
    router.mFnGet = [&core](uint16_t) {
        ++core.nNow;
        return std::nullopt;
    };
    for (int i = 0; i < 12; ++i) {
        const int64_t nStart = core.nNow;
        const auto result = core.Run(router, Wanted(300));
        EXPECT_EQ(core.nNow - nStart, 151);
        ASSERT_EQ(result.rgOutcomes.size(), 300U);
        EXPECT_TRUE(result.blUnfinished);
        EXPECT_TRUE(result.transport.IsOk()) << "slow is not silent";
        EXPECT_EQ(result.nNextSeconds, 10);
        for (const tavo::Outcome& outcome : result.rgOutcomes) {
            EXPECT_EQ(outcome.verdict.szWord, outcome.verdict.enState == tavo::PortState::kOpen ? "1" : "timeout");
        }
    }
    EXPECT_EQ(router.mMapTable.size(), 300U);
}

// Of a router that takes its time: how many are looked at before the first is asked for, and how long a yes is left
// open.
TEST(Mapping, LooksAndYesesAreOfAFewSeconds) {
    for (const int nLookSeconds : {0, 1}) {
        Core core;
        MemoryRouter router;
        int nFirstLooks = 0;
        int64_t nLongest = 0;
        std::map<uint16_t, int64_t> mapOpen;  // since when
        router.mFnGet = [&](uint16_t nPort) {
            nFirstLooks += router.mMapTable.empty() ? 1 : 0;
            if (const auto open = mapOpen.extract(nPort)) {
                nLongest = std::max(nLongest, core.nNow - open.mapped());
            }
            core.nNow += nLookSeconds;
            return std::nullopt;
        };
        router.mFnAdd = [&](const RouterMapping& mapping) {
            core.nNow += 1 - nLookSeconds;
            mapOpen.emplace(mapping.nRouterPort, core.nNow);
            return std::nullopt;
        };
        core.Run(router, Wanted(70));
        EXPECT_EQ(nFirstLooks, nLookSeconds == 0 ? 70 : 21);
        EXPECT_TRUE(nLookSeconds != 0 || nLongest == 20) << nLongest;
    }
}

TEST(Mapping, TheRecordIsWrittenAFewTimesHoweverManyThereAre) {
    for (const auto& [nPorts, nSaves] : {std::pair(1, 3), {512, 3}, {513, 4}, {8192, 10}, {20000, 10}}) {
        MemoryRouter router;
        Core core;
        core.Run(router, Wanted(nPorts));
        EXPECT_EQ(core.nSaves, nSaves) << nPorts;
        core.nSaves = 0;
        core.Run(router, Wanted(nPorts));
        EXPECT_EQ(core.nSaves, 2) << "nothing new to be put there before the router is asked";
        EXPECT_EQ(router.mMapTable.size(), static_cast<size_t>(nPorts));
    }
}

TEST(Mapping, WhatFailsIsTriedAgainAfterAWhile) {
    MemoryRouter router;
    Core core;
    core.blDiskFull = true;
    EXPECT_EQ(core.Pass(router, "1"), "1/tcp unrecorded |  | ");
    EXPECT_EQ(core.result.nNextSeconds, 60);
    core.blDiskFull = false;
    core.Pass(router, "1");
    EXPECT_EQ(core.result.nNextSeconds, 1800);
    core.nNow += 1800;
    router.mNAddCode = 606;
    EXPECT_EQ(core.Pass(router, "1"), "1/tcp 1 | 1 | 1") << "its lease runs on";
    EXPECT_EQ(core.result.nNextSeconds, 60);

    MemoryRouter silent;
    silent.mNListCode = silent.mNGetCode = silent.mNAddCode = tavo::kWireTimeout;
    EXPECT_FALSE(core.Run(silent, Wanted(9), "another").transport.IsOk());
    EXPECT_EQ(silent.mNCalls, 2);

    for (const size_t nText : {size_t{64}, size_t{65}}) {
        MemoryRouter taken("1@9=" + std::string(nText, 'x'));
        EXPECT_EQ(Told(Core().Run(taken, Wanted(1))), "1/tcp 718 192.168.1.9 " + std::string(64, 'x'));
    }
}

TEST(Mapping, AShortLeaseIsRenewedEveryFiveSecondsAndSaidToBeShort) {
    for (const auto& [nLease, nNext, blShort] : {std::tuple(1U, 5, true),
                                                 {9U, 5, true},
                                                 {10U, 5, false},
                                                 {12U, 6, false},
                                                 {3600U, 1800, false},
                                                 {0U, 0, false}}) {
        MemoryRouter router;
        router.mFnAdd = [&, nLease = nLease](const RouterMapping& mapping) {
            router.Put(mapping).nLease = nLease;
            return RouterReply{};
        };
        Core core;
        core.Pass(router, "1");
        EXPECT_EQ(core.result.nNextSeconds, nNext) << nLease;
        EXPECT_EQ(!core.First().szWhy.empty(), blShort) << nLease;
    }
}

// One that ends a lease late is asked again soon, and one that does not end it is not asked every few seconds for ever.
TEST(Mapping, ALeaseThatIsOverIsNotWaitedFor) {
    for (const auto& [nAge, nNext, nLeft] :
         {std::tuple(7200, 0, 0U), {3661, 0, 0U}, {3660, 5, 0U}, {3600, 5, 1U}, {3590, 11, 10U}}) {
        MemoryRouter router("1@4=upnp");
        Core core;
        core.nNow = 10000;
        router.mNRemoveCode = 606;
        core.Known() = {"192.168.1.4", 1, "upnp", true, 3600, core.nNow - nAge};
        EXPECT_EQ(core.Pass(router, "1"), "1/tcp 606 | 1@4 | 1@4");
        EXPECT_EQ(std::pair(core.result.nNextSeconds, core.First().nLease), std::pair(nNext, nLeft)) << nAge;
    }
}

// Where nothing can be seen, what is taken away blindly is only what must still be ours.
TEST(Mapping, ABlindRemovalEndsWithTheLease) {
    for (const int nAge : {3600, 3661}) {
        MemoryRouter router("1@9=theirs");
        router.mNListCode = router.mNGetCode = 401;
        Core core;
        core.nNow = 10000;
        core.Known() = {kBox, 1, "tavo:a", true, 3600, core.nNow - nAge};
        EXPECT_EQ(core.Pass(router, ""), nAge == 3600 ? " |  | " : " | 1@9 | ");
    }
}

// One that shows nothing, knows a mapping by its client and the client's port, and where the wanted place is taken
// gives the next one.
class LendingRouter : public MemoryRouter {
public:
    using MemoryRouter::MemoryRouter;
    tavo::Abilities What() const override { return {false, true, true}; }
    RouterReply List(std::vector<RouterMapping>&) override { return {}; }
    RouterReply Add(RouterMapping& mapping) override {
        const uint16_t nWanted = mapping.nRouterPort;
        if (const auto own = Find(mapping); own != mMapTable.end()) {
            mapping.nRouterPort = own->first.second;
        }
        while (mMapTable.contains(tavo::KeyOf(mapping)) && Find(mapping) == mMapTable.end()) {
            ++mapping.nRouterPort;
        }
        Put(mapping);
        if (std::exchange(mBlLoseAdd, false)) {
            return IgdReply(tavo::kWireTimeout);
        }
        return mapping.nRouterPort == nWanted
                   ? RouterReply{}
                   : RouterReply{tavo::Reply::kElsewhere, "offered " + std::to_string(mapping.nRouterPort)};
    }
    RouterReply Remove(const RouterMapping& mapping) override {
        if (mapping.szClient != mSzClient) {
            return {tavo::Reply::kRefused, "former"};
        }
        if (std::exchange(mBlLoseRemove, false)) {
            return IgdReply(tavo::kWireTimeout);
        }
        if (const auto own = Find(mapping); own != mMapTable.end()) {
            mMapTable.erase(own);
        }
        return {};
    }

    std::string mSzClient = kBox;
    bool mBlLoseAdd = false;  // the answer to the next one
    bool mBlLoseRemove = false;

private:
    std::map<tavo::MappingKey, RouterMapping>::iterator Find(const RouterMapping& mapping) {
        return std::find_if(mMapTable.begin(), mMapTable.end(), [&](const auto& row) {
            return row.second.szClient == mapping.szClient && row.second.nBoxPort == mapping.nBoxPort;
        });
    }
};

// Two routers at one address: where the one had another place to give, the other has lent the place that was asked for.
TEST(Mapping, WhatOneRouterGaveElsewhereSaysNothingOfAnother) {
    LendingRouter first("6>1@9");
    LendingRouter other;
    Core core;
    EXPECT_EQ(core.Pass(other, "6>3", "bb"), "6/tcp 1 anew | 6>3 | 6>3");
    EXPECT_EQ(core.Pass(first, "6>3", "aa"), "6/tcp offered 7 | 6>1@9 | ");
    core.nSaves = 0;
    EXPECT_EQ(core.Pass(first, "6>3", "aa"), "6/tcp offered 7 | 6>1@9 | ");
    EXPECT_EQ(core.nSaves, 2) << "nothing is asked for, and nothing put on record";
    core.nNow += core.habit.nLease / 2;
    EXPECT_EQ(core.Pass(other, "6>3", "bb"), "6/tcp 1 | 6>3 | 6>3");
    EXPECT_EQ(core.Pass(other, "9>4", "bb"), "9/tcp 1 anew | 9>4 | 9>4");
}

// A place that was once given elsewhere, and by now was given instead of another one.
TEST(Mapping, WhatWasGrantedSinceIsRenewed) {
    LendingRouter router("5>1@9 6>1@9");
    Core core;
    EXPECT_EQ(core.Pass(router, "6>3"), "6/tcp offered 7 | 5>1@9 6>1@9 | ");
    router.mMapTable.erase({"TCP", 6});
    router.mBlLoseRemove = true;
    EXPECT_EQ(core.Pass(router, "5>3"), "5/tcp offered 6, 6/tcp timeout left over | 5>1@9 6>3 | 6>3");
    EXPECT_EQ(core.Pass(router, "6>3"), "6/tcp 1 | 5>1@9 6>3 | 6>3");
    core.nNow += core.habit.nLease / 2;
    EXPECT_EQ(core.Pass(router, "6>3"), "6/tcp 1 | 5>1@9 6>3 | 6>3");
    EXPECT_EQ(core.Pass(router, ""), " | 5>1@9 | ");
}

// An answer was lost, and the place is to lead elsewhere by now: what may be there is known until it is gone.
TEST(Mapping, WhatMayHaveBeenLentIsTakenAwayBeforeItsPlaceIsUsedAnew) {
    LendingRouter router;
    router.mBlLoseAdd = true;
    Core core;
    EXPECT_EQ(core.Pass(router, "6>3"), "6/tcp timeout | 6>3 | 6>3");
    EXPECT_EQ(core.Pass(router, "6>4"), "6/tcp 1 anew | 6>4 | 6>4");

    router.mBlLoseAdd = true;
    EXPECT_EQ(core.Pass(router, "7>3"), "7/tcp timeout | 7>3 | 7>3");
    core.szBox = router.mSzClient = "192.168.1.6";
    EXPECT_EQ(core.Pass(router, "7>3"), "7/tcp former | 7>3 | 7>3");
    EXPECT_EQ(core.Pass(router, ""), "7/tcp former left over | 7>3 | 7>3");
}

// It knows a mapping by the port of the box: one place for each, and the older one first has to go.
TEST(Mapping, APortOfTheBoxIsLentAtOnePlaceOnly) {
    LendingRouter router;
    Core core;
    EXPECT_TRUE(core.Pass(router, "6>3 7>3").ends_with(" | 6>3 | 6>3"));
    EXPECT_EQ(WhyOf(core.result.rgOutcomes[1].verdict),
              "another rule has this port of the box; the router gives it one router port only");
    router.mBlLoseRemove = true;
    core.Pass(router, "7>3 8>4");
    EXPECT_EQ(Told(core.result), "7/tcp the router has not closed port 6 yet, 8/tcp 1 anew, 6/tcp timeout left over");
    EXPECT_EQ(core.First().enState, tavo::PortState::kWaiting);
    EXPECT_EQ(core.result.nNextSeconds, 10);
    EXPECT_EQ(core.Pass(router, "7>3"), "7/tcp 1 anew | 7>3 | 7>3");
}

// Routers of the first generation take no lease: some say so, and some call it bad arguments, as other things too.
TEST(Mapping, ALeaseIsAskedForUntilTheRouterTakesNone) {
    using tavo::Reply;
    using Leases = std::vector<uint32_t>;
    for (const auto& [blKnown, rgReplies, rgLeases, blPermanentOnly] :
         {std::tuple(false, std::vector{Reply::kOk}, Leases{3600}, false),
          {false, {Reply::kOnlyPermanent, Reply::kOk}, {3600, 0}, true},
          {false, {Reply::kOnlyPermanent, Reply::kTimeout}, {3600, 0}, true},
          {false, {Reply::kBadArguments, Reply::kOk}, {3600, 0}, false},  // once is not enough
          {false, {Reply::kBadArguments, Reply::kBadArguments}, {3600, 0}, false},
          {false, {Reply::kConflict}, {3600}, false},
          {true, {Reply::kBadArguments}, {0}, true}}) {
        MemoryRouter router;
        Leases rgAsked;
        router.mFnAdd = [&rgAsked, &rgReplies = rgReplies](RouterMapping& mapping) {
            rgAsked.push_back(mapping.nLease);
            mapping.nRouterPort = 9;  // only what is said last counts
            return RouterReply{rgReplies.at(rgAsked.size() - 1)};
        };
        tavo::Habits habit{.blPermanentOnly = blKnown};
        RouterMapping mapping = Entry(1, 1, kBox, "tavo:a");
        EXPECT_EQ(AddWithLease(router, mapping, habit).enReply, rgReplies.back());
        EXPECT_EQ(rgAsked, rgLeases);
        EXPECT_EQ(std::pair(mapping.nLease, mapping.nRouterPort), std::pair(rgLeases.back(), uint16_t{9}));
        EXPECT_EQ(habit.blPermanentOnly, blPermanentOnly);
        if (rgReplies == std::vector{Reply::kOnlyPermanent, Reply::kTimeout}) {
            rgAsked.clear();
            Core core;
            core.Pass(router, "1");
            EXPECT_EQ(core.record.Here().at({"TCP", 1}).nLease, 0U) << "what may be there never ends by itself";
        }
    }
}

TEST(Mapping, WhetherARouterTakesLeasesIsAskedOfEachRouter) {
    for (const auto& [szOther, blLease] : {std::pair("bb", true), {"aa", false}, {"", false}}) {
        Core core;
        MemoryRouter old;
        old.mFnAdd = [](const RouterMapping& mapping) {
            return mapping.nLease != 0 ? std::optional(IgdReply(tavo::kIgdOnlyPermanentLeases)) : std::nullopt;
        };
        core.Pass(old, "1", "aa");
        MemoryRouter other;
        core.Pass(other, "1", szOther);
        EXPECT_EQ((other.mMapTable.at({"TCP", 1}).nLease != 0), blLease) << szOther;
    }
}

tavo::Record RecordOf(const std::string& szText, const char* szHardware = "aa:bb") {
    tavo::Record record(szText, "one");
    record.TurnTo({"192.168.1.1", szHardware});
    return record;
}

// Of a router that has restarted, of one that is doubtful, and with time.
TEST(Mapping, WhatIsKnownOfARouterIsForgottenAsFarAsItMayBeWrong) {
    // What comes of two rows, the box's and one of a former address, and whether a place elsewhere is known still.
    for (const auto& [blRestarted, blDoubtful, nLater, szRows, blElsewhere] :
         {std::tuple(false, false, 1800, "1 shown, 2 shown, ", true),
          {false, false, 1801, "1 shown, 2 shown, ", false},
          {false, true, 0, "1 shown due, 2 shown due, ", false},
          {true, false, 0, "1, ", true},
          {true, true, 0, "1, ", false}}) {
        tavo::Record record = RecordOf("", "");
        record.Here() = {{{"TCP", 1}, {kBox, 1, "tavo:a", true, 3600, 1000}},
                         {{"TCP", 2}, {"192.168.1.4", 2, "tavo:a", true, 3600, 1000}}};
        tavo::Habits habit{.mapElsewhere = {{{"TCP", 3}, "offered 4"}}, .nElsewhereSince = 1000};
        Forget(record, habit, kBox, blRestarted, blDoubtful, 1000 + nLater);
        std::string szLeft;
        for (const auto& [key, made] : record.Here()) {
            szLeft +=
                std::to_string(key.second) + (made.blShown ? " shown" : "") + (made.blBefore ? " due" : "") + ", ";
        }
        EXPECT_EQ(szLeft, szRows);
        EXPECT_EQ(habit.mapElsewhere.size(), blElsewhere ? 1U : 0U);
        EXPECT_EQ(habit.nElsewhereSince, blElsewhere ? 1000 : 1000 + nLater);
    }
}

// Often after a change, seldom in peace; a router that fails is looked for anew at every third time.
TEST(Keeper, LooksSoonAfterAChangeAndSeldomInPeace) {
    // Whether it fails and whether something changes, when the pass itself is due, the seconds, whether one is lost.
    const std::tuple<bool, bool, int, int, bool> rgPasses[] = {
        {false, true, 0, 10, false}, {false, false, 0, 20, false},  {false, false, 0, 40, false},
        {false, false, 7, 7, false}, {false, false, 0, 120, false}, {false, false, 0, 120, false},
        {true, false, 0, 10, false}, {true, false, 0, 10, false},   {true, false, 0, 10, true},
        {true, false, 0, 10, false}, {false, false, 0, 10, false},  {false, false, 500, 20, false},
        {true, false, 0, 10, false}, {true, false, 0, 10, false},   {false, true, 3, 3, false}};
    tavo::Keeper keeper;
    for (const auto& [blFails, blChange, nDue, nSeconds, blLost] : rgPasses) {
        tavo::PassResult result;
        result.transport = {blFails ? tavo::Reply::kTimeout : tavo::Reply::kOk};
        result.nNextSeconds = nDue;
        const tavo::NextLook next = keeper.After(result, blChange, 120);
        EXPECT_EQ(std::pair(next.nSeconds, next.blLost), std::pair(nSeconds, blLost))
            << blFails << blChange << " " << nDue;
    }
    EXPECT_EQ(tavo::Keeper().After({}, false, 120).nSeconds, 10) << "the first one";
    EXPECT_EQ(tavo::Keeper().After({}, true, 1).nSeconds, 1) << "never longer than the user wants it";
}

// A box that slept past the time looks at once, and not after the rest of a wait: the timer goes by the clock that goes
// on in sleep.
TEST(BootTimer, GoesByTheBootClock) {
    tavo::BootTimer timer;
    const auto fnReady = [&timer](int nMilliseconds) {
        pollfd waiting{timer.Fd(), POLLIN, 0};
        return poll(&waiting, 1, nMilliseconds) == 1;
    };
    timer.Set(tavo::BootClock::now() + std::chrono::hours(1));
    EXPECT_FALSE(fnReady(0));
    for (const auto time : {tavo::BootClock::now() - std::chrono::hours(1), tavo::BootClock::time_point(),
                            tavo::BootClock::now() + std::chrono::milliseconds(5)}) {
        timer.Set(time);
        EXPECT_TRUE(fnReady(2000));
    }
    std::ifstream info("/proc/self/fdinfo/" + std::to_string(timer.Fd()));
    const std::string szInfo((std::istreambuf_iterator<char>(info)), std::istreambuf_iterator<char>());
    EXPECT_NE(szInfo.find("clockid: " + std::to_string(CLOCK_BOOTTIME)), std::string::npos) << szInfo;
}

TEST(Record, SurvivesAndKnowsRoutersAndBoots) {
    tavo::Record record = RecordOf("");
    record.Here()[{"TCP", 1}] = {kBox, 11, "\"odd\n]text", true, 100, 5000};
    record.TurnTo({"192.168.1.1", "cc:dd"});
    EXPECT_TRUE(record.Here().empty()) << "another device at the same address";
    record.Here()[{"UDP", 2}] = {kBox, 2, "tavo:b", true, 0, 5000};
    record.Here()[{"BOTH", 65000}] = {kBox, 3, "tavo:range", true, 0, 5000};
    record.Here()[{"BOTH", 65000}].nMore = 535;
    const std::string szText = record.Text();

    tavo::Record same(szText, "one");
    same.TurnTo({"10.0.0.1", "aa:bb"});  // the same device has another address
    ASSERT_EQ(same.Here().size(), 1U);
    tavo::Made& made = same.Here()[{"TCP", 1}];
    EXPECT_EQ(made.szText, "\"odd\n]text");
    for (const bool blShown : {true, false}) {  // until it is shown, what it leads to will do, or our mark
        made.blShown = blShown;
        EXPECT_TRUE(made.IsEntry(Entry(1, 11, kBox, "\"odd\n]text")));
        EXPECT_EQ(made.IsEntry(Entry(1, 11, kBox, "any")), !blShown);
        EXPECT_FALSE(made.IsEntry(Entry(1, 12, kBox, "\"odd\n]text"))) << "the router may give it to everybody's";
        EXPECT_FALSE(made.IsEntry(Entry(1, 12, kBox, "any")));
        EXPECT_FALSE(made.IsEntry(Entry(1, 11, "192.168.1.9", "\"odd\n]text")));
    }
    made.szText = "tavo:a";
    EXPECT_TRUE(made.IsEntry(Entry(1, 12, kBox, "tavo:a")));
    EXPECT_EQ(std::make_tuple(made.IsDue(5049), made.IsDue(5050), made.End()), std::make_tuple(false, true, 5100));

    tavo::Record later(szText, "two");
    later.TurnTo({"192.168.1.1", "aa:bb"});
    EXPECT_TRUE((later.Here()[{"TCP", 1}].IsDue(0)));
    later.TurnTo({"10.9.9.9", "ee:ff"});
    later.Prune(100 + 60);
    EXPECT_EQ(tavo::Record(later.Text(), "two").Text(), later.Text());
    later.Prune(100 + 61);
    later.TurnTo({"192.168.1.1", "aa:bb"});
    EXPECT_TRUE(later.Here().empty()) << "its lease has surely ended, whenever it was asked for";
    later.TurnTo({"192.168.1.1", "cc:dd"});
    EXPECT_EQ(later.Here().size(), 2U) << "these never end";
    EXPECT_EQ((later.Here()[{"BOTH", 65000}].nMore), 535);
    tavo::Record older(
        "[boot]\nid=x\n\n[r]\ngateway=10.9.9.9\nprotocol=TCP\nrouter_port=1\nbox_port=1\n"
        "client=192.168.1.5\nother_port=9\n",
        "x");
    older.TurnTo({"10.9.9.9", ""});
    EXPECT_EQ(older.Here().at({"TCP", 1}).other, (tavo::Target{kBox, 9})) << "earlier versions knew of no other client";
    EXPECT_EQ(tavo::Record("[boot]\nid=\"x\"\n[broken\nprotocol=\"TCP\"\n", "x").Text(), "");
}

using Names = std::vector<std::string>;

TEST(Mapping, WhatARouterThatCannotBeAskedMayStillHaveIsNamed) {
    tavo::Record record = RecordOf("", "");
    record.Here() = {{{"TCP", 1}, {kBox, 1, "tavo:a"}},
                     {{"TCP", 2}, {kBox, 2, "tavo:wanted"}},
                     {{"TCP", 3}, {kBox, 3, "tavo:over", true, 100, 1000}},
                     {{"TCP", 4}, {kBox, 4, "tavo:moved"}}};
    for (const bool blForm : {false, true}) {
        Names rgszNames;
        for (const tavo::Outcome& left :
             tavo::LeftOnRecord(record, {Entry(2, 2, "", "tavo:wanted"), Entry(4, 5, "", "tavo:moved")},
                                {.blForm = blForm}, {tavo::Reply::kUnreachable, "noigd"}, 2000)) {
            EXPECT_TRUE(left.blLeftOver && left.verdict.enState == tavo::PortState::kUnknown);
            rgszNames.push_back(left.szName + " " + left.verdict.szWord);
        }
        EXPECT_EQ(rgszNames, blForm ? (Names{"1/tcp noigd", "4/tcp noigd"}) : Names{"1/tcp noigd"})
            << "a form has an entry beside the one that is to take its place";
    }
}

TEST(Record, LosesTheRowsThatCannotBeReadAndNoOther) {
    tavo::Record record = RecordOf("");
    for (const uint16_t nPort : {uint16_t{1}, uint16_t{2}, uint16_t{3}}) {
        record.Here()[{"TCP", nPort}] = {kBox, nPort, "tavo:a", true, 100, 5000};
    }
    const std::string szText = record.Text();
    const auto fnWith = [&szText](const std::string& szOld, size_t nOld, const std::string& szNew) {
        return RecordOf(std::string(szText).replace(szText.find(szOld), nOld, szNew));
    };
    for (const auto& [szOld, szNew, szLeft] : {std::tuple("more=\"0\"", "more=\"65534\"", "1+65534 2 3"),
                                               {"more=\"0\"", "more=\"65535\"", "2 3"},  // beyond the last port
                                               {"router_port=\"3\"", "router_port=\"0\"", "1 2"},
                                               {"box_port=\"3\"", "box_port=\"0\"", "1 2"},
                                               {"protocol=\"TCP\"", "protocol=\"ICMP\"", "2 3"}}) {
        EXPECT_EQ(PlacesIn(fnWith(szOld, std::string(szOld).size(), szNew).Here()), szLeft) << szNew;
    }
    for (const char* szDamaged : {"[192.168.1.1 TCP 2]", "router_port=\"2\"", "protocol=\"TCP\"\nrouter_port=\"2\""}) {
        tavo::Record damaged = fnWith(szDamaged, 8, std::string("\0\xff\x1b\"=[\\q", 8));
        EXPECT_EQ(PlacesIn(damaged.Here()), "1 3") << szDamaged;
    }
    for (const char* szAsked : {"-9223372036854775808", "9223372036854775807", "99999999999999999999"}) {
        EXPECT_TRUE((fnWith("5000", 4, szAsked).Here()[{"TCP", 1}].IsDue(6000))) << szAsked;
    }
}

// Within a bound, and what may have no lease for however long.
TEST(Record, OfOtherRoutersIsKept) {
    for (const auto& [nRows, blShown, nLease, nPrunedAt, nKept] :
         {std::tuple(5000, true, 0U, 0, 4096U), {1, false, 100U, 5000 + 100 + 30 * 24 * 60 * 60, 1U}}) {
        tavo::Record record = RecordOf("");
        for (int i = 1; i <= nRows; ++i) {
            record.Here()[{"TCP", static_cast<uint16_t>(i)}] = {kBox, 1, "tavo:a", blShown, nLease, 5000};
        }
        record.TurnTo({"192.168.1.1", "cc:dd"});
        record.Prune(nPrunedAt);
        record.TurnTo({"192.168.1.1", "aa:bb"});
        EXPECT_EQ(record.Here().size(), nKept);
    }
}

// Every port of both protocols, with texts as long as a router may show them.
TEST(Record, OfEveryPortIsReadBack) {
    constexpr char kFile[] = "/var/lib/tavo/every_port.conf";
    {
        tavo::MadeFile file(kFile);
        file.Get().TurnTo({"192.168.100.100", "aa:bb:cc:dd:ee:ff"});
        for (int i = 1; i <= 65535; ++i) {
            for (const char* szProtocol : {"TCP", "UDP"}) {
                const auto nPort = static_cast<uint16_t>(i);
                file.Get().Here()[{szProtocol, nPort}] = {kBox, nPort, std::string(256, 'x'), true, 3600, 5000};
            }
        }
        file.Save();
    }
    tavo::MadeFile again(kFile);
    again.Get().TurnTo({"192.168.100.100", "aa:bb:cc:dd:ee:ff"});
    EXPECT_EQ(again.Get().Here().size(), 2U * 65535U);
    // What has not changed is not written: neither what was read nor what was saved.
    ino_t nWritten = InodeOf(kFile);
    EXPECT_TRUE(again.Save());
    EXPECT_EQ(InodeOf(kFile), nWritten);
    again.Get().Here().erase({"TCP", 1});
    EXPECT_TRUE(again.Save());
    EXPECT_NE(InodeOf(kFile), std::exchange(nWritten, InodeOf(kFile)));
    EXPECT_TRUE(again.Save());
    EXPECT_EQ(InodeOf(kFile), nWritten);
    std::remove(kFile);
}

// Some do not say what they refuse: what is taken without a lease, twice, tells; one port that is refused in any case
// does not, nor a refusal by itself.
TEST(Mapping, ARefusalOfALeaseIsLearntFromWhatIsTakenWithoutOne) {
    // The ports that are refused whatever is asked; of the first askings those that are refused with a lease; what
    // becomes of four ports; the askings; what is learnt.
    const std::tuple<int, int, std::string, int, bool> rgCases[] = {{0, 99, "1 1 1 1 ", 2 + 2 + 1 + 1, true},
                                                                    {0, 1, "1 1 1 1 ", 2 + 1 + 1 + 1, false},
                                                                    {1, 99, "501 1 1 1 ", 2 + 2 + 2 + 1, true},
                                                                    {1, 0, "501 1 1 1 ", 2 + 1 + 1 + 1, false},
                                                                    {4, 99, "501 501 501 501 ", 2 + 2 + 2 + 1, false}};
    for (const auto& [nRefused, nNoLease, szWords, nAsked, blPermanentOnly] : rgCases) {
        MemoryRouter router;
        int nAdds = 0;
        router.mFnAdd = [&, nRefused = nRefused, nNoLease = nNoLease](const RouterMapping& mapping) {
            ++nAdds;
            const bool blRefused = mapping.nRouterPort <= nRefused || (mapping.nLease != 0 && nAdds <= nNoLease);
            return blRefused ? std::optional(IgdReply(501)) : std::nullopt;
        };
        Core core;
        std::string szSaid;
        for (const tavo::Outcome& outcome : core.Run(router, Wanted(4)).rgOutcomes) {
            szSaid += outcome.verdict.szWord + " ";
        }
        EXPECT_EQ(szSaid, szWords);
        EXPECT_EQ(nAdds, nAsked) << szWords << nNoLease;
        EXPECT_EQ(core.habit.blPermanentOnly, blPermanentOnly) << szWords << nNoLease;
    }
}

// Each line of a router has a table of its own. What was made before lines were told apart is of whichever is in use.
TEST(Record, TheLinesOfARouterHaveRowsOfTheirOwn) {
    const auto fnRow = [](const char* szLine, int nPort) {
        const std::string szPort = std::to_string(nPort);
        return std::string("[") + szLine + szPort + "]\ngateway=g\nhardware=aa\nline=" + szLine +
               "\nprotocol=TCP\nrouter_port=" + szPort + "\nbox_port=1\nclient=c\ntext=t\nshown=yes\nlease=0\n";
    };
    tavo::Record record(fnRow("", 1) + fnRow("/a", 2) + fnRow("/b", 3), "");
    const auto fnAt = [&](const char* szLine) {
        record.TurnTo({"g", "aa", szLine});
        std::string szSeen;
        for (const auto& [key, made] : record.Here()) {
            szSeen += std::to_string(key.second);
        }
        for (const std::string& szOther : record.OtherLines()) {
            szSeen += " " + szOther;
        }
        return szSeen + (record.HasRows() ? "" : " none");
    };
    EXPECT_EQ(fnAt("/a"), "12 /b");
    record = tavo::Record(record.Text(), "");
    EXPECT_EQ(fnAt("/c"), " /a /b");
    EXPECT_EQ(fnAt("/b"), "3 /a");
    EXPECT_EQ(fnAt("/a"), "12 /b");
    record.TurnTo({"g", "bb", "/a"});
    EXPECT_FALSE(record.HasRows());
}

// The neighbour's hardware is not always known. A pass without it must not make one router's rows another one's.
TEST(Record, ALookWithoutTheHardwareMixesNoRouters) {
    tavo::Record record("", "one");
    for (const char* szHardware : {"aa:bb", "cc:dd"}) {
        record.TurnTo({"192.168.1.1", szHardware});
        record.Here()[{"TCP", 1}] = {kBox, 1, szHardware, true, 0, 5000};
    }
    record.TurnTo({"192.168.1.1", ""});
    const std::string szFirst = record.Here()[{"TCP", 1}].szText;
    for (int i = 0; i < 3; ++i) {
        const std::string szText = record.Text();
        record.TurnTo({"192.168.1.1", ""});
        EXPECT_EQ((record.Here()[{"TCP", 1}].szText), szFirst) << "the same at each pass";
        EXPECT_EQ(record.Text(), szText);
    }
    for (const char* szHardware : {"aa:bb", "cc:dd", "aa:bb"}) {
        record.TurnTo({"192.168.1.1", szHardware});
        ASSERT_EQ(record.Here().size(), 1U);
        EXPECT_EQ((record.Here()[{"TCP", 1}].szText), szHardware);
    }
}

// What a rule is called on the router, to a user, and as a key; each text with what it is cut at.
TEST(Rules, TheirTextsAreHarmlessAndOfALengthThatIsKept) {
    const std::string szLong(300, 'x');
    for (const auto& [szService, szRouter, szTitle] :
         {std::tuple<std::string, std::string, std::string>{"web", "web", "web"},
          {" ~\x7f\x1f", " ~__", " ~"},
          {szLong, szLong.substr(0, 55), szLong.substr(0, 200)}}) {
        const tavo::RuleText rule{szService, "tcp", "1=2#" + szLong, ""};
        EXPECT_EQ(tavo::MappingDescription(rule), tavo::kOwnPrefix + szRouter);
        EXPECT_EQ(tavo::RuleTitle(rule), szTitle);
        EXPECT_EQ(tavo::RuleName(rule), "1_2_" + szLong.substr(0, 196));
    }
}

TEST(Rules, EachOutcomeHasANameOfItsOwn) {
    std::vector<tavo::RuleText> rgRules;
    for (const char* szBoxPorts : {"1-2", "9", "8", "7", "1-3"}) {
        rgRules.push_back({"web", "tcp", "9", szBoxPorts});
    }
    const tavo::WantedSet wanted = tavo::Expand(rgRules);
    ASSERT_EQ(wanted.rgMappings.size(), 1U);
    std::vector<std::string> rgszNames = {MappingName(wanted.rgMappings.front()) + " " + wanted.rgszRules.front()};
    for (const tavo::Outcome& outcome : wanted.rgRefused) {
        rgszNames.push_back(outcome.szName + " " + outcome.verdict.szWord);
    }
    EXPECT_EQ(rgszNames, (std::vector<std::string>{"9/tcp web", "9/tcp (web) invalid", "9/tcp (web, 2) duplicate",
                                                   "9/tcp (web, 3) duplicate", "9/tcp (web, 4) invalid"}));
}

TEST(Rules, AreTakenApartPairByPair) {
    using M = tavo::SingleMapping;
    EXPECT_EQ(*tavo::ExpandRule("ALL", "80", "8080"), (std::vector<M>{{"TCP", 80, 8080}, {"UDP", 80, 8080}}));
    EXPECT_EQ(*tavo::ExpandRule(" Udp", "65535", "1"), (std::vector<M>{{"UDP", 65535, 1}}));
    for (const char* szBoth : {"both", "TCP_UDP"}) {
        EXPECT_EQ(tavo::ExpandRule(szBoth, "65534-65535", "1,2")->size(), 4U);
    }
    EXPECT_EQ(*tavo::ExpandRule("tcp", "12-10, 1", "20-22,7"),
              (std::vector<M>{{"TCP", 10, 20}, {"TCP", 11, 21}, {"TCP", 12, 22}, {"TCP", 1, 7}}));
    const char* rgszBad[][3] = {{"tcp", "1-3", "1-2"}, {"icmp", "1", "1"}, {"tcp", "", ""},    {"tcp", "0", "1"},
                                {"tcp", "65536", "1"}, {"tcp", "1x", "1"}, {"tcp", "1,", "1"}, {"tcp", "1-", "1"},
                                {"tcp", "1", "65536"}, {"tcp", "-1", "1"}};
    for (const auto& rgszRule : rgszBad) {
        EXPECT_FALSE(tavo::ExpandRule(rgszRule[0], rgszRule[1], rgszRule[2])) << rgszRule[1];
    }
}

// 204 ports take 1,019 bytes, so that the rest is what a cut leaves of the next ones.
std::string LongList(const std::string& szRest) {
    std::string szPorts;
    for (int nPort = 1001; nPort < 1408; nPort += 2) {
        szPorts += std::to_string(nPort) + ",";
    }
    return szPorts.substr(0, szPorts.size() - 1) + szRest;
}

TEST(Rules, WhatACutListNamesAtItsEndIsNotAskedFor) {
    ASSERT_EQ(LongList("").size(), 1019U);
    const std::tuple<std::string, std::string, size_t, bool> rgCases[] = {
        {LongList(",443"), LongList(",443"), 204, true},     // of 4433, perhaps
        {LongList(",5-9"), LongList(",5-9"), 204, true},     // of 5-9000, perhaps
        {LongList(",44,"), LongList(",44,"), 205, true},     // between two
        {LongList(",443"), LongList(",44,45"), 204, true},   // the sides are cut at different places
        {LongList(",44"), LongList(",44"), 205, false},      // a byte is left
        {LongList(",4433"), LongList(",4433"), 205, false},  // written by hand, and whole
    };
    for (const auto& [szRouter, szBox, nPairs, blCut] : rgCases) {
        const auto rgPairs = tavo::ExpandRule("tcp", szRouter, szBox);
        ASSERT_TRUE(rgPairs) << szRouter;
        EXPECT_EQ(rgPairs->size(), nPairs) << szRouter;
        const tavo::WantedSet wanted = tavo::Expand({{"1", "tcp", szRouter, szBox}});
        EXPECT_EQ(wanted.rgMappings.size(), nPairs);
        ASSERT_EQ(wanted.rgRefused.size(), blCut ? 1U : 0U);
        EXPECT_TRUE(!blCut || wanted.rgRefused[0].verdict.szWord == "cut");
    }
}

// A router under test: some ports conflict, and some answers are lost after the work was done.
class OddRouter : public MemoryRouter {
public:
    using MemoryRouter::MemoryRouter;
    RouterReply Add(RouterMapping& mapping) override {
        if (mSetConflicts.contains(mapping.nRouterPort)) {
            return IgdReply(tavo::kIgdConflict);
        }
        for (const auto& [key, entry] : mMapTable) {  // as strict as any: no two lead to one port of the box
            if (key.second != mapping.nRouterPort && entry.nBoxPort == mapping.nBoxPort && entry.szClient == kBox) {
                return IgdReply(501);
            }
        }
        return Lose(MemoryRouter::Add(mapping));
    }
    RouterReply Remove(const RouterMapping& mapping) override { return Lose(MemoryRouter::Remove(mapping)); }
    RouterReply Get(const std::string& szProtocol, uint16_t nPort, RouterMapping& mapping) override {
        return Lose(MemoryRouter::Get(szProtocol, nPort, mapping));
    }
    std::set<uint16_t> mSetConflicts;
    int mNLoseEvery = 0;
    bool mBlSilent = false;

private:
    RouterReply Lose(RouterReply reply) {
        const bool blLost = mBlSilent || (mNLoseEvery != 0 && ++mNAnswers % mNLoseEvery == 0);
        return blLost ? IgdReply(tavo::kWireTimeout) : std::move(reply);
    }
    int mNAnswers = 0;
};

std::vector<tavo::TestRule> TestRules(int nRules) {
    std::vector<tavo::TestRule> rgRules;
    for (int i = 10; i < 10 + nRules; ++i) {
        rgRules.push_back({static_cast<uint16_t>(i), static_cast<uint16_t>(i), false, ""});
    }
    return rgRules;
}

std::string TestPlaces(std::map<tavo::MappingKey, RouterMapping> mapTable) {
    std::erase_if(mapTable, [](const auto& row) { return !row.second.szDescription.starts_with("tavotest:"); });
    return PlacesIn(mapTable);
}

const auto kAnyPort = [](uint16_t) { return true; };
const auto kGoOn = [] { return false; };

TEST(TestMappings, TakeOnlyWhatNobodyHasAndLeaveTheTableAsItWas) {
    for (const int nListCode : {static_cast<int>(tavo::kWireOk), 401}) {
        for (const int nLoseEvery : {0, 3}) {
            SCOPED_TRACE(nListCode + nLoseEvery);
            OddRouter router("11>1=tavo:rule 12@9=tavotest:12 13>3=game");
            const std::string szBefore = PlacesIn(router.mMapTable);
            router.mSetConflicts = {15};
            router.mNListCode = nListCode;
            router.mNLoseEvery = nLoseEvery;
            if (nListCode == tavo::kWireOk) {
                router.Put(Entry(40, 40, kBox, "tavotest:40"));  // of one that was killed
            }
            tavo::TestMappings test(router, kBox, TestRules(4), [](uint16_t nPort) { return nPort != 16; });
            EXPECT_TRUE(test.Add(kGoOn));
            if (nListCode == tavo::kWireOk) {
                EXPECT_EQ(TestPlaces(router.mMapTable), "10 12@9 14 17 18");
            }
            EXPECT_TRUE(test.Readd(kGoOn));
            EXPECT_TRUE(test.Change(kGoOn));
            if (nListCode == tavo::kWireOk) {
                EXPECT_EQ(TestPlaces(router.mMapTable), "10>14 12@9 14>17 17>18 18>10");
            }
            EXPECT_TRUE(test.Remove(kGoOn));
            EXPECT_EQ(PlacesIn(router.mMapTable), szBefore);
        }
    }
}

TEST(TestMappings, NeverTouchAPortThatBecameAnotherHosts) {
    OddRouter router;
    tavo::TestMappings test(router, kBox, TestRules(3), kAnyPort);
    ASSERT_TRUE(test.Add(kGoOn));
    router.mMapTable[{"TCP", 11}].szClient = "192.168.1.9";  // the router restarted, and another host was faster
    EXPECT_TRUE(test.Remove(kGoOn));
    EXPECT_EQ(PlacesIn(router.mMapTable), "11@9");
}

TEST(TestMappings, ARouterThatFallsSilentFailsSoon) {
    for (bool (tavo::TestMappings::*pfnStep)(const std::function<bool()>&) :
         {&tavo::TestMappings::Add, &tavo::TestMappings::Readd, &tavo::TestMappings::Change,
          &tavo::TestMappings::Remove}) {
        OddRouter router;
        tavo::TestMappings test(router, kBox, TestRules(60), kAnyPort);
        ASSERT_TRUE(test.Add(kGoOn));
        router.mBlSilent = true;
        router.mNListCode = tavo::kWireTimeout;
        router.mNCalls = 0;
        EXPECT_FALSE((test.*pfnStep)(kGoOn));
        EXPECT_LE(router.mNCalls, 4);
    }
}

TEST(TestMappings, OneThatIsKeptIsChangedToo) {
    OddRouter router;
    tavo::TestMappings test(router, kBox, TestRules(1), kAnyPort);
    ASSERT_TRUE(test.Add(kGoOn));
    EXPECT_TRUE(test.Change(kGoOn));
    EXPECT_EQ(PlacesIn(router.mMapTable), "10>11");
}

}  // namespace
