// See Plan.h.
#include "mapping/Plan.h"

#include "ground/Marks.h"

namespace tavo {

namespace {

Step Unwanted(const PlaceView& view, const std::string& szBox, int64_t nNow, bool blLeases) {
    switch (view.enSeen) {
        case Seen::kUnknown:
            return view.pMade == nullptr ? Step{} : Step{Action::kLook, "no rule asks for it, and it may be there"};
        case Seen::kHidden:
            if (view.pMade != nullptr && view.pMade->IsSurelyOver(nNow, blLeases)) {
                return {Action::kForget, "its lease is over, and the place may be somebody else's"};
            }
            return view.pMade == nullptr ? Step{} : Step{Action::kRemove, "no rule asks for what we made here"};
        case Seen::kAbsent:
            if (view.pMade != nullptr && view.pMade->MayShowLate(nNow)) {
                return {Action::kRemove, "no rule asks for it, and the router may only not show it yet"};
            }
            return view.pMade == nullptr ? Step{} : Step{Action::kForget, "the router has it no more"};
        default:
            break;
    }
    if (IsOurs(*view.pEntry, view.pMade, szBox)) {
        return {Action::kRemove, "no rule asks for it"};
    }
    return view.pMade == nullptr ? Step{} : Step{Action::kForget, "somebody else has the place by now"};
}

Step WantedAndThere(const PlaceView& view, const std::string& szBox, int64_t nNow, const Abilities& what) {
    const RouterMapping& entry = *view.pEntry;
    if (KeyOf(entry) != KeyOf(*view.pWanted)) {
        return {Action::kInTheWay, "another entry of the router has one of its ports"};
    }
    if (!IsOurs(entry, view.pMade, szBox)) {
        return Serves(entry, *view.pWanted, szBox) ? Step{Action::kLeave, "another program of this box made it"}
               : entry.szClient == szBox
                   ? Step{Action::kInTheWay, "another program of this box has this port on the router"}
               : entry.szClient.empty() ? Step{Action::kInTheWay, "somebody else has this port on the router"}
                                        : Step{Action::kInTheWay, "another device has this port on the router"};
    }
    if (entry.szClient != szBox) {
        return {Action::kReplace, "it leads to an address that this box had before"};
    }
    if (!Serves(entry, *view.pWanted, szBox)) {
        // Where nobody could see what came of a change, or cannot ask for one, it is made anew.
        return {what.blShows && !what.blForm ? Action::kChange : Action::kReplace,
                "it is to lead to another port of this box"};
    }
    // One without our record was made before there was one: nobody knows how old its lease is.
    const bool blDue = entry.nLease != 0 && (view.pMade == nullptr || view.pMade->IsDue(nNow));
    return blDue ? Step{Action::kRenew, "half of its lease is over"} : Step{Action::kKeep, "as it is to be"};
}

// Whether what was asked for here before may be there and lead elsewhere. A router that knows a mapping by the port of
// the box puts the new one beside it, and our record of the place would be of the new one only.
bool MayHoldAnother(const PlaceView& view, const std::string& szBox, int64_t nNow, const Abilities& what) {
    return what.blByBoxPort && view.pMade != nullptr && !view.pMade->blShown &&
           !view.pMade->IsSurelyOver(nNow, what.blLeases) &&
           !Serves(MappingOf(KeyOf(*view.pWanted), *view.pMade, 0), *view.pWanted, szBox);
}

}  // namespace

bool IsOurs(const RouterMapping& entry, const Made* pMade, const std::string& szBox) {
    return (pMade != nullptr && pMade->IsEntry(entry)) ||
           (entry.szClient == szBox && entry.szDescription.starts_with(kOwnPrefix));
}

bool Serves(const RouterMapping& entry, const RouterMapping& wanted, const std::string& szBox) {
    return entry.szClient == szBox && entry.nBoxPort == wanted.nBoxPort && entry.nMore == wanted.nMore &&
           entry.blEnabled;
}

Step Decide(const PlaceView& view, const std::string& szBox, int64_t nNow, const Abilities& what) {
    if (view.pWanted == nullptr) {
        return Unwanted(view, szBox, nNow, what.blLeases);
    }
    switch (view.enSeen) {
        case Seen::kUnknown:
            return {Action::kLook, "a rule asks for it, and nobody has looked"};
        case Seen::kPresent:
            return WantedAndThere(view, szBox, nNow, what);
        case Seen::kHidden:
            if (what.blForm && view.pMade != nullptr) {
                return {Action::kReplace, "made anew: the answer shows whether it is there"};
            }
            if (MayHoldAnother(view, szBox, nNow, what)) {
                return {Action::kReplace, "what was asked for here before may be there, and leads elsewhere"};
            }
            [[fallthrough]];
        default:
            return {Action::kAdd, "a rule asks for it, and the router does not show it"};
    }
}

}  // namespace tavo
