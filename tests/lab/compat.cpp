// Tests a router by the platform's calls, in the library's order but without its pauses, and prints one line
// of JSON: the step that failed, the count, and how long it took. Usage: compat N
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>

#include "tavo/core.h"
#include "tavo/upnptest.h"

namespace {

constexpr char kProgress[] = "/tmp/upnp_test.progress";
constexpr useconds_t kPollMicroseconds = 20000;

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

}  // namespace

int main(int argc, char** argv) {
    const auto start = std::chrono::steady_clock::now();
    int nCount = 0;
    const char* szFailed = FailedStep(argc > 1 ? std::atoi(argv[1]) : 0, nCount);
    const std::chrono::duration<double> took = std::chrono::steady_clock::now() - start;
    std::printf("{\"failed\": \"%s\", \"count\": %d, \"seconds\": %.2f}\n", szFailed, nCount, took.count());
    return *szFailed == '\0' ? 0 : 1;
}
