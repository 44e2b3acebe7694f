// Runs the compatibility test and records it. Relies on TLibTestUpnpCompatibility and TLibWriteRecordIntoUpnpDB.
// Promises: see CompatRun.h.
#include "CompatRun.h"

#include <fmt/format.h>

#include <mutex>

#include "Box.h"
#include "CompatTest.h"
#include "Progress.h"
#include "Verdict.h"

namespace tavo::cli {

namespace {

// In the order in which they come; the percentages go back once, the bar does not.
constexpr Step kSteps[] = {
    {10, "preparing", "the test could not begin; the system log says why", "prepare"},
    {20, "looking for the router", "the router could not be asked; the system log says why", "find"},
    {30, "making test mappings on the router",
     "it did not take the test mappings (or the test daemon of this box did not start; the system log says which)",
     "add"},
    {60, "counting the mappings that the router really holds",
     "it holds none of the mappings that it said yes to, or does not show what it holds", "count"},
    {40, "taking the mappings away", "it did not take the mappings away when it was told to", "delete"},
    {50, "looking whether the ports are closed again", "ports of deleted mappings are still open", "closed"},
    {70, "making the mappings again, and changing them", "it did not take mappings a second time", "add again"},
    {80, "looking whether the ports are open", "ports of its mappings stay closed", "open"},
    {90, "taking everything away", "the last mappings could not be taken away", "end"},
    {100, "done", "", "done"},
};

struct Watch {
    Progress progress;
    std::mutex mutex = {};  // held for good by whoever stops the test
    int nLast = 0;          // the step that was begun last
};

void ShowStep(const TestResult* pResult, void* pData) {
    auto* pWatch = static_cast<Watch*>(pData);
    const std::lock_guard guard(pWatch->mutex);
    pWatch->nLast = pResult->nProgress < 100 ? pResult->nProgress : pWatch->nLast;
    pWatch->progress.Show(pResult->nProgress, StepAt(kSteps, pResult->nProgress).szDoing);
}

}  // namespace

std::string TestRun::FailedWords() const {
    return StepAt(kSteps, nLast).szFailed;
}

std::string TestRun::FailedName() const {
    return StepAt(kSteps, nLast).szName;
}

TestRun RunTest(int nRules, bool blJson) {
    TestRun run;
    Watch watch{Progress(blJson)};
    {
        const StopOnSignal stop(blJson, [&watch] {
            watch.mutex.lock();
            watch.progress.End();
        });
        run.nResult = TLibTestUpnpCompatibility(nRules, &run.result, &ShowStep, &watch, false);
    }
    watch.progress.End();
    run.nLast = watch.nLast;
    return run;
}

Reply NotRun(const TestRun& run) {
    switch (run.result.nStatus) {
        case TAVO_ROUTER_STATUS_LOCKED:
            return Busy();
        case TAVO_ROUTER_STATUS_NO_GATEWAY:
            return Failure(
                "no router answered that speaks UPnP and says what it is; nothing was changed. 'sudo tavoportmap "
                "setup' "
                "looks "
                "for the other ways there are");
        default:
            return Failure(StepAt(kSteps, run.nLast).szFailed);
    }
}

std::string AfterFailure() {
    return fmt::format("More of it stands in /var/log/router.log{}",
                       CanBeReported() ? "; 'sudo tavoportmap report' sends it to the report server" : "");
}

std::string RecordEffect(const TestRun& run) {
    return run.HasPassed()
               ? fmt::format(
                     "detection takes this model's UPnP as working, and a save of more than {} rules is refused "
                     "before anything is changed",
                     run.result.nMaxRule)
               : "detection takes this model's UPnP as unknown, and no save checks how many rules it holds";
}

std::string RecordTest(const TestRun& run) {
    __tag_TAVO_ROUTER_RECORD record = {};
    Put(record.szBrand, run.result.szBrand);
    Put(record.szModel, run.result.szModel);
    Put(record.szVersion, run.result.szVersion);
    Put(record.szSupport, run.result.szSupport);
    record.nMaxRule = run.result.nMaxRule;
    return TLibWriteRecordIntoUpnpDB(&record) == 0
               ? ""
               : Failure("the outcome could not be recorded in /etc/portforward/router_upnp.db.user").szMessage;
}

}  // namespace tavo::cli
