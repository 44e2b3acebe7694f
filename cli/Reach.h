// Whether a port can be reached from outside, in words. Relies on the statuses of the library's test and on its
// log, which names what they cannot. Promises: nothing that could not be judged is called open or closed.
#pragma once

#include <string>
#include <vector>

#include "Answer.h"

namespace tavo::cli {

// One line of the table.
struct PortVerdict {
    std::string szRule;  // id of the stored rule; empty for a request
    std::string szName;
    std::string szRouterPorts;
    std::string szBoxPorts;
    std::string szProtocol;
    int enStatus = 0;              // as the library writes it: 0 not tested, 1 disabled, 2 ok, 3 fail
    bool blNobodyListens = false;  // on this box, so that nobody outside was asked
    std::string szReason = {};     // in the tester's own words, where it has some
};

// The port checker that the settings name; empty where they name none.
std::string CheckerUrl();

// Gives each verdict its reason. szLog: what the library logged while it tested them, in this order.
void AddReasons(std::vector<PortVerdict>& rgVerdicts, const std::string& szLog);

// Adds the table and what can be done about it; kRefused when a port is closed or nobody listens there, kFailed when
// one could not be judged.
void DescribePorts(const std::vector<PortVerdict>& rgVerdicts, Reply& reply);

}  // namespace tavo::cli
