// The daemons' run keys through an operation of the library that switches them. Relies on the seam's runkeys.h.
// Promises: an operation that came to nothing leaves the keys as they were, also when this process is killed: the
// next caller, or a daemon at its start, mends them then.
#pragma once

#include <optional>

#include "Answer.h"

namespace tavo::cli {

class KeysGuard {
public:
    enum class Lock { kHeld, kTakenByTheCall };

    // kHeld: the caller holds the router lock until the guard is gone. kTakenByTheCall: the library's call takes
    // it itself, so that the guard holds it only for its own two moments.
    explicit KeysGuard(Lock enLock = Lock::kHeld);
    ~KeysGuard();
    KeysGuard(const KeysGuard&) = delete;
    KeysGuard& operator=(const KeysGuard&) = delete;

    // Why the operation must not be begun; nothing when it may.
    const std::optional<Reply>& Obstacle() const { return mObstacle; }
    // The operation did what it should: the keys stay as it has set them.
    void Keep();

private:
    void Restore() const;

    Lock mEnLock;
    bool mBlRestore = false;
    std::optional<Reply> mObstacle;
};

}  // namespace tavo::cli
