// Compares before it writes: an unchanged set costs one listing. Relies on a Router.
// Reads back what it wrote in batches, because a router reads its own table faster while nobody writes
// to it, and some show a whole range at once. Promises: see Reconcile.h.
#include "daemons/common/Reconcile.h"

#include <algorithm>
#include <chrono>
#include <map>
#include <optional>
#include <utility>

#include "daemons/common/Wanted.h"

namespace tavo {

namespace {

constexpr auto kReadBackAfter = std::chrono::seconds(20);  // a slow router's yes is not left open for longer
constexpr int kRangeFrom = 4;                              // a range costs a request a protocol
constexpr char kWritten[] = "written";                     // the router said yes, and has not shown it yet
constexpr size_t kMaxDescription = 64;                     // of somebody else's entry

using Key = std::pair<std::string, uint16_t>;

Key KeyOf(const RouterMapping& mapping) {
    return {mapping.szProtocol, mapping.nRouterPort};
}

class Pass {
public:
    Pass(Router& router, const std::string& szBox, LeaseHabit& habit, bool blRenew, const std::function<bool()>& fnStop)
        : mRouter(router), mSzBox(szBox), mHabit(habit), mBlRenew(blRenew), mGuard(mResult, fnStop) {}

    PassResult Run(const std::vector<RouterMapping>& rgWanted);

private:
    bool IsOver() { return mGuard.IsOver(); }
    int Note(int nCode) { return mGuard.Note(nCode); }
    bool IsOwn(const RouterMapping& mapping) const {
        return mapping.szClient == mSzBox && mapping.szDescription.starts_with(kOwnPrefix);
    }
    bool Serves(const RouterMapping& entry, const RouterMapping& wanted) const {
        return entry.szClient == mSzBox && entry.nBoxPort == wanted.nBoxPort && entry.blEnabled;
    }
    void RemoveUnwanted(const std::map<Key, RouterMapping>& mapWanted);
    Verdict InTheWay(const RouterMapping& entry) const;
    Verdict Place(const RouterMapping& wanted);
    Verdict Create(const RouterMapping& wanted);
    int AddOwn(RouterMapping mapping);
    std::map<Key, RouterMapping> ShowRanges(const std::vector<RouterMapping>& rgWanted);
    void ReadBack(const std::vector<RouterMapping>& rgWanted);
    Verdict Confirm(const RouterMapping& wanted, const std::map<Key, RouterMapping>& mapShown);
    Verdict AfterConflict(const RouterMapping& wanted);
    Verdict Open(const RouterMapping& entry);

    Router& mRouter;
    const std::string& mSzBox;
    LeaseHabit& mHabit;
    bool mBlRenew;
    std::map<Key, RouterMapping> mMapTable;
    std::map<Key, int> mMapKept;  // ours and unwanted, and the code with which the router kept it
    PassResult mResult;
    PassGuard mGuard;
    size_t mNRead = 0;  // statuses up to here are not kWritten
    std::chrono::steady_clock::time_point mReadBack = std::chrono::steady_clock::now();
};

// A mapping that the router showed.
Verdict Pass::Open(const RouterMapping& entry) {
    if (entry.nLease != 0 && (mResult.nShortestLease == 0 || entry.nLease < mResult.nShortestLease)) {
        mResult.nShortestLease = entry.nLease;
    }
    return {PortState::kOpen, "1", {}, entry.nLease};
}

// A mapping that cannot be made because of another entry, and whose that is.
Verdict Pass::InTheWay(const RouterMapping& entry) const {
    Verdict verdict = Refusal(kRouterConflict);
    verdict.holder = Holder{entry.szClient, HarmlessText(entry.szDescription, kMaxDescription)};
    verdict.blOthers = entry.szClient == mSzBox;
    return verdict;
}

PassResult Pass::Run(const std::vector<RouterMapping>& rgWanted) {
    std::vector<RouterMapping> rgTable;
    const int nCode = mRouter.List(rgTable);
    if (nCode != kRouterOk) {
        mResult.nTransport = nCode < 0 ? nCode : kRouterOk;
        for (const RouterMapping& wanted : rgWanted) {
            mResult.rgOutcomes.push_back(OutcomeOf(wanted, Refusal(nCode)));
        }
        return mResult;
    }
    for (RouterMapping& entry : rgTable) {
        const Key key = KeyOf(entry);
        mMapTable.emplace(key, std::move(entry));
    }
    std::map<Key, RouterMapping> mapWanted;
    for (const RouterMapping& wanted : rgWanted) {
        mapWanted.emplace(KeyOf(wanted), wanted);
    }
    RemoveUnwanted(mapWanted);
    for (const RouterMapping& wanted : rgWanted) {
        mResult.rgOutcomes.push_back(OutcomeOf(wanted, IsOver() ? Refusal(mResult.nTransport) : Place(wanted)));
        if (std::chrono::steady_clock::now() - mReadBack > kReadBackAfter) {
            ReadBack(rgWanted);
        }
    }
    ReadBack(rgWanted);
    for (const auto& [key, nKept] : mMapKept) {
        if (!mapWanted.contains(key)) {
            Outcome outcome = OutcomeOf(mMapTable[key], Refusal(nKept));
            outcome.blLeftOver = true;
            outcome.verdict.nLease = mMapTable[key].nLease;
            mResult.rgOutcomes.push_back(std::move(outcome));
        }
    }
    return mResult;
}

// Takes away what we made and the rules no longer ask for.
void Pass::RemoveUnwanted(const std::map<Key, RouterMapping>& mapWanted) {
    for (auto it = mMapTable.begin(); it != mMapTable.end() && !IsOver();) {
        const auto wanted = mapWanted.find(it->first);
        if (!IsOwn(it->second) || (wanted != mapWanted.end() && Serves(it->second, wanted->second))) {
            ++it;
            continue;
        }
        const int nCode = Note(mRouter.Remove(it->first.first, it->first.second));
        if (nCode == kRouterOk || nCode == kRouterNoSuchEntry) {
            it = mMapTable.erase(it);
        } else {
            mMapKept.emplace(it->first, nCode);
            ++it;
        }
    }
}

Verdict Pass::Place(const RouterMapping& wanted) {
    const auto it = mMapTable.find(KeyOf(wanted));
    if (it == mMapTable.end()) {
        return Create(wanted);
    }
    if (!Serves(it->second, wanted)) {
        const auto kept = mMapKept.find(it->first);
        return kept == mMapKept.end() ? InTheWay(it->second) : Refusal(kept->second);
    }
    if (!IsOwn(it->second)) {
        Verdict verdict{PortState::kOpen, "1", {}, it->second.nLease};
        verdict.blOthers = true;  // and it is that program's to renew
        return verdict;
    }
    const bool blDue = mBlRenew && it->second.nLease != 0;
    if (blDue && Note(AddOwn(wanted)) == kRouterOk) {
        return {PortState::kOpen, kWritten};
    }
    return Open(it->second);
}

Verdict Pass::Create(const RouterMapping& wanted) {
    const int nCode = Note(AddOwn(wanted));
    if (nCode == kRouterConflict) {
        return AfterConflict(wanted);
    }
    Verdict verdict = nCode == kRouterOk ? Verdict{PortState::kOpen, kWritten} : Refusal(nCode);
    verdict.blAnew = nCode == kRouterOk;
    return verdict;
}

int Pass::AddOwn(RouterMapping mapping) {
    mapping.szClient = mSzBox;
    return AddWithLease(mRouter, std::move(mapping), mHabit);
}

// What the router shows of what was written, where it can show ranges; may be incomplete.
std::map<Key, RouterMapping> Pass::ShowRanges(const std::vector<RouterMapping>& rgWanted) {
    std::map<std::string, std::pair<uint16_t, uint16_t>> mapRanges;
    int nWritten = 0;
    for (size_t i = mNRead; i < mResult.rgOutcomes.size(); ++i) {
        if (mResult.rgOutcomes[i].verdict.szWord == kWritten) {
            const uint16_t nPort = rgWanted[i].nRouterPort;
            auto& range = mapRanges.try_emplace(rgWanted[i].szProtocol, nPort, nPort).first->second;
            range = {std::min(range.first, nPort), std::max(range.second, nPort)};
            ++nWritten;
        }
    }
    std::map<Key, RouterMapping> mapShown;
    for (auto it = mapRanges.begin(); nWritten >= kRangeFrom && it != mapRanges.end() && !IsOver(); ++it) {
        std::vector<RouterMapping> rgShown;
        Note(mRouter.ListRange(it->first, it->second.first, it->second.second, rgShown));
        for (RouterMapping& shown : rgShown) {
            const Key key = KeyOf(shown);
            mapShown.emplace(key, std::move(shown));
        }
    }
    return mapShown;
}

// A router's yes is not enough: the mapping must be in its table, and be ours.
void Pass::ReadBack(const std::vector<RouterMapping>& rgWanted) {
    const std::map<Key, RouterMapping> mapShown = ShowRanges(rgWanted);
    for (; mNRead < mResult.rgOutcomes.size(); ++mNRead) {
        Verdict& verdict = mResult.rgOutcomes[mNRead].verdict;
        if (verdict.szWord == kWritten) {
            const bool blAnew = verdict.blAnew;
            verdict = Confirm(rgWanted[mNRead], mapShown);
            verdict.blAnew = blAnew && verdict.enState == PortState::kOpen;
        }
    }
    mReadBack = std::chrono::steady_clock::now();
}

Verdict Pass::Confirm(const RouterMapping& wanted, const std::map<Key, RouterMapping>& mapShown) {
    const auto it = mapShown.find(KeyOf(wanted));
    if (it != mapShown.end() && Serves(it->second, wanted)) {
        return Open(it->second);
    }
    if (IsOver()) {
        return Refusal(mResult.nTransport);
    }
    RouterMapping entry;
    const int nCode = Note(mRouter.Get(wanted.szProtocol, wanted.nRouterPort, entry));
    const Verdict lost{PortState::kRefused, "lost"};
    if (nCode == kRouterNoSuchEntry) {
        return lost;
    }
    if (nCode != kRouterOk) {
        return Refusal(nCode);
    }
    if (!Serves(entry, wanted)) {
        return entry.szClient == mSzBox ? lost : InTheWay(entry);
    }
    return Open(entry);
}

// The listing did not show who is in the way; ask for this port alone.
Verdict Pass::AfterConflict(const RouterMapping& wanted) {
    RouterMapping entry;
    if (Note(mRouter.Get(wanted.szProtocol, wanted.nRouterPort, entry)) != kRouterOk) {
        return Refusal(kRouterConflict);  // a router that guards its entries does not even show them
    }
    if (Serves(entry, wanted)) {
        Verdict verdict{PortState::kOpen, "1", {}, entry.nLease};
        verdict.blOthers = !IsOwn(entry);
        return verdict;
    }
    if (!IsOwn(entry) || Note(mRouter.Remove(wanted.szProtocol, wanted.nRouterPort)) != kRouterOk) {
        return InTheWay(entry);
    }
    const int nCode = Note(AddOwn(wanted));
    return nCode == kRouterOk ? Verdict{PortState::kOpen, kWritten} : Refusal(nCode);
}

}  // namespace

std::string CodeText(int nCode) {
    switch (nCode) {
        case kRouterOk:
            return "stopped";
        case kRouterTimeout:
            return "timeout";
        case kRouterUnreachable:
            return "unreachable";
        case kRouterGarbage:
            return "garbage";
        default:
            return std::to_string(nCode);
    }
}

Verdict Refusal(int nCode) {
    return {nCode > 0 ? PortState::kRefused : nCode == 0 ? PortState::kWaiting : PortState::kUnknown, CodeText(nCode)};
}

// Routers of the first generation know permanent mappings only; some say so, some call it bad arguments.
int AddWithLease(Router& router, RouterMapping mapping, LeaseHabit& habit) {
    mapping.nLease = habit.blPermanentOnly ? 0 : habit.nLease;
    int nCode = router.Add(mapping);
    if (mapping.nLease != 0 && (nCode == kRouterOnlyPermanentLeases || nCode == kRouterInvalidArgs)) {
        const bool blSaysSo = nCode == kRouterOnlyPermanentLeases;
        mapping.nLease = 0;
        nCode = router.Add(mapping);
        habit.blPermanentOnly = habit.blPermanentOnly || (nCode == kRouterOk || blSaysSo);
    }
    return nCode;
}

PassResult Reconcile(Router& router, const std::vector<RouterMapping>& rgWanted, const std::string& szBox,
                     LeaseHabit& habit, bool blRenew, const std::function<bool()>& fnStop) {
    return Pass(router, szBox, habit, blRenew, fnStop).Run(rgWanted);
}

}  // namespace tavo
