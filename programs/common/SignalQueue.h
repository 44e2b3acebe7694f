// The signals of a daemon, taken in when it asks for them. Relies on signalfd.
// Promises: SIGHUP is a request, SIGTERM and SIGINT are a stop, SIGUSR1 is a stop that leaves what was made to
// whoever comes next; none is lost, also not for who waits after another look at the queue took it in; SIGPIPE never
// comes; a child's end only wakes who waits.
#pragma once

#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <span>
#include <utility>

#include "ground/Descriptor.h"

namespace tavo {

class SignalQueue {
public:
    SignalQueue() {
        sigemptyset(&mSignals);
        for (const int nSignal : {SIGHUP, SIGTERM, SIGINT, SIGUSR1, SIGCHLD}) {
            sigaddset(&mSignals, nSignal);
        }
        sigprocmask(SIG_BLOCK, &mSignals, nullptr);
        signal(SIGPIPE, SIG_IGN);
        signal(SIGCHLD, SIG_DFL);  // an ignored end is kept for nobody
        mFd.Reset(signalfd(-1, &mSignals, SFD_CLOEXEC | SFD_NONBLOCK));
    }
    // What a list to wait for begins with.
    pollfd Waiting() const { return {mFd.Get(), POLLIN, 0}; }
    // Until a signal comes, something else of the list, or the time is up; not at all when a signal was taken in
    // since the last wait, whatever was asked for then.
    void Wait(std::span<pollfd> rgWaiting, int nMilliseconds) {
        Drain();
        poll(rgWaiting.data(), rgWaiting.size(), std::exchange(mBlNews, false) ? 0 : nMilliseconds);
    }
    void Wait(int nMilliseconds) {
        pollfd waiting = Waiting();
        Wait({&waiting, 1}, nMilliseconds);
    }
    bool IsStop() {
        Drain();
        return mBlStop;
    }
    bool IsHandOver() {
        Drain();
        return mBlHandOver;
    }
    bool TakeRequest() {
        Drain();
        return std::exchange(mBlRequested, false);
    }
    bool HasRequest() {
        Drain();
        return mBlRequested;
    }

private:
    // Takes in what has arrived.
    void Drain() {
        signalfd_siginfo info = {};
        while (read(mFd.Get(), &info, sizeof(info)) == sizeof(info)) {
            mBlNews = true;
            if (info.ssi_signo == SIGHUP) {
                mBlRequested = true;
            } else if (info.ssi_signo != SIGCHLD) {
                mBlStop = true;
                mBlHandOver = mBlHandOver || info.ssi_signo == SIGUSR1;
            }
        }
    }

    sigset_t mSignals;
    Descriptor mFd;
    bool mBlRequested = false;
    bool mBlStop = false;
    bool mBlHandOver = false;
    bool mBlNews = false;  // since the last wait
};

}  // namespace tavo
