// What this process itself writes to a descriptor, caught. Relies on a file in memory. Promises: the
// descriptor is as it was afterwards, and nothing that was written before or after is caught.
#pragma once

#include <string>

namespace tavo::cli {

class Capture {
public:
    // fd: standard output or standard error.
    explicit Capture(int fd);
    ~Capture();
    Capture(const Capture&) = delete;
    Capture& operator=(const Capture&) = delete;

    // What was written until now; the descriptor is its old self from here on.
    std::string Take();

private:
    void Restore();

    int mFd;
    int mOldFd;
    int mMemoryFd;
};

// The library's own log lines, which go to the system log all the same. They name what its answers cannot.
class LogCapture {
public:
    LogCapture();
    ~LogCapture();
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    std::string Take() { return mStandardError.Take(); }

private:
    Capture mStandardError;
};

}  // namespace tavo::cli
