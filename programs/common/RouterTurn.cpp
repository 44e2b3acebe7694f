// Takes turns at the router by a lock on one file. Relies on flock. Promises: see RouterTurn.h.
#include "programs/common/RouterTurn.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>

#include <utility>

#include "ground/SysLog.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr char kTurnFile[] = "/var/run/tavo_router.lock";
constexpr int kPollMilliseconds = 20;

}  // namespace

bool RouterTurn::Take(const std::function<bool()>& fnWait) {
    if (mFd.Get() >= 0) {
        return true;
    }
    Descriptor fd(open(kTurnFile, O_RDWR | O_CREAT | O_CLOEXEC, kPrivateMode));
    if (fd.Get() < 0) {
        SysLog(LOG_ERR, "cannot open %s", kTurnFile);
        return false;
    }
    while (flock(fd.Get(), LOCK_EX | LOCK_NB) != 0) {
        if (!fnWait()) {
            return false;
        }
        poll(nullptr, 0, kPollMilliseconds);
    }
    mFd = std::move(fd);
    return true;
}

}  // namespace tavo
