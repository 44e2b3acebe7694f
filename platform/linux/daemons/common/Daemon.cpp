// The frame of a port-mapping daemon. Relies on Linux descriptors for signals and file events.
// Promises: see Daemon.h.
#include "daemons/common/Daemon.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>

#include "core/Descriptor.h"
#include "core/TextFile.h"
#include "daemons/common/SignalQueue.h"
#include "tavo/core.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

constexpr char kHelp[] =
    "Usage: %s [--foreground]\n"
    "Keeps the %s port mappings of the router in line with /etc/portforward/rule.conf.\n"
    "\n"
    "  --foreground  stay attached to the terminal\n"
    "  --help        this text\n"
    "\n"
    "SIGHUP reads the rules again; SIGTERM takes the mappings away and ends.\n"
    "The results stand in %s, the pid in %s.\n"
    "It maps only while %s=\"yes\" stands in /etc/tavoinfo.conf.\n";
constexpr int kExitUsage = 2;
constexpr char kMarkerDir[] = "/tmp";
constexpr char kMarker[] = "/tmp/pfProgress";
constexpr mode_t kPidFileMode = 0644;
constexpr int kCutPasses = 3;  // in a row, before one goes on to its end
constexpr auto kWithdrawLimit = std::chrono::seconds(10);

// Writes our pid where the library looks for it; it deletes the file before it starts a daemon.
void WritePidFile(const DaemonNames& names) {
    if (TLIBCReadPidFile(names.szPidFile) != getpid() &&
        !WriteFileAtomic(names.szPidFile, std::to_string(getpid()) + "\n", kPidFileMode)) {
        syslog(LOG_ERR, "cannot write %s", names.szPidFile);
    }
}

// Goes into the background. In the parent: waits until the daemon is ready and exits with its word.
// In the child: the descriptor through which it says so.
Descriptor Detach() {
    int rgFd[2];
    if (pipe2(rgFd, O_CLOEXEC) != 0) {
        return Descriptor();
    }
    const pid_t pid = fork();
    if (pid != 0) {
        close(rgFd[1]);
        char cReady = 0;
        _exit(pid > 0 && read(rgFd[0], &cReady, 1) == 1 ? 0 : 1);
    }
    close(rgFd[0]);
    setsid();
    if (chdir("/") != 0) {
        syslog(LOG_WARNING, "cannot change to /");
    }
    const Descriptor fdNull(open("/dev/null", O_RDWR | O_CLOEXEC));
    for (int fd = STDIN_FILENO; fdNull.Get() >= 0 && fd <= STDERR_FILENO; ++fd) {
        dup2(fdNull.Get(), fd);
    }
    return Descriptor(rgFd[1]);
}

class Frame {
public:
    explicit Frame(Mapper& mapper) : mNames(mapper.Names()), mMapper(mapper) {
        mFdEvents.Reset(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
        inotify_add_watch(mFdEvents.Get(), kMarkerDir, IN_CREATE | IN_MOVED_TO);
    }
    void Loop();

private:
    void Wait();
    void RunPass();
    void Stop();
    void RemoveMarker() const {
        if (TLIBCFileExist(kMarker) == 1 && mMapper.IsSwitchedOn()) {
            unlink(kMarker);
        }
    }

    const DaemonNames& mNames;
    Mapper& mMapper;
    SignalQueue mSignals;
    Descriptor mFdEvents;
    bool mBlRequested = true;  // the start counts as a request
    int mNCut = 0;             // passes in a row that a newer request may have ended early
    Clock::time_point mNext = Clock::now();
};

// Until the clock, a signal, a new file in the marker's directory or a word from the router.
void Frame::Wait() {
    const auto nLeft = std::chrono::duration_cast<std::chrono::milliseconds>(mNext - Clock::now()).count() + 1;
    pollfd rgWaiting[] = {{mSignals.Fd(), POLLIN, 0}, {mFdEvents.Get(), POLLIN, 0}, {mMapper.WakeFd(), POLLIN, 0}};
    poll(rgWaiting, std::size(rgWaiting), static_cast<int>(std::clamp<int64_t>(nLeft, 0, 3600 * 1000)));
    alignas(inotify_event) char szEvents[4096];
    while (read(mFdEvents.Get(), szEvents, sizeof(szEvents)) > 0) {
    }
    if (rgWaiting[2].revents != 0 && mMapper.OnWake()) {
        mNext = Clock::now();
    }
}

void Frame::RunPass() {
    WritePidFile(mNames);
    // A stop or a newer request ends a pass early: what it would report is out of date. But requests
    // without end must not keep the router from ever being brought in line.
    const bool blWhole = mNCut >= kCutPasses;
    const int nSeconds =
        mMapper.Run(mBlRequested, [this, blWhole] { return mSignals.IsStop() || (!blWhole && mSignals.HasRequest()); });
    mNCut = mSignals.HasRequest() && !blWhole ? mNCut + 1 : 0;

    mNext = Clock::now() + std::chrono::seconds(nSeconds);
    mBlRequested = false;
}

void Frame::Stop() {
    const auto end = Clock::now() + kWithdrawLimit;
    mMapper.Withdraw([end] { return Clock::now() > end; });
    unlink(mNames.szPidFile);
    RemoveMarker();
}

void Frame::Loop() {
    while (!mSignals.IsStop()) {
        mBlRequested = mSignals.TakeRequest() || mBlRequested;
        if (mBlRequested || Clock::now() >= mNext) {
            RunPass();
            continue;
        }
        // The marker is made just after the signal or the start that it belongs to, so one that stands
        // here belongs to a request that has been served, though it may have come after the end of it.
        RemoveMarker();
        if (!mSignals.HasRequest()) {
            Wait();
        }
    }
    Stop();
}

int RunDaemon(Mapper& mapper, bool blForeground) {
    const DaemonNames& names = mapper.Names();
    openlog(names.szName, LOG_PID, LOG_DAEMON);
    Descriptor fdReady = blForeground ? Descriptor() : Detach();
    const Descriptor fdLock(open(names.szLockFile, O_RDWR | O_CREAT | O_CLOEXEC, kPrivateMode));
    if (fdLock.Get() < 0 || flock(fdLock.Get(), LOCK_EX | LOCK_NB) != 0) {
        syslog(LOG_ERR, "another %s is running (lock %s)", names.szName, names.szLockFile);
        return 1;
    }
    Frame frame(mapper);
    WritePidFile(names);
    if (fdReady.Get() >= 0 && write(fdReady.Get(), "r", 1) != 1) {
        syslog(LOG_WARNING, "nobody waited for the start");
    }
    fdReady.Reset();
    frame.Loop();
    return 0;
}

void PrintHelp(FILE* pOut, const DaemonNames& names) {
    std::fprintf(pOut, kHelp, names.szName, names.szProtocol, names.szResultFile, names.szPidFile, names.szRunKey);
}

}  // namespace

int DaemonMain(int argc, char** argv, Mapper& mapper) {
    bool blForeground = false;
    for (int i = 1; i < argc; ++i) {
        const std::string szArgument = argv[i];
        if (szArgument == "--help") {
            PrintHelp(stdout, mapper.Names());
            return 0;
        }
        if (szArgument != "--foreground") {
            std::fprintf(stderr, "%s: unknown argument '%s'\n\n", mapper.Names().szName, argv[i]);
            PrintHelp(stderr, mapper.Names());
            return kExitUsage;
        }
        blForeground = true;
    }
    return RunDaemon(mapper, blForeground);
}

}  // namespace tavo
