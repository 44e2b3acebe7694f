// See Intents.h.
#include "mapping/Intents.h"

#include <optional>
#include <utility>

#include "ground/Marks.h"

namespace tavo {

namespace {

// True when it is news.
bool Intend(Places& places, const Place& place) {
    Made* pMade = places.MadeAt(place);
    RouterMapping mapping = *place.pWanted;
    mapping.szClient = places.around.szBox;
    mapping.nLease = places.habit.blPermanentOnly ? 0 : places.habit.nLease;
    if (pMade != nullptr && place.enSeen == Seen::kPresent) {  // a change: it may lead to the one port or to the other
        const bool blNews = pMade->blShown || pMade->other.nBoxPort != mapping.nBoxPort;
        pMade->blShown = false;
        pMade->other = {mapping.szClient, mapping.nBoxPort};
        return blNews;
    }
    // What was shown is known by its text from then on. One that the router gives to everybody's stays what it is.
    const bool blText = pMade != nullptr && pMade->blShown && pMade->szText.starts_with(kOwnPrefix) &&
                        pMade->szText != mapping.szDescription;
    const bool blNews = pMade == nullptr || places.habit.setUnsaved.contains(place.key) ||
                        pMade->szClient != mapping.szClient || pMade->nBoxPort != mapping.nBoxPort ||
                        pMade->nMore != mapping.nMore || blText;
    Made made = RowOf(mapping, false, places.Now());
    // What was taken away there is gone when the new one is shown: a form has to be applied, and some only say yes.
    if (place.before && (place.before->szClient != made.szClient || place.before->nBoxPort != made.nBoxPort)) {
        made.other = {place.before->szClient, place.before->nBoxPort};
    } else if (!place.before && pMade != nullptr && place.enSeen != Seen::kAbsent) {
        made.other = pMade->other;  // its removal was not answered
    }
    places.rows[place.key] = std::move(made);
    return blNews;
}

void Put(Places& places, const PlaceList& rgpAsked, bool blNews) {
    std::vector<std::pair<Place*, std::optional<Made>>> rgBefore;
    for (Place* pPlace : rgpAsked) {
        const Made* pMade = places.MadeAt(*pPlace);
        std::optional<Made> before = pMade == nullptr ? std::nullopt : std::optional(*pMade);
        if (Intend(places, *pPlace)) {
            rgBefore.emplace_back(pPlace, std::move(before));
        }
    }
    if ((!blNews && rgBefore.empty()) || places.Save()) {
        return;
    }
    for (const auto& [pPlace, before] : rgBefore) {
        places.rows.erase(pPlace->key);
        if (before) {
            places.rows.emplace(pPlace->key, *before);
        }
        pPlace->blUnrecorded = true;
    }
}

}  // namespace

void NoteIntents(Places& places, const PlaceList& rgpPlaces) {
    PlaceList rgpAsked;
    bool blNews = false;
    for (Place* pPlace : rgpPlaces) {
        const Action enAction = places.StepFor(*pPlace).enAction;
        if (enAction == Action::kAdd || enAction == Action::kChange) {
            if (places.habit.mapElsewhere.contains(pPlace->key) || places.IsLookedFor(*pPlace)) {
                continue;  // it is not asked for now
            }
            rgpAsked.push_back(pPlace);
        } else if (enAction == Action::kRenew && places.MadeAt(*pPlace) == nullptr) {  // made before there was a record
            Made made = RowOf(pPlace->entry, true, 0);
            made.blBefore = true;
            places.Adopt(*pPlace, std::move(made));
            blNews = true;
        }
    }
    Put(places, rgpAsked, blNews);
}

void NoteIntent(Places& places, Place& place) {
    Put(places, {&place}, false);
}

}  // namespace tavo
