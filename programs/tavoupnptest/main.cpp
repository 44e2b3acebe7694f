// tavoupnptest: starts a test of the router by hand, and ends a running one. Relies on the calls that the
// library uses. Promises: waits for nothing but the start, and for the end that -t asks for.
#include <unistd.h>

#include <charconv>
#include <cstdio>
#include <cstring>
#include <string>

#include "tavo/upnptest.h"
#include "wire/upnptest/TestRules.h"

namespace {

constexpr char kHelp[] =
    "Usage: tavoupnptest [N | -t | --help]\n"
    "Tests what the router does with UPnP port mappings of TCP ports that nobody uses.\n"
    "\n"
    "  N       starts a test of N mappings (without it: 60), \"/usr/tavo/sbin/upnpd --debug -p\"\n"
    "  -t      ends the running test: its mappings are taken away\n"
    "  --help  this text\n"
    "\n"
    "What became of each step stands in /tmp/upnp_test.progress and /var/log/router.log. A test that nobody\n"
    "directs ends by itself after three minutes.\n"
    "Exit status: 0 started, or no test runs any more; 1 it could not be; 2 unknown argument.\n";
constexpr int kUsualRules = 60;
constexpr int kFailed = 1;
constexpr int kUsage = 2;

bool IsRoot() {
    if (geteuid() == 0) {
        return true;
    }
    std::fputs("tavoupnptest: this needs root: run it with sudo\n", stderr);
    return false;
}

int End() {
    tavo::EndTestDaemon();
    return tavo::IsTestDaemonAlive() ? kFailed : 0;
}

int Start(int nRules) {
    TAVOUpnpReportTestProgress(tavo::kStepAdd, tavo::kWordProcessing, 0);
    if (TAVOUPnPAddTest(nRules) != 0) {
        std::fputs("tavoupnptest: a test is running already, or upnpd cannot be started\n", stderr);
        return kFailed;
    }
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    const std::string szArgument = argc > 1 ? argv[1] : "";
    if (szArgument == "-t" && argc == 2) {
        return IsRoot() ? End() : kFailed;
    }
    if (szArgument == "--help") {
        std::fputs(kHelp, stdout);
        return 0;
    }
    int nRules = kUsualRules;
    const char* szEnd = szArgument.data() + szArgument.size();
    const auto [pEnd, error] = std::from_chars(szArgument.data(), szEnd, nRules);
    if (argc > 2 || (argc == 2 && (error != std::errc() || pEnd != szEnd || nRules < 1))) {
        std::fputs(kHelp, stderr);
        return kUsage;
    }
    return IsRoot() ? Start(nRules) : kFailed;
}
