// A daemon's signals: one that comes between two looks at the queue ends the wait that follows; and what the frame of a
// daemon makes of them, with passes that the test plays.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <memory>

#include "ground/BootClock.h"
#include "programs/common/Daemon.h"
#include "programs/common/Instance.h"
#include "programs/common/SignalQueue.h"
#include "programs/common/Watch.h"
#include "programs/natpmpd/NatpmpMapper.h"
#include "programs/upnpd/UpnpMapper.h"
#include "tavo/core.h"
#include "world.h"

extern "C" void __gcov_dump() __attribute__((weak));  // there where coverage is measured

namespace {

TEST(SignalQueue, WhatAQuestionTookInEndsTheNextWaitAndNoFurtherOne) {
    constexpr int kLongMilliseconds = 20000;
    using Question = bool (tavo::SignalQueue::*)();
    // The first question takes the signal in, and is about another one.
    const std::tuple<int, Question, Question> rgCases[] = {
        {SIGTERM, &tavo::SignalQueue::HasRequest, &tavo::SignalQueue::IsStop},
        {SIGUSR1, &tavo::SignalQueue::TakeRequest, &tavo::SignalQueue::IsHandOver},
        {SIGHUP, &tavo::SignalQueue::IsStop, &tavo::SignalQueue::TakeRequest}};
    sigset_t before;
    sigprocmask(SIG_BLOCK, nullptr, &before);
    for (const auto& [nSignal, pfnAsked, pfnToldAfter] : rgCases) {
        tavo::SignalQueue queue;
        raise(nSignal);
        EXPECT_FALSE((queue.*pfnAsked)());
        const auto start = std::chrono::steady_clock::now();
        queue.Wait(kLongMilliseconds);
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(kLongMilliseconds / 2));
        EXPECT_TRUE((queue.*pfnToldAfter)());
        queue.Wait(0);
        pollfd waiting = queue.Waiting();
        queue.Wait({&waiting, 1}, 1);
        EXPECT_EQ(waiting.revents, 0) << "a signal that is known is no news";
    }
    sigprocmask(SIG_SETMASK, &before, nullptr);
    signal(SIGPIPE, SIG_DFL);
}

constexpr tavo::DaemonNames kNames = {
    "played", "UPnP", "k", "/run/played.pid", "/run/played.lock", "/tmp/played.out", "/var/lib/tavo/playe_made.conf"};
constexpr char kMarker[] = "/tmp/pfProgress";
constexpr char kMade[] = "[1]\ngateway=\"192.168.1.1\"\nprotocol=\"TCP\"\nrouter_port=\"80\"\nbox_port=\"80\"\n";
constexpr char kElsewhere[] = "[1]\ngateway=\"10.0.0.1\"\nprotocol=\"TCP\"\nrouter_port=\"80\"\nbox_port=\"80\"\n";

// Tells its story in a file: each pass as "request" or "clock", "cut" or "whole", and the marker that it leaves.
class PlayedMapper : public tavo::Mapper {
public:
    using OnPass = std::function<void(int)>;
    explicit PlayedMapper(OnPass fnOnPass) : mFnOnPass(std::move(fnOnPass)) {}
    int Run(bool blRequested, const std::function<bool()>& fnStop) override {
        mFnOnPass(++mNPasses);
        Tell(std::string(blRequested ? "request" : "clock") + (fnStop() ? " cut" : " whole"));
        if (mNPasses > 30) {
            raise(SIGTERM);
        }
        return mNSeconds;
    }
    bool IsSwitchedOn() const override { return true; }
    bool Withdraw(const std::function<bool()>& fnStop) override {
        Tell("withdraw");
        while (mBlSlow && !fnStop()) {
        }
        if (!mBlSlow) {
            std::filesystem::remove(kNames.szMadeFile);
        }
        return !mBlSlow;
    }
    std::vector<int> WakeFds() const override { return {mFdWord}; }
    bool OnWake() override {
        char cWord = 0;
        return read(mFdWord, &cWord, 1) == 1 && cWord == 'y';
    }
    bool OnNetworkChange() override { return true; }
    static void Tell(const std::string& szLine) { std::ofstream(kNames.szResultFile, std::ios::app) << szLine << "\n"; }
    int mNSeconds = 1;
    bool mBlSlow = false;  // the router does not let its mappings go
    int mFdWord = -1;

private:
    OnPass mFnOnPass;
    int mNPasses = 0;
};

// In a process of its own; its exit status.
int InChild(const std::function<int()>& fnRun) {
    fflush(stdout);
    const pid_t pid = fork();
    if (pid == 0) {
        gNClockJumped = 0;
        const int nExit = fnRun();
        if (__gcov_dump != nullptr) {
            __gcov_dump();
        }
        _exit(nExit);
    }
    int nStatus = -1;
    EXPECT_EQ(waitpid(pid, &nStatus, 0), pid);
    return WIFEXITED(nStatus) ? WEXITSTATUS(nStatus) : -1;
}

int RunPlayed(const PlayedMapper& mapper, std::string szOption = "--foreground", std::string szSecond = "") {
    char szName[] = "played";
    char* rgszArguments[] = {szName, szOption.data(), szSecond.data(), nullptr};
    return tavo::DaemonMain(szOption.empty()   ? 1
                            : szSecond.empty() ? 2
                                               : 3,
                            rgszArguments, kNames, [&] { return std::make_unique<PlayedMapper>(mapper); });
}

// Each look at the clock takes a second, so that the limits go by faster; tells what it took, a long time
// without the looks besides, and its last word.
int RunFast(const PlayedMapper& mapper, const std::string& szOption, const std::string& szSecond = "") {
    const auto start = tavo::BootClock::now();
    gLog = {""};
    gNClockStep = 1;
    const int nExit = RunPlayed(mapper, szOption, szSecond);
    gNClockStep = 0;
    const auto nTook = (tavo::BootClock::now() - start) / std::chrono::seconds(1);
    PlayedMapper::Tell(std::to_string(nTook < 60 ? nTook : nTook / 10 * 10) + " s " + gLog.back());
    return nExit;
}

TEST(Daemon, PassesFollowTheirSignals) {
    const auto fnEndAfter = [](int nPass, int nPasses, int nSignal) {
        if (nPass == nPasses) {
            raise(nSignal);
        }
    };
    const std::tuple<const char*, PlayedMapper::OnPass, std::string> rgCases[] = {
        {"requests without end starve no pass",
         [&](int nPass) {
             raise(SIGHUP);
             fnEndAfter(nPass, 9, SIGTERM);
         },
         "request cut\nrequest cut\nrequest cut\nrequest whole\nrequest cut\nrequest cut\nrequest cut\nrequest whole\n"
         "request cut\nwithdraw\n"},
        {"a request in a pass makes the next one, and then the clock",
         [&](int nPass) {
             fnEndAfter(nPass, 1, SIGHUP);
             fnEndAfter(nPass, 3, SIGTERM);
         },
         "request cut\nrequest whole\nclock cut\nwithdraw\n"},
        {"a hand-over leaves what was made", [&](int nPass) { fnEndAfter(nPass, 1, SIGUSR1); }, "request cut\n"},
        {"a marker of a request that came in a pass stands until that one is served",
         [&](int nPass) {
             PlayedMapper::Tell(std::filesystem::exists(kMarker) ? "marked" : "clean");
             if (nPass == 1) {
                 Write(kMarker, "");
                 raise(SIGHUP);
             }
             fnEndAfter(nPass, 3, SIGTERM);
         },
         "clean\nrequest cut\nmarked\nrequest whole\nclean\nclock cut\nwithdraw\n"},
        {"a marker of a start that comes while nothing is to be done goes at once",
         [&](int nPass) {
             const std::string szRest = "kill -TERM " + std::to_string(getpid()) + ") &";
             fnEndAfter(nPass, 2, SIGTERM);
             TLIBCSystem(
                 ("(sleep .2; touch /tmp/pfProgress; sleep .3; ls /tmp/pfProgress >> /tmp/played.out 2>&-; " + szRest)
                     .c_str());
         },
         "request whole\nwithdraw\n"}};
    for (const auto& [szWhat, fnOnPass, szStory] : rgCases) {
        std::filesystem::remove(kNames.szResultFile);
        EXPECT_EQ(InChild([&fnOnPass = fnOnPass, &szStory = szStory] {
                      PlayedMapper mapper(fnOnPass);
                      mapper.mNSeconds = szStory == "request whole\nwithdraw\n" ? 60 : 1;
                      return RunPlayed(mapper);
                  }),
                  0)
            << szWhat;
        EXPECT_EQ(Read(kNames.szResultFile), szStory) << szWhat;
        EXPECT_FALSE(std::filesystem::exists(kNames.szPidFile) || std::filesystem::exists(kMarker)) << szWhat;
    }
}

// A process that has the lock until some time after SIGTERM, and leaves whatever is on record.
pid_t HoldUntilTold(int nMilliseconds) {
    const pid_t pid = fork();
    if (pid == 0) {
        const tavo::SignalQueue queue;
        tavo::Instance instance(kNames.szLockFile);
        pollfd told = queue.Waiting();
        poll(&told, instance.Take() ? 1 : 0, 20000);
        usleep(static_cast<useconds_t>(nMilliseconds) * 1000);
        _exit(0);
    }
    for (int i = 0; i < 1000 && tavo::Instance(kNames.szLockFile).Holder() != pid; ++i) {
        usleep(2000);
    }
    return pid;
}

TEST(Daemon, SaysByItsExitStatusWhatBecameOfAnOption) {
    struct Case {
        const char* szOption;
        int nExit;
        const char* szStory = "";
        bool blHeld = false;  // by somebody who does not end
        const char* szMade = "";
        bool blSlow = false;
        const char* szSecond = "";
        bool blTerm = false;  // else what runs is told to hand over
        int nEnds = 0;        // one is there that ends so many milliseconds after it was told to
    };
    constexpr int kSoon = 1;
    constexpr int kLate = 500;  // as looks go by, it has waited for a silent router
    const char* szStays = "70 s played that runs does not end (lock /run/played.lock)\n";
    const char* szKept = "withdraw\n60 s router could not be asked to take the mappings away; it may keep them\n";
    const char* szEndedAndKept =
        "request cut\nwithdraw\n60 s router could not be asked to take the mappings away; it may keep them\n";
    const char* szTaken = "0 s played is running (lock /run/played.lock)\n";
    const Case rgCases[] = {
        {"--help", 0},
        {"--hepl", 2},
        {.szOption = "--help", .nExit = 2, .szSecond = "--stop"},
        {.szOption = "--foreground", .nExit = 2, .szSecond = "--stop"},
        {"--make-locks", 0},
        {"--hand-over", 0},
        {"--hand-over", 1, szStays, true},
        {"--foreground", 1, szTaken, true},
        {.szOption = "--foreground", .nExit = 1, .szStory = szStays, .blHeld = true, .szSecond = "--take-over"},
        {.szOption = "--foreground", .nExit = 0, .szStory = "request cut\n", .szSecond = "--take-over"},
        {"", 1, szTaken, true},
        {"--stop", 0, "withdraw\n", false, kMade},
        {"--stop", 0},
        {"--stop", 0, "", false, kElsewhere},
        {"--stop", 1, szStays, true, kMade},
        {"--stop", 1, szKept, false, kMade, true},
        {.szOption = "--stop", .nExit = 0, .szStory = "withdraw\n", .szMade = kMade, .nEnds = kSoon},
        {.szOption = "--stop", .nExit = 0, .szMade = kElsewhere, .nEnds = kSoon},
        {.szOption = "--stop", .nExit = 1, .szMade = kMade, .nEnds = kLate},
        {.szOption = "--foreground",
         .nExit = 3,
         .szStory = szEndedAndKept,
         .szMade = kMade,
         .blSlow = true,
         .blTerm = true},
        {.szOption = "--foreground",
         .nExit = 0,
         .szStory = "request cut\nwithdraw\n60 s begins\n",
         .blSlow = true,
         .blTerm = true}};
    std::filesystem::create_directories("/tmp/t");
    for (const Case& one : rgCases) {
        std::filesystem::remove(kNames.szResultFile);
        const pid_t pidEnds = one.nEnds == 0 ? 0 : HoldUntilTold(one.nEnds);
        tavo::Instance holder(kNames.szLockFile);
        ASSERT_TRUE(!one.blHeld || holder.Take());
        Write(kNames.szMadeFile, one.szMade);
        Write(one.blHeld ? kNames.szLockFile : "/tmp/t/none", "x");  // it does not say who it is
        EXPECT_EQ(InChild([&] {
                      PlayedMapper mapper([&](int) { raise(one.blTerm ? SIGTERM : SIGUSR1); });
                      mapper.mBlSlow = one.blSlow;
                      gNClockStep = one.nEnds == kLate ? 1 : 0;
                      dup2(open("/tmp/t/said", O_WRONLY | O_CREAT | O_TRUNC, 0600), STDOUT_FILENO);
                      dup2(open("/dev/null", O_WRONLY), STDERR_FILENO);
                      const int nExit = one.blHeld || one.blSlow ? RunFast(mapper, one.szOption, one.szSecond)
                                                                 : RunPlayed(mapper, one.szOption, one.szSecond);
                      fflush(stdout);
                      return nExit;
                  }),
                  one.nExit)
            << one.szOption << one.szSecond << one.szMade << one.nEnds;
        EXPECT_TRUE(pidEnds == 0 || waitpid(pidEnds, nullptr, 0) == pidEnds);
        EXPECT_EQ(Read(kNames.szResultFile), one.szStory) << one.szOption;
        EXPECT_EQ(Read("/tmp/t/said").starts_with("Usage: played ["), &one == rgCases);
    }
    EXPECT_STREQ(tavo::kUpnpNames.szMadeFile, tavo::kUpnpMadeFile);
    EXPECT_STREQ(tavo::kNatpmpNames.szMadeFile, "/var/lib/tavo/natpmp_made.conf");
    signal(SIGHUP, SIG_IGN);
    tavo::Instance parent(tavo::Watch::LockFile(kNames.szName));
    ASSERT_TRUE(parent.Take());
    std::filesystem::remove(kNames.szResultFile);
    EXPECT_EQ(InChild([] { return RunFast(PlayedMapper([](int) {}), ""); }), 1) << "a parent that starts nobody";
    EXPECT_EQ(Read(kNames.szResultFile), "6 s \n");
    signal(SIGHUP, SIG_DFL);
}

// A word of the router, or a change of the box's own network, brings the next pass near, but not nearer than some
// seconds after the last such pass.
TEST(Daemon, NewsIsHeardSoonAndNotTooOften) {
    for (const bool blNetwork : {false, true}) {
        std::filesystem::remove(kNames.szResultFile);
        int rgFd[2];
        ASSERT_EQ(pipe2(rgFd, O_CLOEXEC | O_NONBLOCK), 0);
        const auto fnTell = [&](int nPass) {
            if (blNetwork) {
                TLIBCSystem(("/sbin/ip address add 127.9.9." + std::to_string(nPass) + "/32 dev lo").c_str());
            } else if (write(rgFd[1], "y", 1) != 1) {
                PlayedMapper::Tell("cannot tell");
            }
        };
        EXPECT_EQ(InChild([&] {
                      auto last = std::chrono::steady_clock::now();
                      PlayedMapper mapper([&](int nPass) {
                          const std::chrono::duration<double> pause = std::chrono::steady_clock::now() - last;
                          last += std::chrono::duration_cast<std::chrono::nanoseconds>(pause);
                          PlayedMapper::Tell(pause.count() < 0.9   ? "at once"
                                             : pause.count() < 1.9 ? "soon"
                                             : pause.count() < 4   ? "later"
                                             : pause.count() < 4.9 ? "?"
                                                                   : "much later");
                          fnTell(nPass);
                          if (nPass == 3) {
                              raise(SIGTERM);
                          }
                      });
                      mapper.mNSeconds = 60;
                      mapper.mFdWord = rgFd[0];
                      return RunPlayed(mapper);
                  }),
                  0);
        EXPECT_EQ(Read(kNames.szResultFile), "at once\nrequest whole\nsoon\nclock whole\n" +
                                                 std::string(blNetwork ? "" : "much ") +
                                                 "later\nclock cut\nwithdraw\n");
        close(rgFd[0]);
        close(rgFd[1]);
    }
}

TEST(Instance, APidCountsWhileItsProcessHoldsTheLock) {
    constexpr char kLock[] = "/run/played.other";
    EXPECT_EQ(tavo::Instance(kLock).Holder(), 0) << "no file";
    {
        tavo::Instance instance(kLock);
        ASSERT_TRUE(instance.Take());
        EXPECT_EQ(Read(kLock), std::to_string(getpid()) + "\n");
        EXPECT_FALSE(tavo::Instance(kLock).Take());
        for (const auto& [szText, pid] : {std::pair{"", -1}, {"x", -1}, {"0", -1}, {"1", -1}, {"-5", -1}, {"2", 2}}) {
            Write(kLock, szText);
            EXPECT_EQ(tavo::Instance(kLock).Holder(), pid) << szText;
        }
    }
    EXPECT_EQ(tavo::Instance(kLock).Holder(), 0) << "left over";
    std::filesystem::remove(kLock);
    std::filesystem::create_symlink("/tmp/victim", kLock);
    EXPECT_EQ(tavo::Instance(kLock).Holder(), -1);
    EXPECT_FALSE(tavo::Instance(kLock).Take());
    std::filesystem::remove(kLock);
}

// Ten crashes are too many within ten minutes, of which so many seconds go by between two looks at the clock.
TEST(Watch, ACrashIsFollowedByANewStartUnlessItIsTheTenth) {
    static constexpr char kStarts[] = "/tmp/t/starts";
    for (const auto& [szWhat, nStep, nSignal, nEnd, nExit, nStarts] :  // the signal comes at the second start
         {std::tuple{"too many", 16, 0, 99U, 1, 10U},
          {"not so many in the time", 17, 0, 12U, 7, 12U},
          {"an end is no crash", 16, 0, 1U, 7, 1U},
          {"stopped", 16, SIGTERM, 99U, 1, 2U},
          {"handed over", 16, SIGUSR1, 99U, 1, 2U}}) {
        std::filesystem::create_directories("/tmp/t");
        std::filesystem::remove(kStarts);
        const auto fnWork = [nSignal = nSignal, nEnd = nEnd] {
            std::ofstream(kStarts, std::ios::app) << "x";
            const auto nStart = std::filesystem::file_size(kStarts);
            if (nStart == nEnd) {
                return 7;
            }
            kill(getppid(), nStart == 2 ? nSignal : 0);
            usleep(20000);
            return raise(SIGKILL);
        };
        EXPECT_EQ(InChild([&, nStep = nStep] {
                      gLog = {""};
                      gNClockStep = nStep;
                      char szTitle[] = "played --and-more";
                      const int nAnswer = tavo::Watch("played", szTitle).Run(fnWork);
                      Write("/tmp/t/last", gLog.back());
                      return nAnswer;
                  }),
                  nExit)
            << szWhat;
        EXPECT_EQ(Read(kStarts).size(), nStarts) << szWhat;
        EXPECT_EQ(Read("/tmp/t/last"), nExit == 1  ? "is not started again"
                                       : nEnd == 1 ? ""
                                                   : "was ended by signal 9")
            << szWhat;
    }
}

}  // namespace
