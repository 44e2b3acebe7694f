// The mapping side of natpmpd: the gateway's NAT-PMP mappings kept in line with the rules.
// Relies on the mapping core and on the gateway's announcements. Promises: see RuleMapper.h; a gateway that
// restarts gets every mapping again, at once when it announces its return.
#pragma once

#include <map>
#include <string>

#include "mapping/Carry.h"
#include "programs/common/MadeFile.h"
#include "programs/common/RuleMapper.h"
#include "programs/natpmpd/EpochWatch.h"
#include "wire/pcp/Announcements.h"

namespace tavo {

extern const DaemonNames kNatpmpNames;

class NatpmpMapper : public RuleMapper {
public:
    NatpmpMapper();
    std::vector<int> WakeFds() const override {
        std::vector<int> rgFds = RuleMapper::WakeFds();
        rgFds.push_back(mAnnounced.Fd());
        return rgFds;
    }
    bool OnWake() override;

private:
    PassResult Map(const std::vector<RouterMapping>& rgWanted, bool blRequested,
                   const std::function<bool()>& fnStop) override;
    std::string ResultText(const OutcomeList& rgOutcomes) const override;
    std::string Outside(const std::function<bool()>& fnStop) override;
    void NewGateway() override;
    bool HasMade(const std::function<bool()>& fnStop) override;

    GatewayAnnouncements mAnnounced;
    MadeFile mMade;
    Habits mHabit;
    std::map<std::string, EpochWatch> mMapEpochs;  // by what names a router
    EpochWatch* mPEpoch = nullptr;                 // of the one in front; null before the first pass there
    bool mBlDoubtful = false;  // the gateway did not answer the last time, or had just started: it may have begun anew
    BootClock::time_point mNextDoubt;  // when a word of the router's may make it so again
    std::string mSzOutside;            // its address on its other side, as it said the last time
};

}  // namespace tavo
