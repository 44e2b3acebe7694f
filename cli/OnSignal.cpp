// Ends the program in good order. Relies on a pipe from the handler to a thread. Promises: see OnSignal.h.
#include "OnSignal.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <utility>

namespace tavo::cli {

namespace {

constexpr int kSignals[] = {SIGINT, SIGTERM, SIGHUP};
constexpr char kLeave = 'l';
constexpr char kDone = 'd';

// The one end that the handler may write to.
int gFdNote = -1;

void NoteSignal(int /*nSignal*/) {
    const ssize_t nWritten = write(gFdNote, &kLeave, 1);
    static_cast<void>(nWritten);  // a full pipe holds the same note
}

void Handle(void (*pfnHandler)(int)) {
    struct sigaction action = {};
    action.sa_handler = pfnHandler;
    action.sa_flags = static_cast<int>(SA_RESETHAND);
    for (const int nSignal : kSignals) {
        sigaction(nSignal, &action, nullptr);
    }
}

}  // namespace

OnSignal::OnSignal(std::function<int()> fnEnd) : mFnEnd(std::move(fnEnd)) {
    int rgFds[2] = {-1, -1};
    if (pipe2(rgFds, O_CLOEXEC) != 0) {
        return;  // without it a signal ends the program as it ends any other
    }
    gFdNote = rgFds[1];
    mThread = std::thread([this, fd = rgFds[0]] { Watch(fd); });
    Handle(&NoteSignal);
}

OnSignal::~OnSignal() {
    Handle(SIG_DFL);
    if (mThread.joinable()) {
        const ssize_t nWritten = write(gFdNote, &kDone, 1);
        static_cast<void>(nWritten);
        mThread.join();
        close(gFdNote);
    }
}

void OnSignal::Watch(int fd) const {
    char cNote = kDone;
    const ssize_t nRead = TEMP_FAILURE_RETRY(read(fd, &cNote, 1));
    if (nRead == 1 && cNote == kLeave) {
        _exit(mFnEnd());
    }
    close(fd);
}

}  // namespace tavo::cli
