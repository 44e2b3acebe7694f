// The operation rules: built from requests and from rule.conf, written back as public records. Relies on
// the platform's test of a port number. Promises: a builder that fails frees what it made.
#include "OperationRules.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

namespace {

using tavo::lib::kHopLinkFile;
using tavo::lib::LogError;
using tavo::lib::OPERATION_RULE;
using tavo::lib::PortList;

constexpr const char* kProtocols[] = {"tcp", "udp", "all"};
constexpr char kRelayServiceName[] = "hoplink";
constexpr char kRelayServiceId[] = "HopLink";

bool MakeLists(OPERATION_RULE& rule) {
    rule.routerPortSet = new (std::nothrow) PortList;
    rule.boxPortSet = new (std::nothrow) PortList;
    if (rule.routerPortSet == nullptr || rule.boxPortSet == nullptr) {
        LogError("%s:%d new set<int> failed", kHopLinkFile, __LINE__);
        return false;
    }
    return true;
}

bool FillFromRequest(OPERATION_RULE& rule, const __tag_TAVO_PORTMAP_RULE& request, const char* szServiceName) {
    rule.blEnable = true;
    rule.protocol = static_cast<tavo::lib::PORTMAP_PROTOCOL>(request.enProtocol);
    if (!MakeLists(rule)) {
        return false;
    }
    if (TLibParsePorts(*rule.routerPortSet, request.szPorts) != 0) {
        LogError("%s:%d TLibParsePorts() for routerPort failed", kHopLinkFile, __LINE__);
        return false;
    }
    if (TLibParsePorts(*rule.boxPortSet, request.szPorts) != 0) {
        LogError("%s:%d TLibParsePorts() for boxPort failed", kHopLinkFile, __LINE__);
        return false;
    }
    tavo::lib::FillText(rule.szServiceName, szServiceName);
    tavo::lib::FillText(rule.szServiceId, std::strcmp(szServiceName, kRelayServiceName) == 0 ? kRelayServiceId : "");
    return true;
}

bool FillPorts(PortList& ports, const char* szPorts) {
    if (TLibParsePorts(ports, szPorts) != 0) {
        LogError("%s:%d TLibParsePorts(%s) failed", kHopLinkFile, __LINE__, szPorts);
        return false;
    }
    return true;
}

bool FillFromRouterRule(OPERATION_RULE& rule, const __tag_TAVO_ROUTER_RULE& stored, int i) {
    rule.blEnable = stored.blEnable;
    const int nProtocol = tavo::lib::ToProtocolEnum(stored.szProtocol);
    if (nProtocol < 0) {
        LogError("%s:%d ToProtocolEnum([%d]=%d) failed", kHopLinkFile, __LINE__, i, nProtocol);
        return false;
    }
    rule.protocol = static_cast<tavo::lib::PORTMAP_PROTOCOL>(nProtocol);
    if (!MakeLists(rule) || !FillPorts(*rule.routerPortSet, stored.szRouterPort) ||
        !FillPorts(*rule.boxPortSet, stored.szSrcPort)) {
        return false;
    }
    tavo::lib::FillText(rule.szServiceId, stored.szServiceID);
    tavo::lib::FillText(rule.szServiceName, stored.szServiceName);
    return true;
}

// Hands out nRules records, the i-th filled by fnFill(record, i); null and 0 where that failed.
template <typename Fill>
int BuildArray(OPERATION_RULE** pRgOutRules, int* pnOutRules, int nRules, Fill fnFill) {
    *pRgOutRules = nullptr;
    *pnOutRules = 0;
    if (nRules == 0) {
        return 0;
    }
    tavo::lib::OperationRules rules;
    rules.rgRules = static_cast<OPERATION_RULE*>(std::calloc(static_cast<size_t>(nRules), sizeof(OPERATION_RULE)));
    if (rules.rgRules == nullptr) {
        LogError("%s:%d malloc failed", kHopLinkFile, __LINE__);
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
bool IsFitForBuilding(OPERATION_RULE* const* pRgOutRules, const __tag_TAVO_ROUTER_RULE* rgRules, int nRules) {
    if (*pRgOutRules != nullptr) {
        LogError("%s:%d Bad parameter, *pRgOutRules is not NULL", kHopLinkFile, __LINE__);
        return false;
    }
    if (nRules < 0) {
        LogError("%s:%d 0 > nRules=%d", kHopLinkFile, __LINE__, nRules);
        return false;
    }
    if (nRules > 0 && rgRules == nullptr) {
        LogError("%s:%d Bad parameter, rgRules is NULL", kHopLinkFile, __LINE__);
        return false;
    }
    return true;
}

// A cut text can end inside a number or a range and so name ports that the rule does not have: whoever looks
// for them finds why. Room for one character more tells it from a text that just fits.
bool FillOutPorts(char (&szField)[TAVO_TEXT_SIZE], const PortList& ports, int nId) {
    char szText[TAVO_TEXT_SIZE + 1] = {};
    if (tavo::lib::ToPorts(szText, sizeof(szText), ports) != 0) {
        LogError("%s:%d ToPorts() failed", kHopLinkFile, __LINE__);
        return false;
    }
    if (szText[TAVO_TEXT_SIZE - 1] != '\0') {
        LogError("%s:%d ports of rule %d do not fit, cut at %d characters", kHopLinkFile, __LINE__, nId,
                 TAVO_TEXT_SIZE - 1);
    }
    tavo::lib::FillText(szField, szText);
    return true;
}

bool FillRouterRule(__tag_TAVO_ROUTER_RULE& rule, const OPERATION_RULE& opRule, int nId) {
    tavo::lib::FillText(rule.szRuleID, std::to_string(nId));
    rule.blEnable = opRule.blEnable;
    tavo::lib::FillText(rule.szProtocol, tavo::lib::ToProtocolString(opRule.protocol));
    if (opRule.routerPortSet == nullptr) {
        LogError("%s:%d rgOpRules[i].routerPortSet is NULL", kHopLinkFile, __LINE__);
        return false;
    }
    if (!FillOutPorts(rule.szRouterPort, *opRule.routerPortSet, nId)) {
        return false;
    }
    if (opRule.boxPortSet == nullptr) {
        LogError("%s:%d rgOpRules[i].boxPortSet is NULL", kHopLinkFile, __LINE__);
        return false;
    }
    if (!FillOutPorts(rule.szSrcPort, *opRule.boxPortSet, nId)) {
        return false;
    }
    tavo::lib::FillText(rule.szServiceID, opRule.szServiceId);
    tavo::lib::FillText(rule.szServiceName, opRule.szServiceName);
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

int ToPorts(char* szOutPorts, int nOutPorts, const PortList& ports) {
    if (nOutPorts < 1) {
        LogError("%s:%d Bad parameter, nOutPorts=%d", kHopLinkFile, __LINE__, nOutPorts);
        return -1;
    }
    if (szOutPorts == nullptr) {
        LogError("%s:%d Bad parameter, szOutPorts is NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    std::string szText;
    bool blRun = false;
    int nPrevious = 0;
    for (const int nPort : ports) {
        if (TAVOPFIsValidPortNo(nPort) == 0) {
            LogError("%s:%d TAVOPFIsValidPortNo(%d) failed", kHopLinkFile, __LINE__, nPort);
            return -1;
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
    std::snprintf(szOutPorts, static_cast<size_t>(nOutPorts), "%s", szText.c_str());
    return 0;
}

int ToProtocolEnum(const char* szProtocol) {
    for (size_t i = 0; i < std::size(kProtocols); ++i) {
        if (std::strcmp(szProtocol, kProtocols[i]) == 0) {
            return static_cast<int>(i);
        }
    }
    LogError("%s:%d Bad parameter, szProtocol=%s", kHopLinkFile, __LINE__, szProtocol);
    return -1;
}

const char* ToProtocolString(PORTMAP_PROTOCOL protocol) {
    const auto nProtocol = static_cast<unsigned>(protocol);
    if (nProtocol >= std::size(kProtocols)) {
        LogError("%s:%d non support protocol enum", kHopLinkFile, __LINE__);
        return "";
    }
    return kProtocols[nProtocol];
}

int CreateOperationRulesArray(OPERATION_RULE** pRgOutRules, int* pnOutRules, const char* szServiceName,
                              const __tag_TAVO_PORTMAP_RULE* rgRules, int nRules) {
    if (*pRgOutRules != nullptr) {
        LogError("%s:%d Bad parameter, rgOutRules is not NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (szServiceName == nullptr) {
        LogError("%s:%d Bad parameter, szServiceName is NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (nRules < 0) {
        LogError("%s:%d Bad parameter, 0 > nRules=%d", kHopLinkFile, __LINE__, nRules);
        return -1;
    }
    if (nRules > 0 && rgRules == nullptr) {
        LogError("%s:%d Bad parameter, nRules=%d >0, but rgRules is NULL", kHopLinkFile, __LINE__, nRules);
        return -1;
    }
    return BuildArray(pRgOutRules, pnOutRules, nRules,
                      [&](OPERATION_RULE& rule, int i) { return FillFromRequest(rule, rgRules[i], szServiceName); });
}

int CreateOperationRulesArray(OPERATION_RULE** pRgOutRules, int* pnOutRules, const __tag_TAVO_ROUTER_RULE* rgRules,
                              int nRules) {
    if (!IsFitForBuilding(pRgOutRules, rgRules, nRules)) {
        *pRgOutRules = nullptr;  // every failure of this one clears the outputs
        *pnOutRules = 0;
        return -1;
    }
    return BuildArray(pRgOutRules, pnOutRules, nRules,
                      [&](OPERATION_RULE& rule, int i) { return FillFromRouterRule(rule, rgRules[i], i); });
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

int WriteRouterRules(int* pcRules, __tag_TAVO_ROUTER_RULE* rgRules, int nRules, const OPERATION_RULE* rgOpRules,
                     int nOpRules) {
    for (int i = 0; i < nOpRules; ++i) {
        if (rgOpRules[i].blDeleted) {
            continue;
        }
        if (*pcRules >= nRules) {
            LogError("%s:%d out of range, cRules=%d >= nRules=%d", kHopLinkFile, __LINE__, *pcRules, nRules);
            return -1;
        }
        if (!FillRouterRule(rgRules[*pcRules], rgOpRules[i], *pcRules + 1)) {
            return -1;
        }
        ++*pcRules;
    }
    return 0;
}

int CreateRulesArray(__tag_TAVO_ROUTER_RULE** pRgRules, int* pnRules, const OPERATION_RULE* rgRuleConfOpRules,
                     int nRuleConfOpRules, const OPERATION_RULE* rgOpRules, int nOpRules) {
    if (*pRgRules != nullptr) {
        LogError("%s:%d Bad parameter, rgRules is not NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    if (nRuleConfOpRules > 0 && rgRuleConfOpRules == nullptr) {
        LogError("%s:%d Bad parameter, 0 < nRuleConfOpRules=%d, but rgRuleConfOpRules is NULL", kHopLinkFile, __LINE__,
                 nRuleConfOpRules);
        return -1;
    }
    if (nOpRules > 0 && rgOpRules == nullptr) {
        LogError("%s:%d Bad parameter, 0 < nOpRules=%d, but rgOpRules is NULL", kHopLinkFile, __LINE__, nOpRules);
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
        LogError("%s:%d malloc() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    int cRules = 0;
    if (WriteRouterRules(&cRules, rules.rgRules, rules.nRules, rgRuleConfOpRules, nRuleConfOpRules) != 0 ||
        WriteRouterRules(&cRules, rules.rgRules, rules.nRules, rgOpRules, nOpRules) != 0) {
        LogError("%s:%d WriteRouterRules() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    rules.MoveTo(pRgRules, pnRules);
    return 0;
}

}  // namespace tavo::lib
