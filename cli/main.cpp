// tavoportmap: the port-forwarding rules of this box, for people and scripts.
// Relies on the library's public header; CLI11 reads the arguments, fmt and jsoncpp write the answers.
// Promises: the rule file is never rewritten from something that could not be read; exit codes as in --help.
#include <fmt/format.h>
#include <json/json.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <charconv>
#include <cstring>
#include <iostream>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "libtavoportmap.h"

namespace {

enum Exit : int { kOk = 0, kFailed = 1, kUsage = 2, kBusy = 3, kRefused = 4, kTooMany = 5 };

constexpr char kFooter[] =
    "Rules live in /etc/portforward/rule.conf; 'rules' changes them there, 'save' writes them to the router.\n\n"
    "Examples:\n"
    "  tavoportmap rules add --name web --protocol tcp --router-port 443 --box-port 8443\n"
    "  tavoportmap rules list\n"
    "  tavoportmap save\n\n"
    "Exit codes: 0 done, 1 failed, 2 wrong arguments, 3 another operation is running,\n"
    "4 the router refused some ports, 5 more rules than the router holds.\n";

using RuleArray = std::unique_ptr<__tag_TAVO_ROUTER_RULE, decltype(&TLibFreeRulesArr)>;

struct Rules {
    RuleArray pRules{nullptr, &TLibFreeRulesArr};
    int nRules = 0;
};

bool gBlJson = false;

int Answer(Exit enExit, const std::string& szMessage, Json::Value jsAnswer = Json::objectValue) {
    if (gBlJson) {
        jsAnswer["ok"] = enExit == kOk;
        jsAnswer["message"] = szMessage;
        std::cout << jsAnswer.toStyledString();
    } else if (!szMessage.empty()) {
        (enExit == kOk ? std::cout : std::cerr) << szMessage << "\n";
    }
    return enExit;
}

// The stored rules; nothing when the file cannot be read.
std::optional<Rules> LoadRules() {
    Rules rules;
    __tag_TAVO_ROUTER_RULE* pRules = nullptr;
    RouterRuleConfReader(false).StartNextRule();  // brings back the rules that a killed writer left aside
    if (TLibGetRulesArrFromRuleConf(&rules.nRules, &pRules, nullptr, false, nullptr) != 0) {
        return std::nullopt;
    }
    rules.pRules.reset(pRules);
    return rules;
}

constexpr char kUnreadable[] =
    "/etc/portforward/rule.conf cannot be read as rules; it was left as it is (the system log says where)";

// The ports of a text like "80,443,5000-5010", in its order; nothing when it cannot be read.
std::optional<std::vector<int>> ParsePorts(const std::string& szText) {
    std::vector<int> rgPorts;
    for (const std::string& szItem : CLI::detail::split(szText, ',')) {
        int rgnEnds[2] = {};
        const size_t nDash = szItem.find('-');
        const std::string rgszEnds[2] = {szItem.substr(0, nDash),
                                         nDash == std::string::npos ? szItem : szItem.substr(nDash + 1)};
        for (int i = 0; i < 2; ++i) {
            const char* pEnd = rgszEnds[i].data() + rgszEnds[i].size();
            const auto [pRead, error] = std::from_chars(rgszEnds[i].data(), pEnd, rgnEnds[i]);
            if (error != std::errc() || pRead != pEnd || rgnEnds[i] < 1 || rgnEnds[i] > 65535) {
                return std::nullopt;
            }
        }
        for (int nPort = std::min(rgnEnds[0], rgnEnds[1]); nPort <= std::max(rgnEnds[0], rgnEnds[1]); ++nPort) {
            rgPorts.push_back(nPort);
        }
    }
    return rgPorts;
}

bool Overlap(const std::string& szOne, const std::string& szOther) {
    return szOne == szOther || szOne == "all" || szOther == "all";
}

struct NewRule {
    std::string szName;
    std::string szProtocol = "tcp";
    std::string szRouterPort;
    std::string szBoxPort;
    bool blDisabled = false;
    bool blForce = false;
};

// What is wrong with a new rule, and what would be right; empty when nothing is.
std::string FaultOf(const NewRule& rule, const Rules& rules) {
    const auto rgRouter = ParsePorts(rule.szRouterPort);
    const auto rgBox = ParsePorts(rule.szBoxPort);
    if (!rgRouter || !rgBox) {
        return fmt::format("'{}' is no port list: write ports from 1 to 65535, such as 443, 80,443 or 5000-5010",
                           rgRouter ? rule.szBoxPort : rule.szRouterPort);
    }
    if (rgRouter->size() != rgBox->size()) {
        return fmt::format("{} router ports but {} box ports: each router port needs one box port", rgRouter->size(),
                           rgBox->size());
    }
    const std::set<int> setWanted(rgRouter->begin(), rgRouter->end());
    for (int i = 0; i < rules.nRules && !rule.blForce; ++i) {
        const __tag_TAVO_ROUTER_RULE& old = rules.pRules.get()[i];
        const auto rgOld = ParsePorts(old.szRouterPort);
        for (const int nPort :
             old.blEnable&& rgOld&& Overlap(old.szProtocol, rule.szProtocol) ? *rgOld : std::vector<int>()) {
            if (setWanted.contains(nPort)) {
                return fmt::format("rule {} already forwards router port {}; remove it, or add --force", old.szRuleID,
                                   nPort);
            }
        }
    }
    return "";
}

bool StoreRules(RouterRuleConfWriter& writer) {
    return writer.Sync() != 0;
}

bool Copy(RouterRuleConfWriter& writer, const __tag_TAVO_ROUTER_RULE& rule, bool blEnable) {
    return writer.AddRule(std::string(rule.szRuleID), blEnable, rule.szRouterPort, rule.szSrcPort, rule.szProtocol,
                          rule.szServiceID, rule.szServiceName) != 0;
}

// Holds the router lock for as long as the rule file is read, changed and written.
class Lock {
public:
    ~Lock() { TLibTavoPortMapUnLock(); }
    bool Get() { return TLibTavoPortMapLock() == 0; }
};

constexpr char kBusyText[] = "another port-forwarding operation is running; try again when it has ended";

int AddRule(const NewRule& rule) {
    Lock lock;
    if (!lock.Get()) {
        return Answer(kBusy, kBusyText);
    }
    const auto rules = LoadRules();
    if (!rules) {
        return Answer(kFailed, kUnreadable);
    }
    if (const std::string szFault = FaultOf(rule, *rules); !szFault.empty()) {
        return Answer(kUsage, szFault);
    }
    RouterRuleConfWriter writer;
    int nId = 0;
    bool blCopied = true;
    for (int i = 0; i < rules->nRules; ++i) {
        nId = std::max(nId, std::atoi(rules->pRules.get()[i].szRuleID));
        blCopied = blCopied && Copy(writer, rules->pRules.get()[i], rules->pRules.get()[i].blEnable);
    }
    ++nId;
    if (!blCopied ||
        writer.AddRule(nId, !rule.blDisabled, rule.szRouterPort, rule.szBoxPort, rule.szProtocol, "", rule.szName) ==
            0 ||
        !StoreRules(writer)) {
        return Answer(kFailed, "the rules could not be written; the old ones are still there");
    }
    Json::Value jsAnswer;
    jsAnswer["id"] = std::to_string(nId);
    return Answer(kOk, fmt::format("rule {} stored; 'tavoportmap save' writes it to the router", nId), jsAnswer);
}

enum class Change { kRemove, kEnable, kDisable };

int ChangeRule(const std::string& szId, Change enChange) {
    Lock lock;
    if (!lock.Get()) {
        return Answer(kBusy, kBusyText);
    }
    const auto rules = LoadRules();
    if (!rules) {
        return Answer(kFailed, kUnreadable);
    }
    RouterRuleConfWriter writer;
    bool blFound = false;
    std::string szIds;
    for (int i = 0; i < rules->nRules; ++i) {
        const __tag_TAVO_ROUTER_RULE& rule = rules->pRules.get()[i];
        const bool blThis = szId == rule.szRuleID;
        blFound = blFound || blThis;
        szIds += (szIds.empty() ? "" : ", ") + std::string(rule.szRuleID);
        if (!(blThis && enChange == Change::kRemove) &&
            !Copy(writer, rule, blThis ? enChange == Change::kEnable : rule.blEnable)) {
            return Answer(kFailed, "out of memory; nothing was changed");
        }
    }
    if (!blFound) {
        return Answer(kUsage,
                      fmt::format("there is no rule {}; the rules are: {}", szId, szIds.empty() ? "none" : szIds));
    }
    if (!StoreRules(writer)) {
        return Answer(kFailed, "the rules could not be written; the old ones are still there");
    }
    return Answer(kOk, "stored; 'tavoportmap save' writes the rules to the router");
}

int ListRules() {
    const auto rules = LoadRules();
    if (!rules) {
        return Answer(kFailed, kUnreadable);
    }
    Json::Value jsAnswer;
    jsAnswer["rules"] = Json::arrayValue;
    if (!gBlJson) {
        fmt::print("{:<4} {:<8} {:<6} {:<20} {:<20} {}\n", "id", "state", "proto", "router ports", "box ports", "name");
    }
    for (int i = 0; i < rules->nRules; ++i) {
        const __tag_TAVO_ROUTER_RULE& rule = rules->pRules.get()[i];
        if (!gBlJson) {
            fmt::print("{:<4} {:<8} {:<6} {:<20} {:<20} {}\n", rule.szRuleID, rule.blEnable ? "enabled" : "disabled",
                       rule.szProtocol, rule.szRouterPort, rule.szSrcPort, rule.szServiceName);
        }
        Json::Value jsRule;
        jsRule["id"] = rule.szRuleID;
        jsRule["enabled"] = rule.blEnable;
        jsRule["protocol"] = rule.szProtocol;
        jsRule["router_ports"] = rule.szRouterPort;
        jsRule["box_ports"] = rule.szSrcPort;
        jsRule["name"] = rule.szServiceName;
        jsAnswer["rules"].append(jsRule);
    }
    return Answer(kOk, "", jsAnswer);
}

// ---- saving -------------------------------------------------------------------------------------------

void ShowProgress(const __tag_TAVO_ROUTER_SAVE_RULE_RESULT* pResult, void* pData) {
    static_cast<Json::Value*>(pData)->append(pResult->nProgress);
    if (gBlJson) {
        return;
    }
    const size_t nDone = static_cast<size_t>(pResult->nProgress) / 5;
    if (isatty(STDOUT_FILENO) != 0) {
        fmt::print("\r[{:<20}] {:>3} %{}", std::string(nDone, '#'), pResult->nProgress,
                   pResult->nProgress == 100 ? "\n" : "");
    } else {
        fmt::print("{} %\n", pResult->nProgress);
    }
    std::fflush(stdout);
}

struct Verdict {
    Exit enExit;
    std::string szText;
};

Verdict Explain(const __tag_TAVO_ROUTER_SAVE_RULE_RESULT& result) {
    switch (result.nStatus) {
        case 2:
            return {kBusy, kBusyText};
        case 7:
            return {kTooMany, fmt::format("the router holds {} rules at most; nothing was changed. Remove some rules",
                                          result.nLimit)};
        case 8:
            return {kRefused, fmt::format("the router already uses these ports for something else: {}. The other rules "
                                          "are in force; choose other router ports",
                                          result.szPortList)};
        case 9:
            return {kRefused,
                    fmt::format("the router refused these ports: {}. The other rules are in force; the reasons "
                                "stand in /var/tmp/upnp_portmap.status",
                                result.szPortList)};
        case 10:
        case 11:
            return {kTooMany, result.nLimit < 0
                                  ? "the rules exceed what this router holds; nothing was changed"
                                  : fmt::format("this router holds {} single ports and no ranges; nothing "
                                                "was changed",
                                                result.nLimit)};
        case 12:
            return {kTooMany, fmt::format("this router holds {} single ports and {} ranges; nothing was changed",
                                          result.nLimit, result.nLimit2)};
        default:
            return {kFailed,
                    "the rules were not saved. Most often the router is not known yet (no section for it in "
                    "/etc/portforward/router.conf) or not in the compatibility database; the system log says which"};
    }
}

int Save() {
    char szGateway[64] = {};
    if (TLibGetGatewayIP(szGateway, sizeof(szGateway)) != 0) {
        return Answer(kFailed, "this box has no default gateway, so there is no router to write to");
    }
    const auto rules = LoadRules();
    if (!rules) {
        return Answer(kFailed, kUnreadable);
    }
    __tag_TAVO_ROUTER_SAVE_RULE_RESULT result = {};
    Json::Value jsProgress(Json::arrayValue);
    const int nResult =
        TLibSaveRules(szGateway, rules->nRules, rules->pRules.get(), true, &result, &ShowProgress, &jsProgress);
    if (nResult != 0 && !gBlJson && isatty(STDOUT_FILENO) != 0) {
        fmt::print("\n");
    }
    const Verdict verdict =
        nResult == 0 ? Verdict{kOk, fmt::format("{} rules are in force on the router {}", rules->nRules, szGateway)}
                     : Explain(result);
    Json::Value jsAnswer;
    jsAnswer["result"] = nResult;
    jsAnswer["status"] = result.nStatus;
    jsAnswer["progress"] = jsProgress;
    if (verdict.enExit == kRefused) {
        jsAnswer["ports"] = result.szPortList;
    }
    if (verdict.enExit == kTooMany) {
        jsAnswer["limit"] = result.nLimit;
    }
    return Answer(verdict.enExit, verdict.szText, jsAnswer);
}

// ---- status ---------------------------------------------------------------------------------------------

int Status() {
    std::string szGateway;
    const bool blGateway = GetGatewayIP(szGateway) != 0;
    RouterConfReader reader(szGateway);
    std::string szBrand, szModel, szVersion, szUpnp, szNatpmp;
    bool blKnown = false;
    blKnown = reader.IsSectionExist(blKnown) != 0 && blKnown;
    if (blKnown) {
        reader.GetBrand(szBrand);
        reader.GetModel(szModel);
        reader.GetVersion(szVersion);
        reader.GetSupportUpnp(szUpnp);
        reader.GetSupportNatpmp(szNatpmp);
    }
    auto enTask = TAVO_LIBTAVOPORTMAP_TASK_IDLE;
    TLibGetLibTavoPortMapRunningTask(&enTask);
    const char* rgszTasks[] = {"nothing", "a UPnP compatibility test", "saving rules"};
    const auto rules = LoadRules();
    Json::Value jsAnswer;
    jsAnswer["gateway"] = blGateway ? Json::Value(szGateway) : Json::Value();
    jsAnswer["router"] = blKnown ? Json::Value(szBrand + " " + szModel + " " + szVersion) : Json::Value();
    jsAnswer["upnp"] = szUpnp;
    jsAnswer["natpmp"] = szNatpmp;
    jsAnswer["rules"] = rules ? Json::Value(rules->nRules) : Json::Value();
    jsAnswer["running"] = rgszTasks[enTask];
    if (!gBlJson) {
        fmt::print("gateway  {}\nrouter   {}\nUPnP     {}\nNAT-PMP  {}\nrules    {}\nrunning  {}\n",
                   blGateway ? szGateway : "none",
                   blKnown ? szBrand + " " + szModel + " " + szVersion : "not known yet", szUpnp.empty() ? "-" : szUpnp,
                   szNatpmp.empty() ? "-" : szNatpmp, rules ? std::to_string(rules->nRules) : "unreadable",
                   rgszTasks[enTask]);
    }
    return Answer(blGateway ? kOk : kFailed, blGateway ? "" : "this box has no default gateway", jsAnswer);
}

int Run(int argc, char** argv) {
    CLI::App app("Gets this box's ports through the router in front of it.");
    app.footer(kFooter);
    app.require_subcommand(1);
    app.add_flag("--json", gBlJson, "one JSON document on standard output");
    int nExit = kOk;

    CLI::App* pRules = app.add_subcommand("rules", "the stored rules: list, add, remove, enable, disable");
    pRules->require_subcommand(1)->fallthrough();
    pRules->add_subcommand("list", "show the rules")->fallthrough()->callback([&] { nExit = ListRules(); });
    NewRule rule;
    CLI::App* pAdd = pRules->add_subcommand("add", "store one more rule")->fallthrough();
    pAdd->add_option("--name", rule.szName, "what the rule is for");
    pAdd->add_option("--protocol", rule.szProtocol, "tcp, udp or all (default tcp)")
        ->check(CLI::IsMember({"tcp", "udp", "all"}));
    pAdd->add_option("--router-port", rule.szRouterPort, "ports outside: 443, 80,443 or 5000-5010")->required();
    pAdd->add_option("--box-port", rule.szBoxPort, "ports on this box (default: the same)");
    pAdd->add_flag("--disabled", rule.blDisabled, "store it switched off");
    pAdd->add_flag("--force", rule.blForce, "also when another rule forwards the same router port");
    pAdd->callback([&] {
        rule.szBoxPort = rule.szBoxPort.empty() ? rule.szRouterPort : rule.szBoxPort;
        nExit = AddRule(rule);
    });
    std::string szId;
    const std::pair<const char*, Change> rgVerbs[] = {
        {"remove", Change::kRemove}, {"enable", Change::kEnable}, {"disable", Change::kDisable}};
    for (const auto& [szVerb, enChange] : rgVerbs) {
        CLI::App* pVerb = pRules->add_subcommand(szVerb, std::string(szVerb) + " one rule")->fallthrough();
        pVerb->add_option("id", szId, "the rule's id, as 'rules list' shows it")->required();
        pVerb->callback([&, enChange = enChange] { nExit = ChangeRule(szId, enChange); });
    }
    app.add_subcommand("save", "write the rules to the router and wait for its answer")->fallthrough()->callback([&] {
        nExit = Save();
    });
    app.add_subcommand("status", "the gateway, what is known of it, what is running")->fallthrough()->callback([&] {
        nExit = Status();
    });
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        return app.exit(error) == 0 ? kOk : kUsage;
    }
    return nExit;
}

}  // namespace

int main(int argc, char** argv) {
    try {
        return Run(argc, argv);
    } catch (const std::exception& error) {
        std::cerr << "tavoportmap: " << error.what() << "\n";
        return kFailed;
    }
}
