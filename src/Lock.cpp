// The two lock primitives, and what a forked child does with a lock. Relies on flock. Promises: see the headers.
#include "Lock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

namespace {

constexpr int kLockFileMode = 0600;

}  // namespace

void tavo::lib::FileLock::LeaveToParent() {
    if (mFd >= 0) {
        close(mFd);
    }
    mFd = -1;
}

int lock_file(const char* szPath, int& fd) {
    fd = open(szPath, O_RDWR | O_CREAT | O_NONBLOCK, kLockFileMode);
    if (fd < 0) {
        return 0;
    }
    // A program that the caller starts with it open would hold the lock for as long as it lives.
    fcntl(fd, F_SETFD, FD_CLOEXEC);
    return flock(fd, LOCK_EX | LOCK_NB) == 0 ? 1 : 0;
}

void unlock_file(int fd) {
    if (fd < 0) {
        return;
    }
    flock(fd, LOCK_UN);
    close(fd);
}
