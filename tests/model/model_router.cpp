// See model_router.h.
#include "model_router.h"

#include <algorithm>
#include <utility>

namespace model {

namespace {

constexpr size_t kFirstEntries = 3;  // that a listing shows before it ends in a fault
constexpr int64_t kSlow = 3;         // seconds until a change is shown

}  // namespace

void Router::Expire() {
    std::erase_if(mMapTable,
                  [this](const auto& entry) { return entry.second.nEnd != 0 && entry.second.nEnd <= mNNow; });
}

const Router::Entry* Router::At(const tavo::MappingKey& key) {
    Expire();
    const auto it = mMapTable.find(key);
    return it == mMapTable.end() ? nullptr : &it->second;
}

template <typename Effect>
Reply Router::Answer(Effect fnEffect) {
    const Reply lost{tavo::Reply::kTimeout, "timeout"};
    ++nRequests;
    mNNow += habits.blSlow ? 1 : 0;
    Expire();
    if (Chance(nKillPerMille)) {
        throw Killed();
    }
    if (blAway || Chance(nLosePerMille)) {
        return lost;
    }
    const Reply reply = fnEffect();
    if (Chance(nKillPerMille)) {
        throw Killed();
    }
    return Chance(nLosePerMille) ? lost : reply;
}

tavo::RouterMapping Router::Shown(const Entry& entry) const {
    tavo::RouterMapping shown = entry.mapping;
    if (habits.blForgetsLease) {
        shown.nLease = 0;
    } else if (habits.blHidesClient) {
        shown.szClient.clear();
    } else if (habits.blListsWhatIsLeft && entry.nEnd != 0) {
        shown.nLease = static_cast<uint32_t>(entry.nEnd - mNNow);
    }
    return shown;
}

std::string Habits::Text() const {
    const std::pair<bool, const char*> rgHas[] = {
        {blPermanentOnly, "permanent only"},
        {blForgetsLease, "forgets leases"},
        {blListsWhatIsLeft, "lists what is left"},
        {nLongestLease != 0, "short leases"},
        {nText == 1, "rewrites texts"},
        {nText == 2, "drops texts"},
        {blSecure, "secure"},
        {!blOverwrites, "718 for a change"},
        {nCapacity < 1000, blSaysFull ? "small" : "small and does not say so"},
        {enList != tavo::Reply::kOk, "lists badly"},
        {blRanges, blRangesLie ? "ranges that lie" : "ranges"},
        {blSaysChanged, "says changed"},
        {blBlind, "blind"},
        {blKeepsRemoved, "keeps removed"},
        {blSlowToHide, "slow to hide"},
        {blSlowToShow, "slow to show"},
        {blSlow, "slow"},
        {blForm, "form"},
        {blApply, "to be applied"},
        {blMute, "mute"},
        {blHidesClient, "hides clients"},
    };
    std::string szText;
    for (const auto& [blHas, szHabit] : rgHas) {
        szText += blHas ? std::string(szText.empty() ? "" : ", ") + szHabit : "";
    }
    return szText;
}

std::map<tavo::MappingKey, tavo::RouterMapping> Router::View() const {
    std::map<tavo::MappingKey, tavo::RouterMapping> mapView;
    for (const auto& [key, entry] : mMapTable) {
        if (!habits.blSlowToShow || !entry.blBox || mNNow - entry.nMade >= kSlow) {
            mapView.emplace(key, Shown(entry));
        }
    }
    for (const auto& [key, gone] : mMapGone) {
        if (habits.blSlowToHide && mNNow - gone.first < kSlow && !mMapTable.contains(key)) {
            mapView.emplace(key, Shown(gone.second));
        }
    }
    return mapView;
}

void Router::BeforeChange() {
    mBlListed = false;
    mBlChanged = true;
    if (habits.blApply && !mMapBefore) {
        mMapBefore = mMapTable;
    }
}

void Router::EndRun() {
    if (mMapBefore) {
        mMapTable = std::move(*mMapBefore);
        mMapBefore.reset();
    }
}

Reply Router::ReadForm() {
    if (mBlListed || habits.blMute) {
        return {};
    }
    return Answer([&]() -> Reply {
        mBlListed = true;
        mMapListed.clear();
        for (const auto& [key, entry] : mMapTable) {
            mMapListed[key] = Shown(entry);
        }
        return {};
    });
}

Reply Router::FormGet(const tavo::MappingKey& key, tavo::RouterMapping& mapping) {
    if (const Reply reply = ReadForm(); !reply.IsOk()) {
        return reply;
    }
    const auto it = mMapListed.find(key);
    if (it == mMapListed.end()) {
        return {tavo::Reply::kNoSuchEntry, "not listed"};
    }
    mapping = it->second;
    return {};
}

// Once for what was done before; the answer is that of the last time.
Reply Router::Apply() {
    if (std::exchange(mBlChanged, false)) {
        mBlListed = false;
        mApplied = Answer([this] {
            mMapBefore.reset();
            return Reply{};
        });
    }
    return mApplied;
}

Reply Router::List(std::vector<tavo::RouterMapping>& rgMappings) {
    if (habits.blForm) {
        Reply reply = ReadForm();
        for (const auto& [key, mapping] : mMapListed) {
            if (mBlListed) {
                rgMappings.push_back(mapping);
            }
        }
        return reply;
    }
    if (habits.blBlind) {
        return mAsked;
    }
    return Answer([&]() -> Reply {
        for (const auto& [key, shown] : View()) {
            if (habits.enList != tavo::Reply::kOk && rgMappings.size() >= kFirstEntries) {
                break;
            }
            if (habits.enList <= tavo::Reply::kTooLong && !Chance(nSkipPerMille)) {
                rgMappings.push_back(shown);
            }
        }
        return {habits.enList, "list"};
    });
}

Reply Router::ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                        std::vector<tavo::RouterMapping>& rgMappings) {
    if (!habits.blRanges) {
        return {tavo::Reply::kRefused, "401"};
    }
    return Answer([&]() -> Reply {
        for (const auto& [key, shown] : View()) {
            const bool blShown = !habits.blRangesLie || shown.szClient != szBox;
            if (blShown && key.first == szProtocol && key.second >= nFirst && key.second <= nLast) {
                rgMappings.push_back(shown);
            }
        }
        return {};
    });
}

Reply Router::Get(const std::string& szProtocol, uint16_t nRouterPort, tavo::RouterMapping& mapping) {
    if (habits.blForm) {
        return FormGet({szProtocol, nRouterPort}, mapping);
    }
    return Answer([&]() -> Reply {
        const auto mapView = View();
        const auto it = mapView.find({szProtocol, nRouterPort});
        if (it == mapView.end()) {
            return {tavo::Reply::kNoSuchEntry, "714"};
        }
        mapping = it->second;
        return {};
    });
}

Reply Router::DoAdd(const tavo::RouterMapping& mapping) {
    if (habits.blPermanentOnly && mapping.nLease != 0) {
        return {tavo::Reply::kOnlyPermanent, "725"};
    }
    const tavo::MappingKey key = tavo::KeyOf(mapping);
    const Entry* pThere = At(key);
    if (pThere != nullptr && habits.blForm) {
        return {tavo::Reply::kRefused, "in use"};
    }
    if (pThere != nullptr) {
        const bool blSame = pThere->mapping.nBoxPort == mapping.nBoxPort;
        if (pThere->mapping.szClient != mapping.szClient || (!blSame && !habits.blOverwrites)) {
            return {tavo::Reply::kConflict, "718"};
        }
        if (!pThere->blBox && !pThere->blOrphan) {
            szBroken = "another program's mapping is changed";
        }
        if (!blSame && habits.blSaysChanged) {
            return {};
        }
    } else if (mMapTable.size() >= habits.nCapacity) {
        return habits.blSaysFull ? Reply{tavo::Reply::kRefused, "728"} : Reply{};
    }
    const int64_t nMade = pThere != nullptr ? pThere->nMade : mNNow;
    Entry& entry = mMapTable[key] = {mapping, 0, true, false, nMade};
    if (habits.nLongestLease != 0 && (mapping.nLease == 0 || mapping.nLease > habits.nLongestLease)) {
        entry.mapping.nLease = habits.nLongestLease;
    }
    entry.nEnd = entry.mapping.nLease == 0 ? 0 : mNNow + entry.mapping.nLease;
    entry.mapping.szDescription = TextOf(mapping.szDescription);
    return {};
}

const Router::Entry* Router::OfBoxPort(const tavo::RouterMapping& mapping) const {
    for (const auto& [key, entry] : mMapTable) {
        if (entry.mapping.szClient == szBox && key.first == mapping.szProtocol &&
            entry.mapping.nBoxPort == mapping.nBoxPort) {
            return &entry;
        }
    }
    return nullptr;
}

Reply Router::DoGrant(tavo::RouterMapping& mapping) {
    const uint16_t nWanted = mapping.nRouterPort;
    if (const Entry* pOwn = OfBoxPort(mapping)) {
        mapping.nRouterPort = pOwn->mapping.nRouterPort;
    } else if (mMapTable.size() >= habits.nCapacity) {
        return {tavo::Reply::kRefused, "refused: out of resources"};
    } else {
        while (At(tavo::KeyOf(mapping)) != nullptr) {
            ++mapping.nRouterPort;
        }
    }
    if (habits.nLongestLease != 0) {
        mapping.nLease = std::min(mapping.nLease, habits.nLongestLease);
    }
    mMapTable[tavo::KeyOf(mapping)] = {mapping, mNNow + mapping.nLease, true};
    return mapping.nRouterPort == nWanted ? Reply{} : Reply{tavo::Reply::kElsewhere, "elsewhere"};
}

Reply Router::Add(tavo::RouterMapping& mapping) {
    if (mapping.szClient != szBox) {
        szBroken = "a mapping for another host is asked for";
    }
    fnBeforeAdd(mapping);
    BeforeChange();
    const Reply reply = Answer([&] { return habits.blBlind ? DoGrant(mapping) : DoAdd(mapping); });
    fnTell("add " + mapping.szProtocol + std::to_string(mapping.nRouterPort) + " -> " + mapping.szClient + ":" +
           std::to_string(mapping.nBoxPort) + " = " + reply.szWord);
    return reply;
}

Reply Router::DoRemove(const tavo::RouterMapping& mapping) {
    const Entry* pEntry = habits.blBlind ? OfBoxPort(mapping) : At(tavo::KeyOf(mapping));
    if (pEntry == nullptr) {
        return habits.blBlind ? Reply{} : Reply{tavo::Reply::kNoSuchEntry, "714"};
    }
    if (habits.blMute &&
        (pEntry->mapping.szClient != mapping.szClient || pEntry->mapping.nBoxPort != mapping.nBoxPort)) {
        return {tavo::Reply::kNoSuchEntry, "no such rule"};
    }
    if (habits.blSecure && pEntry->mapping.szClient != szBox) {
        return {tavo::Reply::kRefused, "606"};
    }
    if (!pEntry->blBox && !pEntry->blOrphan) {
        szBroken = "somebody else's mapping is taken away";
    }
    if (!habits.blKeepsRemoved) {
        const tavo::MappingKey key = tavo::KeyOf(pEntry->mapping);
        mMapGone.insert_or_assign(key, std::pair(mNNow, *pEntry));
        mMapTable.erase(key);
    }
    return {};
}

Reply Router::Remove(const tavo::RouterMapping& mapping) {
    BeforeChange();
    const bool blForeign = habits.blBlind && mapping.szClient != szBox;
    const Reply reply = blForeign ? Reply{tavo::Reply::kRefused, "former"} : Answer([&] { return DoRemove(mapping); });
    fnTell("remove " + mapping.szProtocol + std::to_string(mapping.nRouterPort) + " = " + reply.szWord);
    return reply;
}

Reply Router::Ask(int& nLifeNow) {
    return mAsked = Answer([&]() -> Reply {
               nLifeNow = nLife;
               return {};
           });
}

}  // namespace model
