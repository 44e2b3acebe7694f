// Whether the ports of saved rules can be reached from outside. Relies on the platform's port tester.
// Promises: a failure leaves every rule's status as it was; the router lock is given back on every path.
#include <algorithm>
#include <cstdlib>

#include "Border.h"
#include "Entry.h"
#include "Log.h"
#include "Sections.h"
#include "tavo/porttest.h"

namespace {

using tavo::lib::AddRule;
using tavo::lib::AtBorder;
using tavo::lib::GetRouterLock;
using tavo::lib::kEntryFile;
using tavo::lib::kPortTestMarker;
using tavo::lib::LogError;
using tavo::lib::RouterLock;

constexpr int kTesterFlags = 1;

static_assert(sizeof(TAVO_PORT_STATUS) == 1028, "the tester's entry");

enum RuleTestStatus : int { kRuleNotTested = 0, kRuleDisabled = 1, kRuleOk = 2, kRuleFail = 3 };

// The verdict of one rule in the words of the rule record.
int RuleStatusOf(int enStatus, int nIndex, const char* szRouterPort) {
    switch (enStatus) {
        case TAVO_PORT_DISABLED:
            return kRuleDisabled;
        case TAVO_PORT_UNKNOWN:
            LogError("%s:%d router_prots [%s] = UNKNOWN", kEntryFile, __LINE__, szRouterPort);
            return kRuleNotTested;
        case TAVO_PORT_OPEN:
            return kRuleOk;
        case TAVO_PORT_REFUSED:
        case TAVO_PORT_TIMEOUT:
            return kRuleFail;
        case TAVO_PORT_NOLISTEN:
            LogError("%s:%d router_prots [%s] = NOLISTEN", kEntryFile, __LINE__, szRouterPort);
            return kRuleNotTested;
        default:
            LogError("%s:%d [%d] enStatus=%d is non-support enum case", kEntryFile, __LINE__, nIndex, enStatus);
            return kRuleDisabled;
    }
}

int TestRules(int nRules, __tag_TAVO_ROUTER_RULE* rgRules) {
    RouterRuleConfWriter rules;
    for (int i = 0; i < nRules; ++i) {
        if (!AddRule(rules, rgRules[i])) {
            return -1;
        }
    }
    TAVO_PF_CONF* pRulesHead = nullptr;
    if (rules.GetRuleConf(&pRulesHead) == 0) {
        LogError("%s:%d GetRuleConf failed", kEntryFile, __LINE__);
        return -1;
    }
    if (pRulesHead == nullptr && nRules > 0) {
        LogError("%s:%d pRulesHead of GetRuleConf() is NULL", kEntryFile, __LINE__);
        return -1;
    }
    const size_t nEntries = static_cast<size_t>(std::max(nRules, 1));
    const std::unique_ptr<TAVO_PORT_STATUS, tavo::lib::FreeDeleter> pEntries(
        static_cast<TAVO_PORT_STATUS*>(std::calloc(nEntries, sizeof(TAVO_PORT_STATUS))));
    if (!pEntries) {
        LogError("%s:%d malloc failed", kEntryFile, __LINE__);
        return -1;
    }
    if (TavoPortConnTest(pRulesHead, kTesterFlags, pEntries.get(), nRules) < 0) {
        LogError("%s:%d TavoPortConnTest() failed", kEntryFile, __LINE__);
        return -1;
    }
    for (int i = 0; i < nRules; ++i) {
        rgRules[i].enTestStatus = RuleStatusOf(pEntries.get()[i].enStatus, i, rgRules[i].szRouterPort);
    }
    return 0;
}

}  // namespace

int TLibTestRulesInit() {
    if (TavoPortConnTestInit() < 0) {
        LogError("%s:%d TavoPortConnTestInit() failed", kEntryFile, __LINE__);
        return -1;
    }
    return 0;
}

int TLibTestRules(int nRules, __tag_TAVO_ROUTER_RULE* rgRules, __tag_TAVO_LIBTAVOPORTMAP_ERR* err, bool blLock) {
    return AtBorder(-1, [&] {
        if (rgRules == nullptr) {
            LogError("%s:%d Bad parameter, rgRules is NULL", kEntryFile, __LINE__);
            return -1;
        }
        if (nRules < 0) {
            LogError("%s:%d Bad parameter, 0 > nRules=%d", kEntryFile, __LINE__, nRules);
            return -1;
        }
        if (err != nullptr) {
            *err = TAVO_LIBTAVOPORTMAP_ERR_NONE;
        }
        if (TLIBCFileExist(kPortTestMarker) != 1) {
            LogError("%s:%d TLibTestRules() has not been initialized, call TLibTestRulesInit() before TLibTestRules()",
                     kEntryFile, __LINE__);
            return -1;
        }
        RouterLock lock;
        if (blLock && !GetRouterLock(lock, err)) {
            return -1;
        }
        return TestRules(nRules, rgRules);
    });
}
