// What the relay service's entry points share with the diagnostic ones. Relies on the merge. Promises: none of the
// names here is exported.
#pragma once

#include "libtavoportmap.h"
#include "src/merge/OperationRules.h"

namespace tavo::lib {

// The library as the merge's host: its log, and the platform's test of a port number.
const MergeHost& Host();

// Tests from outside the rules made from as many requests, and writes each verdict into its request. 0, or
// -1: the requests are as they were.
int TestRequestedRules(const RouterRules& rules, __tag_TAVO_PORTMAP_RULE* rgRequests);

}  // namespace tavo::lib
