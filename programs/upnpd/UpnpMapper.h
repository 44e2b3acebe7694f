// The mapping side of upnpd: the gateway's IGD kept in line with the rules.
// Relies on the IGD client and the mapping core. Promises: see RuleMapper.h.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "mapping/Carry.h"
#include "programs/common/MadeFile.h"
#include "programs/common/RuleMapper.h"
#include "wire/upnp/Events.h"
#include "wire/upnp/GatewayMemory.h"
#include "wire/upnp/Igd.h"

namespace tavo {

extern const DaemonNames kUpnpNames;

class UpnpMapper : public RuleMapper {
public:
    UpnpMapper();
    std::vector<int> WakeFds() const override;
    // The router has told that its table has changed, too.
    bool OnWake() override;

private:
    PassResult Map(const std::vector<RouterMapping>& rgWanted, bool blRequested,
                   const std::function<bool()>& fnStop) override;
    std::string ResultText(const OutcomeList& rgOutcomes) const override;
    std::string Outside(const std::function<bool()>& fnStop) override;
    void NewGateway() override;
    bool HasMade(const std::function<bool()>& fnStop) override;
    void LostRouter() override;

    bool FindRouter(const std::function<bool()>& fnStop);
    void Remember();
    RouterName Name(const std::function<bool()>& fnStop);
    void TurnTo(const RouterName& router);
    void ChooseLine(const std::function<bool()>& fnStop);
    OutcomeList ClearOtherLines(const RouterName& router, const Surroundings& around);
    void KeepEvents(const std::vector<RouterMapping>& rgWanted, const std::function<bool()>& fnStop);
    PassResult MapOnce(const std::vector<RouterMapping>& rgWanted, const std::function<bool()>& fnStop);

    IgdPlace mPlace;
    KnownRouter mKept;             // what stands in the file of this gateway
    std::string mSzKnownHardware;  // of the router whose habits are known
    std::unique_ptr<Igd> mPIgd;
    Descriptor mFdLate;  // where nothing was found, what comes later is heard
    Habits mHabit;
    bool mBlNoGet = false;  // it shows no entry by name
    MadeFile mMade;
    Events mEvents;
    BootClock::time_point mQuietUntil;  // before then, what the router tells of its table is our own doing
};

}  // namespace tavo
