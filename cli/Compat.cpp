// "compat": whether the router's UPnP can be relied on, and how many rules it really keeps. Relies on the
// library's compatibility test. Promises: a test that runs already is never disturbed; a stopped one leaves no
// mapping and no record; nothing is recorded that nobody agreed to.
#include <fmt/format.h>
#include <unistd.h>

#include <iostream>
#include <mutex>

#include "Box.h"
#include "Commands.h"
#include "CompatTest.h"
#include "Progress.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

using TestResult = __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT;

constexpr int kLeastRules = 3;
constexpr int kMostRules = 1000;
constexpr int kUsualRules = 60;

struct Wish {
    int nRules = kUsualRules;
    bool blRecord = false;
    bool blYes = false;
    bool blStop = false;
};

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

// ---- the record -----------------------------------------------------------------------------------------

bool Confirm(const std::string& szQuestion) {
    std::cerr << szQuestion << " [y/N] " << std::flush;
    std::string szAnswer;
    return std::getline(std::cin, szAnswer) && !szAnswer.empty() && (szAnswer[0] == 'y' || szAnswer[0] == 'Y');
}

// What recording the outcome would change.
std::string Effect(const TestResult& result, bool blPassed) {
    return blPassed ? fmt::format(
                          "detection takes this model's UPnP as working, and a save of more than {} rules is refused "
                          "before anything is changed",
                          result.nMaxRule)
                    : "detection takes this model's UPnP as unknown, and no save checks how many rules it holds";
}

bool IsWanted(const TestResult& result, bool blPassed, const Wish& wish, bool blJson) {
    if (wish.blYes || (wish.blRecord && blPassed)) {
        return true;
    }
    // The file holds one record: a failure takes the place of a limit that was found before.
    return !blJson && isatty(STDIN_FILENO) != 0 &&
           Confirm(fmt::format("Recorded, this changes: {}.\nIt takes the place of the last record. Record it?",
                               Effect(result, blPassed)));
}

void Record(const TestResult& result, bool blPassed, Reply& reply) {
    __tag_TAVO_ROUTER_RECORD record = {};
    Put(record.szBrand, result.szBrand);
    Put(record.szModel, result.szModel);
    Put(record.szVersion, result.szVersion);
    Put(record.szSupport, result.szSupport);
    record.nMaxRule = result.nMaxRule;
    if (TLibWriteRecordIntoUpnpDB(&record) != 0) {
        reply.rgszWarnings.push_back(
            Failure("the outcome could not be recorded in /etc/portforward/router_upnp.db.user").szMessage);
        reply.enExit = kFailed;
        return;
    }
    reply.jsAnswer["recorded"] = true;
    reply.szMessage += fmt::format("\nrecorded: {}", Effect(result, blPassed));
    if (const auto szFault = OtherLimit(result.szBrand, result.szModel, result.szVersion, result.nMaxRule)) {
        reply.rgszWarnings.push_back(*szFault);
    }
}

// ---- the outcome ----------------------------------------------------------------------------------------

std::string LimitWords(int nHeld, int nAsked) {
    return nHeld < nAsked ? fmt::format("{} rules", nHeld)
                          : fmt::format("{} rules at least, as many as were tried (--rules NUMBER tries more)", nHeld);
}

Json::Value ToJson(const TestResult& result) {
    Json::Value js;
    js["brand"] = result.szBrand;
    js["model"] = result.szModel;
    js["version"] = result.szVersion;
    return js;
}

// A test that could not run.
Reply NotRun(const TestResult& result, int nLast) {
    switch (result.nStatus) {
        case 2:
            return Busy();
        case 13:
            return Failure(
                "no router answered that speaks UPnP and says what it is; nothing was changed. Switch UPnP on in the "
                "router's settings; 'tavoportmap detect' looks at the rest of the way");
        default:
            return Failure(StepAt(kSteps, nLast).szFailed);
    }
}

Reply Outcome(const TestResult& result, bool blPassed, int nLast, int nAsked) {
    Reply reply{.enExit = blPassed ? kOk : kFailed};
    const Step& failed = StepAt(kSteps, nLast);
    const std::string szName = RouterName(result.szBrand, result.szModel, result.szVersion);
    reply.szBody = Columns({{"router", szName.empty() ? "without a name" : szName},
                            {"UPnP", blPassed ? "works: every step passed" : "cannot be relied on"},
                            {"failed", blPassed ? "" : failed.szFailed},
                            {"holds", blPassed && result.nMaxRule > 0 ? LimitWords(result.nMaxRule, nAsked) : ""}});
    reply.szMessage = blPassed ? "the router passed the test"
                               : fmt::format(
                                     "the router failed the test: {}\nMore of it stands in "
                                     "/var/log/router.log; 'tavoportmap report' sends it to the report server",
                                     failed.szFailed);
    reply.jsAnswer["failed_step"] = blPassed ? Json::Value() : Json::Value(failed.szName);
    return reply;
}

Reply Conclude(const TestResult& result, int nResult, int nLast, const Wish& wish, bool blJson) {
    Reply reply = nResult < 0 ? NotRun(result, nLast) : Outcome(result, nResult == 0, nLast, wish.nRules);
    reply.jsAnswer["passed"] = nResult < 0 ? Json::Value() : Json::Value(nResult == 0);
    reply.jsAnswer["status"] = result.nStatus;
    reply.jsAnswer["recorded"] = false;
    reply.jsAnswer["router"] = ToJson(result);
    reply.jsAnswer["max_rules"] = result.nMaxRule > 0 ? Json::Value(result.nMaxRule) : Json::Value();
    if (nResult < 0) {
        return reply;
    }
    if (*result.szSupport == '\0') {
        reply.rgszWarnings.emplace_back("the router does not say what it is, so that nothing can be recorded of it");
    } else if (IsWanted(result, nResult == 0, wish, blJson)) {
        Record(result, nResult == 0, reply);
    } else {
        reply.szMessage += "\nnot recorded";
    }
    return reply;
}

Reply Test(const Wish& wish, bool blJson) {
    if (!Gateway()) {
        return NoGateway();
    }
    // A refused start would end the test that runs.
    if (IsTesting()) {
        return AlreadyTesting();
    }
    const Lock lock;
    if (!lock.IsHeld()) {
        return Busy();
    }
    TestResult result = {};
    Watch watch{Progress(blJson)};
    int nResult = -1;
    {
        const StopOnSignal stop(blJson, [&watch] {
            watch.mutex.lock();
            watch.progress.End();
        });
        nResult = TLibTestUpnpCompatibility(wish.nRules, &result, &ShowStep, &watch, false);
    }
    watch.progress.End();
    return Conclude(result, nResult, watch.nLast, wish, blJson);
}

Reply Compat(const Wish& wish, bool blJson) {
    if (!wish.blStop) {
        return Test(wish, blJson);
    }
    if (IsTesting()) {
        return Stopped(StopTest());
    }
    // Stopping also deletes what a report of the last test is made of.
    Reply reply{.szMessage = "no compatibility test has mappings on the router"};
    if (const Lock lock; !lock.IsHeld()) {
        reply.rgszWarnings.emplace_back(
            "another operation holds the router lock; where that is a test that still looks for its router, stop it "
            "in a moment");
    }
    return reply;
}

}  // namespace

void OfferCompat(CLI::App& app, Request& request) {
    const auto pWish = std::make_shared<Wish>();
    CLI::App* pCompat = AddCommand(app, "compat", "test whether the router's UPnP can be relied on; takes minutes");
    pCompat->add_option("--rules", pWish->nRules, fmt::format("how many mappings to try (default: {})", kUsualRules))
        ->check(NumberBetween(kLeastRules, kMostRules))
        ->type_name("NUMBER");
    pCompat->add_flag("--record", pWish->blRecord, "record a test that passed, without asking");
    pCompat->add_flag("--yes", pWish->blYes, "record the outcome whatever it is, without asking");
    pCompat->add_flag("--stop", pWish->blStop, "end a test that is running and take its mappings away");
    pCompat->footer(
        "Makes test mappings on the router, counts what it really holds, takes them away, makes\n"
        "them anew, and looks whether the ports follow. Rules and other devices' mappings stay.\n"
        "The recorded number of rules is what 'save' goes by from then on. Ctrl-C stops the test.\n");
    pCompat->callback(
        [pWish, &request] { request.fnCommand = [pWish, &request] { return Compat(*pWish, request.blJson); }; });
}

}  // namespace tavo::cli
