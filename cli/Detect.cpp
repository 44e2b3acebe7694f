// "detect": what the router in front of the box is. Relies on Detection. Promises: what was found is told also when
// the call as a whole failed; nothing is stored unless --save asks for it, and nothing is switched off.
#include <fmt/format.h>

#include "Box.h"
#include "Commands.h"
#include "Detection.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

struct Wish {
    bool blSave = false;
    bool blLast = false;
    bool blTrustUpnp = false;
    int nMaxRules = -1;
};

constexpr char kNoLimit[] =
    "nobody has recorded how many rules this router holds, so that no save can tell beforehand when it is full; "
    "--max-rules NUMBER says it, with --save";

// What the user can do with a verdict that is not stored.
std::string NextStep(const Detected& detected) {
    const Finding enFinding = FindingOf(detected);
    switch (enFinding) {
        case Finding::kKnown:
            return "'sudo tavoportmap detect --last --save' stores this as the router's settings";
        case Finding::kNoRouter:
            return FindingWords(enFinding, detected);
        case Finding::kNeither:
        case Finding::kRefusesNatpmp:
            return FindingWords(enFinding, detected) + ", then run 'sudo tavoportmap setup'. " + kManualWay;
        default:
            return FindingWords(enFinding, detected) +
                   "; 'sudo tavoportmap setup' finds a way to drive it and stores that";
    }
}

Reply Store(const Detected& detected, const Wish& wish) {
    DetectResult result = detected.result;
    if (wish.blTrustUpnp && FindingOf(detected) == Finding::kUntested) {
        result.enSupportUpnp = TAVO_ROUTER_SUPPORT_YES;
    }
    const Way enWay = WayOf(result);
    if (enWay != Way::kUpnp && enWay != Way::kNatpmp) {
        return {.enExit = kFailed, .szMessage = "nothing was stored: " + NextStep(detected)};
    }
    __tag_TAVO_ROUTER_CONF conf = {};
    Put(conf.szBrand, result.szBrand);
    Put(conf.szModel, result.szModel);
    Put(conf.szVersion, result.szVersion);
    Put(conf.szSupportUpnp, SupportWord(result.enSupportUpnp));
    Put(conf.szSupportNatpmp, SupportWord(result.enSupportNatpmp));
    return StoreSettings(detected.szGateway, conf, wish.nMaxRules);
}

// The verdict in words, and with it what storing it came to.
Reply Conclude(const Detected& detected, const Wish& wish) {
    Reply reply;
    if (wish.blSave) {
        reply = Store(detected, wish);
    } else {
        reply.szMessage = NextStep(detected);
    }
    if (detected.IsLimitMissing() && wish.nMaxRules < 0) {
        reply.rgszWarnings.emplace_back(kNoLimit);
    }
    DescribeVerdict(detected.result, detected.word, reply);
    return reply;
}

Reply RunDetect(const Wish& wish, bool blJson) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    if (!wish.blSave && (wish.blTrustUpnp || wish.nMaxRules >= 0)) {
        return {.enExit = kUsage, .szMessage = "--trust-upnp and --max-rules say what is stored: with --save"};
    }
    Detected detected{.szGateway = Gateway().value_or("")};
    if (detected.szGateway.empty()) {
        return NoGateway();
    }
    if (wish.blLast) {
        RecallDetection(detected);
    } else {
        const Lock lock;
        if (!lock.IsHeld()) {
            return Busy();
        }
        if (const auto obstacle = Detect(detected, blJson)) {
            return *obstacle;
        }
    }
    // Detection fails as a whole when it found a router whose limit nobody knows; the finding stands.
    if (detected.IsDone()) {
        return Conclude(detected, wish);
    }
    Reply reply = FailedDetection(detected);
    AddEnvironment(detected.result, detected.word, reply);
    return reply;
}

}  // namespace

void OfferDetect(CLI::App& app, Request& request) {
    const auto pWish = std::make_shared<Wish>();
    CLI::App* pDetect = AddCommand(app, "detect", "find out what the router is; 'setup' does this and more");
    pDetect->add_flag("--save", pWish->blSave, "store the verdict as the router's settings");
    pDetect->add_flag("--last", pWish->blLast, "take the last verdict instead of detecting again");
    pDetect->add_flag("--trust-upnp", pWish->blTrustUpnp,
                      "with --save: use UPnP although nobody has recorded that it works on this model");
    pDetect->add_option("--max-rules", pWish->nMaxRules, "with --save: how many rules the router holds; 0: unknown")
        ->check(NumberBetween(0, 65535))
        ->type_name("NUMBER");
    pDetect->footer(
        "Looks at the interface, the gateway, the way to the Internet and name resolution, then asks the router "
        "itself. It takes some seconds, restarts the avahi service, opens no port and closes none.\n");
    pDetect->callback(
        [pWish, &request] { request.fnCommand = [pWish, &request] { return RunDetect(*pWish, request.blJson); }; });
}

}  // namespace tavo::cli
