// See Instance.h. Relies on FileLock: the lock goes with its holder, however that ends. Promises: see Instance.h.
#include "programs/common/Instance.h"

#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>

namespace tavo {

namespace {

constexpr int kTries = 5;  // a look at the holder locks for a moment, too
constexpr size_t kPidSize = 16;

}  // namespace

bool Instance::Take() {
    mLock = FileLock(mSzLockFile, FileLock::kMake | O_NOFOLLOW);
    if (mLock.Wait([nLeft = kTries]() mutable { return --nLeft > 0; })) {
        const std::string szPid = std::to_string(getpid()) + "\n";
        return ftruncate(mLock.Fd(), 0) == 0 &&
               write(mLock.Fd(), szPid.data(), szPid.size()) == static_cast<ssize_t>(szPid.size());
    }
    mLock.Release();
    return false;
}

pid_t Instance::Holder() const {
    const FileLock lock(mSzLockFile, O_RDONLY | O_NOFOLLOW);
    if (!lock.IsOpen()) {
        return errno == ENOENT ? 0 : -1;
    }
    if (lock.Try(LOCK_SH)) {
        return 0;
    }
    std::array<char, kPidSize> rgText = {};
    const ssize_t nRead = pread(lock.Fd(), rgText.data(), rgText.size(), 0);
    pid_t pid = -1;
    if (nRead > 0) {
        std::from_chars(rgText.data(), rgText.data() + nRead, pid);
    }
    return pid > 1 ? pid : -1;
}

}  // namespace tavo
