// The files and orders of the UPnP compatibility test. Relies on the platform's sectioned files and on a local
// socket. Promises: see TestRules.h.
#include "wire/upnptest/TestRules.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>

#include "ground/ConfList.h"
#include "ground/Descriptor.h"
#include "ground/Paths.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

constexpr char kTestRules[] = "/var/lib/tavo/upnp_test.conf";
constexpr auto kOrderLimit = std::chrono::seconds(2);  // a daemon just started opens its socket within it
constexpr auto kEndLimit = std::chrono::seconds(12);   // it takes its mappings away meanwhile
constexpr int kPollMilliseconds = 50;

uint16_t ToPort(const std::string& szText) {
    uint16_t nPort = 0;
    std::from_chars(szText.data(), szText.data() + szText.size(), nPort);
    return nPort;
}

}  // namespace

std::vector<TestRule> LoadTestRules() {
    std::vector<TestRule> rgRules;
    const ConfList pRules = LoadConfList(kTestRules);
    for (const TAVO_PF_CONF* pRule = pRules.get(); pRule != nullptr; pRule = pRule->pNext) {
        rgRules.push_back({ToPort(Value(pRule, "r_port")), ToPort(Value(pRule, "s_port")),
                           Value(pRule, "enabled") == "1", Value(pRule, "result")});
    }
    return rgRules;
}

bool SaveTestRules(const std::vector<TestRule>& rgRules) {
    std::vector<Section> rgSections;
    for (const TestRule& rule : rgRules) {
        rgSections.push_back({std::to_string(rgSections.size() + 1),
                              {{"r_port", std::to_string(rule.nRouterPort)},
                               {"s_port", std::to_string(rule.nBoxPort)},
                               {"enabled", rule.blKept ? "1" : "0"},
                               {"result", rule.szResult}}});
    }
    return MakeDirectory(kStateDir) && WriteFileAtomic(kTestRules, FormatSections(rgSections));
}

bool RemoveTestRules() {
    return unlink(kTestRules) == 0 || errno == ENOENT;
}

bool IsStepUnderWay(const char* szStep) {
    char szWord[16] = {};
    return TLIBCFileGetKeyValue(kTestProgress, szStep, szWord, sizeof(szWord), 0) >= 1 &&
           std::strcmp(szWord, kWordProcessing) == 0;
}

bool IsTestDaemonAlive() {
    return TLIBCIsProcAlive(kTestDaemon) == 1;
}

bool SendTestOrder(std::string_view szOrder) {
    const Descriptor fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof(address.sun_path), "%s", kTestSocket);
    const auto end = Clock::now() + kOrderLimit;
    while (fd.Get() >= 0 && IsTestDaemonAlive()) {
        if (sendto(fd.Get(), szOrder.data(), szOrder.size(), MSG_NOSIGNAL, reinterpret_cast<const sockaddr*>(&address),
                   sizeof(address)) == static_cast<ssize_t>(szOrder.size())) {
            return true;
        }
        if (Clock::now() > end) {
            break;
        }
        poll(nullptr, 0, kPollMilliseconds);
    }
    return false;
}

void EndTestDaemon() {
    const auto end = Clock::now() + kEndLimit;
    if (!SendTestOrder(kOrderEnd)) {
        return;
    }
    while (IsTestDaemonAlive() && Clock::now() < end) {
        poll(nullptr, 0, kPollMilliseconds);
    }
}

}  // namespace tavo
