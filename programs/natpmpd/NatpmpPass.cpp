// Brings one gateway in line: takes away, then asks, then believes only the answer.
// Relies on NatpmpClient. Promises: see NatpmpPass.h.
#include "programs/natpmpd/NatpmpPass.h"

#include <algorithm>

#include "ground/SysLog.h"
#include "programs/common/Wanted.h"

namespace tavo {

namespace {

// A gateway keeps one mapping for each port of the box and ends it by that port. Asking for a second one
// would be answered with the first, and giving that back would end it.
constexpr char kShared[] = "another rule has this port of the box; NAT-PMP gives it one router port only";

constexpr int kYoungAgain = 10;  // seconds until a gateway that has just started is asked once more

RouterState StateOf(int nTransport) {
    switch (nTransport) {
        case kRouterOk:
            return RouterState::kOk;
        case kRouterUnreachable:
            return RouterState::kNoService;
        default:
            return RouterState::kSilent;
    }
}

Verdict Refusal(int nCode, std::string szWords) {
    return {nCode < 0 ? PortState::kUnknown : PortState::kRefused, std::move(szWords)};
}

uint32_t SecondsLeft(const Held& held) {
    return static_cast<uint32_t>(std::clamp<int64_t>(held.nExpiry - BootSeconds(), 1, UINT32_MAX));
}

Verdict Open(const Held& held) {
    return {PortState::kOpen, "1", {}, SecondsLeft(held)};
}

}  // namespace

NatpmpPass::NatpmpPass(NatpmpState& state, const std::string& szGateway, const std::string& szBox,
                       uint32_t nWishedLease, const std::function<bool()>& fnStop)
    : mState(state),
      mSzGateway(szGateway),
      mSzBox(szBox),
      mNWishedLease(nWishedLease),
      mClient(szGateway, fnStop, [&state](uint32_t nEpoch) { state.epoch.Note(nEpoch, BootClock::now()); }),
      mGuard(mResult, fnStop) {}

std::vector<HeldKey> NatpmpPass::HeldHere() const {
    std::vector<HeldKey> rgKeys;
    for (const auto& [key, held] : mState.held.mRows) {
        if (key.szGateway == mSzGateway && key.szBox == mSzBox) {
            rgKeys.push_back(key);
        }
    }
    return rgKeys;
}

// The router's port as this box has it still by an address that it had before. A gateway knows a client by its address:
// only the end of the lease takes that away.
std::optional<HeldKey> NatpmpPass::FormerOf(const RouterMapping& wanted) const {
    for (const auto& [key, held] : mState.held.mRows) {
        if (key.szGateway == mSzGateway && key.szBox != mSzBox && key.szProtocol == wanted.szProtocol &&
            held.nRouterPort == wanted.nRouterPort) {
            return key;
        }
    }
    return std::nullopt;
}

Verdict NatpmpPass::HeldFor(const HeldKey& former) {
    const uint32_t nLeft = SecondsLeft(mState.held.mRows.at(former));
    const int nNext = static_cast<int>(std::min<uint32_t>(nLeft + 1, INT32_MAX));
    mResult.nNextSeconds = mResult.nNextSeconds == 0 ? nNext : std::min(mResult.nNextSeconds, nNext);
    Verdict verdict{PortState::kWaiting, "the router keeps it for this box's former address " + former.szBox};
    verdict.nLease = nLeft;
    return verdict;
}

// What leads to an address that the box had before, and no rule asks for.
void NatpmpPass::ReportFormer() {
    for (const auto& [key, held] : mState.held.mRows) {
        const bool blWanted =
            std::any_of(mMapWanted.begin(), mMapWanted.end(), [&, &former = key, &row = held](const auto& wanted) {
                return wanted.second->nRouterPort == row.nRouterPort && wanted.first.szProtocol == former.szProtocol;
            });
        if (key.szGateway == mSzGateway && key.szBox != mSzBox && !blWanted) {
            Outcome outcome =
                OutcomeOf({key.szProtocol, held.nRouterPort, key.nBoxPort, key.szBox, "", 0, true}, HeldFor(key));
            outcome.blLeftOver = true;
            mRgOpen.push_back(std::move(outcome));
        }
    }
}

bool NatpmpPass::IsWanted(const HeldKey& key) const {
    const auto it = mMapWanted.find(key);
    return it != mMapWanted.end() && it->second->nRouterPort == mState.held.mRows.at(key).nRouterPort;
}

// Nothing that the gateway once granted counts any more.
void NatpmpPass::Doubt() {
    for (const HeldKey& key : HeldHere()) {
        mState.held.mRows[key].nLifetime = 0;
    }
    mState.mapRemapped.clear();
    mResult.blRenewed = true;
}

PassResult NatpmpPass::Run(const std::vector<RouterMapping>& rgWanted, bool blRenew) {
    for (const RouterMapping& wanted : rgWanted) {
        mMapWanted.emplace(KeyOf(wanted), &wanted);  // the first rule that asks for a port of the box has it
    }
    mState.held.Prune();
    const bool blHeld = std::any_of(mState.held.mRows.begin(), mState.held.mRows.end(),
                                    [this](const auto& row) { return row.first.szGateway == mSzGateway; });
    if (rgWanted.empty() && !blHeld) {
        mState.held.Save();
        return mResult;
    }
    // One question that changes nothing tells whether the gateway answers, and whether it has restarted.
    const int nCode = mClient.AskAddress(mState.szOutside);
    const bool blRestarted = mState.epoch.TakeRestart();
    mBlLost = blRestarted;
    if (blRestarted) {
        SysLog(LOG_NOTICE, "the router has restarted; every mapping is asked for again");
        std::erase_if(mState.held.mRows, [this](const auto& row) {
            return row.first.szGateway == mSzGateway && row.first.szBox != mSzBox;
        });
    }
    ReportFormer();
    if (blRenew || blRestarted || mState.blDoubtful) {
        Doubt();
    }
    mResult.nTransport = std::min(nCode, int{kRouterOk});
    RemoveUnwanted();
    NoteIntents();
    PlaceAll(rgWanted);
    if (mState.epoch.TakeRestart()) {  // it restarted while we spoke
        mBlLost = true;
        Doubt();
        NoteIntents();
        PlaceAll(rgWanted);
    }
    mState.held.Save();
    const bool blYoung = mResult.nTransport == kRouterOk && mState.epoch.IsYoung();
    mState.blDoubtful = mResult.nTransport != kRouterOk || blYoung;
    if (blYoung && !mMapWanted.empty()) {
        mResult.nNextSeconds = kYoungAgain;
    }
    NoteLease();
    mResult.rgOutcomes.insert(mResult.rgOutcomes.end(), mRgOpen.begin(), mRgOpen.end());
    mResult.enRouter = StateOf(mResult.nTransport);
    return mResult;
}

void NatpmpPass::ReportOpen(const HeldKey& key, int nCode) {
    const RouterMapping mapping{key.szProtocol, mState.held.mRows.at(key).nRouterPort, key.nBoxPort, "", "", 0, true};
    Outcome outcome = OutcomeOf(mapping, Refusal(nCode, "still open: " + NatpmpWords(nCode)));
    outcome.verdict.nLease = SecondsLeft(mState.held.mRows.at(key));
    outcome.blLeftOver = true;
    mRgOpen.push_back(std::move(outcome));
}

// Takes away what the rules no longer ask for, and what they ask for at another router port.
void NatpmpPass::RemoveUnwanted() {
    for (const HeldKey& key : HeldHere()) {
        if (IsWanted(key)) {
            continue;
        }
        const int nCode =
            mGuard.IsOver() ? mResult.nTransport : mGuard.Note(mClient.Unmap(key.szProtocol, key.nBoxPort));
        if (nCode == kRouterOk && !mResult.blStopped) {
            mState.held.mRows.erase(key);
        } else {
            ReportOpen(key, nCode);
        }
    }
}

void NatpmpPass::NoteIntents() {
    for (const auto& [key, pWanted] : mMapWanted) {
        if (mState.mapRemapped.count(MappingName(*pWanted)) == 0) {
            const Held intent{pWanted->nRouterPort, 0, BootSeconds() + mNWishedLease, mNWishedLease};
            if (mState.held.mRows.emplace(key, intent).second) {
                mSetNew.insert(key);
            }
        }
    }
    mState.held.Save();
}

void NatpmpPass::PlaceAll(const std::vector<RouterMapping>& rgWanted) {
    mResult.rgOutcomes.clear();
    for (const RouterMapping& wanted : rgWanted) {
        const bool blShared = mMapWanted.at(KeyOf(wanted)) != &wanted;
        const Verdict verdict = mGuard.IsOver() ? Refusal(mResult.nTransport, NatpmpWords(mResult.nTransport))
                                : blShared      ? Verdict{PortState::kRefused, kShared}
                                                : Place(wanted);
        mResult.rgOutcomes.push_back(OutcomeOf(wanted, verdict));
    }
}

Verdict NatpmpPass::Place(const RouterMapping& wanted) {
    if (const auto former = FormerOf(wanted)) {
        return HeldFor(*former);
    }
    const auto remapped = mState.mapRemapped.find(MappingName(wanted));
    if (remapped != mState.mapRemapped.end()) {
        return {PortState::kRefused, remapped->second};
    }
    Held& held = mState.held.mRows.at(KeyOf(wanted));
    if (held.nRouterPort != wanted.nRouterPort) {
        return {PortState::kWaiting, "the router has not closed port " + std::to_string(held.nRouterPort) + " yet"};
    }
    return held.nLifetime != 0 ? Open(held) : Ask(wanted, held);
}

Verdict NatpmpPass::Ask(const RouterMapping& wanted, Held& held) {
    NatpmpGrant grant;
    const int nCode =
        mGuard.Note(mClient.Map(wanted.szProtocol, wanted.nBoxPort, wanted.nRouterPort, mNWishedLease, grant));
    if (nCode != kRouterOk) {
        held = {wanted.nRouterPort, 0, std::max(held.nExpiry, BootSeconds() + mNWishedLease), mNWishedLease};
        return Refusal(nCode, NatpmpWords(nCode));
    }
    held = {grant.nRouterPort, grant.nLifetime, BootSeconds() + grant.nLifetime, grant.nLifetime};
    if (grant.nRouterPort != wanted.nRouterPort) {
        return HandBack(wanted);
    }
    Verdict verdict = Open(held);
    verdict.blAnew = mBlLost || mSetNew.contains(KeyOf(wanted));
    return verdict;
}

// The gateway opened a port that nobody asked for: it is closed before anything else is done.
Verdict NatpmpPass::HandBack(const RouterMapping& wanted) {
    const HeldKey key = KeyOf(wanted);
    std::string szWords = "the router offered " + std::to_string(mState.held.mRows.at(key).nRouterPort);
    const int nCode = mGuard.Note(mClient.Unmap(wanted.szProtocol, wanted.nBoxPort));
    if (nCode != kRouterOk) {
        return {PortState::kRefused, szWords + " and has not closed it yet: " + NatpmpWords(nCode)};
    }
    mState.held.mRows.erase(key);
    mState.mapRemapped[MappingName(wanted)] = szWords;
    SysLog(LOG_WARNING, "%s: %s; given back", MappingName(wanted).c_str(), szWords.c_str());
    return {PortState::kRefused, szWords};
}

void NatpmpPass::NoteLease() {
    mResult.nShortestLease = mMapWanted.empty() ? 0 : mNWishedLease;
    for (const HeldKey& key : HeldHere()) {
        const uint32_t nLifetime = mState.held.mRows.at(key).nLifetime;
        if (nLifetime != 0 && IsWanted(key)) {
            mResult.nShortestLease = std::min(mResult.nShortestLease, nLifetime);
        }
    }
}

}  // namespace tavo
