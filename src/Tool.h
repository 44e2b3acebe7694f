// A command of the box whose output is read. Relies on /bin/sh. Promises: nothing beyond this library; it
// shares no descriptor but its output with us, and it never holds the caller for longer than its time.
#pragma once

#include <sys/types.h>

#include <chrono>

namespace tavo::lib {

// A shell command whose output is read through a pipe. It shares no other descriptor with us, so that one
// that stays alive holds no lock of ours; one that has not ended within kToolSeconds is killed.
class Tool {
public:
    ~Tool();
    bool Start(const char* szCommand);
    // What it printed next; 0: it has ended, or its time has.
    ssize_t Read(char* szBlock, size_t nSize);

private:
    using Clock = std::chrono::steady_clock;

    int MillisecondsLeft() const;
    // Whether the command itself is over; what it left behind may still hold the pipe.
    bool HasEnded();

    int mFd = -1;
    pid_t mPid = -1;
    Clock::time_point mEnd;
};

}  // namespace tavo::lib
