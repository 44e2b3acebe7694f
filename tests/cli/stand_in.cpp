// What only a router answers, as a test wants it: preloaded before the library. Relies on TAVO_SAVE ("result
// status limit limit2" or "result status ports", "write" at the end: the rules are stored), TAVO_DETECT ("result error
// flags level upnp natpmp max percent...", "child" at the end: the forked process returns, too), TAVO_COMPAT ("result
// status brand support max percent...", "hang" at the end), TAVO_REACH (statuses; 0 with the word that is logged),
// TAVO_LAST ("upnp brand", the last detection), TAVO_USED ("TCP:5000 UDP:53@192.168.77.2:53", the router's table: of
// another host where none is named), TAVO_WORD ("there natpmp outside kind", the gateway's own word), TAVO_CHECKS
// ("interface answer gateway answer outside level names", "-" where there is none to name), TAVO_HURRY (each wait is a
// hundredth of what it is to be, and told on standard error like each question to the router), TAVO_UID (who asks).
// Promises: calls back and logs as the library does.
#include <dlfcn.h>
#include <poll.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sstream>
#include <string>

#include "libtavoportmap.h"
#include "tavo/net.h"
#include "tavo/upnp.h"

namespace {

void Fill(char (&szField)[TAVO_TEXT_SIZE], const char* szValue) {
    std::snprintf(szField, sizeof(szField), "%s", szValue);
}

bool Wants(const char* szVariable, const char* szWord) {
    const char* szWanted = std::getenv(szVariable);
    return szWanted != nullptr && std::strstr(szWanted, szWord) != nullptr;
}

// The words of a variable, and those that stand for it where the test wants nothing.
std::istringstream Wanted(const char* szVariable, const char* szElse) {
    const char* szWanted = std::getenv(szVariable);
    return std::istringstream(szWanted == nullptr ? szElse : szWanted);
}

// What the n-th word says of the checks of the network.
std::string Check(int n) {
    std::istringstream wanted = Wanted("TAVO_CHECKS", "");
    std::string szWord;
    for (int i = 0; i <= n; ++i) {
        wanted >> szWord;
    }
    return szWord == "-" ? "" : szWord;
}

void Store(int nRules, const __tag_TAVO_ROUTER_RULE* rgRules) {
    RouterRuleConfWriter writer;
    for (int i = 0; i < nRules; ++i) {
        const __tag_TAVO_ROUTER_RULE& rule = rgRules[i];
        writer.AddRule(rule.szRuleID, rule.blEnable, rule.szRouterPort, rule.szSrcPort, rule.szProtocol,
                       rule.szServiceID, rule.szServiceName);
    }
    writer.Sync();
}

}  // namespace

int TLibSaveRules(const char*, int nRules, __tag_TAVO_ROUTER_RULE* rgRules, bool,
                  __tag_TAVO_ROUTER_SAVE_RULE_RESULT* pResult,
                  void (*pfnCallback)(const __tag_TAVO_ROUTER_SAVE_RULE_RESULT*, void*), void* pData) {
    std::istringstream wanted = Wanted("TAVO_SAVE", "-1 0");
    int nResult = -1;
    wanted >> nResult;
    if (Wants("TAVO_SAVE", "write")) {
        Store(nRules, rgRules);
    }
    if (pResult == nullptr) {
        return nResult;
    }
    wanted >> pResult->nStatus;
    for (const int nPercent : {20, 40, 60, 80}) {
        pResult->nProgress = nPercent;
        pfnCallback(pResult, pData);
    }
    if (pResult->nStatus == 8 || pResult->nStatus == 9) {
        wanted.ignore();
        wanted.getline(pResult->szPortList, sizeof(pResult->szPortList));
    } else {
        wanted >> pResult->nLimit >> pResult->nLimit2;
    }
    return nResult;
}

int TLibDetectRouter(__tag_TAVO_ROUTER_DETECT_RESULT* pResult,
                     void (*pfnCallback)(const __tag_TAVO_ROUTER_DETECT_RESULT*, void*), void* pData, bool) {
    std::istringstream wanted = Wanted("TAVO_DETECT", "-1");
    int nResult = -1;
    wanted >> nResult >> pResult->errCode >> pResult->nEnvFlags >> pResult->nPublicIPLevel >> pResult->enSupportUpnp >>
        pResult->enSupportNatpmp >> pResult->nMaxRule;
    if (pfnCallback == nullptr) {
        pfnCallback = [](const __tag_TAVO_ROUTER_DETECT_RESULT*, void*) {};
    }
    for (int nPercent = 0; wanted >> nPercent;) {
        pResult->nProgress = nPercent;
        pfnCallback(pResult, pData);
    }
    if (Wants("TAVO_DETECT", "child")) {
        const pid_t nPid = fork();
        if (nPid == 0) {
            // As the library's own child, which returns through both its ends.
            if (Wants("TAVO_DETECT", "callback")) {
                pfnCallback(pResult, pData);
            }
            return -1;
        }
        waitpid(nPid, nullptr, 0);
    }
    Fill(pResult->szGateway, "192.168.77.1");
    Fill(pResult->szInterface, "box");
    Fill(pResult->szBrand, "Acme\x1b]0;x\a");
    Fill(pResult->szModel, "R1");
    Fill(pResult->szVersion, "1");
    pfnCallback(pResult, pData);
    pResult->nProgress = nResult == 0 ? 100 : pResult->nProgress;
    return nResult;
}

// UPnP is answered where the detection has a word on it, and with "able" whatever it has.
bool UpnpDetector::IsAbleToGetBrandModelVersion() {
    std::istringstream wanted = Wanted("TAVO_DETECT", "");
    int nSupport = 0;
    for (int i = 0; i < 5; ++i) {
        wanted >> nSupport;
    }
    return nSupport != 0 || Wants("TAVO_DETECT", "able");
}

int TAVONetGatewayAsk(TAVO_NET_GATEWAY_WORD* pWord) {
    std::istringstream wanted = Wanted("TAVO_WORD", "1 -1");
    std::string szOutside;
    int nKind = 0;
    wanted >> pWord->nThere >> pWord->nNatpmp >> szOutside >> nKind;
    std::snprintf(pWord->szOutside, sizeof(pWord->szOutside), "%s", szOutside.c_str());
    pWord->enOutside = static_cast<TAVO_NET_ADDRESS_KIND>(nKind);
    return 0;
}

int TLibTestUpnpCompatibility(int, __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT* pResult,
                              void (*pfnCallback)(const __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT*, void*),
                              void* pData, bool) {
    std::istringstream wanted = Wanted("TAVO_COMPAT", "-1 0 -");
    int nResult = -1;
    int nMaxRule = 0;
    std::string szBrand, szSupport;
    wanted >> nResult >> pResult->nStatus >> szBrand >> szSupport >> nMaxRule;
    if (pfnCallback == nullptr) {
        pfnCallback = [](const __tag_TAVO_ROUTER_TEST_COMPATIBILITY_RESULT*, void*) {};
    }
    for (int nPercent = 0; wanted >> nPercent;) {
        pResult->nProgress = nPercent;
        pfnCallback(pResult, pData);
    }
    if (Wants("TAVO_COMPAT", "hang")) {
        pause();
    }
    if (szBrand != "-") {
        Fill(pResult->szBrand, szBrand.c_str());
        Fill(pResult->szModel, "R1");
        Fill(pResult->szVersion, "1");
        Fill(pResult->szSupport, szSupport.c_str());
        pResult->nMaxRule = nMaxRule;
        pResult->nProgress = 100;
        pfnCallback(pResult, pData);
    }
    return nResult;
}

int TLibTestRules(int nRules, __tag_TAVO_ROUTER_RULE* rgRules, __tag_TAVO_LIBTAVOPORTMAP_ERR*, bool) {
    std::istringstream wanted = Wanted("TAVO_REACH", "");
    for (int i = 0; i < nRules && wanted >> rgRules[i].enTestStatus; ++i) {
        std::string szWord;
        if (rgRules[i].enTestStatus == 0 && wanted >> szWord) {
            syslog(LOG_ERR, "%s:%d router_prots [%s] = %s", "src/x.cpp", 1, rgRules[i].szRouterPort, szWord.c_str());
        }
    }
    return 0;
}

int TLibGetRouterDetectResult(__tag_TAVO_ROUTER_DETECT_RESULT* pResult) {
    std::istringstream wanted = Wanted("TAVO_LAST", "");
    std::string szBrand;
    wanted >> pResult->enSupportUpnp >> szBrand;
    Fill(pResult->szBrand, szBrand.c_str());
    Fill(pResult->szModel, szBrand.empty() ? "" : "R1");
    return 0;
}

uid_t geteuid() {
    const char* szUser = std::getenv("TAVO_UID");
    return szUser == nullptr ? static_cast<uid_t>(syscall(SYS_geteuid)) : static_cast<uid_t>(std::atoi(szUser));
}

int checkGwIfEnable(char* szInterface, int nSize) {
    std::snprintf(szInterface, static_cast<size_t>(nSize), "%s", Check(0).c_str());
    return std::atoi(Check(1).c_str());
}

int checkDefaultGatewaySetting(char* szGateway, int nSize) {
    std::snprintf(szGateway, static_cast<size_t>(nSize), "%s", Check(2).c_str());
    return std::atoi(Check(3).c_str());
}

int checkConnectToWAN() {
    return std::atoi(Check(4).c_str());
}

int getPublicIPLevel(int& nLevel, int nHops) {
    std::fprintf(stderr, "%d hops\n", nHops);
    nLevel = std::atoi(Check(5).c_str());
    return nLevel < 0 ? -1 : 0;
}

int checkDNSSetting() {
    return std::atoi(Check(6).c_str());
}

int poll(pollfd* rgFds, nfds_t nFds, int nMilliseconds) {
    const auto pfnReal = reinterpret_cast<int (*)(pollfd*, nfds_t, int)>(dlsym(RTLD_NEXT, "poll"));
    if (std::getenv("TAVO_HURRY") == nullptr) {
        return pfnReal(rgFds, nFds, nMilliseconds);
    }
    std::fprintf(stderr, "%d ms\n", nMilliseconds);
    return pfnReal(rgFds, nFds, nMilliseconds / 100);
}

int TAVOUpnpInit(int nLimitSeconds, int) {
    if (std::getenv("TAVO_HURRY") != nullptr) {
        std::fprintf(stderr, "asked for %d s\n", nLimitSeconds);
    }
    return std::getenv("TAVO_USED") == nullptr ? 1 : 0;
}

int TAVOUpnpPortMappingGet(int nIndex, TAVO_UPNP_PORT_MAPPING* pMapping) {
    std::istringstream wanted = Wanted("TAVO_USED", "");
    std::string szItem;
    for (int i = 0; i <= nIndex; ++i) {
        if (!(wanted >> szItem)) {
            return 713;
        }
    }
    *pMapping = {};
    std::snprintf(pMapping->szProtocol, sizeof(pMapping->szProtocol), "%s", szItem.substr(0, 3).c_str());
    std::snprintf(pMapping->szInternalClient, sizeof(pMapping->szInternalClient), "192.168.77.99");
    std::snprintf(pMapping->szDescription, sizeof(pMapping->szDescription), "console\x1b[2J");
    pMapping->nExternalPort = std::atoi(szItem.c_str() + 4);
    if (const size_t nHost = szItem.find('@'); nHost != std::string::npos) {
        const size_t nPort = szItem.find(':', nHost);
        szItem.substr(nHost + 1, nPort - nHost - 1)
            .copy(pMapping->szInternalClient, sizeof(pMapping->szInternalClient) - 1);
        pMapping->szInternalClient[nPort - nHost - 1] = '\0';
        pMapping->nInternalPort = std::atoi(szItem.c_str() + nPort + 1);
    }
    pMapping->nEnabled = 1;
    return 0;
}

int TAVOUpnpPortMappingFind(int, const char*, TAVO_UPNP_PORT_MAPPING*) {
    return 0;
}

int TAVOUpnpGatewayModelGet(TAVO_UPNP_GATEWAY_MODEL*) {
    return -1;
}
