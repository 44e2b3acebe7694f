// Finds and runs hooks. Relies on looks at the child, many a second, while it waits for what the child says.
// Promises: see Hooks.h.
#include "programs/tavohook/Hooks.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>

#include "ground/Descriptor.h"
#include "ground/Directory.h"
#include "mapping/Outcome.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

constexpr char kPath[] = "PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";
constexpr size_t kMostHooks = 64;
constexpr size_t kMostOutput = 300;
constexpr int kLastPieces = 16;                        // of what an ended hook has said
constexpr auto kKillAfter = std::chrono::seconds(2);   // between the polite signal and the other one
constexpr auto kTick = std::chrono::milliseconds(50);  // how late an end may be seen
constexpr int kNotRun = 127;
constexpr int kSignalled = 128;

bool IsHookName(const std::string& szName) {
    return !szName.empty() && std::all_of(szName.begin(), szName.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_' || c == '-';
    });
}

bool IsRootsAlone(const struct stat& status) {
    return status.st_uid == 0 && (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

// Why a file is not run; null when it is. The path can be used after that: only root can put another file there.
const char* Objection(int fdDirectory, const std::string& szName) {
    const Descriptor fd(openat(fdDirectory, szName.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat status = {};
    if (fd.Get() < 0 || fstat(fd.Get(), &status) != 0) {
        return errno == ELOOP ? "it is a link" : "it cannot be opened";
    }
    if (!S_ISREG(status.st_mode)) {
        return "it is no plain file";
    }
    if (!IsRootsAlone(status)) {
        return "others than root may change it";
    }
    return (status.st_mode & S_IXUSR) == 0 ? "it is not executable" : nullptr;
}

// In the child: a process group of its own, nothing open but its output, no shell.
[[noreturn]] void BecomeHook(const std::string& szPath, char* const* rgszEnvironment, int fdOutput) {
    setpgid(0, 0);
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    for (int nSignal = 1; nSignal < NSIG; ++nSignal) {
        signal(nSignal, SIG_DFL);
    }
    const int fdNull = open("/dev/null", O_RDONLY);
    dup2(fdNull, STDIN_FILENO);
    dup2(fdOutput, STDOUT_FILENO);
    dup2(fdOutput, STDERR_FILENO);
    closefrom(STDERR_FILENO + 1);
    char* const rgszArguments[] = {const_cast<char*>(szPath.c_str()), nullptr};
    if (chdir("/") == 0) {
        execve(szPath.c_str(), rgszArguments, rgszEnvironment);
    }
    _exit(kNotRun);
}

// Takes what the hook says, as long as it is not too much; the rest is read and dropped. A piece at a time: a hook
// that never stops writing would else never be looked at by the clock.
bool TakeOutput(int fd, std::string& szOutput) {
    std::array<char, 4096> rgBytes;
    const ssize_t nRead = read(fd, rgBytes.data(), rgBytes.size());
    if (nRead > 0) {
        szOutput.append(rgBytes.data(), std::min(static_cast<size_t>(nRead), kMostOutput - szOutput.size()));
    }
    return nRead > 0;
}

// The child keeps its pid all the same until it is waited for.
bool HasEnded(pid_t pid) {
    siginfo_t info = {};
    return waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOHANG | WNOWAIT) != 0 || info.si_pid == pid;
}

// Whether the child has ended by then, or before fnStop. What it says is taken in the meantime.
bool WaitUntil(pid_t pid, int fdOutput, Clock::time_point end, const std::function<bool()>& fnStop,
               std::string& szOutput) {
    bool blEnded = HasEnded(pid);
    while (!blEnded && Clock::now() < end && !fnStop()) {
        pollfd output = {fdOutput, POLLIN, 0};
        poll(&output, 1, static_cast<int>(kTick.count()));
        if (output.revents != 0 && !TakeOutput(fdOutput, szOutput) && (output.revents & (POLLHUP | POLLERR)) != 0) {
            fdOutput = -1;  // nobody is there to say anything; poll passes over it
        }
        blEnded = HasEnded(pid);
    }
    for (int i = 0; blEnded && i < kLastPieces && TakeOutput(fdOutput, szOutput); ++i) {
    }
    return blEnded;
}

std::string OneLine(std::string szText) {
    std::replace(szText.begin(), szText.end(), '\n', ' ');
    return HarmlessText(szText, kMostOutput);
}

}  // namespace

std::vector<std::string> FindHooks(const std::string& szDirectory, std::vector<std::string>& rgszRefused) {
    const Descriptor fd(open(szDirectory.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    struct stat status = {};
    if (fd.Get() < 0 || fstat(fd.Get(), &status) != 0) {
        return {};
    }
    if (!IsRootsAlone(status)) {
        rgszRefused.push_back(szDirectory + ": others than root may change it");
        return {};
    }
    std::vector<std::string> rgszHooks;
    for (const std::string& szName : NamesIn(szDirectory).value_or(std::vector<std::string>())) {
        if (!IsHookName(szName)) {
            continue;
        }
        const char* szWhy = rgszHooks.size() >= kMostHooks ? "there are too many" : Objection(fd.Get(), szName);
        if (szWhy == nullptr) {
            rgszHooks.push_back(szName);
        } else {
            rgszRefused.push_back(szDirectory + "/" + szName + ": " + szWhy);
        }
    }
    std::sort(rgszHooks.begin(), rgszHooks.end());
    return rgszHooks;
}

HookEnd RunHook(const std::string& szPath, const std::vector<std::string>& rgFacts, std::chrono::milliseconds limit,
                const std::function<bool()>& fnStop) {
    std::vector<char*> rgszEnvironment = {const_cast<char*>(kPath)};
    for (const std::string& szFact : rgFacts) {
        rgszEnvironment.push_back(const_cast<char*>(szFact.c_str()));
    }
    rgszEnvironment.push_back(nullptr);
    HookEnd end;
    int rgFd[2];
    if (pipe2(rgFd, O_CLOEXEC | O_NONBLOCK) != 0) {
        return end;
    }
    const Descriptor fdRead(rgFd[0]);
    Descriptor fdWrite(rgFd[1]);
    fcntl(fdWrite.Get(), F_SETFL, 0);  // the hook's end is an ordinary one
    const pid_t pid = fork();
    if (pid == 0) {
        BecomeHook(szPath, rgszEnvironment.data(), fdWrite.Get());
    }
    fdWrite.Reset();
    if (pid < 0) {
        return end;
    }
    end.blStarted = true;
    std::string szOutput;
    end.blInTime = WaitUntil(pid, fdRead.Get(), Clock::now() + limit, fnStop, szOutput);
    if (!end.blInTime) {
        kill(-pid, SIGTERM);
        WaitUntil(
            pid, fdRead.Get(), Clock::now() + kKillAfter, [] { return false; }, szOutput);
        kill(-pid, SIGKILL);  // also who of its group is left
    }
    int nStatus = 0;
    waitpid(pid, &nStatus, 0);
    end.nStatus = WIFEXITED(nStatus) ? WEXITSTATUS(nStatus) : kSignalled + WTERMSIG(nStatus);
    end.szOutput = OneLine(std::move(szOutput));
    return end;
}

}  // namespace tavo
