// The entry points with C types: support words, the router lock and the busy state, rule arrays, the
// router description, and saving rules. Relies on the library's own classes and the platform.
// Promises: arguments are checked before any work, locks are given back on every path.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

#include "common.h"
#include "tavo/log.h"
#include "tavo/net.h"

namespace {

constexpr char kFile[] = "src/libtavoportmap.cpp";
constexpr char kTestScript[] = "testupnp.sh";
constexpr char kRelayService[] = "tavorelayd";
constexpr char kUpnpRunKey[] = "runupnpportmapping";
constexpr char kNatpmpRunKey[] = "runnatpmpportmapping";
constexpr char kRunKeyFormat[] = "%s=\"%s\"\n";
constexpr int kWaitPolls = 302;
constexpr unsigned kPollSeconds = 1;

using tavo::lib::AtBorder;
using tavo::lib::kProgressMarker;
using tavo::lib::kRouterLock;
using tavo::lib::LogError;
using tavo::lib::RouterLock;

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
    return lock_file(kRouterLock, gFdRouterLock) != 0 ? 0 : -1;
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
    if (blLock && !lock.Get()) {
        LogError("%s:%d PortForward conflict = %s", kFile, __LINE__, kRouterLock);
        if (pErr != nullptr) {
            *pErr = TAVO_LIBTAVOPORTMAP_ERR_CONFLICT;
        }
        return -1;
    }
    struct stat status = {};
    const bool blExist = TLIBCFileExist(szPath) == 1;
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
        if (blLock && !lock.Get()) {
            LogError("%s:%d PortForward conflict = %s", kFile, __LINE__, kRouterLock);
            if (pErr != nullptr) {
                *pErr = TAVO_LIBTAVOPORTMAP_ERR_CONFLICT;
            }
            return -1;
        }
        return FillRouterDesc(szGwRouterIP, *routerDesc);
    });
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
        tavo::lib::FillText(mPResult->szPortList, szPorts);
    }
}

bool RuleSave::CollectRules() {
    for (int i = 0; HasRules() && i < mNRules; ++i) {
        const __tag_TAVO_ROUTER_RULE& rule = mRgRules[i];
        if (rule.szProtocol[0] == '\0' && rule.szRouterPort[0] == '\0' && rule.szSrcPort[0] == '\0') {
            LogError("%s:%d protocol, and port should not be empty", kFile, __LINE__);
            return false;
        }
        if (mRules.AddRule(std::string(rule.szRuleID), rule.blEnable, rule.szRouterPort, rule.szSrcPort,
                           rule.szProtocol, rule.szServiceID, rule.szServiceName) == 0) {
            LogError("%s:%d add rule failed", kFile, __LINE__);
            return false;
        }
    }
    return true;
}

bool SetRunKey(const char* szKey, const char* szValue) {
    return TLIBCFileSetKeyValue(tavo::lib::kSystemConf, szKey, szValue, kRunKeyFormat) >= 0;
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
