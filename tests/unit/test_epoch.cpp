// When a gateway's "seconds since start" says that it has lost its mappings, and the clock that this is held against.
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>

#include "programs/natpmpd/EpochWatch.h"

namespace {

TEST(EpochWatch, AnEighthSlowOrTwoSecondsOffIsNoRestart) {
    const std::tuple<uint32_t, int64_t, uint32_t, bool> rgCases[] = {
        {1000, 80, 1080, false}, {1000, 80, 1070, false},   {1000, 80, 1068, false},
        {1000, 80, 1067, true},  {1000, 0, 999, false},     {1000, 0, 998, true},
        {1000, 80, 9000, false}, {1000, 800, 60, true},     {0, 80, 0, true},
        {0, 1, 0, false},        {UINT32_MAX, 80, 5, true}, {UINT32_MAX, 0, UINT32_MAX, false}};
    const auto start = tavo::BootClock::now();
    for (const auto& [nBefore, nElapsed, nNow, blRestart] : rgCases) {
        tavo::EpochWatch watch;
        watch.Note(nBefore, start);
        EXPECT_FALSE(watch.TakeRestart()) << "the first answer tells nothing";
        const auto now = start + std::chrono::seconds(nElapsed);
        EXPECT_EQ(watch.IsRestart(nNow, now), blRestart) << nBefore << " " << nElapsed << " " << nNow;
        watch.Note(nNow, now);
        watch.Note(nNow, now);
        EXPECT_EQ(watch.TakeRestart(), blRestart) << "and is not forgotten before it is asked for";
        EXPECT_FALSE(watch.TakeRestart());
    }
}

// A box that sleeps does not run, and its router's leases do. Here it slept two hours, as a namespace of times has it.
TEST(BootClock, GoesOnWhileTheBoxSleeps) {
    enum : int { kCounts = 1, kDoesNot, kNoNamespaces, kBroken };
    const pid_t pid = fork();
    if (pid == 0) {
        const int64_t nBefore = tavo::BootSeconds();
        if (unshare(CLONE_NEWTIME) != 0) {
            _exit(errno == EINVAL ? kNoNamespaces : kBroken);
        }
        if (!(std::ofstream("/proc/self/timens_offsets") << "boottime 7200 0" << std::flush)) {
            _exit(kBroken);
        }
        if (fork() == 0) {  // the one that has its times
            _exit(tavo::BootSeconds() - nBefore >= 7200 ? kCounts : kDoesNot);
        }
        int nStatus = 0;
        wait(&nStatus);
        _exit(WEXITSTATUS(nStatus));
    }
    int nStatus = 0;
    ASSERT_EQ(waitpid(pid, &nStatus, 0), pid);
    if (WEXITSTATUS(nStatus) == kNoNamespaces) {
        GTEST_SKIP() << "this kernel has no namespaces of times: whether the clock goes on in a sleep is not looked at";
    }
    EXPECT_EQ(WEXITSTATUS(nStatus), kCounts);
}

}  // namespace
