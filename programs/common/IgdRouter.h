// A UPnP gateway as the mapping core sees a router. Relies on the IGD client. Promises: the protocol's codes are known
// here and nowhere above; a refusal's word is its code.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "mapping/Router.h"
#include "wire/upnp/Igd.h"

namespace tavo {

// A code of the protocol, or a WireCode, as an answer.
RouterReply IgdReply(int nCode);

class IgdRouter : public Router {
public:
    // igd outlives it. szBox: the address that asks; one that the box still has beside it asks for what leads there.
    explicit IgdRouter(Igd& igd, std::string szBox = "") : mIgd(igd), mSzBox(std::move(szBox)) {}
    Abilities What() const override;
    RouterReply List(std::vector<RouterMapping>& rgMappings) override;
    RouterReply ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                          std::vector<RouterMapping>& rgMappings) override;
    RouterReply Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) override;
    RouterReply Add(RouterMapping& mapping) override;
    RouterReply Remove(const RouterMapping& mapping) override;

private:
    Igd& mIgd;
    std::string mSzBox;
};

}  // namespace tavo
