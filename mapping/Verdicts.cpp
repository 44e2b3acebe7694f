// See Verdicts.h.
#include "mapping/Verdicts.h"

#include <algorithm>
#include <utility>

namespace tavo {

namespace {

constexpr char kGoesOn[] = "the router needs longer for so many ports; it is gone on with";
constexpr size_t kMaxDescription = 64;  // of somebody else's entry
constexpr int64_t kAskAgain = 10;       // seconds after an answer that did not come
constexpr int64_t kLeastPause = 5;      // seconds between passes, whatever leases a router gives

Outcome OfWanted(Places& places, const RouterMapping& wanted, const RouterReply& applied) {
    Verdict verdict = places.At(KeyOf(wanted)).verdict;
    if (verdict.szWord.empty()) {
        verdict = RefusedBy(places.guard.Unasked());
    }
    if (verdict.enState == PortState::kOpen && !applied.IsOk()) {
        verdict = RefusedBy(applied);
    }
    if (verdict.enState == PortState::kUnknown) {
        const bool blGoesOn = places.result.blUnfinished && places.result.transport.IsOk();
        verdict.szWhy = blGoesOn ? kGoesOn : verdict.szWhy;
        places.Wake(places.Now() + kAskAgain);
    }
    return OutcomeOf(wanted, std::move(verdict));
}

// What no rule asks for and may be there.
void AddLeftOver(Places& places, const Place& place) {
    const Made* pMade = places.MadeAt(place);
    const bool blThere = place.enSeen == Seen::kPresent && IsOurs(place.entry, pMade, places.around.szBox);
    // What a form still has of before is there beside what is wanted.
    const bool blBeside = places.what.blForm && !place.kept.IsOk();
    if ((place.pWanted != nullptr && !blBeside) || (!blThere && pMade == nullptr) || places.IsOthers(place)) {
        return;
    }
    const RouterMapping left = places.Known(place);
    Outcome outcome =
        OutcomeOf(left, StillHeld(places, place, place.kept.IsOk() ? places.guard.Unasked() : place.kept));
    outcome.blLeftOver = true;
    outcome.verdict.nLease = blThere ? left.nLease : outcome.verdict.nLease;
    places.result.rgOutcomes.push_back(std::move(outcome));
}

}  // namespace

Verdict Open(Places& places, const Place& place) {
    Verdict verdict{PortState::kOpen, "1", {}, place.entry.nLease};
    if (const Made* pMade = places.MadeAt(place); pMade != nullptr && pMade->nLease != 0) {
        places.Wake(pMade->nAsked + pMade->nLease / 2);
        if (pMade->nLease / 2 < kLeastPause) {
            verdict.szWhy = "the router lends it for " + std::to_string(pMade->nLease) +
                            " seconds at a time, so that it is closed now and then";
        }
    }
    return verdict;
}

Verdict InTheWay(const Places& places, const RouterMapping& entry, const char* szWhy) {
    Verdict verdict = RefusedBy({Reply::kConflict, places.what.szConflict});
    verdict.holder = Holder{entry.szClient, HarmlessText(entry.szDescription, kMaxDescription)};
    verdict.szWhy = szWhy;
    return verdict;
}

Verdict StillHeld(Places& places, const Place& place, const RouterReply& reply) {
    Verdict verdict = RefusedBy(reply);
    const Made* pMade = places.MadeAt(place);
    if (pMade == nullptr) {
        return verdict;
    }
    if (pMade->szClient != places.around.szBox && !places.what.blForm) {  // a form obeys everybody
        verdict.enState = PortState::kWaiting;
        verdict.szWhy = "the router keeps it for this box's former address " + pMade->szClient;
    }
    const int64_t nNow = places.Now();
    if (pMade->End() >= nNow) {  // else the router does not keep to it, and nobody knows for how long
        verdict.nLease = static_cast<uint32_t>(std::max<int64_t>(pMade->End() - nNow, 1));
        places.Wake(pMade->End() + 1);
    } else if (pMade->nLease != 0 && !pMade->IsSurelyOver(nNow, true)) {  // some end a lease late
        places.Wake(nNow + kLeastPause);
    }
    return verdict;
}

PassResult Conclude(Places& places, const std::vector<RouterMapping>& rgWanted, const RouterReply& applied) {
    PassResult& result = places.result;
    if (!places.mapPlaces.empty() && !places.guard.HasSense() && result.transport.IsOk() && !result.blStopped) {
        // Codes, and nothing but codes: it is looked for anew in the end.
        result.transport = {Reply::kGarbage, "garbage"};
    }
    for (const RouterMapping& wanted : rgWanted) {
        result.rgOutcomes.push_back(OfWanted(places, wanted, applied));
    }
    for (const auto& [key, place] : places.mapPlaces) {
        AddLeftOver(places, place);
    }
    if (places.nNext != Places::kNever) {
        result.nNextSeconds = static_cast<int>(
            std::clamp<int64_t>(places.nNext - places.Now(), kLeastPause, std::numeric_limits<int>::max()));
    }
    return std::move(result);
}

}  // namespace tavo
