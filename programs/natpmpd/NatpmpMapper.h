// The mapping side of natpmpd: the gateway's NAT-PMP mappings kept in line with the rules.
// Relies on NatpmpPass and on the gateway's announcements. Promises: see RuleMapper.h; a gateway that
// restarts gets every mapping again, at once when it announces its return.
#pragma once

#include <string>

#include "ground/Descriptor.h"
#include "programs/common/RuleMapper.h"
#include "programs/natpmpd/NatpmpPass.h"

namespace tavo {

class NatpmpMapper : public RuleMapper {
public:
    NatpmpMapper();
    std::vector<int> WakeFds() const override {
        std::vector<int> rgFds = RuleMapper::WakeFds();
        rgFds.push_back(mFdAnnouncements.Get());
        return rgFds;
    }
    bool OnWake() override;

private:
    PassResult Map(const std::vector<RouterMapping>& rgWanted, bool blRenew,
                   const std::function<bool()>& fnStop) override;
    std::string ResultText(const OutcomeList& rgOutcomes) const override;
    std::string Outside(const std::function<bool()>& fnStop) override;
    void NewGateway() override;

    Descriptor mFdAnnouncements;
    NatpmpState mState;
};

}  // namespace tavo
