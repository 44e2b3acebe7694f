// Puts the daemon's word on a save into words. Relies on Published.h. Promises: see Outcome.h.
#include "Outcome.h"

#include <fmt/format.h>

#include <algorithm>
#include <set>

#include "PortPairs.h"
#include "Table.h"

namespace tavo::cli {

namespace {

const char* ProgramOf(const StoredRouter& router) {
    return router.enWay == Way::kNatpmp ? "natpmpd" : router.enWay == Way::kUpnp ? "upnpd" : "tavoportforward";
}

struct Cause {
    const char* szRouter;
    const char* szWhat;
    const char* szDo;
};

// What keeps a router from being asked; each with what helps.
constexpr Cause kCauses[] = {
    {"unreachable", "the router {} cannot be reached", "look at its power and at the cable, or at the Wi-Fi"},
    {"no_gateway", "this box has no default gateway any more", "'ip route' shows the routes; is the cable plugged in?"},
    {"no_upnp", "the router {} is there, but does not offer UPnP",
     "switch UPnP on in its own pages (http://{}/), or 'sudo tavoportmap setup' looks for another way"},
    {"no_natpmp", "the router {} is there, but does not offer NAT-PMP",
     "switch it on in its own pages (http://{}/), or 'sudo tavoportmap setup' looks for another way"},
    {"silent", "the router {} does not answer", "often it helps to restart the router"},
};
// Pages that nobody serves at their port look the same from here.
constexpr Cause kNoPages = {"unreachable", "the pages of the router {} cannot be reached",
                            "look at its power and at the cable, or at the Wi-Fi, and whether its pages are where "
                            "'sudo tavoportmap router show' says ('router set --conn-type, --conn-port')"};

// Nothing when the router was spoken to.
std::optional<std::string> WhyAway(const Published& published, const std::string& szGateway) {
    const auto pCause = std::find_if(std::begin(kCauses), std::end(kCauses),
                                     [&](const Cause& cause) { return published.szRouter == cause.szRouter; });
    if (pCause == std::end(kCauses)) {
        return std::nullopt;
    }
    const bool blPages = published.szProtocol == "pages";
    const Cause& cause = blPages && published.szRouter == kNoPages.szRouter ? kNoPages : *pCause;
    const std::string szWhat = fmt::format(fmt::runtime(cause.szWhat), szGateway);
    const std::string szDo = fmt::format(fmt::runtime(cause.szDo), szGateway);
    // Of those that are written once nobody tries again.
    const std::string szLater =
        blPages ? fmt::format("'sudo tavoportmap {}' tells it again when it is back", IsOff() ? "off" : "save")
                : "the daemon brings the router in line with them as soon as it is back";
    return fmt::format(
        "{}: nothing was refused, and what is open there is not known. The rules are stored; {}\n{}; 'tavoportmap "
        "status' shows how it is",
        szWhat, szLater, szDo);
}

std::string StateWords(const PublishedRule& rule) {
    switch (rule.enState) {
        case PortState::kOpen:
            return "open";
        case PortState::kRefused:
            return "refused";
        case PortState::kWaiting:
            return "not yet";
        default:
            return "unknown";
    }
}

// Whether it speaks of just these rules: what was published a moment before a save has the same second. What is no
// single port cannot be compared.
bool IsAbout(const Published& published, const Rules& rules) {
    std::set<std::string> setAsked, setSaid;
    for (const Rule& rule : rules) {
        const auto rgPairs = rule.blEnabled ? PairsOf(rule) : std::vector<PortPair>();
        if (!rgPairs) {
            return true;
        }
        for (const PortPair& pair : *rgPairs) {
            setAsked.insert(pair.Name());
        }
    }
    for (const PublishedRule& said : published.rgRules) {
        if (said.nRouterPort == 0) {
            return true;
        }
        setSaid.insert(PortPair{said.szProtocol, said.nRouterPort, said.nBoxPort}.Name());
    }
    return setAsked == setSaid;
}

size_t NotOpen(const Published& published) {
    return static_cast<size_t>(std::count_if(published.rgRules.begin(), published.rgRules.end(),
                                             [](const PublishedRule& r) { return r.enState != PortState::kOpen; }));
}

// What to do about ports that are not open.
const char* Remedy(const Published& published) {
    const bool blAccount =
        published.szRouterWhy.find("password") != std::string::npos ||
        std::any_of(published.rgRules.begin(), published.rgRules.end(), [](const PublishedRule& rule) {
            return rule.enState == PortState::kRefused && rule.szWhy.find("password") != std::string::npos;
        });
    if (published.szProtocol == "pages" && blAccount) {
        return "'sudo tavoportmap router set --ask-password' stores another password, and '--user' another name";
    }
    if (published.szProtocol == "pages" && !published.szRouterWhy.empty()) {
        return "'sudo journalctl -t tavoportforward' says more; 'sudo tavoportmap save' tries again";
    }
    // A router that maps each port of the box but once; another router port would not help.
    const auto nShared = static_cast<size_t>(
        std::count_if(published.rgRules.begin(), published.rgRules.end(), [](const PublishedRule& rule) {
            return rule.enState != PortState::kOpen && rule.szWhy.starts_with("another rule has this port of the box");
        }));
    if (nShared == 0) {
        return "Choose other router ports ('sudo tavoportmap rules edit'), or free them there";
    }
    return nShared == NotOpen(published)
               ? "Choose another port of this box ('sudo tavoportmap rules edit RULE --box-port PORT')"
               : "Choose other router ports ('sudo tavoportmap rules edit') or free them there, and another port of "
                 "this box where another rule has it";
}

}  // namespace

std::optional<Published> PublishedSince(const StoredRouter& router, const Rules& rules, time_t nSince) {
    auto published = ReadPublished(ProgramOf(router));
    const bool blNew = published && published->nAt >= nSince;
    return blNew && (router.enWay == Way::kManual || IsAbout(*published, rules)) ? published : std::nullopt;
}

std::optional<Reply> Unsaid(const StoredRouter& router) {
    const bool blAlive = router.enWay == Way::kNatpmp ? NatpmpDaemon().IsAlive()
                         : router.enWay == Way::kUpnp ? UpnpDaemon().IsAlive()
                                                      : false;
    if (!blAlive) {
        return std::nullopt;
    }
    return Failure(fmt::format(
        "the rules are stored, but {} has not said what became of them, so that nothing is known to be open or closed "
        "on the router; is the disk full ('df /run')? 'tavoportmap status --live' looks again",
        ProgramOf(router)));
}

void AddPorts(const Published& published, bool blAll, Reply& reply) {
    Table table({"port", "state", ""});
    reply.jsAnswer["ports"] = Json::arrayValue;
    for (const PublishedRule& rule : published.rgRules) {
        const bool blOpen = rule.enState == PortState::kOpen;
        if (blAll || !blOpen) {
            table.Add({rule.szName, StateWords(rule), Clean(rule.szWhy) + WhoHas(rule.holder)});
        }
        Json::Value js;
        js["name"] = rule.szName;
        js["state"] = ToWord(rule.enState);
        js["why"] = rule.szWhy.empty() ? Json::Value() : Json::Value(rule.szWhy);
        if (rule.holder) {
            js["holder"]["address"] = rule.holder->szAddress;
            js["holder"]["description"] = rule.holder->szDescription;
        }
        reply.jsAnswer["ports"].append(js);
    }
    for (const PublishedLeftOver& left : published.rgLeftOver) {
        table.Add({left.szName, "still on the router", left.szWhy});
        Json::Value js;
        js["name"] = left.szName;
        js["why"] = left.szWhy;
        reply.jsAnswer["left_over"].append(js);
    }
    reply.szBody += table.ToText();
}

Reply OutcomeOf(const Published& published, const Rules& rules, const std::string& szGateway) {
    Reply reply;
    const auto nOn = std::count_if(rules.begin(), rules.end(), [](const Rule& rule) { return rule.blEnabled; });
    if (const auto szAway = WhyAway(published, szGateway)) {
        AddPorts(published, false, reply);
        reply.szBody.clear();  // the same for each of them
        reply.enExit = kAway;
        reply.szMessage = *szAway;
        return reply;
    }
    AddPorts(published, false, reply);
    const size_t nNot = NotOpen(published);
    const size_t nLeft = published.rgLeftOver.size();
    reply.enExit = nNot + nLeft > 0 ? kRefused : kOk;
    const std::string szOthers =
        nNot == published.rgRules.size() ? "and no other one is asked for" : "the others are in force";
    reply.szMessage =
        nNot > 0    ? fmt::format("{} not open on the router; {}. {}", Count(nNot, "port"), szOthers, Remedy(published))
        : nLeft > 0 ? fmt::format("{} could not be taken away from the router yet; {}", Count(nLeft, "port"),
                                  published.szProtocol != "pages" ? "the daemon goes on trying"
                                  : IsOff()                       ? "'sudo tavoportmap off' tries again"
                                                                  : "the next 'sudo tavoportmap save' tries again")
        : nOn == 0  ? fmt::format("no rule is switched on; the router {} keeps none of ours", szGateway)
                    : fmt::format("{} in force on the router {}", Count(nOn, "rule"), szGateway);
    return reply;
}

}  // namespace tavo::cli
