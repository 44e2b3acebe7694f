// Reads settings and judges them. Relies on the library's readers. Promises: see Settings.h.
#include "Settings.h"

#include <fmt/format.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>

#include "Box.h"

namespace tavo::cli {

namespace {

constexpr char kConfFile[] = "/etc/portforward/router.conf";
constexpr char kUserDb[] = "/etc/portforward/router_upnp.db.user";

constexpr char kManualRouter[] =
    "this router is driven through its own pages, where a service's ports are never written; 'sudo tavoportmap open "
    "PORT' "
    "forwards one by a rule of yours";

Found Look(const std::string& szGateway, RouterConf& conf, bool blLock) {
    if (AreUnreadable(szGateway)) {
        return Found::kFailed;
    }
    auto enError = TAVO_LIBTAVOPORTMAP_ERR_NONE;
    const int nResult = TLibGetRouterConf(szGateway.c_str(), &conf, &enError, blLock);
    if (nResult >= 0) {
        return nResult == 0 ? Found::kYes : Found::kNothing;
    }
    if (enError == TAVO_LIBTAVOPORTMAP_ERR_CONFLICT) {
        return Found::kBusy;
    }
    // The limit is the last thing that is looked up, and the only one that may be missing.
    const Way enWay = WayOf(conf.szSupportUpnp, conf.szSupportNatpmp);
    return enWay == Way::kUpnp || enWay == Way::kNatpmp ? Found::kWithoutLimit : Found::kFailed;
}

std::optional<Reply> Obstacle(Found enFound) {
    if (enFound == Found::kBusy) {
        return Busy();
    }
    if (enFound != Found::kFailed) {
        return std::nullopt;
    }
    return Failure(fmt::format(
        "{} cannot be read as settings; it was left as it is. 'sudo tavoportmap setup' puts it aside and starts "
        "anew",
        kConfFile));
}

__TAG_TAVO_ROUTER_INIT_STATE CachedState(const std::string& szGateway) {
    auto enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
    DetectCacheReader reader(szGateway);
    bool blExisted = false;
    if (!DetectCache::IsCacheExisted() || reader.IsSectionExisted(blExisted) == 0 || !blExisted) {
        return TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED;
    }
    return reader.GetType(enState) != 0 ? enState : TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED;
}

// A router of which detection could not tell whether its UPnP works: the recorded test can.
__TAG_TAVO_ROUTER_INIT_STATE RecordedState(const RouterConf& conf) {
    std::string szSupport;
    if (!std::filesystem::exists(kUserDb)) {
        return TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED;
    }
    return RouterUpnpDB(conf.szBrand, conf.szModel, conf.szVersion).GetSupport(szSupport) && szSupport == "yes"
               ? TAVO_ROUTER_INIT_STATE_UPNP_NATPMP
               : TAVO_ROUTER_INIT_STATE_MANUAL;
}

__TAG_TAVO_ROUTER_INIT_STATE StateOf(const Settings& settings) {
    const RouterConf& conf = settings.conf;
    if (settings.enFound == Found::kNothing) {
        return CachedState(settings.szGateway);
    }
    const Way enWay = WayOf(conf.szSupportUpnp, conf.szSupportNatpmp);
    if (enWay == Way::kUpnp || enWay == Way::kNatpmp) {
        return TAVO_ROUTER_INIT_STATE_UPNP_NATPMP;
    }
    return std::string(conf.szSupportUpnp) == "unknown" ? RecordedState(conf) : TAVO_ROUTER_INIT_STATE_MANUAL;
}

}  // namespace

const char kNotDetected[] = "the router has not been detected yet: 'sudo tavoportmap service detect' comes first";

bool AreUnreadable(const std::string& szGateway) {
    std::error_code error;
    bool blExist = false;
    return std::filesystem::file_size(kConfFile, error) > 0 && !error &&
           RouterConfReader(szGateway).IsSectionExist(blExist) == 0;
}

bool PutAside() {
    return std::rename(kConfFile, (std::string(kConfFile) + ".unreadable").c_str()) == 0;
}

std::string OtherGateway(const std::string& szGateway) {
    RouterConfReader reader;
    std::string szSection;
    return reader.GetSectionName(szSection) != 0 && szSection != szGateway ? szSection : "";
}

Settings ReadSettings(bool blLocked) {
    Settings settings;
    settings.obstacle = NeedsRoot();  // the settings are nobody else's to read
    if (settings.obstacle) {
        return settings;
    }
    const auto szGateway = Gateway();
    if (!szGateway) {
        settings.obstacle = NoGateway();
        return settings;
    }
    settings.szGateway = *szGateway;
    settings.enFound = Look(*szGateway, settings.conf, !blLocked);
    settings.obstacle = Obstacle(settings.enFound);
    return settings;
}

ServiceRouter ReadServiceRouter(const Settings& settings) {
    const RouterConf& conf = settings.conf;
    const Found enFound = settings.enFound;
    ServiceRouter router{.blUpnp = enFound == Found::kYes && std::string(conf.szSupportUpnp) == "yes"};
    if (enFound == Found::kWithoutLimit) {
        router.szRefusal =
            "nobody has recorded how many rules the router holds, so no rules can be saved; 'sudo tavoportmap setup' "
            "finds it out";
        return router;
    }
    if (*conf.szMaxRule != '\0') {
        router.nMaxRules = std::atoi(conf.szMaxRule);
    }
    switch (StateOf(settings)) {
        case TAVO_ROUTER_INIT_STATE_UPNP_NATPMP:
            break;
        case TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED:
            router.szRefusal = kNotDetected;
            break;
        case TAVO_ROUTER_INIT_STATE_MANUAL:
            router.szRefusal = kManualRouter;
            break;
        default:
            router.szRefusal = "what is remembered of the router cannot be read; 'sudo tavoportmap setup' does it anew";
    }
    return router;
}

}  // namespace tavo::cli
