// Finds, signals and starts processes. Relies on /proc, posix_spawn, closefrom, and systemd where it runs.
// Promises: children get no descriptor above standard error and default signals; TLIBCExec leaves no
// zombie; zombies do not count as alive.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "ground/Border.h"
#include "ground/Descriptor.h"
#include "ground/Fail.h"
#include "ground/Spawn.h"
#include "ground/TextFile.h"
#include "ground/Unit.h"
#include "tavo/core.h"

namespace {

constexpr size_t kKernelNameSize = 15;
constexpr int kSignalledStatus = 128;
constexpr int kLostStatus = 255;  // the caller ignores SIGCHLD: the child has ended, nobody knows how

using tavo::AtBorder;
using tavo::Descriptor;
using tavo::Fail;

struct DirCloser {
    void operator()(DIR* pDir) const { closedir(pDir); }
};

// /proc files tell no size: read to the end.
std::string ReadProc(const std::string& szPath) {
    std::string szText;
    const Descriptor fd(open(szPath.c_str(), O_RDONLY | O_CLOEXEC));
    char szBlock[4096];
    ssize_t nRead = 0;
    while (fd.Get() >= 0 && (nRead = read(fd.Get(), szBlock, sizeof(szBlock))) > 0) {
        szText.append(szBlock, static_cast<size_t>(nRead));
    }
    return szText;
}

std::string BaseName(const std::string& szPath) {
    return szPath.substr(szPath.rfind('/') + 1);
}

bool IsInterpreter(const std::string& szName) {
    static constexpr const char* kNames[] = {"sh", "bash", "dash", "perl", "python3", "python", "env"};
    return std::any_of(std::begin(kNames), std::end(kNames), [&](const char* szKnown) { return szName == szKnown; }) ||
           szName.starts_with("python3.");
}

std::vector<std::string> Arguments(const std::string& szCommandLine) {
    std::vector<std::string> rgArguments;
    for (size_t i = 0; i < szCommandLine.size();) {
        size_t nEnd = szCommandLine.find('\0', i);
        nEnd = nEnd == std::string::npos ? szCommandLine.size() : nEnd;
        rgArguments.push_back(szCommandLine.substr(i, nEnd - i));
        i = nEnd + 1;
    }
    return rgArguments;
}

bool IsZombie(const std::string& szDir) {
    const std::string szStat = ReadProc(szDir + "/stat");
    const size_t nState = szStat.rfind(')');
    return nState == std::string::npos || nState + 2 >= szStat.size() || szStat[nState + 2] == 'Z' ||
           szStat[nState + 2] == 'X';
}

// The script that an interpreter runs, by its base name; empty when it runs none.
std::string ScriptName(const std::vector<std::string>& rgArguments) {
    if (!IsInterpreter(BaseName(rgArguments.front()))) {
        return "";
    }
    for (size_t i = 1; i < rgArguments.size(); ++i) {
        if (rgArguments[i] == "-c" || rgArguments[i] == "-m") {
            return "";
        }
        if (!rgArguments[i].starts_with("-")) {
            return BaseName(rgArguments[i]);
        }
    }
    return "";
}

bool Matches(const std::string& szDir, const std::string& szName) {
    const std::vector<std::string> rgArguments = Arguments(ReadProc(szDir + "/cmdline"));
    if (rgArguments.empty() || IsZombie(szDir)) {  // kernel threads have no command line
        return false;
    }
    if (szName.find_first_of("/ ") != std::string::npos) {
        std::string szWhole = rgArguments.front();
        for (size_t i = 1; i < rgArguments.size(); ++i) {
            szWhole += " " + rgArguments[i];
        }
        return szWhole == szName;
    }
    if (BaseName(rgArguments.front()) == szName || ScriptName(rgArguments) == szName) {
        return true;
    }
    const std::string szKernelName = ReadProc(szDir + "/comm");
    return szKernelName.substr(0, szKernelName.find('\n')) == szName.substr(0, kKernelNameSize) &&
           szName.size() <= kKernelNameSize;
}

// Calls fnFound with the pid of every process of that name; false when /proc cannot be read.
bool ForEachProcess(const std::string& szName, const std::function<void(pid_t)>& fnFound) {
    const std::unique_ptr<DIR, DirCloser> pDir(opendir("/proc"));
    if (!pDir) {
        return false;
    }
    while (const dirent* pEntry = readdir(pDir.get())) {
        const pid_t pid = static_cast<pid_t>(std::strtol(pEntry->d_name, nullptr, 10));
        if (pid > 0 && Matches("/proc/" + std::string(pEntry->d_name), szName)) {
            fnFound(pid);
        }
    }
    return true;
}

void ResetSignals() {
    for (int nSignal = 1; nSignal < NSIG; ++nSignal) {
        signal(nSignal, SIG_DFL);
    }
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
}

[[noreturn]] void ReportAndExit(int fdReport) {
    const int nErrno = errno;
    const ssize_t nWritten = write(fdReport, &nErrno, sizeof(nErrno));
    _exit(nWritten == sizeof(nErrno) ? 127 : 126);
}

// In the grandchild: becomes the program, or writes errno to the pipe.
[[noreturn]] void BecomeProgram(char* const* rgszArguments, int fdReport) {
    ResetSignals();
    // The report pipe moves to a fixed place, so that all above it can be closed in one call; and first,
    // for in a caller without standard streams it may be one of them.
    constexpr int kReport = STDERR_FILENO + 1;
    dup2(fdReport, kReport);
    fcntl(kReport, F_SETFD, FD_CLOEXEC);
    const int fdNull = open("/dev/null", O_RDWR);
    for (int fd = STDIN_FILENO; fdNull >= 0 && fd <= STDERR_FILENO; ++fd) {
        dup2(fdNull, fd);
    }
    closefrom(kReport + 1);
    execv(rgszArguments[0], rgszArguments);
    ReportAndExit(kReport);
}

int WaitFor(pid_t pid) {
    int nStatus = 0;
    while (waitpid(pid, &nStatus, 0) < 0) {
        if (errno != EINTR) {
            return kLostStatus;
        }
    }
    return WIFEXITED(nStatus) ? WEXITSTATUS(nStatus) : kSignalledStatus + WTERMSIG(nStatus);
}

// Starts a program that belongs to nobody here. 0 or -1.
int Launch(char* const* rgszArguments) {
    int rgFdPipe[2];
    if (pipe2(rgFdPipe, O_CLOEXEC) != 0) {
        return Fail(TLIBC_ERR_EXEC);
    }
    Descriptor fdRead(rgFdPipe[0]);
    Descriptor fdWrite(rgFdPipe[1]);
    const pid_t pid = fork();
    if (pid < 0) {
        return Fail(TLIBC_ERR_EXEC);
    }
    if (pid == 0) {
        // A child of a child belongs to init, which takes care of its end.
        setsid();
        const pid_t pidProgram = fork();
        if (pidProgram == 0) {
            BecomeProgram(rgszArguments, rgFdPipe[1]);
        }
        if (pidProgram < 0) {
            ReportAndExit(rgFdPipe[1]);
        }
        _exit(0);
    }
    fdWrite.Reset();
    WaitFor(pid);
    int nErrno = 0;
    ssize_t nRead = 0;
    while ((nRead = read(fdRead.Get(), &nErrno, sizeof(nErrno))) < 0 && errno == EINTR) {
    }
    // The pipe alone tells: a caller that ignores SIGCHLD gets no exit status.
    if (nRead != 0) {
        errno = nErrno;
        return Fail(TLIBC_ERR_EXEC);
    }
    return 0;
}

}  // namespace

int TLIBCIsProcAlive(const char* szName) {
    return AtBorder(-1, [&] {
        if (szName == nullptr || *szName == '\0') {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        bool blAlive = false;
        if (!ForEachProcess(szName, [&blAlive](pid_t) { blAlive = true; })) {
            return Fail(TLIBC_ERR_READ);
        }
        return blAlive ? 1 : 0;
    });
}

int TLIBCKill(const char* szName, int nSignal) {
    return AtBorder(-1, [&] {
        if (szName == nullptr || *szName == '\0' || nSignal < 0 || nSignal >= NSIG) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        int nSignalled = 0;
        const bool blRead = ForEachProcess(szName, [&](pid_t pid) {
            if (pid != getpid() && kill(pid, nSignal) == 0) {
                ++nSignalled;
            }
        });
        return blRead ? nSignalled : Fail(TLIBC_ERR_READ);
    });
}

pid_t TLIBCReadPidFile(const char* szPath) {
    return AtBorder(pid_t{-1}, [&] {
        if (szPath == nullptr) {
            return pid_t{Fail(TLIBC_ERR_BAD_PARAMETER)};
        }
        const std::optional<std::string> szText = tavo::ReadFile(szPath);
        const long nPid = szText ? std::strtol(szText->c_str(), nullptr, 10) : -1;
        return nPid >= 1 && nPid <= INT32_MAX ? static_cast<pid_t>(nPid) : pid_t{Fail(TLIBC_ERR_NOT_FOUND)};
    });
}

int TLIBCExec(const char* szPath, const char* szArg1, const char* szArg2, const char* szArg3, const char* szArg4) {
    return AtBorder(-1, [&] {
        if (szPath == nullptr || *szPath == '\0') {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        // A daemon belongs to the service manager, whoever asks for it.
        if (const std::optional<bool> blUnit = szArg1 == nullptr ? tavo::StartUnitOf(szPath) : std::nullopt) {
            return *blUnit ? 0 : Fail(TLIBC_ERR_EXEC);
        }
        const char* rgszGiven[] = {szPath, szArg1, szArg2, szArg3, szArg4, nullptr};
        char* rgszArguments[std::size(rgszGiven)] = {};
        for (size_t i = 0; i < std::size(rgszGiven) && rgszGiven[i] != nullptr; ++i) {
            rgszArguments[i] = const_cast<char*>(rgszGiven[i]);
        }
        return Launch(rgszArguments);
    });
}

pid_t TLIBCProcFork() {
    return fork();
}

int TLIBCSystem(const char* szCommand) {
    if (szCommand == nullptr) {
        return Fail(TLIBC_ERR_BAD_PARAMETER);
    }
    char szShell[] = "sh";
    char szOption[] = "-c";
    char* const rgszArguments[] = {szShell, szOption, const_cast<char*>(szCommand), nullptr};
    pid_t pid = -1;
    tavo::SpawnSetup().Spawn(pid, "/bin/sh", rgszArguments, environ);
    return pid < 0 ? Fail(TLIBC_ERR_EXEC) : WaitFor(pid);
}
