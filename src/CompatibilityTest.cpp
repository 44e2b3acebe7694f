// The UPnP compatibility test: whether the gateway keeps, forwards and deletes what it is asked to.
// Relies on the platform's UPnP client, on the test daemon that it directs, and on the progress file.
// Promises: the gateway is left without a test mapping by every ending; a refused start ends the running test.
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <cstdio>
#include <cstring>

#include "Border.h"
#include "Lock.h"
#include "Log.h"
#include "Text.h"
#include "tavo/core.h"
#include "tavo/log.h"
#include "tavo/upnp.h"
#include "tavo/upnptest.h"

namespace {

using tavo::lib::AtBorder;
using tavo::lib::FillText;
using tavo::lib::kEntryFile;
using tavo::lib::kPortTestMarker;
using tavo::lib::kRouterLock;
using tavo::lib::kRouterLog;
using tavo::lib::kTestProgress;
using tavo::lib::kUpnpStatus;
using tavo::lib::LogError;
using tavo::lib::Refuse;
using tavo::lib::RouterLock;

using TestResult = __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT;
using TestCallback = void (*)(const TestResult*, void*);

constexpr char kTestStepFile[] = "/tmp/upnp_test.step";
constexpr char kTestLock[] = "/tmp/upnp_test.lock";
constexpr char kUpnpStatusNew[] = "/var/tmp/upnp_portmap.status.tmp";
constexpr char kTestTool[] = "tavoupnptest";
constexpr char kPortTestTool[] = "tavopftest";

constexpr char kProcessing[] = "processing";
constexpr char kFinished[] = "finished";
constexpr char kSuccess[] = "success";
constexpr char kFailed[] = "failed";
constexpr char kStepInit[] = "upnp_init";
constexpr char kStepAdd[] = "upnp_add";
constexpr char kStepReadd1[] = "upnp_readd1";
constexpr char kStepReadd2[] = "upnp_readd2";
constexpr char kStepDelete[] = "upnp_delete";
constexpr char kStepMax[] = "upnp_max";
constexpr char kStepClosed[] = "upnp_connection_failed";
constexpr char kStepOpen[] = "upnp_connection_success";
constexpr char kStepTerminal[] = "upnp_terminal";
constexpr const char* kSteps[] = {kStepInit, kStepAdd,    kStepReadd1, kStepReadd2,  kStepDelete,
                                  kStepMax,  kStepClosed, kStepOpen,   kStepTerminal};

constexpr int kLeastTestRules = 3;
constexpr int kTestSearchLimitSeconds = 30;
constexpr int kTestLocalPort = 55001;
constexpr int kConnectionLimitSeconds = 60;
constexpr unsigned kStepSettleSeconds = 2;
constexpr unsigned kStepPollSeconds = 1;
constexpr int kStepValueSize = 1024;
constexpr size_t kRouterLogLineSize = 512;
constexpr size_t kCountTextSize = 8;

// One line of the router log; szFormat takes the file and the line.
void RouterLog(const char* szFormat, int nLine) {
    char szText[kRouterLogLineSize] = {};
    std::snprintf(szText, sizeof(szText), szFormat, kEntryFile, nLine);
    TAVOWriteLog(szText, 1, 1);
}

void Report(const char* szStep, const char* szValue) {
    TAVOUpnpReportTestProgress(szStep, szValue, 0);
}

bool IsTestDaemonAlive() {
    return TLIBCIsProcAlive(tavo::lib::kUpnpTestDaemon) == 1;
}

void RemoveFile(const char* szPath) {
    if (TLIBCFileExist(szPath) == 1) {
        unlink(szPath);
    }
}

bool ReadStep(const char* szStep, char (&szValue)[kStepValueSize]) {
    return TLIBCFileGetKeyValue(kTestProgress, szStep, szValue, sizeof(szValue), 0) >= 1 ||
           Refuse("%s:%d TLIBCFileGetKeyValue() failed", kEntryFile, __LINE__);
}

// Waits for as long as the tool works on a step. 0: done; 1: the step failed; -1: nobody can tell.
int WaitTestStep(const char* szStep) {
    if (szStep == nullptr) {
        LogError("%s:%d szStep is NULL", kEntryFile, __LINE__);
        return -1;
    }
    const auto fnIsStep = [szStep](const char* szKnown) { return std::strcmp(szKnown, szStep) == 0; };
    if (std::none_of(std::begin(kSteps), std::end(kSteps), fnIsStep)) {
        LogError("%s:%d invalid szStep=%s", kEntryFile, __LINE__, szStep);
        return -1;
    }
    char szValue[kStepValueSize] = {};
    sleep(kStepSettleSeconds);
    if (!ReadStep(szStep, szValue)) {
        return -1;
    }
    while (std::strcmp(szValue, kProcessing) == 0) {
        sleep(kStepPollSeconds);
        if (!ReadStep(szStep, szValue)) {
            return -1;
        }
    }
    sleep(kStepSettleSeconds);
    if (!ReadStep(szStep, szValue)) {
        return -1;
    }
    if (std::strcmp(szValue, kFinished) == 0 || std::strcmp(szValue, kSuccess) == 0) {
        return 0;
    }
    if (std::strcmp(szValue, kFailed) == 0) {
        return 1;
    }
    LogError("%s:%d unknown error szValue=%s", kEntryFile, __LINE__, szValue);
    return -1;
}

bool IsStepDone(const char* szStep) {
    return WaitTestStep(szStep) == 0 ||
           Refuse("%s:%d TavoUpnpTestWaitMessage(%s) failed", kEntryFile, __LINE__, szStep);
}

// Has the test daemon take its mappings away and end; negative when that could not be asked for.
int EndTestDaemon() {
    RouterLog("(%s:%d) =====terminal daemon=====", __LINE__);
    Report(kStepTerminal, kProcessing);
    if (!IsTestDaemonAlive()) {
        Report(kStepTerminal, kFinished);
        return TAVOUpnpRemoveTestRulePath();
    }
    const int nResult = TAVOUPnPDeletetest();
    if (nResult == -1) {
        LogError("%s:%d TAVOUPnPDeletetest() failed", kEntryFile, __LINE__);
        Report(kStepTerminal, kFailed);
    }
    return nResult;
}

// The end of a test that could not run.
int EndEarly() {
    if (EndTestDaemon() < 0) {
        LogError("%s:%d final release:TavoUpnpTestTerminate() failed", kEntryFile, __LINE__);
    }
    return -1;
}

int FillTestResult(TestResult* pResult, const TAVO_UPNP_GATEWAY_MODEL& model, const char* szSupport, int nMaxRule) {
    if (model.szBrand[0] == '\0' && model.szModel[0] == '\0' && model.szVersion[0] == '\0') {
        LogError("%s:%d brand & model & version shall not be all empty", kEntryFile, __LINE__);
        return -1;
    }
    if (pResult == nullptr) {
        LogError("%s:%d testCompResult is NULL", kEntryFile, __LINE__);
        return -1;
    }
    pResult->nStatus = TAVO_ROUTER_STATUS_NONE;
    pResult->nProgress = 100;
    FillText(pResult->szBrand, model.szBrand);
    FillText(pResult->szModel, model.szModel);
    FillText(pResult->szVersion, model.szVersion);
    FillText(pResult->szSupport, szSupport);
    pResult->nMaxRule = nMaxRule;
    return 0;
}

// One test, from the search for the gateway to the record. Each step answers whether to go on.
class CompatibilityTest {
public:
    CompatibilityTest(int nRules, TestResult& result, TestCallback pfnCallback, void* pData)
        : mNRules(nRules), mResult(result), mPfnCallback(pfnCallback), mPData(pData) {}

    int Run(bool blLock);

private:
    void Progress(int nPercent);
    bool Fail(int nStatus);
    bool NoGateway();
    bool FindGateway();
    bool RunSteps();
    bool AddRules();
    bool CountRules();
    bool DeleteRules();
    bool ClosedPorts();
    bool ReaddRules();
    bool OpenPorts();
    bool EndTest();
    int Finish(const char* szSupport, int nMaxRule, int nAnswer);

    int mNRules;
    TestResult& mResult;
    TestCallback mPfnCallback;
    void* mPData;
    TAVO_UPNP_GATEWAY_MODEL mModel = {};
    int mNCounted = -1;
};

void CompatibilityTest::Progress(int nPercent) {
    mResult.nProgress = nPercent;
    if (mPfnCallback != nullptr) {
        mPfnCallback(&mResult, mPData);
    }
}

bool CompatibilityTest::Fail(int nStatus) {
    mResult.nStatus = nStatus;
    return false;
}

bool CompatibilityTest::NoGateway() {
    LogError("%s:%d TavoUpnpTestInit() failed", kEntryFile, __LINE__);
    return Fail(TAVO_ROUTER_STATUS_NO_GATEWAY);
}

bool CompatibilityTest::FindGateway() {
    RouterLog("(%s:%d) =====init upnp start=====", __LINE__);
    Report(kStepInit, kProcessing);
    Report(kStepAdd, kProcessing);
    if (TAVOUpnpInit(kTestSearchLimitSeconds, kTestLocalPort) == 1) {
        Report(kStepInit, kFailed);
        RouterLog("(%s:%d) init fail, try again later", __LINE__);
        return NoGateway();
    }
    if (TAVOUpnpGatewayModelGet(&mModel) < 0) {
        Report(kStepInit, kFailed);
        RouterLog("(%s:%d) Failed to get model information from gateway", __LINE__);
        return NoGateway();
    }
    Report(kStepInit, kSuccess);
    if (TAVOUpnpCleanup() != 0) {
        RouterLog("(%s:%d) Failed to TAVOUpnpCleanup()", __LINE__);
    }
    Progress(30);
    return true;
}

bool CompatibilityTest::AddRules() {
    unlink(kUpnpStatus);
    unlink(kUpnpStatusNew);
    RouterLog("(%s:%d) =====add port test start=====", __LINE__);
    Report(kStepAdd, kProcessing);
    if (TAVOUPnPAddTest(mNRules) < 0) {
        Report(kStepAdd, kFailed);
        LogError("%s:%d TavoUpnpTestAdd() failed", kEntryFile, __LINE__);
        return Fail(TAVO_ROUTER_STATUS_TEST_ADD);
    }
    return IsStepDone(kStepAdd) || Fail(TAVO_ROUTER_STATUS_TEST_ADD);
}

bool CompatibilityTest::CountRules() {
    Progress(60);
    RouterLog("(%s:%d) =====count max rule start=====", __LINE__);
    Report(kStepMax, kProcessing);
    const int nCount = TAVOUPnPCountMaxRule();
    if (nCount < 1) {
        Report(kStepMax, "-1");
        LogError("%s:%d TavoUpnpTestMaxRuleGet() failed", kEntryFile, __LINE__);
        return Fail(TAVO_ROUTER_STATUS_TEST_MAX);
    }
    char szCount[kCountTextSize] = {};
    if (std::snprintf(szCount, sizeof(szCount), "%d", nCount) < 0) {
        return Fail(TAVO_ROUTER_STATUS_TEST_MAX);
    }
    Report(kStepMax, szCount);
    char szValue[kStepValueSize] = {};
    if (TLIBCFileGetKeyValue(kTestProgress, kStepMax, szValue, sizeof(szValue), 0) < 1) {
        return Refuse("%s:%d %s[0x%04X %s:%d]", kEntryFile, __LINE__, "max empty", static_cast<unsigned>(TLIBCErrGet()),
                      TLIBCErrorGetFile(), TLIBCErrorGetLine());
    }
    mNCounted = tavo::lib::ToInt(szValue);
    return true;
}

bool CompatibilityTest::DeleteRules() {
    Progress(40);
    RouterLog("(%s:%d) =====delete port test start=====", __LINE__);
    Report(kStepDelete, kProcessing);
    if (TAVOUPnPDeletetest() < 0) {
        Report(kStepDelete, kFailed);
        LogError("%s:%d TavoUpnpTestDeleteRules() failed", kEntryFile, __LINE__);
        return Fail(TAVO_ROUTER_STATUS_TEST_DELETE);
    }
    return IsStepDone(kStepDelete) || Fail(TAVO_ROUTER_STATUS_TEST_DELETE);
}

bool CompatibilityTest::ClosedPorts() {
    Progress(50);
    unlink(kPortTestMarker);
    RouterLog("(%s:%d) =====test ports connection status(del) start=====", __LINE__);
    Report(kStepClosed, kProcessing);
    if (TAVOUPnPSetupTest(kConnectionLimitSeconds, 0) != 0 || TAVOUPnPPortTest(0) != 0) {
        Report(kStepClosed, kFailed);
        LogError("%s:%d TavoUpnpTestConnForDeletedPorts() failed", kEntryFile, __LINE__);
        return Fail(TAVO_ROUTER_STATUS_TEST_CLOSED_PORTS);
    }
    Report(kStepClosed, kSuccess);
    return IsStepDone(kStepClosed) || Fail(TAVO_ROUTER_STATUS_TEST_CLOSED_PORTS);
}

bool CompatibilityTest::ReaddRules() {
    Progress(70);
    RouterLog("(%s:%d) =====re-add port test start=====", __LINE__);
    Report(kStepReadd1, kProcessing);
    if (TAVOUPnPModifyRule() < 0) {
        Report(kStepReadd1, kFailed);
        Report(kStepReadd2, kFailed);
        LogError("%s:%d TavoUpnpTestReAdd() failed", kEntryFile, __LINE__);
        return Fail(TAVO_ROUTER_STATUS_TEST_READD);
    }
    return (IsStepDone(kStepReadd1) && IsStepDone(kStepReadd2)) || Fail(TAVO_ROUTER_STATUS_TEST_READD);
}

bool CompatibilityTest::OpenPorts() {
    Progress(80);
    unlink(kPortTestMarker);
    RouterLog("(%s:%d) =====test ports connection status(add) start=====", __LINE__);
    Report(kStepOpen, kProcessing);
    if (TAVOUPnPPortTest(1) != 0) {
        Report(kStepOpen, kFailed);
        LogError("%s:%d TavoUpnpTestConnForAddedPorts() failed", kEntryFile, __LINE__);
        return Fail(TAVO_ROUTER_STATUS_TEST_OPEN_PORTS);
    }
    Report(kStepOpen, kSuccess);
    return IsStepDone(kStepOpen) || Fail(TAVO_ROUTER_STATUS_TEST_OPEN_PORTS);
}

bool CompatibilityTest::EndTest() {
    Progress(90);
    if (EndTestDaemon() < 0) {
        LogError("%s:%d TavoUpnpTestTerminate() failed", kEntryFile, __LINE__);
        return Fail(TAVO_ROUTER_STATUS_TEST_TERMINAL);
    }
    return IsStepDone(kStepTerminal) || Fail(TAVO_ROUTER_STATUS_TEST_TERMINAL);
}

bool CompatibilityTest::RunSteps() {
    return AddRules() && CountRules() && DeleteRules() && ClosedPorts() && ReaddRules() && OpenPorts() && EndTest();
}

int CompatibilityTest::Finish(const char* szSupport, int nMaxRule, int nAnswer) {
    if (FillTestResult(&mResult, mModel, szSupport, nMaxRule) < 0) {
        LogError("%s:%d fillTestCompResult() failed", kEntryFile, __LINE__);
    } else if (mPfnCallback != nullptr) {
        mPfnCallback(&mResult, mPData);
    }
    return nAnswer;
}

int CompatibilityTest::Run(bool blLock) {
    mResult = TestResult{};
    Progress(10);
    RouterLock lock;
    if (blLock && !lock.Get()) {
        LogError("%s:%d PortForward conflict = %s", kEntryFile, __LINE__, kRouterLock);
        Fail(TAVO_ROUTER_STATUS_LOCKED);
        return EndEarly();
    }
    RemoveFile(kTestStepFile);
    if (IsTestDaemonAlive()) {
        LogError("%s:%d upnp compatibility test process:%s is running", kEntryFile, __LINE__,
                 tavo::lib::kUpnpTestDaemon);
        return EndEarly();
    }
    RemoveFile(kTestProgress);
    Progress(20);
    if (!FindGateway()) {
        return EndEarly();
    }
    return RunSteps() ? Finish("yes", mNCounted, 0) : Finish("no", -1, 1);
}

void SignalIfAlive(const char* szName) {
    if (TLIBCIsProcAlive(szName) == 1) {
        TLIBCKill(szName, SIGHUP);
    }
}

}  // namespace

int TLibTestUpnpCompatibility(int nMaxRule, __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT* testCompResult,
                              void (*pfnCallback)(const __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT*, void*),
                              void* pData, bool blLock) {
    return AtBorder(-1, [&] {
        if (nMaxRule < kLeastTestRules) {
            LogError("%s:%d nMaxRule=%d < 3 is out of range", kEntryFile, __LINE__, nMaxRule);
            return EndEarly();
        }
        if (testCompResult == nullptr) {
            LogError("%s:%d testCompResult is NULL", kEntryFile, __LINE__);
            return EndEarly();
        }
        return CompatibilityTest(nMaxRule, *testCompResult, pfnCallback, pData).Run(blLock);
    });
}

int TLibStopTestUpnpCompatibility() {
    if (IsTestDaemonAlive()) {
        char szCommand[tavo::lib::kCommandSize] = {};
        std::snprintf(szCommand, sizeof(szCommand), "%s%s", tavo::lib::kBinDir, kTestTool);
        TLIBCExec(szCommand, "-t", nullptr, nullptr, nullptr);
    }
    SignalIfAlive(tavo::lib::kUpnpTestDaemon);
    SignalIfAlive(kPortTestTool);
    for (const char* szFile : {kPortTestMarker, kTestProgress, kUpnpStatus, kRouterLog, kTestLock}) {
        unlink(szFile);
    }
    return 0;
}
