// A compatibility test that runs: who may end it and how. Relies on the library's stop. Promises: a signal that
// asks this program to end ends the test first, wherever it stands.
#pragma once

#include <functional>

#include "Answer.h"
#include "OnSignal.h"

namespace tavo::cli {

// A test, of any process, has mappings on the router now.
bool IsTesting();
// What whoever would start another one is told: a refused start ends the test that runs.
Reply AlreadyTesting();
// Ends it and waits until it has taken its mappings away; false when it still does so after some seconds.
bool StopTest();
// What became of a stopped test.
Reply Stopped(bool blEnded);

// While it lives, a signal that asks this program to end stops the test, shows what became of it and ends the program.
class StopOnSignal : private OnSignal {
public:
    // fnPark is called before the test is stopped; what it locks keeps the program from going on.
    StopOnSignal(bool blJson, std::function<void()> fnPark);
};

}  // namespace tavo::cli
