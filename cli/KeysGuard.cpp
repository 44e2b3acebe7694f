// Notes the run keys and puts them back. Relies on runkeys.h and the router lock. Promises: see KeysGuard.h.
#include "KeysGuard.h"

#include <chrono>
#include <thread>

#include "Box.h"
#include "tavo/runkeys.h"

namespace tavo::cli {

namespace {

constexpr int kLockTries = 50;
constexpr auto kLockPause = std::chrono::milliseconds(100);

std::optional<Reply> Remember() {
    switch (TAVORunKeysRemember()) {
        case 0:
            return std::nullopt;
        case 1:
            return Busy();
        default:
            return Failure(
                "nothing was begun: what the daemons do now could not be noted in /var/lib/tavo, so that a failure "
                "could not be made good; is the disk full or read-only ('df /var/lib')?");
    }
}

}  // namespace

KeysGuard::KeysGuard(Lock enLock) : mEnLock(enLock) {
    if (enLock == Lock::kHeld) {
        mObstacle = Remember();
    } else {
        const tavo::cli::Lock lock;
        mObstacle = lock.IsHeld() ? Remember() : Busy();
    }
    mBlRestore = !mObstacle;
}

void KeysGuard::Keep() {
    if (mBlRestore) {
        TAVORunKeysForget();
        mBlRestore = false;
    }
}

// Whoever has the lock meanwhile is no reason to give up at once; what is not put back here, the next caller mends.
void KeysGuard::Restore() const {
    if (mEnLock == Lock::kHeld) {
        TAVORunKeysRestore();
        return;
    }
    for (int i = 0; i < kLockTries; ++i) {
        const tavo::cli::Lock lock;
        if (lock.IsHeld()) {
            TAVORunKeysRestore();
            return;
        }
        std::this_thread::sleep_for(kLockPause);
    }
}

KeysGuard::~KeysGuard() {
    if (mBlRestore) {
        Restore();
    }
}

}  // namespace tavo::cli
