// Stand-ins that the dynamic linker prefers over the C library's and the platform's own.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <syslog.h>

#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "tavo/portforward.h"
#include "world.h"

std::vector<std::string> gLog;
std::string gSzFailRename;
std::string gSzGateway = "192.168.1.1";
int gNSlept = 0;
std::function<void()> gFnOnSleep;
std::function<int()> gFnOnConfSet;

extern "C" {

void syslog(int /*nPriority*/, const char* szFormat, ...) {
    char szLine[8192];
    va_list args;
    va_start(args, szFormat);
    vsnprintf(szLine, sizeof(szLine), szFormat, args);
    va_end(args);
    const std::string szText = szLine;
    gLog.push_back(szText.substr(szText.find(' ') + 1));
}

int rename(const char* szFrom, const char* szTo) {
    if (gSzFailRename == szFrom) {
        gSzFailRename.clear();
        return -1;
    }
    static const auto fnReal = reinterpret_cast<int (*)(const char*, const char*)>(dlsym(RTLD_NEXT, "rename"));
    return fnReal(szFrom, szTo);
}

int TAVOGwRouterConfSet(const TAVO_PF_CONF* pHead) {
    if (gFnOnConfSet) {
        return gFnOnConfSet();
    }
    static const auto fnReal = reinterpret_cast<int (*)(const TAVO_PF_CONF*)>(dlsym(RTLD_NEXT, "TAVOGwRouterConfSet"));
    return fnReal(pHead);
}

unsigned sleep(unsigned nSeconds) {
    if (gFnOnSleep) {
        gFnOnSleep();
    }
    gNSlept += static_cast<int>(nSeconds);
    return 0;
}

int TAVONetDefaultGatewayGet(char* szGateway, int nSize) {
    if (gSzGateway.empty()) {
        return -1;
    }
    snprintf(szGateway, static_cast<size_t>(nSize), "%s", gSzGateway.c_str());
    return 0;
}
}

// The one list that the library keeps by design: GetRulesArrFromConfFile() does not release what it parsed.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:GetRulesArrFromConfFile\n";
}
