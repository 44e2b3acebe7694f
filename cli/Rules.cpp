// "rules": list, add, remove, enable, disable, edit, discard, import, export. Relies on the rule store and the router
// lock. Promises: an edit changes the draft, under the lock, and nothing that is in force; one that would take
// another rule's port is refused unless --force says otherwise, and overlaps that are there are pointed out.
#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <set>

#include "Box.h"
#include "Commands.h"
#include "PortPairs.h"
#include "RuleImport.h"
#include "RuleStore.h"
#include "Table.h"
#include "TextFile.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr char kDirectory[] = "/etc/portforward";

// What brings an edit into force.
const char* Next() {
    return IsOff() ? "not in force yet: while every port is switched off nothing is saved; 'sudo tavoportmap on' comes "
                     "first"
                   : "not in force yet: 'sudo tavoportmap save' writes it to the router";
}

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

// The enabled rule that already wants one of the ports of the rules setIds.
std::string FaultOfOverlap(const Rules& rules, const std::set<std::string>& setIds) {
    for (const Overlap& overlap : OverlapsOf(rules)) {
        if (setIds.count(overlap.szLater) + setIds.count(overlap.szEarlier) > 0) {
            const std::string& szOther = setIds.count(overlap.szLater) != 0 ? overlap.szEarlier : overlap.szLater;
            return fmt::format(
                "rule {} already forwards router port {}; choose another one, or 'rules remove {}', or add --force",
                Clean(szOther), overlap.szPort, Clean(szOther));
        }
    }
    return "";
}

// Reads the rules with their edits, has fnChange change them and keeps them as the draft, all of it under the lock.
// fnChange answers what the user is told; nothing is kept when that is a complaint.
Reply ChangeRules(const std::function<Reply(Rules&)>& fnChange) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    const Lock lock;
    if (!lock.IsHeld()) {
        return Busy();
    }
    auto rules = LoadDraft();
    if (!rules) {
        return Unreadable();
    }
    Reply reply = fnChange(*rules);
    if (reply.enExit == kOk && !StoreDraft(*rules)) {
        return Failure(
            fmt::format("the edit could not be written to {}{}; nothing was changed", kDirectory,
                        access(kDirectory, W_OK) == 0 ? " (is the disk full?)" : ", which is missing or read-only"));
    }
    WarnOfOverlaps(*rules, reply);
    return reply;
}

Reply AddRule(Rule rule, bool blForce) {
    if (const std::string szFault = FaultOf(rule); !szFault.empty()) {
        return {.enExit = kUsage, .szMessage = szFault};
    }
    return ChangeRules([&](Rules& rules) -> Reply {
        rule.szId = NextId(rules);
        Rules rulesNew = rules;
        rulesNew.push_back(rule);
        if (const std::string szFault = FaultOfOverlap(rulesNew, {rule.szId}); !szFault.empty() && !blForce) {
            return {.enExit = kUsage, .szMessage = szFault};
        }
        rules = rulesNew;
        Reply reply{.szMessage = fmt::format("rule {} noted, {}", rule.szId, Next())};
        reply.jsAnswer["id"] = rule.szId;
        return reply;
    });
}

// Removes the rule that szWhich names, or has fnEdit change it, whose complaint keeps it as it was.
Reply ChangeRule(const std::string& szWhich, bool blForce, const std::function<std::string(Rule&)>& fnEdit,
                 bool blRemove) {
    return ChangeRules([&](Rules& rules) -> Reply {
        const Choice choice = Choose(rules, szWhich);
        if (choice.nRule == std::string::npos) {
            return {.enExit = kUsage, .szMessage = choice.szFault};
        }
        Rules rulesNew = rules;
        Rule& rule = rulesNew[choice.nRule];
        const std::string szId = rule.szId, szName = Clean(szId + (rule.szName.empty() ? "" : " " + rule.szName));
        if (blRemove) {
            rulesNew.erase(rulesNew.begin() + static_cast<std::ptrdiff_t>(choice.nRule));
        } else if (const std::string szFault = fnEdit(rule); !szFault.empty()) {
            return {.enExit = kUsage, .szMessage = szFault};
        } else if (const std::string szOverlap = FaultOfOverlap(rulesNew, {szId});
                   rule.blEnabled && !blForce && !szOverlap.empty()) {
            return {.enExit = kUsage, .szMessage = szOverlap};
        }
        rules = rulesNew;
        Reply reply{.szMessage =
                        fmt::format("{} of rule {} noted, {}", blRemove ? "removal" : "change", szName, Next())};
        reply.jsAnswer["id"] = szId;
        return reply;
    });
}

// ---- list --------------------------------------------------------------------------------------------------

std::vector<std::string> RowOf(const Rule& rule, const std::string& szState, const std::string& szEdit) {
    return {rule.szId, szState, rule.szProtocol, rule.szRouterPorts, rule.szBoxPorts, rule.szName, szEdit};
}

// Adds what the draft changes; whether it changes anything.
bool ListEdited(const Rules& inForce, const Rules& rules, Reply& reply) {
    Table table({"id", "state", "proto", "router ports", "box ports", "name", ""});
    const std::vector<size_t> rgBefore = Fellows(rules, inForce);
    const std::vector<size_t> rgAfter = Fellows(inForce, rules);
    bool blEdited = false;
    reply.jsAnswer["rules"] = Json::arrayValue;
    reply.jsAnswer["removed"] = Json::arrayValue;
    for (size_t i = 0; i < rules.size(); ++i) {
        const bool blNew = rgBefore[i] == std::string::npos;
        const std::string szChange = blNew ? "new" : IsSameContent(rules[i], inForce[rgBefore[i]]) ? "" : "changed";
        blEdited = blEdited || !szChange.empty();
        table.Add(RowOf(rules[i], rules[i].blEnabled ? "enabled" : "disabled",
                        szChange.empty() ? "" : szChange + ", not saved"));
        Json::Value js = ToJson(rules[i]);
        js["change"] = szChange.empty() ? Json::Value() : Json::Value(szChange);
        reply.jsAnswer["rules"].append(js);
    }
    for (size_t i = 0; i < inForce.size(); ++i) {
        if (rgAfter[i] == std::string::npos) {
            blEdited = true;
            table.Add(RowOf(inForce[i], "removed", "not saved"));
            reply.jsAnswer["removed"].append(ToJson(inForce[i]));
        }
    }
    reply.szBody = table.ToText();
    return blEdited;
}

Reply ListRules() {
    const auto inForce = LoadRules();
    const auto rules = LoadDraft();
    if (!inForce || !rules) {
        return NeedsRoot().value_or(Unreadable());
    }
    Reply reply;
    const bool blEdited = ListEdited(*inForce, *rules, reply);
    reply.jsAnswer["draft"] = blEdited;
    reply.jsAnswer["off"] = IsOff();
    WarnOfOverlaps(*rules, reply);
    if (rules->empty() && inForce->empty()) {
        reply.szMessage =
            "no rules are stored yet; 'sudo tavoportmap open 443' opens a port, or note a rule, for example\n"
            "  sudo tavoportmap rules add web --router-port 443 --box-port 8443";
    } else if (IsOff()) {
        reply.szMessage = fmt::format("every port is switched off; 'sudo tavoportmap on' opens them again{}",
                                      blEdited ? ", which comes before 'save' of what is not saved yet" : "");
    } else if (blEdited) {
        reply.szMessage =
            "not saved yet: 'sudo tavoportmap save' brings it into force (--dry-run shows what that does), "
            "'sudo tavoportmap rules discard' drops it";
    }
    if (IsOffUnreadable()) {
        reply.rgszWarnings.emplace_back(kOffUnreadable);
    }
    return reply;
}

// ---- discard, import, export -------------------------------------------------------------------------------

Reply Discard() {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    const Lock lock;
    if (!lock.IsHeld()) {
        return Busy();
    }
    const bool blAny = HasDraft();
    if (!DropDraft()) {
        return Failure("the edits could not be dropped; is /etc/portforward read-only?");
    }
    Reply reply{.szMessage = blAny ? "the edits are dropped; the rules are those in force"
                                   : "there was nothing to drop: every edit is saved"};
    reply.jsAnswer["dropped"] = blAny;
    return reply;
}

Reply Import(const std::string& szPath, bool blReplace, bool blForce) {
    const auto szText = ReadUsersFile(szPath);
    if (!szText) {
        return {.enExit = kFailed,
                .szMessage = fmt::format("'{}' cannot be read, or is too long to be rules", Clean(szPath))};
    }
    std::string szFault;
    const auto imported = ReadImport(*szText, szFault);
    if (!imported) {
        return {.enExit = kUsage, .szMessage = szFault + "\nNothing was changed"};
    }
    return ChangeRules([&](Rules& rules) -> Reply {
        Rules rulesNew = blReplace ? Rules() : rules;
        std::set<std::string> setIds;
        int nId = std::atoi(NextId(rulesNew).c_str());
        for (Rule rule : *imported) {
            rule.szId = std::to_string(nId++);
            setIds.insert(rule.szId);
            rulesNew.push_back(rule);
        }
        const std::string szOverlap = blForce ? "" : FaultOfOverlap(rulesNew, setIds);
        if (!szOverlap.empty()) {
            return {.enExit = kUsage, .szMessage = szOverlap + "\nNothing was changed"};
        }
        rules = rulesNew;
        Reply reply{.szMessage = fmt::format("{} noted, {}", Count(imported->size(), "rule"), Next())};
        reply.jsAnswer["imported"] = static_cast<Json::UInt>(imported->size());
        return reply;
    });
}

Reply Export() {
    const auto rules = LoadDraft();
    if (!rules) {
        return NeedsRoot().value_or(Unreadable());
    }
    Reply reply;
    Json::Value js;
    js["rules"] = Json::arrayValue;
    for (const Rule& rule : *rules) {
        js["rules"].append(ToJson(rule));
    }
    reply.szBody = js.toStyledString();
    reply.jsAnswer = js;
    return reply;
}

void OfferAdd(CLI::App& rules, Request& request) {
    const auto pNew = std::make_shared<NewRule>();
    Rule& rule = pNew->rule;
    rule.szProtocol = "tcp";
    CLI::App* pAdd = AddCommand(rules, "add", "note one more rule");
    pAdd->add_option("name,--name", rule.szName, "what the rule is for");
    pAdd->add_option("--router-port", rule.szRouterPorts, "ports outside: 443, 80,443 or 5000-5010")
        ->type_name("PORTS")
        ->required();
    pAdd->add_option("--box-port", rule.szBoxPorts, "ports on this box, one for each of them (default: the same)")
        ->type_name("PORTS");
    pAdd->add_option("--protocol", rule.szProtocol, "tcp, udp or all, which is both (default: tcp)")
        ->check(OneOf({"tcp", "udp", "all"}))
        ->type_name("WORD");
    pAdd->add_flag("--disabled", pNew->blDisabled, "note it switched off");
    pAdd->add_flag("--force", pNew->blForce, "also when another rule wants the same router port");
    pAdd->footer("Example: sudo tavoportmap rules add web --router-port 443 --box-port 8443\n");
    pAdd->callback([pNew, &request] {
        request.fnCommand = [pNew] {
            Rule rule = pNew->rule;
            rule.blEnabled = !pNew->blDisabled;
            rule.szBoxPorts = rule.szBoxPorts.empty() ? rule.szRouterPorts : rule.szBoxPorts;
            return AddRule(rule, pNew->blForce);
        };
    });
}

constexpr char kWhich[] = "the rule: its id, its name or its router port";

void OfferChange(CLI::App& rules, Request& request, const std::string& szVerb, const std::string& szWhat,
                 const std::function<std::string(Rule&)>& fnEdit, bool blRemove) {
    const auto pWhich = std::make_shared<std::string>();
    const auto pForce = std::make_shared<bool>(false);
    CLI::App* pVerb = AddCommand(rules, szVerb, szWhat);
    pVerb->add_option("rule", *pWhich, kWhich)->required();
    if (szVerb == "enable") {
        pVerb->add_flag("--force", *pForce, "also when another rule wants the same router port");
    }
    pVerb->callback(
        [=, &request] { request.fnCommand = [=] { return ChangeRule(*pWhich, *pForce, fnEdit, blRemove); }; });
}

struct Edit {
    std::string szWhich;
    Rule rule;
    CLI::App* pApp = nullptr;
    bool blForce = false;

    bool Says(const char* szOption) const { return pApp->count(szOption) > 0; }
};

std::string Apply(const Edit& edit, Rule& rule) {
    const bool blSamePorts = rule.szBoxPorts == rule.szRouterPorts;
    if (edit.Says("--router-port")) {
        rule.szRouterPorts = edit.rule.szRouterPorts;
        rule.szBoxPorts = blSamePorts ? rule.szRouterPorts : rule.szBoxPorts;
    }
    rule.szBoxPorts = edit.Says("--box-port") ? edit.rule.szBoxPorts : rule.szBoxPorts;
    rule.szProtocol = edit.Says("--protocol") ? edit.rule.szProtocol : rule.szProtocol;
    rule.szName = edit.Says("--name") ? edit.rule.szName : rule.szName;
    return FaultOf(rule);
}

void OfferEdit(CLI::App& rules, Request& request) {
    const auto pEdit = std::make_shared<Edit>();
    CLI::App* pVerb = pEdit->pApp = AddCommand(rules, "edit", "change ports, protocol or name of one rule");
    pVerb->add_option("rule", pEdit->szWhich, kWhich)->required();
    pVerb->add_option("--name", pEdit->rule.szName, "what the rule is for");
    pVerb->add_option("--router-port", pEdit->rule.szRouterPorts, "ports outside: 443, 80,443 or 5000-5010")
        ->type_name("PORTS");
    pVerb->add_option("--box-port", pEdit->rule.szBoxPorts, "ports on this box, one for each of them")
        ->type_name("PORTS");
    pVerb->add_option("--protocol", pEdit->rule.szProtocol, "tcp, udp or all, which is both")
        ->check(OneOf({"tcp", "udp", "all"}))
        ->type_name("WORD");
    pVerb->add_flag("--force", pEdit->blForce, "also when another rule wants the same router port");
    pVerb->footer("Example: sudo tavoportmap rules edit web --box-port 9443\n");
    pVerb->callback([pEdit, &request] {
        request.fnCommand = [pEdit]() -> Reply {
            if (!pEdit->Says("--name") && !pEdit->Says("--router-port") && !pEdit->Says("--box-port") &&
                !pEdit->Says("--protocol")) {
                return {
                    .enExit = kUsage,
                    .szMessage = "nothing to change; for example\n  sudo tavoportmap rules edit web --box-port 9443"};
            }
            return ChangeRule(
                pEdit->szWhich, pEdit->blForce, [pEdit](Rule& rule) { return Apply(*pEdit, rule); }, false);
        };
    });
}

void OfferFiles(CLI::App& rules, Request& request) {
    AddCommand(rules, "discard", "drop the edits that are not saved yet")->callback([&request] {
        request.fnCommand = &Discard;
    });
    const auto pPath = std::make_shared<std::string>();
    const auto pReplace = std::make_shared<bool>(false);
    const auto pForce = std::make_shared<bool>(false);
    CLI::App* pImport = AddCommand(rules, "import", "note the rules of a JSON document, all of them or none");
    pImport->add_option("file", *pPath, "the document, as 'rules export' writes it; - for standard input")->required();
    pImport->add_flag("--replace", *pReplace, "in place of the rules that are there");
    pImport->add_flag("--force", *pForce, "also when another rule wants the same router port");
    pImport->footer(
        "A rule is {\"router_ports\": \"443\"} at least; \"box_ports\", \"protocol\" (tcp), \"name\" and \"enabled\" "
        "(true) may follow. The rules stand in a list, or in one under \"rules\".\n");
    pImport->callback([=, &request] { request.fnCommand = [=] { return Import(*pPath, *pReplace, *pForce); }; });
    AddCommand(rules, "export", "print the rules as a JSON document, those that are not saved, too")
        ->callback([&request] { request.fnCommand = &Export; });
}

}  // namespace

void OfferRules(CLI::App& app, Request& request) {
    CLI::App* pRules = AddCommand(app, "rules", "the rules: list, add, remove, enable, disable, edit, import, export");
    pRules->require_subcommand(1);
    pRules->footer(
        "An edit stands aside until 'sudo tavoportmap save' writes the rules to the router; 'rules discard' drops it. "
        "'sudo tavoportmap open' and 'close' do it all at once for a port.\n");
    AddCommand(*pRules, "list", "show the rules, what is not saved yet and which of them want the same port")
        ->callback([&request] { request.fnCommand = &ListRules; });
    OfferAdd(*pRules, request);
    OfferChange(*pRules, request, "remove", "forget one rule", nullptr, true);
    const auto fnSwitch = [](bool blOn) {
        return [blOn](Rule& rule) {
            rule.blEnabled = blOn;
            return std::string();
        };
    };
    OfferChange(*pRules, request, "enable", "switch one rule on", fnSwitch(true), false);
    OfferChange(*pRules, request, "disable", "switch one rule off and keep it", fnSwitch(false), false);
    OfferEdit(*pRules, request);
    OfferFiles(*pRules, request);
}

}  // namespace tavo::cli
