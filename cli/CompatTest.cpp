// Ends compatibility tests. Relies on TLibStopTestUpnpCompatibility. Promises: see CompatTest.h.
#include "CompatTest.h"

#include <poll.h>

#include <chrono>
#include <utility>

#include "Box.h"

namespace tavo::cli {

namespace {

constexpr int kPollMilliseconds = 200;
constexpr auto kStopLimit = std::chrono::seconds(10);

}  // namespace

bool IsTesting() {
    auto enTask = TAVO_LIBTAVOPORTMAP_TASK_IDLE;
    return TLibGetLibTavoPortMapRunningTask(&enTask) == 0 && enTask == TAVO_LIBTAVOPORTMAP_TASK_TESTING;
}

bool StopTest() {
    const auto end = std::chrono::steady_clock::now() + kStopLimit;
    do {
        // Once more each time: a test that was about to begin has begun by then.
        TLibStopTestUpnpCompatibility();
        poll(nullptr, 0, kPollMilliseconds);
    } while (IsTesting() && std::chrono::steady_clock::now() < end);
    return !IsTesting();
}

Reply Stopped(bool blEnded) {
    return blEnded
               ? Reply{.szMessage =
                           "the test is stopped and nothing was recorded; its mappings are taken away, or will be by "
                           "the next test where the router has gone silent"}
               : Failure(
                     "the test was told to stop, but it still takes its mappings away from a slow router; "
                     "'tavoportmap status' shows when it has ended");
}

Reply AlreadyTesting() {
    return {.enExit = kBusy,
            .szMessage = "a compatibility test is running already; 'sudo tavoportmap compat --stop' would end it"};
}

StopOnSignal::StopOnSignal(bool blJson, std::function<void()> fnPark)
    : OnSignal([blJson, fnPark = std::move(fnPark)] {
          fnPark();
          Reply reply = Stopped(StopTest());
          reply.enExit = kFailed;
          Print(reply, blJson);
          return static_cast<int>(reply.enExit);
      }) {}

}  // namespace tavo::cli
