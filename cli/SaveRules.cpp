// Saves rules and waits for the router. Relies on TLibSaveRules, on the run keys' guard and on what the daemons
// publish. Promises: see SaveRules.h.
#include "SaveRules.h"

#include <fmt/format.h>
#include <unistd.h>

#include <CLI/StringTools.hpp>
#include <algorithm>
#include <atomic>
#include <chrono>
#include <numeric>
#include <thread>

#include "Box.h"
#include "KeysGuard.h"
#include "OnSignal.h"
#include "Outcome.h"
#include "Pages.h"
#include "Progress.h"
#include "StoredRouter.h"
#include "tavo/portforward.h"
#include "tavo/runkeys.h"

namespace tavo::cli {

namespace {

constexpr int kPagesCleared = 10;
constexpr int kRulesWritten = 80;  // percent, once the rule file is written
constexpr auto kPoll = std::chrono::milliseconds(50);
constexpr auto kHandOver = std::chrono::seconds(5);
constexpr auto kTakenAway = std::chrono::seconds(60);
constexpr char kChanged[] =
    "somebody else has changed /etc/portforward/rule.conf meanwhile: the next save goes by what stands there now "
    "('sudo tavoportmap rules list')";

std::string StepAt(int nPercent) {
    switch (nPercent) {
        case 20:
            return "checking the rules";
        case 40:
            return "collecting the rules";
        case 60:
            return "checking what the router holds";
        case 80:
            return "writing the rules to the router and waiting for it";
        case 90:
            return "reading back what the router refused";
        default:
            return "done";
    }
}

// Whether fnDone answers true before the time is over.
template <typename Function>
bool WaitFor(std::chrono::seconds limit, Function fnDone) {
    const auto end = std::chrono::steady_clock::now() + limit;
    while (!fnDone()) {
        if (std::chrono::steady_clock::now() > end) {
            return false;
        }
        std::this_thread::sleep_for(kPoll);
    }
    return true;
}

// Why a save without a status failed, although nothing was in its way beforehand.
Reply WhyFailed(const StoredRouter& router, const Rules& rules, const SaveResult& result, bool blPagesAsked) {
    if (result.nProgress < kRulesWritten || !AreStored(rules)) {
        return Failure(
            std::string("the rules could not be written to /etc/portforward; is the disk full or read-only? ") +
            (blPagesAsked ? "The old rules are in force, but the router's own pages were told before to take away what "
                            "they forward: what they forwarded is closed until a save succeeds"
                          : "Nothing was changed: the old rules are in force"));
    }
    if (router.enWay == Way::kManual) {
        return Failure(
            "the rules are stored, but the program that writes them into the router's pages failed or did "
            "not end; the system log has the reason:\n  sudo journalctl -t tavoportforward");
    }
    const char* szDaemon = router.enWay == Way::kNatpmp ? "natpmpd" : "upnpd";
    const bool blAlive = router.enWay == Way::kNatpmp ? NatpmpDaemon().IsAlive() : UpnpDaemon().IsAlive();
    Reply reply =
        Failure(fmt::format("the rules are stored, but {} {}; the system log says why:\n  sudo journalctl -t {}",
                            szDaemon, blAlive ? "has not answered in five minutes" : "could not be started", szDaemon));
    reply.enExit = kAway;
    return reply;
}

// Which ports the router refused, and what became of the others.
std::string WhyRefused(const SaveResult& result, Way enWay) {
    const std::string szPorts = Clean(result.szPortList);
    if (result.nStatus == TAVO_ROUTER_STATUS_ADD_FAILED) {
        return fmt::format(
            "these ports are not open on the router: {}\nThe others, if any, are. The reasons stand in "
            "/var/tmp/upnp_portmap.status",
            szPorts);
    }
    if (enWay == Way::kNatpmp) {
        return fmt::format(
            "the router would not give these ports as they were asked for: {}\nThe other rules are in "
            "force; choose other router ports for these",
            szPorts);
    }
    return fmt::format(
        "another device, or another program, already holds these ports on the router: {}\nThe other "
        "rules are in force; choose other router ports for these, or free them there",
        szPorts);
}

// Why the rules do not fit the router. Nothing has been changed then.
std::string WhyTooMany(const SaveResult& result, size_t nRules) {
    const std::string szHint =
        "\nNothing was changed; 'sudo tavoportmap rules list' shows the rules: remove some, or 'rules discard' the "
        "edits";
    switch (result.nStatus) {
        case TAVO_ROUTER_STATUS_TOO_MANY_RULES:
            return fmt::format("the router holds {} and there are {}", Count(result.nLimit, "rule"), nRules) + szHint;
        case TAVO_ROUTER_STATUS_NO_RANGE_PAGE:
            return fmt::format("the router holds {}, each of them one port or one range",
                               Count(result.nLimit, "place")) +
                   szHint;
        case TAVO_ROUTER_STATUS_RANGE_LIMIT:
            return fmt::format("the router holds {} and {}", Count(result.nLimit, "single port"),
                               Count(result.nLimit2, "range")) +
                   szHint;
        default:
            return result.nLimit < 0
                       ? "the rules do not fit this router, whose description is contradictory" + szHint
                       : fmt::format("the router holds {} and no ranges", Count(result.nLimit, "single port")) +
                             szHint + ". Or write ranges as single ports";
    }
}

// The library's own word on a save that did not come to its end.
Reply Explain(const SaveResult& result, const StoredRouter& router, size_t nRules) {
    switch (result.nStatus) {
        case TAVO_ROUTER_STATUS_LOCKED:
            return Busy();
        case TAVO_ROUTER_STATUS_TOO_MANY_RULES:
        case TAVO_ROUTER_STATUS_PORT_LIMIT:
        case TAVO_ROUTER_STATUS_NO_RANGE_PAGE:
        case TAVO_ROUTER_STATUS_RANGE_LIMIT: {
            Reply reply{.enExit = kTooMany, .szMessage = WhyTooMany(result, nRules)};
            reply.jsAnswer["limit"] = result.nLimit;
            if (result.nStatus == TAVO_ROUTER_STATUS_RANGE_LIMIT) {
                reply.jsAnswer["range_limit"] = result.nLimit2;
            }
            return reply;
        }
        case TAVO_ROUTER_STATUS_PORT_CONFLICT:
        case TAVO_ROUTER_STATUS_ADD_FAILED: {
            Reply reply{.enExit = kRefused, .szMessage = WhyRefused(result, router.enWay)};
            for (const std::string& szPort : CLI::detail::split(result.szPortList, ',')) {
                reply.jsAnswer["ports"].append(CLI::detail::trim_copy(szPort));
            }
            return reply;
        }
        default:
            return {};
    }
}

// Without the daemon's own word: what the library says.
Reply Saved(const std::string& szGateway, const StoredRouter& router, const Rules& rules) {
    const auto nOn = std::count_if(rules.begin(), rules.end(), [](const Rule& rule) { return rule.blEnabled; });
    if (router.enWay == Way::kManual) {
        return {.szMessage = fmt::format("{} handed to the router {}", Count(nOn, "rule"), szGateway),
                .rgszWarnings = {"the router's own pages did not say what they took: look at them, or try a connection "
                                 "from outside"}};
    }
    return {.szMessage = nOn == 0 ? fmt::format("no rule is switched on; the router {} is told to drop ours", szGateway)
                                  : fmt::format("{} in force on the router {}", Count(nOn, "rule"), szGateway)};
}

// What the library is not asked for, since it would switch the daemons off before it refuses.
std::optional<Reply> Refused(const StoredRouter& router, const std::string& szGateway, const Rules& rules,
                             SaveResult& result) {
    if (const auto szWhy = WhyUnsavable(router, szGateway)) {
        return Failure("the rules were not saved: " + *szWhy);
    }
    return Fits(router, szGateway, rules, result) ? std::nullopt : std::optional(Explain(result, router, rules.size()));
}

// What a rule file needs for a rule beside its texts.
constexpr size_t kRuleBytes =
    sizeof("[]\nenabled=\"1\"\ns_port=\"\"\nr_port=\"\"\nprotocol name=\"\"\nservice_id=\"\"\nservice=\"\"\n");

size_t BytesOf(const Rules& rules) {
    return std::accumulate(rules.begin(), rules.end(), size_t{0}, [](size_t nBytes, const Rule& rule) {
        return nBytes + kRuleBytes + rule.szId.size() + rule.szBoxPorts.size() + rule.szRouterPorts.size() +
               rule.szProtocol.size() + rule.szServiceId.size() + rule.szName.size();
    });
}

// What a rule file cannot hold, or nobody could read again.
std::optional<Reply> Unwritable(const Rules& rules) {
    if (rules.size() > TAVO_PF_MAX_SECTIONS) {
        return Reply{.enExit = kTooMany,
                     .szMessage = fmt::format("a rule file holds {} rules and there are {}. Nothing was changed",
                                              static_cast<int>(TAVO_PF_MAX_SECTIONS), rules.size())};
    }
    if (BytesOf(rules) > TLIBC_MAX_FILE) {
        return Reply{.enExit = kTooMany,
                     .szMessage =
                         "a rule file holds 16 MiB, and the names and port lists of these rules are more. "
                         "Nothing was changed"};
    }
    if (const std::string szWhy = TooLong(rules); !szWhy.empty()) {
        return Failure(szWhy);
    }
    return std::nullopt;
}

// A signal while the router's own pages take away what they forward: no rule has been handed over, and what runs is not
// the save.
int LeaveEarly(bool blJson, Progress& progress) {
    progress.End();
    TAVORunKeysRestore();
    return Print(
        {.enExit = kFailed,
         .szMessage = "the save is ended before it stored a rule: the old rules are in force. The router's own "
                      "pages go on taking away what they forward, so that it is closed until the next "
                      "'sudo tavoportmap save'"},
        blJson);
}

// A signal: once the rules are handed over, the daemon carries on by itself, and only the waiting ends.
int GoOn(bool blJson, Progress& progress) {
    const bool blHanded = WaitFor(kHandOver, [] { return IsSavingRules() != 0; });
    progress.End();
    if (blHanded) {
        TAVORunKeysForget();
    } else {
        TAVORunKeysRestore();
    }
    return Print({.enExit = kFailed,
                  .szMessage = blHanded ? "the waiting is ended, not the save: the rules are stored, and the daemon "
                                          "brings them to the router; 'tavoportmap status' shows what comes of it"
                                        : "the save is ended; 'sudo tavoportmap rules list' shows what is in force"},
                 blJson);
}

// The library's call, and for rules that leave none the wait that it leaves out. What pages forward that are not in use
// goes before: the other way would find its ports taken.
int CallLibrary(bool blClearsPages, const std::string& szGateway, std::vector<__tag_TAVO_ROUTER_RULE>& rgRecords,
                bool blJson, SaveResult& result, std::vector<PublishedLeftOver>& rgLeft) {
    Progress progress(blJson);
    std::atomic<bool> blClears = blClearsPages;
    const OnSignal signals([&] { return blClears ? LeaveEarly(blJson, progress) : GoOn(blJson, progress); });
    if (blClearsPages) {
        progress.Show(kPagesCleared, "having the router's own pages take away what they forward");
        rgLeft = TakeAwayByPages();
        blClears = false;
    }
    const int nResult = TLibSaveRules(
        szGateway.c_str(), static_cast<int>(rgRecords.size()), rgRecords.data(), false, &result,
        [](const SaveResult* pResult, void* pData) {
            static_cast<Progress*>(pData)->Show(pResult->nProgress, StepAt(pResult->nProgress));
        },
        &progress);
    if (nResult == 0 && rgRecords.empty()) {
        AwaitDaemon();
    }
    return nResult;
}

Reply SaveRecords(const StoredRouter& router, const std::string& szGateway, const Rules& rules,
                  std::vector<__tag_TAVO_ROUTER_RULE>& rgRecords, SaveResult& result, bool blJson,
                  std::vector<PublishedLeftOver>& rgLeft) {
    KeysGuard keys;
    if (keys.Obstacle()) {
        return *keys.Obstacle();
    }
    const time_t nStart = std::time(nullptr);
    const bool blClearsPages = router.enWay != Way::kManual && HavePagesMade();
    const int nResult = CallLibrary(blClearsPages, szGateway, rgRecords, blJson, result, rgLeft);
    if (nResult == 0) {
        keys.Keep();
    }
    if (nResult != 0 && result.nStatus == TAVO_ROUTER_STATUS_NONE) {
        return WhyFailed(router, rules, result, blClearsPages);
    }
    const auto published = PublishedSince(router, rules, nStart);
    const auto unsaid = nResult == 0 && !published ? Unsaid(router) : std::nullopt;
    if (unsaid) {
        return AreStored(rules) ? *unsaid : Failure(kChanged);
    }
    Reply reply = nResult == 0 ? Saved(szGateway, router, rules) : Explain(result, router, rules.size());
    if (published && (nResult == 0 || reply.enExit == kRefused)) {
        const Exit enLibrary = reply.enExit;
        reply = OutcomeOf(*published, rules, szGateway);
        reply.enExit = reply.enExit == kOk ? enLibrary : reply.enExit;
    }
    return reply;
}

}  // namespace

std::optional<Reply> WouldBeRefused(const StoredRouter& router, const std::string& szGateway, const Rules& rules) {
    SaveResult result = {};
    const auto unwritable = Unwritable(rules);
    return unwritable ? unwritable : Refused(router, szGateway, rules, result);
}

void AwaitDaemon() {
    WaitFor(kTakenAway, [] { return IsSavingRules() == 0; });
}

bool AreStored(const Rules& rules) {
    const auto stored = LoadRules();
    return stored && std::equal(stored->begin(), stored->end(), rules.begin(), rules.end(),
                                [](const Rule& one, const Rule& other) { return IsSameContent(one, other); });
}

Reply SaveRules(const Rules& rules, bool blJson) {
    const auto szGateway = Gateway();
    if (!szGateway) {
        Reply reply = NoGateway();
        reply.enExit = kAway;
        reply.szMessage += "\nNothing was changed";
        return reply;
    }
    if (const auto reply = Unwritable(rules)) {
        return *reply;
    }
    auto rgRecords = ToRecords(rules);
    SaveResult result = {};
    const StoredRouter router = ReadStoredRouter();
    const auto refused = Refused(router, *szGateway, rules, result);
    std::vector<PublishedLeftOver> rgLeft;
    Reply reply = refused ? *refused : SaveRecords(router, *szGateway, rules, *rgRecords, result, blJson, rgLeft);
    if (reply.enExit == kOk && !AreStored(rules)) {
        reply.rgszWarnings.emplace_back(kChanged);
    }
    AddLeftByPages(rgLeft, rules, reply);
    reply.jsAnswer["status"] = result.nStatus;
    reply.jsAnswer["rules"] = static_cast<Json::UInt>(rules.size());
    return reply;
}

}  // namespace tavo::cli
