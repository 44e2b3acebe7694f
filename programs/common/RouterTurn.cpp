// Takes turns at the router by a lock on one file. Relies on FileLock. Promises: see RouterTurn.h.
#include "programs/common/RouterTurn.h"

#include <utility>

#include "ground/SysLog.h"

namespace tavo {

namespace {

constexpr char kTurnFile[] = "/var/run/tavo_router.lock";

}  // namespace

bool RouterTurn::Take(const std::function<bool()>& fnWait) {
    if (mLock.IsOpen()) {
        return true;
    }
    FileLock lock(kTurnFile);
    if (!lock.IsOpen()) {
        SysLog(LOG_ERR, "cannot open %s", kTurnFile);
        return false;
    }
    if (!lock.Wait(fnWait)) {
        return false;
    }
    mLock = std::move(lock);
    return true;
}

}  // namespace tavo
