// See IgdRouter.h.
#include "programs/common/IgdRouter.h"

#include <utility>

#include "ground/net/Neighbour.h"

namespace tavo {

namespace {

RouterMapping MappingOf(IgdEntry entry) {
    return {std::move(entry.szProtocol),    entry.nRouterPort, entry.nBoxPort, std::move(entry.szClient),
            std::move(entry.szDescription), entry.nLease,      entry.blEnabled};
}

RouterReply Take(int nCode, std::vector<IgdEntry> rgEntries, std::vector<RouterMapping>& rgMappings) {
    for (IgdEntry& entry : rgEntries) {
        rgMappings.push_back(MappingOf(std::move(entry)));
    }
    return IgdReply(nCode);
}

}  // namespace

RouterReply IgdReply(int nCode) {
    switch (nCode) {
        case kWireOk:
            return {};
        case kWireTimeout:
            return {Reply::kTimeout, "timeout"};
        case kWireTooLong:
            return {Reply::kTooLong, "timeout"};
        case kWireUnreachable:
            return {Reply::kUnreachable, "unreachable"};
        case kWireGarbage:
            return {Reply::kGarbage, "garbage"};
        case kIgdNoSuchEntry:
            return {Reply::kNoSuchEntry, std::to_string(nCode)};
        case kIgdConflict:
            return {Reply::kConflict, std::to_string(nCode)};
        case kIgdOnlyPermanentLeases:
            return {Reply::kOnlyPermanent, std::to_string(nCode)};
        case kIgdInvalidArgs:
            return {Reply::kBadArguments, std::to_string(nCode)};
        default:
            return {Reply::kRefused, std::to_string(nCode)};
    }
}

Abilities IgdRouter::What() const {
    return {true, false, false, std::to_string(kIgdConflict)};
}

RouterReply IgdRouter::ReadTable(std::vector<RouterMapping>& rgTable) {
    std::vector<IgdEntry> rgEntries;
    const int nCode = mIgd.List(rgEntries);
    return Take(nCode, std::move(rgEntries), rgTable);
}

RouterReply IgdRouter::List(std::vector<RouterMapping>& rgMappings) {
    RouterReply reply = ReadTable(rgMappings);
    if (mBlNoGet) {
        Keep(rgMappings, reply);
    }
    return reply;
}

void IgdRouter::Keep(const std::vector<RouterMapping>& rgTable, const RouterReply& reply) {
    mListed = reply;
    mBlChanged = false;
    mMapTable.clear();
    for (const RouterMapping& mapping : rgTable) {
        mMapTable.emplace(Place(mapping.szProtocol, mapping.nRouterPort), mapping);
    }
}

RouterReply IgdRouter::ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                                 std::vector<RouterMapping>& rgMappings) {
    std::vector<IgdEntry> rgEntries;
    const int nCode = mIgd.ListRange(szProtocol, nFirst, nLast, rgEntries);
    return Take(nCode, std::move(rgEntries), rgMappings);
}

RouterReply IgdRouter::GetByName(const Place& place, RouterMapping& mapping) {
    IgdEntry entry;
    const int nCode = mIgd.Get(place.first, place.second, entry);
    if (nCode == kWireOk) {
        mapping = MappingOf(std::move(entry));
    }
    return IgdReply(nCode);
}

// A list without an end is not asked for again; one that was refused may only have been empty.
RouterReply IgdRouter::GetByList(const Place& place, RouterMapping& mapping) {
    if (mListed.enReply != Reply::kTooLong && (mBlChanged || mListed.IsSilence())) {
        std::vector<RouterMapping> rgTable;
        const RouterReply reply = ReadTable(rgTable);
        Keep(rgTable, reply);
    }
    if (const auto it = mMapTable.find(place); mListed.IsOk() && it != mMapTable.end()) {
        mapping = it->second;
        return {};
    }
    if (mListed.IsOk()) {
        return {Reply::kNoSuchEntry, std::to_string(kIgdNoSuchEntry)};
    }
    return mListed.enReply == Reply::kTooLong ? RouterReply{Reply::kRefused, mListed.szWord} : mListed;
}

RouterReply IgdRouter::Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) {
    const Place place(szProtocol, nRouterPort);
    if (mBlNoGet) {
        return GetByList(place, mapping);
    }
    RouterReply reply = GetByName(place, mapping);
    const bool blDenied = reply.enReply == Reply::kNoSuchEntry;
    if (!reply.IsRefusal() || (blDenied && !mSetGranted.contains(place))) {
        return reply;
    }
    RouterReply listed = GetByList(place, mapping);
    RouterMapping again;  // one that was only slow to show it shows it by name by now
    mBlNoGet = !blDenied || (listed.IsOk() && GetByName(place, again).enReply == Reply::kNoSuchEntry);
    return blDenied && listed.IsRefusal() ? reply : listed;
}

RouterReply IgdRouter::Add(RouterMapping& mapping) {
    mBlChanged = true;
    RouterReply reply = IgdReply(mIgd.Add({mapping.szProtocol, mapping.nRouterPort, mapping.nBoxPort, mapping.szClient,
                                           mapping.szDescription, mapping.nLease, mapping.blEnabled}));
    if (reply.IsOk()) {
        mSetGranted.emplace(mapping.szProtocol, mapping.nRouterPort);
    }
    return reply;
}

RouterReply IgdRouter::Remove(const RouterMapping& mapping) {
    mBlChanged = true;
    const bool blOwn = mapping.szClient != mSzBox && IsOwnAddress(mapping.szClient);
    RouterReply reply = IgdReply(mIgd.Remove(mapping.szProtocol, mapping.nRouterPort, blOwn ? mapping.szClient : ""));
    if (reply.IsOk()) {
        mSetGranted.erase({mapping.szProtocol, mapping.nRouterPort});
    }
    return reply;
}

}  // namespace tavo
