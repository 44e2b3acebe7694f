// What came of a question to a router. Relies on nothing.
#pragma once

namespace tavo {

// 0, the protocol's own code above 0, or why there was no answer below 0.
enum WireCode : int {
    kWireOk = 0,
    kWireTimeout = -1,
    kWireUnreachable = -2,
    kWireGarbage = -3,
    kWireTooLong = -4  // a table that could not be read to its end in time
};

}  // namespace tavo
