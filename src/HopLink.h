// What the relay service's entry points share with the diagnostic ones. Relies on the operation rules.
// Promises: the name here is not exported.
#pragma once

#include "merge/OperationRules.h"

namespace tavo::lib {

// Tests from outside the rules made from as many requests, and writes each verdict into its request. 0, or
// -1: the requests are as they were.
int TestRequestedRules(const RouterRules& rules, __tag_TAVO_PORTMAP_RULE* rgRequests);

}  // namespace tavo::lib
