// Runs a command and reads what it prints. Relies on fork and a pipe. Promises: see Tool.h.
#include "Tool.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>

namespace tavo::lib {

namespace {

constexpr int kToolSeconds = 10;            // a tool that has not answered by then hangs
constexpr int kToolLookMilliseconds = 100;  // between two looks whether it has ended

}  // namespace

bool Tool::Start(const char* szCommand) {
    int rgFd[2];
    if (pipe2(rgFd, O_CLOEXEC) != 0) {
        return false;
    }
    mFd = rgFd[0];
    mEnd = Clock::now() + std::chrono::seconds(kToolSeconds);
    mPid = fork();
    if (mPid == 0) {
        setpgid(0, 0);
        dup2(rgFd[1], STDOUT_FILENO);
        fcntl(STDOUT_FILENO, F_SETFD, 0);  // where the pipe itself had that number
        closefrom(STDERR_FILENO + 1);
        execl("/bin/sh", "sh", "-c", szCommand, nullptr);
        _exit(127);
    }
    close(rgFd[1]);
    return mPid > 0;
}

int Tool::MillisecondsLeft() const {
    const auto nLeft = std::chrono::duration_cast<std::chrono::milliseconds>(mEnd - Clock::now()).count();
    return static_cast<int>(std::clamp<int64_t>(nLeft, 0, kToolLookMilliseconds));
}

bool Tool::HasEnded() {
    if (mPid > 0 && waitpid(mPid, nullptr, WNOHANG) != 0) {
        mPid = -1;
    }
    return mPid < 0;
}

ssize_t Tool::Read(char* szBlock, size_t nSize) {
    for (bool blLast = false;;) {
        const int nLeft = MillisecondsLeft();
        pollfd waiting = {mFd, POLLIN, 0};
        if (nLeft > 0 && poll(&waiting, 1, blLast ? 0 : nLeft) > 0) {
            return std::max<ssize_t>(read(mFd, szBlock, nSize), 0);
        }
        if (nLeft == 0 || blLast) {
            return 0;
        }
        blLast = HasEnded();  // one more look: it may have printed just before
    }
}

Tool::~Tool() {
    if (mFd >= 0) {
        close(mFd);
    }
    while (!HasEnded() && MillisecondsLeft() > 0) {
        usleep(1000);
    }
    if (mPid > 0) {
        kill(-mPid, SIGKILL);
        waitpid(mPid, nullptr, 0);
    }
}

}  // namespace tavo::lib
