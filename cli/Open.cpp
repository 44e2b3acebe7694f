// "open": one port, from nothing to the truth about it. Relies on setup, the save, the listeners of this box and the
// test from outside. Promises: only this port is opened, whatever edits are waiting; what was not looked at is not
// called open; a port that should not face the world is not opened without a word.
#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>

#include "Ask.h"
#include "Box.h"
#include "Commands.h"
#include "Listeners.h"
#include "Open.h"
#include "OpenPort.h"
#include "PortNames.h"
#include "Published.h"
#include "Reach.h"
#include "RuleImport.h"
#include "SaveRules.h"
#include "Setup.h"
#include "Situation.h"
#include "Table.h"
#include "Test.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

struct OpenWish {
    std::string szWhat;
    std::string szTo;
    std::string szName;
    std::string szProtocol;
    bool blYes = false;
};

// The rule that is asked for; a complaint, or nothing when it is one.
std::string MakeRule(const OpenWish& wish, Rule& rule) {
    const auto ports = ReadPortWish(wish.szWhat);
    if (!ports) {
        const std::string szNearest = Nearest(wish.szWhat, PresetNames());
        return fmt::format(
            "'{}' is neither a port nor a name of one{} Write a port from 1 to 65535 such as 443, 5000-5010, 53/udp, a "
            "name of /etc/services, or one of {}; --to names another port of this box",
            Clean(wish.szWhat), szNearest.empty() ? "." : fmt::format("; did you mean '{}'?", szNearest),
            Join(PresetNames()));
    }
    rule.szRouterPorts = ports->szPorts;
    rule.szBoxPorts = wish.szTo.empty() ? ports->szPorts : wish.szTo;
    rule.szProtocol = !wish.szProtocol.empty()    ? wish.szProtocol
                      : ports->szProtocol.empty() ? "tcp"
                                                  : ports->szProtocol;
    rule.szName = wish.szName.empty() ? ports->szName : wish.szName;
    return FaultOf(rule);
}

// ---- before ------------------------------------------------------------------------------------------------

// Why the user does not want this after all; nothing when he does.
std::optional<Reply> Dissuade(const Rule& rule, bool blYes, bool blJson) {
    std::vector<int> rgPorts = *ParsePorts(rule.szBoxPorts);
    const auto rgRouter = *ParsePorts(rule.szRouterPorts);
    std::copy_if(rgRouter.begin(), rgRouter.end(), std::back_inserter(rgPorts),
                 [&](int nPort) { return std::find(rgPorts.begin(), rgPorts.end(), nPort) == rgPorts.end(); });
    const std::vector<std::string> rgszRisks = RisksOf(rgPorts);
    if (rgszRisks.empty() || blYes) {
        return std::nullopt;
    }
    const std::string szRisks = fmt::format("{}", fmt::join(rgszRisks, "\n"));
    if (!blJson && IsAnybodyThere()) {
        return Confirm(szRisks + "\nOpen it to everybody on the Internet all the same?")
                   ? std::nullopt
                   : std::optional(Reply{.enExit = kFailed, .szMessage = "nothing was changed"});
    }
    return Reply{.enExit = kUsage, .szMessage = szRisks + "\nNothing was changed; add --yes to open it all the same"};
}

// Whether the daemon has every port of the rule open, although it could not open all that is asked for.
bool IsSaidOpen(const Rule& rule, const Json::Value& jsPorts) {
    const auto rgPairs = PairsOf(rule).value_or(std::vector<PortPair>());
    return !rgPairs.empty() && std::all_of(rgPairs.begin(), rgPairs.end(), [&](const PortPair& pair) {
        return std::any_of(jsPorts.begin(), jsPorts.end(), [&](const Json::Value& js) {
            return js.isObject() && js["name"] == pair.Name() && js["state"] == "open";
        });
    });
}

// The rule among those in force, and into the router.
Reply SaveOpening(const Rule& rule, bool& blAlready, bool blJson) {
    const Lock lock;
    if (!lock.IsHeld()) {
        return Busy();
    }
    const auto rules = LoadRules();
    if (!rules) {
        return Unreadable();
    }
    if (IsOff()) {
        return {.enExit = kFailed,
                .szMessage = "every port is switched off, and nothing was changed; 'sudo tavoportmap on' comes first"};
    }
    const Opening opening = Open(*rules, rule);
    if (!opening.szFault.empty()) {
        return {.enExit = kUsage, .szMessage = opening.szFault};
    }
    blAlready = opening.blAlready;
    Reply reply = SaveRules(opening.rules, blJson);
    if (reply.enExit == kRefused && IsSaidOpen(rule, reply.jsAnswer["ports"])) {
        reply.szMessage +=
            fmt::format("\nPort {} itself, which was asked for, is open on the router", Clean(rule.szRouterPorts));
    } else if (reply.enExit != kOk && AreStored(opening.rules) && !blAlready) {
        reply.szMessage +=
            fmt::format("\nThe rule stays; 'sudo tavoportmap close {}{}' takes it back", Clean(rule.szRouterPorts),
                        rule.szProtocol == "all" ? "" : "/" + rule.szProtocol);
    }
    return reply;
}

// ---- afterwards --------------------------------------------------------------------------------------------

// What waits for connections at a port of this box; words for whoever expects something there, empty when all is well.
std::string ListenWords(const std::vector<Listener>& rgListeners, const PortPair& pair, Json::Value& jsPort) {
    std::string szLoopback;
    for (const Listener& listener : rgListeners) {
        if (listener.szProtocol != pair.szProtocol || listener.nPort != pair.nBox) {
            continue;
        }
        const std::string szProgram = listener.szProgram.empty() ? "a program" : Clean(listener.szProgram);
        if (!listener.blLoopbackOnly) {
            jsPort["listens"] = szProgram;
            return "";
        }
        szLoopback = fmt::format(
            "{} waits at {} port {}, but only for this box itself ({}): have it listen on every address (0.0.0.0) in "
            "its own settings",
            szProgram, pair.szProtocol, pair.nBox, Clean(listener.szAddress));
    }
    jsPort["listens"] = Json::Value();
    jsPort["loopback_only"] = !szLoopback.empty();
    return !szLoopback.empty() ? szLoopback
                               : fmt::format("no program of this box waits at {} port {} yet, so nobody answers there",
                                             pair.szProtocol, pair.nBox);
}

void AddListeners(const Rule& rule, Reply& reply) {
    constexpr size_t kMostWarnings = 8;
    const std::vector<Listener> rgListeners = ReadListeners();
    size_t nWarnings = 0;
    for (const PortPair& pair : PairsOf(rule).value_or(std::vector<PortPair>())) {
        Json::Value jsPort;
        jsPort["router_port"] = pair.nRouter;
        jsPort["box_port"] = pair.nBox;
        jsPort["protocol"] = pair.szProtocol;
        const std::string szWords = ListenWords(rgListeners, pair, jsPort);
        // A rule for both protocols is mostly there for one of them.
        const bool blOther = rule.szProtocol == "all" && jsPort["loopback_only"] == false &&
                             std::any_of(rgListeners.begin(), rgListeners.end(),
                                         [&](const Listener& listener) { return listener.nPort == pair.nBox; });
        if (!szWords.empty() && !blOther && ++nWarnings <= kMostWarnings) {
            reply.rgszWarnings.push_back(szWords);
        }
        reply.jsAnswer["opened"].append(jsPort);
    }
}

// The router's outside address as the daemon in charge has it.
std::string Outside() {
    for (const char* szProgram : {"upnpd", "natpmpd", "tavoportforward"}) {
        const auto published = ReadPublished(szProgram);
        if (published && published->blSwitchedOn && !published->szOutside.empty()) {
            return published->szOutside;
        }
    }
    return "";
}

std::string AddressToTry(const Rule& rule, const std::string& szOutside) {
    const int nPort = ParsePorts(rule.szRouterPorts)->front();
    const bool blTcp = rule.szProtocol != "udp";
    if (blTcp && nPort == 80) {
        return "http://" + szOutside + "/";
    }
    return blTcp && nPort == 443 ? "https://" + szOutside + "/" : fmt::format("{}:{}", szOutside, nPort);
}

// What a stranger meets: by the checker's word, else where to try it oneself.
void AddOutside(const Rule& rule, bool blJson, Reply& reply) {
    const std::string szOutside = Outside();
    reply.jsAnswer["outside"] = szOutside.empty() ? Json::Value() : Json::Value(szOutside);
    if (!szOutside.empty()) {
        reply.jsAnswer["address"] = AddressToTry(rule, szOutside);
        reply.szBody += fmt::format("from outside it is {}\n", Clean(AddressToTry(rule, szOutside)));
    }
    const std::string szCaveat = ReachCaveat(ReachOf(szOutside));
    if (!szCaveat.empty()) {
        reply.rgszWarnings.push_back(
            fmt::format("the router's address outside is {}, {}. Until then nobody on the Internet reaches the port",
                        Clean(szOutside), szCaveat));
    }
    reply.jsAnswer["outside_kind"] = ToWord(ReachOf(szOutside));
    reply.jsAnswer["tested"] = Json::Value();
    if (CheckerUrl().empty()) {
        reply.szBody += Wrap(
            "try it from elsewhere, such as a phone without Wi-Fi; nobody outside was asked, as no port checker is "
            "named ('tavoportmap test --help')\n",
            WidthOf(STDOUT_FILENO));
        return;
    }
    const Reply tested = TestRules({rule}, blJson);
    reply.szBody += tested.szBody;
    reply.rgszWarnings.insert(reply.rgszWarnings.end(), tested.rgszWarnings.begin(), tested.rgszWarnings.end());
    reply.jsAnswer["tested"] = tested.jsAnswer["ports"];
    const Json::Value& jsPorts = tested.jsAnswer["ports"];  // that nobody listens yet is said already
    if (std::any_of(jsPorts.begin(), jsPorts.end(), [](const Json::Value& js) { return js["status"] == "fail"; })) {
        reply.enExit = kRefused;
        reply.szMessage += ", but it is closed from outside";
    }
}

Reply OpenPorts(const OpenWish& wish, bool blJson) {
    Rule rule;
    if (const std::string szFault = MakeRule(wish, rule); !szFault.empty()) {
        return {.enExit = kUsage, .szMessage = szFault};
    }
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    if (const auto reply = Dissuade(rule, wish.blYes, blJson)) {
        return *reply;
    }
    Reply setup;
    if (!IsRouterKnown()) {
        setup = Setup({.blYes = wish.blYes, .blOffer = false}, blJson);
        if (setup.enExit != kOk) {
            return setup;
        }
    }
    bool blAlready = false;
    Reply reply = SaveOpening(rule, blAlready, blJson);
    reply.szBody = setup.szBody + reply.szBody;
    reply.rgszWarnings.insert(reply.rgszWarnings.begin(), setup.rgszWarnings.begin(), setup.rgszWarnings.end());
    reply.jsAnswer["already"] = blAlready;
    if (reply.enExit != kOk) {
        return reply;
    }
    const std::string szProtocol = rule.szProtocol == "all" ? "tcp and udp" : rule.szProtocol;
    reply.szMessage = fmt::format("port {} ({}) {} on the router{}", Clean(rule.szRouterPorts), szProtocol,
                                  blAlready ? "was open already" : "is open",
                                  rule.szBoxPorts == rule.szRouterPorts
                                      ? ""
                                      : fmt::format(" and leads to port {} of this box", Clean(rule.szBoxPorts)));
    AddListeners(rule, reply);
    AddOutside(rule, blJson, reply);
    return reply;
}

}  // namespace

Reply OpenPort(const std::string& szWhat, bool blJson) {
    OpenWish wish;
    wish.szWhat = szWhat;
    return OpenPorts(wish, blJson);
}

void OfferOpen(CLI::App& app, Request& request) {
    const auto pWish = std::make_shared<OpenWish>();
    CLI::App* pOpen = AddCommand(app, "open", "open a port, and say whether it can be reached");
    pOpen->add_option("port", pWish->szWhat, "443, 5000-5010, 53/udp, or a name such as https, ssh or minecraft")
        ->required();
    pOpen->add_option("--to", pWish->szTo, "the port of this box that it leads to (default: the same)")
        ->type_name("PORTS");
    pOpen->add_option("--name", pWish->szName, "what it is for");
    pOpen->add_option("--protocol", pWish->szProtocol, "tcp, udp or all, which is both (default: tcp)")
        ->check(OneOf({"tcp", "udp", "all"}))
        ->type_name("WORD");
    pOpen->add_flag("--yes", pWish->blYes, "ask nothing, and open also what should not face the world");
    pOpen->footer(
        "Finds out what the router is when that is not known yet, opens the port there and looks at who answers. Edits "
        "by 'rules' that are not saved stay so. 'sudo tavoportmap close' takes it back.\n"
        "Example: sudo tavoportmap open 443 --to 8443 --name web\n");
    pOpen->callback(
        [pWish, &request] { request.fnCommand = [pWish, &request] { return OpenPorts(*pWish, request.blJson); }; });
}

}  // namespace tavo::cli
