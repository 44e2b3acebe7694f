// The diagnostic entry points: what a developer's tool drives the relay service's port mapping with, one
// step at a time. Relies on the operation rules and the passes over them. Promises: results go to
// standard output, errors to the system log; everything built is freed on every path.
#include <cstdio>
#include <cstring>
#include <iterator>

#include "Border.h"
#include "HopLink.h"
#include "Log.h"
#include "RouterConflicts.h"
#include "Text.h"

namespace {

using tavo::lib::AtBorder;
using tavo::lib::Host;
using tavo::lib::kHopLinkFile;
using tavo::lib::LogError;
using tavo::lib::OPERATION_RULE;
using tavo::lib::PortList;

constexpr int kMaxNumbers = 10;
constexpr int kRequestRoom = 10;  // the one that fills it is refused
constexpr const char* kTestStatuses[] = {"not test", "disabled", "ok", "fail"};

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
    std::printf("protocol=%s\n", tavo::lib::ToProtocolString(Host(), rule.protocol));
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
    if (CreateOperationRulesArray(Host(), &rules.rgRules, &rules.nRules, stored.rgRules, stored.nRules) != 0) {
        LogError("%s:%d CreateOperationRulesArray(ruleConf) failed", kHopLinkFile, __LINE__);
        return -1;
    }
    for (int i = 0; i < rules.nRules; ++i) {
        PrintRule(rules.rgRules[i], i);
    }
    return 0;
}

// "service;ports;protocol;ports;protocol..." taken apart; empty fields vanish.
struct ServiceRequests {
    std::string szServiceName;
    __tag_TAVO_PORTMAP_RULE rgRules[kRequestRoom] = {};
    int nRules = 0;
};

bool ReadProtocol(int& enProtocol, const char* szProtocol) {
    std::printf(" szProtocol:%s\n", szProtocol == nullptr ? "NULL" : szProtocol);
    if (szProtocol == nullptr) {
        return false;
    }
    for (const auto protocol :
         {tavo::lib::PORTMAP_PROTOCOL_TCP, tavo::lib::PORTMAP_PROTOCOL_UDP, tavo::lib::PORTMAP_PROTOCOL_ALL}) {
        if (std::strcmp(szProtocol, tavo::lib::ToProtocolString(Host(), protocol)) == 0) {
            enProtocol = protocol;
            return true;
        }
    }
    std::printf("err: unknown protocol=%s", szProtocol);
    return false;
}

// Everything read is printed as it is read, so that a developer sees where a text goes wrong.
bool ReadRequests(ServiceRequests& requests, const char* szRequest) {
    if (szRequest == nullptr) {
        return false;
    }
    std::string szCopy = szRequest;
    char* pRest = nullptr;
    const char* szField = strtok_r(szCopy.data(), ";", &pRest);
    if (szField == nullptr) {
        std::printf("Wrong format: %s", szRequest);
        return false;
    }
    std::printf("service name=%s\n", szField);
    requests.szServiceName = szField;
    while ((szField = strtok_r(nullptr, ";", &pRest)) != nullptr) {
        __tag_TAVO_PORTMAP_RULE& rule = requests.rgRules[requests.nRules];
        std::printf("ports:%s", szField);
        tavo::lib::FillText(rule.szPorts, szField);
        if (!ReadProtocol(rule.enProtocol, strtok_r(nullptr, ";", &pRest))) {
            return false;
        }
        if (++requests.nRules == kRequestRoom) {
            std::puts("out of buf size");
            return false;
        }
    }
    return true;
}

// Prints the ports of one side, or says which side cannot be written.
bool DumpPorts(const char* szSide, const PortList& ports) {
    char szPorts[TAVO_TEXT_SIZE] = {};
    if (tavo::lib::ToPorts(Host(), szPorts, TAVO_TEXT_SIZE, ports) != 0) {
        std::printf("ToPorts(%s) failed\n", szSide);
        return false;
    }
    std::printf("%s_ports=%s\n", szSide, szPorts);
    return true;
}

void DumpOperationRules(const char* szTitle, const OPERATION_RULE* rgOpRules, int nOpRules) {
    std::printf("---- Begin to dump: %s ----\n", szTitle);
    for (int i = 0; i < nOpRules; ++i) {
        const OPERATION_RULE& rule = rgOpRules[i];
        std::printf("[%d]: %s\n", i, rule.blDeleted ? "(D)" : "");
        std::printf("blEnable=%d\n", rule.blEnable);
        if (!DumpPorts("router", *rule.routerPortSet) || !DumpPorts("box", *rule.boxPortSet)) {
            return;
        }
        std::printf("protocol=%s\n\n", tavo::lib::ToProtocolString(Host(), rule.protocol));
    }
}

bool CreateOperationRules(tavo::lib::OperationRules& rules, const ServiceRequests& requests) {
    if (CreateOperationRulesArray(Host(), &rules.rgRules, &rules.nRules, requests.szServiceName.c_str(),
                                  requests.rgRules, requests.nRules) != 0) {
        std::puts("CreateOperationRulesArray(rgRules) failed");
        return false;
    }
    return true;
}

void PrintStatuses(const ServiceRequests& requests) {
    for (int i = 0; i < requests.nRules; ++i) {
        const __tag_TAVO_PORTMAP_RULE& rule = requests.rgRules[i];
        const auto nStatus = static_cast<unsigned>(rule.nTestConnStatus);
        std::printf("router_ports [%s]=%s\n", rule.szPorts,
                    nStatus < std::size(kTestStatuses) ? kTestStatuses[nStatus] : "unknown");
    }
}

int TestRequests(const char* szRequest) {
    ServiceRequests requests;
    tavo::lib::OperationRules opRules;
    if (!ReadRequests(requests, szRequest) || !CreateOperationRules(opRules, requests)) {
        return -1;
    }
    tavo::lib::RouterRules rules;
    if (CreateRulesArray(Host(), &rules.rgRules, &rules.nRules, nullptr, 0, opRules.rgRules, opRules.nRules) != 0) {
        LogError("%s:%d CreateRulesArray() failed", kHopLinkFile, __LINE__);
        return -1;
    }
    if (tavo::lib::TestRequestedRules(rules, requests.rgRules) != 0) {
        return -1;
    }
    PrintStatuses(requests);
    return 0;
}

// A lock that is held and a router that is not known are answers too: they print what stands in the requests.
int SetRequests(const char* szRequest) {
    ServiceRequests requests;
    if (!ReadRequests(requests, szRequest)) {
        return -1;
    }
    if (TLibTavoPortMapRulesSet(requests.szServiceName.c_str(), requests.rgRules, requests.nRules, true) < 0) {
        std::puts("TLibTavoPortMapRulesSet() failed");
        return -1;
    }
    PrintStatuses(requests);
    return 0;
}

int DeleteConflicts(const char* szRequest) {
    ServiceRequests requests;
    tavo::lib::OperationRules rules;
    if (!ReadRequests(requests, szRequest) || !CreateOperationRules(rules, requests)) {
        return -1;
    }
    const char* szServiceName = requests.szServiceName.c_str();
    DumpOperationRules("before delete", rules.rgRules, rules.nRules);
    if (DeleteConflictPortsForUPnPRouter(rules.rgRules, rules.nRules, nullptr, 0, szServiceName) != 0) {
        std::puts("DeleteConflictPortsForUPnPRouter() failed");
        return -1;
    }
    DumpOperationRules("after delete", rules.rgRules, rules.nRules);
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
    if (tavo::lib::ToPorts(Host(), szOut, nOut, ports) != 0) {
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

int TestFuncGetUsedRouterPortList(std::list<int>& tcpPorts, std::list<int>& udpPorts) {
    return AtBorder(-1, [&] { return tavo::lib::GetUsedRouterPortList(tcpPorts, udpPorts); });
}

int TestFuncTestRules(const char* szRequest) {
    return AtBorder(-1, [&] { return TestRequests(szRequest); });
}

int TestFuncDeleteConflictPortsForUPnPRouter(const char* szRequest) {
    return AtBorder(-1, [&] { return DeleteConflicts(szRequest); });
}

int TestFuncSetRules(const char* szRequest) {
    return AtBorder(-1, [&] { return SetRequests(szRequest); });
}
