// A lock on a file (flock), which goes with the object or with its process, however that ends. Relies on flock.
// Promises: whoever takes one learns whether he has it; it is inherited by no program that is started meanwhile.
#pragma once

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>

#include <functional>
#include <string>

#include "ground/Descriptor.h"

namespace tavo {

class FileLock {
public:
    static constexpr int kMake = O_RDWR | O_CREAT;
    static constexpr int kPollMilliseconds = 20;

    FileLock() = default;
    // Opens the file, its owner's alone where kMake has it made, and takes nothing yet.
    explicit FileLock(const std::string& szPath, int nFlags = kMake)
        : mFd(open(szPath.c_str(), nFlags | O_CLOEXEC | O_NONBLOCK, S_IRUSR | S_IWUSR)) {}

    // False: somebody else has it, or there is no file to lock. nKind: LOCK_EX; LOCK_SH to look whether anybody has it,
    // so that two who look do not take each other for a holder.
    [[nodiscard]] bool Try(int nKind = LOCK_EX) const { return IsOpen() && flock(mFd.Get(), nKind | LOCK_NB) == 0; }
    // The same, for as long as fnWait answers true.
    [[nodiscard]] bool Wait(const std::function<bool()>& fnWait) const {
        while (!Try()) {
            if (!IsOpen() || !fnWait()) {
                return false;
            }
            poll(nullptr, 0, kPollMilliseconds);
        }
        return true;
    }
    void Release() { mFd.Reset(); }
    bool IsOpen() const { return mFd.Get() >= 0; }
    int Fd() const { return mFd.Get(); }

private:
    Descriptor mFd;
};

}  // namespace tavo
