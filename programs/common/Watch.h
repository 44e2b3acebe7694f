// A parent that watches over the process that does the work, where no service manager does.
// Relies on the signals of a daemon. Promises: passes signals on; a crash is followed by a new start
// after a pause, not without end; the parent never goes by the name of the work that it watches.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>

#include "programs/common/Instance.h"
#include "programs/common/SignalQueue.h"

namespace tavo {

// Waits until the child has ended; fnPassOn is called at first, and when a signal has come. Its wait status.
int WaitForChild(pid_t pid, SignalQueue& signals, const std::function<void()>& fnPassOn);

class Watch {
public:
    // szTitle: argv[0], where a process shows its name.
    Watch(const char* szName, char* szTitle);
    // Runs fnWork in a child process, again after every crash. In the parent: the exit status for it, once the
    // work has ended by itself, was told to end, or has crashed too often.
    int Run(const std::function<int()>& fnWork);

    // The lock of the parent that watches over the program of a name.
    static std::string LockFile(const std::string& szName) { return "/var/run/" + szName + "_watch.lock"; }

private:
    pid_t Start(const std::function<int()>& fnWork);
    void ShowAs(const std::string& szTitle, const char* szName);
    void PassOn(pid_t pid);
    bool Pause();

    const char* mSzName;
    char* mSzTitle;
    std::string mSzOwnTitle;
    Instance mInstance;
    SignalQueue mSignals;
};

}  // namespace tavo
