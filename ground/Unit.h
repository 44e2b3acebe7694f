// The daemons of this box as units of systemd. Relies on systemctl. Promises: ends within half a minute.
#pragma once

#include <optional>
#include <string_view>

namespace tavo {

// Starts the unit of one of our programs, and waits until it works; systemd keeps it running from then on.
// Nothing when systemd does not run, the program is none of ours or has no unit: start the program itself.
std::optional<bool> StartUnitOf(std::string_view szProgram);

}  // namespace tavo
