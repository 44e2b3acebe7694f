// "compat": whether the router's UPnP can be relied on, and how many rules it really keeps. Relies on CompatRun.
// Promises: a test that runs already is never disturbed; a stopped one leaves no mapping and no record; nothing is
// recorded that nobody agreed to.
#include <fmt/format.h>

#include "Ask.h"
#include "Box.h"
#include "Commands.h"
#include "CompatRun.h"
#include "CompatTest.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr int kLeastRules = 3;
constexpr int kMostRules = 1000;

struct Wish {
    int nRules = kUsualTestRules;
    bool blRecord = false;
    bool blYes = false;
    bool blStop = false;
};

// ---- the record -----------------------------------------------------------------------------------------

// A question needs the result before it; whoever is asked sees it, and is not told again.
bool IsWanted(const TestRun& run, const Wish& wish, bool blJson, Reply& reply) {
    if (wish.blYes || (wish.blRecord && run.HasPassed())) {
        return true;
    }
    if (blJson || !IsAnybodyThere()) {
        return false;
    }
    Print(reply, false);
    reply.szBody.clear();
    reply.szMessage.clear();
    reply.rgszWarnings.clear();
    // The file holds one record: a failure takes the place of a limit that was found before.
    return Confirm(fmt::format("Recorded, this changes: {}.\nIt takes the place of the last record. Record it?",
                               RecordEffect(run)));
}

void Record(const TestRun& run, Reply& reply) {
    if (const std::string szFault = RecordTest(run); !szFault.empty()) {
        reply.rgszWarnings.push_back(szFault);
        reply.enExit = kFailed;
        return;
    }
    reply.jsAnswer["recorded"] = true;
    reply.szMessage += fmt::format("{}recorded: {}", reply.szMessage.empty() ? "" : "\n", RecordEffect(run));
    const TestResult& result = run.result;
    if (const auto szFault = OtherLimit(result.szBrand, result.szModel, result.szVersion, result.nMaxRule);
        szFault && run.HasPassed()) {
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

Reply Outcome(const TestRun& run, int nAsked) {
    const TestResult& result = run.result;
    const bool blPassed = run.HasPassed();
    Reply reply{.enExit = blPassed ? kOk : kFailed};
    const std::string szName = RouterName(result.szBrand, result.szModel, result.szVersion);
    reply.szBody = Columns({{"router", szName.empty() ? "without a name" : szName},
                            {"UPnP", blPassed ? "works: every step passed" : "cannot be relied on"},
                            {"failed", blPassed ? "" : run.FailedWords()},
                            {"holds", blPassed && result.nMaxRule > 0 ? LimitWords(result.nMaxRule, nAsked) : ""}});
    reply.szMessage = blPassed ? "the router passed the test"
                               : fmt::format("the router failed the test: {}\n{}", run.FailedWords(), AfterFailure());
    reply.jsAnswer["failed_step"] = blPassed ? Json::Value() : Json::Value(run.FailedName());
    return reply;
}

Reply Conclude(const TestRun& run, const Wish& wish, bool blJson) {
    const TestResult& result = run.result;
    Reply reply = run.nResult < 0 ? NotRun(run) : Outcome(run, wish.nRules);
    reply.jsAnswer["passed"] = run.nResult < 0 ? Json::Value() : Json::Value(run.HasPassed());
    reply.jsAnswer["status"] = result.nStatus;
    reply.jsAnswer["recorded"] = false;
    reply.jsAnswer["router"] = ToJson(result);
    reply.jsAnswer["max_rules"] = result.nMaxRule > 0 ? Json::Value(result.nMaxRule) : Json::Value();
    if (run.nResult < 0) {
        return reply;
    }
    if (*result.szSupport == '\0') {
        reply.rgszWarnings.emplace_back("the router does not say what it is, so that nothing can be recorded of it");
    } else if (IsWanted(run, wish, blJson, reply)) {
        Record(run, reply);
    } else {
        reply.szMessage += reply.szMessage.empty() ? "not recorded" : "\nnot recorded";
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
    return Conclude(RunTest(wish.nRules, blJson), wish, blJson);
}

Reply Compat(const Wish& wish, bool blJson) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
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
    pCompat
        ->add_option("--rules", pWish->nRules, fmt::format("how many mappings to try (default: {})", kUsualTestRules))
        ->check(NumberBetween(kLeastRules, kMostRules))
        ->type_name("NUMBER");
    pCompat->add_flag("--record", pWish->blRecord, "record a test that passed, without asking");
    pCompat->add_flag("--yes", pWish->blYes, "record the outcome whatever it is, without asking");
    pCompat->add_flag("--stop", pWish->blStop, "end a test that is running and take its mappings away");
    pCompat->footer(
        "Makes test mappings on the router, counts what it really holds, takes them away, makes them anew, and looks "
        "whether the ports follow. Rules and other devices' mappings stay. The recorded number of rules is what 'save' "
        "goes by from then on. Ctrl-C stops the test.\n");
    pCompat->callback(
        [pWish, &request] { request.fnCommand = [pWish, &request] { return Compat(*pWish, request.blJson); }; });
}

}  // namespace tavo::cli
