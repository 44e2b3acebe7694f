// When a gateway's "seconds since start" says that it has lost its mappings.
#include <gtest/gtest.h>

#include "programs/natpmpd/EpochWatch.h"

namespace {

TEST(EpochWatch, AnEighthSlowOrTwoSecondsOffIsNoRestart) {
    struct Case {
        uint32_t nBefore;
        int64_t nElapsed;
        uint32_t nNow;
        bool blRestart;
    };
    const Case rgCases[] = {{1000, 80, 1080, false}, {1000, 80, 1070, false},   {1000, 80, 1068, false},
                            {1000, 80, 1067, true},  {1000, 0, 999, false},     {1000, 0, 998, true},
                            {1000, 80, 9000, false}, {1000, 800, 60, true},     {0, 80, 0, true},
                            {0, 1, 0, false},        {UINT32_MAX, 80, 5, true}, {UINT32_MAX, 0, UINT32_MAX, false}};
    const auto start = tavo::BootClock::now();
    for (const Case& one : rgCases) {
        tavo::EpochWatch watch;
        watch.Note(one.nBefore, start);
        EXPECT_FALSE(watch.TakeRestart()) << "the first answer tells nothing";
        const auto now = start + std::chrono::seconds(one.nElapsed);
        EXPECT_EQ(watch.IsRestart(one.nNow, now), one.blRestart)
            << one.nBefore << " " << one.nElapsed << " " << one.nNow;
        watch.Note(one.nNow, now);
        watch.Note(one.nNow, now);
        EXPECT_EQ(watch.TakeRestart(), one.blRestart) << "and is not forgotten before it is asked for";
        EXPECT_FALSE(watch.TakeRestart());
    }
}

}  // namespace
