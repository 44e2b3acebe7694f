// A daemon's signals: one that comes between two looks at the queue ends the wait that follows.
#include <gtest/gtest.h>

#include <chrono>

#include "programs/common/SignalQueue.h"

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

}  // namespace
