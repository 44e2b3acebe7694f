// See Instance.h. Relies on flock: the lock goes with its holder, however that ends. Promises: see Instance.h.
#include "programs/common/Instance.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>

#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr int kTries = 5;  // a look at the holder locks for a moment, too
constexpr int kTryMilliseconds = 20;
constexpr size_t kPidSize = 16;

Descriptor Open(const std::string& szLockFile, int nFlags) {
    return Descriptor(open(szLockFile.c_str(), nFlags | O_CLOEXEC | O_NOFOLLOW, kPrivateMode));
}

}  // namespace

bool Instance::Take() {
    mFd = Open(mSzLockFile, O_RDWR | O_CREAT);
    for (int i = 0; i < kTries && mFd.Get() >= 0; ++i) {
        if (flock(mFd.Get(), LOCK_EX | LOCK_NB) == 0) {
            const std::string szPid = std::to_string(getpid()) + "\n";
            return ftruncate(mFd.Get(), 0) == 0 &&
                   write(mFd.Get(), szPid.data(), szPid.size()) == static_cast<ssize_t>(szPid.size());
        }
        poll(nullptr, 0, kTryMilliseconds);
    }
    mFd.Reset();
    return false;
}

pid_t Instance::Holder() const {
    const Descriptor fd = Open(mSzLockFile, O_RDONLY);
    if (fd.Get() < 0) {
        return errno == ENOENT ? 0 : -1;
    }
    if (flock(fd.Get(), LOCK_SH | LOCK_NB) == 0) {
        return 0;
    }
    std::array<char, kPidSize> rgText = {};
    const ssize_t nRead = pread(fd.Get(), rgText.data(), rgText.size(), 0);
    pid_t pid = -1;
    if (nRead > 0) {
        std::from_chars(rgText.data(), rgText.data() + nRead, pid);
    }
    return pid > 1 ? pid : -1;
}

}  // namespace tavo
