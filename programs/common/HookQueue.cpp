// A runner of hooks, started when there is something to run. Relies on posix_spawn and a local socket that keeps
// messages apart. Promises: see HookQueue.h.
#include "programs/common/HookQueue.h"

#include <sys/socket.h>
#include <sys/wait.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "ground/Directory.h"
#include "ground/Spawn.h"
#include "ground/SysLog.h"

namespace tavo {

namespace {

constexpr char kRunner[] = "/usr/tavo/bin/tavohook";
constexpr int kQueueBytes = 32768;  // what waits for a slow hook is bounded

// The system's word for it; 0: pid is the runner.
int StartRunner(int fdFacts, pid_t& pid) {
    char szName[] = "tavohook";
    char szFollow[] = "--follow";
    char* const rgszArguments[] = {szName, szFollow, nullptr};
    char* const rgszEnvironment[] = {nullptr};
    return SpawnSetup(fdFacts, true).Spawn(pid, kRunner, rgszArguments, rgszEnvironment);
}

}  // namespace

HookQueue::~HookQueue() {
    mFdFacts.Reset();  // the runner ends with what it has
}

bool HookQueue::Start() {
    int rgFd[2];
    if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, rgFd) != 0) {
        return false;
    }
    mFdFacts.Reset(rgFd[0]);
    const Descriptor fdRunner(rgFd[1]);
    setsockopt(mFdFacts.Get(), SOL_SOCKET, SO_SNDBUF, &kQueueBytes, sizeof(kQueueBytes));
    const int nErrno = StartRunner(fdRunner.Get(), mPid);
    if (nErrno != 0) {
        mPid = -1;
        mFdFacts.Reset();
        SysLog(LOG_ERR, "cannot run %s: %s", kRunner, std::strerror(nErrno));
    }
    return nErrno == 0;
}

bool HookQueue::Send(const std::string& szFacts) {
    return mFdFacts.Get() >= 0 &&
           send(mFdFacts.Get(), szFacts.data(), szFacts.size(), MSG_DONTWAIT | MSG_NOSIGNAL) >= 0;
}

void HookQueue::Run(const std::vector<std::string>& rgFacts) {
    if (mPid > 0 && waitpid(mPid, nullptr, WNOHANG) == mPid) {
        mPid = -1;
        mFdFacts.Reset();
    }
    if (mPid < 0 && NamesIn(kHookDirectory).value_or(std::vector<std::string>()).empty()) {
        return;
    }
    std::string szFacts;
    for (const std::string& szFact : rgFacts) {
        szFacts += szFact + '\0';
    }
    if (szFacts.size() > kMaxHookFacts || (mPid < 0 && !Start()) || !Send(szFacts)) {
        SysLog(LOG_WARNING, "a notice was not passed on to the hooks in %s", kHookDirectory);
    }
}

}  // namespace tavo
