// One instance of a program on this box, told by a lock that it holds.
// Relies on FileLock. Promises: a pid counts only while its process holds the lock, whatever file is left over.
#pragma once

#include <sys/types.h>

#include <string>

#include "ground/FileLock.h"

namespace tavo {

class Instance {
public:
    explicit Instance(std::string szLockFile) : mSzLockFile(std::move(szLockFile)) {}

    // Makes this process the one instance, until the object goes. False: another process is.
    bool Take();
    // Leaves the lock to a parent that shares it.
    void Forget() { mLock.Release(); }
    // The process that is the instance now; 0 where none is, -1 where it does not say which it is.
    pid_t Holder() const;

    const std::string& LockFile() const { return mSzLockFile; }

private:
    std::string mSzLockFile;
    FileLock mLock;
};

}  // namespace tavo
