// "close", "off" and "on": ports closed at once, for good or for a while. Relies on the rules in force and on the save.
// Promises: edits that are not saved stay so; what is closed on the router is said only when the router says so.
#include <fmt/format.h>

#include <algorithm>

#include "Box.h"
#include "Commands.h"
#include "OpenPort.h"
#include "PortNames.h"
#include "SaveRules.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

// Has fnChange change the rules in force and saves them. fnChange answers what there is to say when nothing is to be
// saved; fnDone completes the reply to a save whose rules are in rule.conf.
Reply Change(bool blJson, const std::function<std::optional<Reply>(Rules&)>& fnChange,
             const std::function<void(Reply&)>& fnDone) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    const Lock lock;
    if (!lock.IsHeld()) {
        return Busy();
    }
    auto rules = LoadRules();
    if (!rules) {
        return Unreadable();
    }
    if (const auto reply = fnChange(*rules)) {
        return *reply;
    }
    Reply reply = SaveRules(*rules, blJson);
    if (AreStored(*rules)) {
        fnDone(reply);
    }
    return reply;
}

// ---- close -------------------------------------------------------------------------------------------------

// The ports that a word means: a number is a port, whatever rules are called; else those of the rules with this name,
// else those that the word stands for. Nothing when it means none.
std::optional<std::vector<PortPair>> Meant(const Rules& rules, const std::string& szWord) {
    const auto wish = ReadPortWish(szWord);
    Rules named;
    std::copy_if(rules.begin(), rules.end(), std::back_inserter(named),
                 [&](const Rule& rule) { return !szWord.empty() && rule.szName == szWord; });
    if (!named.empty() && !(wish && wish->szName.empty())) {
        return PairsOf(named);
    }
    if (!wish) {
        return std::nullopt;
    }
    // Without a word for the protocol both are meant: what is closed is not opened by mistake.
    const std::string szProtocol = szWord.find('/') == std::string::npos ? "all" : wish->szProtocol;
    return PairsOf(Rule{"", true, szProtocol, wish->szPorts, wish->szPorts, "", ""});
}

// Whether the daemon has taken away all that is not asked for, although not all that is asked for is open.
bool IsNothingLeft(const Json::Value& jsAnswer) {
    const Json::Value& jsPorts = jsAnswer["ports"];
    return !jsAnswer.isMember("left_over") && !jsPorts.empty() && jsPorts[0].isObject();  // else the library's list
}

Reply ClosePorts(const std::vector<std::string>& rgszWords, bool blJson) {
    std::string szWhat = Join(rgszWords);
    size_t nClosed = 0;
    const auto fnChange = [&](Rules& rules) -> std::optional<Reply> {
        std::vector<PortPair> rgAll;
        for (const std::string& szWord : rgszWords) {
            const auto rgPairs = Meant(rules, szWord);
            if (!rgPairs) {
                return Reply{.enExit = kUsage,
                             .szMessage = fmt::format("'{}' is neither a port nor the name of a rule; 'tavoportmap "
                                                      "rules list' shows them",
                                                      Clean(szWord))};
            }
            rgAll.insert(rgAll.end(), rgPairs->begin(), rgPairs->end());
        }
        nClosed = Close(rules, rgAll);
        return nClosed > 0 ? std::nullopt
                           : std::optional(Reply{.szMessage = fmt::format(
                                                     "nothing to close: no rule in force forwards {}", Clean(szWhat))});
    };
    return Change(blJson, fnChange, [&](Reply& reply) {
        reply.jsAnswer["closed"] = static_cast<Json::UInt>(nClosed);
        if (reply.enExit == kOk) {
            reply.szMessage = fmt::format("{} closed; {}", Clean(szWhat), reply.szMessage);
        } else if (reply.enExit == kRefused && IsNothingLeft(reply.jsAnswer)) {
            reply.szMessage += fmt::format("\n{} itself, which was to be closed, is closed", Clean(szWhat));
        }
    });
}

// ---- off, on -----------------------------------------------------------------------------------------------

Reply Off(bool blJson) {
    bool blNoted = false;
    const auto fnChange = [&](Rules& rules) -> std::optional<Reply> {
        Rules on;
        std::copy_if(rules.begin(), rules.end(), std::back_inserter(on),
                     [](const Rule& rule) { return rule.blEnabled; });
        if (on.empty()) {
            return Reply{.szMessage = IsOff() ? "every port is switched off already; 'tavoportmap on' opens them again"
                                              : "nothing to switch off: no rule in force opens a port"};
        }
        if (!StoreOff(on)) {
            return Failure(
                "what to switch on again could not be noted in /etc/portforward; is the disk full or "
                "read-only? Nothing was changed");
        }
        blNoted = true;
        for (Rule& rule : rules) {
            rule.blEnabled = false;
        }
        return std::nullopt;
    };
    bool blStored = false;
    Reply reply = Change(blJson, fnChange, [&](Reply& done) {
        blStored = true;
        if (done.enExit == kOk) {
            done.szMessage = "every port is closed, and the rules are kept; 'tavoportmap on' opens them again";
        }
    });
    if (blNoted && !blStored) {
        DropOff();
    }
    reply.jsAnswer["off"] = IsOff();
    return reply;
}

// Switches on what was on before.
void SwitchOn(Rules& rules, const Rules& before) {
    for (Rule rule : before) {
        rule.blEnabled = false;
        const auto pRule = std::find_if(rules.begin(), rules.end(), [&](const Rule& there) {
            return !there.blEnabled && there.szId == rule.szId && IsSameContent(there, rule);
        });
        const auto pSame =
            pRule != rules.end() ? pRule : std::find_if(rules.begin(), rules.end(), [&](const Rule& there) {
                return IsSameContent(there, rule);
            });
        if (pSame != rules.end()) {
            pSame->blEnabled = true;
        }
    }
}

Reply On(bool blJson) {
    const auto fnChange = [](Rules& rules) -> std::optional<Reply> {
        Rules before;
        const ReadState enState = ReadOff(before);
        if (enState == ReadState::kUnreadable) {
            return Failure(
                "what 'off' has switched off cannot be read (/etc/portforward/rules.off); 'tavoportmap rules list' "
                "shows the rules, 'tavoportmap rules enable RULE' and 'tavoportmap save' open one again");
        }
        if (enState == ReadState::kAbsent) {
            DropOff();
            return Reply{.szMessage = "nothing to switch on: no rule in force is one that 'tavoportmap off' closed"};
        }
        SwitchOn(rules, before);
        return std::nullopt;
    };
    Reply reply = Change(blJson, fnChange, [](Reply&) { DropOff(); });
    reply.jsAnswer["off"] = IsOff();
    return reply;
}

}  // namespace

void OfferClose(CLI::App& app, Request& request) {
    const auto pWords = std::make_shared<std::vector<std::string>>();
    CLI::App* pClose = AddCommand(app, "close", "close ports, by number or by the name of a rule");
    pClose->add_option("port", *pWords, "443, 5000-5010, 53/udp, or the name of a rule")->required();
    pClose->footer(
        "The port goes out of the rules in force; of a range the other ports stay. 'rules disable' and 'save' switch a "
        "rule off and keep it.\n");
    pClose->callback(
        [pWords, &request] { request.fnCommand = [pWords, &request] { return ClosePorts(*pWords, request.blJson); }; });
    CLI::App* pOff = AddCommand(app, "off", "close every port of this box on the router, and keep the rules");
    pOff->footer("It stays so, whatever a service asks for, until 'tavoportmap on'.\n");
    pOff->callback([&request] { request.fnCommand = [&request] { return Off(request.blJson); }; });
    CLI::App* pOn = AddCommand(app, "on", "open again what 'off' has closed");
    pOn->footer("Opens no rule that was switched off before 'off'; 'tavoportmap rules enable' and 'save' do.\n");
    pOn->callback([&request] { request.fnCommand = [&request] { return On(request.blJson); }; });
}

}  // namespace tavo::cli
