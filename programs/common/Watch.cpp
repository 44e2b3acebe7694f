// See Watch.h. Relies on fork and the signal queue. Promises: see Watch.h.
#include "programs/common/Watch.h"

#include <sys/prctl.h>
#include <sys/wait.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <deque>

#include "ground/SysLog.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

// The same bounds stand in the systemd units.
constexpr auto kPause = std::chrono::seconds(2);
constexpr auto kCrashWindow = std::chrono::minutes(10);
constexpr size_t kMostCrashes = 10;
constexpr char kTitle[] = "tavowatch";

}  // namespace

int WaitForChild(pid_t pid, SignalQueue& signals, const std::function<void()>& fnPassOn) {
    for (;;) {
        fnPassOn();
        int nStatus = -1;
        if (const pid_t pidEnded = waitpid(pid, &nStatus, WNOHANG); pidEnded != 0) {
            return pidEnded == pid ? nStatus : -1;
        }
        signals.Wait(-1);
    }
}

Watch::Watch(const char* szName, char* szTitle)
    : mSzName(szName), mSzTitle(szTitle), mSzOwnTitle(szTitle), mInstance(LockFile(szName)) {}

// Whoever looks for the work by its name must not find the parent: it would count as the work that lives, also
// between a crash and the new start.
void Watch::ShowAs(const std::string& szTitle, const char* szName) {
    std::memset(mSzTitle, 0, mSzOwnTitle.size());
    std::memcpy(mSzTitle, szTitle.data(), std::min(szTitle.size(), mSzOwnTitle.size()));
    prctl(PR_SET_NAME, szName);
}

pid_t Watch::Start(const std::function<int()>& fnWork) {
    const pid_t pid = fork();
    if (pid == 0) {
        ShowAs(mSzOwnTitle, mSzName);
        mInstance.Forget();
        _exit(fnWork());
    }
    return pid;
}

void Watch::PassOn(pid_t pid) {
    if (mSignals.TakeRequest()) {
        kill(pid, SIGHUP);
    }
    if (mSignals.IsHandOver()) {
        kill(pid, SIGUSR1);
    } else if (mSignals.IsStop()) {
        kill(pid, SIGTERM);
    }
}

// False: a signal says that it is not to be started again. A request is a reason to start at once.
bool Watch::Pause() {
    const auto end = Clock::now() + kPause;
    while (!mSignals.IsStop() && !mSignals.TakeRequest() && Clock::now() < end) {
        const auto nLeft = std::chrono::ceil<std::chrono::milliseconds>(end - Clock::now()).count();
        mSignals.Wait(static_cast<int>(std::max<int64_t>(0, nLeft)));
    }
    return !mSignals.IsHandOver();
}

int Watch::Run(const std::function<int()>& fnWork) {
    if (!mInstance.Take()) {
        SysLog(LOG_ERR, "another process watches over %s (lock %s)", mSzName, mInstance.LockFile().c_str());
        return 1;
    }
    std::deque<Clock::time_point> crashes;
    for (;;) {
        const pid_t pid = Start(fnWork);
        if (pid < 0) {
            return 1;
        }
        ShowAs(kTitle, kTitle);
        // Also a stop that came in the pause: what the crash left in the router is taken away.
        const int nStatus = WaitForChild(pid, mSignals, [this, pid] { PassOn(pid); });
        if (nStatus < 0 || WIFEXITED(nStatus)) {
            return nStatus < 0 ? 1 : WEXITSTATUS(nStatus);
        }
        crashes.push_back(Clock::now());
        while (crashes.front() < Clock::now() - kCrashWindow) {
            crashes.pop_front();
        }
        SysLog(LOG_ERR, "%s was ended by signal %d", mSzName, WTERMSIG(nStatus));
        if (mSignals.IsStop() || crashes.size() >= kMostCrashes) {
            SysLog(LOG_ERR, "%s is not started again", mSzName);
            return 1;
        }
        if (!Pause()) {
            return 0;
        }
    }
}

}  // namespace tavo
