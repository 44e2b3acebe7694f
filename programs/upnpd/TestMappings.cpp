// The steps of a router's test on its table. Relies on a Router. Promises: see TestMappings.h.
#include "programs/upnpd/TestMappings.h"

#include <algorithm>

#include "ground/Marks.h"
#include "mapping/Plan.h"

namespace tavo {

namespace {

constexpr char kProtocol[] = "TCP";
constexpr int kLastPort = 65535;
constexpr int kRefusalsOfAFullTable = 3;  // in a row, after which nothing more is asked for
constexpr int kMostConflicts = 20;        // ports that turn out to be taken, in one test
constexpr size_t kMostChanged = 8;
constexpr char kMade[] = "1";
constexpr char kLost[] = "lost";  // the router said yes, and does not show it
constexpr char kUntried[] = "untried";
constexpr char kNoPort[] = "noport";

// Whether the router was asked for a mapping, whatever it answered, or did not.
bool IsTried(const TestRule& rule) {
    return !rule.szResult.empty() && rule.szResult != kUntried && rule.szResult != kNoPort;
}

}  // namespace

struct TestMappings::Step {
    explicit Step(const Stop& fnStop) : guard(result, fnStop) {}
    PassResult result;
    PassGuard guard;
    int nRefused = 0;  // in a row
    int nConflicts = 0;
};

// What the router's table holds of ours, and which ports are taken.
RouterReply TestMappings::ReadTable(std::vector<RouterMapping>& rgOwn) {
    std::vector<RouterMapping> rgTable;
    RouterReply reply = mRouter.List(rgTable);
    mBlTableRead = reply.IsOk();
    mSetHeld.clear();
    for (const RouterMapping& entry : rgTable) {
        if (entry.szProtocol == kProtocol) {
            mSetHeld.insert(entry.nRouterPort);
        }
        if (IsTestMapping(entry)) {
            rgOwn.push_back(entry);
        }
    }
    return reply;
}

bool TestMappings::CleanUp(const Stop& fnStop) {
    Step step(fnStop);
    std::vector<RouterMapping> rgOwn;
    if (const RouterReply reply = ReadTable(rgOwn); !reply.IsOk() && reply.enReply != Reply::kTooLong) {
        return reply.IsRefusal();  // a router that cannot show its table has nothing that we could know of
    }
    if (rgOwn.empty()) {
        return true;
    }
    for (const RouterMapping& entry : rgOwn) {
        if (step.guard.IsOver()) {
            return false;
        }
        step.guard.Note(mRouter.Remove(entry));
    }
    rgOwn.clear();
    if (step.guard.IsOver()) {
        return false;
    }
    const RouterReply reply = ReadTable(rgOwn);
    return (!reply.IsSilence() || reply.enReply == Reply::kTooLong) && rgOwn.empty();
}

bool TestMappings::IsTestMapping(const RouterMapping& entry) const {
    return entry.szClient == mSzBox && entry.szDescription.starts_with(kTestPrefix);
}

RouterMapping TestMappings::MappingOf(const TestRule& rule) const {
    return {kProtocol, rule.nRouterPort, rule.nBoxPort, mSzBox, kTestPrefix + std::to_string(rule.nRouterPort), 0,
            true};
}

// The next port that nobody has, here or at the router.
bool TestMappings::Choose(TestRule& rule) {
    for (mNNext = mNNext == 0 ? rule.nRouterPort : mNNext; mNNext <= kLastPort; ++mNNext) {
        const auto nPort = static_cast<uint16_t>(mNNext);
        if (!mSetHeld.contains(nPort) && mFnHold(nPort)) {
            rule.nRouterPort = rule.nBoxPort = nPort;
            ++mNNext;
            return true;
        }
    }
    return false;
}

RouterReply TestMappings::Ask(Step& step, TestRule& rule) {
    RouterMapping mapping = MappingOf(rule);
    RouterReply reply = step.guard.Note(AddWithLease(mRouter, mapping, mHabit));
    rule.szResult = reply.IsOk() ? kMade : reply.szWord;
    return reply;
}

// Asks for a rule's mapping, on another port where somebody else has this one.
RouterReply TestMappings::AskSomewhere(Step& step, TestRule& rule) {
    RouterReply reply{Reply::kConflict};
    while (reply.enReply == Reply::kConflict && step.nConflicts < kMostConflicts && !step.guard.IsOver()) {
        if (!Choose(rule)) {
            rule.szResult = kNoPort;
            return reply;
        }
        RouterMapping entry;
        if (!mBlTableRead && !step.guard.Note(mRouter.Get(kProtocol, rule.nRouterPort, entry)).IsRefusal()) {
            ++step.nConflicts;
            rule.szResult = kUntried;  // somebody has it, or nobody knows
            continue;
        }
        reply = Ask(step, rule);
        step.nConflicts += reply.enReply == Reply::kConflict ? 1 : 0;
    }
    return reply;
}

// False when the router does not say.
bool TestMappings::IsShown(Step& step, const TestRule& rule, bool& blShown) {
    while (!step.guard.IsOver()) {
        RouterMapping entry;
        const RouterReply reply = step.guard.Note(mRouter.Get(kProtocol, rule.nRouterPort, entry));
        if (!reply.IsSilence()) {  // whatever it refuses an entry with, it does not show one
            blShown = reply.IsOk() && Serves(entry, MappingOf(rule), mSzBox);
            return true;
        }
    }
    return false;
}

// Which of them the router shows. False when it was not heard to the end.
bool TestMappings::ReadBack(Step& step, const std::vector<TestRule*>& rgpRules) {
    for (TestRule* pRule : rgpRules) {
        bool blShown = false;
        if (!IsShown(step, *pRule, blShown)) {
            return false;
        }
        pRule->blKept = blShown;
        if (blShown || pRule->szResult == kMade) {
            pRule->szResult = blShown ? kMade : kLost;
        }
    }
    return true;
}

bool TestMappings::Add(const Stop& fnStop) {
    Step step(fnStop);
    CleanUp(fnStop);
    std::vector<TestRule*> rgpTried;
    for (TestRule& rule : mRgRules) {
        rule.blKept = false;
        if (step.guard.IsOver() || step.nRefused >= kRefusalsOfAFullTable) {
            rule.szResult = kUntried;
            continue;
        }
        step.nRefused = AskSomewhere(step, rule).IsRefusal() ? step.nRefused + 1 : 0;
        if (IsTried(rule)) {
            rgpTried.push_back(&rule);
        }
    }
    return ReadBack(step, rgpTried) && !Kept().empty();
}

std::vector<TestRule*> TestMappings::Kept() {
    std::vector<TestRule*> rgpKept;
    for (TestRule& rule : mRgRules) {
        if (rule.blKept) {
            rgpKept.push_back(&rule);
        }
    }
    return rgpKept;
}

bool TestMappings::Readd(const Stop& fnStop) {
    Step step(fnStop);
    const std::vector<TestRule*> rgpKept = Kept();
    for (TestRule* pRule : rgpKept) {
        if (step.guard.IsOver()) {
            return false;
        }
        Ask(step, *pRule);
    }
    return ReadBack(step, rgpKept) && Kept().size() == rgpKept.size();
}

bool TestMappings::Change(const Stop& fnStop) {
    Step step(fnStop);
    std::vector<TestRule*> rgpChanged = Kept();
    rgpChanged.resize(std::min(rgpChanged.size(), kMostChanged));
    std::vector<uint16_t> rgPorts;  // each gets the next one's, so that no two lead to one port
    for (const TestRule* pRule : rgpChanged) {
        rgPorts.push_back(pRule->nBoxPort);
    }
    TestRule other;
    if (rgPorts.size() == 1 && Choose(other)) {
        rgPorts.front() = other.nBoxPort;
    }
    std::rotate(rgPorts.begin(), rgPorts.begin() + (rgPorts.empty() ? 0 : 1), rgPorts.end());
    for (const TestRule* pRule : rgpChanged) {
        if (!RemoveRule(step, *pRule)) {
            return false;
        }
    }
    for (size_t i = 0; i < rgpChanged.size() && !step.guard.IsOver(); ++i) {
        rgpChanged[i]->nBoxPort = rgPorts[i];
        Ask(step, *rgpChanged[i]);
    }
    return ReadBack(step, rgpChanged) &&
           std::all_of(rgpChanged.begin(), rgpChanged.end(), [](const TestRule* pRule) { return pRule->blKept; });
}

// Takes a rule's mapping away, when the entry at its port is that one. False when the router was not heard.
bool TestMappings::RemoveRule(Step& step, const TestRule& rule) {
    while (!step.guard.IsOver()) {
        RouterMapping entry;
        RouterReply reply = step.guard.Note(mRouter.Get(kProtocol, rule.nRouterPort, entry));
        if (reply.IsRefusal()) {
            return true;
        }
        const bool blOurs = entry.szClient == mSzBox && (entry.nBoxPort == rule.nBoxPort || IsTestMapping(entry));
        if (reply.IsOk() && blOurs) {
            reply = step.guard.Note(mRouter.Remove(entry));
        }
        if (!reply.IsSilence()) {
            return true;
        }
    }
    return false;
}

bool TestMappings::Remove(const Stop& fnStop) {
    Step step(fnStop);
    size_t nLeft = 0;
    for (const TestRule& rule : mRgRules) {
        if (IsTried(rule) && !RemoveRule(step, rule)) {
            return false;
        }
    }
    for (TestRule& rule : mRgRules) {
        bool blShown = false;
        if (IsTried(rule) && !IsShown(step, rule, blShown)) {
            return false;
        }
        rule.szResult = blShown ? "left over" : rule.szResult;
        nLeft += blShown ? 1 : 0;
    }
    return nLeft == 0;
}

}  // namespace tavo
