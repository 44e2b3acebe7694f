// What every port-mapping daemon does alike: one instance, pid file, signals, the progress marker, the
// clock of checks and renewals. Relies on signalfd and inotify; the mapping itself is a Mapper's.
// Promises: the marker goes only after the results of the newest request have been written; a stop
// takes the mappings away, within a bound.
#pragma once

#include <functional>
#include <string>

namespace tavo {

class Mapper {
public:
    virtual ~Mapper() = default;
    // One pass: reads the settings anew when blRequested (a start or a SIGHUP, as against the clock),
    // brings the router in line and writes the results. fnStop: whether to end early. Seconds until the
    // next pass.
    virtual int Run(bool blRequested, const std::function<bool()>& fnStop) = 0;
    // Whether the settings have this daemon map at all; if not, the marker is the other daemon's.
    virtual bool IsSwitchedOn() const = 0;
    // Takes away every mapping that we made.
    virtual void Withdraw(const std::function<bool()>& fnStop) = 0;
};

struct DaemonNames {
    const char* szName;
    const char* szPidFile;
    const char* szLockFile;
};

// Runs until SIGTERM or SIGINT. Exit status: 0, or 1 when another instance runs or nothing could be started.
int RunDaemon(const DaemonNames& names, Mapper& mapper, bool blForeground);

}  // namespace tavo
