// See Places.h.
#include "mapping/Places.h"

#include <algorithm>
#include <iterator>
#include <set>
#include <utility>

#include "ground/Marks.h"

namespace tavo {

namespace {

constexpr int64_t kLookFor = 20;  // seconds; then what was looked at is done
constexpr int kRangeFrom = 4;     // fewer are asked for one by one
// Of one request. A widespread router daemon dies of a range with more than some hundred and thirty entries.
constexpr int kRangePorts = 64;
// Asking for a second place would be answered with the first, and giving that back would end it.
constexpr char kShared[] = "another rule has this port of the box; the router gives it one router port only";

}  // namespace

Places::Places(Router& aRouter, const std::vector<RouterMapping>& rgWanted, Record& record, Habits& aHabit,
               const Surroundings& surroundings)
    : router(aRouter),
      what(aRouter.What()),
      rows(record.Here()),
      habit(aHabit),
      around(surroundings),
      guard(result, around.fnStop, around.fnNow, around.fnHeard) {
    std::set<std::pair<std::string, uint16_t>> setBoxPorts;  // the first rule that asks for one has it
    for (const RouterMapping& wanted : rgWanted) {
        Place& place = At(KeyOf(wanted));
        if (what.blByBoxPort && !setBoxPorts.emplace(wanted.szProtocol, wanted.nBoxPort).second) {
            place.verdict = {PortState::kRefused, kShared};
        } else if (place.pWanted == nullptr) {
            place.pWanted = &wanted;
        }
    }
    for (const auto& [key, made] : rows) {
        At(key);
    }
}

Place& Places::At(const MappingKey& key) {
    return mapPlaces.try_emplace(key, Place{.key = key}).first->second;
}

Made* Places::MadeAt(const Place& place) {
    const auto it = rows.find(place.key);
    return it == rows.end() ? nullptr : &it->second;
}

void Places::Adopt(const Place& place, Made made) {
    rows[place.key] = std::move(made);
    habit.setUnsaved.insert(place.key);
}

bool Places::Save() {
    const bool blSaved = around.fnSave();
    if (blSaved) {
        habit.setUnsaved.clear();
    }
    return blSaved;
}

Step Places::StepFor(const Place& place) {
    const PlaceView view{place.pWanted, place.enSeen, place.enSeen == Seen::kPresent ? &place.entry : nullptr,
                         MadeAt(place)};
    return Decide(view, around.szBox, Now(), what);
}

bool Places::IsServed(const Place& place) const {
    return place.enSeen == Seen::kPresent && Serves(place.entry, *place.pWanted, around.szBox);
}

bool Places::IsLookedFor(const Place& place) {
    const Made* pMade = MadeAt(place);
    return habit.setLost.contains(place.key) && pMade != nullptr && !pMade->blShown && !pMade->blBefore &&
           place.enSeen == Seen::kAbsent && Serves(MappingOf(place.key, *pMade, 0), *place.pWanted, around.szBox);
}

bool Places::IsOthers(const Place& place) {
    const auto it = around.mapOthers.find(place.key);
    return it != around.mapOthers.end() && it->second == Known(place).nBoxPort;
}

RouterMapping Places::Known(const Place& place) {
    const Made* pMade = MadeAt(place);
    if (pMade == nullptr || (place.enSeen == Seen::kPresent && !place.entry.szProtocol.empty())) {
        return place.entry;
    }
    const auto nLeft = static_cast<uint32_t>(std::clamp<int64_t>(pMade->End() - Now(), 0, UINT32_MAX));
    return MappingOf(place.key, *pMade, nLeft);
}

// What a table does not show may be there: it is read entry by entry, and whatever others take away or make meanwhile
// moves those that follow.
void Places::LookAtTable() {
    std::vector<RouterMapping> rgTable;
    const RouterReply reply = guard.Note(router.List(rgTable));
    if (!what.blShows) {
        result.transport = reply.IsSilence() ? reply : result.transport;
        Recall();
        return;
    }
    for (const RouterMapping& entry : rgTable) {
        Show(entry, At(KeyOf(entry)));
    }
    nListed = reply.IsOk() ? rgTable.size() : 0;
}

// A router that shows nothing: what it has granted, and what has not run out since, is what there is while it answers.
// Where it was not asked for anything, nothing of ours is.
void Places::Recall() {
    for (auto& [key, place] : mapPlaces) {
        const Made* pMade = MadeAt(place);
        const bool blThere = pMade != nullptr && pMade->blShown && Now() < pMade->End();
        place.enSeen = blThere ? Seen::kPresent : pMade == nullptr ? Seen::kAbsent : Seen::kHidden;
        if (blThere) {
            place.entry = Known(place);
        }
    }
}

void Places::Show(const RouterMapping& entry, Place& place) {
    place.enSeen = Seen::kPresent;
    place.entry = entry;
    Made* pMade = KeyOf(entry) == place.key ? MadeAt(place) : nullptr;
    // Whom it is for where the router does not show that: for whom we made it, unless its text is somebody else's. What
    // was there before and may be there still is looked for first, but where the router has just said yes to the new.
    if (pMade != nullptr && entry.szClient.empty() &&
        (entry.szDescription.empty() || entry.szDescription.starts_with(kOwnPrefix))) {
        const bool blBefore = !place.blWritten && !pMade->blShown && pMade->other.nBoxPort == entry.nBoxPort;
        place.entry.szClient = blBefore ? pMade->other.szClient : pMade->szClient;
    }
    if (pMade == nullptr || !pMade->IsEntry(place.entry)) {
        return;
    }
    pMade->szClient = place.entry.szClient;
    pMade->szText = entry.szDescription;
    pMade->nBoxPort = entry.nBoxPort;
    pMade->other = {};
    habit.setLost.erase(place.key);
    // How long a lease is shows right after it was granted; later listings show what is left of it, or nothing new.
    if (place.blWritten || !pMade->blShown) {
        pMade->nLease = pMade->nLease == 0 ? entry.nLease : std::min(pMade->nLease, entry.nLease);
    }
    pMade->blShown = true;
}

RouterReply Places::Look(Place& place) {
    RouterMapping entry;
    RouterReply reply = guard.Note(router.Get(place.key.first, place.key.second, entry));
    if (reply.IsOk()) {
        Show(entry, place);
    } else if (reply.IsRefusal()) {
        place.enSeen = reply.enReply == Reply::kNoSuchEntry ? Seen::kAbsent : Seen::kHidden;
    }
    return reply;
}

void Places::LookAt(PlaceList& rgpPlaces) {
    const int64_t nEnd = Now() + kLookFor;
    size_t nLooked = 0;
    for (; nLooked < rgpPlaces.size() && (nLooked == 0 || Now() <= nEnd); ++nLooked) {
        if (!guard.IsOver() && StepFor(*rgpPlaces[nLooked]).enAction == Action::kLook) {
            Look(*rgpPlaces[nLooked]);
        }
    }
    rgpPlaces.resize(nLooked);
}

void Places::LookAtRanges(PlaceList rgpPlaces, const std::function<void(Place&)>& fnCovered) {
    std::sort(rgpPlaces.begin(), rgpPlaces.end(),
              [](const Place* pOne, const Place* pOther) { return pOne->key < pOther->key; });
    for (auto it = rgpPlaces.begin(); it != rgpPlaces.end() && !habit.blNoRanges && !guard.IsOver();) {
        const MappingKey& first = (*it)->key;
        const auto end = std::find_if(it, rgpPlaces.end(), [&](const Place* pPlace) {
            return pPlace->key.first != first.first || pPlace->key.second - first.second >= kRangePorts;
        });
        if (end - it >= kRangeFrom) {
            const uint16_t nLast = (*std::prev(end))->key.second;
            std::vector<RouterMapping> rgShown;
            habit.blNoRanges = !guard.Note(router.ListRange(first.first, first.second, nLast, rgShown)).IsOk();
            if (!habit.blNoRanges) {
                std::for_each(it, end, [&](Place* pPlace) { fnCovered(*pPlace); });
            }
            for (const RouterMapping& entry : rgShown) {
                Show(entry, At(KeyOf(entry)));
            }
        }
        it = end;
    }
}

// One listing, where most of the table was taken away. What others take away or make meanwhile moves the entries, so
// that it proves something only if it is as long as it is to be.
bool Places::IsListedWithout(const PlaceList& rgpPlaces) {
    if (nListed < rgpPlaces.size() || nListed - rgpPlaces.size() >= rgpPlaces.size()) {
        return false;
    }
    std::vector<RouterMapping> rgTable;
    const bool blShown = guard.Note(router.List(rgTable)).IsOk();
    const bool blWithout = blShown && rgTable.size() == std::exchange(nListed, rgTable.size()) - rgpPlaces.size();
    for (const RouterMapping& entry : rgTable) {
        Show(entry, At(KeyOf(entry)));
    }
    return blWithout;
}

// What a range does not show is gone where the router says so of one of the places by name, too: some leave out what
// they have.
void Places::LookForGoneInRanges(const PlaceList& rgpPlaces) {
    PlaceList rgpCovered;
    LookAtRanges(rgpPlaces, [&](Place& place) {
        if (place.gone.szClient == around.szBox) {  // a range shows the asker's own mappings
            rgpCovered.push_back(&place);
        }
    });
    std::erase_if(rgpCovered, [](const Place* pPlace) { return pPlace->enSeen != Seen::kUnknown; });
    if (rgpCovered.empty() || guard.IsOver() || !Look(*rgpCovered.front()).IsRefusal()) {
        return;
    }
    for (Place* pPlace : rgpCovered) {
        pPlace->enSeen = Seen::kAbsent;
    }
}

void Places::LookForGone(const PlaceList& rgpPlaces) {
    for (Place* pPlace : rgpPlaces) {
        pPlace->enSeen = Seen::kUnknown;
    }
    if (rgpPlaces.empty() || guard.IsOver()) {
        return;
    }
    const bool blForm = what.blForm;  // one look reads the list for all
    if (!blForm) {
        LookForGoneInRanges(rgpPlaces);
    }
    PlaceList rgpOpen;
    std::copy_if(rgpPlaces.begin(), rgpPlaces.end(), std::back_inserter(rgpOpen),
                 [](const Place* pPlace) { return pPlace->enSeen == Seen::kUnknown; });
    if (!blForm && !rgpOpen.empty() && rgpOpen.size() == rgpPlaces.size() && IsListedWithout(rgpOpen)) {
        std::for_each(rgpOpen.begin(), rgpOpen.end(), [&](Place* pPlace) {
            if (pPlace->enSeen == Seen::kUnknown) {
                pPlace->enSeen = Seen::kAbsent;
            }
        });
    }
    for (Place* pPlace : rgpOpen) {
        if (pPlace->enSeen == Seen::kUnknown && !guard.IsOver()) {
            Look(*pPlace);
        }
    }
}

}  // namespace tavo
