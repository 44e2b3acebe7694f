// The verdicts of single ports put together into one for a user. Relies on nothing. Promises: no port's failure is
// hidden by another's success, and every port that is not open is named, as far as the text reaches.
#pragma once

#include <string>
#include <vector>

namespace tavo {

struct PortVerdict {
    int enStatus;          // TAVO_PORT_...
    std::string szReason;  // as text for a user
};

struct NamedVerdict {
    std::string szPort;  // "5001/tcp"
    PortVerdict verdict;
};

// Of two verdicts about the same rule the one that its user must know first: a failure, then a port
// without a listener, then what could not be told, then open.
bool IsWorse(int enStatus, int enThan);

// The worst status, and as reason every reason with its ports, the worst first: "5001/tcp, 5003/tcp: connection
// refused; 5002/tcp: open". nLeftOut: further ports of the rule, of which nothing is known. No ports at all:
// unknown, without a reason.
PortVerdict MergeVerdicts(std::vector<NamedVerdict> rgVerdicts, size_t nLeftOut);

}  // namespace tavo
