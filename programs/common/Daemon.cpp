// The frame of a port-mapping daemon. Relies on Linux descriptors for signals and file events.
// Promises: see Daemon.h.
#include "programs/common/Daemon.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <memory>
#include <string_view>
#include <utility>

#include "ground/BootClock.h"
#include "ground/BootTimer.h"
#include "ground/Descriptor.h"
#include "ground/OwnFile.h"
#include "ground/Paths.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "ground/net/Neighbour.h"
#include "ground/net/NetworkWatch.h"
#include "programs/common/Instance.h"
#include "programs/common/MadeFile.h"
#include "programs/common/Published.h"
#include "programs/common/SignalQueue.h"
#include "programs/common/Watch.h"
#include "tavo/core.h"
#include "tavo/net.h"

namespace tavo {

namespace {

using Clock = BootClock;

constexpr char kHelp[] =
    "Usage: %s [--foreground [--take-over] | --stop | --hand-over | --make-locks]\n"
    "Keeps the %s port mappings of the router in line with /etc/portforward/rule.conf.\n"
    "Without arguments it goes into the background, where a parent starts it again after a crash.\n"
    "\n"
    "  --foreground  stay attached to the terminal, or to the service manager\n"
    "  --take-over   have one that runs already end and leave its mappings to this one\n"
    "  --stop        end the one that runs, and take the mappings away\n"
    "  --hand-over   end the one that runs, and leave the mappings in the router\n"
    "  --make-locks  make the lock files in /tmp, also in the place of what others have put there\n"
    "  --help        this text\n"
    "\n"
    "SIGHUP reads the rules again; SIGTERM takes the mappings away and ends; SIGUSR1 ends and leaves them.\n"
    "The results stand in %s, the pid in %s.\n"
    "It maps only while %s=\"yes\" stands in /etc/tavoinfo.conf.\n";
constexpr int kExitUsage = 2;
constexpr int kExitLeft = 3;  // of a daemon that was stopped; the units know it
constexpr size_t kAddressSize = 16;
constexpr char kMarkerDir[] = "/tmp";
constexpr char kMarker[] = "/tmp/pfProgress";
constexpr mode_t kPidFileMode = 0644;
// As in tmpfiles.d, which makes them at the boot where systemd runs.
constexpr const char* kLockFiles[] = {kRouterLock, "/tmp/upnp_detector.lock", "/tmp/natpmp_detector.lock",
                                      "/tmp/upnp_test.lock"};
constexpr int kCutPasses = 3;                              // in a row, before one goes on to its end
constexpr auto kWithdrawLimit = std::chrono::seconds(60);  // of a router that answers slowly
constexpr auto kSilentStop = std::chrono::seconds(10);     // one that took so long need not be tried again
constexpr auto kEndLimit = std::chrono::seconds(70);       // for another instance: a pass, and the mappings
constexpr auto kSettle = std::chrono::seconds(1);          // an address rarely changes alone
// Between passes: that anybody on the network can cause, and that this box's own addresses, routes and links do.
constexpr auto kRouterPause = std::chrono::seconds(5);
constexpr auto kNetworkPause = std::chrono::seconds(2);
constexpr auto kStartLimit = std::chrono::seconds(5);  // of an instance that somebody else starts
constexpr int kPollMilliseconds = 20;
constexpr int kWaitMilliseconds = 3600 * 1000;  // the timer comes before

// Writes our pid where the library looks for it; it deletes the file before it starts a daemon.
void WritePidFile(const DaemonNames& names) {
    if (TLIBCReadPidFile(names.szPidFile) != getpid() &&
        !WriteFileAtomic(names.szPidFile, std::to_string(getpid()) + "\n", kPidFileMode)) {
        SysLog(LOG_ERR, "cannot write %s", names.szPidFile);
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
        SysLog(LOG_WARNING, "cannot change to /");
    }
    const Descriptor fdNull(open("/dev/null", O_RDWR | O_CLOEXEC));
    for (int fd = STDIN_FILENO; fdNull.Get() >= 0 && fd <= STDERR_FILENO; ++fd) {
        dup2(fdNull.Get(), fd);
    }
    return Descriptor(rgFd[1]);
}

// Whether the router in front may have something of ours, by the record; where none is in front, any router.
bool HasLeft(const DaemonNames& names) {
    MadeFile made(names.szMadeFile);
    Record& record = made.Get();
    record.Prune(BootSeconds());
    char szGateway[kAddressSize] = {};
    if (record.Text().empty() || TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) != 0) {
        return !record.Text().empty();
    }
    record.TurnTo({szGateway, HardwareAddress(szGateway)});
    return record.HasRows();
}

int SayLeft(int nExit) {
    SysLog(LOG_ERR, "the router could not be asked to take the mappings away; it may keep them");
    return nExit;
}

// Whether all is gone. A router that cannot be found is no matter where nothing was made.
bool Withdraw(const DaemonNames& names, Mapper& mapper, const std::function<bool()>& fnStop) {
    const auto end = Clock::now() + kWithdrawLimit;
    return mapper.Withdraw([&] { return fnStop() || Clock::now() > end; }) || !HasLeft(names);
}

// Tells the service manager, where one started us, that the work has begun. Our own children have nothing to tell it.
void NotifyReady() {
    const char* szSocket = getenv("NOTIFY_SOCKET");
    sockaddr_un address = {};
    if (szSocket != nullptr && std::strlen(szSocket) < sizeof(address.sun_path)) {
        const Descriptor fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
        address.sun_family = AF_UNIX;
        const size_t nLength = std::strlen(szSocket);
        std::memcpy(address.sun_path, szSocket, nLength);
        address.sun_path[0] = szSocket[0] == '@' ? '\0' : szSocket[0];
        constexpr std::string_view kReady = "READY=1";
        sendto(fd.Get(), kReady.data(), kReady.size(), MSG_NOSIGNAL, reinterpret_cast<const sockaddr*>(&address),
               static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + nLength));
    }
    unsetenv("NOTIFY_SOCKET");
}

bool WaitUntil(std::chrono::seconds limit, const std::function<bool()>& fnTrue) {
    const auto end = Clock::now() + limit;
    while (!fnTrue()) {
        if (Clock::now() > end) {
            return false;
        }
        poll(nullptr, 0, kPollMilliseconds);
    }
    return true;
}

// Ends what runs, the parent that would start it again first of all. True when nothing runs any more.
bool EndRunning(const DaemonNames& names, int nSignal) {
    const Instance rgInstances[] = {Instance(Watch::LockFile(names.szName)), Instance(names.szLockFile)};
    pid_t pidTold = 0;
    const bool blEnded = WaitUntil(kEndLimit, [&] {
        for (const Instance& instance : rgInstances) {
            const pid_t pid = instance.Holder();
            if (pid > 0 && pid != pidTold) {
                kill(pid, nSignal);
                pidTold = pid;
            }
            if (pid != 0) {
                return false;
            }
        }
        return true;
    });
    if (!blEnded) {
        SysLog(LOG_ERR, "the %s that runs does not end (lock %s)", names.szName, names.szLockFile);
    }
    return blEnded;
}

class Frame {
public:
    Frame(const DaemonNames& names, Mapper& mapper) : mNames(names), mMapper(mapper) {
        mFdEvents.Reset(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
        inotify_add_watch(mFdEvents.Get(), kMarkerDir, IN_CREATE | IN_MOVED_TO);
    }
    int Loop();  // the exit status

private:
    void Wait();
    void RunPass();
    int Stop();
    void RemoveMarker() const {
        if (TLIBCFileExist(kMarker) == 1 && mMapper.IsSwitchedOn()) {
            unlink(kMarker);
        }
    }

    const DaemonNames& mNames;
    Mapper& mMapper;
    SignalQueue mSignals;
    Descriptor mFdEvents;
    NetworkWatch mNetwork;
    BootTimer mTimer;
    bool mBlRequested = true;  // the start counts as a request
    int mNCut = 0;             // passes in a row that a newer request may have ended early
    Clock::time_point mNext = Clock::now();
    bool mBlWoken = false;     // mNext is so early because of a wake
    Clock::time_point mWoken;  // when the last pass of that kind began
};

// Until the clock, a signal, a new file in the marker's directory or a word from the router.
void Frame::Wait() {
    mTimer.Set(mNext);
    std::vector<pollfd> rgWaiting = {
        mSignals.Waiting(), {mFdEvents.Get(), POLLIN, 0}, {mNetwork.Fd(), POLLIN, 0}, {mTimer.Fd(), POLLIN, 0}};
    const auto nOurs = static_cast<std::ptrdiff_t>(rgWaiting.size());
    for (const int fd : mMapper.WakeFds()) {
        rgWaiting.push_back({fd, POLLIN, 0});
    }
    mSignals.Wait(rgWaiting, kWaitMilliseconds);
    alignas(inotify_event) char szEvents[4096];
    while (read(mFdEvents.Get(), szEvents, sizeof(szEvents)) > 0) {
    }
    const bool blSpoke = std::any_of(rgWaiting.begin() + nOurs, rgWaiting.end(),
                                     [](const pollfd& waiting) { return waiting.revents != 0; });
    const bool blRouter = blSpoke && mMapper.OnWake();
    const bool blNetwork = rgWaiting[2].revents != 0 && mNetwork.TakeChange() && mMapper.OnNetworkChange();
    const auto early = std::max(Clock::now() + kSettle, mWoken + (blNetwork ? kNetworkPause : kRouterPause));
    if ((blRouter || blNetwork) && early < mNext) {
        mNext = early;
        mBlWoken = true;
    }
}

void Frame::RunPass() {
    WritePidFile(mNames);
    mWoken = std::exchange(mBlWoken, false) ? Clock::now() : mWoken;
    // A stop or a newer request ends a pass early: what it would report is out of date. But requests
    // without end must not keep the router from ever being brought in line.
    const bool blWhole = mNCut >= kCutPasses;
    const int nSeconds =
        mMapper.Run(mBlRequested, [this, blWhole] { return mSignals.IsStop() || (!blWhole && mSignals.HasRequest()); });
    mNCut = mSignals.HasRequest() && !blWhole ? mNCut + 1 : 0;

    mNext = Clock::now() + std::chrono::seconds(nSeconds);
    mBlRequested = false;
}

int Frame::Stop() {
    const bool blDone = mSignals.IsHandOver() || Withdraw(mNames, mMapper, [] { return false; });
    unlink(mNames.szPidFile);
    RemoveMarker();
    return blDone ? 0 : SayLeft(kExitLeft);
}

int Frame::Loop() {
    while (!mSignals.IsStop()) {
        mBlRequested = mSignals.TakeRequest() || mBlRequested;
        if (mBlRequested || Clock::now() >= mNext) {
            RunPass();
            continue;
        }
        // The marker is made just after the signal or the start that it belongs to, so one that stands
        // here belongs to a request that has been served, though it may have come after the end of it.
        RemoveMarker();
        WritePidFile(mNames);  // whoever asks for a start deletes it, and makes the marker afterwards
        Wait();
    }
    return Stop();
}

// The locks of saves, detections and tests, before anybody else can put something of his own in their places: a link,
// or a file that he holds.
int MakeLockFiles() {
    int nExit = 0;
    for (const char* szPath : kLockFiles) {
        if (!MakeOwnFile(szPath)) {
            SysLog(LOG_ERR, "cannot make %s: %s", szPath, std::strerror(errno));
            nExit = 1;
        }
    }
    return nExit;
}

int AnotherRuns(const DaemonNames& names) {
    SysLog(LOG_ERR, "another %s is running (lock %s)", names.szName, names.szLockFile);
    return 1;
}

// The mapper reads what the one before it has left, be that another program or a child that crashed: not before this
// process is the one instance.
int RunInstance(const DaemonNames& names, const MakeMapper& fnMake, Descriptor& fdReady) {
    Instance instance(names.szLockFile);
    if (!instance.Take()) {
        return AnotherRuns(names);
    }
    MakeLockFiles();
    const std::unique_ptr<Mapper> pMapper = fnMake();
    Frame frame(names, *pMapper);
    WritePidFile(names);
    const bool blTold = fdReady.Get() < 0 || write(fdReady.Get(), "r", 1) == 1;
    SysLog(LOG_INFO, "%s begins%s", names.szName, blTold ? "" : " anew");
    fdReady.Reset();
    NotifyReady();
    return frame.Loop();
}

int RunInBackground(const DaemonNames& names, const MakeMapper& fnMake, char* szTitle) {
    const Instance instance(names.szLockFile);
    if (instance.Holder() != 0) {
        return AnotherRuns(names);
    }
    // After a crash its parent waits for a moment: what is asked for now need not wait.
    if (const pid_t pid = Instance(Watch::LockFile(names.szName)).Holder(); pid > 0) {
        kill(pid, SIGHUP);
        return WaitUntil(kStartLimit, [&] { return instance.Holder() != 0; }) ? 0 : 1;
    }
    Descriptor fdReady = Detach();
    return Watch(names.szName, szTitle).Run([&] { return RunInstance(names, fnMake, fdReady); });
}

// Whoever ends has no way to tell us what became of its mappings, and may have been killed: the record has it. What
// nobody has tried to take away, or a router has refused at once, is tried here; one that is silent was waited for.
int StopRunning(const DaemonNames& names, const MakeMapper& fnMake) {
    const auto start = Clock::now();
    if (!EndRunning(names, SIGTERM)) {
        return 1;
    }
    unlink(names.szPidFile);  // of one that was killed
    if (!HasLeft(names)) {
        Unpublish(names.szName);  // else its last word is what is left
        return 0;
    }
    SignalQueue signals;  // another stop tells us to end, and goes on with what we leave
    Instance instance(names.szLockFile);
    if (Clock::now() - start >= kSilentStop || !instance.Take()) {
        return SayLeft(1);
    }
    const std::unique_ptr<Mapper> pMapper = fnMake();
    return Withdraw(names, *pMapper, [&] { return signals.IsStop(); }) ? 0 : SayLeft(1);
}

int RunDaemon(const DaemonNames& names, const MakeMapper& fnMake, std::string_view szOptions, char* szTitle) {
    openlog(names.szName, LOG_PID | (szOptions == "--stop " ? LOG_PERROR : 0), LOG_DAEMON);
    if (geteuid() != 0) {
        std::fprintf(stderr, "%s: only root can do this: run it with sudo\n", names.szName);
        return 1;
    }
    if (szOptions == "--make-locks ") {
        return MakeLockFiles();
    }
    if (szOptions.empty()) {
        return RunInBackground(names, fnMake, szTitle);
    }
    if (szOptions == "--stop ") {
        return StopRunning(names, fnMake);
    }
    if (szOptions != "--foreground " && !EndRunning(names, SIGUSR1)) {
        return 1;
    }
    Descriptor fdReady;
    return szOptions == "--hand-over " ? 0 : RunInstance(names, fnMake, fdReady);
}

void PrintHelp(FILE* pOut, const DaemonNames& names) {
    std::fprintf(pOut, kHelp, names.szName, names.szProtocol, names.szResultFile, names.szPidFile, names.szRunKey);
}

}  // namespace

int DaemonMain(int argc, char** argv, const DaemonNames& names, const MakeMapper& fnMake) {
    std::string szOptions;
    for (int i = 1; i < argc; ++i) {
        szOptions += std::string(argv[i]) + " ";
    }
    if (szOptions == "--help ") {
        PrintHelp(stdout, names);
        return 0;
    }
    constexpr std::string_view kOptions[] = {"",        "--foreground ", "--foreground --take-over ",
                                             "--stop ", "--hand-over ",  "--make-locks "};
    if (std::find(std::begin(kOptions), std::end(kOptions), szOptions) == std::end(kOptions)) {
        std::fprintf(stderr, "%s: unknown arguments '%s'\n\n", names.szName, szOptions.c_str());
        PrintHelp(stderr, names);
        return kExitUsage;
    }
    return RunDaemon(names, fnMake, szOptions, argv[0]);
}

}  // namespace tavo
