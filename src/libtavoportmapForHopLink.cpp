// The diagnostic entry points: what a developer's tool drives the relay service's port mapping with, one
// step at a time. Relies on the operation rules and the passes over them. Promises: results go to
// standard output, errors to the system log; everything built is freed on every path.
#include <cstring>

#include "OperationRules.h"

namespace {

using tavo::lib::AtBorder;
using tavo::lib::kHopLinkFile;
using tavo::lib::LogError;
using tavo::lib::OPERATION_RULE;
using tavo::lib::PortList;

constexpr int kMaxNumbers = 10;

void PrintPorts(const char* szTitle, const PortList& ports) {
    std::printf("%s", szTitle);
    const char* szSeparator = "";
    for (const int nPort : ports) {
        std::printf("%s%d ", szSeparator, nPort);
        szSeparator = ",";
    }
    std::printf("\n");
}

void PrintRule(const OPERATION_RULE& rule, int i) {
    std::printf("[%d]\n", i);
    std::printf("enable=%d\n", rule.blEnable);
    std::printf("protocol=%s\n", tavo::lib::ToProtocolString(rule.protocol));
    PrintPorts("router ports=", *rule.routerPortSet);
    PrintPorts("box ports=", *rule.boxPortSet);
    std::printf("service id=%s\n", rule.szServiceId);
    std::printf("service name=%s\n", rule.szServiceName);
    std::printf("test conn status=%d\n", rule.nTestConnStatus);
    std::printf("deleted=%d\n", rule.blDeleted);
}

int PrintRuleConf() {
    tavo::lib::RouterRules stored;
    if (TLibGetRulesArrFromRuleConf(&stored.nRules, &stored.rgRules, nullptr, false, nullptr) != 0) {
        LogError("%s:%d TLibGetRulesArrFromRuleConf() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    tavo::lib::OperationRules rules;
    if (CreateOperationRulesArray(&rules.rgRules, &rules.nRules, stored.rgRules, stored.nRules) != 0) {
        LogError("%s:%d CreateOperationRulesArray(ruleConf) failed", kHopLinkFile, __LINE__);
        return -1;
    }
    for (int i = 0; i < rules.nRules; ++i) {
        PrintRule(rules.rgRules[i], i);
    }
    return 0;
}

int FormatNumbers(char* szOut, int nOut, const char* szNumbers) {
    if (szNumbers == nullptr) {
        LogError("%s:%d szNumbers is NULL", kHopLinkFile, __LINE__);
        return -1;
    }
    std::string szCopy = szNumbers;
    PortList ports;
    int i = 0;
    char* pRest = nullptr;
    for (const char* szNumber = strtok_r(szCopy.data(), ",", &pRest); szNumber != nullptr;
         szNumber = strtok_r(nullptr, ",", &pRest), ++i) {
        if (i >= kMaxNumbers) {
            std::printf("out of range, i=%d MAX=%d\n", i, kMaxNumbers);
            return -1;
        }
        ports.push_back(tavo::lib::ToInt(szNumber));
    }
    if (tavo::lib::ToPorts(szOut, nOut, ports) != 0) {
        LogError("%s:%d ToPorts() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    return 0;
}

}  // namespace

int TestFuncTLibParsePorts(std::list<int>& ports, char* szPort) {
    return TLibParsePorts(ports, szPort);
}

int TestFuncToPorts(char* szOut, int nOut, const char* szNumbers) {
    return AtBorder(-1, [&] { return FormatNumbers(szOut, nOut, szNumbers); });
}

int TestFuncCreateOpRulesByRuleConf() {
    return AtBorder(-1, [] { return PrintRuleConf(); });
}
