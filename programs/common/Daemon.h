// What every port-mapping daemon does alike: one instance, pid file, signals, the progress marker, the
// clock of checks and renewals. Relies on signalfd and inotify; the mapping itself is a Mapper's.
// Promises: the marker goes only after the results of the newest request have been written; a stop
// takes the mappings away, within a bound; a hand-over leaves them to the next instance. In the background a
// parent starts it again after a crash, elsewhere the service manager does.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace tavo {

struct DaemonNames {
    const char* szName;      // also its section in the platform's settings
    const char* szProtocol;  // as a user reads it
    const char* szRunKey;    // it maps only while this key of /etc/tavoinfo.conf is "yes"
    const char* szPidFile;
    const char* szLockFile;
    const char* szResultFile;  // what became of the newest request
    const char* szMadeFile;    // the record of what it has made at routers
};

class Mapper {
public:
    virtual ~Mapper() = default;
    // One pass: reads the settings anew when blRequested (a start or a SIGHUP, as against the clock),
    // brings the router in line and writes the results. fnStop: whether to end early. Seconds until the
    // next pass.
    virtual int Run(bool blRequested, const std::function<bool()>& fnStop) = 0;
    // Whether the settings have this daemon map at all; if not, the marker is the other daemon's.
    virtual bool IsSwitchedOn() const = 0;
    // Takes away every mapping that we made. False: some may be left in the router.
    virtual bool Withdraw(const std::function<bool()>& fnStop) = 0;
    // The descriptors on which the router may speak of its own accord; and, when it did, whether what it said is a
    // reason for a pass now. That is only a hint: the pass asks the router itself.
    virtual std::vector<int> WakeFds() const = 0;
    virtual bool OnWake() = 0;
    // Whether what has changed of this box's network is a reason for a pass.
    virtual bool OnNetworkChange() = 0;
};

// Called in the process that does the work, once it is the one instance: again after each crash.
using MakeMapper = std::function<std::unique_ptr<Mapper>()>;

// A daemon's whole main(): arguments, the way into the background, then a mapper until SIGTERM, SIGINT or
// SIGUSR1. Exit status: 0; 1 when another instance runs, or what was asked for could not be done; 2 for a wrong
// argument; 3 when it was stopped, and the router may have kept mappings, which is no reason to start it again.
int DaemonMain(int argc, char** argv, const DaemonNames& names, const MakeMapper& fnMake);

}  // namespace tavo
