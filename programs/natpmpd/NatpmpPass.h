// One pass over the NAT-PMP mappings of one gateway. Relies on NatpmpClient and on what is held.
// Promises: what the rules do not ask for is taken away, what they ask for is there or reported; every
// mapping is on disk as possibly there before the gateway is asked for it.
#pragma once

#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "mapping/Pass.h"
#include "programs/natpmpd/EpochWatch.h"
#include "programs/natpmpd/HeldMappings.h"
#include "wire/pcp/Client.h"

namespace tavo {

// What is known of the gateway, kept between passes.
struct NatpmpState {
    HeldMappings held;
    EpochWatch epoch;
    bool blDoubtful = false;  // it did not answer the last time, or had just started: it may have begun anew since
    // Mapping names, each with what the gateway offered instead. They are asked for again when leases are
    // renewed and not at each check, because each asking opens a wrong port for a moment.
    std::map<std::string, std::string> mapRemapped;
    std::string szOutside;  // the gateway's address on its other side, as it said the last time
};

class NatpmpPass {
public:
    NatpmpPass(NatpmpState& state, const std::string& szGateway, const std::string& szBox, uint32_t nWishedLease,
               const std::function<bool()>& fnStop);
    PassResult Run(const std::vector<RouterMapping>& rgWanted, bool blRenew);

private:
    HeldKey KeyOf(const RouterMapping& mapping) const {
        return {mSzGateway, mSzBox, mapping.szProtocol, mapping.nBoxPort};
    }
    std::vector<HeldKey> HeldHere() const;
    std::optional<HeldKey> FormerOf(const RouterMapping& wanted) const;
    Verdict HeldFor(const HeldKey& former);
    void ReportFormer();
    bool IsWanted(const HeldKey& key) const;
    void Doubt();
    void RemoveUnwanted();
    void NoteIntents();
    void PlaceAll(const std::vector<RouterMapping>& rgWanted);
    Verdict Place(const RouterMapping& wanted);
    Verdict Ask(const RouterMapping& wanted, Held& held);
    Verdict HandBack(const RouterMapping& wanted);
    void ReportOpen(const HeldKey& key, int nCode);
    void NoteLease();

    NatpmpState& mState;
    const std::string& mSzGateway;
    const std::string& mSzBox;
    uint32_t mNWishedLease;
    NatpmpClient mClient;
    std::map<HeldKey, const RouterMapping*> mMapWanted;
    bool mBlLost = false;       // the gateway has restarted since it was last spoken to
    std::set<HeldKey> mSetNew;  // not held when the pass began
    PassResult mResult;
    OutcomeList mRgOpen;  // what could not be taken away
    PassGuard mGuard;
};

}  // namespace tavo
