// Starting a daemon. Relies on the platform's processes. Promises: the progress marker stands only behind a daemon that
// was told to work.
#include "DaemonStart.h"

#include <signal.h>
#include <unistd.h>

#include <cstdio>

#include "Log.h"
#include "tavo/core.h"

namespace tavo::lib {

namespace {

constexpr char kKeyLineFormat[] = "%s=\"%s\"\n";
constexpr char kSbinDir[] = "/usr/tavo/sbin/";

// Runs the daemon's program; it writes its own pid file.
bool ExecDaemon(const DaemonControl& control) {
    unlink(control.szPidFile);
    char szCommand[kCommandSize] = {};
    const int nLength = std::snprintf(szCommand, sizeof(szCommand), "%s%s", kSbinDir, control.szName);
    if (nLength < 0 || TLIBCExec(szCommand, nullptr, nullptr, nullptr, nullptr) == -1) {
        return Refuse("%s:%d exec %s daemon failed", control.szFile, __LINE__, control.szName);
    }
    return true;
}

bool HupDaemon(const DaemonControl& control, pid_t pid) {
    if (kill(pid, SIGHUP) != -1) {
        return true;
    }
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat"  // "%m" is the C library's own
    LogError("%s:%d send SIGHUP to %s failed errno=%m", control.szFile, __LINE__, control.szName);
#pragma GCC diagnostic pop
    return Refuse("%s:%d HupDaemon() %s failed", control.szFile, __LINE__, control.szName);
}

// A daemon whose pid is not known: signalled by name, and started anew.
bool RestartDaemon(const DaemonControl& control) {
    TLIBCKill(control.szName, SIGHUP);
    if (ExecDaemon(control)) {
        return true;
    }
    LogError("%s:%d StartDaemon() failed", control.szFile, __LINE__);
    return Refuse("%s:%d RestartDaemon() %s failed", control.szFile, __LINE__, control.szName);
}

bool StartFresh(const DaemonControl& control) {
    if (ExecDaemon(control)) {
        return true;
    }
    return Refuse("%s:%d StartDaemon() %s failed", control.szFile, __LINE__, control.szName);
}

}  // namespace

bool SetRunKey(const char* szKey, const char* szValue) {
    return TLIBCFileSetKeyValue(kSystemConf, szKey, szValue, kKeyLineFormat) >= 0;
}

bool StartDaemonOf(const DaemonControl& control) {
    const bool blAlive = TLIBCIsProcAlive(control.szName) == 1;
    unlink(kProgressMarker);
    if (TLIBCIsProcAlive(control.szOther) > 0) {
        TLIBCKill(control.szOther, SIGHUP);
    }
    bool blStarted = false;
    if (!blAlive) {
        blStarted = StartFresh(control);
    } else if (const pid_t pid = TLIBCReadPidFile(control.szPidFile); pid >= 1) {
        blStarted = HupDaemon(control, pid);
    } else {
        blStarted = RestartDaemon(control);
    }
    if (blStarted) {
        TLIBCFileTouch(kProgressMarker);
    }
    return blStarted;
}

}  // namespace tavo::lib
