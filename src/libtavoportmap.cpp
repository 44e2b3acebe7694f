// The entry points with C types that are no longer than themselves: support words, the router lock and the
// busy state, rule arrays, the router description. The longer ones have files of their own. Relies on the
// library's own classes and the platform.
// Promises: arguments are checked before any work, locks are given back on every path.
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iterator>

#include "Border.h"
#include "Entry.h"
#include "Log.h"
#include "Sections.h"
#include "tavo/net.h"

namespace {

constexpr char kTestRuleConf[] = "/etc/portforward/testrule.conf";
constexpr char kTestScript[] = "testupnp.sh";

using tavo::lib::AtBorder;
using tavo::lib::GetRouterLock;
using tavo::lib::kEntryFile;
using tavo::lib::kProgressMarker;
using tavo::lib::kRouterLock;
using tavo::lib::LogError;
using tavo::lib::RouterLock;

// The descriptor of the lock that a caller holds across several calls; one per process.
int gFdRouterLock = -1;

constexpr const char* kSupportWords[] = {"no", "yes", "unknown"};

}  // namespace

namespace tavo::lib {

bool IsGatewayAddress(const char* szGwRouterIP) {
    if (szGwRouterIP == nullptr) {
        return Refuse("%s:%d szGwRouterIP is NULL", kEntryFile, __LINE__);
    }
    return BlTLIBIsIpAddr(szGwRouterIP) != 0 ||
           Refuse("%s:%d szGwRouterIP=%s is not IP format", kEntryFile, __LINE__, szGwRouterIP);
}

bool GetRouterLock(RouterLock& lock, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr) {
    if (lock.Get()) {
        return true;
    }
    LogError("%s:%d PortForward conflict = %s", kEntryFile, __LINE__, kRouterLock);
    if (pErr != nullptr) {
        *pErr = TAVO_LIBTAVOPORTMAP_ERR_CONFLICT;
    }
    return false;
}

bool AddRule(RouterRuleConfWriter& rules, const __tag_TAVO_ROUTER_RULE& rule) {
    if (rules.AddRule(std::string(rule.szRuleID), rule.blEnable, rule.szRouterPort, rule.szSrcPort, rule.szProtocol,
                      rule.szServiceID, rule.szServiceName) == 0) {
        return Refuse("%s:%d add rule failed", kEntryFile, __LINE__);
    }
    return true;
}

}  // namespace tavo::lib

int TLibSupportEnumToString(char* szOut, int nOutSize, __tag_TAVO_ROUTER_SUPPORT enSupport) {
    if (szOut == nullptr) {
        LogError("%s:%d szOut is NULL", kEntryFile, __LINE__);
        return -1;
    }
    const auto nWord = static_cast<unsigned>(enSupport);
    if (nWord >= std::size(kSupportWords)) {
        LogError("%s:%d non-support enum case", kEntryFile, __LINE__);
        return 0;
    }
    if (nOutSize > 0) {
        std::snprintf(szOut, static_cast<size_t>(nOutSize), "%s", kSupportWords[nWord]);
    }
    return 0;
}

int TLibSupportStringToEnum(__tag_TAVO_ROUTER_SUPPORT* pEnSupport, const char* szSupport) {
    if (szSupport == nullptr) {
        LogError("%s:%d szSupport is NULL", kEntryFile, __LINE__);
        return -1;
    }
    if (pEnSupport == nullptr) {
        LogError("%s:%d pEnSupport is NULL", kEntryFile, __LINE__);
        return -1;
    }
    for (size_t i = 0; i < std::size(kSupportWords); ++i) {
        if (std::strcmp(szSupport, kSupportWords[i]) == 0) {
            *pEnSupport = static_cast<__tag_TAVO_ROUTER_SUPPORT>(i);
            return 0;
        }
    }
    LogError("%s:%d non-support szSupport=%s", kEntryFile, __LINE__, szSupport);
    return -1;
}

int TLibFreeRulesArr(__tag_TAVO_ROUTER_RULE* pRules) {
    std::free(pRules);
    return 0;
}

int TLibTavoPortMapLock() {
    if (lock_file(kRouterLock, gFdRouterLock) != 0) {
        return 0;
    }
    // Held elsewhere: a caller that tries again and again must not run out of descriptors.
    unlock_file(gFdRouterLock);
    gFdRouterLock = -1;
    return -1;
}

int TLibTavoPortMapUnLock() {
    if (gFdRouterLock >= 0) {
        unlock_file(gFdRouterLock);
    }
    return 0;
}

int IsSavingRules() {
    const bool blTool = TLIBCIsProcAlive(tavo::lib::kForwardTool) == 1;
    const bool blTestMode = TLIBCIsProcAlive(tavo::lib::kUpnpTestDaemon) != 0;
    const bool blUpnp = !blTestMode && TLIBCIsProcAlive(tavo::lib::kUpnpd) == 1 && TLIBCFileExist(kProgressMarker) == 1;
    const bool blNatpmp = TLIBCIsProcAlive(tavo::lib::kNatpmpd) != 0 && TLIBCFileExist(kProgressMarker) == 1;
    return blTool || blUpnp || blNatpmp ? 1 : 0;
}

int TLibGetLibTavoPortMapRunningTask(__tag_TAVO_LIBTAVOPORTMAP_TASK* pEnTask) {
    const bool blSaving = IsSavingRules() != 0;
    const bool blTesting = TLIBCIsProcAlive(tavo::lib::kUpnpTestDaemon) == 1 || TLIBCIsProcAlive(kTestScript) == 1;
    if (pEnTask == nullptr) {
        LogError("%s:%d enTask is NULL", kEntryFile, __LINE__);
        return -1;
    }
    *pEnTask = TAVO_LIBTAVOPORTMAP_TASK_IDLE;
    if (blTesting) {
        *pEnTask = TAVO_LIBTAVOPORTMAP_TASK_TESTING;
    } else if (blSaving) {
        *pEnTask = TAVO_LIBTAVOPORTMAP_TASK_SAVING;
    }
    return 0;
}

int TLibGetGatewayIP(char* szOutGatewayIP, int nSize) {
    return AtBorder(-1, [&] {
        if (szOutGatewayIP == nullptr) {
            LogError("%s:%d szOutGatewayIP is NULL", kEntryFile, __LINE__);
            return -1;
        }
        std::string szGatewayIP;
        if (GetGatewayIP(szGatewayIP) == 0) {
            LogError("%s:%d GetGatewayIP() failed", kEntryFile, __LINE__);
            return -1;
        }
        if (nSize > 0) {
            std::snprintf(szOutGatewayIP, static_cast<size_t>(nSize), "%s", szGatewayIP.c_str());
        }
        return 0;
    });
}

// ---- rule arrays ------------------------------------------------------------------------------------

namespace {

// Whether the rule file is there. A writer that was killed may have left the rules aside only: the first
// reader brings them back, and "no rules" must not be said before one has looked.
bool IsRuleFileThere(const char* szPath, bool blRuleConf) {
    if (TLIBCFileExist(szPath) == 1) {
        return true;
    }
    const tavo::lib::ConfList pList(blRuleConf ? TAVOPFRuleGet() : TAVOPFTestRuleGet());
    return pList != nullptr || TLIBCFileExist(szPath) == 1;
}

}  // namespace

int GetRulesArrFromConfFile(int* pnRules, __tag_TAVO_ROUTER_RULE** ppRules, bool blRuleConf, char* szIdList,
                            bool blLock, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr) {
    const char* szPath = blRuleConf ? tavo::lib::kRuleConf : kTestRuleConf;
    if (ppRules == nullptr) {
        LogError("%s:%d ppRgRules is NULL", kEntryFile, __LINE__);
        return -1;
    }
    if (pnRules == nullptr) {
        LogError("%s:%d nPRules is NULL", kEntryFile, __LINE__);
        return -1;
    }
    if (pErr != nullptr) {
        *pErr = TAVO_LIBTAVOPORTMAP_ERR_NONE;
    }
    RouterLock lock;
    if (blLock && !GetRouterLock(lock, pErr)) {
        return -1;
    }
    struct stat status = {};
    const bool blExist = IsRuleFileThere(szPath, blRuleConf);
    if (blExist && stat(szPath, &status) != 0) {
        LogError("%s:%d stat(%s) failed", kEntryFile, __LINE__, szPath);
        return -1;
    }
    if (!blExist || status.st_size == 0) {
        *ppRules = nullptr;
        *pnRules = 0;
        return 0;
    }
    TAVO_PF_CONF* pList = blRuleConf ? TAVOPFRuleGetByIdList(szIdList) : TAVOPFTestRuleGetByIdList(szIdList);
    if (pList == nullptr) {
        LogError("%s:%d TAVOPFRuleGetByIdList() failed", kEntryFile, __LINE__);
        return -1;
    }
    // The list is never released: long-standing, and kept.
    if (PF_CONF::ToArray(*pnRules, ppRules, pList) == 0) {
        LogError("%s:%d PF_CONF::ToArray() failed", kEntryFile, __LINE__);
        return -1;
    }
    return 0;
}

int TLibGetRulesArrFromRuleConf(int* pnRules, __tag_TAVO_ROUTER_RULE** ppRules, char* szIdList, bool blLock,
                                __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr) {
    return GetRulesArrFromConfFile(pnRules, ppRules, true, szIdList, blLock, pErr);
}

int TLibGetRulesArrFromTestRuleConf(int* pnRules, __tag_TAVO_ROUTER_RULE** ppRules, char* szIdList, bool blLock,
                                    __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr) {
    return GetRulesArrFromConfFile(pnRules, ppRules, false, szIdList, blLock, pErr);
}

// ---- router description database -----------------------------------------------------------------------

int TLibGetRouterDBList(__tag_TAVO_ROUTERDB_LIST** pplRouterDBList) {
    if (pplRouterDBList == nullptr) {
        LogError("%s:%d pplRouterDBList is NULL", kEntryFile, __LINE__);
        return -1;
    }
    return RouterDB::List(pplRouterDBList) ? 1 : 0;
}

int TLibFreeRouterDBList(__tag_TAVO_ROUTERDB_LIST* plRouterDBList) {
    if (plRouterDBList == nullptr) {
        LogError("%s:%d plRouterDBList is NULL", kEntryFile, __LINE__);
        return -1;
    }
    return RouterDB::FreeList(plRouterDBList) ? 1 : 0;
}

int TLibUpdateRouterDBList(int* pnVersion) {
    if (pnVersion == nullptr) {
        LogError("%s:%d pnVersion is NULL", kEntryFile, __LINE__);
        return -1;
    }
    return RouterDB::Update(*pnVersion) ? 1 : 0;
}

namespace {

// What the description says of the manual router behind szGwRouterIP; nothing to say of another one.
int FillRouterDesc(const char* szGwRouterIP, __tag_TAVO_ROUTER_DESC& routerDesc) {
    RouterConfReader reader{std::string(szGwRouterIP)};
    bool blExist = false;
    if (reader.IsSectionExist(blExist) == 0) {
        LogError("%s:%d szGwRouterIP=%s cause IsSectionExist() failed", kEntryFile, __LINE__, szGwRouterIP);
        return -1;
    }
    if (!blExist) {
        return 0;
    }
    std::string szUpnp;
    std::string szNatpmp;
    if (reader.GetSupportUpnp(szUpnp) == 0 || reader.GetSupportNatpmp(szNatpmp) == 0) {
        LogError("%s:%d critical error, can not get support upnp", kEntryFile, __LINE__);
        return -1;
    }
    if (szUpnp != "no" || szNatpmp != "no") {
        return 0;
    }
    RouterDB db("");  // long-standing: the description is looked up without the gateway's address
    bool blSupport = false;
    if (!db.IsSupportChangePort(blSupport)) {
        LogError("%s:%d get support change port failed", kEntryFile, __LINE__);
        return -1;
    }
    routerDesc.blSupportChangePort = blSupport;
    return 0;
}

}  // namespace

int TLibGetRouterDesc(const char* szGwRouterIP, __tag_TAVO_ROUTER_DESC* routerDesc, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr,
                      bool blLock) {
    return AtBorder(-1, [&] {
        if (pErr != nullptr) {
            *pErr = TAVO_LIBTAVOPORTMAP_ERR_FAILED;
        }
        if (routerDesc == nullptr) {
            LogError("%s:%d routerDesc is NULL", kEntryFile, __LINE__);
            return -1;
        }
        routerDesc->blSupportChangePort = false;
        if (!tavo::lib::IsGatewayAddress(szGwRouterIP)) {
            return -1;
        }
        RouterLock lock;
        if (blLock && !GetRouterLock(lock, pErr)) {
            return -1;
        }
        return FillRouterDesc(szGwRouterIP, *routerDesc);
    });
}
