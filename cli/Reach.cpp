// The table of tested ports. Relies on fmt and on the platform's settings. Promises: see Reach.h.
#include "Reach.h"

#include <fmt/format.h>

#include <algorithm>

#include "Table.h"
#include "tavo/core.h"

namespace tavo::cli {

namespace {

enum Status : int { kNotTested = 0, kDisabled = 1, kOpen = 2, kClosed = 3 };

constexpr char kAdviceClosed[] =
    "closed from outside: have the rules been written ('sudo tavoportmap save')? Then it is another router on the way "
    "('sudo tavoportmap detect' warns of it), a firewall, or a provider who blocks the port";
constexpr size_t kUrlSize = 1024;
constexpr std::string_view kNotTestedSaid = "not tested: ";
constexpr char kAdviceNoChecker[] =
    "whether a port is open can only be told from outside, by a port checker: tavoportcheckd on a host elsewhere, "
    "named as url in [portcheck] of /etc/tavo/platform.conf";

std::string StatusWord(int enStatus) {
    constexpr const char* kWords[] = {"not tested", "disabled", "ok", "fail"};
    return enStatus >= kNotTested && enStatus <= kClosed ? kWords[enStatus] : "unknown";
}

// The words of the log for the verdicts that could not be given, in their order: "UNKNOWN", "NOLISTEN".
std::vector<std::string> LoggedWords(const std::string& szLog) {
    constexpr std::string_view kBegin = "router_prots [";
    constexpr std::string_view kMiddle = "] = ";
    std::vector<std::string> rgszWords;
    for (size_t nAt = szLog.find(kBegin); nAt != std::string::npos; nAt = szLog.find(kBegin, nAt + 1)) {
        const size_t nWord = szLog.find(kMiddle, nAt) + kMiddle.size();
        rgszWords.push_back(szLog.substr(nWord, szLog.find('\n', nWord) - nWord));
    }
    return rgszWords;
}

// What the tester said of the rule at this place, without the port where it is the only one; empty when it said
// nothing.
std::string LoggedReason(const std::string& szLog, size_t nRule, const PortVerdict& verdict) {
    const std::string szBegin = fmt::format("port test, rule {}: ", nRule + 1);
    const std::string szPort = fmt::format("{}/{}: ", verdict.szRouterPorts, verdict.szProtocol);
    const size_t nAt = szLog.rfind(szBegin);
    if (nAt == std::string::npos) {
        return "";
    }
    const std::string szReason = szLog.substr(nAt + szBegin.size(), szLog.find('\n', nAt) - nAt - szBegin.size());
    std::string_view szRest(szReason);
    for (const std::string_view szSaid : {std::string_view(szPort), kNotTestedSaid}) {  // beside it in the table
        szRest.remove_prefix(szRest.starts_with(szSaid) ? szSaid.size() : 0);
    }
    return Clean(std::string(szRest));
}

// What stands there when the tester said nothing.
std::string UsualReason(const PortVerdict& verdict) {
    switch (verdict.enStatus) {
        case kNotTested:
            return verdict.blNobodyListens ? "no program on this box listens there" : "nobody outside could tell";
        case kDisabled:
            return "the rule is switched off";
        case kOpen:
            return "a connection from outside came through to this box";
        case kClosed:
            return "refused, without an answer, or another host answers";
        default:
            return "the tester gave no verdict that is known";
    }
}

// What the tester found wrong with the checker, not with a port; empty when nothing.
std::string FaultOfChecker(const std::vector<PortVerdict>& rgVerdicts) {
    for (const PortVerdict& verdict : rgVerdicts) {
        const size_t nAt = verdict.szReason.find("the port checker ");
        if (verdict.enStatus == kNotTested && nAt != std::string::npos) {
            return verdict.szReason.substr(nAt, verdict.szReason.find(';', nAt) - nAt);  // other ports may follow
        }
    }
    return "";
}

// What can be done about ports that could not be judged; empty where the table says it.
std::string AdviceNoJudge(const std::vector<PortVerdict>& rgVerdicts) {
    const std::string szUrl = CheckerUrl();
    if (szUrl.empty()) {
        return kAdviceNoChecker;
    }
    const std::string szFault = FaultOfChecker(rgVerdicts);
    return szFault.empty() ? ""
                           : fmt::format("{}; it is {}, named as url in [portcheck] of /etc/tavo/platform.conf",
                                         szFault, Clean(szUrl));
}

std::string PortWords(const PortVerdict& verdict) {
    const std::string szPorts = verdict.szRouterPorts + "/" + verdict.szProtocol;
    return Clean(verdict.szBoxPorts == verdict.szRouterPorts ? szPorts : szPorts + " to " + verdict.szBoxPorts);
}

Json::Value ToJson(const PortVerdict& verdict) {
    Json::Value js;
    js["rule"] = verdict.szRule.empty() ? Json::Value() : Json::Value(verdict.szRule);
    js["name"] = verdict.szName;
    js["router_ports"] = verdict.szRouterPorts;
    js["box_ports"] = verdict.szBoxPorts;
    js["protocol"] = verdict.szProtocol;
    js["status"] = StatusWord(verdict.enStatus);
    js["reason"] = verdict.szReason;
    return js;
}

}  // namespace

std::string CheckerUrl() {
    char szUrl[kUrlSize];
    TLIBPlatformSettingGet("portcheck", "url", "", szUrl, sizeof(szUrl));
    return szUrl;
}

void AddReasons(std::vector<PortVerdict>& rgVerdicts, const std::string& szLog) {
    const std::vector<std::string> rgszWords = LoggedWords(szLog);
    const auto nUnjudged = std::count_if(rgVerdicts.begin(), rgVerdicts.end(),
                                         [](const PortVerdict& verdict) { return verdict.enStatus == kNotTested; });
    // A log that does not fit the verdicts says nothing about any one of them.
    const bool blFits = rgszWords.size() == static_cast<size_t>(nUnjudged);
    size_t nWord = 0;
    for (size_t i = 0; i < rgVerdicts.size(); ++i) {
        PortVerdict& verdict = rgVerdicts[i];
        verdict.blNobodyListens = verdict.enStatus == kNotTested && blFits && rgszWords[nWord++] == "NOLISTEN";
        const std::string szLogged = LoggedReason(szLog, i, verdict);
        // "open" and "the rule is disabled" say less than our own words.
        const bool blSaysMore = !szLogged.empty() && szLogged != "open" && verdict.enStatus != kDisabled;
        verdict.szReason = blSaysMore ? szLogged : UsualReason(verdict);
    }
}

void DescribePorts(const std::vector<PortVerdict>& rgVerdicts, Reply& reply) {
    bool blClosed = false, blUnserved = false, blUnjudged = false;
    reply.jsAnswer["ports"] = Json::arrayValue;
    Table table({"rule", "port", "verdict", "reason"});
    for (const PortVerdict& verdict : rgVerdicts) {
        const std::string szRule = verdict.szRule + (verdict.szRule.empty() ? "" : " ") + verdict.szName;
        table.Add({szRule, PortWords(verdict), StatusWord(verdict.enStatus), verdict.szReason});
        reply.jsAnswer["ports"].append(ToJson(verdict));
        blClosed = blClosed || verdict.enStatus == kClosed;
        blUnserved = blUnserved || verdict.blNobodyListens;
        blUnjudged = blUnjudged || (verdict.enStatus == kNotTested && !verdict.blNobodyListens);
    }
    reply.szBody += table.ToText();
    if (const std::string szAdvice = AdviceNoJudge(rgVerdicts); blUnjudged && !szAdvice.empty()) {
        reply.rgszWarnings.push_back(szAdvice);
    }
    if (blClosed) {
        reply.rgszWarnings.emplace_back(kAdviceClosed);
    }
    reply.enExit = blClosed || blUnserved ? kRefused : blUnjudged ? kFailed : kOk;
}

}  // namespace tavo::cli
