// What the entry points with C types share, in whichever file they stand. Relies on the lock. Promises: a refusal is
// logged.
#pragma once

#include "Lock.h"

namespace tavo::lib {

// Whether a caller's gateway argument is an IP address; a refusal is logged.
bool IsGatewayAddress(const char* szGwRouterIP);

// The lock of an entry point that was asked to take it. False: held elsewhere, which is logged and, unless
// pErr is null, told as a conflict.
bool GetRouterLock(RouterLock& lock, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr);

// Adds a caller's rule to a rule file that is being built. False: it was refused, which is logged.
bool AddRule(RouterRuleConfWriter& rules, const __tag_TAVO_ROUTER_RULE& rule);

}  // namespace tavo::lib
