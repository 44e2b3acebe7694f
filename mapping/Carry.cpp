// See Carry.h. Compares before it writes: an unchanged set costs one listing. Where the table cannot be listed, too
// long for its time or refused, our own places are asked for by name. What was written is read back in batches, because
// a router reads its own table faster while nobody writes to it, and some show a whole range at once.
#include "mapping/Carry.h"

#include <algorithm>
#include <map>
#include <utility>

#include "mapping/Intents.h"
#include "mapping/Places.h"
#include "mapping/Verdicts.h"

namespace tavo {

namespace {

constexpr int64_t kReadBackAfter = 20;  // seconds; a slow router's yes is not left open for longer
constexpr int kMostSteps = 4;           // about one place in one pass: look, take away, add, and one surprise
constexpr size_t kTogether = 512;       // wanted places that are looked at before the first of them is written
constexpr size_t kMostSaves = 8;        // of the record in one pass, however many they are
constexpr char kWritten[] = "written";  // the router said yes, and has not shown it yet
constexpr char kLost[] = "lost";        // the router said yes, and does not show it
constexpr char kKept[] = "kept";        // it said yes to the removal, and shows it
constexpr int64_t kRenewAgain = 60;     // seconds after a renewal that was refused
constexpr int64_t kRecordAgain = 60;    // seconds after the record could not be written
constexpr int64_t kLookForLost = 10;    // seconds until one more look for what was not shown
constexpr int kMostVain = 3;            // mappings, of which it is not the lease that is refused
constexpr int kTakenWithout = 2;        // mappings, after which a router is known to take no lease
constexpr int64_t kCloseAgain = 10;     // seconds until an older place of a port of the box may be closed

class Carrier {
public:
    explicit Carrier(Places& places) : mPlaces(places) {}
    PassResult Run(const std::vector<RouterMapping>& rgWanted);

private:
    bool IsOver() { return mPlaces.guard.IsOver(); }
    RouterReply Note(RouterReply reply) { return mPlaces.guard.Note(std::move(reply)); }
    const std::string& Box() const { return mPlaces.around.szBox; }
    void Forget(const Place& place) { mPlaces.rows.erase(place.key); }
    void Clear(PlaceList rgpPlaces);
    void BringAll(PlaceList rgpPlaces);
    size_t Bring(PlaceList rgpPlaces);
    void TakeAway(const PlaceList& rgpPlaces);
    bool Remove(Place& place, const char* szWhy);
    void OnGone(Place& place);
    void CheckGone();
    void OnNotApplied();
    bool Unrecorded(Place& place);
    void Settle(Place& place);
    bool Do(Place& place, const Step& step);
    bool Replace(Place& place, const char* szWhy);
    bool Renew(Place& place);
    bool Add(Place& place, bool blAnew);
    void OnMade(Place& place, const RouterMapping& mapping, int64_t nAsked, bool blAnew);
    void OnElsewhere(Place& place, const RouterMapping& made, const RouterReply& reply);
    void OnRefused(Place& place, const RouterReply& reply);
    void LookAgain(Place& place);
    uint16_t OlderPlace(const Place& place) const;
    void ReadBack();
    void Confirm(Place& place);
    void OnLost(const Place& place, const RouterReply& reply);
    bool IsLost(Place& place);

    Places& mPlaces;
    PlaceList mRgpWritten;  // to be read back
    PlaceList mRgpGone;     // the router said yes to their removal, which is to be looked at
    RouterReply mApplied;   // whether what was done has taken effect
    int64_t mNReadBack = 0;
    // What was on record at first, where the router has one place for each port of the box: by protocol and that port.
    std::multimap<std::pair<std::string, uint16_t>, const Place*> mMapByBoxPort;
};

// True when the router says that it is gone. A yes is not enough where there is more to see or to be done: the row
// stays until then. What a rule asks for there is asked for anew, and the answer to that shows what came of it.
bool Carrier::Remove(Place& place, const char* szWhy) {
    place.gone = mPlaces.Known(place);
    place.szWhyGone = szWhy;
    place.before.reset();
    mPlaces.habit.setLost.erase(place.key);
    RouterReply reply = Note(mPlaces.router.Remove(place.gone));
    const Made* pMade = mPlaces.MadeAt(place);
    const bool blUnseen = mPlaces.what.blForm && !mPlaces.what.blShows;
    if (blUnseen && reply.enReply == Reply::kNoSuchEntry && pMade != nullptr &&
        pMade->other.nBoxPort != 0) {  // the change of it may not have been applied
        place.gone.szClient = pMade->other.szClient;
        place.gone.nBoxPort = pMade->other.nBoxPort;
        reply = Note(mPlaces.router.Remove(place.gone));
    }
    if (!reply.IsOk() && reply.enReply != Reply::kNoSuchEntry) {
        place.kept = std::move(reply);
        return false;
    }
    // Such a form has nothing there by what it was told last, which may not have taken effect either.
    if (blUnseen || (reply.IsOk() && mPlaces.what.blShows)) {
        place.before = mPlaces.rows.try_emplace(place.key, RowOf(place.gone, true, mPlaces.Now())).first->second;
        place.before->szClient = place.gone.szClient;  // which of the two that the row may be of
        place.before->nBoxPort = place.gone.nBoxPort;
        if (mPlaces.what.blForm || place.pWanted == nullptr) {
            mRgpGone.push_back(&place);
        }
    }
    if (!place.before || place.pWanted != nullptr) {
        OnGone(place);
    }
    place.enSeen = Seen::kAbsent;
    place.kept = {};
    return true;
}

void Carrier::OnGone(Place& place) {
    mPlaces.around.fnTell(place.gone, {Action::kRemove, place.szWhyGone});
    if (!place.before || place.pWanted == nullptr) {  // else it is asked for anew, and stays on record
        Forget(place);
    }
}

// What the router was told to take away, all of it together. Where it does not say what it has, its yes has to do; what
// it still shows is taken away again by the next pass, unless it was only slow to go.
void Carrier::CheckGone() {
    PlaceList rgpGone;
    for (Place* pPlace : std::exchange(mRgpGone, {})) {
        if (pPlace->pWanted == nullptr) {
            rgpGone.push_back(pPlace);
        } else if (Made* pMade = mPlaces.MadeAt(*pPlace); pMade != nullptr) {
            pMade->other = {};  // what came of it shows in what was made in its place
        }
    }
    if (mPlaces.what.blShows) {
        mPlaces.LookForGone(rgpGone);
    }
    for (Place* pPlace : rgpGone) {
        if (pPlace->enSeen == Seen::kPresent && IsOurs(pPlace->entry, mPlaces.MadeAt(*pPlace), Box())) {
            pPlace->kept = {Reply::kRefused, kKept};
        } else if (pPlace->enSeen != Seen::kUnknown) {
            OnGone(*pPlace);
        } else if (!IsOver()) {
            pPlace->kept = {Reply::kTimeout, "timeout"};
        }
    }
}

// What was done on a form has not taken effect: what was taken away there may be there still.
void Carrier::OnNotApplied() {
    for (Place* pPlace : std::exchange(mRgpGone, {})) {
        const bool blAsWanted = pPlace->pWanted != nullptr && Serves(pPlace->gone, *pPlace->pWanted, Box());
        pPlace->kept = blAsWanted ? RouterReply{} : mApplied;
    }
    mRgpWritten.clear();
}

// What the rules no longer ask for, and what has to go before something else can be made in its place.
void Carrier::TakeAway(const PlaceList& rgpPlaces) {
    for (Place* pPlace : rgpPlaces) {
        if (IsOver()) {
            return;
        }
        const Step step = mPlaces.StepFor(*pPlace);
        const bool blAway = step.enAction == Action::kRemove || step.enAction == Action::kReplace;
        if (blAway && !mPlaces.IsOthers(*pPlace)) {
            Remove(*pPlace, step.szWhy);
        } else if (step.enAction == Action::kForget) {
            Forget(*pPlace);
        }
    }
}

// The places that no rule asks for, each time as many as there is time to look at.
void Carrier::Clear(PlaceList rgpPlaces) {
    while (!rgpPlaces.empty() && !IsOver()) {
        PlaceList rgpNow = rgpPlaces;
        mPlaces.LookAt(rgpNow);
        TakeAway(rgpNow);
        rgpPlaces.erase(rgpPlaces.begin(), rgpPlaces.begin() + static_cast<std::ptrdiff_t>(rgpNow.size()));
    }
    if (!mPlaces.what.blForm) {
        CheckGone();
    }
}

// Some of the places, together, as many as there is time to look at: looking, saving and writing in turns would be
// slow.
size_t Carrier::Bring(PlaceList rgpPlaces) {
    mPlaces.LookAt(rgpPlaces);
    TakeAway(rgpPlaces);
    if (!IsOver()) {
        NoteIntents(mPlaces, rgpPlaces);
    }
    for (Place* pPlace : rgpPlaces) {
        Settle(*pPlace);
        if (!mPlaces.what.blForm && mPlaces.Now() - mNReadBack > kReadBackAfter) {
            ReadBack();
        }
    }
    return rgpPlaces.size();
}

void Carrier::BringAll(PlaceList rgpPlaces) {
    const auto next = std::find_if(rgpPlaces.begin(), rgpPlaces.end(),
                                   [this](const Place* pPlace) { return pPlace->key == mPlaces.habit.next; });
    if (next != rgpPlaces.end()) {
        std::rotate(rgpPlaces.begin(), next, rgpPlaces.end());
    }
    // On a form an entry of ours may be in the way of any other one.
    const size_t nAll = rgpPlaces.size();
    const size_t nTogether = std::max(mPlaces.what.blForm ? nAll : kTogether, nAll / kMostSaves + 1);
    for (size_t i = 0; i < nAll && !IsOver();) {
        const auto first = rgpPlaces.begin() + static_cast<std::ptrdiff_t>(i);
        i += Bring({first, first + static_cast<std::ptrdiff_t>(std::min(nTogether, nAll - i))});
    }
    ReadBack();
    mPlaces.habit.next = {};
    const auto undone = std::find_if(rgpPlaces.begin(), rgpPlaces.end(), [](const Place* pPlace) {
        return pPlace->verdict.enState == PortState::kUnknown;
    });
    if (mPlaces.result.blUnfinished && undone != rgpPlaces.end()) {
        mPlaces.habit.next = (*undone)->key;
    }
}

void Carrier::Settle(Place& place) {
    for (int i = 0; i < kMostSteps && !IsOver(); ++i) {
        if (!Do(place, mPlaces.StepFor(place))) {
            return;
        }
    }
}

// Does one step about a wanted place. False: there is nothing more to do about it now.
bool Carrier::Do(Place& place, const Step& step) {
    switch (step.enAction) {
        case Action::kLook:
            return !mPlaces.Look(place).IsSilence();
        case Action::kAdd:
            place.szWhy = step.szWhy;
            return !Unrecorded(place) && Add(place, true);
        case Action::kRenew:
            return Renew(place);
        case Action::kChange:
            if (Unrecorded(place)) {
                return false;
            }
            place.szWhy = step.szWhy;
            Add(place, true);
            return !place.blWritten && !place.blUnrecorded && !IsOver() && Replace(place, step.szWhy);
        case Action::kReplace:
            return Replace(place, step.szWhy);
        case Action::kKeep:
            if (mPlaces.MadeAt(place) == nullptr) {  // made before there was a record; its age is not known
                mPlaces.Adopt(place, RowOf(place.entry, true, mPlaces.Now()));
            }
            place.verdict = Open(mPlaces, place);
            LookAgain(place);
            return false;
        case Action::kLeave:
            place.verdict = {PortState::kOpen, "1", {}, place.entry.nLease, false, step.szWhy};
            mPlaces.Wake(place.entry.nLease == 0 ? Places::kNever : mPlaces.Now() + place.entry.nLease);
            LookAgain(place);
            return false;
        case Action::kInTheWay:
            place.verdict = InTheWay(mPlaces, place.entry, step.szWhy);
            return false;
        default:
            return false;
    }
}

bool Carrier::Replace(Place& place, const char* szWhy) {
    if (place.before) {  // it is there again, or still
        place.kept = {Reply::kRefused, kKept};
    }
    if (place.kept.IsOk() && Remove(place, szWhy)) {
        return true;
    }
    if (place.enSeen == Seen::kHidden && Serves(mPlaces.Known(place), *place.pWanted, Box())) {
        return Add(place, true);  // the answer shows whether it is there
    }
    place.verdict = StillHeld(mPlaces, place, place.kept);
    return false;
}

// True: what is known of the place has changed.
bool Carrier::Renew(Place& place) {
    const Made* pMade = mPlaces.MadeAt(place);
    const bool blDoubtful = !mPlaces.what.blShows && (pMade == nullptr || pMade->blBefore);
    const bool blAgain = Add(place, false);
    if (!place.blWritten && mPlaces.MadeAt(place) != nullptr) {  // the lease runs on, where there is one
        place.verdict = blDoubtful ? RefusedBy(place.answer) : Verdict{PortState::kOpen, "1", {}, place.entry.nLease};
        mPlaces.Wake(mPlaces.Now() + kRenewAgain);
    }
    return blAgain;
}

bool Carrier::Unrecorded(Place& place) {
    if (place.blUnrecorded) {
        place.verdict = {PortState::kRefused, kUnrecorded};
        if (place.enSeen == Seen::kPresent && IsOurs(place.entry, mPlaces.MadeAt(place), Box())) {
            place.verdict.szWhy = "it still leads to port " + std::to_string(place.entry.nBoxPort) + " of " +
                                  place.entry.szClient + ", as before: " + WhyOf(place.verdict);
        }
        mPlaces.Wake(mPlaces.Now() + kRecordAgain);
    }
    return place.blUnrecorded;
}

// Asks for what is wanted at a place. True: what is known of the place has changed, and is to be decided anew.
bool Carrier::Add(Place& place, bool blAnew) {
    // What was granted since, and is to be renewed, is there.
    const auto& mapElsewhere = mPlaces.habit.mapElsewhere;
    if (const auto it = mapElsewhere.find(place.key); blAnew && it != mapElsewhere.end()) {
        place.verdict = RefusedBy({Reply::kElsewhere, it->second});
        return false;
    }
    if (blAnew && IsLost(place)) {
        return false;
    }
    if (const uint16_t nOlder = OlderPlace(place); nOlder != 0) {
        place.verdict = {PortState::kWaiting, "the router has not closed port " + std::to_string(nOlder) + " yet"};
        mPlaces.Wake(mPlaces.Now() + kCloseAgain);
        return false;
    }
    if (blAnew) {  // news where nobody knew before: the router did not answer at first
        NoteIntent(mPlaces, place);
        if (Unrecorded(place)) {
            return false;
        }
    }
    RouterMapping mapping = *place.pWanted;
    mapping.szClient = Box();
    const int64_t nAsked = mPlaces.Now();
    const RouterReply& reply = place.answer = Note(AddWithLease(mPlaces.router, mapping, mPlaces.habit));
    if (Made* pMade = mPlaces.MadeAt(place); reply.IsSilence() && mapping.nLease == 0 && pMade != nullptr) {
        pMade->nLease = 0;  // it may be there by now, without the lease that was asked for at first
    }
    if (reply.IsOk()) {
        OnMade(place, mapping, nAsked, blAnew);
        return false;
    }
    if (reply.enReply == Reply::kElsewhere) {
        OnElsewhere(place, mapping, reply);
        return false;
    }
    if (blAnew) {
        OnRefused(place, reply);
    }
    if (reply.enReply != Reply::kConflict || place.enSeen == Seen::kPresent) {
        return false;
    }
    // The listing did not show who is in the way. A router that guards its entries does not even show them now.
    return mPlaces.Look(place).IsOk();
}

void Carrier::OnMade(Place& place, const RouterMapping& mapping, int64_t nAsked, bool blAnew) {
    // Some say yes to a change, and leave the entry as it was.
    const bool blChange = mPlaces.what.blShows && place.enSeen == Seen::kPresent && blAnew;
    const Made* pMade = mPlaces.MadeAt(place);
    Made made = RowOf(mapping, !mPlaces.what.blShows, nAsked);
    if (blChange) {
        made.other = {place.entry.szClient, place.entry.nBoxPort};
    } else if (pMade != nullptr) {
        made.other = pMade->other;
    }
    mPlaces.rows[place.key] = std::move(made);
    if (blAnew) {
        mPlaces.around.fnTell(mapping, {Action::kAdd, place.szWhy});
    }
    mPlaces.habit.mapElsewhere.erase(place.key);
    place.blWritten = true;
    if (mPlaces.what.blShows) {
        place.enSeen = Seen::kUnknown;
        place.verdict = {PortState::kOpen, kWritten};
        mRgpWritten.push_back(&place);
    } else {
        place.enSeen = Seen::kPresent;
        place.entry = mapping;
        place.verdict = Open(mPlaces, place);
    }
    place.verdict.blAnew = blAnew;
}

// The router opened a port that nobody asked for: it is closed before anything else is done.
void Carrier::OnElsewhere(Place& place, const RouterMapping& made, const RouterReply& reply) {
    Forget(place);
    place.enSeen = Seen::kHidden;
    place.verdict = RefusedBy(reply);
    Place& other = mPlaces.At(KeyOf(made));
    mPlaces.rows[other.key] = RowOf(made, true, mPlaces.Now());
    other.enSeen = Seen::kPresent;
    other.entry = made;
    if (Remove(other, "the router made it instead of another one")) {
        mPlaces.habit.mapElsewhere[place.key] = reply.szWord;
    }
}

// What was refused is not there, unless it was before. Then it may be in the way still.
void Carrier::OnRefused(Place& place, const RouterReply& reply) {
    place.verdict = RefusedBy(reply);
    const Made* pMade = mPlaces.MadeAt(place);
    if (reply.IsRefusal() && place.enSeen == Seen::kAbsent && pMade != nullptr && !pMade->blShown) {
        Forget(place);
        if (place.before) {
            mPlaces.rows.emplace(place.key, *place.before);
        }
    }
}

// What a form showed before something was done may look different afterwards.
void Carrier::LookAgain(Place& place) {
    if (mPlaces.what.blForm && mPlaces.what.blShows) {
        mRgpWritten.push_back(&place);
    }
}

// Another place that may still have the port of the box, at a router that would take away the one with the other. 0:
// none.
uint16_t Carrier::OlderPlace(const Place& place) const {
    const auto [first, end] = mMapByBoxPort.equal_range({place.key.first, place.pWanted->nBoxPort});
    const auto older = std::find_if(first, end, [&](const auto& row) {
        const Made* pMade = mPlaces.MadeAt(*row.second);  // as it is by now
        return row.second != &place && pMade != nullptr && pMade->nBoxPort == row.first.second &&
               pMade->szClient == Box();
    });
    return older == end ? uint16_t{0} : older->second->key.second;
}

// A router's yes is not enough: the mapping must be in its table, and be ours.
void Carrier::ReadBack() {
    do {  // once more for those that had to be replaced
        if (mPlaces.what.blForm) {
            mApplied = Note(mPlaces.router.Apply());
            if (!mApplied.IsOk()) {
                OnNotApplied();
                break;
            }
            CheckGone();
        }
        mPlaces.LookAtRanges(mRgpWritten);
        for (Place* pPlace : std::exchange(mRgpWritten, {})) {
            Confirm(*pPlace);
        }
    } while (!mRgpWritten.empty());
    mNReadBack = mPlaces.Now();
}

void Carrier::Confirm(Place& place) {
    const bool blAnew = place.verdict.blAnew;
    RouterReply reply;
    if (!mPlaces.IsServed(place) || mPlaces.what.blForm) {
        reply = IsOver() ? mPlaces.guard.Unasked() : mPlaces.Look(place);
    }
    const bool blWritten = std::exchange(place.blWritten, false);
    if (mPlaces.IsServed(place)) {
        if (blWritten) {
            place.verdict = Open(mPlaces, place);
            place.verdict.blAnew = blAnew;
        }
    } else if (IsOver() || (!reply.IsOk() && reply.enReply != Reply::kNoSuchEntry)) {
        place.verdict = RefusedBy(reply);
    } else if (place.enSeen == Seen::kPresent && IsOurs(place.entry, mPlaces.MadeAt(place), Box()) &&
               !std::exchange(place.blReplaced, true) && Remove(place, "the router said yes to a change of it")) {
        place.verdict = {PortState::kRefused, kLost};
        Settle(place);
    } else if (place.enSeen == Seen::kPresent && IsOurs(place.entry, mPlaces.MadeAt(place), Box())) {
        place.kept = {Reply::kRefused, kKept};
        place.verdict = StillHeld(mPlaces, place, place.kept);
    } else if (place.enSeen == Seen::kPresent && place.entry.szClient != Box()) {
        place.verdict = InTheWay(mPlaces, place.entry);
        Forget(place);
    } else {
        place.verdict = {PortState::kRefused, kLost};
        OnLost(place, reply);
    }
}

// The router may only be slow to show it: it stays on record for one more look, and is not asked for until then.
void Carrier::OnLost(const Place& place, const RouterReply& reply) {
    if (reply.enReply == Reply::kNoSuchEntry && mPlaces.what.blForm) {
        Forget(place);
    } else if (reply.enReply == Reply::kNoSuchEntry) {
        mPlaces.habit.setLost.insert(place.key);
        mPlaces.Wake(mPlaces.Now() + kLookForLost);
    }
}

// That look. Whatever comes to its place after it is somebody else's. True: it is not shown yet, or lost.
bool Carrier::IsLost(Place& place) {
    const Made* pMade = mPlaces.MadeAt(place);
    const bool blLooked = mPlaces.IsLookedFor(place);
    if (blLooked) {
        place.verdict = {PortState::kRefused, kLost};
        if (const int64_t nLook = pMade->nAsked + kLookForLost; mPlaces.Now() < nLook) {
            mPlaces.Wake(nLook);
            return true;
        }
        Forget(place);
    }
    mPlaces.habit.setLost.erase(place.key);
    return blLooked;
}

PassResult Carrier::Run(const std::vector<RouterMapping>& rgWanted) {
    mNReadBack = mPlaces.Now();
    mPlaces.Save();  // what could not be written before
    mPlaces.LookAtTable();
    PlaceList rgpUnwanted;
    for (auto& [key, place] : mPlaces.mapPlaces) {
        if (place.pWanted == nullptr) {
            rgpUnwanted.push_back(&place);
        }
        if (const Made* pMade = mPlaces.MadeAt(place); mPlaces.what.blByBoxPort && pMade != nullptr) {
            mMapByBoxPort.emplace(std::pair(key.first, pMade->nBoxPort), &place);
        }
    }
    Clear(std::move(rgpUnwanted));
    PlaceList rgpWanted;
    for (const RouterMapping& wanted : rgWanted) {
        if (Place& place = mPlaces.At(KeyOf(wanted)); place.pWanted != nullptr) {
            rgpWanted.push_back(&place);
        }
    }
    BringAll(std::move(rgpWanted));
    PassResult result = Conclude(mPlaces, rgWanted, mApplied);
    mPlaces.Save();
    return result;
}

}  // namespace

void Forget(Record& record, Habits& habit, const std::string& szBox, bool blRestarted, bool blDoubtful, int64_t nNow) {
    if (blRestarted) {
        record.Lose(szBox);
    } else if (blDoubtful) {
        record.Doubt();
    }
    if (blDoubtful || nNow - habit.nElsewhereSince > habit.nLease / 2) {
        habit.mapElsewhere.clear();
        habit.nElsewhereSince = nNow;
    }
}

// Routers of the first generation know permanent mappings only; some say so, some call it bad arguments, and some only
// refuse. What is not said is believed of the router when it has happened twice.
RouterReply AddWithLease(Router& router, RouterMapping& mapping, Habits& habit) {
    const RouterMapping wanted = mapping;
    mapping.nLease = habit.blPermanentOnly ? 0 : habit.nLease;
    const bool blLease = mapping.nLease != 0;
    RouterReply reply = router.Add(mapping);
    const bool blSaysSo = reply.enReply == Reply::kOnlyPermanent;
    const bool blMayBeLease = (reply.enReply == Reply::kBadArguments || reply.enReply == Reply::kRefused) &&
                              !habit.blTakesLease && habit.nVain < kMostVain;
    habit.blTakesLease = habit.blTakesLease || (blLease && reply.IsOk());
    if (blLease && (blSaysSo || blMayBeLease)) {
        mapping = wanted;
        mapping.nLease = 0;
        reply = router.Add(mapping);
        habit.nTakenWithout += reply.IsOk() ? 1 : 0;
        habit.nVain += reply.IsOk() ? 0 : 1;
        habit.blPermanentOnly = habit.blPermanentOnly || blSaysSo || habit.nTakenWithout >= kTakenWithout;
    }
    return reply;
}

PassResult BringInLine(Router& router, const std::vector<RouterMapping>& rgWanted, Record& record, Habits& habit,
                       const Surroundings& around) {
    if (habit.router != record.Router()) {
        // What it can do is true for as long as nothing says that it is another one.
        const bool blOther = !habit.router.szGateway.empty() && !habit.router.IsSame(record.Router());
        habit.blPermanentOnly = habit.blPermanentOnly && !blOther;
        habit.blTakesLease = habit.blTakesLease && !blOther;
        habit.nTakenWithout = blOther ? 0 : habit.nTakenWithout;
        habit.blNoRanges = habit.blNoRanges && !blOther;
        habit.mapElsewhere.clear();
        habit.setLost.clear();
        habit.router = record.Router();
    }
    habit.nVain = 0;
    Places places(router, rgWanted, record, habit, around);
    return Carrier(places).Run(rgWanted);
}

OutcomeList LeftOnRecord(const Record& record, const std::vector<RouterMapping>& rgWanted, const Abilities& what,
                         const RouterReply& why, int64_t nNow) {
    std::map<MappingKey, const RouterMapping*> mapWanted;
    for (const RouterMapping& wanted : rgWanted) {
        mapWanted.emplace(KeyOf(wanted), &wanted);
    }
    OutcomeList rgOutcomes;
    for (const auto& [key, made] : record.Here()) {
        const auto it = mapWanted.find(key);
        // What a form still has of before is there beside what is wanted.
        const bool blWanted =
            it != mapWanted.end() &&
            (!what.blForm || (it->second->nBoxPort == made.nBoxPort && it->second->nMore == made.nMore));
        if (!blWanted && !made.IsSurelyOver(nNow, what.blLeases)) {
            rgOutcomes.push_back(OutcomeOf(MappingOf(key, made, 0), RefusedBy(why)));
            rgOutcomes.back().blLeftOver = true;
        }
    }
    return rgOutcomes;
}

}  // namespace tavo
