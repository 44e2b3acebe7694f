// What is known of the gateway, from its settings, else from the cache of the last detection. Relies on
// the stores' readers. Promises: see InitState.h.
#include "InitState.h"

#include <memory>

#include "Log.h"
#include "Paths.h"
#include "src/merge/MergeHost.h"
#include "tavo/core.h"

namespace tavo::lib {

namespace {

using State = __TAG_TAVO_ROUTER_INIT_STATE;
using Conf = __tag_TAVO_ROUTER_CONF;

bool ToSupport(__tag_TAVO_ROUTER_SUPPORT& enSupport, const char* szSupport) {
    return TLibSupportStringToEnum(&enSupport, szSupport) == 0 ||
           Refuse("%s:%d TLibSupportStringToEnum(%s) failed", kHopLinkFile, __LINE__, szSupport);
}

// A section whose state is missing or makes no sense counts as absent: only a new detection can replace it.
State FromCache(const std::string& szGateway) {
    DetectCacheReader reader(szGateway);
    bool blExisted = false;
    if (!DetectCache::IsCacheExisted() || reader.IsSectionExisted(blExisted) == 0 || !blExisted) {
        return TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED;
    }
    State enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
    return reader.GetType(enState) != 0 ? enState : TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED;
}

// A router whose UPnP nobody could tell: the verdict of the compatibility test.
bool FromCompatibilityTest(State& enState, const Conf& conf) {
    if (TLIBCFileExist(kUpnpUserDb) != 1) {
        LogError("%s:%d file not exist=%s, this is case of compatibility fail", kHopLinkFile, __LINE__, kUpnpUserDb);
        enState = TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED;
        return true;
    }
    RouterUpnpDB db(conf.szBrand, conf.szModel, conf.szVersion);
    std::string szSupport;
    if (!db.GetSupport(szSupport)) {
        return Refuse("%s:%d db.GetSupport() failed", kHopLinkFile, __LINE__);
    }
    auto enSupport = TAVO_ROUTER_SUPPORT_UNKNOWN;
    if (!ToSupport(enSupport, szSupport.c_str())) {
        return false;
    }
    enState = enSupport == TAVO_ROUTER_SUPPORT_YES ? TAVO_ROUTER_INIT_STATE_UPNP_NATPMP : TAVO_ROUTER_INIT_STATE_MANUAL;
    return true;
}

bool FromConf(State& enState, const Conf& conf) {
    auto enUpnp = TAVO_ROUTER_SUPPORT_UNKNOWN;
    auto enNatpmp = TAVO_ROUTER_SUPPORT_UNKNOWN;
    if (!ToSupport(enUpnp, conf.szSupportUpnp) || !ToSupport(enNatpmp, conf.szSupportNatpmp)) {
        return false;
    }
    if (enUpnp == TAVO_ROUTER_SUPPORT_YES || enNatpmp == TAVO_ROUTER_SUPPORT_YES) {
        enState = TAVO_ROUTER_INIT_STATE_UPNP_NATPMP;
        return true;
    }
    if (enUpnp != TAVO_ROUTER_SUPPORT_UNKNOWN) {
        enState = TAVO_ROUTER_INIT_STATE_MANUAL;
        return true;
    }
    return FromCompatibilityTest(enState, conf);
}

}  // namespace

int GetInitState(State* pState) {
    std::string szGateway;
    if (GetGatewayIP(szGateway) == 0) {
        LogError("%s:%d get gateway ip failed", kHopLinkFile, __LINE__);
        return -1;
    }
    const auto pConf = std::make_unique<Conf>();
    auto enErr = TAVO_LIBTAVOPORTMAP_ERR_NONE;
    const int nResult = TLibGetRouterConf(szGateway.c_str(), pConf.get(), &enErr, false);
    if (nResult < 0) {
        LogError("%s:%d TLibGetRouterConf() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    if (nResult > 0) {
        *pState = FromCache(szGateway);
        return 0;
    }
    return FromConf(*pState, *pConf) ? 0 : -1;
}

}  // namespace tavo::lib
