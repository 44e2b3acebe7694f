// The mappings by which a router is tested: made, changed and taken away like those of rules, on ports that
// nobody has. Relies on a Router and nothing else.
// Promises: a mapping counts as there only when the router showed it, and as gone only when it no longer does;
// a port that any entry of the router's table has is passed over; every step is bounded.
#pragma once

#include <functional>
#include <set>
#include <string>
#include <vector>

#include "mapping/Carry.h"
#include "mapping/Pass.h"
#include "wire/upnptest/TestRules.h"

namespace tavo {

class TestMappings {
public:
    using Stop = std::function<bool()>;
    // fnHold: takes a port of the box for the test; false when it is somebody else's.
    TestMappings(Router& router, std::string szBox, std::vector<TestRule> rgRules, std::function<bool(uint16_t)> fnHold)
        : mRouter(router), mSzBox(std::move(szBox)), mRgRules(std::move(rgRules)), mFnHold(std::move(fnHold)) {}

    // Takes away what an earlier test has left at the router. False when something of it stays.
    bool CleanUp(const Stop& fnStop);
    // Makes the mappings, for rules whose ports are not free on others. True when the router keeps some,
    // and was heard to the end.
    bool Add(const Stop& fnStop);
    // Makes those that were kept once more. True when all of them are there.
    bool Readd(const Stop& fnStop);
    // Has some lead to another port of the box, as upnpd does it. True when all of them do.
    bool Change(const Stop& fnStop);
    // Takes all away. True when none is left.
    bool Remove(const Stop& fnStop);

    const std::vector<TestRule>& Rules() const { return mRgRules; }

private:
    struct Step;
    RouterReply ReadTable(std::vector<RouterMapping>& rgOwn);
    bool IsTestMapping(const RouterMapping& entry) const;
    RouterMapping MappingOf(const TestRule& rule) const;
    bool Choose(TestRule& rule);
    RouterReply Ask(Step& step, TestRule& rule);
    RouterReply AskSomewhere(Step& step, TestRule& rule);
    bool IsShown(Step& step, const TestRule& rule, bool& blShown);
    bool ReadBack(Step& step, const std::vector<TestRule*>& rgpRules);
    bool RemoveRule(Step& step, const TestRule& rule);
    std::vector<TestRule*> Kept();

    Router& mRouter;
    std::string mSzBox;
    std::vector<TestRule> mRgRules;
    std::function<bool(uint16_t)> mFnHold;
    Habits mHabit;
    std::set<uint16_t> mSetHeld;  // TCP ports of the router that are somebody's
    bool mBlTableRead = false;    // else each port is asked for
    int mNNext = 0;               // the next port to try; 0: the first rule's
};

}  // namespace tavo
