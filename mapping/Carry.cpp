// See Carry.h. Compares before it writes: an unchanged set costs one listing. Where the table cannot be listed, too
// long for its time or refused, our own places are asked for by name. What was written is read back in batches, because
// a router reads its own table faster while nobody writes to it, and some show a whole range at once.
#include "mapping/Carry.h"

#include <algorithm>
#include <iterator>
#include <limits>
#include <map>
#include <utility>

#include "mapping/Plan.h"

namespace tavo {

namespace {

constexpr int64_t kReadBackAfter = 20;  // seconds; a slow router's yes is not left open for longer
constexpr int kRangeFrom = 4;           // fewer are asked for one by one
constexpr int kRangePorts = 64;         // of one request
constexpr int kMostSteps = 4;           // about one place in one pass: look, take away, add, and one surprise
constexpr size_t kTogether = 512;       // wanted places that are looked at before the first of them is written
constexpr size_t kMostSaves = 8;        // of the record in one pass, however many they are
constexpr char kWritten[] = "written";  // the router said yes, and has not shown it yet
constexpr char kLost[] = "lost";        // the router said yes, and does not show it
constexpr size_t kMaxDescription = 64;  // of somebody else's entry
constexpr int64_t kRenewAgain = 60;     // seconds after a renewal that was refused
constexpr int64_t kAskAgain = 10;       // seconds after an answer that did not come
constexpr int64_t kLeastPause = 5;      // seconds between passes, whatever leases a router gives
constexpr int64_t kNever = std::numeric_limits<int64_t>::max();

// What this pass knows of a place, and what it has done about it.
struct Place {
    const RouterMapping* pWanted = nullptr;
    Seen enSeen = Seen::kUnknown;
    RouterMapping entry = {};
    bool blWritten = false;   // asked for in this pass, and not read back yet
    bool blReplaced = false;  // taken away, because the router said yes to a change and did not make it
    int nKept = kRouterOk;    // the router's code for what it did not take away
    Verdict verdict = {};
};

class Pass {
public:
    Pass(Router& router, Record& record, LeaseHabit& habit, const Surroundings& around)
        : mRouter(router),
          mRecord(record),
          mHabit(habit),
          mAround(around),
          mGuard(mResult, around.fnStop, around.fnNow) {}

    PassResult Run(const std::vector<RouterMapping>& rgWanted);

private:
    bool IsOver() { return mGuard.IsOver(); }
    int Note(int nCode);
    Made* MadeAt(const MappingKey& key);
    Step StepFor(const MappingKey& key, const Place& place);
    void Show(const RouterMapping& entry);
    void LookAtTable();
    int Look(const MappingKey& key, Place& place);
    void LookAt(const std::vector<MappingKey>& rgKeys);
    void TakeAway(const std::vector<MappingKey>& rgKeys);
    bool Remove(const MappingKey& key, Place& place);
    bool Intend(const MappingKey& key, const Place& place);
    void NoteIntents(const std::vector<MappingKey>& rgKeys);
    void Bring(const std::vector<MappingKey>& rgKeys);
    void Settle(const MappingKey& key, Place& place);
    bool Do(const MappingKey& key, Place& place, const Step& step);
    bool Add(const MappingKey& key, Place& place, bool blAnew);
    void OnRefused(const MappingKey& key, Place& place, int nCode);
    void ShowRanges();
    void ReadBack();
    void Confirm(const MappingKey& key, Place& place);
    Verdict Open(const MappingKey& key, const Place& place);
    Verdict InTheWay(const RouterMapping& entry) const;
    Verdict StillHeld(const MappingKey& key, int nCode);
    void Wake(int64_t nAt) { mNNext = std::min(mNNext, nAt); }
    void Conclude(const std::vector<RouterMapping>& rgWanted);

    Router& mRouter;
    Record& mRecord;
    LeaseHabit& mHabit;
    const Surroundings& mAround;
    std::map<MappingKey, Place> mMapPlaces;
    std::vector<MappingKey> mRgWritten;  // to be read back
    PassResult mResult;
    PassGuard mGuard;
    bool mBlSense = false;  // the router has answered at least one question of this pass with sense
    int64_t mNReadBack = 0;
    int64_t mNNext = kNever;
};

int Pass::Note(int nCode) {
    mBlSense = mBlSense || nCode == kRouterOk || nCode == kRouterNoSuchEntry || nCode == kRouterConflict;
    return mGuard.Note(nCode);
}

Made* Pass::MadeAt(const MappingKey& key) {
    const auto it = mRecord.Here().find(key);
    return it == mRecord.Here().end() ? nullptr : &it->second;
}

Step Pass::StepFor(const MappingKey& key, const Place& place) {
    const PlaceView view{place.pWanted, place.enSeen, place.enSeen == Seen::kPresent ? &place.entry : nullptr,
                         MadeAt(key)};
    return Decide(view, mAround.szBox, mAround.fnNow());
}

// Takes in what the router shows at a place. What it shows of ours is how we know it from then on.
void Pass::Show(const RouterMapping& entry) {
    Place& place = mMapPlaces[KeyOf(entry)];
    place.enSeen = Seen::kPresent;
    place.entry = entry;
    Made* pMade = MadeAt(KeyOf(entry));
    if (pMade == nullptr || !pMade->IsEntry(entry)) {
        return;
    }
    pMade->szText = entry.szDescription;
    pMade->nBoxPort = entry.nBoxPort;
    pMade->nOtherPort = 0;
    // How long a lease is shows right after it was granted; later listings show what is left of it, or nothing new.
    if (place.blWritten || !pMade->blShown) {
        pMade->nLease = pMade->nLease == 0 ? entry.nLease : std::min(pMade->nLease, entry.nLease);
    }
    pMade->blShown = true;
}

// What a table does not show may be there: it is read entry by entry, and whatever others take away or make meanwhile
// moves those that follow.
void Pass::LookAtTable() {
    std::vector<RouterMapping> rgTable;
    Note(mRouter.List(rgTable));
    for (const RouterMapping& entry : rgTable) {
        Show(entry);
    }
}

int Pass::Look(const MappingKey& key, Place& place) {
    RouterMapping entry;
    const int nCode = Note(mRouter.Get(key.first, key.second, entry));
    if (nCode == kRouterOk) {
        Show(entry);
    } else if (nCode > kRouterOk) {
        place.enSeen = nCode == kRouterNoSuchEntry ? Seen::kAbsent : Seen::kHidden;
    }
    return nCode;
}

void Pass::LookAt(const std::vector<MappingKey>& rgKeys) {
    for (const MappingKey& key : rgKeys) {
        Place& place = mMapPlaces[key];
        if (!IsOver() && StepFor(key, place).enAction == Action::kLook) {
            Look(key, place);
        }
    }
}

// True when it is gone.
bool Pass::Remove(const MappingKey& key, Place& place) {
    const int nCode = Note(mRouter.Remove(key.first, key.second));
    if (nCode == kRouterOk || nCode == kRouterNoSuchEntry) {
        place.enSeen = Seen::kAbsent;
        place.nKept = kRouterOk;
        mRecord.Here().erase(key);
        return true;
    }
    place.nKept = nCode;
    return false;
}

// What the rules no longer ask for, and what has to go before something else can be made in its place.
void Pass::TakeAway(const std::vector<MappingKey>& rgKeys) {
    for (const MappingKey& key : rgKeys) {
        Place& place = mMapPlaces[key];
        if (IsOver()) {
            return;
        }
        const Action enAction = StepFor(key, place).enAction;
        if (enAction == Action::kRemove || enAction == Action::kReplace) {
            Remove(key, place);
        } else if (enAction == Action::kForget) {
            mRecord.Here().erase(key);
        }
    }
}

// Puts on record what the router is about to be asked for at a place. True when that is news.
bool Pass::Intend(const MappingKey& key, const Place& place) {
    Made* pMade = MadeAt(key);
    const uint16_t nPort = place.pWanted->nBoxPort;
    if (pMade != nullptr && place.enSeen == Seen::kPresent) {  // a change: it may lead to the one port or to the other
        const bool blNews = pMade->blShown || pMade->nOtherPort != nPort;
        pMade->blShown = false;
        pMade->nOtherPort = nPort;
        return blNews;
    }
    const bool blNews = pMade == nullptr || pMade->szClient != mAround.szBox || pMade->nBoxPort != nPort;
    const uint32_t nLease = mHabit.blPermanentOnly ? 0 : mHabit.nLease;
    mRecord.Here()[key] = {mAround.szBox, nPort, place.pWanted->szDescription, false, nLease, mAround.fnNow()};
    return blNews;
}

// A crash between this and the answers leaves nothing that nobody knows of.
void Pass::NoteIntents(const std::vector<MappingKey>& rgKeys) {
    bool blNews = false;
    for (const MappingKey& key : rgKeys) {
        const Place& place = mMapPlaces[key];
        const Action enAction = StepFor(key, place).enAction;
        if (enAction == Action::kAdd || enAction == Action::kChange) {
            blNews = Intend(key, place) || blNews;
        } else if (enAction == Action::kRenew && MadeAt(key) == nullptr) {  // made before there was a record
            mRecord.Here()[key] = {
                mAround.szBox, place.entry.nBoxPort, place.entry.szDescription, true, place.entry.nLease, 0, true};
            blNews = true;
        }
    }
    if (blNews) {
        mAround.fnSave();
    }
}

// Some of the wanted places, together: looking, saving and writing in turns would be slow.
void Pass::Bring(const std::vector<MappingKey>& rgKeys) {
    LookAt(rgKeys);
    TakeAway(rgKeys);
    if (!IsOver()) {
        NoteIntents(rgKeys);
    }
    for (const MappingKey& key : rgKeys) {
        Settle(key, mMapPlaces[key]);
        if (mAround.fnNow() - mNReadBack > kReadBackAfter) {
            ReadBack();
        }
    }
}

void Pass::Settle(const MappingKey& key, Place& place) {
    for (int i = 0; i < kMostSteps && !IsOver(); ++i) {
        if (!Do(key, place, StepFor(key, place))) {
            return;
        }
    }
}

// Does one step about a wanted place. False: there is nothing more to do about it now.
bool Pass::Do(const MappingKey& key, Place& place, const Step& step) {
    switch (step.enAction) {
        case Action::kLook:
            return Look(key, place) >= kRouterOk;
        case Action::kAdd:
            return Add(key, place, true);
        case Action::kRenew:
            Add(key, place, false);
            if (!place.blWritten) {  // the lease runs on
                place.verdict = {PortState::kOpen, "1", {}, place.entry.nLease};
                Wake(mAround.fnNow() + kRenewAgain);
            }
            return false;
        case Action::kChange:
            Add(key, place, true);
            if (place.blWritten || IsOver()) {
                return false;
            }
            [[fallthrough]];
        case Action::kReplace:
            if (place.nKept == kRouterOk && Remove(key, place)) {
                return true;
            }
            place.verdict = StillHeld(key, place.nKept);
            return false;
        case Action::kKeep:
            if (MadeAt(key) == nullptr) {  // made before there was a record; its age is not known
                mRecord.Here()[key] = {mAround.szBox, place.entry.nBoxPort, place.entry.szDescription,
                                       true,          place.entry.nLease,   mAround.fnNow()};
            }
            place.verdict = Open(key, place);
            return false;
        case Action::kLeave:
            place.verdict = {PortState::kOpen, "1", {}, place.entry.nLease, true};
            Wake(place.entry.nLease == 0 ? kNever : mAround.fnNow() + place.entry.nLease);
            return false;
        case Action::kInTheWay:
            place.verdict = InTheWay(place.entry);
            return false;
        default:
            return false;
    }
}

// Asks for what is wanted at a place. True: what is known of the place has changed, and is to be decided anew.
bool Pass::Add(const MappingKey& key, Place& place, bool blAnew) {
    RouterMapping mapping = *place.pWanted;
    mapping.szClient = mAround.szBox;
    if (blAnew && Intend(key, place)) {  // what nobody knew before: the router did not answer at first
        mAround.fnSave();
    }
    const int64_t nAsked = mAround.fnNow();
    const int nCode = Note(AddWithLease(mRouter, mapping, mHabit));
    if (Made* pMade = MadeAt(key); nCode < kRouterOk && mapping.nLease == 0 && pMade != nullptr) {
        pMade->nLease = 0;  // it may be there by now, without the lease that was asked for at first
    }
    if (nCode == kRouterOk) {
        // Some say yes to a change, and leave the entry as it was.
        const uint16_t nBefore = place.enSeen == Seen::kPresent && blAnew ? place.entry.nBoxPort : uint16_t{0};
        mRecord.Here()[key] = {mAround.szBox, mapping.nBoxPort, mapping.szDescription, false, mapping.nLease, nAsked,
                               false,         nBefore};
        place.enSeen = Seen::kUnknown;
        place.blWritten = true;
        place.verdict = {PortState::kOpen, kWritten};
        place.verdict.blAnew = blAnew;
        mRgWritten.push_back(key);
        return false;
    }
    if (blAnew) {
        OnRefused(key, place, nCode);
    }
    if (nCode != kRouterConflict || place.enSeen == Seen::kPresent) {
        return false;
    }
    // The listing did not show who is in the way. A router that guards its entries does not even show them now.
    return Look(key, place) == kRouterOk;
}

// What was refused is not there, unless it was before.
void Pass::OnRefused(const MappingKey& key, Place& place, int nCode) {
    place.verdict = Refusal(nCode);
    const Made* pMade = MadeAt(key);
    if (nCode > kRouterOk && place.enSeen == Seen::kAbsent && pMade != nullptr && !pMade->blShown) {
        mRecord.Here().erase(key);
    }
}

// What the router shows of what was written, where it can show ranges; may be incomplete. A few ports at a time: a
// widespread router daemon dies of a range with more than some hundred and thirty entries.
void Pass::ShowRanges() {
    std::vector<MappingKey> rgKeys = mRgWritten;
    std::sort(rgKeys.begin(), rgKeys.end());
    bool blShows = true;
    for (auto first = rgKeys.begin(); first != rgKeys.end() && blShows && !IsOver();) {
        const auto end = std::find_if(first, rgKeys.end(), [&](const MappingKey& key) {
            return key.first != first->first || key.second - first->second >= kRangePorts;
        });
        if (end - first >= kRangeFrom) {
            std::vector<RouterMapping> rgShown;
            blShows =
                Note(mRouter.ListRange(first->first, first->second, std::prev(end)->second, rgShown)) == kRouterOk;
            for (const RouterMapping& entry : rgShown) {
                Show(entry);
            }
        }
        first = end;
    }
}

// A router's yes is not enough: the mapping must be in its table, and be ours.
void Pass::ReadBack() {
    while (!mRgWritten.empty()) {  // once more for those that had to be replaced
        ShowRanges();
        for (const MappingKey& key : std::exchange(mRgWritten, {})) {
            Confirm(key, mMapPlaces[key]);
        }
    }
    mNReadBack = mAround.fnNow();
}

void Pass::Confirm(const MappingKey& key, Place& place) {
    const bool blAnew = place.verdict.blAnew;
    const auto fnServes = [&] {
        return place.enSeen == Seen::kPresent && Serves(place.entry, *place.pWanted, mAround.szBox);
    };
    int nCode = kRouterOk;
    if (!fnServes()) {
        nCode = IsOver() ? mResult.nTransport : Look(key, place);
    }
    place.blWritten = false;
    if (fnServes()) {
        place.verdict = Open(key, place);
        place.verdict.blAnew = blAnew;
    } else if (IsOver() || (nCode != kRouterOk && nCode != kRouterNoSuchEntry)) {
        place.verdict = Refusal(nCode);
    } else if (place.enSeen == Seen::kPresent && IsOurs(place.entry, MadeAt(key), mAround.szBox) &&
               !std::exchange(place.blReplaced, true) && Remove(key, place)) {
        place.verdict = {PortState::kRefused, kLost};
        Settle(key, place);
    } else if (place.enSeen == Seen::kPresent && place.entry.szClient != mAround.szBox) {
        place.verdict = InTheWay(place.entry);
        mRecord.Here().erase(key);
    } else {
        place.verdict = {PortState::kRefused, kLost};
        if (nCode == kRouterNoSuchEntry) {
            mRecord.Here().erase(key);
        }
    }
}

// A mapping that the router showed.
Verdict Pass::Open(const MappingKey& key, const Place& place) {
    if (const Made* pMade = MadeAt(key); pMade != nullptr && pMade->nLease != 0) {
        Wake(pMade->nAsked + pMade->nLease / 2);
    }
    return {PortState::kOpen, "1", {}, place.entry.nLease};
}

// A mapping that cannot be made because of another entry, and whose that is.
Verdict Pass::InTheWay(const RouterMapping& entry) const {
    Verdict verdict = Refusal(kRouterConflict);
    verdict.holder = Holder{entry.szClient, HarmlessText(entry.szDescription, kMaxDescription)};
    verdict.blOthers = entry.szClient == mAround.szBox;
    return verdict;
}

// Ours, and the router does not take it away: from whom it belongs to, which this box is no more, until its lease ends.
Verdict Pass::StillHeld(const MappingKey& key, int nCode) {
    Verdict verdict = Refusal(nCode);
    const Made* pMade = MadeAt(key);
    if (pMade == nullptr) {
        return verdict;
    }
    if (pMade->szClient != mAround.szBox) {
        verdict.enState = PortState::kWaiting;
        verdict.szWhy = "the router keeps it for this box's former address " + pMade->szClient;
    }
    const int64_t nNow = mAround.fnNow();
    if (pMade->End() >= nNow) {  // else the router does not keep to it, and nobody knows for how long
        verdict.nLease = static_cast<uint32_t>(std::max<int64_t>(pMade->End() - nNow, 1));
        Wake(pMade->End() + 1);
    }
    return verdict;
}

void Pass::Conclude(const std::vector<RouterMapping>& rgWanted) {
    const bool blAsked = !mMapPlaces.empty();
    if (blAsked && !mBlSense && mResult.nTransport == kRouterOk && !mResult.blStopped) {
        mResult.nTransport = kRouterGarbage;  // codes, and nothing but codes: it is looked for anew in the end
    }
    for (const RouterMapping& wanted : rgWanted) {
        Place& place = mMapPlaces[KeyOf(wanted)];
        if (place.verdict.szWord.empty()) {
            const bool blLost = mResult.nTransport == kRouterOk && !mResult.blStopped;
            place.verdict = Refusal(blLost ? int{kRouterTimeout} : mResult.nTransport);
        }
        if (place.verdict.enState == PortState::kUnknown) {
            Wake(mAround.fnNow() + kAskAgain);
        }
        mResult.rgOutcomes.push_back(OutcomeOf(wanted, place.verdict));
    }
    for (const auto& [key, place] : mMapPlaces) {
        const Made* pMade = MadeAt(key);
        const bool blThere = place.enSeen == Seen::kPresent && IsOurs(place.entry, pMade, mAround.szBox);
        if (place.pWanted != nullptr || (!blThere && pMade == nullptr)) {
            continue;
        }
        RouterMapping left = place.entry;
        if (!blThere) {
            left = {key.first, key.second, pMade->nBoxPort, pMade->szClient, pMade->szText, 0, true};
        }
        Outcome outcome = OutcomeOf(left, StillHeld(key, place.nKept == kRouterOk ? mResult.nTransport : place.nKept));
        outcome.blLeftOver = true;
        outcome.verdict.nLease = blThere ? left.nLease : outcome.verdict.nLease;
        mResult.rgOutcomes.push_back(std::move(outcome));
    }
    if (mNNext != kNever) {
        mResult.nNextSeconds = static_cast<int>(
            std::clamp<int64_t>(mNNext - mAround.fnNow(), kLeastPause, std::numeric_limits<int>::max()));
    }
}

PassResult Pass::Run(const std::vector<RouterMapping>& rgWanted) {
    for (const RouterMapping& wanted : rgWanted) {
        Place& place = mMapPlaces[KeyOf(wanted)];
        place.pWanted = place.pWanted == nullptr ? &wanted : place.pWanted;
    }
    for (const auto& [key, made] : mRecord.Here()) {
        mMapPlaces[key];
    }
    mNReadBack = mAround.fnNow();
    mAround.fnSave();  // what could not be written before
    LookAtTable();
    std::vector<MappingKey> rgUnwanted;
    for (const auto& [key, place] : mMapPlaces) {
        if (place.pWanted == nullptr) {
            rgUnwanted.push_back(key);
        }
    }
    LookAt(rgUnwanted);
    TakeAway(rgUnwanted);
    const size_t nTogether = std::max(kTogether, rgWanted.size() / kMostSaves + 1);
    for (size_t i = 0; i < rgWanted.size(); i += nTogether) {
        std::vector<MappingKey> rgKeys;
        for (size_t j = i; j < std::min(i + nTogether, rgWanted.size()); ++j) {
            rgKeys.push_back(KeyOf(rgWanted[j]));
        }
        Bring(rgKeys);
    }
    ReadBack();
    Conclude(rgWanted);
    mAround.fnSave();
    return std::move(mResult);
}

}  // namespace

std::string CodeText(int nCode) {
    switch (nCode) {
        case kRouterOk:
            return "stopped";
        case kRouterTimeout:
        case kRouterTooLong:
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
int AddWithLease(Router& router, RouterMapping& mapping, LeaseHabit& habit) {
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

PassResult BringInLine(Router& router, const std::vector<RouterMapping>& rgWanted, Record& record, LeaseHabit& habit,
                       const Surroundings& around) {
    return Pass(router, record, habit, around).Run(rgWanted);
}

}  // namespace tavo
