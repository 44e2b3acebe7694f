// How the library starts the two port-mapping daemons, and lets them run. Relies on their names, pid files and signals,
// and on the run keys of the system settings.
#pragma once

#include "Paths.h"

namespace tavo::lib {

inline constexpr char kUpnpRunKey[] = "runupnpportmapping";
inline constexpr char kNatpmpRunKey[] = "runnatpmpportmapping";

// Sets one of the two run keys of the system settings. False: it could not be written.
bool SetRunKey(const char* szKey, const char* szValue);

// What distinguishes one port-mapping daemon from the other.
struct DaemonControl {
    const char* szFile;   // source path of the lines logged
    const char* szName;   // process and program name
    const char* szOther;  // the daemon that must stop mapping
    const char* szPidFile;
};

// Starts the daemon, or has a running one read its settings again; afterwards the progress marker
// stands until the daemon has finished. False, with the marker gone, when neither was possible.
bool StartDaemonOf(const DaemonControl& control);

}  // namespace tavo::lib
