// Lock files: the router's, and those of the detectors. Relies on the two lock primitives of the public header.
#pragma once

#include "Paths.h"
#include "libtavoportmap.h"

namespace tavo::lib {

// A lock file for one call. Get() tries it without waiting; it is released with the object, also when it
// was held elsewhere and only a descriptor was opened.
class FileLock {
public:
    explicit FileLock(const char* szPath) : mSzPath(szPath) {}
    ~FileLock() { Release(); }
    FileLock(const FileLock&) = delete;
    FileLock& operator=(const FileLock&) = delete;

    bool Get() { return lock_file(mSzPath, mFd) != 0; }
    void Release() {
        unlock_file(mFd);
        mFd = -1;
    }
    // In a forked child: gives up this process's descriptor, and leaves the lock to the parent.
    void LeaveToParent();

private:
    const char* mSzPath;
    int mFd = -1;
};

class RouterLock : public FileLock {
public:
    RouterLock() : FileLock(kRouterLock) {}
};

}  // namespace tavo::lib
