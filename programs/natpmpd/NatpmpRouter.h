// A NAT-PMP gateway as the mapping core sees a router: it shows nothing, and every mapping has a lease. Relies on
// NatpmpClient. Promises: the protocol's codes are known here and nowhere above; a gateway that fell silent is not
// asked again.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "mapping/Router.h"
#include "programs/natpmpd/EpochWatch.h"
#include "wire/pcp/Client.h"

namespace tavo {

class NatpmpRouter : public Router {
public:
    // szBox: who asks; the gateway knows a client by its address, and lets nobody else take its mappings away.
    NatpmpRouter(const std::string& szGateway, std::string szBox, EpochWatch& epoch, std::function<bool()> fnStop)
        : mSzBox(std::move(szBox)),
          mClient(szGateway, std::move(fnStop), [&epoch](uint32_t nEpoch) { epoch.Note(nEpoch, BootClock::now()); }) {}

    // One question that changes nothing tells whether the gateway answers, and whether it has restarted.
    RouterReply AskAddress(std::string& szAddress);

    Abilities What() const override { return {false, true, true}; }
    RouterReply List(std::vector<RouterMapping>& rgMappings) override;
    RouterReply Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) override;
    RouterReply Add(RouterMapping& mapping) override;
    RouterReply Remove(const RouterMapping& mapping) override;

private:
    RouterReply Note(int nCode);

    std::string mSzBox;
    NatpmpClient mClient;
    std::optional<RouterReply> mSilence;
};

}  // namespace tavo
