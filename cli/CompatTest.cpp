// Ends compatibility tests. Relies on TLibStopTestUpnpCompatibility, and on a thread that waits for what a
// signal handler may only note. Promises: see CompatTest.h.
#include "CompatTest.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <chrono>
#include <csignal>

#include "Box.h"

namespace tavo::cli {

namespace {

constexpr int kPollMilliseconds = 200;
constexpr auto kStopLimit = std::chrono::seconds(10);
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

bool IsTesting() {
    auto enTask = TAVO_LIBTAVOPORTMAP_TASK_IDLE;
    return TLibGetLibTavoPortMapRunningTask(&enTask) == 0 && enTask == TAVO_LIBTAVOPORTMAP_TASK_TESTING;
}

bool StopTest() {
    const auto end = std::chrono::steady_clock::now() + kStopLimit;
    do {
        // Once more each time: a test that was about to begin has begun by then.
        TLibStopTestUpnpCompatibility();
        poll(nullptr, 0, kPollMilliseconds);
    } while (IsTesting() && std::chrono::steady_clock::now() < end);
    return !IsTesting();
}

Reply Stopped(bool blEnded) {
    return blEnded
               ? Reply{.szMessage =
                           "the test is stopped and nothing was recorded; its mappings are taken away, or will be by "
                           "the next test where the router has gone silent"}
               : Failure(
                     "the test was told to stop, but it still takes its mappings away from a slow router; "
                     "'tavoportmap status' shows when it has ended");
}

Reply AlreadyTesting() {
    return {.enExit = kBusy,
            .szMessage = "a compatibility test is running already; 'tavoportmap compat --stop' would end it"};
}

StopOnSignal::StopOnSignal(bool blJson, std::function<void()> fnPark) : mBlJson(blJson), mFnPark(std::move(fnPark)) {
    int rgFds[2] = {-1, -1};
    if (pipe2(rgFds, O_CLOEXEC) != 0) {
        return;  // without it a signal ends the program; the test then ends by itself, a little later
    }
    gFdNote = rgFds[1];
    mThread = std::thread([this, fd = rgFds[0]] { Watch(fd); });
    Handle(&NoteSignal);
}

StopOnSignal::~StopOnSignal() {
    Handle(SIG_DFL);
    if (mThread.joinable()) {
        const ssize_t nWritten = write(gFdNote, &kDone, 1);
        static_cast<void>(nWritten);
        mThread.join();
        close(gFdNote);
    }
}

void StopOnSignal::Watch(int fd) const {
    char cNote = kDone;
    const ssize_t nRead = TEMP_FAILURE_RETRY(read(fd, &cNote, 1));
    if (nRead == 1 && cNote == kLeave) {
        mFnPark();
        Reply reply = Stopped(StopTest());
        reply.enExit = kFailed;
        Print(reply, mBlJson);
        _exit(reply.enExit);
    }
    close(fd);
}

}  // namespace tavo::cli
