// Catches output and log lines. Relies on memfd_create and on syslog's copy to standard error. Promises: see
// Capture.h.
#include "Capture.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>

namespace tavo::cli {

Capture::Capture(int fd)
    : mFd(fd), mOldFd(fcntl(fd, F_DUPFD_CLOEXEC, STDERR_FILENO + 1)), mMemoryFd(memfd_create("output", MFD_CLOEXEC)) {
    std::fflush(nullptr);
    if (mOldFd < 0 || mMemoryFd < 0 || dup2(mMemoryFd, mFd) < 0) {
        Restore();
    }
}

Capture::~Capture() {
    Restore();
}

void Capture::Restore() {
    std::fflush(nullptr);
    if (mOldFd >= 0) {
        dup2(mOldFd, mFd);
        close(mOldFd);
    }
    if (mMemoryFd >= 0) {
        close(mMemoryFd);
    }
    mOldFd = mMemoryFd = -1;
}

std::string Capture::Take() {
    std::fflush(nullptr);
    std::string szText;
    char rgChunk[4096];
    ssize_t nRead = 0;
    while (mMemoryFd >= 0 &&
           (nRead = pread(mMemoryFd, rgChunk, sizeof(rgChunk), static_cast<off_t>(szText.size()))) > 0) {
        szText.append(rgChunk, static_cast<size_t>(nRead));
    }
    Restore();
    return szText;
}

LogCapture::LogCapture() : mStandardError(STDERR_FILENO) {
    openlog(nullptr, LOG_PERROR, LOG_USER);
}

LogCapture::~LogCapture() {
    openlog(nullptr, 0, LOG_USER);
}

}  // namespace tavo::cli
