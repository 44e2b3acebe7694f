// Finds out what the gateway is: the checks of the network, then the two detectors side by side, and the
// record of what they stored. Relies on the platform's checks, the detectors and the compatibility database.
// Promises: progress in its fixed order; the router lock is free before the last callback.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Border.h"
#include "Lock.h"
#include "Log.h"
#include "Text.h"
#include "tavo/core.h"
#include "tavo/net.h"

namespace {

using tavo::lib::AtBorder;
using tavo::lib::FillText;
using tavo::lib::kEntryFile;
using tavo::lib::kRouterLock;
using tavo::lib::LogError;
using tavo::lib::Refuse;
using tavo::lib::RouterLock;

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
        return Refuse("%s:%d Network interface is not enabled", kEntryFile, __LINE__);
    }
    FillText(mResult.szInterface, szInterface);
    return true;
}

void Detection::CheckGateway() {
    Progress(30);
    char szGateway[TAVO_TEXT_SIZE] = {};
    if (checkDefaultGatewaySetting(szGateway, sizeof(szGateway)) != 0) {
        LogError("%s:%d Gateway setting is not correct", kEntryFile, __LINE__);
        mResult.nEnvFlags |= kEnvGateway;
    }
    FillText(mResult.szGateway, szGateway);
}

bool Detection::CheckWan() {
    Progress(40);
    if (checkConnectToWAN() != 0) {
        LogError("%s:%d Can not connect to WAN", kEntryFile, __LINE__);
        mResult.errCode = TAVO_LIBTAVOPORTMAP_ERR_NO_WAN;
        return false;
    }
    return true;
}

void Detection::CheckPublicLevel() {
    Progress(70);
    int nLevel = kLevelUnknown;
    if (getPublicIPLevel(nLevel, kHopsLookedAt) != 0) {
        LogError("%s:%d Unable to get public ip level", kEntryFile, __LINE__);
        mResult.nPublicIPLevel = kLevelUnknown;
        mResult.nEnvFlags |= kEnvLevelUnknown;
        return;
    }
    mResult.nPublicIPLevel = nLevel;
    if (nLevel > kLevelBehindOneRouter) {
        LogError("%s:%d nPublicIPLevel=%d > 1, can not do portforwarding", kEntryFile, __LINE__, nLevel);
        mResult.nEnvFlags |= kEnvManyTranslations;
    }
}

bool Detection::CheckNames() {
    Progress(50);
    if (checkDNSSetting() != 0) {
        LogError("%s:%d DNS setting may be not correct", kEntryFile, __LINE__);
        mResult.errCode = TAVO_LIBTAVOPORTMAP_ERR_DNS;
        return false;
    }
    return true;
}

// The wait for NAT-PMP announcements and the search for UPnP go on at the same time, in two processes.
bool Detection::RunDetectors(RouterLock& lock) {
    const pid_t pid = TLIBCProcFork();
    if (pid < 0) {
        return Refuse("%s:%d upnp fork error, errno=%s", kEntryFile, __LINE__, std::strerror(errno));
    }
    if (pid == 0) {
        std::string szGatewayIP;
        if (GetGatewayIP(szGatewayIP) != 0) {
            signal(SIGCHLD, SIG_DFL);  // a caller that ignores its children's ends would hide those of ours
            NatpmpDetector().Start(szGatewayIP.c_str());
            _exit(0);
        }
        LogError("%s:%d GetGatewayIP() failed", kEntryFile, __LINE__);
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
        LogError("%s:%d PortForward conflict = %s", kEntryFile, __LINE__, kRouterLock);
        mResult.errCode = TAVO_LIBTAVOPORTMAP_ERR_CONFLICT;
        return false;
    }
    if (CleanDetectManualCache() == 0) {
        return Refuse("%s:%d Clean cached file failed", kEntryFile, __LINE__);
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
    LogError("%s:%d All network env checks are pass", kEntryFile, __LINE__);
    int nVersion = 0;
    if (!RouterUpnpDB::Update(nVersion)) {
        LogError("%s:%d upgrade db fail", kEntryFile, __LINE__);
    }
    if (!RunDetectors(lock)) {
        return false;
    }
    return DETECT_INFO::fillRouterDetectResult(&mResult) >= 0 ||
           Refuse("%s:%d fillRouterDetectResult failed", kEntryFile, __LINE__);
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
            LogError("%s:%d detectResult is NULL", kEntryFile, __LINE__);
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
            LogError("%s:%d can not get max rule, this router may not in routerdb", kEntryFile, __LINE__);
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
        LogError("%s:%d detectResult is NULL", kEntryFile, __LINE__);
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
        LogError("%s:%d Bad parameter, detectResult is NULL", kEntryFile, __LINE__);
        return -1;
    }
    if (DETECT_INFO::fillRouterDetectResult(detectResult) < 0) {
        LogError("%s:%d fillRouterDetectResult() failed", kEntryFile, __LINE__);
        return -1;
    }
    return 0;
}
