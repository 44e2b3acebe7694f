// The port connection tester of the seam: rules taken apart into ports, and the ports' verdicts put together into
// one for each rule. Relies on TestPorts. Promises: see tavo/porttest.h.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>

#include "ground/Border.h"
#include "ground/ConfList.h"
#include "ground/Descriptor.h"
#include "ground/Fail.h"
#include "ground/SysLog.h"
#include "porttest/PortTest.h"
#include "porttest/RuleVerdict.h"
#include "tavo/porttest.h"

namespace {

using tavo::Fail;

using namespace tavo;

constexpr char kMarker[] = "/tmp/pfStatusRule";
constexpr mode_t kMarkerMode = 0644;
constexpr int kTestFlag = 1;
constexpr size_t kMaxQuestions = 4096;  // for all rules together; no settings allow as many

// In a directory where everybody may write: a link, or what another user put there, is not the marker.
bool IsOurMarker() {
    struct stat status = {};
    return lstat(kMarker, &status) == 0 && S_ISREG(status.st_mode) &&
           (status.st_uid == geteuid() || status.st_uid == 0);
}

bool MakeMarker() {
    const Descriptor fd(open(kMarker, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kMarkerMode));
    return fd.Get() >= 0;
}

// One rule's share of the questions: nCount of them from nFirst on; without any, the verdict stands already.
struct RulePart {
    PortVerdict verdict;
    size_t nFirst = 0;
    size_t nCount = 0;
    size_t nLeftOut = 0;
};

RulePart TakeApart(const TAVO_PF_CONF* pRule, std::vector<PortQuestion>& rgQuestions) {
    if (Value(pRule, "enabled") != "1") {
        return {{TAVO_PORT_DISABLED, "the rule is disabled"}};
    }
    auto rgMappings = ExpandRule(Value(pRule, "protocol name"), Value(pRule, "r_port"), Value(pRule, "s_port"));
    if (!rgMappings) {
        return {{TAVO_PORT_UNKNOWN, "the rule's protocol or ports cannot be read, or its ports not be paired"}};
    }
    const size_t nFirst = rgQuestions.size();
    const size_t nCount = std::min(rgMappings->size(), kMaxQuestions - nFirst);
    for (size_t i = 0; i < nCount; ++i) {
        rgQuestions.push_back({std::move((*rgMappings)[i])});
    }
    return {{TAVO_PORT_UNKNOWN, ""}, nFirst, nCount, rgMappings->size() - nCount};
}

PortVerdict PutTogether(const RulePart& part, const std::vector<PortQuestion>& rgQuestions,
                        const std::vector<PortVerdict>& rgVerdicts) {
    if (part.nCount + part.nLeftOut == 0) {
        return part.verdict;
    }
    std::vector<NamedVerdict> rgNamed;
    for (size_t i = part.nFirst; i < part.nFirst + part.nCount; ++i) {
        const SingleMapping& mapping = rgQuestions[i].mapping;
        rgNamed.push_back({PortName(mapping.szProtocol, mapping.nRouterPort), rgVerdicts[i]});
    }
    return MergeVerdicts(std::move(rgNamed), part.nLeftOut);
}

void Fill(TAVO_PORT_STATUS& status, const PortVerdict& verdict) {
    std::snprintf(status.szText, sizeof(status.szText), "%s", verdict.szReason.c_str());
    status.enStatus = verdict.enStatus;
}

}  // namespace

int TavoPortConnTestInit() {
    return AtBorder(-1, [] {
        if (IsOurMarker() || MakeMarker() || (unlink(kMarker) == 0 && MakeMarker())) {
            return 0;
        }
        return Fail(TLIBC_ERR_WRITE);
    });
}

int TavoPortConnTest(const TAVO_PF_CONF* pRules, int nFlags, TAVO_PORT_STATUS* rgStatus, int nRules) {
    return AtBorder(-1, [&] {
        if (nFlags != kTestFlag || nRules < 0 || (rgStatus == nullptr && nRules > 0)) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const auto nParts = static_cast<size_t>(nRules);
        std::vector<PortQuestion> rgQuestions;
        std::vector<RulePart> rgParts;
        for (const TAVO_PF_CONF* pRule = pRules; pRule != nullptr && rgParts.size() < nParts; pRule = pRule->pNext) {
            rgParts.push_back(TakeApart(pRule, rgQuestions));
        }
        rgParts.resize(nParts, {{TAVO_PORT_UNKNOWN, "there is no such rule"}});
        const std::vector<PortVerdict> rgVerdicts =
            rgQuestions.empty() ? std::vector<PortVerdict>() : TestPorts(rgQuestions);
        for (size_t i = 0; i < nParts; ++i) {
            Fill(rgStatus[i], PutTogether(rgParts[i], rgQuestions, rgVerdicts));
            // The library passes on the status alone; the reason is for whoever reads the log.
            tavo::SysLog(LOG_NOTICE, "port test, rule %zu: %s", i + 1, rgStatus[i].szText);
        }
        return 0;
    });
}
