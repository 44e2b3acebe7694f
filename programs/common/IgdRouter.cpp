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

RouterReply IgdRouter::List(std::vector<RouterMapping>& rgMappings) {
    std::vector<IgdEntry> rgEntries;
    const int nCode = mIgd.List(rgEntries);
    return Take(nCode, std::move(rgEntries), rgMappings);
}

RouterReply IgdRouter::ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                                 std::vector<RouterMapping>& rgMappings) {
    std::vector<IgdEntry> rgEntries;
    const int nCode = mIgd.ListRange(szProtocol, nFirst, nLast, rgEntries);
    return Take(nCode, std::move(rgEntries), rgMappings);
}

RouterReply IgdRouter::Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) {
    IgdEntry entry;
    const int nCode = mIgd.Get(szProtocol, nRouterPort, entry);
    if (nCode == kWireOk) {
        mapping = MappingOf(std::move(entry));
    }
    return IgdReply(nCode);
}

RouterReply IgdRouter::Add(RouterMapping& mapping) {
    return IgdReply(mIgd.Add({mapping.szProtocol, mapping.nRouterPort, mapping.nBoxPort, mapping.szClient,
                              mapping.szDescription, mapping.nLease, mapping.blEnabled}));
}

RouterReply IgdRouter::Remove(const RouterMapping& mapping) {
    const bool blOwn = mapping.szClient != mSzBox && IsOwnAddress(mapping.szClient);
    return IgdReply(mIgd.Remove(mapping.szProtocol, mapping.nRouterPort, blOwn ? mapping.szClient : ""));
}

}  // namespace tavo
