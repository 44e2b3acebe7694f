// The test of ports from outside. Relies on TLibTestRules. Promises: see Test.cpp.
#pragma once

#include "Answer.h"
#include "RuleStore.h"

namespace tavo::cli {

// A row and, as JSON, an entry of "ports" for each port; kRefused when one is closed or nobody listens there,
// kFailed when one could not be judged. Takes the router lock itself.
Reply TestRules(const Rules& rules, bool blJson);

}  // namespace tavo::cli
