// The operation rules: built from requests and from rule.conf, written back as public records. Relies on
// its host's test of a port number. Promises: a builder that fails frees what it made.
#include "OperationRules.h"

#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>

namespace {

using tavo::lib::kHopLinkFile;
using tavo::lib::MergeHost;
using tavo::lib::OPERATION_RULE;
using tavo::lib::PortList;

constexpr const char* kProtocols[] = {"tcp", "udp", "all"};
constexpr char kRelayServiceName[] = "hoplink";
constexpr char kRelayServiceId[] = "HopLink";

template <size_t N>
void FillText(char (&szField)[N], const char* szText) {
    std::snprintf(szField, N, "%s", szText);
}

// sscanf leaves a value outside its type undefined; read wide and clamped, it is refused as a port.
int Clamped(long nNumber) {
    return static_cast<int>(std::clamp(nNumber, long{INT_MIN}, long{INT_MAX}));
}

bool AppendRange(const MergeHost& host, PortList& ports, const char* szToken) {
    long nFirst = 0;
    long nLast = 0;
    std::sscanf(szToken, "%ld-%ld", &nFirst, &nLast);
    const int nLow = Clamped(nFirst);
    const int nHigh = Clamped(nLast);
    if (!host.IsValidPortNo(nLow) || !host.IsValidPortNo(nHigh)) {
        host.LogError("%s:%d invalid port range [%d-%d]", kHopLinkFile, __LINE__, nLow, nHigh);
        return false;
    }
    ports.AppendRange(std::min(nLow, nHigh), std::max(nLow, nHigh));
    return true;
}

bool AppendPort(const MergeHost& host, PortList& ports, const char* szToken) {
    const int nPort = Clamped(std::strtol(szToken, nullptr, 10));
    if (!host.IsValidPortNo(nPort)) {
        host.LogError("%s:%d invalid port no [%s]", kHopLinkFile, __LINE__, szToken);
        return false;
    }
    ports.push_back(nPort);
    return true;
}

int ReadPorts(const MergeHost& host, PortList& ports, const char* szPort) {
    if (szPort == nullptr) {
        host.LogError("%s:%d Bad parameter, NULL == szPort", kHopLinkFile, __LINE__);
        return -1;
    }
    std::string szCopy = szPort;
    char* pRest = nullptr;
    const char* szToken = strtok_r(szCopy.data(), ",", &pRest);
    if (szToken == nullptr) {
        host.LogError("%s:%d invalid port format", kHopLinkFile, __LINE__);
        return -1;
    }
    for (; szToken != nullptr; szToken = strtok_r(nullptr, ",", &pRest)) {
        const bool blRange = std::strchr(szToken, '-') != nullptr;
        if (!(blRange ? AppendRange(host, ports, szToken) : AppendPort(host, ports, szToken))) {
            return -1;
        }
    }
    return 0;
}

bool MakeLists(const MergeHost& host, OPERATION_RULE& rule) {
    rule.routerPortSet = new (std::nothrow) PortList;
    rule.boxPortSet = new (std::nothrow) PortList;
    if (rule.routerPortSet == nullptr || rule.boxPortSet == nullptr) {
        host.LogError("%s:%d new set<int> failed", kHopLinkFile, __LINE__);
        return false;
    }
    return true;
}

bool FillFromRequest(const MergeHost& host, OPERATION_RULE& rule, const __tag_TAVO_PORTMAP_RULE& request,
                     const char* szServiceName) {
    rule.blEnable = true;
    rule.protocol = static_cast<tavo::lib::PORTMAP_PROTOCOL>(request.enProtocol);
    if (!MakeLists(host, rule)) {
        return false;
    }
    if (ParsePorts(host, *rule.routerPortSet, request.szPorts) != 0) {
        host.LogError("%s:%d TLibParsePorts() for routerPort failed", kHopLinkFile, __LINE__);
        return false;
    }
    if (ParsePorts(host, *rule.boxPortSet, request.szPorts) != 0) {
        host.LogError("%s:%d TLibParsePorts() for boxPort failed", kHopLinkFile, __LINE__);
        return false;
    }
    FillText(rule.szServiceName, szServiceName);
    FillText(rule.szServiceId, std::strcmp(szServiceName, kRelayServiceName) == 0 ? kRelayServiceId : "");
    return true;
}

bool FillPorts(const MergeHost& host, PortList& ports, const char* szPorts) {
    if (ParsePorts(host, ports, szPorts) != 0) {
        host.LogError("%s:%d TLibParsePorts(%s) failed", kHopLinkFile, __LINE__, szPorts);
        return false;
    }
    return true;
}

bool FillFromRouterRule(const MergeHost& host, OPERATION_RULE& rule, const __tag_TAVO_ROUTER_RULE& stored, int i) {
    rule.blEnable = stored.blEnable;
    const int nProtocol = tavo::lib::ToProtocolEnum(host, stored.szProtocol);
    if (nProtocol < 0) {
        host.LogError("%s:%d ToProtocolEnum([%d]=%d) failed", kHopLinkFile, __LINE__, i, nProtocol);
        return false;
    }
    rule.protocol = static_cast<tavo::lib::PORTMAP_PROTOCOL>(nProtocol);
    if (!MakeLists(host, rule) || !FillPorts(host, *rule.routerPortSet, stored.szRouterPort) ||
        !FillPorts(host, *rule.boxPortSet, stored.szSrcPort)) {
        return false;
    }
    FillText(rule.szServiceId, stored.szServiceID);
    FillText(rule.szServiceName, stored.szServiceName);
    return true;
}

// Hands out nRules records, the i-th filled by fnFill(record, i); null and 0 where that failed.
template <typename Fill>
int BuildArray(const MergeHost& host, OPERATION_RULE** pRgOutRules, int* pnOutRules, int nRules, Fill fnFill) {
    *pRgOutRules = nullptr;
    *pnOutRules = 0;
    if (nRules == 0) {
        return 0;
    }
    tavo::lib::OperationRules rules;
    rules.rgRules = static_cast<OPERATION_RULE*>(std::calloc(static_cast<size_t>(nRules), sizeof(OPERATION_RULE)));
    if (rules.rgRules == nullptr) {
        host.LogError("%s:%d malloc failed", kHopLinkFile, __LINE__);
        return -1;
    }
    rules.nRules = nRules;
    for (int i = 0; i < nRules; ++i) {
        if (!fnFill(rules.rgRules[i], i)) {
            return -1;
        }
    }
    rules.MoveTo(pRgOutRules, pnOutRules);
    return 0;
}

// The refusals of the builder from rule.conf; a count of 0 is fine whatever the array.
bool IsFitForBuilding(const MergeHost& host, OPERATION_RULE* const* pRgOutRules, const __tag_TAVO_ROUTER_RULE* rgRules,
                      int nRules) {
    if (*pRgOutRules != nullptr) {
        host.LogError("%s:%d Bad parameter, *pRgOutRules is not NULL", kHopLinkFile, __LINE__);
        return false;
    }
    if (nRules < 0) {
        host.LogError("%s:%d 0 > nRules=%d", kHopLinkFile, __LINE__, nRules);
        return false;
    }
    if (nRules > 0 && rgRules == nullptr) {
        host.LogError("%s:%d Bad parameter, rgRules is NULL", kHopLinkFile, __LINE__);
        return false;
    }
    return true;
}

// A cut text can end inside a number or a range and so name ports that the rule does not have: whoever looks
// for them finds why.
bool FillOutPorts(const MergeHost& host, char (&szField)[TAVO_TEXT_SIZE], const PortList& ports, int nId) {
    const auto szText = tavo::lib::ToText(host, ports);
    if (!szText) {
        host.LogError("%s:%d ToPorts() failed", kHopLinkFile, __LINE__);
        return false;
    }
    if (szText->size() >= TAVO_TEXT_SIZE) {
        host.LogError("%s:%d ports of rule %d do not fit, cut at %d characters", kHopLinkFile, __LINE__, nId,
                      TAVO_TEXT_SIZE - 1);
    }
    FillText(szField, szText->c_str());
    return true;
}

bool FillRouterRule(const MergeHost& host, __tag_TAVO_ROUTER_RULE& rule, const OPERATION_RULE& opRule, int nId) {
    FillText(rule.szRuleID, std::to_string(nId).c_str());
    rule.blEnable = opRule.blEnable;
    FillText(rule.szProtocol, tavo::lib::ToProtocolString(host, opRule.protocol));
    if (opRule.routerPortSet == nullptr) {
        host.LogError("%s:%d rgOpRules[i].routerPortSet is NULL", kHopLinkFile, __LINE__);
        return false;
    }
    if (!FillOutPorts(host, rule.szRouterPort, *opRule.routerPortSet, nId)) {
        return false;
    }
    if (opRule.boxPortSet == nullptr) {
        host.LogError("%s:%d rgOpRules[i].boxPortSet is NULL", kHopLinkFile, __LINE__);
        return false;
    }
    if (!FillOutPorts(host, rule.szSrcPort, *opRule.boxPortSet, nId)) {
        return false;
    }
    FillText(rule.szServiceID, opRule.szServiceId);
    FillText(rule.szServiceName, opRule.szServiceName);
    rule.enTestStatus = 0;
    return true;
}

int CountKept(const OPERATION_RULE* rgOpRules, int nOpRules) {
    return nOpRules < 1 ? 0 : static_cast<int>(std::count_if(rgOpRules, rgOpRules + nOpRules, [](const auto& rule) {
        return !rule.blDeleted;
    }));
}

}  // namespace

namespace tavo::lib {

int ParsePorts(const MergeHost& host, PortList& ports, const char* szPort) {
    try {
        return ReadPorts(host, ports, szPort);
    } catch (const std::bad_alloc&) {
        host.LogError("%s:%d memory has run out in %s()", kHopLinkFile, __LINE__, __func__);
        return -1;
    }
}

int ToPorts(const MergeHost& host, char* szOutPorts, int nOutPorts, const PortList& ports) {
    if (nOutPorts < 1) {
        host.LogError("%s:%d Bad parameter, nOutPorts=%d", kHopLinkFile, __LINE__, nOutPorts);
        return -1;
    }
    if (szOutPorts == nullptr) {
        host.LogError("%s:%d Bad parameter, szOutPorts is NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    const auto szText = ToText(host, ports);
    if (!szText) {
        return -1;
    }
    std::snprintf(szOutPorts, static_cast<size_t>(nOutPorts), "%s", szText->c_str());
    return 0;
}

std::optional<std::string> ToText(const MergeHost& host, const PortList& ports) {
    std::string szText;
    bool blRun = false;
    int nPrevious = 0;
    for (const int nPort : ports) {
        if (!host.IsValidPortNo(nPort)) {
            host.LogError("%s:%d TAVOPFIsValidPortNo(%d) failed", kHopLinkFile, __LINE__, nPort);
            return std::nullopt;
        }
        if (szText.empty()) {
            szText = std::to_string(nPort);
        } else if (nPort - nPrevious == 1 || nPort - nPrevious == -1) {
            if (!blRun) {
                szText += '-';
            }
            blRun = true;
        } else {
            if (blRun) {
                szText += std::to_string(nPrevious);
            }
            szText += ", ";
            szText += std::to_string(nPort);
            blRun = false;
        }
        nPrevious = nPort;
    }
    if (blRun) {
        szText += std::to_string(nPrevious);
    }
    return szText;
}

bool FitsRecord(const MergeHost& host, const OPERATION_RULE& rule) {
    const auto fnFits = [&host](const PortList& ports) {
        const auto szText = ToText(host, ports);
        return szText && szText->size() < TAVO_TEXT_SIZE - 1;
    };
    return fnFits(*rule.routerPortSet) && fnFits(*rule.boxPortSet);
}

int ToProtocolEnum(const MergeHost& host, const char* szProtocol) {
    for (size_t i = 0; i < std::size(kProtocols); ++i) {
        if (std::strcmp(szProtocol, kProtocols[i]) == 0) {
            return static_cast<int>(i);
        }
    }
    host.LogError("%s:%d Bad parameter, szProtocol=%s", kHopLinkFile, __LINE__, szProtocol);
    return -1;
}

const char* ToProtocolString(const MergeHost& host, PORTMAP_PROTOCOL protocol) {
    const auto nProtocol = static_cast<unsigned>(protocol);
    if (nProtocol >= std::size(kProtocols)) {
        host.LogError("%s:%d non support protocol enum", kHopLinkFile, __LINE__);
        return "";
    }
    return kProtocols[nProtocol];
}

int CreateOperationRulesArray(const MergeHost& host, OPERATION_RULE** pRgOutRules, int* pnOutRules,
                              const char* szServiceName, const __tag_TAVO_PORTMAP_RULE* rgRules, int nRules) {
    if (*pRgOutRules != nullptr) {
        host.LogError("%s:%d Bad parameter, rgOutRules is not NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (szServiceName == nullptr) {
        host.LogError("%s:%d Bad parameter, szServiceName is NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (nRules < 0) {
        host.LogError("%s:%d Bad parameter, 0 > nRules=%d", kHopLinkFile, __LINE__, nRules);
        return -1;
    }
    if (nRules > 0 && rgRules == nullptr) {
        host.LogError("%s:%d Bad parameter, nRules=%d >0, but rgRules is NULL", kHopLinkFile, __LINE__, nRules);
        return -1;
    }
    return BuildArray(host, pRgOutRules, pnOutRules, nRules, [&](OPERATION_RULE& rule, int i) {
        return FillFromRequest(host, rule, rgRules[i], szServiceName);
    });
}

int CreateOperationRulesArray(const MergeHost& host, OPERATION_RULE** pRgOutRules, int* pnOutRules,
                              const __tag_TAVO_ROUTER_RULE* rgRules, int nRules) {
    if (!IsFitForBuilding(host, pRgOutRules, rgRules, nRules)) {
        *pRgOutRules = nullptr;  // every failure of this one clears the outputs
        *pnOutRules = 0;
        return -1;
    }
    return BuildArray(host, pRgOutRules, pnOutRules, nRules,
                      [&](OPERATION_RULE& rule, int i) { return FillFromRouterRule(host, rule, rgRules[i], i); });
}

void FreeOperationRulesArray(OPERATION_RULE* rgRules, int nRules) {
    if (rgRules == nullptr) {
        return;
    }
    for (int i = 0; i < nRules; ++i) {
        delete rgRules[i].routerPortSet;
        delete rgRules[i].boxPortSet;
    }
    std::free(rgRules);
}

void FreeRouterRulesArray(__tag_TAVO_ROUTER_RULE* rgRules, int /*nRules*/) {
    std::free(rgRules);
}

int WriteRouterRules(const MergeHost& host, int* pcRules, __tag_TAVO_ROUTER_RULE* rgRules, int nRules,
                     const OPERATION_RULE* rgOpRules, int nOpRules) {
    for (int i = 0; i < nOpRules; ++i) {
        if (rgOpRules[i].blDeleted) {
            continue;
        }
        if (*pcRules >= nRules) {
            host.LogError("%s:%d out of range, cRules=%d >= nRules=%d", kHopLinkFile, __LINE__, *pcRules, nRules);
            return -1;
        }
        if (!FillRouterRule(host, rgRules[*pcRules], rgOpRules[i], *pcRules + 1)) {
            return -1;
        }
        ++*pcRules;
    }
    return 0;
}

int CreateRulesArray(const MergeHost& host, __tag_TAVO_ROUTER_RULE** pRgRules, int* pnRules,
                     const OPERATION_RULE* rgRuleConfOpRules, int nRuleConfOpRules, const OPERATION_RULE* rgOpRules,
                     int nOpRules) {
    if (*pRgRules != nullptr) {
        host.LogError("%s:%d Bad parameter, rgRules is not NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (nRuleConfOpRules > 0 && rgRuleConfOpRules == nullptr) {
        host.LogError("%s:%d Bad parameter, 0 < nRuleConfOpRules=%d, but rgRuleConfOpRules is NULL", kHopLinkFile,
                      __LINE__, nRuleConfOpRules);
        return -1;
    }
    if (nOpRules > 0 && rgOpRules == nullptr) {
        host.LogError("%s:%d Bad parameter, 0 < nOpRules=%d, but rgOpRules is NULL", kHopLinkFile, __LINE__, nOpRules);
        return -1;
    }
    *pnRules = 0;
    RouterRules rules;
    rules.nRules = CountKept(rgRuleConfOpRules, nRuleConfOpRules) + CountKept(rgOpRules, nOpRules);
    if (rules.nRules == 0) {
        return 0;
    }
    rules.rgRules = static_cast<__tag_TAVO_ROUTER_RULE*>(
        std::calloc(static_cast<size_t>(rules.nRules), sizeof(__tag_TAVO_ROUTER_RULE)));
    if (rules.rgRules == nullptr) {
        host.LogError("%s:%d malloc() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    int cRules = 0;
    if (WriteRouterRules(host, &cRules, rules.rgRules, rules.nRules, rgRuleConfOpRules, nRuleConfOpRules) != 0 ||
        WriteRouterRules(host, &cRules, rules.rgRules, rules.nRules, rgOpRules, nOpRules) != 0) {
        host.LogError("%s:%d WriteRouterRules() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    rules.MoveTo(pRgRules, pnRules);
    return 0;
}

}  // namespace tavo::lib
