// A UPnP gateway as the mapping core sees a router. Relies on the IGD client. Promises: the protocol's codes are known
// here and nowhere above; a refusal's word is its code.
#pragma once

#include <map>
#include <set>
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
    // blNoGet: it is known to show no entry by name.
    explicit IgdRouter(Igd& igd, std::string szBox = "", bool blNoGet = false)
        : mIgd(igd), mSzBox(std::move(szBox)), mBlNoGet(blNoGet) {}
    Abilities What() const override;
    RouterReply List(std::vector<RouterMapping>& rgMappings) override;
    RouterReply ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                          std::vector<RouterMapping>& rgMappings) override;
    // By its list, where the router knows no such question, or denies what it has said yes to.
    RouterReply Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) override;
    RouterReply Add(RouterMapping& mapping) override;
    RouterReply Remove(const RouterMapping& mapping) override;
    bool HasNoGet() const { return mBlNoGet; }

private:
    using Place = std::pair<std::string, uint16_t>;

    RouterReply ReadTable(std::vector<RouterMapping>& rgTable);
    void Keep(const std::vector<RouterMapping>& rgTable, const RouterReply& reply);
    RouterReply GetByName(const Place& place, RouterMapping& mapping);
    RouterReply GetByList(const Place& place, RouterMapping& mapping);

    Igd& mIgd;
    std::string mSzBox;
    bool mBlNoGet;
    std::set<Place> mSetGranted;               // what it said yes to
    std::map<Place, RouterMapping> mMapTable;  // as it was listed, where that has to do
    RouterReply mListed = {Reply::kTimeout};   // what the listing ended with
    bool mBlChanged = true;                    // something was asked for since
};

}  // namespace tavo
