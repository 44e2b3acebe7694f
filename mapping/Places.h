// What one pass knows of the places in a router's table, and how it learns it: from a listing, entry by entry, by
// ranges, or from what was granted before. Relies on a Router, on the rows of its record and on the Plan.
// Promises: what the router shows of ours is how the record knows it from then on; looking changes nothing at the
// router.
#pragma once

#include <functional>
#include <limits>
#include <map>
#include <optional>
#include <vector>

#include "mapping/Pass.h"

namespace tavo {

// What this pass knows of a place, and what it has done about it.
struct Place {
    MappingKey key;
    const RouterMapping* pWanted = nullptr;
    Seen enSeen = Seen::kUnknown;
    RouterMapping entry = {};
    bool blWritten = false;           // asked for in this pass, and not read back yet
    bool blUnrecorded = false;        // what was to be asked for cannot be put on record
    bool blReplaced = false;          // taken away, because the router said yes to a change and did not make it
    RouterReply kept = {};            // the router's word for what it did not take away
    RouterMapping gone = {};          // what was taken away, as it was known
    const char* szWhyGone = "";       // it was taken away
    std::optional<Made> before = {};  // our record of it, where the router's yes to that is not all there is to see
    RouterReply answer = {};          // to the last asking for it
    const char* szWhy = "";           // it was asked for
    Verdict verdict = {};
};
using PlaceList = std::vector<Place*>;

struct Places {
    // rgWanted outlives it.
    Places(Router& aRouter, const std::vector<RouterMapping>& rgWanted, Record& record, Habits& aHabit,
           const Surroundings& surroundings);

    Place& At(const MappingKey& key);
    Made* MadeAt(const Place& place);  // our record of it; null: there is none
    Step StepFor(const Place& place);
    bool IsServed(const Place& place) const;  // it is there, and leads where it is wanted to
    // The router said yes to it, and is to be looked at once more before it is asked again.
    bool IsLookedFor(const Place& place);
    bool IsOthers(const Place& place);  // another daemon of this box has it lead where it leads
    // What is known of what is at a place: what the router shows, else what was asked for.
    RouterMapping Known(const Place& place);

    void LookAtTable();
    RouterReply Look(Place& place);
    // Drops those for which there was no time: a slow router's pass is for doing something, too.
    void LookAt(PlaceList& rgpPlaces);
    // What the router shows of the places, where it can show ranges; may be incomplete. fnCovered: is told of each
    // place of a range that was shown.
    void LookAtRanges(
        PlaceList rgpPlaces, const std::function<void(Place&)>& fnCovered = [](Place&) {});
    // Whether what was taken away is gone: of each place it is known afterwards, as far as the router says. Places that
    // it no longer shows together with others are not asked for one by one.
    void LookForGone(const PlaceList& rgpPlaces);

    // Puts a row on record that stands in memory alone until the next saving.
    void Adopt(const Place& place, Made made);
    bool Save();
    void Wake(int64_t nAt) { nNext = std::min(nNext, nAt); }
    int64_t Now() const { return around.fnNow(); }

    static constexpr int64_t kNever = std::numeric_limits<int64_t>::max();

    Router& router;
    const Abilities what;
    Record::Rows& rows;
    Habits& habit;
    const Surroundings& around;
    PassResult result;
    PassGuard guard;
    int64_t nNext = kNever;  // when something has to be done again
    std::map<MappingKey, Place> mapPlaces;
    size_t nListed = 0;  // entries, where the table was shown to its end

private:
    void Show(const RouterMapping& entry, Place& place);
    bool IsListedWithout(const PlaceList& rgpPlaces);
    void LookForGoneInRanges(const PlaceList& rgpPlaces);
    void Recall();
};

}  // namespace tavo
