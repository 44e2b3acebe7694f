// Turns jobs and refusals into log lines, events and rows. Relies on Published and the platform's event log.
// Promises: see Telling.h.
#include "programs/tavoportforward/Telling.h"

#include <algorithm>
#include <ctime>

#include "ground/ConfList.h"
#include "ground/PortText.h"
#include "ground/SysLog.h"
#include "programs/common/Published.h"
#include "programs/common/RuleFile.h"
#include "tavo/log.h"

namespace tavo {

namespace {

constexpr char kName[] = "tavoportforward";
constexpr char kProtocol[] = "pages";
constexpr int kErrorLevel = 3;
constexpr int kSystemEvents = 1;
constexpr size_t kMaxText = 1000;

void AddEvent(const std::string& szWhat, const std::string& szWhy) {
    TAVOLogSet1(kSystemEvents, kErrorLevel, TAVO_EVENT_PF_ADD_FAILED, szWhat.c_str(), ("(" + szWhy + ")").c_str(),
                nullptr, nullptr);
}

// One log line each, and one event for each reason.
void Log(const std::vector<Refusal>& rgRefusals) {
    std::vector<std::pair<std::string, std::string>> rgEvents;  // reason, what it holds for
    for (const Refusal& refusal : rgRefusals) {
        const std::string szWhat = (refusal.enKind == RefusalKind::kRemoval ? "removal of " : "") + refusal.szWhat;
        SysLog(LOG_ERR, "%s: %s", szWhat.c_str(), refusal.szWhy.c_str());
        const auto it = std::find_if(rgEvents.begin(), rgEvents.end(),
                                     [&](const auto& event) { return event.first == refusal.szWhy; });
        if (it == rgEvents.end()) {
            rgEvents.emplace_back(refusal.szWhy, szWhat);
        } else if (it->second.size() < kMaxText) {
            it->second += ", " + szWhat;
        }
    }
    for (const auto& [szWhy, szWhat] : rgEvents) {
        AddEvent(szWhat, szWhy);
    }
}

// A row for each port of a job and each of its protocols; one without ports for a rule that has no job.
void AddRows(const Job& job, const std::string& szName, const Verdict& verdict, OutcomeList& rgOutcomes) {
    Outcome outcome{szName, verdict};
    outcome.szRule = job.szRule;
    if (job.mapping.nRouterPort == 0) {
        rgOutcomes.push_back(outcome);
        return;
    }
    for (const char* szProtocol : {"TCP", "UDP"}) {
        if (job.mapping.szProtocol != szProtocol && job.mapping.szProtocol != "BOTH") {
            continue;
        }
        outcome.szProtocol = szProtocol;
        for (int i = 0; i <= job.mapping.nMore; ++i) {
            outcome.nRouterPort = static_cast<uint16_t>(job.mapping.nRouterPort + i);
            outcome.nBoxPort = static_cast<uint16_t>(job.mapping.nBoxPort + i);
            outcome.szName = PortName(szProtocol, outcome.nRouterPort);
            rgOutcomes.push_back(outcome);
        }
    }
}

Verdict NotInPlace(const Refusal& refusal) {
    Verdict verdict{refusal.blAnswered ? PortState::kRefused : PortState::kUnknown,
                    refusal.blAnswered ? "refused" : "unknown"};
    verdict.szWhy = refusal.szWhy;
    verdict.holder = refusal.holder;
    return verdict;
}

OutcomeList Outcomes(const RunResult& result) {
    OutcomeList rgOutcomes;
    for (const Job& job : result.rgWanted) {
        const bool blInPlace =
            std::none_of(result.rgRefusals.begin(), result.rgRefusals.end(), [&](const Refusal& refusal) {
                return refusal.enKind == RefusalKind::kForward && IsSame(refusal.job.mapping, job.mapping);
            });
        if (blInPlace) {
            AddRows(job, "", {PortState::kOpen, "1"}, rgOutcomes);
        }
    }
    for (const Refusal& refusal : result.rgRefusals) {
        if (refusal.enKind == RefusalKind::kForward) {
            AddRows(refusal.job, refusal.szWhat, NotInPlace(refusal), rgOutcomes);
        } else if (refusal.enKind == RefusalKind::kRemoval) {
            rgOutcomes.push_back({refusal.szWhat, NotInPlace(refusal)});
            rgOutcomes.back().blLeftOver = true;
        }
    }
    return rgOutcomes;
}

Published StateOf(const RunResult& result) {
    Published state{.szDaemon = kName, .szProtocol = kProtocol};
    state.nAt = std::time(nullptr);
    state.blSwitchedOn = result.blInUse;
    state.blRulesReadable = result.blRulesReadable;
    state.szGateway = result.szGateway;
    state.szBox = result.szBox;
    state.enRouter = result.enRouter;
    state.szRouterWhy = result.szRouterWhy;
    state.rgOutcomes = Outcomes(result);
    state.nRouterSince = state.nAt;
    for (Outcome& outcome : state.rgOutcomes) {
        outcome.nSince = state.nAt;
    }
    return state;
}

}  // namespace

void Tell(const RunResult& result) {
    Log(result.rgRefusals);
    Publish(StateOf(result));
}

std::string TextOf(const RunResult& result) {
    return ToJson(StateOf(result));
}

void TellNotTried(RunResult result, const std::string& szWhy) {
    SysLog(LOG_ERR, "nothing was tried: %s", szWhy.c_str());
    const ConfList pRules(TAVOPFRuleGet());
    result.blRulesReadable =
        pRules != nullptr || TLIBCErrGet() == TLIBC_ERR_NONE || TLIBCErrGet() == TLIBC_ERR_NOT_FOUND;
    if (!result.blRulesReadable || TLIBPFCountRuleConf(pRules.get(), 1) != 0) {  // else there was nothing to try either
        AddEvent("all", szWhy);
    }
    result.szRouterWhy = szWhy;
    for (const TAVO_PF_CONF* pRule = pRules.get(); pRule != nullptr; pRule = pRule->pNext) {
        if (Value(pRule, "enabled") != "1") {
            continue;
        }
        const RuleText rule = RuleTextOf(pRule);
        const auto rgSingles = ExpandRule(rule.szProtocol, rule.szRouterPorts, rule.szBoxPorts);
        for (const SingleMapping& single : rgSingles.value_or(std::vector<SingleMapping>())) {
            const Job job{{single.szProtocol, single.nRouterPort, single.nBoxPort, "", ""}, RuleTitle(rule)};
            result.rgRefusals.push_back({MappingName(job.mapping), szWhy, job, RefusalKind::kForward, false});
        }
    }
    Publish(StateOf(result));
}

}  // namespace tavo
