// "detect": what the router in front of the box is. Relies on TLibDetectRouter and TLibGetRouterDetectResult.
// Promises: the process that detection forks never answers a second time; what was found is told also
// when the call as a whole failed; nothing is stored unless --save asks for it.
#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>

#include "Box.h"
#include "Commands.h"
#include "KeysGuard.h"
#include "Progress.h"
#include "Usage.h"
#include "Verdict.h"

namespace tavo::cli {

namespace {

struct Wish {
    bool blSave = false;
    bool blLast = false;
    bool blTrustUpnp = false;
    int nMaxRules = -1;
};

// In the order in which they come; the percentages go back once, the bar does not.
constexpr Step kSteps[] = {
    {10, "preparing", "what was known of the router could not be cleared; the system log says why"},
    {20, "looking at the network interface", "no network interface is up; is the cable plugged in?"},
    {30, "looking at the gateway setting", "the gateway setting could not be read"},
    {40, "trying to reach the Internet", "the Internet cannot be reached"},
    {70, "counting the routers on the way to the Internet", "the way to the Internet could not be looked at"},
    {50, "trying to resolve a name", "names cannot be resolved"},
    {80, "asking the router what it is", "the router could not be asked; the system log says why"},
};

struct Watch {
    Progress progress;
    pid_t nPid;
};

void ShowStep(const DetectResult* pResult, void* pData) {
    auto* pWatch = static_cast<Watch*>(pData);
    if (getpid() != pWatch->nPid) {
        _exit(0);  // the child of detection that has nothing to look for
    }
    if (pResult != nullptr) {
        pWatch->progress.Show(pResult->nProgress, StepAt(kSteps, pResult->nProgress).szDoing);
    }
}

// Detects; the result of the library's call, made with the lock held.
int Detect(DetectResult& result, bool blJson) {
    Watch watch{Progress(blJson), getpid()};
    // What stands in a buffer now would be written by the forked process, too.
    std::fflush(nullptr);
    const int nResult = TLibDetectRouter(&result, &ShowStep, &watch, false);
    if (getpid() != watch.nPid) {
        _exit(0);
    }
    return nResult;
}

// The same with the lock and the run keys looked after: detection switches the daemon of each protocol off that it
// does not find, but it changes no settings, and the daemon that they name goes on. What kept it from beginning, or
// nothing.
std::optional<Reply> DetectGuarded(DetectResult& result, int& nResult, bool blJson) {
    const Lock lock;
    if (!lock.IsHeld()) {
        return Busy();
    }
    const KeysGuard keys;
    if (!keys.Obstacle()) {
        nResult = Detect(result, blJson);
    }
    return keys.Obstacle();
}

Reply Failed(const DetectResult& result) {
    switch (result.errCode) {
        case TAVO_LIBTAVOPORTMAP_ERR_CONFLICT:
            return Busy();
        case TAVO_LIBTAVOPORTMAP_ERR_NO_WAN:
            return {.enExit = kFailed,
                    .szMessage =
                        "the Internet cannot be reached through the gateway; see to the router's own "
                        "connection first (modem, cable, provider), then detect again"};
        case TAVO_LIBTAVOPORTMAP_ERR_DNS:
            return {.enExit = kFailed,
                    .szMessage =
                        "names cannot be resolved; see to the name servers in /etc/resolv.conf or in the "
                        "router's settings, then detect again"};
        default:
            return Failure(StepAt(kSteps, result.nProgress).szFailed);
    }
}

// What the user can do with a verdict that is not stored, or could not be.
std::string NextStep(const DetectResult& result) {
    switch (WayOf(result)) {
        case Way::kUpnp:
        case Way::kNatpmp:
            return "'tavoportmap detect --last --save' stores this as the router's settings";
        case Way::kManual:
            return "this router offers neither UPnP nor NAT-PMP, or has them switched off. Switch one of them on in "
                   "its "
                   "settings and detect again, or have it driven through its own pages:\n"
                   "  tavoportmap routers            shows the models that are known\n"
                   "  tavoportmap router set --brand BRAND --model MODEL --version VERSION --upnp no --natpmp no \\\n"
                   "      --user NAME --conn-type http --conn-port 80";
        default:
            return "nobody has recorded whether this router can be trusted with UPnP. To try it:\n"
                   "  tavoportmap detect --last --save --trust-upnp\n"
                   "then save a rule and look from outside; 'save' says what the router refused";
    }
}

Reply Store(DetectResult result, const std::string& szGateway, const Wish& wish) {
    int nMaxRules = wish.nMaxRules;
    if (wish.blTrustUpnp && result.enSupportUpnp == TAVO_ROUTER_SUPPORT_UNKNOWN && *result.szModel != '\0') {
        result.enSupportUpnp = TAVO_ROUTER_SUPPORT_YES;
        nMaxRules = std::max(nMaxRules, 0);  // nobody knows a limit
    }
    const Way enWay = WayOf(result);
    if (enWay != Way::kUpnp && enWay != Way::kNatpmp) {
        return {.enExit = kFailed, .szMessage = "nothing was stored: " + NextStep(result)};
    }
    __tag_TAVO_ROUTER_CONF conf = {};
    Put(conf.szBrand, result.szBrand);
    Put(conf.szModel, result.szModel);
    Put(conf.szVersion, result.szVersion);
    Put(conf.szSupportUpnp, SupportWord(result.enSupportUpnp));
    Put(conf.szSupportNatpmp, SupportWord(result.enSupportNatpmp));
    return StoreSettings(szGateway, conf, nMaxRules);
}

constexpr char kNoLimit[] =
    "the router is not in the compatibility database, so nobody knows how many rules it holds, and no rules can be "
    "saved; add --max-rules with the number (0: no limit is known)";

// The verdict in words, and with it what storing it came to.
Reply Conclude(const DetectResult& result, const std::string& szGateway, const Wish& wish, bool blLimitMissing) {
    Reply reply;
    if (wish.blSave) {
        reply = Store(result, szGateway, wish);
    } else {
        reply.szMessage = NextStep(result);
    }
    if (blLimitMissing && wish.nMaxRules < 0) {
        reply.rgszWarnings.emplace_back(kNoLimit);
        reply.enExit = reply.enExit == kOk && !wish.blSave ? kFailed : reply.enExit;
    }
    DescribeVerdict(result, reply);
    return reply;
}

Reply RunDetect(const Wish& wish, bool blJson) {
    const auto szGateway = Gateway();
    if (!szGateway) {
        return NoGateway();
    }
    DetectResult result = {};
    result.nMaxRule = -1;
    int nResult = -1;
    if (wish.blLast) {
        nResult = TLibGetRouterDetectResult(&result);
    } else if (const auto obstacle = DetectGuarded(result, nResult, blJson)) {
        return *obstacle;
    }
    // Detection fails as a whole when it found a router whose limit nobody knows; the finding stands.
    const Way enWay = WayOf(result);
    const bool blFound = enWay == Way::kUpnp || enWay == Way::kNatpmp;
    const bool blLimitMissing = nResult != 0 && blFound && result.errCode == 0 && result.nMaxRule < 0;
    if (nResult == 0 || blLimitMissing) {
        return Conclude(result, *szGateway, wish, blLimitMissing);
    }
    Reply reply = Failed(result);
    AddEnvironment(result, reply);
    return reply;
}

}  // namespace

void OfferDetect(CLI::App& app, Request& request) {
    const auto pWish = std::make_shared<Wish>();
    CLI::App* pDetect = AddCommand(app, "detect", "find out what the router is and how to drive it");
    pDetect->add_flag("--save", pWish->blSave, "store the verdict as the router's settings");
    pDetect->add_flag("--last", pWish->blLast, "take the last verdict instead of detecting again");
    pDetect->add_flag("--trust-upnp", pWish->blTrustUpnp,
                      "with --save: use UPnP although nobody has recorded that it works on this model");
    pDetect->add_option("--max-rules", pWish->nMaxRules, "with --save: how many rules the router holds; 0: unknown")
        ->check(NumberBetween(0, 65535))
        ->type_name("NUMBER");
    pDetect->footer(
        "Looks at the interface, the gateway, the way to the Internet and name resolution, then\n"
        "asks the router itself. It takes some seconds, and it opens no port.\n");
    pDetect->callback(
        [pWish, &request] { request.fnCommand = [pWish, &request] { return RunDetect(*pWish, request.blJson); }; });
}

}  // namespace tavo::cli
