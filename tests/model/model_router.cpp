// See model_router.h.
#include "model_router.h"

namespace model {

namespace {

constexpr int kNotAuthorized = 606;
constexpr int kFull = 728;
constexpr size_t kFirstEntries = 3;  // that a listing shows before it ends in a fault

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
int Router::Answer(Effect fnEffect) {
    ++nRequests;
    Expire();
    if (Chance(nKillPerMille)) {
        throw Killed();
    }
    if (blAway || Chance(nLosePerMille)) {
        return tavo::kRouterTimeout;
    }
    const int nCode = fnEffect();
    if (Chance(nKillPerMille)) {
        throw Killed();
    }
    return Chance(nLosePerMille) ? static_cast<int>(tavo::kRouterTimeout) : nCode;
}

tavo::RouterMapping Router::Shown(const Entry& entry) const {
    tavo::RouterMapping shown = entry.mapping;
    if (habits.blForgetsLease) {
        shown.nLease = 0;
    } else if (habits.blListsWhatIsLeft && entry.nEnd != 0) {
        shown.nLease = static_cast<uint32_t>(entry.nEnd - mNNow);
    }
    return shown;
}

int Router::List(std::vector<tavo::RouterMapping>& rgMappings) {
    return Answer([&] {
        for (const auto& [key, entry] : mMapTable) {
            if (habits.nListCode != tavo::kRouterOk && rgMappings.size() >= kFirstEntries) {
                break;
            }
            if (habits.nListCode <= tavo::kRouterOk && !Chance(nSkipPerMille)) {
                rgMappings.push_back(Shown(entry));
            }
        }
        return habits.nListCode;
    });
}

int Router::ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                      std::vector<tavo::RouterMapping>& rgMappings) {
    if (!habits.blRanges) {
        return tavo::kRouterInvalidAction;
    }
    return Answer([&] {
        for (const auto& [key, entry] : mMapTable) {
            if (key.first == szProtocol && key.second >= nFirst && key.second <= nLast &&
                entry.mapping.szClient == szBox) {
                rgMappings.push_back(Shown(entry));
            }
        }
        return static_cast<int>(tavo::kRouterOk);
    });
}

int Router::Get(const std::string& szProtocol, uint16_t nRouterPort, tavo::RouterMapping& mapping) {
    return Answer([&] {
        const Entry* pEntry = At({szProtocol, nRouterPort});
        if (pEntry == nullptr) {
            return static_cast<int>(tavo::kRouterNoSuchEntry);
        }
        mapping = Shown(*pEntry);
        return static_cast<int>(tavo::kRouterOk);
    });
}

int Router::DoAdd(const tavo::RouterMapping& mapping) {
    if (mapping.szClient != szBox) {
        szBroken = "a mapping for another host is asked for";
    }
    if (habits.blPermanentOnly && mapping.nLease != 0) {
        return tavo::kRouterOnlyPermanentLeases;
    }
    const tavo::MappingKey key = tavo::KeyOf(mapping);
    const Entry* pThere = At(key);
    if (pThere != nullptr) {
        const bool blSame = pThere->mapping.nBoxPort == mapping.nBoxPort;
        if (pThere->mapping.szClient != mapping.szClient || (!blSame && !habits.blOverwrites)) {
            return tavo::kRouterConflict;
        }
        if (!pThere->blBox && !pThere->blOrphan) {
            szBroken = "another program's mapping is changed";
        }
        if (!blSame && habits.blSaysChanged) {
            return tavo::kRouterOk;
        }
    } else if (mMapTable.size() >= habits.nCapacity) {
        return habits.blSaysFull ? kFull : static_cast<int>(tavo::kRouterOk);
    }
    Entry& entry = mMapTable[key] = {mapping, 0, true};
    if (habits.nLongestLease != 0 && (mapping.nLease == 0 || mapping.nLease > habits.nLongestLease)) {
        entry.mapping.nLease = habits.nLongestLease;
    }
    entry.nEnd = entry.mapping.nLease == 0 ? 0 : mNNow + entry.mapping.nLease;
    entry.mapping.szDescription = TextOf(mapping.szDescription);
    return tavo::kRouterOk;
}

int Router::Add(const tavo::RouterMapping& mapping) {
    fnBeforeAdd(mapping);
    const int nCode = Answer([&] { return DoAdd(mapping); });
    fnTell("add " + mapping.szProtocol + std::to_string(mapping.nRouterPort) + " -> " + mapping.szClient + ":" +
           std::to_string(mapping.nBoxPort) + " = " + std::to_string(nCode));
    return nCode;
}

int Router::DoRemove(const tavo::MappingKey& key) {
    const Entry* pEntry = At(key);
    if (pEntry == nullptr) {
        return tavo::kRouterNoSuchEntry;
    }
    if (habits.blSecure && pEntry->mapping.szClient != szBox) {
        return kNotAuthorized;
    }
    if (!pEntry->blBox && !pEntry->blOrphan) {
        szBroken = "somebody else's mapping is taken away";
    }
    mMapTable.erase(key);
    return tavo::kRouterOk;
}

int Router::Remove(const std::string& szProtocol, uint16_t nRouterPort) {
    const int nCode = Answer([&] { return DoRemove({szProtocol, nRouterPort}); });
    fnTell("remove " + szProtocol + std::to_string(nRouterPort) + " = " + std::to_string(nCode));
    return nCode;
}

}  // namespace model
