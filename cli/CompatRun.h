// One run of the compatibility test and the record of its outcome. Relies on the library's test. Promises: a stopped
// test leaves no mapping and no record.
#pragma once

#include <string>

#include "Answer.h"
#include "libtavoportmap.h"

namespace tavo::cli {

using TestResult = __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT;

inline constexpr int kUsualTestRules = 60;

struct TestRun {
    TestResult result = {};
    int nResult = -1;  // 0: passed; 1: failed; below: it could not run
    int nLast = 0;     // the step that was begun last, by its percentage

    bool HasPassed() const { return nResult == 0; }
    // What a failure of the last step means, in words and for scripts.
    std::string FailedWords() const;
    std::string FailedName() const;
};

// Runs a test; the caller holds the router lock and has seen that none runs already.
TestRun RunTest(int nRules, bool blJson);

// A test that could not run.
Reply NotRun(const TestRun& run);
// What the user can do about a test that failed: the files it left, and a report where one can be sent.
std::string AfterFailure();

// What recording the outcome would change.
std::string RecordEffect(const TestRun& run);
// Records it: a message when that failed, or nothing. The file holds one record, the last one.
std::string RecordTest(const TestRun& run);

}  // namespace tavo::cli
