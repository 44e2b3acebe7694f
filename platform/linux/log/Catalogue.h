// The messages of the event log. Relies on nothing. Promises: one for every number; see tavo/log.h.
#pragma once

#include "core/Export.h"

namespace tavo {

// What stands before the first text of an event; it ends in ": ".
TAVO_PLATFORM_API const char* EventMessage(unsigned nEvent);

}  // namespace tavo
