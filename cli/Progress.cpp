// Draws progress. Relies on the terminal's width and "erase to the end of the line". Promises: see Progress.h.
#include "Progress.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>

#include "Answer.h"
#include "Table.h"

namespace tavo::cli {

namespace {

constexpr int kBarCells = 20;

}  // namespace

const Step& StepAt(std::span<const Step> rgSteps, int nPercent) {
    const auto pStep = std::find_if(rgSteps.begin(), rgSteps.end(),
                                    [nPercent](const Step& step) { return step.nPercent == nPercent; });
    return pStep == rgSteps.end() ? rgSteps.front() : *pStep;
}

Progress::Progress(bool blQuiet) : mBlQuiet(blQuiet), mBlTerminal(IsSmartTerminal(STDERR_FILENO)) {}

Progress::~Progress() {
    End();
}

void Progress::Show(int nPercent, const std::string& szStep) {
    nPercent = std::clamp(nPercent, mNPercent, 100);
    if (mBlQuiet || (nPercent == mNPercent && szStep == mSzStep)) {
        return;
    }
    mNPercent = nPercent;
    mSzStep = szStep;
    if (mBlTerminal) {
        const int nDone = nPercent * kBarCells / 100;
        const std::string szLine =
            fmt::format("[{:#<{}}{:{}}] {:>3} %  {}", "", nDone, "", kBarCells - nDone, nPercent, szStep);
        // A line that wraps could not be redrawn.
        Tell("\r" + szLine.substr(0, WidthOf(STDERR_FILENO) - 1) + "\x1b[K");
        mBlOpen = true;
    } else {
        Tell(fmt::format("{:>3} %  {}\n", nPercent, szStep));
    }
}

void Progress::End() {
    if (mBlOpen) {
        Tell("\n");
        mBlOpen = false;
    }
}

}  // namespace tavo::cli
