// A daemon's signals: one that comes between two looks at the queue ends the wait that follows; and what the frame of a
// daemon makes of them, with passes that the test plays.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <chrono>

#include "programs/common/Daemon.h"
#include "programs/common/SignalQueue.h"
#include "world.h"

namespace {

TEST(SignalQueue, WhatAQuestionTookInEndsTheNextWaitAndNoFurtherOne) {
    constexpr int kLongMilliseconds = 20000;
    using Question = bool (tavo::SignalQueue::*)();
    struct Case {
        int nSignal;
        Question pfnAsked;  // takes the signal in, and is about another one
        Question pfnToldAfter;
    };
    const Case rgCases[] = {{SIGTERM, &tavo::SignalQueue::HasRequest, &tavo::SignalQueue::IsStop},
                            {SIGUSR1, &tavo::SignalQueue::TakeRequest, &tavo::SignalQueue::IsHandOver},
                            {SIGHUP, &tavo::SignalQueue::IsStop, &tavo::SignalQueue::TakeRequest}};
    sigset_t before;
    sigprocmask(SIG_BLOCK, nullptr, &before);
    for (const Case& one : rgCases) {
        tavo::SignalQueue queue;
        raise(one.nSignal);
        EXPECT_FALSE((queue.*one.pfnAsked)());
        const auto start = std::chrono::steady_clock::now();
        queue.Wait(kLongMilliseconds);
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(kLongMilliseconds / 2));
        EXPECT_TRUE((queue.*one.pfnToldAfter)());
        queue.Wait(0);
        pollfd waiting = queue.Waiting();
        queue.Wait({&waiting, 1}, 1);
        EXPECT_EQ(waiting.revents, 0) << "a signal that is known is no news";
    }
    sigprocmask(SIG_SETMASK, &before, nullptr);
    signal(SIGPIPE, SIG_DFL);
}

constexpr tavo::DaemonNames kNames = {"played", "UPnP", "k", "/run/played.pid", "/run/played.lock", "/tmp/played.out"};
constexpr char kMarker[] = "/tmp/pfProgress";

// Tells its story in a file: each pass as "request" or "clock", "cut" or "whole", and the marker that it leaves.
class PlayedMapper : public tavo::Mapper {
public:
    using OnPass = std::function<void(int)>;
    explicit PlayedMapper(OnPass fnOnPass) : mFnOnPass(std::move(fnOnPass)) {}
    const tavo::DaemonNames& Names() const override { return kNames; }
    int Run(bool blRequested, const std::function<bool()>& fnStop) override {
        mFnOnPass(++mNPasses);
        Tell(std::string(blRequested ? "request" : "clock") + (fnStop() ? " cut" : " whole"));
        if (mNPasses > 30) {
            raise(SIGTERM);
        }
        return mNSeconds;
    }
    bool IsSwitchedOn() const override { return true; }
    bool Withdraw(const std::function<bool()>&) override {
        Tell("withdraw");
        return true;
    }
    std::vector<int> WakeFds() const override { return {}; }
    bool OnWake() override { return false; }
    bool OnNetworkChange() override { return false; }
    static void Tell(const std::string& szLine) { std::ofstream(kNames.szResultFile, std::ios::app) << szLine << "\n"; }
    int mNSeconds = 1;

private:
    OnPass mFnOnPass;
    int mNPasses = 0;
};

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
         "clean\nrequest cut\nmarked\nrequest whole\nclean\nclock cut\nwithdraw\n"}};
    for (const auto& [szWhat, fnOnPass, szStory] : rgCases) {
        std::filesystem::remove(kNames.szResultFile);
        const pid_t pid = fork();
        if (pid == 0) {
            gNClockJumped = 0;
            PlayedMapper mapper(fnOnPass);
            char szName[] = "played";
            char szOption[] = "--foreground";
            char* rgszArguments[] = {szName, szOption, nullptr};
            _exit(DaemonMain(2, rgszArguments, mapper));
        }
        int nStatus = -1;
        EXPECT_EQ(waitpid(pid, &nStatus, 0), pid);
        EXPECT_EQ(nStatus, 0) << szWhat;
        EXPECT_EQ(Read(kNames.szResultFile), szStory) << szWhat;
        EXPECT_FALSE(std::filesystem::exists(kNames.szPidFile) || std::filesystem::exists(kMarker)) << szWhat;
    }
}

}  // namespace
