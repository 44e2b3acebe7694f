// See Carry.h. Compares before it writes: an unchanged set costs one listing. Where the table cannot be listed, too
// long for its time or refused, our own places are asked for by name. What was written is read back in batches, because
// a router reads its own table faster while nobody writes to it, and some show a whole range at once.
#include "mapping/Carry.h"

#include <algorithm>
#include <iterator>
#include <limits>
#include <map>
#include <optional>
#include <utility>

#include "ground/Marks.h"
#include "mapping/Plan.h"

namespace tavo {

namespace {

constexpr int64_t kReadBackAfter = 20;  // seconds; a slow router's yes is not left open for longer
constexpr int64_t kLookFor = 20;        // seconds; then what was looked at is done
constexpr int kRangeFrom = 4;           // fewer are asked for one by one
constexpr int kRangePorts = 64;         // of one request
constexpr int kMostSteps = 4;           // about one place in one pass: look, take away, add, and one surprise
constexpr size_t kTogether = 512;       // wanted places that are looked at before the first of them is written
constexpr size_t kMostSaves = 8;        // of the record in one pass, however many they are
constexpr char kGoesOn[] = "the router needs longer for so many ports; it is gone on with";
constexpr char kWritten[] = "written";  // the router said yes, and has not shown it yet
constexpr char kLost[] = "lost";        // the router said yes, and does not show it
constexpr size_t kMaxDescription = 64;  // of somebody else's entry
constexpr int64_t kRenewAgain = 60;     // seconds after a renewal that was refused
constexpr int64_t kRecordAgain = 60;    // seconds after the record could not be written
constexpr int64_t kAskAgain = 10;       // seconds after an answer that did not come
constexpr int64_t kLeastPause = 5;      // seconds between passes, whatever leases a router gives
constexpr int64_t kNever = std::numeric_limits<int64_t>::max();

// What this pass knows of a place, and what it has done about it.
struct Place {
    const RouterMapping* pWanted = nullptr;
    Seen enSeen = Seen::kUnknown;
    RouterMapping entry = {};
    bool blWritten = false;     // asked for in this pass, and not read back yet
    bool blUnrecorded = false;  // what was to be asked for cannot be put on record
    bool blReplaced = false;    // taken away, because the router said yes to a change and did not make it
    RouterReply kept = {};      // the router's word for what it did not take away
    RouterReply answer = {};    // to the last asking for it
    const char* szWhy = "";     // it was asked for
    Verdict verdict = {};
};

// What goes on record of a mapping that was asked for at that time.
Made RowOf(const RouterMapping& mapping, bool blShown, int64_t nAsked) {
    Made made{mapping.szClient, mapping.nBoxPort, mapping.szDescription, blShown, mapping.nLease, nAsked};
    made.nMore = mapping.nMore;
    return made;
}

class Pass {
public:
    Pass(Router& router, Record& record, Habits& habit, const Surroundings& around)
        : mRouter(router),
          mAbilities(router.What()),
          mRecord(record),
          mHabit(habit),
          mAround(around),
          mGuard(mResult, around.fnStop, around.fnNow) {}

    PassResult Run(const std::vector<RouterMapping>& rgWanted);

private:
    bool IsOver() { return mGuard.IsOver(); }
    RouterReply Note(RouterReply reply);
    Made* MadeAt(const MappingKey& key);
    std::optional<Made> RowAt(const MappingKey& key);  // a copy
    Step StepFor(const MappingKey& key, const Place& place);
    void Show(const MappingKey& key, const RouterMapping& entry);
    void LookAtTable();
    RouterReply Look(const MappingKey& key, Place& place);
    void Recall();
    void LookAt(std::vector<MappingKey>& rgKeys);
    void TakeAway(const std::vector<MappingKey>& rgKeys);
    bool Remove(const MappingKey& key, Place& place);
    bool Intend(const MappingKey& key, const Place& place);
    void Forgo(const MappingKey& key, const std::optional<Made>& before);
    bool Unrecorded(Place& place);
    void NoteIntents(const std::vector<MappingKey>& rgKeys);
    size_t Clear(std::vector<MappingKey> rgKeys);
    size_t Bring(std::vector<MappingKey> rgKeys);
    void Settle(const MappingKey& key, Place& place);
    bool Do(const MappingKey& key, Place& place, const Step& step);
    bool Renew(const MappingKey& key, Place& place);
    bool Add(const MappingKey& key, Place& place, bool blAnew);
    void OnMade(const MappingKey& key, Place& place, const RouterMapping& mapping, int64_t nAsked, bool blAnew);
    void OnElsewhere(const MappingKey& key, Place& place, const RouterMapping& made, const RouterReply& reply);
    void LookAgain(const MappingKey& key);
    uint16_t OlderPlace(const MappingKey& key, uint16_t nBoxPort) const;
    void OnRefused(const MappingKey& key, Place& place, const RouterReply& reply);
    void ShowRanges();
    void ReadBack();
    void Confirm(const MappingKey& key, Place& place);
    Verdict Open(const MappingKey& key, const Place& place);
    Verdict InTheWay(const RouterMapping& entry) const;
    Verdict StillHeld(const MappingKey& key, const RouterReply& reply);
    RouterMapping Known(const MappingKey& key, const Place& place);
    void Wake(int64_t nAt) { mNNext = std::min(mNNext, nAt); }
    RouterReply Unasked() const;
    void Conclude(const std::vector<RouterMapping>& rgWanted);

    Router& mRouter;
    const Abilities mAbilities;
    Record& mRecord;
    Habits& mHabit;
    const Surroundings& mAround;
    std::map<MappingKey, Place> mMapPlaces;
    std::vector<MappingKey> mRgWritten;  // to be read back
    RouterReply mApplied;                // whether what was done has taken effect
    PassResult mResult;
    PassGuard mGuard;
    bool mBlSense = false;  // the router has answered at least one question of this pass with sense
    int64_t mNReadBack = 0;
    int64_t mNNext = kNever;
};

RouterReply Pass::Note(RouterReply reply) {
    mBlSense = mBlSense || reply.IsOk() || reply.enReply == Reply::kNoSuchEntry || reply.enReply == Reply::kConflict;
    return mGuard.Note(std::move(reply));
}

Made* Pass::MadeAt(const MappingKey& key) {
    const auto it = mRecord.Here().find(key);
    return it == mRecord.Here().end() ? nullptr : &it->second;
}

std::optional<Made> Pass::RowAt(const MappingKey& key) {
    const Made* pMade = MadeAt(key);
    return pMade == nullptr ? std::nullopt : std::optional(*pMade);
}

Step Pass::StepFor(const MappingKey& key, const Place& place) {
    const PlaceView view{place.pWanted, place.enSeen, place.enSeen == Seen::kPresent ? &place.entry : nullptr,
                         MadeAt(key)};
    return Decide(view, mAround.szBox, mAround.fnNow(), mAbilities);
}

// Takes in what the router shows at a place. What it shows of ours is how we know it from then on.
void Pass::Show(const MappingKey& key, const RouterMapping& entry) {
    Place& place = mMapPlaces[key];
    place.enSeen = Seen::kPresent;
    place.entry = entry;
    Made* pMade = KeyOf(entry) == key ? MadeAt(key) : nullptr;
    // Whom it is for where the router does not show that: for whom we made it, unless its text is somebody else's.
    if (pMade != nullptr && entry.szClient.empty() &&
        (entry.szDescription.empty() || entry.szDescription.starts_with(kOwnPrefix))) {
        place.entry.szClient = pMade->szClient;
    }
    if (pMade == nullptr || !pMade->IsEntry(place.entry)) {
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
        Show(KeyOf(entry), entry);
    }
}

// A router that shows nothing: what it has granted, and what has not run out since, is what there is while it answers.
// Where it was not asked for anything, nothing of ours is.
void Pass::Recall() {
    std::vector<RouterMapping> rgNone;
    if (RouterReply reply = Note(mRouter.List(rgNone)); reply.IsSilence()) {
        mResult.transport = std::move(reply);
    }
    for (auto& [key, place] : mMapPlaces) {
        const Made* pMade = MadeAt(key);
        const bool blThere = pMade != nullptr && pMade->blShown && mAround.fnNow() < pMade->End();
        place.enSeen = blThere ? Seen::kPresent : pMade == nullptr ? Seen::kAbsent : Seen::kHidden;
        if (blThere) {
            place.entry = Known(key, place);
        }
    }
    mBlSense = true;
}

RouterReply Pass::Look(const MappingKey& key, Place& place) {
    RouterMapping entry;
    RouterReply reply = Note(mRouter.Get(key.first, key.second, entry));
    if (reply.IsOk()) {
        Show(key, entry);
    } else if (reply.IsRefusal()) {
        place.enSeen = reply.enReply == Reply::kNoSuchEntry ? Seen::kAbsent : Seen::kHidden;
    }
    return reply;
}

// Drops those for which there was no time: a slow router's pass is for doing something, too.
void Pass::LookAt(std::vector<MappingKey>& rgKeys) {
    const int64_t nEnd = mAround.fnNow() + kLookFor;
    size_t nLooked = 0;
    for (; nLooked < rgKeys.size() && (nLooked == 0 || mAround.fnNow() <= nEnd); ++nLooked) {
        Place& place = mMapPlaces[rgKeys[nLooked]];
        if (!IsOver() && StepFor(rgKeys[nLooked], place).enAction == Action::kLook) {
            Look(rgKeys[nLooked], place);
        }
    }
    rgKeys.resize(nLooked);
}

// True when it is gone.
bool Pass::Remove(const MappingKey& key, Place& place) {
    RouterReply reply = Note(mRouter.Remove(Known(key, place)));
    if (reply.IsOk() || reply.enReply == Reply::kNoSuchEntry) {
        place.enSeen = Seen::kAbsent;
        place.kept = {};
        if (!mAbilities.blForm || place.pWanted == nullptr) {  // else it is asked for anew at once, and stays on record
            mRecord.Here().erase(key);
        }
        return true;
    }
    place.kept = std::move(reply);
    return false;
}

// What the rules no longer ask for, and what has to go before something else can be made in its place.
void Pass::TakeAway(const std::vector<MappingKey>& rgKeys) {
    for (const MappingKey& key : rgKeys) {
        Place& place = mMapPlaces[key];
        if (IsOver()) {
            return;
        }
        const Step step = StepFor(key, place);
        if (step.enAction == Action::kRemove || step.enAction == Action::kReplace) {
            const RouterMapping gone = Known(key, place);
            if (Remove(key, place)) {
                mAround.fnTell(gone, step);
            }
        } else if (step.enAction == Action::kForget) {
            mRecord.Here().erase(key);
        }
    }
}

// Puts on record what the router is about to be asked for at a place. True when that is news.
bool Pass::Intend(const MappingKey& key, const Place& place) {
    Made* pMade = MadeAt(key);
    RouterMapping mapping = *place.pWanted;
    mapping.szClient = mAround.szBox;
    mapping.nLease = mHabit.blPermanentOnly ? 0 : mHabit.nLease;
    if (pMade != nullptr && place.enSeen == Seen::kPresent) {  // a change: it may lead to the one port or to the other
        const bool blNews = pMade->blShown || pMade->nOtherPort != mapping.nBoxPort;
        pMade->blShown = false;
        pMade->nOtherPort = mapping.nBoxPort;
        return blNews;
    }
    // What was shown is known by its text from then on. One that the router gives to everybody's stays what it is.
    const bool blText = pMade != nullptr && pMade->blShown && pMade->szText.starts_with(kOwnPrefix) &&
                        pMade->szText != mapping.szDescription;
    const bool blNews = pMade == nullptr || pMade->szClient != mAround.szBox || pMade->nBoxPort != mapping.nBoxPort ||
                        pMade->nMore != mapping.nMore || blText;
    mRecord.Here()[key] = RowOf(mapping, false, mAround.fnNow());
    return blNews;
}

// What cannot be put on record is not asked for, and what the record said before stands.
void Pass::Forgo(const MappingKey& key, const std::optional<Made>& before) {
    mRecord.Here().erase(key);
    if (before) {
        mRecord.Here().emplace(key, *before);
    }
    mMapPlaces[key].blUnrecorded = true;
}

bool Pass::Unrecorded(Place& place) {
    if (place.blUnrecorded) {
        place.verdict = {PortState::kRefused, kUnrecorded};
        Wake(mAround.fnNow() + kRecordAgain);
    }
    return place.blUnrecorded;
}

// A crash between this and the answers leaves nothing that nobody knows of.
void Pass::NoteIntents(const std::vector<MappingKey>& rgKeys) {
    bool blNews = false;
    std::vector<std::pair<MappingKey, std::optional<Made>>> rgBefore;
    for (const MappingKey& key : rgKeys) {
        const Place& place = mMapPlaces[key];
        const Action enAction = StepFor(key, place).enAction;
        if (enAction == Action::kAdd || enAction == Action::kChange) {
            std::optional<Made> before = RowAt(key);
            if (Intend(key, place)) {
                rgBefore.emplace_back(key, std::move(before));
            }
        } else if (enAction == Action::kRenew && MadeAt(key) == nullptr) {  // made before there was a record
            mRecord.Here()[key] = RowOf(place.entry, true, 0);
            mRecord.Here()[key].blBefore = true;
            blNews = true;
        }
    }
    if ((blNews || !rgBefore.empty()) && !mAround.fnSave()) {
        for (const auto& [key, before] : rgBefore) {
            Forgo(key, before);
        }
    }
}

// Some of the places that no rule asks for, as many as there is time to look at.
size_t Pass::Clear(std::vector<MappingKey> rgKeys) {
    LookAt(rgKeys);
    TakeAway(rgKeys);
    return rgKeys.size();
}

// Some of the places, together, as many as there is time to look at: looking, saving and writing in turns would be
// slow.
size_t Pass::Bring(std::vector<MappingKey> rgKeys) {
    LookAt(rgKeys);
    TakeAway(rgKeys);
    if (!IsOver()) {
        NoteIntents(rgKeys);
    }
    for (const MappingKey& key : rgKeys) {
        Settle(key, mMapPlaces[key]);
        if (!mAbilities.blForm && mAround.fnNow() - mNReadBack > kReadBackAfter) {
            ReadBack();
        }
    }
    return rgKeys.size();
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
            return !Look(key, place).IsSilence();
        case Action::kAdd:
            place.szWhy = step.szWhy;
            return !Unrecorded(place) && Add(key, place, true);
        case Action::kRenew:
            return Renew(key, place);
        case Action::kChange:
            if (Unrecorded(place)) {
                return false;
            }
            place.szWhy = step.szWhy;
            Add(key, place, true);
            if (place.blWritten || place.blUnrecorded || IsOver()) {
                return false;
            }
            [[fallthrough]];
        case Action::kReplace:
            if (place.kept.IsOk() && Remove(key, place)) {
                return true;
            }
            if (place.enSeen == Seen::kHidden && Serves(Known(key, place), *place.pWanted, mAround.szBox)) {
                return Add(key, place, true);  // the answer shows whether it is there
            }
            place.verdict = StillHeld(key, place.kept);
            return false;
        case Action::kKeep:
            if (MadeAt(key) == nullptr) {  // made before there was a record; its age is not known
                mRecord.Here()[key] = RowOf(place.entry, true, mAround.fnNow());
            }
            place.verdict = Open(key, place);
            LookAgain(key);
            return false;
        case Action::kLeave:
            place.verdict = {PortState::kOpen, "1", {}, place.entry.nLease, true};
            Wake(place.entry.nLease == 0 ? kNever : mAround.fnNow() + place.entry.nLease);
            LookAgain(key);
            return false;
        case Action::kInTheWay:
            place.verdict = InTheWay(place.entry);
            return false;
        default:
            return false;
    }
}

// True: what is known of the place has changed.
bool Pass::Renew(const MappingKey& key, Place& place) {
    const Made* pMade = MadeAt(key);
    const bool blDoubtful = !mAbilities.blShows && (pMade == nullptr || pMade->blBefore);
    const bool blAgain = Add(key, place, false);
    if (!place.blWritten && MadeAt(key) != nullptr) {  // the lease runs on, where there is one
        place.verdict = blDoubtful ? RefusedBy(place.answer) : Verdict{PortState::kOpen, "1", {}, place.entry.nLease};
        Wake(mAround.fnNow() + kRenewAgain);
    }
    return blAgain;
}

// Asks for what is wanted at a place. True: what is known of the place has changed, and is to be decided anew.
bool Pass::Add(const MappingKey& key, Place& place, bool blAnew) {
    if (const auto it = mHabit.mapElsewhere.find(key); it != mHabit.mapElsewhere.end()) {
        place.verdict = RefusedBy({Reply::kElsewhere, it->second});
        mRecord.Here().erase(key);
        return false;
    }
    if (const uint16_t nOlder = OlderPlace(key, place.pWanted->nBoxPort); nOlder != 0) {
        place.verdict = {PortState::kWaiting, "the router has not closed port " + std::to_string(nOlder) + " yet"};
        Wake(mAround.fnNow() + kAskAgain);
        return false;
    }
    RouterMapping mapping = *place.pWanted;
    mapping.szClient = mAround.szBox;
    const std::optional<Made> before = RowAt(key);
    // What nobody knew before: the router did not answer at first.
    if (blAnew && Intend(key, place) && !mAround.fnSave()) {
        Forgo(key, before);
        Unrecorded(place);
        return false;
    }
    const int64_t nAsked = mAround.fnNow();
    const RouterReply& reply = place.answer = Note(AddWithLease(mRouter, mapping, mHabit));
    if (Made* pMade = MadeAt(key); reply.IsSilence() && mapping.nLease == 0 && pMade != nullptr) {
        pMade->nLease = 0;  // it may be there by now, without the lease that was asked for at first
    }
    if (reply.IsOk()) {
        OnMade(key, place, mapping, nAsked, blAnew);
        return false;
    }
    if (reply.enReply == Reply::kElsewhere) {
        OnElsewhere(key, place, mapping, reply);
        return false;
    }
    if (blAnew) {
        OnRefused(key, place, reply);
    }
    if (reply.enReply != Reply::kConflict || place.enSeen == Seen::kPresent) {
        return false;
    }
    // The listing did not show who is in the way. A router that guards its entries does not even show them now.
    return Look(key, place).IsOk();
}

void Pass::OnMade(const MappingKey& key, Place& place, const RouterMapping& mapping, int64_t nAsked, bool blAnew) {
    // Some say yes to a change, and leave the entry as it was.
    const bool blChange = mAbilities.blShows && place.enSeen == Seen::kPresent && blAnew;
    mRecord.Here()[key] = RowOf(mapping, !mAbilities.blShows, nAsked);
    mRecord.Here()[key].nOtherPort = blChange ? place.entry.nBoxPort : uint16_t{0};
    if (blAnew) {
        mAround.fnTell(mapping, {Action::kAdd, place.szWhy});
    }
    place.blWritten = true;
    place.verdict = {PortState::kOpen, kWritten};
    place.verdict.blAnew = blAnew;
    if (mAbilities.blShows) {
        place.enSeen = Seen::kUnknown;
        mRgWritten.push_back(key);
        return;
    }
    place.enSeen = Seen::kPresent;
    place.entry = mapping;
    place.verdict = Open(key, place);
    place.verdict.blAnew = blAnew;
}

// The router opened a port that nobody asked for: it is closed before anything else is done.
void Pass::OnElsewhere(const MappingKey& key, Place& place, const RouterMapping& made, const RouterReply& reply) {
    mRecord.Here().erase(key);
    place.enSeen = Seen::kHidden;
    place.verdict = RefusedBy(reply);
    Place& other = mMapPlaces[KeyOf(made)];
    mRecord.Here()[KeyOf(made)] = RowOf(made, true, mAround.fnNow());
    other.enSeen = Seen::kPresent;
    other.entry = made;
    if (Remove(KeyOf(made), other)) {
        mAround.fnTell(made, {Action::kRemove, "the router made it instead of another one"});
        mHabit.mapElsewhere[key] = reply.szWord;
    }
}

// What a form showed before something was done may look different afterwards.
void Pass::LookAgain(const MappingKey& key) {
    if (mAbilities.blForm && mAbilities.blShows) {
        mRgWritten.push_back(key);
    }
}

// Another place that may still have the port of the box, at a router that would take away the one with the other. 0:
// none.
uint16_t Pass::OlderPlace(const MappingKey& key, uint16_t nBoxPort) const {
    if (!mAbilities.blByBoxPort) {
        return 0;
    }
    for (const auto& [other, made] : mRecord.Here()) {
        const bool blSame = other.first == key.first && made.nBoxPort == nBoxPort && made.szClient == mAround.szBox;
        if (blSame && other != key) {
            return other.second;
        }
    }
    return 0;
}

// What was refused is not there, unless it was before.
void Pass::OnRefused(const MappingKey& key, Place& place, const RouterReply& reply) {
    place.verdict = RefusedBy(reply);
    const Made* pMade = MadeAt(key);
    if (reply.IsRefusal() && place.enSeen == Seen::kAbsent && pMade != nullptr && !pMade->blShown) {
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
            blShows = Note(mRouter.ListRange(first->first, first->second, std::prev(end)->second, rgShown)).IsOk();
            for (const RouterMapping& entry : rgShown) {
                Show(KeyOf(entry), entry);
            }
        }
        first = end;
    }
}

// A router's yes is not enough: the mapping must be in its table, and be ours.
void Pass::ReadBack() {
    do {  // once more for those that had to be replaced
        if (mAbilities.blForm) {
            mApplied = Note(mRouter.Apply());
        }
        ShowRanges();
        for (const MappingKey& key : std::exchange(mRgWritten, {})) {
            Confirm(key, mMapPlaces[key]);
        }
    } while (!mRgWritten.empty());
    mNReadBack = mAround.fnNow();
}

void Pass::Confirm(const MappingKey& key, Place& place) {
    const bool blAnew = place.verdict.blAnew;
    const auto fnServes = [&] {
        return place.enSeen == Seen::kPresent && Serves(place.entry, *place.pWanted, mAround.szBox);
    };
    RouterReply reply;
    if (!fnServes() || mAbilities.blForm) {
        reply = IsOver() ? Unasked() : Look(key, place);
    }
    const bool blWritten = std::exchange(place.blWritten, false);
    if (fnServes()) {
        if (blWritten) {
            place.verdict = Open(key, place);
            place.verdict.blAnew = blAnew;
        }
    } else if (IsOver() || (!reply.IsOk() && reply.enReply != Reply::kNoSuchEntry)) {
        place.verdict = RefusedBy(reply);
    } else if (place.enSeen == Seen::kPresent && IsOurs(place.entry, MadeAt(key), mAround.szBox) &&
               !std::exchange(place.blReplaced, true) && Remove(key, place)) {
        place.verdict = {PortState::kRefused, kLost};
        Settle(key, place);
    } else if (place.enSeen == Seen::kPresent && place.entry.szClient != mAround.szBox) {
        place.verdict = InTheWay(place.entry);
        mRecord.Here().erase(key);
    } else {
        place.verdict = {PortState::kRefused, kLost};
        if (reply.enReply == Reply::kNoSuchEntry) {
            mRecord.Here().erase(key);
        }
    }
}

// A mapping that the router showed.
Verdict Pass::Open(const MappingKey& key, const Place& place) {
    Verdict verdict{PortState::kOpen, "1", {}, place.entry.nLease};
    if (const Made* pMade = MadeAt(key); pMade != nullptr && pMade->nLease != 0) {
        Wake(pMade->nAsked + pMade->nLease / 2);
        if (pMade->nLease / 2 < kLeastPause) {
            verdict.szWhy = "the router lends it for " + std::to_string(pMade->nLease) +
                            " seconds at a time, so that it is closed now and then";
        }
    }
    return verdict;
}

// A mapping that cannot be made because of another entry, and whose that is.
Verdict Pass::InTheWay(const RouterMapping& entry) const {
    Verdict verdict = RefusedBy({Reply::kConflict, mAbilities.szConflict});
    verdict.holder = Holder{entry.szClient, HarmlessText(entry.szDescription, kMaxDescription)};
    verdict.blOthers = entry.szClient == mAround.szBox;
    return verdict;
}

// Ours, and the router does not take it away: from whom it belongs to, which this box is no more, until its lease ends.
Verdict Pass::StillHeld(const MappingKey& key, const RouterReply& reply) {
    Verdict verdict = RefusedBy(reply);
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

// What is known of what is at a place: what the router shows, else what was asked for.
RouterMapping Pass::Known(const MappingKey& key, const Place& place) {
    const Made* pMade = MadeAt(key);
    if (pMade == nullptr || (place.enSeen == Seen::kPresent && !place.entry.szProtocol.empty())) {
        return place.entry;
    }
    const auto nLeft = static_cast<uint32_t>(std::clamp<int64_t>(pMade->End() - mAround.fnNow(), 0, UINT32_MAX));
    return {key.first, key.second, pMade->nBoxPort, pMade->szClient, pMade->szText, nLeft, true, pMade->nMore};
}

// What there is to say of a place that the router was not asked about any more.
RouterReply Pass::Unasked() const {
    const bool blLate = mResult.transport.IsOk() && !mResult.blStopped;
    return blLate ? RouterReply{Reply::kTimeout, "timeout"} : mResult.transport;
}

void Pass::Conclude(const std::vector<RouterMapping>& rgWanted) {
    const bool blAsked = !mMapPlaces.empty();
    if (blAsked && !mBlSense && mResult.transport.IsOk() && !mResult.blStopped) {
        mResult.transport = {Reply::kGarbage,
                             "garbage"};  // codes, and nothing but codes: it is looked for anew in the end
    }
    for (const RouterMapping& wanted : rgWanted) {
        Place& place = mMapPlaces[KeyOf(wanted)];
        if (place.verdict.szWord.empty()) {
            place.verdict = RefusedBy(Unasked());
        }
        if (place.verdict.enState == PortState::kOpen && !mApplied.IsOk()) {
            place.verdict = RefusedBy(mApplied);
        }
        if (mResult.blUnfinished && mResult.transport.IsOk() && place.verdict.enState == PortState::kUnknown) {
            place.verdict.szWhy = kGoesOn;
        }
        if (place.verdict.enState == PortState::kUnknown) {
            Wake(mAround.fnNow() + kAskAgain);
        }
        mResult.rgOutcomes.push_back(OutcomeOf(wanted, place.verdict));
    }
    for (const auto& [key, place] : mMapPlaces) {
        const Made* pMade = MadeAt(key);
        const bool blThere = place.enSeen == Seen::kPresent && IsOurs(place.entry, pMade, mAround.szBox);
        // What a form still has of before is there beside what is wanted.
        const bool blBeside = mAbilities.blForm && !place.kept.IsOk();
        if ((place.pWanted != nullptr && !blBeside) || (!blThere && pMade == nullptr)) {
            continue;
        }
        const RouterMapping left = Known(key, place);
        Outcome outcome = OutcomeOf(left, StillHeld(key, place.kept.IsOk() ? Unasked() : place.kept));
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
    mAbilities.blShows ? LookAtTable() : Recall();
    std::vector<MappingKey> rgUnwanted;
    for (const auto& [key, place] : mMapPlaces) {
        if (place.pWanted == nullptr) {
            rgUnwanted.push_back(key);
        }
    }
    for (size_t i = 0; i < rgUnwanted.size() && !IsOver();) {
        i += Clear({rgUnwanted.begin() + static_cast<std::ptrdiff_t>(i), rgUnwanted.end()});
    }
    std::vector<MappingKey> rgKeys;
    for (const RouterMapping& wanted : rgWanted) {
        rgKeys.push_back(KeyOf(wanted));
    }
    if (const auto next = std::find(rgKeys.begin(), rgKeys.end(), mHabit.next); next != rgKeys.end()) {
        std::rotate(rgKeys.begin(), next, rgKeys.end());
    }
    // On a form an entry of ours may be in the way of any other one.
    const size_t nTogether =
        std::max(mAbilities.blForm ? rgWanted.size() : kTogether, rgWanted.size() / kMostSaves + 1);
    for (size_t i = 0; i < rgKeys.size() && !IsOver();) {
        const auto first = rgKeys.begin() + static_cast<std::ptrdiff_t>(i);
        i += Bring({first, first + static_cast<std::ptrdiff_t>(std::min(nTogether, rgKeys.size() - i))});
    }
    ReadBack();
    mHabit.next = {};
    if (mResult.blUnfinished) {
        const auto next = std::find_if(rgKeys.begin(), rgKeys.end(), [this](const MappingKey& key) {
            return mMapPlaces[key].verdict.enState == PortState::kUnknown;
        });
        mHabit.next = next == rgKeys.end() ? MappingKey() : *next;
    }
    Conclude(rgWanted);
    mAround.fnSave();
    return std::move(mResult);
}

}  // namespace

Verdict RefusedBy(const RouterReply& reply) {
    const PortState enState = reply.IsRefusal() ? PortState::kRefused
                              : reply.IsOk()    ? PortState::kWaiting
                                                : PortState::kUnknown;
    return {enState, reply.IsOk() ? "stopped" : reply.szWord};
}

// Routers of the first generation know permanent mappings only; some say so, some call it bad arguments.
RouterReply AddWithLease(Router& router, RouterMapping& mapping, Habits& habit) {
    const RouterMapping wanted = mapping;
    mapping.nLease = habit.blPermanentOnly ? 0 : habit.nLease;
    RouterReply reply = router.Add(mapping);
    if (mapping.nLease != 0 && (reply.enReply == Reply::kOnlyPermanent || reply.enReply == Reply::kBadArguments)) {
        const bool blSaysSo = reply.enReply == Reply::kOnlyPermanent;
        mapping = wanted;
        mapping.nLease = 0;
        reply = router.Add(mapping);
        habit.blPermanentOnly = habit.blPermanentOnly || (reply.IsOk() || blSaysSo);
    }
    return reply;
}

PassResult BringInLine(Router& router, const std::vector<RouterMapping>& rgWanted, Record& record, Habits& habit,
                       const Surroundings& around) {
    return Pass(router, record, habit, around).Run(rgWanted);
}

}  // namespace tavo
