// A compatibility test that runs: who may end it and how. Relies on the library's stop. Promises: a signal that
// asks this program to end ends the test first, wherever it stands.
#pragma once

#include <functional>
#include <thread>

#include "Answer.h"

namespace tavo::cli {

// A test, of any process, has mappings on the router now.
bool IsTesting();
// What whoever would start another one is told: a refused start ends the test that runs.
Reply AlreadyTesting();
// Ends it and waits until it has taken its mappings away; false when it still does so after some seconds.
bool StopTest();
// What became of a stopped test.
Reply Stopped(bool blEnded);

// While it lives, SIGINT, SIGTERM and SIGHUP stop the test, show what became of it and end the program; a
// second SIGINT ends the program at once.
class StopOnSignal {
public:
    // fnPark is called before the test is stopped; what it locks keeps the program from going on.
    StopOnSignal(bool blJson, std::function<void()> fnPark);
    ~StopOnSignal();
    StopOnSignal(const StopOnSignal&) = delete;
    StopOnSignal& operator=(const StopOnSignal&) = delete;

private:
    void Watch(int fd) const;

    bool mBlJson;
    std::function<void()> mFnPark;
    std::thread mThread;
};

}  // namespace tavo::cli
