// The test mode of upnpd. Relies on Linux descriptors for signals and orders. Promises: see TestDaemon.h.
#include "programs/upnpd/TestDaemon.h"

#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <syslog.h>

#include <algorithm>
#include <chrono>
#include <cstdio>

#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "programs/common/RuleFile.h"
#include "programs/common/Watch.h"
#include "tavo/core.h"
#include "tavo/log.h"
#include "tavo/upnptest.h"
#include "wire/upnp/GatewayMemory.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

constexpr char kLockFile[] = "/var/run/upnpd_test.lock";
constexpr mode_t kResultMode = 0644;
constexpr char kRunKey[] = "runupnpportmapping";
constexpr int kDiscoveryMilliseconds = 8000;
constexpr auto kLockWait = std::chrono::seconds(5);     // another one may be about to end
constexpr auto kIdleLimit = std::chrono::seconds(180);  // longer than any test of ports between two orders
constexpr auto kRemoveLimit = std::chrono::seconds(30);
// After a signal: a request under way is left within a second, and a router that is silent gets two more.
constexpr int kHastyCallMilliseconds = 700;
constexpr auto kHastyLimit = std::chrono::seconds(10);  // for a router that answers
constexpr size_t kOrderSize = 16;
constexpr size_t kMostOrders = 16;
constexpr int kBacklog = 4;

std::function<bool()> Until(Clock::time_point end) {
    return [end] { return Clock::now() > end; };
}

void Log(const std::string& szText) {
    TAVOWriteLog(szText.c_str(), 1, 1);
}

// A progress file that was taken away belongs to a test that is over: it is not made anew.
void Report(const char* szStep, const char* szWord) {
    if (TLIBCFileExist(kTestProgress) == 1 && TAVOUpnpReportTestProgress(szStep, szWord, 0) != 0) {
        SysLog(LOG_ERR, "cannot report %s of %s", szWord, szStep);
    }
}

}  // namespace

bool TestDaemon::TakeLock() {
    mLock = FileLock(kLockFile);
    const auto fnLate = Until(Clock::now() + kLockWait);
    return mLock.Wait([&] { return !fnLate() && !IsSignalled(); });
}

bool TestDaemon::OpenSocket() {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof(address.sun_path), "%s", kTestSocket);
    unlink(kTestSocket);  // of one that was killed; whoever lives has the lock
    mFdOrders.Reset(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const mode_t nMask = umask(077);
    const bool blBound = mFdOrders.Get() >= 0 &&
                         bind(mFdOrders.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0;
    umask(nMask);
    return blBound;
}

bool TestDaemon::FindRouter() {
    std::string szBox;
    mPIgd = FindGatewayIgd(kDiscoveryMilliseconds, 0, &szBox, [this] { return IsSignalled(); });
    if (mPIgd == nullptr) {
        if (!IsSignalled()) {
            Log("no router with UPnP port mapping was found");
            WriteFileAtomic(kUpnpResults, "upnp=noigd\n", kResultMode);
        }
        return false;
    }
    mPRouter = std::make_unique<IgdRouter>(*mPIgd);
    for (const RouterMapping& wanted : ReadWanted(kRunKey).rgMappings) {
        mSetRulePorts.insert({wanted.nRouterPort, wanted.nBoxPort});
    }
    mPMappings = std::make_unique<TestMappings>(*mPRouter, szBox, LoadTestRules(),
                                                [this](uint16_t nPort) { return HoldPort(nPort); });
    return true;
}

// A port of the box that leads outside for a while is ours alone, so that nothing else is exposed. We listen
// there, and close what connects.
bool TestDaemon::HoldPort(uint16_t nPort) {
    if (mSetRulePorts.contains(nPort)) {
        return false;
    }
    Descriptor fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(nPort);
    if (fd.Get() < 0 || bind(fd.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0 ||
        listen(fd.Get(), kBacklog) != 0) {
        return false;
    }
    mRgFdPorts.push_back(std::move(fd));
    return true;
}

void TestDaemon::TakeOrders() {
    char szOrder[kOrderSize];
    ssize_t nRead = 0;
    while ((nRead = recv(mFdOrders.Get(), szOrder, sizeof(szOrder), 0)) > 0) {
        if (mRgszOrders.size() < kMostOrders) {
            mRgszOrders.emplace_back(szOrder, static_cast<size_t>(nRead));
        }
    }
}

bool TestDaemon::IsSignalled() {
    return mSignals.IsStop() || mSignals.HasRequest();
}

bool TestDaemon::IsEndOrdered() {
    TakeOrders();
    return std::find(mRgszOrders.begin(), mRgszOrders.end(), kOrderEnd) != mRgszOrders.end();
}

// Closes what has connected to a test port.
void TestDaemon::Answer() {
    for (const Descriptor& fdPort : mRgFdPorts) {
        while (Descriptor(accept4(fdPort.Get(), nullptr, nullptr, SOCK_CLOEXEC)).Get() >= 0) {
        }
    }
}

// The next order; empty when the time is up or a signal came.
std::string TestDaemon::NextOrder() {
    const auto end = Clock::now() + kIdleLimit;
    std::vector<pollfd> rgWaiting = {mSignals.Waiting(), {mFdOrders.Get(), POLLIN, 0}};
    for (const Descriptor& fdPort : mRgFdPorts) {
        rgWaiting.push_back({fdPort.Get(), POLLIN, 0});
    }
    while (!IsSignalled() && Clock::now() < end) {
        if (IsEndOrdered()) {
            return kOrderEnd;  // and stays in the queue, for End() to see
        }
        if (!mRgszOrders.empty()) {
            const std::string szOrder = mRgszOrders.front();
            mRgszOrders.erase(mRgszOrders.begin());
            return szOrder;
        }
        const auto nLeft = std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count() + 1;
        mSignals.Wait(rgWaiting, static_cast<int>(std::max<int64_t>(0, nLeft)));
        Answer();
    }
    return "";
}

// The results as upnpd writes those of rules, for a report of the test.
void TestDaemon::WriteResults() const {
    std::string szText;
    for (const TestRule& rule : mPMappings->Rules()) {
        szText += std::to_string(rule.nRouterPort) + "/tcp=" + rule.szResult + "\n";
    }
    if (!SaveTestRules(mPMappings->Rules()) || !WriteFileAtomic(kUpnpResults, szText, kResultMode)) {
        SysLog(LOG_ERR, "cannot write the results of the test");
    }
}

// Does one step. False: it failed, and so has the test; End() says so.
bool TestDaemon::Work(const char* szStep, bool (TestMappings::*pfnStep)(const std::function<bool()>&)) {
    const auto fnStop = [this] { return IsSignalled() || IsEndOrdered(); };
    mPIgd->SetStop(fnStop);
    const bool blDone = ((*mPMappings).*pfnStep)(fnStop);
    if (fnStop()) {
        return false;
    }
    WriteResults();
    Log(std::string(szStep) + (blDone ? " is done" : " failed"));
    if (blDone) {
        Report(szStep, kWordFinished);
    }
    return blDone;
}

// False: the test is over.
bool TestDaemon::Obey(const std::string& szOrder) {
    if (szOrder == kOrderDelete) {
        return Work(kStepDelete, &TestMappings::Remove);
    }
    if (szOrder == kOrderModify) {
        Report(kStepChange, kWordProcessing);
        return Work(kStepReadd, &TestMappings::Readd) && Work(kStepChange, &TestMappings::Change);
    }
    return false;
}

// Takes every test mapping away. False when some may be left.
bool TestDaemon::Withdraw() {
    if (!IsSignalled()) {
        const auto end = Clock::now() + kRemoveLimit;
        const auto fnStop = [&] { return IsSignalled() || Clock::now() > end; };
        mPIgd->SetStop(fnStop);
        const bool blGone = mPMappings->Remove(fnStop) && mPMappings->CleanUp(fnStop);
        if (blGone || !IsSignalled()) {
            return blGone;
        }
    }
    const auto fnLate = Until(Clock::now() + kHastyLimit);
    mPIgd->SetCallLimit(kHastyCallMilliseconds);
    mPIgd->SetStop(fnLate);
    return mPMappings->Remove(fnLate) && mPMappings->CleanUp(fnLate);
}

// The word on what was under way comes last: who reads it finds the router as it was before.
void TestDaemon::End() {
    const bool blGone = mPMappings == nullptr || Withdraw();
    if (!blGone) {
        SysLog(LOG_ERR, "the router did not take all test mappings away; the next test tries it again");
    }
    RemoveTestRules();
    unlink(kTestSocket);
    for (const char* szStep : {kStepAdd, kStepDelete, kStepReadd, kStepChange}) {
        if (IsStepUnderWay(szStep)) {
            Report(szStep, kWordFailed);
        }
    }
    if (IsStepUnderWay(kStepTerminal)) {
        Report(kStepTerminal, blGone ? kWordFinished : kWordFailed);
    }
}

// From the first step to the last order. False: a step failed.
bool TestDaemon::LeadToEnd() {
    if (!OpenSocket() || !FindRouter() || !Work(kStepAdd, &TestMappings::Add)) {
        return false;
    }
    std::string szOrder = NextOrder();
    while (Obey(szOrder)) {
        szOrder = NextOrder();
    }
    return szOrder.empty() || szOrder == kOrderEnd;
}

int TestDaemon::RunTest() {
    rlimit limit = {};
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;  // one for each port that is held
        setrlimit(RLIMIT_NOFILE, &limit);
    }
    if (!TakeLock()) {
        SysLog(LOG_ERR, "another test is running (lock %s)", kLockFile);
        Report(kStepAdd, kWordFailed);
        return 1;
    }
    const bool blDone = LeadToEnd();
    End();
    return blDone ? 0 : 1;
}

// Waits for the process that tests, and ends in its place what it could not end.
int TestDaemon::WatchOver(pid_t pid) {
    const int nStatus = WaitForChild(pid, mSignals, [this, pid] {
        if (IsSignalled()) {
            kill(pid, SIGTERM);
        }
    });
    if (nStatus >= 0 && WIFEXITED(nStatus)) {
        return WEXITSTATUS(nStatus);
    }
    SysLog(LOG_ERR, "the test was killed; its mappings are taken away");
    if (TakeLock() && FindRouter()) {
        End();
    }
    return 1;
}

int TestDaemon::Run() {
    openlog("upnpd", LOG_PID, LOG_DAEMON);
    const pid_t pidWatch = getpid();
    const pid_t pid = fork();
    if (pid > 0) {
        return WatchOver(pid);
    }
    prctl(PR_SET_PDEATHSIG, pid == 0 ? SIGTERM : 0);
    if (pid == 0 && getppid() != pidWatch) {
        return 1;
    }
    return RunTest();
}

}  // namespace tavo
