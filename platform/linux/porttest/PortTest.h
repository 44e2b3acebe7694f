// Tests single ports of the router from outside, and says of each what is certain. Relies on the port checker
// of the settings. Promises: every port gets one verdict with its reason as text for a user; "refused" and
// "timeout" only for what a working checker saw; half a minute at most, however many ports; nothing
// stays behind.
#pragma once

#include <vector>

#include "ground/PortText.h"
#include "porttest/RuleVerdict.h"

namespace tavo {

struct PortQuestion {
    SingleMapping mapping;
    // TCP: listen on the box's port ourselves for the time of the test, so that the answer proves that it came
    // from this box. (A port that a program has is tested as that program's.) UDP: always.
    bool blOwnListener = false;
};

// One verdict for each question, in order. Questions beyond the number that the settings allow are unknown.
//
// TCP: nobody on the box's port: NOLISTEN. OPEN only when the connection came to this box; one that did not
// is REFUSED, as another host's. Where that cannot be told, UNKNOWN.
// UDP: OPEN when the probe arrived. A port that a program has is UNKNOWN, as nobody knows its protocol. No
// arrival is TIMEOUT only when another probe arrived in the same test, so that UDP from the checker is known to
// get through; else UNKNOWN.
std::vector<PortVerdict> TestPorts(const std::vector<PortQuestion>& rgQuestions);

}  // namespace tavo
