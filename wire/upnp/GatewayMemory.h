// What was learnt about a router, kept between runs and shared by upnpd, the client and the checks.
// Relies on a sectioned file below /var/lib/tavo. Promises: a file that is missing or damaged is
// "nothing known".
#pragma once

#include <memory>
#include <string>

#include "wire/upnp/Igd.h"

namespace tavo {

struct KnownRouter {
    IgdPlace place;               // where its service was last found
    std::string szHardware = {};  // of the router that this is true of; empty: not known
    bool blPermanentOnly = false;
    bool blNoGet = false;  // it shows no entry by name
    bool blNoRanges = false;

    bool operator==(const KnownRouter& other) const = default;
};

KnownRouter RecallRouter(const std::string& szGateway);
// Writes only what differs from what is there; a failure is logged.
void KeepRouter(const std::string& szGateway, const KnownRouter& router);

// The IGD at the default gateway: where it was the last time, else searched for; what worked is kept.
// pSzLocal (may be null) is set to the box's own address that faces the gateway. Null when there is no
// gateway, or no IGD at it. fnStop as Igd::Find has it.
std::unique_ptr<Igd> FindGatewayIgd(int nLimitMilliseconds, int nLocalPort, std::string* pSzLocal = nullptr,
                                    const std::function<bool()>& fnStop = {});

}  // namespace tavo
