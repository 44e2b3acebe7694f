// "service": the ports of a relay service: set, plan, clear, list, detect. Relies on the library's entry points
// for such a service. Promises: a request that came to less than was asked for is told so, port by port; the
// rules of a user are not taken for a service's.
#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <list>

#include "Box.h"
#include "Capture.h"
#include "Commands.h"
#include "CompatTest.h"
#include "KeysGuard.h"
#include "Outcome.h"
#include "Progress.h"
#include "Reach.h"
#include "SaveRules.h"
#include "ServicePlan.h"
#include "Settings.h"
#include "StoredRouter.h"
#include "Table.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

using Records = std::vector<__tag_TAVO_ROUTER_RULE>;

struct Wish {
    std::string szService;
    std::vector<std::string> rgszPorts;
    bool blTest = false;
    bool blForce = false;
};

constexpr char kAsPort[] = "5000-5001/tcp";

// "5000-5001/tcp" as a request; a complaint, or nothing when it is one.
std::string ReadRequest(const std::string& szText, __tag_TAVO_PORTMAP_RULE& request) {
    const size_t nSlash = szText.rfind('/');
    const std::string szPorts = szText.substr(0, nSlash);
    if (nSlash == std::string::npos || szPorts.empty() || !ParsePorts(szPorts) || !Put(request.szPorts, szPorts)) {
        return fmt::format("'{}' is no request: write ports and a protocol, such as {} or 80,443/all", Clean(szText),
                           kAsPort);
    }
    if (const std::string szFault = FaultOfPorts(szPorts); !szFault.empty()) {
        return szFault;
    }
    const std::string szProtocol = szText.substr(nSlash + 1);
    const auto pWord = std::find(kProtocolWords.begin(), kProtocolWords.end(), szProtocol);
    request.enProtocol = static_cast<int>(pWord - kProtocolWords.begin());
    const std::string szNearest = Nearest(szProtocol, kProtocolWords);
    return pWord != kProtocolWords.end()
               ? ""
               : fmt::format("'{}' in '{}' is none of {}{}", Clean(szProtocol), Clean(szText), Join(kProtocolWords),
                             szNearest.empty() ? "" : fmt::format("; did you mean '{}'?", szNearest));
}

// Everything that a request is judged by.
struct Surroundings {
    Requests rgRequests = {};
    Records rgStored = {};
    ServiceRouter router = {};
    ServicePlan plan = {};
    bool blTooMany = false;
};

std::optional<UsedPorts> AskRouter() {
    std::list<int> tcp, udp;
    if (TestFuncGetUsedRouterPortList(tcp, udp) != 0) {
        return std::nullopt;
    }
    return UsedPorts{{tcp.begin(), tcp.end()}, {udp.begin(), udp.end()}};
}

Reply ReadRequests(const Wish& wish, Requests& rgRequests) {
    if (wish.szService.empty() || wish.szService.size() >= TAVO_TEXT_SIZE) {
        return {.enExit = kUsage, .szMessage = "a service has a name, shorter than 1024 bytes"};
    }
    for (const std::string& szText : wish.rgszPorts) {
        rgRequests.push_back({});
        if (const std::string szFault = ReadRequest(szText, rgRequests.back()); !szFault.empty()) {
            return {.enExit = kUsage, .szMessage = szFault};
        }
    }
    return {};
}

// How many rules there would be is looked at when they are saved, and the daemons are switched off by then.
void CheckCapacity(Surroundings& found) {
    const int nAfter = static_cast<int>(found.plan.after.size());
    if (found.plan.szRefusal.empty() && found.router.nMaxRules >= 1 && nAfter > found.router.nMaxRules) {
        found.blTooMany = true;
        found.plan.szRefusal =
            fmt::format("the router holds {} rules and there would be {}", found.router.nMaxRules, nAfter);
    }
}

// What is known before anything is done.
Reply LookAround(const Wish& wish, Surroundings& found) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    if (const Reply reply = ReadRequests(wish, found.rgRequests); reply.enExit != kOk) {
        return reply;
    }
    const Settings settings = ReadSettings();
    if (settings.obstacle) {
        return *settings.obstacle;
    }
    const auto rules = LoadRules();
    if (!rules) {
        return NeedsRoot().value_or(Unreadable());
    }
    if (const std::string szWhy = TooLong(*rules); !szWhy.empty()) {
        return Failure(szWhy);
    }
    const auto rgStored = LoadRecords();
    if (!rgStored) {
        return NeedsRoot().value_or(Unreadable());
    }
    found.rgStored = *rgStored;
    found.router = ReadServiceRouter(settings);
    if (const auto szWhy = WhyUnsavable(ReadStoredRouter(), settings.szGateway);
        szWhy && found.router.szRefusal.empty()) {
        found.router.szRefusal = *szWhy;
    }
    const bool blAskUpnp =
        found.router.blUpnp && found.router.szRefusal.empty() && !(found.rgRequests.empty() && rgStored->empty());
    const auto used = blAskUpnp ? AskRouter() : std::nullopt;
    found.plan = MakePlan(wish.szService, found.rgRequests, *rgStored, used);
    if (!found.router.szRefusal.empty()) {
        found.plan = {.szRefusal = found.router.szRefusal};
    } else if (blAskUpnp && !used) {
        found.plan = {.szRefusal = "the router does not say what other hosts hold; is its UPnP switched on?"};
    }
    CheckCapacity(found);
    return {};
}

// What a user must agree to with --force; empty when there is nothing.
std::string Objection(const Wish& wish, const Surroundings& found) {
    for (const __tag_TAVO_ROUTER_RULE& rule : found.rgStored) {
        // A service forwards each port to the same port of the box, and nothing else.
        if (wish.szService == rule.szServiceName && std::string(rule.szRouterPort) != rule.szSrcPort) {
            return fmt::format(
                "rule {} has this name, but forwards {} to {}: no service made it, and it would go; add --force to go "
                "on",
                Clean(rule.szRuleID), Clean(rule.szRouterPort), Clean(rule.szSrcPort));
        }
    }
    return "";
}

// ---- what it comes to -------------------------------------------------------------------------------------

// Adds the plan; whether every port that was asked for opens.
bool Describe(const ServicePlan& plan, Reply& reply) {
    bool blAll = true;
    Table table({"port or rule", ""});
    for (const char* szMember : {"requests", "changes", "rules_after"}) {
        reply.jsAnswer[szMember] = Json::arrayValue;
    }
    for (const PortFate& fate : plan.rgPorts) {
        blAll = blAll && fate.szWhyNot.empty();
        table.Add(
            {fate.szPorts + "/" + fate.szProtocol, fate.szWhyNot.empty() ? "opens" : "stays out: " + fate.szWhyNot});
        Json::Value js;
        js["ports"] = fate.szPorts;
        js["protocol"] = fate.szProtocol;
        js["opens"] = fate.szWhyNot.empty();
        js["why_not"] = fate.szWhyNot.empty() ? Json::Value() : Json::Value(fate.szWhyNot);
        reply.jsAnswer["requests"].append(js);
    }
    for (const RuleFate& fate : plan.rgRules) {
        table.Add({"rule " + fate.szRule, fate.szWhat});
        Json::Value js;
        js["rule"] = fate.szRule;
        js["what"] = fate.szWhat;
        reply.jsAnswer["changes"].append(js);
    }
    for (const Rule& rule : plan.after) {
        reply.jsAnswer["rules_after"].append(ToJson(rule));
    }
    reply.szBody += table.ToText();
    return blAll;
}

Reply Plan(const Wish& wish) {
    Surroundings found;
    if (const Reply reply = LookAround(wish, found); reply.enExit != kOk) {
        return reply;
    }
    Reply reply;
    Describe(found.plan, reply);
    const bool blRefused = !found.plan.szRefusal.empty();
    reply.jsAnswer["refusal"] = blRefused ? Json::Value(found.plan.szRefusal) : Json::Value();
    if (blRefused) {
        reply.enExit = kFailed;
        reply.szMessage = fmt::format("the whole request would fail: {}", found.plan.szRefusal);
    } else {
        reply.szMessage =
            fmt::format("there would be {} rules, numbered from 1; nothing was changed", found.plan.after.size());
    }
    if (const std::string szFault = !found.plan.szCut.empty() ? found.plan.szCut : Objection(wish, found);
        !szFault.empty()) {
        reply.rgszWarnings.push_back(szFault);
    }
    return reply;
}

bool IsStored(const Rules& after) {
    const auto rgRecords = ToRecords(after);
    const auto rgStored = LoadRecords();
    return rgRecords && rgStored &&
           std::equal(rgRecords->begin(), rgRecords->end(), rgStored->begin(), rgStored->end(),
                      [](const __tag_TAVO_ROUTER_RULE& one, const __tag_TAVO_ROUTER_RULE& other) {
                          return one.blEnable == other.blEnable && std::string(one.szProtocol) == other.szProtocol &&
                                 std::string(one.szRouterPort) == other.szRouterPort &&
                                 std::string(one.szSrcPort) == other.szSrcPort &&
                                 std::string(one.szServiceName) == other.szServiceName;
                      });
}

// Why the library answered -1.
Reply NotSet(const Surroundings& found, const std::string& szLog, time_t nStart) {
    if (szLog.find("save rule failed") == std::string::npos && szLog.find(" test ") != std::string::npos) {
        return Failure("the rules are in force, but their ports could not be tested; the system log says why");
    }
    if (!found.plan.szRefusal.empty()) {
        return Failure(fmt::format("nothing was changed: {}", found.plan.szRefusal));
    }
    if (!IsStored(found.plan.after)) {
        return Failure(
            "the request failed, and the rules are as they were; 'sudo tavoportmap service plan' shows what it meets, "
            "and "
            "the "
            "system log says why");
    }
    const auto published = PublishedSince(ReadStoredRouter(), found.plan.after, nStart);
    Reply reply = published ? OutcomeOf(*published, found.plan.after, published->szGateway)
                            : Failure(
                                  "the rules are stored, but the router did not take them all, or its daemon did not "
                                  "answer; 'sudo tavoportmap save' tries again and says which");
    reply.enExit = reply.enExit == kOk ? kFailed : reply.enExit;
    return reply;
}

void AddTested(const Wish& wish, const Requests& rgRequests, const std::string& szLog, Reply& reply) {
    std::vector<PortVerdict> rgVerdicts;
    for (const __tag_TAVO_PORTMAP_RULE& request : rgRequests) {
        rgVerdicts.push_back({"", wish.szService, request.szPorts, request.szPorts,
                              kProtocolWords[static_cast<size_t>(request.enProtocol)], request.nTestConnStatus});
    }
    AddReasons(rgVerdicts, szLog);
    DescribePorts(rgVerdicts, reply);
}

Reply SetDone(const Wish& wish, const Surroundings& found, const std::string& szLog, time_t nStart) {
    Reply reply;
    AwaitDaemon();  // the library does not, for rules that leave none
    const StoredRouter router = ReadStoredRouter();
    const auto published = PublishedSince(router, found.plan.after, nStart);
    const bool blAll = Describe(found.plan, reply);
    if (wish.blTest && !found.rgRequests.empty()) {
        AddTested(wish, found.rgRequests, szLog, reply);
    }
    if (!found.plan.szRefusal.empty() || !IsStored(found.plan.after)) {
        reply.szBody.clear();
        reply.szMessage =
            "the request is in force, but others changed the rules meanwhile; 'sudo tavoportmap service list' "
            "shows what came of it";
        return reply;
    }
    if (const Reply outcome = published ? OutcomeOf(*published, found.plan.after, published->szGateway)
                                        : Unsaid(router).value_or(Reply());
        outcome.enExit != kOk) {
        return outcome;
    }
    reply.enExit = !blAll ? kRefused : reply.enExit;
    reply.szMessage = !blAll                     ? "some ports that were asked for stay out; the others are in force"
                      : found.rgRequests.empty() ? "the router keeps no port for this service"
                      : reply.enExit == kOk      ? "in force on the router"
                      : reply.enExit == kRefused ? "in force on the router, but some ports do not answer to the outside"
                                                 : "in force on the router, but some ports could not be judged";
    return reply;
}

// A service that has no rules, or one that is written otherwise.
std::optional<Reply> NothingToClear(const Wish& wish, const Surroundings& found) {
    std::vector<std::string> rgszServices;
    for (const __tag_TAVO_ROUTER_RULE& rule : found.rgStored) {
        const std::string szName = rule.szServiceName;
        if (szName == wish.szService || !wish.rgszPorts.empty()) {
            return std::nullopt;
        }
        if (!szName.empty() && std::find(rgszServices.begin(), rgszServices.end(), szName) == rgszServices.end()) {
            rgszServices.push_back(szName);
        }
    }
    if (!wish.rgszPorts.empty()) {
        return std::nullopt;
    }
    const std::string szNearest = Nearest(wish.szService, rgszServices);
    for (std::string& szName : rgszServices) {
        szName = Clean(szName);
    }
    return Reply{
        .enExit = kUsage,
        .szMessage = fmt::format(
            "'{}' has no rules, and nothing was changed; {}{}", Clean(wish.szService),
            rgszServices.empty() ? "no rule belongs to a service" : "the names of rules are " + Join(rgszServices),
            szNearest.empty() ? "" : fmt::format("; did you mean '{}'?", Clean(szNearest)))};
}

// Why a request is not made; nothing when it may be.
std::optional<Reply> Objections(const Wish& wish, const Surroundings& found) {
    if (const auto reply = NothingToClear(wish, found)) {
        return reply;
    }
    if (IsOff()) {
        return Reply{
            .enExit = kFailed,
            .szMessage = "every port is switched off, and nothing was changed; 'sudo tavoportmap on' comes first"};
    }
    if (IsOffUnreadable()) {
        return Failure(fmt::format("every port is switched off, and nothing was changed: {}", kOffUnreadable));
    }
    if (!found.plan.szCut.empty()) {
        return Reply{.enExit = kUsage, .szMessage = found.plan.szCut};
    }
    if (const std::string szFault = Objection(wish, found); !szFault.empty() && !wish.blForce) {
        return Reply{.enExit = kUsage, .szMessage = szFault};
    }
    return found.blTooMany
               ? std::optional(Reply{.enExit = kTooMany, .szMessage = "nothing was changed: " + found.plan.szRefusal})
               : std::nullopt;
}

Reply Set(const Wish& wish, bool blJson) {
    Surroundings found;
    if (const Reply reply = LookAround(wish, found); reply.enExit != kOk) {
        return reply;
    }
    if (const auto reply = Objections(wish, found)) {
        return *reply;
    }
    KeysGuard keys(KeysGuard::Lock::kTakenByTheCall);
    if (keys.Obstacle()) {
        return *keys.Obstacle();
    }
    Progress progress(blJson);
    progress.Show(0, "merging the request with the rules and writing them to the router");
    const time_t nStart = std::time(nullptr);
    LogCapture log;
    const int nResult =
        TLibTavoPortMapRulesSet(wish.szService.c_str(), found.rgRequests.empty() ? nullptr : found.rgRequests.data(),
                                static_cast<int>(found.rgRequests.size()), wish.blTest);
    const std::string szLog = log.Take();
    progress.End();
    if (nResult == 0) {
        keys.Keep();
    }
    Reply reply = nResult == 0   ? SetDone(wish, found, szLog, nStart)
                  : nResult == 1 ? Failure(kNotDetected)
                  : nResult == 2 ? Busy()
                                 : NotSet(found, szLog, nStart);
    reply.jsAnswer["result"] = nResult;
    return reply;
}

// ---- list, detect -----------------------------------------------------------------------------------------

Reply List() {
    auto rules = LoadRules();
    if (!rules) {
        return NeedsRoot().value_or(Failure(kUnreadable));
    }
    std::erase_if(*rules, [](const Rule& rule) { return rule.szName.empty(); });
    std::stable_sort(rules->begin(), rules->end(),
                     [](const Rule& one, const Rule& other) { return one.szName < other.szName; });
    Reply reply;
    reply.jsAnswer["rules"] = Json::arrayValue;
    Table table({"service", "rule", "state", "proto", "ports"});
    for (const Rule& rule : *rules) {
        table.Add(
            {rule.szName, rule.szId, rule.blEnabled ? "enabled" : "disabled", rule.szProtocol, rule.szRouterPorts});
        reply.jsAnswer["rules"].append(ToJson(rule));
    }
    reply.szBody = table.ToText();
    reply.szMessage = rules->empty() ? "no rule belongs to a service; 'sudo tavoportmap service set' makes some" : "";
    return reply;
}

Reply Detect(bool blJson) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    if (!Gateway()) {
        return NoGateway();
    }
    if (IsTesting()) {
        return AlreadyTesting();
    }
    KeysGuard keys(KeysGuard::Lock::kTakenByTheCall);
    if (keys.Obstacle()) {
        return *keys.Obstacle();
    }
    Progress progress(blJson);
    progress.Show(0, "asking the router what it is; a router that nobody knows is tested, which takes minutes");
    const pid_t nPid = getpid();
    int nResult = -1;
    {
        const StopOnSignal stop(blJson, [&progress] { progress.End(); });
        nResult = TLibTavoPortMapRouterDetect();
        if (getpid() != nPid) {
            _exit(0);  // the child of detection that has nothing to look for
        }
    }
    progress.End();
    constexpr const char* kKinds[] = {"automatic", "manual"};
    Reply reply =
        nResult == 0   ? Reply{.szMessage = "the router takes ports by UPnP or NAT-PMP; a service can have some"}
        : nResult == 1 ? Reply{.szMessage = "the router is driven through its own pages; no service gets ports on it"}
        : nResult == 2
            ? Busy()
            : Failure("the router could not be classified; 'sudo tavoportmap detect' says which step failed");
    reply.jsAnswer["result"] = nResult;
    reply.jsAnswer["kind"] = nResult == 0 || nResult == 1 ? Json::Value(kKinds[nResult]) : Json::Value();
    return reply;
}

CLI::App* OfferRequest(CLI::App& service, Request& request, const std::string& szVerb, const std::string& szWhat,
                       bool blPorts, Reply (*pfnRun)(const Wish&, bool)) {
    const auto pWish = std::make_shared<Wish>();
    CLI::App* pVerb = AddCommand(service, szVerb, szWhat);
    pVerb->add_option("service", pWish->szService, "its name; the relay service is hoplink")->required();
    if (blPorts) {
        pVerb
            ->add_option("ports", pWish->rgszPorts,
                         fmt::format("ports and protocol, such as {} or 80,443/all", kAsPort))
            ->required();
    }
    if (szVerb == "set") {
        pVerb->add_flag("--test", pWish->blTest, "then test every port asked for from outside");
    }
    if (szVerb != "plan") {
        pVerb->add_flag("--force", pWish->blForce, "also when a rule of this name is no service's");
    }
    pVerb->callback([pWish, pfnRun, &request] {
        request.fnCommand = [pWish, pfnRun, &request] { return pfnRun(*pWish, request.blJson); };
    });
    return pVerb;
}

}  // namespace

void OfferService(CLI::App& app, Request& request) {
    CLI::App* pService = AddCommand(app, "service", "the ports of a relay service: set, plan, clear, list, detect");
    pService->require_subcommand(1);
    pService->footer(
        "A service's request takes the place of its rules. The user's rules win over it, so do other hosts' mappings "
        "on a UPnP router, and a rule of the service that is switched off.\n"
        "Example: sudo tavoportmap service set hoplink 5000-5001/tcp 6000/udp --test\n");
    OfferRequest(*pService, request, "set", "have exactly these ports open for a service", true, &Set);
    OfferRequest(*pService, request, "plan", "what that would come to, port by port; changes nothing", true,
                 [](const Wish& wish, bool) { return Plan(wish); });
    OfferRequest(*pService, request, "clear", "take all ports of a service away", false, &Set);
    AddCommand(*pService, "list", "the rules that belong to a service")->callback([&request] {
        request.fnCommand = &List;
    });
    AddCommand(*pService, "detect", "have the router classified once, and tested where nobody knows it")
        ->callback([&request] { request.fnCommand = [&request] { return Detect(request.blJson); }; });
}

}  // namespace tavo::cli
