// Progress of a long operation, on standard error: one line redrawn on a terminal, else a line a step.
// Relies on Answer.h. Promises: never steps back, never leaves the cursor behind a half-drawn bar, and
// holds no text back in a buffer between two calls.
#pragma once

#include <span>
#include <string>

namespace tavo::cli {

// One step of an operation that reports percentages.
struct Step {
    int nPercent;
    const char* szDoing;
    const char* szFailed;     // what a failure of it means
    const char* szName = "";  // for scripts
};

// The step that begins at this percentage; the first one where none does.
const Step& StepAt(std::span<const Step> rgSteps, int nPercent);

class Progress {
public:
    explicit Progress(bool blQuiet);
    ~Progress();
    Progress(const Progress&) = delete;
    Progress& operator=(const Progress&) = delete;

    // What is being done now; a smaller percent than before shows the new step at the old length.
    void Show(int nPercent, const std::string& szStep);
    // Ends the line; Show may begin another.
    void End();

private:
    bool mBlQuiet;
    bool mBlTerminal;
    bool mBlOpen = false;
    int mNPercent = 0;
    std::string mSzStep;
};

}  // namespace tavo::cli
