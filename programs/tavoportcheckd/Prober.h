// Connects back to the ports of one host, all at once. Relies on non-blocking sockets.
// Promises: ends within its limit; sends nothing but requests for connections and the challenges asked for.
#pragma once

#include <string>
#include <vector>

#include "ground/Descriptor.h"
#include "programs/tavoportcheckd/Address.h"
#include "wire/portcheck/Protocol.h"

namespace tavo {

struct ProbeResult {
    std::vector<PortFinding> rgFindings;  // one for each port, in order
    std::vector<Descriptor> rgHeld;       // the connections that were made, still open
};

// fdStop: readable when there is no time for the rest.
ProbeResult ProbePorts(const Address& host, const std::vector<CheckedPort>& rgPorts, const std::string& szProbe,
                       const std::string& szAnswer, int fdStop);

}  // namespace tavo
