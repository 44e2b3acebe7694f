// The steps of a router's test on its table. Relies on a Router. Promises: see TestMappings.h.
#include "programs/upnpd/TestMappings.h"

#include <algorithm>

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

// What the router's table holds of ours, and which ports are taken. The router's code, or why it gave none.
int TestMappings::ReadTable(std::vector<RouterMapping>& rgOwn) {
    std::vector<RouterMapping> rgTable;
    const int nCode = mRouter.List(rgTable);
    mBlTableRead = nCode == kRouterOk;
    mSetHeld.clear();
    for (const RouterMapping& entry : rgTable) {
        if (entry.szProtocol == kProtocol) {
            mSetHeld.insert(entry.nRouterPort);
        }
        if (IsTestMapping(entry, mSzBox)) {
            rgOwn.push_back(entry);
        }
    }
    return nCode;
}

bool TestMappings::CleanUp(const Stop& fnStop) {
    Step step(fnStop);
    std::vector<RouterMapping> rgOwn;
    if (const int nCode = ReadTable(rgOwn); nCode != kRouterOk && nCode != kRouterTooLong) {
        return nCode > 0;  // a router that cannot show its table has nothing that we could know of
    }
    if (rgOwn.empty()) {
        return true;
    }
    for (const RouterMapping& entry : rgOwn) {
        if (step.guard.IsOver()) {
            return false;
        }
        step.guard.Note(mRouter.Remove(entry.szProtocol, entry.nRouterPort));
    }
    rgOwn.clear();
    if (step.guard.IsOver()) {
        return false;
    }
    const int nCode = ReadTable(rgOwn);
    return (nCode >= 0 || nCode == kRouterTooLong) && rgOwn.empty();
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

int TestMappings::Ask(const TestRule& rule) {
    RouterMapping mapping{
        kProtocol, rule.nRouterPort, rule.nBoxPort, mSzBox, kTestPrefix + std::to_string(rule.nRouterPort), 0, true};
    return AddWithLease(mRouter, mapping, mHabit);
}

// Asks for a rule's mapping, on another port where somebody else has this one.
int TestMappings::AskSomewhere(Step& step, TestRule& rule) {
    int nCode = kRouterConflict;
    while (nCode == kRouterConflict && step.nConflicts < kMostConflicts && !step.guard.IsOver()) {
        if (!Choose(rule)) {
            rule.szResult = kNoPort;
            return kRouterConflict;
        }
        RouterMapping entry;
        if (!mBlTableRead && step.guard.Note(mRouter.Get(kProtocol, rule.nRouterPort, entry)) <= kRouterOk) {
            ++step.nConflicts;
            rule.szResult = kUntried;  // somebody has it, or nobody knows
            continue;
        }
        nCode = step.guard.Note(Ask(rule));
        step.nConflicts += nCode == kRouterConflict ? 1 : 0;
        rule.szResult = nCode == kRouterOk ? kMade : CodeText(nCode);
    }
    return nCode;
}

// False when the router does not say.
bool TestMappings::IsShown(Step& step, const TestRule& rule, bool& blShown) {
    while (!step.guard.IsOver()) {
        if (step.guard.Note(ShowsRule(mRouter, rule, mSzBox, blShown)) >= kRouterOk) {
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
        step.nRefused = AskSomewhere(step, rule) > kRouterOk ? step.nRefused + 1 : 0;
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
        const int nCode = step.guard.Note(Ask(*pRule));
        pRule->szResult = nCode == kRouterOk ? kMade : CodeText(nCode);
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
        const int nCode = step.guard.Note(Ask(*rgpChanged[i]));
        rgpChanged[i]->szResult = nCode == kRouterOk ? kMade : CodeText(nCode);
    }
    return ReadBack(step, rgpChanged) &&
           std::all_of(rgpChanged.begin(), rgpChanged.end(), [](const TestRule* pRule) { return pRule->blKept; });
}

// Takes a rule's mapping away, when the entry at its port is that one. False when the router was not heard.
bool TestMappings::RemoveRule(Step& step, const TestRule& rule) {
    while (!step.guard.IsOver()) {
        RouterMapping entry;
        int nCode = step.guard.Note(mRouter.Get(kProtocol, rule.nRouterPort, entry));
        if (nCode > kRouterOk) {
            return true;
        }
        const bool blOurs =
            entry.szClient == mSzBox && (entry.nBoxPort == rule.nBoxPort || IsTestMapping(entry, mSzBox));
        if (nCode == kRouterOk && blOurs) {
            nCode = step.guard.Note(mRouter.Remove(kProtocol, rule.nRouterPort));
        }
        if (nCode >= kRouterOk) {
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
