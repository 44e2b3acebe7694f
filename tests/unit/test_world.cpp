// Stand-ins that the dynamic linker prefers over the C library's and the platform's own.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <new>

#include "tavo/portforward.h"
#include "world.h"

std::vector<std::string> gLog;
std::string gSzFailRename;
int gNGoodChanges = -1;
std::string gSzGateway = "192.168.1.1";
int gNSlept = 0;
std::function<void()> gFnOnSleep;
std::function<int()> gFnOnConfSet;
int gNClockStep = 0;
time_t gNClockJumped = 0;
long gNGoodAllocations = -1;
bool gBlOneFailure = false;
bool gBlAllocationFailed = false;
int OwnMemory::nDepth = 0;

namespace {

bool AllocationFails() {
    if (gNGoodAllocations < 0 || OwnMemory::nDepth > 0 || gNGoodAllocations-- > 0) {
        return false;
    }
    gNGoodAllocations = gBlOneFailure ? -1 : 0;
    gBlAllocationFailed = true;
    errno = ENOMEM;
    return true;
}

}  // namespace

void ChangeName() {
    if (gNGoodChanges >= 0 && gNGoodChanges-- == 0) {
        _exit(kKilled);
    }
}

#ifdef __SANITIZE_ADDRESS__
void* operator new(size_t nSize) {
    void* pBlock = AllocationFails() ? nullptr : std::malloc(nSize);
    return pBlock == nullptr ? throw std::bad_alloc() : pBlock;
}
void* operator new(size_t nSize, const std::nothrow_t& /*tag*/) noexcept {
    return AllocationFails() ? nullptr : std::malloc(nSize);
}
void operator delete(void* pBlock) noexcept {
    std::free(pBlock);
}
void operator delete(void* pBlock, size_t /*nSize*/) noexcept {
    std::free(pBlock);
}
#else
extern "C" {
void* __libc_malloc(size_t nSize);
void* __libc_calloc(size_t nItems, size_t nSize);

void* malloc(size_t nSize) {
    return AllocationFails() ? nullptr : __libc_malloc(nSize);
}
void* calloc(size_t nItems, size_t nSize) {
    return AllocationFails() ? nullptr : __libc_calloc(nItems, nSize);
}
}
#endif

extern "C" {

void syslog(int /*nPriority*/, const char* szFormat, ...) {
    const OwnMemory own;
    char szLine[8192];
    va_list args;
    va_start(args, szFormat);
    vsnprintf(szLine, sizeof(szLine), szFormat, args);
    va_end(args);
    const std::string szText = szLine;
    gLog.push_back(szText.substr(szText.find(' ') + 1));
}

int TAVOGwRouterConfSet(const TAVO_PF_CONF* pHead) {
    if (gFnOnConfSet) {
        return gFnOnConfSet();
    }
    return Real("TAVOGwRouterConfSet", &TAVOGwRouterConfSet)(pHead);
}

unsigned sleep(unsigned nSeconds) {
    if (gFnOnSleep) {
        gFnOnSleep();
    }
    gNSlept += static_cast<int>(nSeconds);
    return 0;
}

int clock_gettime(clockid_t nClock, timespec* pTime) {
    static const auto fnReal = Real("clock_gettime", &clock_gettime);
    const int nResult = fnReal(nClock, pTime);
    pTime->tv_sec += gNClockJumped += gNClockStep;
    pTime->tv_sec += nClock == CLOCK_REALTIME ? gNClockAhead : 0;
    return nResult;
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
