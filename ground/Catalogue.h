// The messages of the event log. Relies on nothing. Promises: one for every number; see tavo/log.h.
#pragma once

namespace tavo {

// What stands before the first text of an event; it ends in ": ".
const char* EventMessage(unsigned nEvent);

}  // namespace tavo
