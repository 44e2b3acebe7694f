// The mapping side of upnpd: the gateway's IGD kept in line with the rules.
// Relies on the IGD client and the mapping core. Promises: see RuleMapper.h.
#pragma once

#include <memory>
#include <string>

#include "mapping/Carry.h"
#include "programs/common/MadeFile.h"
#include "programs/common/RuleMapper.h"
#include "wire/upnp/Igd.h"

namespace tavo {

class UpnpMapper : public RuleMapper {
public:
    UpnpMapper();

private:
    PassResult Map(const std::vector<RouterMapping>& rgWanted, bool blRequested,
                   const std::function<bool()>& fnStop) override;
    std::string ResultText(const OutcomeList& rgOutcomes) const override;
    std::string Outside(const std::function<bool()>& fnStop) override;
    void NewGateway() override;
    void LostRouter() override;

    bool FindRouter(const std::function<bool()>& fnStop);
    void Remember() const;
    void NameLeftOver(const std::vector<RouterMapping>& rgWanted, PassResult& result);
    PassResult MapOnce(const std::vector<RouterMapping>& rgWanted, const std::function<bool()>& fnStop);

    std::string mSzLocation;
    std::unique_ptr<Igd> mPIgd;
    Habits mHabit;
    MadeFile mMade;
};

}  // namespace tavo
