// "rules": list, add, remove, enable, disable. Relies on the rule store and the router lock. Promises: the
// file is read, changed and written under the lock; a change that would take another rule's port is
// refused unless --force says otherwise, and overlaps that are there are pointed out.
#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>

#include "Box.h"
#include "Commands.h"
#include "RuleStore.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr char kNotWritten[] = "the rules could not be written; the old ones are still there";
constexpr char kDirectory[] = "/etc/portforward";
constexpr int kMaxNumber = 1'000'000'000;  // ids beyond it are not ours, and need no successor

struct NewRule {
    Rule rule;
    bool blDisabled = false;
    bool blForce = false;
};

std::string ToText(const Overlap& overlap) {
    return fmt::format("rules {} and {} both want router port {}; only one of them can have it",
                       Clean(overlap.szEarlier), Clean(overlap.szLater), overlap.szPort);
}

void WarnOfOverlaps(const Rules& rules, Reply& reply) {
    reply.jsAnswer["overlaps"] = Json::arrayValue;
    for (const Overlap& overlap : OverlapsOf(rules)) {
        reply.rgszWarnings.push_back(ToText(overlap));
        Json::Value jsOverlap;
        jsOverlap["rules"].append(overlap.szEarlier);
        jsOverlap["rules"].append(overlap.szLater);
        jsOverlap["port"] = overlap.szPort;
        reply.jsAnswer["overlaps"].append(jsOverlap);
    }
}

std::string FaultOfPorts(const Rule& rule) {
    for (const std::string& szPorts : {rule.szRouterPorts, rule.szBoxPorts}) {
        if (!ParsePorts(szPorts)) {
            return fmt::format("'{}' is no port list: write ports from 1 to 65535, such as 443, 80,443 or 5000-5010",
                               Clean(szPorts));
        }
    }
    const size_t nRouter = ParsePorts(rule.szRouterPorts)->size();
    const size_t nBox = ParsePorts(rule.szBoxPorts)->size();
    if (nRouter != nBox) {
        return fmt::format("{} router ports but {} box ports: each router port needs one box port", nRouter, nBox);
    }
    const size_t nLongest = std::max({rule.szRouterPorts.size(), rule.szBoxPorts.size(), rule.szName.size()});
    return nLongest < TAVO_TEXT_SIZE
               ? ""
               : fmt::format("a name or port list is {} bytes long; {} is the most that a rule can hold", nLongest,
                             TAVO_TEXT_SIZE - 1);
}

// The enabled rule that already wants one of the ports of the rule szId.
std::string FaultOfOverlap(const Rules& rules, const std::string& szId) {
    for (const Overlap& overlap : OverlapsOf(rules)) {
        if (overlap.szLater == szId || overlap.szEarlier == szId) {
            const std::string& szOther = overlap.szLater == szId ? overlap.szEarlier : overlap.szLater;
            return fmt::format(
                "rule {} already forwards router port {}; choose another one, or 'rules remove {}', or add --force",
                Clean(szOther), overlap.szPort, Clean(szOther));
        }
    }
    return "";
}

std::string NextId(const Rules& rules) {
    int nLast = 0;
    for (const Rule& rule : rules) {
        int nId = 0;
        std::from_chars(rule.szId.data(), rule.szId.data() + rule.szId.size(), nId);
        nLast = nId < kMaxNumber ? std::max(nLast, nId) : nLast;
    }
    return std::to_string(nLast + 1);
}

// Reads the rules, has fnChange change them and writes them, all of it under the lock. fnChange answers
// what the user is told; the rules are written only when that is no complaint.
Reply ChangeRules(const std::function<Reply(Rules&)>& fnChange) {
    const Lock lock;
    if (!lock.IsHeld()) {
        return Busy();
    }
    auto rules = LoadRules();
    if (!rules) {
        return Failure(kUnreadable);
    }
    Reply reply = fnChange(*rules);
    if (reply.enExit == kOk && !StoreRules(*rules)) {
        return Failure(std::string(kNotWritten) +
                       (access(kDirectory, W_OK) == 0 ? "" : fmt::format("; {} is missing or read-only", kDirectory)));
    }
    WarnOfOverlaps(*rules, reply);
    return reply;
}

Reply AddRule(Rule rule, bool blForce) {
    if (const std::string szFault = FaultOfPorts(rule); !szFault.empty()) {
        return {.enExit = kUsage, .szMessage = szFault};
    }
    return ChangeRules([&](Rules& rules) -> Reply {
        rule.szId = NextId(rules);
        Rules rulesNew = rules;
        rulesNew.push_back(rule);
        if (const std::string szFault = FaultOfOverlap(rulesNew, rule.szId); !szFault.empty() && !blForce) {
            return {.enExit = kUsage, .szMessage = szFault};
        }
        rules = rulesNew;
        Reply reply{.szMessage = fmt::format("rule {} stored; 'tavoportmap save' writes it to the router", rule.szId)};
        reply.jsAnswer["id"] = rule.szId;
        return reply;
    });
}

enum class Change { kRemove, kEnable, kDisable };

Reply ChangeRule(const std::string& szId, Change enChange, bool blForce) {
    return ChangeRules([&](Rules& rules) -> Reply {
        const auto pRule =
            std::find_if(rules.begin(), rules.end(), [&](const Rule& rule) { return rule.szId == szId; });
        if (pRule == rules.end()) {
            return NoSuchRule(rules, szId);
        }
        if (enChange == Change::kRemove) {
            rules.erase(pRule);
        } else {
            pRule->blEnabled = enChange == Change::kEnable;
        }
        const std::string szFault = enChange == Change::kEnable && !blForce ? FaultOfOverlap(rules, szId) : "";
        if (!szFault.empty()) {
            return {.enExit = kUsage, .szMessage = szFault};
        }
        Reply reply{.szMessage = "stored; 'tavoportmap save' writes the rules to the router"};
        reply.jsAnswer["id"] = szId;
        return reply;
    });
}

std::string TableRow(const std::string& szId, const std::string& szState, const Rule& rule) {
    return fmt::format("{:<4} {:<8} {:<6} {:<20} {:<20} {}\n", Clean(szId), szState, Clean(rule.szProtocol),
                       Clean(rule.szRouterPorts), Clean(rule.szBoxPorts), Clean(rule.szName));
}

Reply ListRules() {
    const auto rules = LoadRules();
    if (!rules) {
        return Failure(kUnreadable);
    }
    Reply reply;
    reply.jsAnswer["rules"] = Json::arrayValue;
    const Rule head{"", true, "proto", "router ports", "box ports", "", "name"};
    reply.szBody = rules->empty() ? "" : Paint(Ink::kBold, TableRow("id", "state", head), STDOUT_FILENO);
    for (const Rule& rule : *rules) {
        reply.szBody += TableRow(rule.szId, rule.blEnabled ? "enabled" : "disabled", rule);
        reply.jsAnswer["rules"].append(ToJson(rule));
    }
    WarnOfOverlaps(*rules, reply);
    if (rules->empty()) {
        reply.szMessage =
            "no rules are stored yet; add one, for example\n"
            "  tavoportmap rules add web --router-port 443 --box-port 8443";
    }
    return reply;
}

void OfferAdd(CLI::App& rules, Request& request) {
    const auto pNew = std::make_shared<NewRule>();
    Rule& rule = pNew->rule;
    rule.szProtocol = "tcp";
    CLI::App* pAdd = AddCommand(rules, "add", "store one more rule");
    pAdd->add_option("name,--name", rule.szName, "what the rule is for");
    pAdd->add_option("--router-port", rule.szRouterPorts, "ports outside: 443, 80,443 or 5000-5010")
        ->type_name("PORTS")
        ->required();
    pAdd->add_option("--box-port", rule.szBoxPorts, "ports on this box, one for each of them (default: the same)")
        ->type_name("PORTS");
    pAdd->add_option("--protocol", rule.szProtocol, "tcp, udp or all, which is both (default: tcp)")
        ->check(OneOf({"tcp", "udp", "all"}))
        ->type_name("WORD");
    pAdd->add_flag("--disabled", pNew->blDisabled, "store it switched off");
    pAdd->add_flag("--force", pNew->blForce, "also when another rule wants the same router port");
    pAdd->footer("Example: tavoportmap rules add web --router-port 443 --box-port 8443\n");
    pAdd->callback([pNew, &request] {
        request.fnCommand = [pNew] {
            Rule rule = pNew->rule;
            rule.blEnabled = !pNew->blDisabled;
            rule.szBoxPorts = rule.szBoxPorts.empty() ? rule.szRouterPorts : rule.szBoxPorts;
            return AddRule(rule, pNew->blForce);
        };
    });
}

void OfferChange(CLI::App& rules, Request& request, const std::string& szVerb, Change enChange,
                 const std::string& szWhat) {
    const auto pId = std::make_shared<std::string>();
    const auto pForce = std::make_shared<bool>(false);
    CLI::App* pVerb = AddCommand(rules, szVerb, szWhat);
    pVerb->add_option("id", *pId, "the rule's id, as 'rules list' shows it")->required();
    if (enChange == Change::kEnable) {
        pVerb->add_flag("--force", *pForce, "also when another rule wants the same router port");
    }
    pVerb->callback([pId, pForce, enChange, &request] {
        request.fnCommand = [pId, pForce, enChange] { return ChangeRule(*pId, enChange, *pForce); };
    });
}

}  // namespace

void OfferRules(CLI::App& app, Request& request) {
    CLI::App* pRules = AddCommand(app, "rules", "the stored rules: list, add, remove, enable, disable");
    pRules->require_subcommand(1);
    pRules->footer("The rules live in /etc/portforward/rule.conf; 'tavoportmap save' writes them to the router.\n");
    AddCommand(*pRules, "list", "show the rules and which of them want the same port")->callback([&request] {
        request.fnCommand = &ListRules;
    });
    OfferAdd(*pRules, request);
    OfferChange(*pRules, request, "remove", Change::kRemove, "forget one rule");
    OfferChange(*pRules, request, "enable", Change::kEnable, "switch one rule on");
    OfferChange(*pRules, request, "disable", Change::kDisable, "switch one rule off and keep it");
}

}  // namespace tavo::cli
