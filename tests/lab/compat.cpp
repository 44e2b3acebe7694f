// Tests a router and prints one line of JSON about it.
// Usage: compat steps N   by the platform's calls, in the library's order but without its pauses
//        compat test N    by the library
//        compat stop      ends a test of another process, by the library
//        compat known     looks who the router is, and keeps that its UPnP works
//        compat report    sends the files of a test
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>

#include "libtavoportmap.h"
#include "tavo/core.h"
#include "tavo/upnptest.h"

namespace {

constexpr char kProgress[] = "/tmp/upnp_test.progress";
constexpr useconds_t kPollMicroseconds = 20000;
constexpr int kUsualRules = 60;

bool IsDone(const char* szStep) {
    char szWord[32] = "processing";
    while (std::strcmp(szWord, "processing") == 0) {
        usleep(kPollMicroseconds);
        if (TLIBCFileGetKeyValue(kProgress, szStep, szWord, sizeof(szWord), 0) < 1) {
            return false;
        }
    }
    return std::strcmp(szWord, "finished") == 0;
}

bool Step(const char* szStep, const std::function<int()>& fnStart) {
    TAVOUpnpReportTestProgress(szStep, "processing", 0);
    return fnStart() == 0 && IsDone(szStep);
}

const char* FailedStep(int nRules, int& nCount) {
    if (!Step("upnp_add", [&] { return TAVOUPnPAddTest(nRules); })) {
        return "upnp_add";
    }
    nCount = TAVOUPnPCountMaxRule();
    if (nCount < 1) {
        return "upnp_max";
    }
    if (!Step("upnp_delete", &TAVOUPnPDeletetest)) {
        return "upnp_delete";
    }
    if (TAVOUPnPSetupTest(60, 0) != 0 || TAVOUPnPPortTest(0) != 0) {
        return "upnp_connection_failed";
    }
    if (!Step("upnp_readd1", &TAVOUPnPModifyRule)) {
        return "upnp_readd1";
    }
    if (!IsDone("upnp_readd2")) {
        return "upnp_readd2";
    }
    unlink("/tmp/pfStatusRule");
    if (TAVOUPnPPortTest(1) != 0) {
        return "upnp_connection_success";
    }
    return Step("upnp_terminal", &TAVOUPnPDeletetest) ? "" : "upnp_terminal";
}

int RunSteps(int nRules) {
    int nCount = 0;
    const char* szFailed = FailedStep(nRules, nCount);
    std::printf("{\"failed\": \"%s\", \"count\": %d}\n", szFailed, nCount);
    return *szFailed == '\0' ? 0 : 1;
}

int KnowRouter() {
    UpnpDetector detector;
    if (!detector.Start()) {
        return 1;
    }
    __tag_TAVO_ROUTER_RECORD record = {};
    std::snprintf(record.szBrand, sizeof(record.szBrand), "%s", detector.GetBrand().c_str());
    std::snprintf(record.szModel, sizeof(record.szModel), "%s", detector.GetModel().c_str());
    std::snprintf(record.szVersion, sizeof(record.szVersion), "%s", detector.GetVersion().c_str());
    std::snprintf(record.szSupport, sizeof(record.szSupport), "yes");
    record.nMaxRule = kUsualRules;
    const bool blKept = TLibWriteRecordIntoUpnpDB(&record) == 0 && detector.Start();
    return blKept && detector.GetSupportUpnp() == "yes" ? 0 : 1;
}

int RunTest(int nRules) {
    __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT result = {};
    const int nResult = TLibTestUpnpCompatibility(nRules, &result, nullptr, nullptr, true);
    std::printf("{\"result\": %d, \"status\": %d, \"support\": \"%s\", \"max\": %d}\n", nResult, result.nStatus,
                result.szSupport, result.nMaxRule);
    return nResult == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
    const std::string szVerb = argc > 1 ? argv[1] : "";
    const int nRules = argc > 2 ? std::atoi(argv[2]) : 0;
    if (szVerb == "stop") {
        return TLibStopTestUpnpCompatibility();
    }
    if (szVerb == "known") {
        return KnowRouter();
    }
    if (szVerb == "report") {
        return TLibUploadTestUpnpCompatibilityFailResult() == 0 ? 0 : 1;
    }
    return szVerb == "test" ? RunTest(nRules) : RunSteps(nRules);
}
