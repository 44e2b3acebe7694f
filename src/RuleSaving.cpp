// Makes a rule set the box's own and writes it to the router, by NAT-PMP, UPnP or the router model's script.
// Relies on the rule file's writer, the databases, the two daemons and the script.
// Promises: each step answers whether to go on; bounded waits; the router lock is given back on every path,
// before the relay service is told.
#include <unistd.h>

#include <cstdio>
#include <cstring>

#include "Border.h"
#include "DaemonStart.h"
#include "Entry.h"
#include "Log.h"
#include "Text.h"
#include "tavo/core.h"
#include "tavo/log.h"

namespace {

constexpr char kRelayService[] = "tavorelayd";
constexpr int kWaitPolls = 302;
constexpr unsigned kPollSeconds = 1;

using tavo::lib::AtBorder;
using tavo::lib::FillText;
using tavo::lib::kEntryFile;
using tavo::lib::kNatpmpRunKey;
using tavo::lib::kRouterLock;
using tavo::lib::kUpnpRunKey;
using tavo::lib::LogError;
using tavo::lib::Refuse;
using tavo::lib::RouterLock;
using tavo::lib::SetRunKey;

using SaveResult = __tag_TAVO_ROUTER_SAVE_RULE_RESULT;
using SaveCallback = void (*)(const SaveResult*, void*);

// What saving through one daemon says differently from saving through the other; the texts take the file
// and the line.
struct DaemonWay {
    const char* szRunKey;
    const char* szNotWritten;
    const char* szNoRunKey;
    const char* szTimeOut;
    const char* szAlive;
};

constexpr DaemonWay kNatpmpWay{kNatpmpRunKey, "%s:%d sync rule to file fail", "%s:%d Failed to Set natpmp run key!",
                               "%s:%d wait natpmp daemon alive time out", "%s:%d natpmp daemon is alive now"};
constexpr DaemonWay kUpnpWay{kUpnpRunKey, "%s:%d can not sync rules to file", "%s:%d Failed to Set upnp run key!",
                             "%s:%d wait upnp daemon alive time out", "%s:%d upnp daemon is alive now"};

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
    template <typename Daemon>
    bool SaveThrough(Daemon daemon, const DaemonWay& way);
    bool ReadBack(NatpmpDaemon& daemon);
    bool ReadBack(UpnpDaemon& daemon);
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
    if (!tavo::lib::IsGatewayAddress(mSzGwRouterIP)) {
        return false;
    }
    if (mPfnCallback != nullptr && mPResult == nullptr) {
        return Refuse("%s:%d saveResult is NULL", kEntryFile, __LINE__);
    }
    if (mNRules < 0) {
        return Refuse("%s:%d fail: 0 > nRules=%d", kEntryFile, __LINE__, mNRules);
    }
    if (mNRules > 0 && mRgRules == nullptr) {
        return Refuse("%s:%d rgRules is NULL", kEntryFile, __LINE__);
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
            return Refuse("%s:%d protocol, and port should not be empty", kEntryFile, __LINE__);
        }
        if (!tavo::lib::AddRule(mRules, rule)) {
            return false;
        }
    }
    return true;
}

bool RuleSave::SwitchDaemonsOff() const {
    if (!SetRunKey(kNatpmpRunKey, "no") || !SetRunKey(kUpnpRunKey, "no")) {
        return Refuse("%s:%d Failed to Set run key [%s]", kEntryFile, __LINE__, tavo::lib::kSystemConf);
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
        return Refuse("%s:%d fail to get brand", kEntryFile, __LINE__);
    }
    if (mConf.GetModel(szModel) == 0) {
        return Refuse("%s:%d fail to get model", kEntryFile, __LINE__);
    }
    if (mConf.GetVersion(szVersion) == 0) {
        return Refuse("%s:%d fail to get version", kEntryFile, __LINE__);
    }
    RouterUpnpDB db(szBrand, szModel, szVersion);
    if (!db.GetMaxRule(nMaxRule)) {
        return Refuse("%s:%d get max rule fail", kEntryFile, __LINE__);
    }
    if (mRules.GetRules(nRules) == 0) {
        return Refuse("%s:%d get setting rules fail", kEntryFile, __LINE__);
    }
    blExceed = nMaxRule >= 1 && nRules >= 1 && nMaxRule < nRules;
    return true;
}

// The capacity check of a router that a daemon drives.
bool RuleSave::FitsRouter() {
    bool blExceed = false;
    int nMaxRule = 0;
    if (!CheckExceedMaxRule(blExceed, nMaxRule)) {
        return Refuse("%s:%d check exceed max rule fail", kEntryFile, __LINE__);
    }
    if (blExceed) {
        Limits(TAVO_ROUTER_STATUS_TOO_MANY_RULES, nMaxRule);
        return Refuse("%s:%d exceed max rule", kEntryFile, __LINE__);
    }
    return true;
}

// Writes the rule file; szFailure takes the file and the line.
bool RuleSave::WriteRules(const char* szFailure) {
    if (mRules.Sync() == 0) {
        return Refuse(szFailure, kEntryFile, __LINE__);
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

template <typename Daemon>
bool RuleSave::SaveThrough(Daemon daemon, const DaemonWay& way) {
    if (!FitsRouter() || !WriteRules(way.szNotWritten)) {
        return false;
    }
    if (!SetRunKey(way.szRunKey, "yes")) {
        return Refuse(way.szNoRunKey, kEntryFile, __LINE__);
    }
    if (!daemon.Start()) {
        return Refuse("%s:%d upnp daemon start failed", kEntryFile, __LINE__);  // for either daemon
    }
    if (!HasRules()) {
        return true;
    }
    if (!WaitUntil([&] { return daemon.IsAlive() && IsSavingRules() == 0; })) {
        return Refuse(way.szTimeOut, kEntryFile, __LINE__);
    }
    LogError(way.szAlive, kEntryFile, __LINE__);
    Progress(90);
    return ReadBack(daemon);
}

bool RuleSave::ReadBack(NatpmpDaemon& daemon) {
    bool blRemap = false;
    std::string szRemap;
    if (!daemon.CheckDaemon(blRemap, szRemap)) {
        return Refuse("%s:%d check natpmp daemon failed", kEntryFile, __LINE__);
    }
    LogError("%s:%d natpmpd checking is done", kEntryFile, __LINE__);
    if (blRemap) {
        Ports(TAVO_ROUTER_STATUS_PORT_CONFLICT, szRemap);
        return Refuse("%s:%d natpmp port conflict", kEntryFile, __LINE__);
    }
    return true;
}

bool RuleSave::ReadBack(UpnpDaemon& daemon) {
    bool blConflict = false;
    bool blError = false;
    std::string szConflict;
    std::string szError;
    if (!daemon.CheckDaemon(blConflict, blError, szConflict, szError)) {
        return Refuse("%s:%d check daemon failed", kEntryFile, __LINE__);
    }
    LogError("%s:%d upnpd checking is done", kEntryFile, __LINE__);
    if (blConflict) {
        Ports(TAVO_ROUTER_STATUS_PORT_CONFLICT, szConflict);
        TAVOLogSet1(1, 2, TAVO_EVENT_PF_CONFLICT, szConflict.c_str(), "", "", "");
        return Refuse("%s:%d upnp port conflict", kEntryFile, __LINE__);
    }
    if (blError) {
        Ports(TAVO_ROUTER_STATUS_ADD_FAILED, szError);
        TAVOLogSet1(1, 3, TAVO_EVENT_PF_ADD_FAILED, szError.c_str(), "", "", "");
        return Refuse("%s:%d upnp add port fail", kEntryFile, __LINE__);
    }
    return true;
}

// Says which limit of the router's pages is in the way. It goes by the limits alone: a router with
// both kinds of page is reported with both, whichever was exceeded.
void RuleSave::ReportManualExcess(RouterDB& db, int nMaxPort, int nPortJob, int nMaxRange, int nRangeJob) {
    bool blIsSupport = false;
    if (!db.IsSupportPageRange(blIsSupport)) {
        LogError("%s:%d get is support page range failed", kEntryFile, __LINE__);
        blIsSupport = false;
    }
    if (nMaxRange != 0 && nMaxPort > 0 && nMaxRange > 0) {
        Limits(TAVO_ROUTER_STATUS_RANGE_LIMIT, nMaxPort);
        if (mPResult != nullptr) {
            mPResult->nLimit2 = nMaxRange;
        }
        LogError("%s:%d exceed range max port", kEntryFile, __LINE__);
    } else if (nMaxRange != 0) {
        Limits(TAVO_ROUTER_STATUS_PORT_LIMIT, -1);
        LogError("%s:%d exceed max rule, unknown err, nMaxPort=%d nPortJob=%d nMaxRange=%d nRangeJob=%d blIsSupport=%s",
                 kEntryFile, __LINE__, nMaxPort, nPortJob, nMaxRange, nRangeJob, blIsSupport ? "true" : "false");
    } else if (blIsSupport) {
        Limits(TAVO_ROUTER_STATUS_NO_RANGE_PAGE, nMaxPort);
        LogError("%s:%d get max range == 0", kEntryFile, __LINE__);
    } else {
        Limits(TAVO_ROUTER_STATUS_PORT_LIMIT, nMaxPort);
        LogError("%s:%d get bl is support page range == 0", kEntryFile, __LINE__);
    }
}

bool RuleSave::FitsManualRouter() {
    RouterDB db(mSzGwRouterIP);
    int nMaxPort = 0;
    int nMaxRange = 0;
    int nPortJob = 0;
    int nRangeJob = 0;
    if (!db.GetMaxPorts(nMaxPort)) {
        return Refuse("%s:%d can not get max ports", kEntryFile, __LINE__);
    }
    if (!db.GetMaxRange(nMaxRange)) {
        return Refuse("%s:%d can not get max range", kEntryFile, __LINE__);
    }
    if (mRules.GetPorts(nPortJob, mSzGwRouterIP) == 0) {
        return Refuse("%s:%d failed to count port job of rules", kEntryFile, __LINE__);
    }
    if (mRules.GetRange(nRangeJob, mSzGwRouterIP) == 0) {
        return Refuse("%s:%d failed to count range job of rules", kEntryFile, __LINE__);
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
        return Refuse("%s:%d %s start failed", kEntryFile, __LINE__, tavo::lib::kForwardTool);
    }
    if (!WaitUntil([] { return IsSavingRules() == 0; })) {
        return Refuse("%s:%d wait manual pf process finish time out", kEntryFile, __LINE__);
    }
    return true;
}

bool RuleSave::Run(bool blLock, RouterLock& lock) {
    Progress(20);
    if (blLock && !lock.Get()) {
        LogError("%s:%d PortForward conflict = %s", kEntryFile, __LINE__, kRouterLock);
        mPResult->nStatus = TAVO_ROUTER_STATUS_LOCKED;  // whoever asks for the lock passes a record
        return false;
    }
    Progress(40);
    if (!CollectRules()) {
        return false;
    }
    std::string szUpnp;
    std::string szNatpmp;
    if (mConf.GetSupportUpnp(szUpnp) == 0) {
        return Refuse("%s:%d can not get support upnp", kEntryFile, __LINE__);
    }
    if (mConf.GetSupportNatpmp(szNatpmp) == 0) {
        return Refuse("%s:%d can not get support natpmp", kEntryFile, __LINE__);
    }
    if (!SwitchDaemonsOff()) {
        return false;
    }
    Progress(60);
    const bool blSaved = szNatpmp == "yes" ? SaveThrough(NatpmpDaemon(), kNatpmpWay)
                         : szUpnp == "yes" ? SaveThrough(UpnpDaemon(), kUpnpWay)
                                           : SaveManual();
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
