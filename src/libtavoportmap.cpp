// The entry points with C types: support words, the router lock and the busy state, rule arrays, the
// router description, router settings, detection, and saving rules. Relies on the library's own classes
// and the platform. Promises: arguments are checked before any work, locks are given back on every path.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "common.h"
#include "tavo/log.h"
#include "tavo/net.h"

namespace {

constexpr char kFile[] = "src/libtavoportmap.cpp";
constexpr char kTestScript[] = "testupnp.sh";
constexpr char kRelayService[] = "tavorelayd";
constexpr char kRouterConfBak[] = "/etc/portforward/router.conf.bak";
constexpr int kWaitPolls = 302;
constexpr unsigned kPollSeconds = 1;

using tavo::lib::AtBorder;
using tavo::lib::FillText;
using tavo::lib::GetRouterLock;
using tavo::lib::kNatpmpRunKey;
using tavo::lib::kProgressMarker;
using tavo::lib::kRouterConf;
using tavo::lib::kRouterLock;
using tavo::lib::kUpnpRunKey;
using tavo::lib::LogError;
using tavo::lib::RouterLock;
using tavo::lib::SetRunKey;

// The descriptor of the lock that a caller holds across several calls; one per process.
int gFdRouterLock = -1;

constexpr const char* kSupportWords[] = {"no", "yes", "unknown"};

}  // namespace

int TLibSupportEnumToString(char* szOut, int nOutSize, __tag_TAVO_ROUTER_SUPPORT enSupport) {
    if (szOut == nullptr) {
        LogError("%s:%d szOut is NULL", kFile, __LINE__);
        return -1;
    }
    const auto nWord = static_cast<unsigned>(enSupport);
    if (nWord >= std::size(kSupportWords)) {
        LogError("%s:%d non-support enum case", kFile, __LINE__);
        return 0;
    }
    if (nOutSize > 0) {
        std::snprintf(szOut, static_cast<size_t>(nOutSize), "%s", kSupportWords[nWord]);
    }
    return 0;
}

int TLibSupportStringToEnum(__tag_TAVO_ROUTER_SUPPORT* pEnSupport, const char* szSupport) {
    if (szSupport == nullptr) {
        LogError("%s:%d szSupport is NULL", kFile, __LINE__);
        return -1;
    }
    if (pEnSupport == nullptr) {
        LogError("%s:%d pEnSupport is NULL", kFile, __LINE__);
        return -1;
    }
    for (size_t i = 0; i < std::size(kSupportWords); ++i) {
        if (std::strcmp(szSupport, kSupportWords[i]) == 0) {
            *pEnSupport = static_cast<__tag_TAVO_ROUTER_SUPPORT>(i);
            return 0;
        }
    }
    LogError("%s:%d non-support szSupport=%s", kFile, __LINE__, szSupport);
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
        LogError("%s:%d enTask is NULL", kFile, __LINE__);
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
            LogError("%s:%d szOutGatewayIP is NULL", kFile, __LINE__);
            return -1;
        }
        std::string szGatewayIP;
        if (GetGatewayIP(szGatewayIP) == 0) {
            LogError("%s:%d GetGatewayIP() failed", kFile, __LINE__);
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
    const char* szPath = blRuleConf ? tavo::lib::kRuleConf : tavo::lib::kTestRuleConf;
    if (ppRules == nullptr) {
        LogError("%s:%d ppRgRules is NULL", kFile, __LINE__);
        return -1;
    }
    if (pnRules == nullptr) {
        LogError("%s:%d nPRules is NULL", kFile, __LINE__);
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
        LogError("%s:%d stat(%s) failed", kFile, __LINE__, szPath);
        return -1;
    }
    if (!blExist || status.st_size == 0) {
        *ppRules = nullptr;
        *pnRules = 0;
        return 0;
    }
    TAVO_PF_CONF* pList = blRuleConf ? TAVOPFRuleGetByIdList(szIdList) : TAVOPFTestRuleGetByIdList(szIdList);
    if (pList == nullptr) {
        LogError("%s:%d TAVOPFRuleGetByIdList() failed", kFile, __LINE__);
        return -1;
    }
    // The list stays with the platform's reader and is not released here.
    if (PF_CONF::ToArray(*pnRules, ppRules, pList) == 0) {
        LogError("%s:%d PF_CONF::ToArray() failed", kFile, __LINE__);
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
        LogError("%s:%d pplRouterDBList is NULL", kFile, __LINE__);
        return -1;
    }
    return RouterDB::List(pplRouterDBList) ? 1 : 0;
}

int TLibFreeRouterDBList(__tag_TAVO_ROUTERDB_LIST* plRouterDBList) {
    if (plRouterDBList == nullptr) {
        LogError("%s:%d plRouterDBList is NULL", kFile, __LINE__);
        return -1;
    }
    return RouterDB::FreeList(plRouterDBList) ? 1 : 0;
}

int TLibUpdateRouterDBList(int* pnVersion) {
    if (pnVersion == nullptr) {
        LogError("%s:%d pnVersion is NULL", kFile, __LINE__);
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
        LogError("%s:%d szGwRouterIP=%s cause IsSectionExist() failed", kFile, __LINE__, szGwRouterIP);
        return -1;
    }
    if (!blExist) {
        return 0;
    }
    std::string szUpnp;
    std::string szNatpmp;
    if (reader.GetSupportUpnp(szUpnp) == 0 || reader.GetSupportNatpmp(szNatpmp) == 0) {
        LogError("%s:%d critical error, can not get support upnp", kFile, __LINE__);
        return -1;
    }
    if (szUpnp != "no" || szNatpmp != "no") {
        return 0;
    }
    RouterDB db("");  // long-standing: the description is looked up without the gateway's address
    bool blSupport = false;
    if (!db.IsSupportChangePort(blSupport)) {
        LogError("%s:%d get support change port failed", kFile, __LINE__);
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
            LogError("%s:%d routerDesc is NULL", kFile, __LINE__);
            return -1;
        }
        routerDesc->blSupportChangePort = false;
        if (szGwRouterIP == nullptr) {
            LogError("%s:%d szGwRouterIP is NULL", kFile, __LINE__);
            return -1;
        }
        if (BlTLIBIsIpAddr(szGwRouterIP) == 0) {
            LogError("%s:%d szGwRouterIP=%s is not IP format", kFile, __LINE__, szGwRouterIP);
            return -1;
        }
        RouterLock lock;
        if (blLock && !GetRouterLock(lock, pErr)) {
            return -1;
        }
        return FillRouterDesc(szGwRouterIP, *routerDesc);
    });
}

// ---- router settings ---------------------------------------------------------------------------------------

namespace {

using RouterConf = __tag_TAVO_ROUTER_CONF;
using ErrorReason = __tag_TAVO_LIBTAVOPORTMAP_ERR;

// UPnP or NAT-PMP drives this router; any other one is driven by its model's script.
bool IsDaemonRouter(const RouterConf& conf) {
    return std::strcmp(conf.szSupportUpnp, "yes") == 0 || std::strcmp(conf.szSupportNatpmp, "yes") == 0;
}

bool IsGatewayArgument(const char* szGwRouterIP, const RouterConf* pConf) {
    if (pConf == nullptr) {
        LogError("%s:%d routerConf is NULL", kFile, __LINE__);
        return false;
    }
    if (szGwRouterIP == nullptr) {
        LogError("%s:%d szGwRouterIP is NULL", kFile, __LINE__);
        return false;
    }
    if (BlTLIBIsIpAddr(szGwRouterIP) == 0) {
        LogError("%s:%d szGwRouterIP=%s is not IP format", kFile, __LINE__, szGwRouterIP);
        return false;
    }
    return true;
}

bool FillIdentity(RouterConfReader& reader, RouterConf& conf) {
    using Getter = int (RouterConfReader::*)(std::string&);
    const struct {
        Getter fnGet;
        char (*pSzField)[TAVO_TEXT_SIZE];
        const char* szNotRead;
        const char* szNotCopied;
    } rgFields[] = {
        {&RouterConfReader::GetBrand, &conf.szBrand, "%s:%d get brand failed", "%s:%d snprintf brand failed"},
        {&RouterConfReader::GetModel, &conf.szModel, "%s:%d get model failed", "%s:%d snprintf model failed"},
        {&RouterConfReader::GetVersion, &conf.szVersion, "%s:%d get version failed", "%s:%d snprintf version failed"},
        {&RouterConfReader::GetSupportUpnp, &conf.szSupportUpnp, "%s:%d get support upnp failed",
         "%s:%d snprintf szSupportUpnp failed"},
        {&RouterConfReader::GetSupportNatpmp, &conf.szSupportNatpmp, "%s:%d get support natpmp failed",
         "%s:%d snprintf szSupportNatpmp failed"},
    };
    for (const auto& field : rgFields) {
        std::string szText;
        if ((reader.*field.fnGet)(szText) == 0) {
            LogError(field.szNotRead, kFile, __LINE__);
            return false;
        }
        if (!FillText(*field.pSzField, szText)) {
            LogError(field.szNotCopied, kFile, __LINE__);
            return false;
        }
    }
    return true;
}

// What a manual router needs beyond its identity; what is not stored is left out.
bool FillAccount(RouterConfReader& reader, RouterConf& conf) {
    using Getter = int (RouterConfReader::*)(std::string&);
    const struct {
        Getter fnGet;
        char (*pSzField)[TAVO_TEXT_SIZE];
        const char* szNotCopied;
    } rgFields[] = {
        {&RouterConfReader::GetConnType, &conf.szConnType, "%s:%d snprintf szConnType failed"},
        {&RouterConfReader::GetConnPort, &conf.szConnPort, "%s:%d snprintf szConnPort failed"},
        {&RouterConfReader::GetUser, &conf.szUser, "%s:%d snprintf szUser failed"},
        {&RouterConfReader::GetPass, &conf.szPass, "%s:%d snprintf szPass failed"},
    };
    for (const auto& field : rgFields) {
        std::string szText;
        if ((reader.*field.fnGet)(szText) != 0 && !FillText(*field.pSzField, szText)) {
            LogError(field.szNotCopied, kFile, __LINE__);
            return false;
        }
    }
    return true;
}

bool FillMaxRule(RouterConf& conf) {
    int nMaxRule = 0;
    if (!RouterUpnpDB(conf.szBrand, conf.szModel, conf.szVersion).GetMaxRule(nMaxRule)) {
        LogError("%s:%d get max rule fail", kFile, __LINE__);
        return false;
    }
    if (std::snprintf(conf.szMaxRule, sizeof(conf.szMaxRule), "%d", nMaxRule) < 0) {
        LogError("%s:%d snprintf szMaxRule failed", kFile, __LINE__);
        return false;
    }
    return true;
}

constexpr int kNothingStored = 1;

// The file may be in order: what failed is the box, which has no memory or no descriptor left, or its disk.
bool IsReadFailure(int nErr) {
    return nErr == TLIBC_ERR_NO_MEMORY || nErr == TLIBC_ERR_OPEN || nErr == TLIBC_ERR_READ;
}

int FillRouterConf(const char* szGwRouterIP, RouterConf& conf) {
    if (TLIBCFileExist(kRouterConf) != 1) {
        LogError("%s:%d file=%s not exists", kFile, __LINE__, kRouterConf);
        return kNothingStored;
    }
    TLIBCErrSet(TLIBC_ERR_NONE, kFile, __LINE__);
    RouterConfReader reader{std::string(szGwRouterIP)};
    bool blExist = false;
    if (reader.IsSectionExist(blExist) == 0) {
        if (IsReadFailure(TLIBCErrGet())) {
            return -1;
        }
        LogError("%s:%d file=%s has wrong format, try to unlink it", kFile, __LINE__, kRouterConf);
        unlink(kRouterConf);
        return kNothingStored;
    }
    if (!blExist) {
        return kNothingStored;
    }
    if (!FillIdentity(reader, conf)) {
        return -1;
    }
    return (IsDaemonRouter(conf) ? FillMaxRule(conf) : FillAccount(reader, conf)) ? 0 : -1;
}

// Storing goes through three outcomes: done, refused before anything was touched, or to be undone.
enum class Stored { kDone, kRefused, kUndo };

bool SetIdentity(RouterConfWriter& writer, const RouterConf& conf) {
    if (conf.szSupportUpnp[0] == '\0') {
        LogError("%s:%d support_upnp shall not be empty", kFile, __LINE__);
        return false;
    }
    if (conf.szSupportNatpmp[0] == '\0') {
        LogError("%s:%d support_natpmp shall not be empty", kFile, __LINE__);
        return false;
    }
    if (writer.SetBrandModelVersion(conf.szBrand, conf.szModel, conf.szVersion) == 0) {
        LogError("%s:%d save config failed", kFile, __LINE__);
        return false;
    }
    if (writer.SetSupportUpnp(conf.szSupportUpnp) == 0) {
        LogError("%s:%d save support upnp failed", kFile, __LINE__);
        return false;
    }
    if (writer.SetSupportNatpmp(conf.szSupportNatpmp) == 0) {
        LogError("%s:%d save support natpmp failed", kFile, __LINE__);
        return false;
    }
    return true;
}

bool SetAccount(RouterConfWriter& writer, const RouterConf& conf) {
    const bool blAccount = conf.szUser[0] != '\0';
    if (writer.SetUserPass(blAccount ? conf.szUser : "", blAccount ? conf.szPass : "") == 0) {
        LogError("%s:%d save user/pass failed", kFile, __LINE__);
        return false;
    }
    if (conf.szConnType[0] == '\0') {
        LogError("%s:%d conntype shall not be empty", kFile, __LINE__);
        return false;
    }
    if (conf.szConnPort[0] == '\0') {
        LogError("%s:%d connport shall not be empty", kFile, __LINE__);
        return false;
    }
    if (writer.SetConnType(conf.szConnType) == 0 || writer.SetConnPort(conf.szConnPort) == 0) {
        LogError("%s:%d save config failed", kFile, __LINE__);
        return false;
    }
    return true;
}

bool RenameOrLog(const char* szFrom, const char* szTo, int nLine) {
    if (rename(szFrom, szTo) == 0) {
        return true;
    }
    LogError("%s:%d can not save backup file of '%s'", kFile, nLine, kRouterConfBak);
    return false;
}

Stored StoreManual(RouterConfWriter& writer, const char* szGwRouterIP, const RouterConf& conf, ErrorReason* pErr) {
    RouterDB db(szGwRouterIP);
    if (!SetAccount(writer, conf)) {
        return Stored::kRefused;
    }
    if (TLIBCFileExist(kRouterConf) == 1 && !RenameOrLog(kRouterConf, kRouterConfBak, __LINE__)) {
        return Stored::kRefused;
    }
    if (writer.Sync() == 0) {
        LogError("%s:%d sync config failed", kFile, __LINE__);
        return Stored::kUndo;
    }
    int nDescribed = 0;
    if (!db.GetSyntaxVersion(nDescribed)) {
        LogError("%s:%d can not get router syntax version", kFile, __LINE__);
        return Stored::kUndo;
    }
    if (IGetCurrSyntaxVersion() < nDescribed) {
        if (pErr != nullptr) {
            *pErr = TAVO_LIBTAVOPORTMAP_ERR_SYNTAX_VERSION;
        }
        LogError("%s:%d syntax version and routerdb version is mis-mtached", kFile, __LINE__);
        return Stored::kUndo;
    }
    return Stored::kDone;
}

Stored StoreDaemonRouter(RouterConfWriter& writer) {
    if (writer.Sync() == 0) {
        LogError("%s:%d sync config failed", kFile, __LINE__);
        return Stored::kUndo;
    }
    return Stored::kDone;
}

int FinishStoring(Stored enStored) {
    switch (enStored) {
        case Stored::kDone:
            if (TLIBCFileExist(kRouterConfBak) == 1) {
                unlink(kRouterConfBak);
            }
            return 0;
        case Stored::kUndo:
            unlink(kRouterConf);
            if (TLIBCFileExist(kRouterConfBak) == 1) {
                RenameOrLog(kRouterConfBak, kRouterConf, __LINE__);
            }
            return -1;
        case Stored::kRefused:
            break;
    }
    return -1;
}

}  // namespace

int TLibGetRouterConf(const char* szGwRouterIP, __tag_TAVO_ROUTER_CONF* routerConf, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr,
                      bool blLock) {
    return AtBorder(-1, [&] {
        if (pErr != nullptr) {
            *pErr = TAVO_LIBTAVOPORTMAP_ERR_NONE;
        }
        RouterLock lock;
        if (!IsGatewayArgument(szGwRouterIP, routerConf) || (blLock && !GetRouterLock(lock, pErr))) {
            return -1;
        }
        return FillRouterConf(szGwRouterIP, *routerConf);
    });
}

int TLibSetRouterConf(const char* szGwRouterIP, __tag_TAVO_ROUTER_CONF* routerConf, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr,
                      bool blLock) {
    return AtBorder(-1, [&] {
        RouterConfWriter writer(false);  // the other gateways' sections go
        if (pErr != nullptr) {
            *pErr = TAVO_LIBTAVOPORTMAP_ERR_FAILED;
        }
        RouterLock lock;
        if (!IsGatewayArgument(szGwRouterIP, routerConf) || (blLock && !GetRouterLock(lock, pErr)) ||
            !SetIdentity(writer, *routerConf)) {
            return -1;
        }
        return FinishStoring(IsDaemonRouter(*routerConf) ? StoreDaemonRouter(writer)
                                                         : StoreManual(writer, szGwRouterIP, *routerConf, pErr));
    });
}

// ---- detection ---------------------------------------------------------------------------------------------

namespace {

using DetectResult = __tag_TAVO_ROUTER_DETECT_RESULT;
using DetectCallback = void (*)(const DetectResult*, void*);

constexpr int kHopsLookedAt = 3;
constexpr int kLevelBehindOneRouter = 1;
constexpr int kLevelUnknown = -1;

enum EnvFlag : int { kEnvGateway = 1, kEnvLevelUnknown = 2, kEnvManyTranslations = 4 };

int SupportOf(const std::string& szVerdict) {
    if (szVerdict == "yes") {
        return TAVO_ROUTER_SUPPORT_YES;
    }
    return szVerdict == "no" ? TAVO_ROUTER_SUPPORT_NO : TAVO_ROUTER_SUPPORT_UNKNOWN;
}

// One detection, from the first check to the record. Each step answers whether to go on.
class Detection {
public:
    Detection(DetectResult& result, DetectCallback pfnCallback, void* pArg)
        : mResult(result), mPfnCallback(pfnCallback), mPArg(pArg) {}

    bool Run(bool blLock, RouterLock& lock);

private:
    void Progress(int nPercent);
    bool CheckInterface();
    void CheckGateway();
    bool CheckWan();
    void CheckPublicLevel();
    bool CheckNames();
    bool RunDetectors(RouterLock& lock);

    DetectResult& mResult;
    DetectCallback mPfnCallback;
    void* mPArg;
};

void Detection::Progress(int nPercent) {
    mResult.nProgress = nPercent;
    if (mPfnCallback != nullptr) {
        mPfnCallback(&mResult, mPArg);
    }
}

bool Detection::CheckInterface() {
    Progress(20);
    char szInterface[TAVO_TEXT_SIZE] = {};
    if (checkGwIfEnable(szInterface, sizeof(szInterface)) != 0) {
        LogError("%s:%d Network interface is not enabled", kFile, __LINE__);
        return false;
    }
    FillText(mResult.szInterface, szInterface);
    return true;
}

void Detection::CheckGateway() {
    Progress(30);
    char szGateway[TAVO_TEXT_SIZE] = {};
    if (checkDefaultGatewaySetting(szGateway, sizeof(szGateway)) != 0) {
        LogError("%s:%d Gateway setting is not correct", kFile, __LINE__);
        mResult.nEnvFlags |= kEnvGateway;
    }
    FillText(mResult.szGateway, szGateway);
}

bool Detection::CheckWan() {
    Progress(40);
    if (checkConnectToWAN() != 0) {
        LogError("%s:%d Can not connect to WAN", kFile, __LINE__);
        mResult.errCode = TAVO_LIBTAVOPORTMAP_ERR_NO_WAN;
        return false;
    }
    return true;
}

void Detection::CheckPublicLevel() {
    Progress(70);
    int nLevel = kLevelUnknown;
    if (getPublicIPLevel(nLevel, kHopsLookedAt) != 0) {
        LogError("%s:%d Unable to get public ip level", kFile, __LINE__);
        mResult.nPublicIPLevel = kLevelUnknown;
        mResult.nEnvFlags |= kEnvLevelUnknown;
        return;
    }
    mResult.nPublicIPLevel = nLevel;
    if (nLevel > kLevelBehindOneRouter) {
        LogError("%s:%d nPublicIPLevel=%d > 1, can not do portforwarding", kFile, __LINE__, nLevel);
        mResult.nEnvFlags |= kEnvManyTranslations;
    }
}

bool Detection::CheckNames() {
    Progress(50);
    if (checkDNSSetting() != 0) {
        LogError("%s:%d DNS setting may be not correct", kFile, __LINE__);
        mResult.errCode = TAVO_LIBTAVOPORTMAP_ERR_DNS;
        return false;
    }
    return true;
}

// The wait for NAT-PMP announcements and the search for UPnP go on at the same time, in two processes.
bool Detection::RunDetectors(RouterLock& lock) {
    const pid_t pid = TLIBCProcFork();
    if (pid < 0) {
        LogError("%s:%d upnp fork error, errno=%s", kFile, __LINE__, std::strerror(errno));
        return false;
    }
    if (pid == 0) {
        std::string szGatewayIP;
        if (GetGatewayIP(szGatewayIP) != 0) {
            signal(SIGCHLD, SIG_DFL);  // a caller that ignores its children's ends would hide those of ours
            NatpmpDetector().Start(szGatewayIP.c_str());
            _exit(0);
        }
        LogError("%s:%d GetGatewayIP() failed", kFile, __LINE__);
        lock.LeaveToParent();  // unlocking would take it from the parent too
        return false;
    }
    UpnpDetector().Start();
    while (waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
    }
    return true;
}

bool Detection::Run(bool blLock, RouterLock& lock) {
    Progress(10);
    if (blLock && !lock.Get()) {
        LogError("%s:%d PortForward conflict = %s", kFile, __LINE__, kRouterLock);
        mResult.errCode = TAVO_LIBTAVOPORTMAP_ERR_CONFLICT;
        return false;
    }
    if (CleanDetectManualCache() == 0) {
        LogError("%s:%d Clean cached file failed", kFile, __LINE__);
        return false;
    }
    if (!CheckInterface()) {
        return false;
    }
    CheckGateway();
    if (!CheckWan()) {
        return false;
    }
    CheckPublicLevel();
    if (!CheckNames()) {
        return false;
    }
    Progress(80);
    LogError("%s:%d All network env checks are pass", kFile, __LINE__);
    int nVersion = 0;
    if (!RouterUpnpDB::Update(nVersion)) {
        LogError("%s:%d upgrade db fail", kFile, __LINE__);
    }
    if (!RunDetectors(lock)) {
        return false;
    }
    if (DETECT_INFO::fillRouterDetectResult(&mResult) < 0) {
        LogError("%s:%d fillRouterDetectResult failed", kFile, __LINE__);
        return false;
    }
    return true;
}

// Who the router is, in the words of the protocol that could tell.
void FillModel(DetectResult& result, UpnpDetector& upnp, NatpmpDetector& natpmp) {
    if (upnp.IsAbleToGetBrandModelVersion()) {
        FillText(result.szBrand, upnp.GetBrand());
        FillText(result.szModel, upnp.GetModel());
        FillText(result.szVersion, upnp.GetVersion());
    } else if (result.enSupportNatpmp == TAVO_ROUTER_SUPPORT_YES) {
        FillText(result.szUserSettingName, natpmp.GetUserSettingName());
        FillText(result.szBrand, natpmp.GetBrand());
        FillText(result.szModel, natpmp.GetModel());
        FillText(result.szVersion, natpmp.GetVersion());
    }
}

}  // namespace

int DETECT_INFO::fillRouterDetectResult(__tag_TAVO_ROUTER_DETECT_RESULT* detectResult) {
    return AtBorder(-1, [&] {
        if (detectResult == nullptr) {
            LogError("%s:%d detectResult is NULL", kFile, __LINE__);
            return -1;
        }
        NatpmpDetector natpmp;
        detectResult->enSupportNatpmp = SupportOf(natpmp.GetSupportNatpmp());
        UpnpDetector upnp;
        detectResult->enSupportUpnp = SupportOf(upnp.GetSupportUpnp());
        if (detectResult->enSupportUpnp == TAVO_ROUTER_SUPPORT_YES) {
            FillText(detectResult->szUpnpPfPath, upnp.GetPfPath());
        }
        FillModel(*detectResult, upnp, natpmp);
        int nMaxRule = -1;
        const bool blSupported = detectResult->enSupportUpnp == TAVO_ROUTER_SUPPORT_YES ||
                                 detectResult->enSupportNatpmp == TAVO_ROUTER_SUPPORT_YES;
        if (blSupported &&
            !RouterUpnpDB(detectResult->szBrand, detectResult->szModel, detectResult->szVersion).GetMaxRule(nMaxRule)) {
            LogError("%s:%d can not get max rule, this router may not in routerdb", kFile, __LINE__);
            return -1;
        }
        detectResult->nMaxRule = nMaxRule;
        return 0;
    });
}

int TLibDetectRouter(__tag_TAVO_ROUTER_DETECT_RESULT* detectResult,
                     void (*pfnCallback)(const __tag_TAVO_ROUTER_DETECT_RESULT*, void*), void* arg, bool blLock) {
    bool blDetected = false;
    if (detectResult == nullptr) {
        LogError("%s:%d detectResult is NULL", kFile, __LINE__);
    } else {
        blDetected = AtBorder(false, [&] {
            RouterLock lock;
            return Detection(*detectResult, pfnCallback, arg).Run(blLock, lock);
        });
    }
    AtBorder(0, [&] {
        if (pfnCallback != nullptr) {
            pfnCallback(detectResult, arg);
        }
        return 0;
    });
    if (blDetected) {
        detectResult->nProgress = 100;
    }
    return blDetected ? 0 : -1;
}

int TLibGetRouterDetectResult(__tag_TAVO_ROUTER_DETECT_RESULT* detectResult) {
    if (detectResult == nullptr) {
        LogError("%s:%d Bad parameter, detectResult is NULL", kFile, __LINE__);
        return -1;
    }
    if (DETECT_INFO::fillRouterDetectResult(detectResult) < 0) {
        LogError("%s:%d fillRouterDetectResult() failed", kFile, __LINE__);
        return -1;
    }
    return 0;
}

// ---- saving rules ----------------------------------------------------------------------------------------

namespace {

using SaveResult = __tag_TAVO_ROUTER_SAVE_RULE_RESULT;
using SaveCallback = void (*)(const SaveResult*, void*);

enum SaveStatus : int {
    kStatusLocked = 2,
    kStatusTooManyRules = 7,
    kStatusConflict = 8,
    kStatusAddFailed = 9,
    kStatusPortLimit = 10,
    kStatusNoRangePage = 11,
    kStatusRangeLimit = 12
};

// One save, from validation to the router's answer. Each step answers whether to go on.
class RuleSave {
public:
    RuleSave(const char* szGwRouterIP, int nRules, const __tag_TAVO_ROUTER_RULE* rgRules, SaveResult* pResult,
             SaveCallback pfnCallback, void* pData)
        : mSzGwRouterIP(szGwRouterIP),
          mNRules(nRules),
          mRgRules(rgRules),
          mPResult(pResult),
          mPfnCallback(pfnCallback),
          mPData(pData) {}

    bool IsValid() const;
    bool Run(bool blLock, RouterLock& lock);

private:
    bool HasRules() const { return mNRules > 0 && mRgRules != nullptr; }
    void Progress(int nPercent);
    void Status(int nStatus);
    void Limits(int nStatus, int nLimit);
    void Ports(int nStatus, const std::string& szPorts);

    bool CollectRules();
    bool SwitchDaemonsOff() const;
    bool CheckExceedMaxRule(bool& blExceed, int& nMaxRule);
    bool FitsRouter();
    bool WriteRules(const char* szFailure);
    bool SaveNatpmp();
    bool ReadBackNatpmp();
    bool SaveUpnp();
    bool ReadBackUpnp();
    bool FitsManualRouter();
    void ReportManualExcess(RouterDB& db, int nMaxPort, int nPortJob, int nMaxRange, int nRangeJob);
    bool SaveManual();

    const char* mSzGwRouterIP;
    int mNRules;
    const __tag_TAVO_ROUTER_RULE* mRgRules;
    SaveResult* mPResult;
    SaveCallback mPfnCallback;
    void* mPData;
    RouterConfReader mConf;
    RouterRuleConfWriter mRules;
};

bool RuleSave::IsValid() const {
    if (mSzGwRouterIP == nullptr) {
        LogError("%s:%d szGwRouterIP is NULL", kFile, __LINE__);
        return false;
    }
    if (BlTLIBIsIpAddr(mSzGwRouterIP) == 0) {
        LogError("%s:%d szGwRouterIP=%s is not IP format", kFile, __LINE__, mSzGwRouterIP);
        return false;
    }
    if (mPfnCallback != nullptr && mPResult == nullptr) {
        LogError("%s:%d saveResult is NULL", kFile, __LINE__);
        return false;
    }
    if (mNRules < 0) {
        LogError("%s:%d fail: 0 > nRules=%d", kFile, __LINE__, mNRules);
        return false;
    }
    if (mNRules > 0 && mRgRules == nullptr) {
        LogError("%s:%d rgRules is NULL", kFile, __LINE__);
        return false;
    }
    return true;
}

void RuleSave::Progress(int nPercent) {
    if (mPResult == nullptr) {
        return;
    }
    mPResult->nProgress = nPercent;
    if (mPfnCallback != nullptr) {
        mPfnCallback(mPResult, mPData);
    }
}

void RuleSave::Status(int nStatus) {
    if (mPResult != nullptr) {
        mPResult->nStatus = nStatus;
    }
}

void RuleSave::Limits(int nStatus, int nLimit) {
    Status(nStatus);
    if (mPResult != nullptr) {
        mPResult->nLimit = nLimit;
    }
}

void RuleSave::Ports(int nStatus, const std::string& szPorts) {
    Status(nStatus);
    if (mPResult != nullptr) {
        FillText(mPResult->szPortList, szPorts);
    }
}

bool RuleSave::CollectRules() {
    for (int i = 0; HasRules() && i < mNRules; ++i) {
        const __tag_TAVO_ROUTER_RULE& rule = mRgRules[i];
        if (rule.szProtocol[0] == '\0' && rule.szRouterPort[0] == '\0' && rule.szSrcPort[0] == '\0') {
            LogError("%s:%d protocol, and port should not be empty", kFile, __LINE__);
            return false;
        }
        if (!tavo::lib::AddRule(mRules, rule)) {
            return false;
        }
    }
    return true;
}

bool RuleSave::SwitchDaemonsOff() const {
    if (!SetRunKey(kNatpmpRunKey, "no") || !SetRunKey(kUpnpRunKey, "no")) {
        LogError("%s:%d Failed to Set run key [%s]", kFile, __LINE__, tavo::lib::kSystemConf);
        return false;
    }
    return true;
}

bool RuleSave::CheckExceedMaxRule(bool& blExceed, int& nMaxRule) {
    blExceed = false;
    std::string szBrand;
    std::string szModel;
    std::string szVersion;
    int nRules = 0;
    if (mConf.GetBrand(szBrand) == 0) {
        LogError("%s:%d fail to get brand", kFile, __LINE__);
        return false;
    }
    if (mConf.GetModel(szModel) == 0) {
        LogError("%s:%d fail to get model", kFile, __LINE__);
        return false;
    }
    if (mConf.GetVersion(szVersion) == 0) {
        LogError("%s:%d fail to get version", kFile, __LINE__);
        return false;
    }
    RouterUpnpDB db(szBrand, szModel, szVersion);
    if (!db.GetMaxRule(nMaxRule)) {
        LogError("%s:%d get max rule fail", kFile, __LINE__);
        return false;
    }
    if (mRules.GetRules(nRules) == 0) {
        LogError("%s:%d get setting rules fail", kFile, __LINE__);
        return false;
    }
    blExceed = nMaxRule >= 1 && nRules >= 1 && nMaxRule < nRules;
    return true;
}

// The capacity check of a router that a daemon drives.
bool RuleSave::FitsRouter() {
    bool blExceed = false;
    int nMaxRule = 0;
    if (!CheckExceedMaxRule(blExceed, nMaxRule)) {
        LogError("%s:%d check exceed max rule fail", kFile, __LINE__);
        return false;
    }
    if (blExceed) {
        Limits(kStatusTooManyRules, nMaxRule);
        LogError("%s:%d exceed max rule", kFile, __LINE__);
        return false;
    }
    return true;
}

// Writes the rule file; szFailure takes the file and the line.
bool RuleSave::WriteRules(const char* szFailure) {
    if (mRules.Sync() == 0) {
        LogError(szFailure, kFile, __LINE__);
        return false;
    }
    Progress(80);
    return true;
}

// Polls at once and then after every pause, until fnDone answers true.
template <typename Done>
bool WaitUntil(Done fnDone) {
    for (int nPoll = 0; nPoll < kWaitPolls; ++nPoll) {
        if (fnDone()) {
            return true;
        }
        sleep(kPollSeconds);
    }
    return false;
}

bool RuleSave::SaveNatpmp() {
    if (!FitsRouter() || !WriteRules("%s:%d sync rule to file fail")) {
        return false;
    }
    if (!SetRunKey(kNatpmpRunKey, "yes")) {
        LogError("%s:%d Failed to Set natpmp run key!", kFile, __LINE__);
        return false;
    }
    NatpmpDaemon daemon;
    if (!daemon.Start()) {
        LogError("%s:%d upnp daemon start failed", kFile, __LINE__);
        return false;
    }
    if (!HasRules()) {
        return true;
    }
    if (!WaitUntil([&] { return daemon.IsAlive() && IsSavingRules() == 0; })) {
        LogError("%s:%d wait natpmp daemon alive time out", kFile, __LINE__);
        return false;
    }
    LogError("%s:%d natpmp daemon is alive now", kFile, __LINE__);
    Progress(90);
    return ReadBackNatpmp();
}

bool RuleSave::ReadBackNatpmp() {
    bool blRemap = false;
    std::string szRemap;
    NatpmpDaemon daemon;
    if (!daemon.CheckDaemon(blRemap, szRemap)) {
        LogError("%s:%d check natpmp daemon failed", kFile, __LINE__);
        return false;
    }
    LogError("%s:%d natpmpd checking is done", kFile, __LINE__);
    if (blRemap) {
        Ports(kStatusConflict, szRemap);
        LogError("%s:%d natpmp port conflict", kFile, __LINE__);
        return false;
    }
    return true;
}

bool RuleSave::SaveUpnp() {
    if (!FitsRouter() || !WriteRules("%s:%d can not sync rules to file")) {
        return false;
    }
    if (!SetRunKey(kUpnpRunKey, "yes")) {
        LogError("%s:%d Failed to Set upnp run key!", kFile, __LINE__);
        return false;
    }
    UpnpDaemon daemon;
    if (!daemon.Start()) {
        LogError("%s:%d upnp daemon start failed", kFile, __LINE__);
        return false;
    }
    if (!HasRules()) {
        return true;
    }
    if (!WaitUntil([&] { return daemon.IsAlive() && IsSavingRules() == 0; })) {
        LogError("%s:%d wait upnp daemon alive time out", kFile, __LINE__);
        return false;
    }
    LogError("%s:%d upnp daemon is alive now", kFile, __LINE__);
    Progress(90);
    return ReadBackUpnp();
}

bool RuleSave::ReadBackUpnp() {
    bool blConflict = false;
    bool blError = false;
    std::string szConflict;
    std::string szError;
    UpnpDaemon daemon;
    if (!daemon.CheckDaemon(blConflict, blError, szConflict, szError)) {
        LogError("%s:%d check daemon failed", kFile, __LINE__);
        return false;
    }
    LogError("%s:%d upnpd checking is done", kFile, __LINE__);
    if (blConflict) {
        Ports(kStatusConflict, szConflict);
        TAVOLogSet1(1, 2, TAVO_EVENT_PF_CONFLICT, szConflict.c_str(), "", "", "");
        LogError("%s:%d upnp port conflict", kFile, __LINE__);
        return false;
    }
    if (blError) {
        Ports(kStatusAddFailed, szError);
        TAVOLogSet1(1, 3, TAVO_EVENT_PF_ADD_FAILED, szError.c_str(), "", "", "");
        LogError("%s:%d upnp add port fail", kFile, __LINE__);
        return false;
    }
    return true;
}

// Says which limit of the router's pages is in the way. It goes by the limits alone: a router with
// both kinds of page is reported with both, whichever was exceeded.
void RuleSave::ReportManualExcess(RouterDB& db, int nMaxPort, int nPortJob, int nMaxRange, int nRangeJob) {
    bool blIsSupport = false;
    if (!db.IsSupportPageRange(blIsSupport)) {
        LogError("%s:%d get is support page range failed", kFile, __LINE__);
        blIsSupport = false;
    }
    if (nMaxRange != 0 && nMaxPort > 0 && nMaxRange > 0) {
        Limits(kStatusRangeLimit, nMaxPort);
        if (mPResult != nullptr) {
            mPResult->nLimit2 = nMaxRange;
        }
        LogError("%s:%d exceed range max port", kFile, __LINE__);
    } else if (nMaxRange != 0) {
        Limits(kStatusPortLimit, -1);
        LogError("%s:%d exceed max rule, unknown err, nMaxPort=%d nPortJob=%d nMaxRange=%d nRangeJob=%d blIsSupport=%s",
                 kFile, __LINE__, nMaxPort, nPortJob, nMaxRange, nRangeJob, blIsSupport ? "true" : "false");
    } else if (blIsSupport) {
        Limits(kStatusNoRangePage, nMaxPort);
        LogError("%s:%d get max range == 0", kFile, __LINE__);
    } else {
        Limits(kStatusPortLimit, nMaxPort);
        LogError("%s:%d get bl is support page range == 0", kFile, __LINE__);
    }
}

bool RuleSave::FitsManualRouter() {
    RouterDB db(mSzGwRouterIP);
    int nMaxPort = 0;
    int nMaxRange = 0;
    int nPortJob = 0;
    int nRangeJob = 0;
    if (!db.GetMaxPorts(nMaxPort)) {
        LogError("%s:%d can not get max ports", kFile, __LINE__);
        return false;
    }
    if (!db.GetMaxRange(nMaxRange)) {
        LogError("%s:%d can not get max range", kFile, __LINE__);
        return false;
    }
    if (mRules.GetPorts(nPortJob, mSzGwRouterIP) == 0) {
        LogError("%s:%d failed to count port job of rules", kFile, __LINE__);
        return false;
    }
    if (mRules.GetRange(nRangeJob, mSzGwRouterIP) == 0) {
        LogError("%s:%d failed to count range job of rules", kFile, __LINE__);
        return false;
    }
    if (nMaxPort >= nPortJob && nMaxRange >= nRangeJob) {
        return true;
    }
    ReportManualExcess(db, nMaxPort, nPortJob, nMaxRange, nRangeJob);
    return false;
}

bool RuleSave::SaveManual() {
    if (!FitsManualRouter() || !WriteRules("%s:%d can not sync rules to file")) {
        return false;
    }
    PortForwardScript script;
    if (!script.Run()) {
        LogError("%s:%d %s start failed", kFile, __LINE__, tavo::lib::kForwardTool);
        return false;
    }
    if (!WaitUntil([] { return IsSavingRules() == 0; })) {
        LogError("%s:%d wait manual pf process finish time out", kFile, __LINE__);
        return false;
    }
    return true;
}

bool RuleSave::Run(bool blLock, RouterLock& lock) {
    Progress(20);
    if (blLock && !lock.Get()) {
        LogError("%s:%d PortForward conflict = %s", kFile, __LINE__, kRouterLock);
        mPResult->nStatus = kStatusLocked;  // whoever asks for the lock passes a record
        return false;
    }
    Progress(40);
    if (!CollectRules()) {
        return false;
    }
    std::string szUpnp;
    std::string szNatpmp;
    if (mConf.GetSupportUpnp(szUpnp) == 0) {
        LogError("%s:%d can not get support upnp", kFile, __LINE__);
        return false;
    }
    if (mConf.GetSupportNatpmp(szNatpmp) == 0) {
        LogError("%s:%d can not get support natpmp", kFile, __LINE__);
        return false;
    }
    if (!SwitchDaemonsOff()) {
        return false;
    }
    Progress(60);
    const bool blSaved = szNatpmp == "yes" ? SaveNatpmp() : szUpnp == "yes" ? SaveUpnp() : SaveManual();
    if (blSaved) {
        Progress(100);
    }
    return blSaved;
}

}  // namespace

int TLibSaveRules(const char* szGwRouterIP, int nRules, __tag_TAVO_ROUTER_RULE* rgRules, bool blLock,
                  __tag_TAVO_ROUTER_SAVE_RULE_RESULT* saveResult,
                  void (*pfnCallback)(const __tag_TAVO_ROUTER_SAVE_RULE_RESULT*, void*), void* pData) {
    return AtBorder(-1, [&] {
        RuleSave save(szGwRouterIP, nRules, rgRules, saveResult, pfnCallback, pData);
        {
            RouterLock lock;
            if (!save.IsValid() || !save.Run(blLock, lock)) {
                return -1;
            }
        }
        if (TLIBServiceIsRunning(kRelayService) == 1) {
            TLIBServiceReload(kRelayService);
        }
        return 0;
    });
}
