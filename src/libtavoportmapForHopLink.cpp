// The entry points of the relay service. Relies on the merge of its rules with the others, on what is known
// of the gateway and on the entry points that detect, test, save and store. Promises: arguments are checked
// before any work, the router lock is tried and never waited for, what is taken is released on every path,
// and nothing is thrown.
#include <unistd.h>

#include <memory>

#include "Border.h"
#include "HopLink.h"
#include "InitState.h"
#include "Lock.h"
#include "Log.h"
#include "RouterConflicts.h"
#include "Text.h"
#include "src/merge/RuleConflicts.h"
#include "tavo/portforward.h"

namespace {

using tavo::lib::AtBorder;
using tavo::lib::FillText;
using tavo::lib::Host;
using tavo::lib::kHopLinkFile;
using tavo::lib::kRouterLock;
using tavo::lib::LogError;
using tavo::lib::OperationRules;
using tavo::lib::PortList;
using tavo::lib::Refuse;
using tavo::lib::RouterLock;
using tavo::lib::RouterRules;
using InitState = __TAG_TAVO_ROUTER_INIT_STATE;
using Request = __tag_TAVO_PORTMAP_RULE;
using RouterConf = __tag_TAVO_ROUTER_CONF;
using DetectResult = __tag_TAVO_ROUTER_DETECT_RESULT;
using TestResult = __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT;

constexpr int kFailed = -1;
constexpr int kTestRules = 60;  // mappings that the compatibility test asks for

enum RulesSetAnswer : int { kRulesSet = 0, kNotInitialized = 1, kRulesSetLocked = 2 };
enum RouterAnswer : int { kAutomatic = 0, kManual = 1, kRouterLocked = 2 };

// The library as the merge's host.
class LibraryHost : public tavo::lib::MergeHost {
public:
    bool IsValidPortNo(int nPort) const override { return TAVOPFIsValidPortNo(nPort) != 0; }

private:
    void Log(const char* szFormat, va_list arguments) const override { tavo::lib::LogErrorV(szFormat, arguments); }
};

// What stands before a bad token is the caller's too.
int AppendPorts(std::list<int>& ports, const char* szPort) {
    PortList read;
    const int nResult = ParsePorts(Host(), read, szPort);
    ports.insert(ports.end(), read.begin(), read.end());
    return nResult;
}

// ---- a service sets its rules --------------------------------------------------------------------------

bool CheckArguments(const char* szServiceName, const Request* rgRules, int nRules) {
    if (szServiceName == nullptr) {
        return Refuse("%s:%d Bad parameter, szServiceName is NULL", kHopLinkFile, __LINE__);
    }
    if (szServiceName[0] == '\0') {
        return Refuse("%s:%d Bad parameter, szServiceName is empty", kHopLinkFile, __LINE__);
    }
    if (nRules < 0) {
        return Refuse("%s:%d Bad parameter, 0 > nRules=%d", kHopLinkFile, __LINE__, nRules);
    }
    if (nRules > 0 && rgRules == nullptr) {
        return Refuse("%s:%d Bad parameter, nRules=%d, but rgRules is NULL", kHopLinkFile, __LINE__, nRules);
    }
    return true;
}

bool ReadInitState(InitState& enState) {
    return tavo::lib::GetInitState(&enState) == 0 || Refuse("%s:%d GetInitState() failed", kHopLinkFile, __LINE__);
}

// kRulesSet where the gateway takes rules from a service, else the answer to give.
int CheckInitState() {
    InitState enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
    if (!ReadInitState(enState)) {
        return kFailed;
    }
    switch (enState) {
        case TAVO_ROUTER_INIT_STATE_UPNP_NATPMP:
            return kRulesSet;
        case TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED:
            LogError("%s:%d Not initialized portforwarding", kHopLinkFile, __LINE__);
            return kNotInitialized;
        case TAVO_ROUTER_INIT_STATE_UNKNOWN:
            LogError("%s:%d failed, state is unknown", kHopLinkFile, __LINE__);
            return kFailed;
        case TAVO_ROUTER_INIT_STATE_MANUAL:
            LogError("%s:%d Can not set rules for manual router", kHopLinkFile, __LINE__);
            return kFailed;
    }
    LogError("%s:%d non supported enum type=%d", kHopLinkFile, __LINE__, enState);
    return kFailed;
}

// One request of a service, from rule.conf to the router and back to the requests.
class ServiceRules {
public:
    ServiceRules(const char* szServiceName, Request* rgRequests, int nRequests)
        : mSzServiceName(szServiceName), mRgRequests(rgRequests), mNRequests(nRequests) {}

    // Each step answers whether to go on.
    bool Load();
    bool Merge();
    bool Save();
    bool Test();

private:
    bool BuildFromRequests(OperationRules& rules) const;

    const char* mSzServiceName;
    Request* mRgRequests;
    int mNRequests;
    OperationRules mStored;
    OperationRules mRequested;
};

bool ServiceRules::BuildFromRequests(OperationRules& rules) const {
    if (CreateOperationRulesArray(Host(), &rules.rgRules, &rules.nRules, mSzServiceName, mRgRequests, mNRequests) !=
        0) {
        return Refuse("%s:%d CreateOperationRulesArray(rgRules) fail", kHopLinkFile, __LINE__);
    }
    return true;
}

bool ServiceRules::Load() {
    RouterRules stored;
    if (TLibGetRulesArrFromRuleConf(&stored.nRules, &stored.rgRules, nullptr, false, nullptr) != 0) {
        return Refuse("%s:%d TLibGetRulesArrFromRuleConf() failed", kHopLinkFile, __LINE__);
    }
    if (CreateOperationRulesArray(Host(), &mStored.rgRules, &mStored.nRules, stored.rgRules, stored.nRules) != 0) {
        return Refuse("%s:%d CreateOperationRulesArray(ruleConf) failed", kHopLinkFile, __LINE__);
    }
    return BuildFromRequests(mRequested);
}

bool ServiceRules::Merge() {
    if (tavo::lib::DeletePortsFromRuleConf(Host(), mStored.rgRules, mStored.nRules, mSzServiceName) != 0) {
        return Refuse("%s:%d DeletePortsFromRuleConf(rule.conf rules=%d) failed", kHopLinkFile, __LINE__,
                      mStored.nRules);
    }
    if (tavo::lib::DeletePortsFromInputRules(Host(), mRequested.rgRules, mRequested.nRules, mStored.rgRules,
                                             mStored.nRules, mSzServiceName) != 0) {
        return Refuse("%s:%d DeletePortsFromRuleConf(input rules=%d) failed", kHopLinkFile, __LINE__,
                      mRequested.nRules);
    }
    if (tavo::lib::DeleteConflictPortsForUPnPRouter(mRequested.rgRules, mRequested.nRules, mStored.rgRules,
                                                    mStored.nRules, mSzServiceName) != 0) {
        return Refuse("%s:%d DeleteConflictPortsForUPnPRouter() failed", kHopLinkFile, __LINE__);
    }
    return true;
}

bool ServiceRules::Save() {
    RouterRules merged;
    if (CreateRulesArray(Host(), &merged.rgRules, &merged.nRules, mStored.rgRules, mStored.nRules, mRequested.rgRules,
                         mRequested.nRules) != 0) {
        return Refuse("%s:%d CreateRulesArray() failed", kHopLinkFile, __LINE__);
    }
    char szGateway[TAVO_TEXT_SIZE] = {};
    if (TLibGetGatewayIP(szGateway, sizeof(szGateway)) != 0) {
        return Refuse("%s:%d get gateway ip failed", kHopLinkFile, __LINE__);
    }
    return TLibSaveRules(szGateway, merged.nRules, merged.rgRules, false, nullptr, nullptr, nullptr) == 0 ||
           Refuse("%s:%d save rule failed", kHopLinkFile, __LINE__);
}

// Tests every port asked for, also those that the merge took away.
bool ServiceRules::Test() {
    OperationRules requested;
    if (!BuildFromRequests(requested)) {
        return false;
    }
    RouterRules tested;
    if (CreateRulesArray(Host(), &tested.rgRules, &tested.nRules, nullptr, 0, requested.rgRules, requested.nRules) !=
        0) {
        return Refuse("%s:%d CreateRulesArray() failed", kHopLinkFile, __LINE__);
    }
    if (tested.rgRules == nullptr) {
        return Refuse("%s:%d CreateRouterRulesArray() failed, rgArgRules is NULL", kHopLinkFile, __LINE__);
    }
    if (tested.nRules != mNRequests) {
        return Refuse("%s:%d rgArgRules=%d and rgRules=%d shall same array size", kHopLinkFile, __LINE__, tested.nRules,
                      mNRequests);
    }
    return tavo::lib::TestRequestedRules(tested, mRgRequests) == 0;
}

int SetRules(const char* szServiceName, Request* rgRules, int nRules, bool blTestConnection) {
    if (!CheckArguments(szServiceName, rgRules, nRules)) {
        return kFailed;
    }
    RouterLock lock;
    if (!lock.Get()) {
        LogError("%s:%d PortForwarding conflict = %s, other user is doing portforwarding", kHopLinkFile, __LINE__,
                 kRouterLock);
        return kRulesSetLocked;
    }
    if (const int nAnswer = CheckInitState(); nAnswer != kRulesSet) {
        return nAnswer;
    }
    ServiceRules service(szServiceName, rgRules, nRules);
    if (!service.Load() || !service.Merge() || !service.Save()) {
        return kFailed;
    }
    const bool blTest = blTestConnection && nRules > 0 && rgRules != nullptr;
    return !blTest || service.Test() ? kRulesSet : kFailed;
}

// ---- a service has the router classified -----------------------------------------------------------------

bool FillSupport(char (&szField)[TAVO_TEXT_SIZE], int enSupport) {
    return TLibSupportEnumToString(szField, TAVO_TEXT_SIZE, static_cast<__tag_TAVO_ROUTER_SUPPORT>(enSupport)) == 0 ||
           Refuse("%s:%d TLibSupportEnumToString(%d) failed", kHopLinkFile, __LINE__, enSupport);
}

// Stores a router that maps ports by itself, as a detection or a test found it.
template <typename Found>
bool StoreAutomatic(const std::string& szGateway, const Found& found, int enUpnp, int enNatpmp) {
    const auto pConf = std::make_unique<RouterConf>();
    FillText(pConf->szBrand, found.szBrand);
    FillText(pConf->szModel, found.szModel);
    FillText(pConf->szVersion, found.szVersion);
    FillText(pConf->szMaxRule, std::to_string(found.nMaxRule));
    if (!FillSupport(pConf->szSupportUpnp, enUpnp) || !FillSupport(pConf->szSupportNatpmp, enNatpmp)) {
        return false;
    }
    return TLibSetRouterConf(szGateway.c_str(), pConf.get(), nullptr, false) == 0 ||
           Refuse("%s:%d TLibSetRouterConf(%s) failed", kHopLinkFile, __LINE__, szGateway.c_str());
}

template <typename Found>
bool StoreManual(const std::string& szGateway, const Found& found) {
    return SetDetectManualCache(szGateway, found.szBrand, found.szModel, found.szVersion) != 0 ||
           Refuse("%s:%d set detect cache failed", kHopLinkFile, __LINE__);
}

bool StoreRecord(const TestResult& result) {
    const auto pRecord = std::make_unique<__tag_TAVO_ROUTER_RECORD>();
    FillText(pRecord->szBrand, result.szBrand);
    FillText(pRecord->szModel, result.szModel);
    FillText(pRecord->szVersion, result.szVersion);
    FillText(pRecord->szSupport, result.szSupport);
    pRecord->nMaxRule = result.nMaxRule;
    return TLibWriteRecordIntoUpnpDB(pRecord.get()) == 0 ||
           Refuse("%s:%d TLibWriteRecordIntoUpnpDB() failed", kHopLinkFile, __LINE__);
}

// A router that speaks UPnP and that no database knows. The outcome is recorded whatever it is; a test that
// could not run has none.
int ClassifyByTest(const std::string& szGateway) {
    const auto pResult = std::make_unique<TestResult>();
    const int nVerdict = TLibTestUpnpCompatibility(kTestRules, pResult.get(), nullptr, nullptr, false);
    if (nVerdict < 0) {
        LogError("%s:%d TLibTestUpnpCompatibility() failed", kHopLinkFile, __LINE__);
        return kFailed;
    }
    if (!StoreRecord(*pResult)) {
        return kFailed;
    }
    if (nVerdict == 0) {
        if (!StoreAutomatic(szGateway, *pResult, TAVO_ROUTER_SUPPORT_YES, TAVO_ROUTER_SUPPORT_NO)) {
            return kFailed;
        }
        LogError("%s:%d TLibTavoPortMapRouterDetect() success: (comp) upnp/natpmp", kHopLinkFile, __LINE__);
        return kAutomatic;
    }
    if (nVerdict == 1) {
        if (!StoreManual(szGateway, *pResult)) {
            return kFailed;
        }
        LogError("%s:%d TLibTavoPortMapRouterDetect() success: (comp) manual", kHopLinkFile, __LINE__);
        return kManual;
    }
    LogError("%s:%d TLibTavoPortMapRouterDetect() failed: strange error", kHopLinkFile, __LINE__);
    return kFailed;
}

int Classify(const std::string& szGateway, RouterLock& lock) {
    const auto pResult = std::make_unique<DetectResult>();
    const pid_t pid = getpid();
    if (TLibDetectRouter(pResult.get(), nullptr, nullptr, false) != 0) {
        LogError("%s:%d TLibDetectRouter failed", kHopLinkFile, __LINE__);
        if (getpid() != pid) {
            lock.LeaveToParent();  // the detection's child came back: unlocking would take it from the parent
        }
        return kFailed;
    }
    if (pResult->enSupportUpnp == TAVO_ROUTER_SUPPORT_YES || pResult->enSupportNatpmp == TAVO_ROUTER_SUPPORT_YES) {
        return StoreAutomatic(szGateway, *pResult, pResult->enSupportUpnp, pResult->enSupportNatpmp) ? kAutomatic
                                                                                                     : kFailed;
    }
    if (pResult->enSupportUpnp != TAVO_ROUTER_SUPPORT_NO) {
        return ClassifyByTest(szGateway);
    }
    if (!StoreManual(szGateway, *pResult)) {
        return kFailed;
    }
    LogError("%s:%d TLibTavoPortMapRouterDetect() success: manual", kHopLinkFile, __LINE__);
    return kManual;
}

int DetectRouter() {
    RouterLock lock;
    if (!lock.Get()) {
        LogError("%s:%d TLibTavoPortMapRouterDetect() is busy", kHopLinkFile, __LINE__);
        return kRouterLocked;
    }
    std::string szGateway;
    if (GetGatewayIP(szGateway) == 0) {
        LogError("%s:%d get gateway ip failed", kHopLinkFile, __LINE__);
        return kFailed;
    }
    InitState enState = TAVO_ROUTER_INIT_STATE_UNKNOWN;
    if (!ReadInitState(enState)) {
        return kFailed;
    }
    switch (enState) {
        case TAVO_ROUTER_INIT_STATE_UPNP_NATPMP:
            LogError("%s:%d TLibTavoPortMapRouterDetect() success: upnp/natpmp", kHopLinkFile, __LINE__);
            return kAutomatic;
        case TAVO_ROUTER_INIT_STATE_MANUAL:
            LogError("%s:%d TLibTavoPortMapRouterDetect() success: manual", kHopLinkFile, __LINE__);
            return kManual;
        case TAVO_ROUTER_INIT_STATE_NOT_INITIALIZED:
            return Classify(szGateway, lock);
        case TAVO_ROUTER_INIT_STATE_UNKNOWN:
            break;
    }
    LogError("%s:%d TLibTavoPortMapRouterDetect() failed, state=%d", kHopLinkFile, __LINE__, enState);
    return kFailed;
}

}  // namespace

const tavo::lib::MergeHost& tavo::lib::Host() {
    static const LibraryHost host;
    return host;
}

int tavo::lib::TestRequestedRules(const RouterRules& rules, __tag_TAVO_PORTMAP_RULE* rgRequests) {
    if (TLibTestRulesInit() != 0) {
        LogError("%s:%d test rule init failed", kHopLinkFile, __LINE__);
        return -1;
    }
    if (TLibTestRules(rules.nRules, rules.rgRules, nullptr, false) != 0) {
        LogError("%s:%d test port connection failed", kHopLinkFile, __LINE__);
        return -1;
    }
    for (int i = 0; i < rules.nRules; ++i) {
        rgRequests[i].nTestConnStatus = rules.rgRules[i].enTestStatus;
    }
    return 0;
}

int TLibParsePorts(std::list<int>& ports, const char* szPort) {
    return AtBorder(-1, [&] { return AppendPorts(ports, szPort); });
}

int TLibTavoPortMapRulesSet(const char* szServiceName, __tag_TAVO_PORTMAP_RULE* rgRules, int nRules,
                            bool blTestConnection) {
    return AtBorder(kFailed, [&] { return SetRules(szServiceName, rgRules, nRules, blTestConnection); });
}

int TLibTavoPortMapRouterDetect() {
    return AtBorder(kFailed, [] { return DetectRouter(); });
}
