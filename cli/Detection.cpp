// Runs detections and judges them. Relies on the library's detection, which forks. Promises: see Detection.h.
#include "Detection.h"

#include <fmt/format.h>
#include <unistd.h>

#include <cstdio>

#include "KeysGuard.h"
#include "Progress.h"

namespace tavo::cli {

namespace {

// In the order in which they come; the percentages go back once, the bar does not.
constexpr Step kSteps[] = {
    {10, "preparing", "what was known of the router could not be cleared; the system log says why"},
    {20, "looking at the network interface",
     "no network interface is up and has an address: plug the cable in, or see to the Wi-Fi, then run 'sudo "
     "tavoportmap setup'"},
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

void Run(Detected& detected, bool blJson) {
    Watch watch{Progress(blJson), getpid()};
    // What stands in a buffer now would be written by the forked process, too.
    std::fflush(nullptr);
    detected.nResult = TLibDetectRouter(&detected.result, &ShowStep, &watch, false);
    if (getpid() != watch.nPid) {
        _exit(0);
    }
}

void AskGateway(Detected& detected) {
    detected.word.nThere = 1;
    detected.word.nNatpmp = TAVO_NET_NATPMP_SILENT;
    TAVONetGatewayAsk(&detected.word);
}

std::string Pages(const Detected& detected) {
    return fmt::format("http://{}/", Clean(detected.szGateway));
}

}  // namespace

const char kManualWay[] =
    "Where it has neither, it can be driven through its own pages when its model is described:\n"
    "  tavoportmap routers BRAND    shows the models that are\n"
    "  sudo tavoportmap router set --brand BRAND --model MODEL --version VERSION \\\n"
    "      --upnp no --natpmp no --user NAME --conn-type http --conn-port 80";

bool Detected::IsKnown() const {
    const Way enWay = WayOf(result);
    return enWay == Way::kUpnp || enWay == Way::kNatpmp;
}

bool Detected::IsLimitMissing() const {
    return nResult != 0 && IsKnown() && result.errCode == 0 && result.nMaxRule < 0;
}

std::optional<Reply> Detect(Detected& detected, bool blJson) {
    const KeysGuard keys;
    if (keys.Obstacle()) {
        return keys.Obstacle();
    }
    detected.result.nMaxRule = -1;
    Run(detected, blJson);
    detected.blUpnpAnswers = UpnpDetector().IsAbleToGetBrandModelVersion();
    AskGateway(detected);
    return std::nullopt;
}

void RecallDetection(Detected& detected) {
    detected.result.nMaxRule = -1;
    detected.nResult = TLibGetRouterDetectResult(&detected.result);
    detected.blUpnpAnswers = UpnpDetector().IsAbleToGetBrandModelVersion();
    detected.word.nThere = 1;
    detected.word.nNatpmp = TAVO_NET_NATPMP_SILENT;
}

Reply FailedDetection(const Detected& detected) {
    switch (detected.result.errCode) {
        case TAVO_LIBTAVOPORTMAP_ERR_CONFLICT:
            return Busy();
        case TAVO_LIBTAVOPORTMAP_ERR_NO_WAN:
            return {.enExit = kFailed,
                    .szMessage =
                        detected.word.nThere == 0
                            ? fmt::format("the router {} does not answer at all: is it switched on, and is the cable "
                                          "to it plugged in? See to it, then run 'sudo tavoportmap setup'",
                                          Clean(detected.szGateway))
                            : fmt::format("the router {} is there, but the Internet cannot be reached through it: see "
                                          "to its own connection (modem, cable, provider; its pages are at {}), then "
                                          "run 'sudo tavoportmap setup'",
                                          Clean(detected.szGateway), Pages(detected))};
        case TAVO_LIBTAVOPORTMAP_ERR_DNS:
            return {.enExit = kFailed,
                    .szMessage =
                        "names cannot be resolved: see to the name servers in /etc/resolv.conf or in the "
                        "router's settings, then run 'sudo tavoportmap setup'"};
        default:
            return Failure(StepAt(kSteps, detected.result.nProgress).szFailed);
    }
}

bool SpeaksNatpmp(const TAVO_NET_GATEWAY_WORD& word) {
    return word.nNatpmp == TAVO_NET_NATPMP_OK || word.nNatpmp == TAVO_NET_NATPMP_OFFLINE;
}

Finding FindingOf(const Detected& detected) {
    const DetectResult& result = detected.result;
    if (detected.IsKnown()) {
        return Finding::kKnown;
    }
    if (detected.blUpnpAnswers && result.enSupportUpnp == TAVO_ROUTER_SUPPORT_UNKNOWN) {
        return Finding::kUntested;
    }
    if (SpeaksNatpmp(detected.word)) {
        return Finding::kSpeaksNatpmp;
    }
    if (detected.blUpnpAnswers) {
        const bool blNamed = *result.szBrand != '\0' || *result.szModel != '\0' || *result.szVersion != '\0';
        return blNamed ? Finding::kDistrusted : Finding::kNameless;
    }
    if (result.nProgress > 0 && result.nPublicIPLevel == 0) {
        return Finding::kNoRouter;
    }
    return detected.word.nNatpmp > 0 ? Finding::kRefusesNatpmp : Finding::kNeither;
}

std::string FindingWords(Finding enFinding, const Detected& detected) {
    const DetectResult& result = detected.result;
    const std::string szRouter = Clean(detected.szGateway);
    switch (enFinding) {
        case Finding::kKnown:
            return fmt::format("the router {} can be driven by {}", szRouter, ToWords(WayOf(result)));
        case Finding::kUntested:
            return fmt::format("the router {} answers UPnP, and nobody has recorded how far its model can be relied on",
                               szRouter);
        case Finding::kDistrusted:
            return fmt::format(
                "the router {} answers UPnP, but the compatibility database says that its model cannot be relied on",
                szRouter);
        case Finding::kNameless:
            return fmt::format("the router {} answers UPnP, but does not say what it is", szRouter);
        case Finding::kSpeaksNatpmp:
            return fmt::format("the router {} answers NAT-PMP", szRouter);
        case Finding::kRefusesNatpmp:
            return fmt::format(
                "the router {} answers NAT-PMP but refuses to be used: switch it, or UPnP, on in its pages "
                "at {}",
                szRouter, Pages(detected));
        case Finding::kNoRouter:
            return "this box has a public address of its own: no router stands in the way, and every program that "
                   "listens here can be reached already, unless a firewall of this box keeps it closed";
        default:
            return fmt::format(
                "the router {} answers neither UPnP nor NAT-PMP; on most routers both are switched off at "
                "first: switch UPnP on in its pages at {}",
                szRouter, Pages(detected));
    }
}

}  // namespace tavo::cli
