// What a save would do, port by port. Relies on the rules, and on what the router says of its table. Promises: changes
// nothing; what could not be looked at is not judged.
#pragma once

#include "Answer.h"
#include "RuleStore.h"

namespace tavo::cli {

// kRefused when a port would stay out, kTooMany when all of it would be refused.
Reply DryRunOf(const Rules& inForce, const Rules& rules);

}  // namespace tavo::cli
