// See NatpmpRouter.h.
#include "programs/natpmpd/NatpmpRouter.h"

#include "ground/net/Neighbour.h"

namespace tavo {

namespace {

Reply KindOf(int nCode) {
    switch (nCode) {
        case kWireOk:
            return Reply::kOk;
        case kWireTimeout:
            return Reply::kTimeout;
        case kWireUnreachable:
            return Reply::kUnreachable;
        case kWireGarbage:
            return Reply::kGarbage;
        default:
            return Reply::kRefused;
    }
}

}  // namespace

RouterReply NatpmpRouter::Note(int nCode) {
    RouterReply reply{KindOf(nCode), nCode == kWireOk ? "" : NatpmpWords(nCode)};
    if (reply.IsSilence()) {
        mSilence = reply;
    }
    return reply;
}

RouterReply NatpmpRouter::AskAddress(std::string& szAddress) {
    return Note(mClient.AskAddress(szAddress));
}

RouterReply NatpmpRouter::List(std::vector<RouterMapping>& /*rgMappings*/) {
    return mSilence.value_or(RouterReply());
}

RouterReply NatpmpRouter::Get(const std::string& /*szProtocol*/, uint16_t /*nRouterPort*/, RouterMapping& /*mapping*/) {
    return {Reply::kRefused};
}

RouterReply NatpmpRouter::Add(RouterMapping& mapping) {
    if (mSilence) {
        return *mSilence;
    }
    NatpmpGrant grant;
    RouterReply reply =
        Note(mClient.Map(mapping.szProtocol, mapping.nBoxPort, mapping.nRouterPort, mapping.nLease, grant));
    if (!reply.IsOk()) {
        return reply;
    }
    mapping.nLease = grant.nLifetime;
    if (grant.nRouterPort != mapping.nRouterPort) {
        mapping.nRouterPort = grant.nRouterPort;
        return {Reply::kElsewhere, "the router offered " + std::to_string(grant.nRouterPort)};
    }
    return reply;
}

RouterReply NatpmpRouter::Remove(const RouterMapping& mapping) {
    if (mapping.szClient != mSzBox && IsOwnAddress(mapping.szClient) && !mSilence) {
        NatpmpClient other = mClient;
        other.SetSource(mapping.szClient);
        return Note(other.Unmap(mapping.szProtocol, mapping.nBoxPort));
    }
    if (mapping.szClient != mSzBox) {
        return {Reply::kRefused, "the router keeps it for this box's former address " + mapping.szClient};
    }
    return mSilence ? *mSilence : Note(mClient.Unmap(mapping.szProtocol, mapping.nBoxPort));
}

}  // namespace tavo
