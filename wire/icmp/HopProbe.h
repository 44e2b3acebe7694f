// Which routers lie on the way to a host. Relies on UDP probes with a growing time to live, whose ICMP
// answers the kernel hands to any user through the socket's error queue: no root is needed.
// Promises: all distances are asked at once; ends within the limit, and early once nothing more matters.
#pragma once

#include <netinet/in.h>

#include <optional>
#include <vector>

namespace tavo {

// Who answered at the distances nFirst to nLast (1 is the gateway): a router, or the host itself. Nothing
// for a distance where nobody did. A public router makes everything behind it public: what lies
// farther away is not waited for.
std::vector<std::optional<in_addr>> WalkTowards(const in_addr& host, int nFirst, int nLast, int nLimitMilliseconds);

}  // namespace tavo
