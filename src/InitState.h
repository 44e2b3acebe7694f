// Whether the gateway is known and how it takes rules. Relies on the router's settings, the detection
// cache and the compatibility database. Promises: only reads.
#pragma once

#include "libtavoportmap.h"

namespace tavo::lib {

// 0, or -1: no gateway, or something stored that cannot be read.
int GetInitState(__TAG_TAVO_ROUTER_INIT_STATE* pState);

}  // namespace tavo::lib
