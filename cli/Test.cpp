// "test": which ports of the stored rules can be reached from outside. Relies on TLibTestRules. Promises: saves
// and changes nothing; a rule of several ports gets a verdict for each of them, unless they are very many.
#include <fmt/format.h>

#include <algorithm>

#include "Box.h"
#include "Capture.h"
#include "Commands.h"
#include "PortPairs.h"
#include "Progress.h"
#include "Reach.h"
#include "RuleStore.h"
#include "Test.h"

namespace tavo::cli {

namespace {

constexpr size_t kMostSingles = 64;  // ports of one rule that get a line of their own

// The rule in as many parts as there are verdicts to give.
Rules TakeApart(const Rule& rule) {
    const auto rgRouter = ParsePorts(rule.szRouterPorts);
    const auto rgBox = ParsePorts(rule.szBoxPorts);
    if (!rule.blEnabled || !rgRouter || !rgBox || rgRouter->size() != rgBox->size() ||
        rgRouter->size() > kMostSingles) {
        return {rule};
    }
    Rules parts;
    for (size_t i = 0; i < rgRouter->size(); ++i) {
        for (const std::string& szProtocol : ProtocolsOf(rule.szProtocol)) {
            parts.push_back(rule);
            parts.back().szProtocol = szProtocol;
            parts.back().szRouterPorts = std::to_string((*rgRouter)[i]);
            parts.back().szBoxPorts = std::to_string((*rgBox)[i]);
        }
    }
    return parts;
}

// The rules with these ids, all without any; the id that no rule has, where there is one.
Rules Chosen(const Rules& rules, const std::vector<std::string>& rgszIds, std::string& szMissing) {
    if (rgszIds.empty()) {
        return rules;
    }
    Rules chosen;
    for (const std::string& szId : rgszIds) {
        const auto pRule =
            std::find_if(rules.begin(), rules.end(), [&](const Rule& rule) { return rule.szId == szId; });
        if (pRule == rules.end()) {
            szMissing = szId;
            break;
        }
        chosen.push_back(*pRule);
    }
    return chosen;
}

Reply TestParts(const Rules& parts, bool blJson) {
    auto rgRecords = ToRecords(parts);
    if (!rgRecords) {
        return Failure(TooLong(parts));
    }
    Progress progress(blJson);
    progress.Show(0, "having the ports looked at from outside; half a minute at most");
    auto enError = TAVO_LIBTAVOPORTMAP_ERR_NONE;
    LogCapture log;
    const bool blTested = TLibTestRulesInit() == 0 &&
                          TLibTestRules(static_cast<int>(rgRecords->size()), rgRecords->data(), &enError, true) == 0;
    const std::string szLog = log.Take();
    progress.End();
    if (!blTested) {
        return enError == TAVO_LIBTAVOPORTMAP_ERR_CONFLICT
                   ? Busy()
                   : Failure("the ports could not be tested; the system log says why");
    }
    std::vector<PortVerdict> rgVerdicts;
    for (size_t i = 0; i < parts.size(); ++i) {
        const Rule& part = parts[i];
        rgVerdicts.push_back({part.szId, part.szName, part.szRouterPorts, part.szBoxPorts, part.szProtocol,
                              (*rgRecords)[i].enTestStatus});
    }
    AddReasons(rgVerdicts, szLog);
    Reply reply;
    DescribePorts(rgVerdicts, reply);
    reply.szMessage = reply.enExit == kRefused  ? "some ports do not answer to the outside"
                      : reply.enExit == kFailed ? "some ports could not be judged"
                                                : "every port that is switched on can be reached from outside";
    return reply;
}

Reply Test(const std::vector<std::string>& rgszIds, bool blJson) {
    const auto rules = LoadRules();
    if (!rules) {
        return NeedsRoot().value_or(Failure(kUnreadable));
    }
    std::string szMissing;
    const Rules chosen = Chosen(*rules, rgszIds, szMissing);
    if (!szMissing.empty()) {
        return NoSuchRule(*rules, szMissing);
    }
    if (std::none_of(chosen.begin(), chosen.end(), [](const Rule& rule) { return rule.blEnabled; })) {
        return {.szMessage = "there is no rule to test that is switched on; 'sudo tavoportmap rules list' shows them"};
    }
    return TestRules(chosen, blJson);
}

}  // namespace

Reply TestRules(const Rules& rules, bool blJson) {
    Rules parts;
    for (const Rule& rule : rules) {
        const Rules more = TakeApart(rule);
        parts.insert(parts.end(), more.begin(), more.end());
    }
    return TestParts(parts, blJson);
}

void OfferTest(CLI::App& app, Request& request) {
    const auto pIds = std::make_shared<std::vector<std::string>>();
    CLI::App* pTest = AddCommand(app, "test", "test from outside whether the rules' ports can be reached");
    pTest->add_option("id", *pIds, "only these rules, as 'rules list' shows them");
    pTest->footer(
        "  ok          a connection from outside came through to this box\n"
        "  fail        the port is closed, or another host answers\n"
        "  not tested  nothing listens there on this box, or nobody outside could tell\n"
        "  disabled    the rule is switched off\n"
        "Nobody outside can tell as long as no port checker is named as url in [portcheck] of /etc/tavo/platform.conf; "
        "tavoportcheckd on a host elsewhere is one.\n");
    pTest->callback([pIds, &request] { request.fnCommand = [pIds, &request] { return Test(*pIds, request.blJson); }; });
}

}  // namespace tavo::cli
