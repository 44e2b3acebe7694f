// "close", "off" and "on": ports closed at once, for good or for a while. Relies on the rules in force and on the save.
// Promises: edits that are not saved stay so; what is closed on the router is said only when the router says so.
#include <fmt/format.h>

#include <algorithm>
#include <map>
#include <set>

#include "Box.h"
#include "Commands.h"
#include "OpenPort.h"
#include "Pages.h"
#include "PortNames.h"
#include "SaveRules.h"
#include "StoredRouter.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr char kUnnoted[] =
    "what to switch on again could not be noted in /etc/portforward; is the disk full or read-only? Nothing was "
    "changed";

constexpr char kOffAlready[] = "every port is switched off already; 'sudo tavoportmap on' opens them again";

// Has fnChange change the rules in force and saves them. fnChange answers what there is to say when nothing is to be
// saved; fnDone completes the reply to a save whose rules are in rule.conf; fnUnreadable does what can be done of rules
// that cannot be read.
Reply Change(bool blJson, const std::function<std::optional<Reply>(Rules&)>& fnChange,
             const std::function<void(Reply&)>& fnDone, const std::function<Reply()>& fnUnreadable = Unreadable) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    const Lock lock;
    if (!lock.IsHeld()) {
        return Busy();
    }
    auto rules = LoadRules();
    if (!rules) {
        return fnUnreadable();
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

// What a word means.
struct Meaning {
    std::set<std::string> setPorts;     // "443/tcp"
    std::optional<std::string> szRule;  // only of rules with this name; nothing: whatever they are called
    bool blNameless = false;            // and of rules without a name

    bool IsOf(const Rule& rule) const {
        return !szRule || rule.szName == *szRule || (blNameless && rule.szName.empty());
    }
    bool Has(const PortPair& pair) const { return setPorts.count(pair.Name()) > 0; }
};

std::set<std::string> NamesOf(const std::vector<PortPair>& rgPairs) {
    std::set<std::string> setNames;
    for (const PortPair& pair : rgPairs) {
        setNames.insert(pair.Name());
    }
    return setNames;
}

// A number is a port, whatever rules are called; else a word is the name of a rule, and else the name of ports. Such a
// name is no order to close what somebody has called otherwise. Nothing when it means none.
std::optional<Meaning> Meant(const Rules& rules, const std::string& szWord) {
    const auto wish = ReadPortWish(szWord);
    Rules named;
    std::copy_if(rules.begin(), rules.end(), std::back_inserter(named),
                 [&](const Rule& rule) { return !szWord.empty() && rule.szName == szWord; });
    const bool blNumber = wish && wish->szName.empty();
    if (!named.empty() && !blNumber) {
        return Meaning{NamesOf(PairsOf(named)), szWord};
    }
    if (!wish) {
        return std::nullopt;
    }
    // Without a word for the protocol both are meant: what is closed is not opened by mistake.
    const std::string szProtocol = szWord.find('/') == std::string::npos ? "all" : wish->szProtocol;
    const auto rgPairs = PairsOf(Rule{"", true, szProtocol, wish->szPorts, wish->szPorts, "", ""});
    return Meaning{NamesOf(rgPairs.value_or(std::vector<PortPair>())),
                   blNumber ? std::nullopt : std::optional(wish->szName), !blNumber};
}

// "443/tcp, 5000-5002/udp"
std::string Text(const std::vector<PortPair>& rgPairs, const char* szBetween = ", ") {
    std::map<std::string, std::set<int>> mapPorts;
    for (const PortPair& pair : rgPairs) {
        mapPorts[pair.szProtocol].insert(pair.nRouter);
    }
    std::vector<std::string> rgszTexts;
    for (const auto& [szProtocol, setPorts] : mapPorts) {
        rgszTexts.push_back(PortsText({setPorts.begin(), setPorts.end()}) + "/" + szProtocol);
    }
    return fmt::format("{}", fmt::join(rgszTexts, szBetween));
}

// The ports that a word means and that rules with other names have: how they are closed; empty when there are none.
std::string OthersOf(const Rules& rules, const Meaning& meaning) {
    std::vector<std::string> rgszOthers;
    for (const Rule& rule : rules) {
        const auto rgPairs = rule.blEnabled && !meaning.IsOf(rule) ? PairsOf(rule) : std::nullopt;
        std::vector<PortPair> rgMeant = rgPairs.value_or(std::vector<PortPair>());
        std::erase_if(rgMeant, [&](const PortPair& pair) { return !meaning.Has(pair); });
        if (!rgMeant.empty()) {
            rgszOthers.push_back(fmt::format("Rule {} forwards {}; 'sudo tavoportmap close {}' closes that",
                                             NameOf(rule), Text(rgMeant), Text(rgMeant, " ")));
        }
    }
    return fmt::format("{}", fmt::join(rgszOthers, "\n"));
}

// Whether the rules are stored, and only the router could not be told, by the word of who tells it.
bool IsRouterAway(const Reply& reply) {
    return reply.enExit == kAway && reply.jsAnswer.isMember("ports");
}

// Whether the daemon has taken away all that is not asked for, although not all that is asked for is open.
bool IsNothingLeft(const Json::Value& jsAnswer) {
    const Json::Value& jsPorts = jsAnswer["ports"];
    return !jsAnswer.isMember("left_over") && !jsPorts.empty() && jsPorts[0].isObject();  // else the library's list
}

// What the words mean all together; a complaint where one of them closes nothing although its ports are open.
std::optional<Reply> Understand(const Rules& rules, const std::vector<std::string>& rgszWords,
                                std::vector<Meaning>& rgMeanings, std::vector<std::string>& rgszOthers) {
    for (const std::string& szWord : rgszWords) {
        const auto wish = ReadPortWish(szWord);
        const std::string szFault = wish ? FaultOfPorts(wish->szPorts) : "";
        if (!szFault.empty()) {
            return Reply{.enExit = kUsage, .szMessage = szFault};
        }
        const auto meaning = Meant(rules, szWord);
        if (!meaning) {
            return Reply{
                .enExit = kUsage,
                .szMessage = fmt::format("'{}' is neither a port nor the name of a rule; 'sudo tavoportmap rules "
                                         "list' shows them",
                                         Clean(szWord))};
        }
        const std::string szOthers = OthersOf(rules, *meaning);
        Rules left = rules;
        const bool blAny = !Close(left, [&](const Rule& rule, const PortPair& pair) {
                                return meaning->IsOf(rule) && meaning->Has(pair);
                            }).empty();
        if (!blAny && !szOthers.empty()) {
            return Reply{
                .enExit = kUsage,
                .szMessage = fmt::format("nothing was closed: no rule is called '{}'. {}", Clean(szWord), szOthers)};
        }
        if (!szOthers.empty()) {
            rgszOthers.push_back(szOthers);
        }
        rgMeanings.push_back(*meaning);
    }
    return std::nullopt;
}

// What 'on' opens again, while ports are closed for good.
class Waiting {
public:
    // Has rules as they will be once 'on' has been said.
    void Take(Rules& rules) {
        mBefore = LoadOff();
        if (mBefore) {
            SwitchOn(rules, *mBefore);
        }
    }
    // The other way round. False when what is left could not be noted. Until the rules are stored the note is good
    // for those that are there as well.
    bool PutBack(Rules& rules) {
        if (!mBefore) {
            return true;
        }
        std::copy_if(rules.begin(), rules.end(), std::back_inserter(mAfter),
                     [](const Rule& rule) { return rule.blEnabled; });
        for (Rule& rule : rules) {
            rule.blEnabled = false;
        }
        Rules both = *mBefore;
        both.insert(both.end(), mAfter.begin(), mAfter.end());
        mBlNoted = StoreOff(both);
        return mBlNoted;
    }
    void End(bool blStored) {
        if (!mBlNoted) {
            return;
        }
        if (blStored && mAfter.empty()) {
            DropOff();
        } else {
            StoreOff(blStored ? mAfter : *mBefore);
        }
    }
    bool IsAny() const { return mBefore.has_value(); }
    size_t Left() const { return mAfter.size(); }

private:
    std::optional<Rules> mBefore;
    Rules mAfter;
    bool mBlNoted = false;
};

// What to say once they are closed.
void Describe(const std::vector<PortPair>& rgClosed, const Waiting& waiting, Reply& reply) {
    const std::string szClosed = Text(rgClosed);
    if (reply.enExit == kOk && waiting.IsAny()) {
        reply.szMessage =
            fmt::format("every port was switched off already; {} will not be opened again by 'on', {}", szClosed,
                        waiting.Left() > 0 ? "which brings back the others" : "and no other one waits for it");
    } else if (reply.enExit == kOk) {
        reply.szMessage = fmt::format("{} closed; {}", szClosed, reply.szMessage);
    } else if (IsRouterAway(reply)) {
        reply.szMessage = fmt::format("{} closed on this box, not yet on the router\n{}", szClosed, reply.szMessage);
    } else if (reply.enExit == kRefused && IsNothingLeft(reply.jsAnswer)) {
        reply.szMessage += fmt::format("\n{} itself, which was to be closed, is closed", szClosed);
    }
}

Reply ClosePorts(const std::vector<std::string>& rgszWords, bool blJson) {
    std::vector<PortPair> rgClosed;
    std::vector<std::string> rgszOthers;
    Waiting waiting;
    const auto fnChange = [&](Rules& rules) -> std::optional<Reply> {
        waiting.Take(rules);
        std::vector<Meaning> rgMeanings;
        if (const auto reply = Understand(rules, rgszWords, rgMeanings, rgszOthers)) {
            return reply;
        }
        rgClosed = Close(rules, [&](const Rule& rule, const PortPair& pair) {
            return std::any_of(rgMeanings.begin(), rgMeanings.end(),
                               [&](const Meaning& meaning) { return meaning.IsOf(rule) && meaning.Has(pair); });
        });
        if (rgClosed.empty()) {
            return Reply{.szMessage =
                             fmt::format("nothing to close: no rule in force forwards {}", Clean(Join(rgszWords)))};
        }
        if (!waiting.PutBack(rules)) {
            return Failure(kUnnoted);
        }
        return std::nullopt;
    };
    bool blStored = false;
    const Reply answer = Change(blJson, fnChange, [&](Reply& reply) {
        blStored = true;
        waiting.End(true);
        reply.jsAnswer["closed"] = static_cast<Json::UInt>(rgClosed.size());
        for (const std::string& szName : NamesOf(rgClosed)) {
            reply.jsAnswer["closed_ports"].append(szName);
        }
        reply.rgszWarnings.insert(reply.rgszWarnings.end(), rgszOthers.begin(), rgszOthers.end());
        Describe(rgClosed, waiting, reply);
    });
    if (!blStored) {
        waiting.End(false);
    }
    return answer;
}

// ---- off, on -----------------------------------------------------------------------------------------------

// What the router's own pages forward that are not in use any more goes by their record, whatever the rules are.
Reply OffUnread() {
    Reply reply = Unreadable();
    const StoredRouter router = ReadStoredRouter();
    const auto before = router.blAny && router.enWay == Way::kManual ? std::nullopt : LeftByPages();
    if (before && !before->rgLeftOver.empty()) {
        const auto rgLeft = TakeAwayByPages();
        if (rgLeft.empty()) {
            reply.szMessage += fmt::format(
                "\nThe router's own pages, which are not in use any more, have taken away what they still forwarded: "
                "{}",
                NamesOf(before->rgLeftOver));
        }
        AddLeftByPages(rgLeft, {}, reply);
    }
    return reply;
}

// Said once more it tells the router again, which may not have heard it.
Reply Off(bool blJson) {
    bool blNoted = false;
    bool blAlready = false;
    const auto fnChange = [&](Rules& rules) -> std::optional<Reply> {
        Rules on;
        std::copy_if(rules.begin(), rules.end(), std::back_inserter(on),
                     [](const Rule& rule) { return rule.blEnabled; });
        blAlready = on.empty() && IsOff();
        if (blAlready && Gateway()) {
            return std::nullopt;
        }
        if (on.empty()) {
            return Reply{.szMessage = blAlready ? kOffAlready : "nothing to switch off: no rule in force opens a port"};
        }
        if (!StoreOff(on)) {
            return Failure(kUnnoted);
        }
        blNoted = true;
        for (Rule& rule : rules) {
            rule.blEnabled = false;
        }
        return std::nullopt;
    };
    bool blStored = false;
    const auto fnDone = [&](Reply& done) {
        blStored = true;
        if (done.enExit == kOk) {
            done.szMessage = blAlready
                                 ? kOffAlready
                                 : "every port is closed, and the rules are kept; 'sudo tavoportmap on' opens them "
                                   "again";
        } else if (IsRouterAway(done)) {
            done.szMessage =
                "every port is switched off on this box, not yet on the router; 'sudo tavoportmap on' opens them "
                "again\n" +
                done.szMessage;
        }
    };
    Reply reply = Change(blJson, fnChange, fnDone, OffUnread);
    if (blNoted && !blStored) {
        DropOff();
    }
    reply.jsAnswer["off"] = IsOff();
    return reply;
}

Reply On(bool blJson) {
    const auto fnChange = [](Rules& rules) -> std::optional<Reply> {
        Rules before;
        const ReadState enState = ReadOff(before);
        if (enState == ReadState::kUnreadable) {
            return Failure(kOffUnreadable);
        }
        if (enState == ReadState::kAbsent) {
            DropOff();
            return Reply{.szMessage = "nothing to switch on: no rule in force is one that 'off' closed"};
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
    pOff->footer("It stays so, whatever a service asks for, until 'sudo tavoportmap on'.\n");
    pOff->callback([&request] { request.fnCommand = [&request] { return Off(request.blJson); }; });
    CLI::App* pOn = AddCommand(app, "on", "open again what 'off' has closed");
    pOn->footer("Opens no rule that was switched off before 'off'; 'sudo tavoportmap rules enable' and 'save' do.\n");
    pOn->callback([&request] { request.fnCommand = [&request] { return On(request.blJson); }; });
}

}  // namespace tavo::cli
