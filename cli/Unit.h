// A daemon of this box as the system looks after it. Relies on systemctl where systemd runs, else on the processes.
// Promises: changes nothing, needs no root, ends within seconds.
#pragma once

#include <optional>
#include <string>

namespace tavo::cli {

// What systemd says of the daemon's unit, in its own words.
struct UnitState {
    std::string szActive;   // "active", "inactive", "failed", "activating" ...
    std::string szEnabled;  // "enabled", "disabled", "masked" ...; empty where it has none
    std::string szResult;   // why it ended: "exit-code", "start-limit-hit" ...; "success" when all is well

    bool IsActive() const { return szActive == "active" || szActive == "reloading"; }
    bool StartsAtBoot() const { return szEnabled == "enabled" || szEnabled == "enabled-runtime"; }
};

// Nothing where systemd does not run, does not answer, or has no such unit.
std::optional<UnitState> ReadUnit(const std::string& szDaemon);

// The other thing that is at work on this box's ports now.
struct Running {
    std::string szWord = "idle";  // "idle", "saving", "testing", "detecting", "busy"
    std::string szProgram = {};   // who holds the router lock, as far as that may be seen
    std::string ToText() const;
};
Running WhatRuns();

}  // namespace tavo::cli
