// The stand-ins behind the stage; off stage they pass on to the platform and the C library.
#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "network.h"
#include "stage.h"
#include "tavo/core.h"
#include "tavo/log.h"
#include "tavo/natpmp.h"
#include "tavo/portforward.h"
#include "world.h"

Stage gStage;

void StagedTest::SetUp() {
    gStage = {};
    gPNetwork = nullptr;
    gPHome = nullptr;
    gPClient = nullptr;
    gFnOnSleep = nullptr;
    gFnOnConfSet = nullptr;
    gSzGateway = "192.168.1.1";
    gNClockAhead = 0;
    gNSlept = 0;
    gLog.clear();
}

void Tell(const std::string& szLine) {
    const OwnMemory own;
    gLog.push_back("> " + szLine);
}

namespace {

template <typename... Words>
int Told(const Words&... words) {
    const OwnMemory own;
    std::ostringstream line;
    ((line << words), ...);
    Tell(line.str());
    return 0;
}

bool Fails(const char* szCall) {
    return gStage.blOn && gStage.szFail == szCall && gStage.nWorks-- <= 0;
}

// Whether another process could take the router lock now.
bool IsLockFree() {
    const int fd = open("/tmp/routerconf.lock", O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    const bool blFree = flock(fd, LOCK_EX | LOCK_NB) == 0;
    close(fd);
    return blFree;
}

}  // namespace

extern "C" {
TLIBCSzHash* TLIBCSzHashAlloc(int nSize) {
    return Fails("hash") ? nullptr : Real("TLIBCSzHashAlloc", &TLIBCSzHashAlloc)(nSize);
}
int TLIBCSzHashSetValue(TLIBCSzHash* pHash, const char* szKey, const char* szValue) {
    return Fails(szKey) ? -1 : Real("TLIBCSzHashSetValue", &TLIBCSzHashSetValue)(pHash, szKey, szValue);
}
int TLIBCFileSetKeyValue(const char* szPath, const char* szKey, const char* szValue, const char* szFormat) {
    if (gStage.blOn) {
        Told(szKey, "=", szValue);
    }
    return Fails("run key") ? -1
                            : Real("TLIBCFileSetKeyValue", &TLIBCFileSetKeyValue)(szPath, szKey, szValue, szFormat);
}
int TLIBCFileGetSectionValue(const char* szPath, const char* szSection, const char* szKey, char* szValue, int nSize) {
    return Fails("look-up")
               ? -1
               : Real("TLIBCFileGetSectionValue", &TLIBCFileGetSectionValue)(szPath, szSection, szKey, szValue, nSize);
}
int TLIBCFileGetKeys(const char* szPath, const char* szPrefix, TLIBCSzHash** ppHash, const char* szSeparator) {
    return Fails("status") ? -1 : Real("TLIBCFileGetKeys", &TLIBCFileGetKeys)(szPath, szPrefix, ppHash, szSeparator);
}
int TLIBPFCountRuleConf(const TAVO_PF_CONF* pHead, int nEnabledOnly) {
    return Fails("count") ? -1 : Real("TLIBPFCountRuleConf", &TLIBPFCountRuleConf)(pHead, nEnabledOnly);
}
int TAVOPFCountJobNumber(const TAVO_PF_CONF* pHead, const char* szGwRouterIP, const char* szJob) {
    return Fails(szJob) ? -1 : Real("TAVOPFCountJobNumber", &TAVOPFCountJobNumber)(pHead, szGwRouterIP, szJob);
}
int TAVOPFRuleBuildByPath(const TAVO_PF_CONF* pHead, const char* szPath) {
    if (gStage.blOn) {
        Told("write ", szPath);
    }
    return Fails("write") ? -1 : Real("TAVOPFRuleBuildByPath", &TAVOPFRuleBuildByPath)(pHead, szPath);
}
int NetpmpRemapGet(char** ppszRemap, int* pnSize) {
    if (gStage.blOn) {
        Tell("remap");
    }
    return Fails("remap") ? -1 : Real("NetpmpRemapGet", &NetpmpRemapGet)(ppszRemap, pnSize);
}
const char* GetRouterDBPath() {
    return gStage.blOn ? gStage.szLocation.c_str() : Real("GetRouterDBPath", &GetRouterDBPath)();
}
int TLIBCIsProcAlive(const char* szName) {
    if (!gStage.blOn) {
        return Real("TLIBCIsProcAlive", &TLIBCIsProcAlive)(szName);
    }
    const OwnMemory own;
    return gStage.alive.contains(szName) ? 1 : 0;
}
int TLIBCKill(const char* szName, int nSignal) {
    return gStage.blOn ? Told("signal ", szName, " ", nSignal) + 1 : Real("TLIBCKill", &TLIBCKill)(szName, nSignal);
}
int kill(pid_t pid, int nSignal) noexcept {
    if (!gStage.blOn || pid < 0) {
        return Real("kill", &kill)(pid, nSignal);
    }
    Told("kill ", pid, " ", nSignal);
    errno = ESRCH;
    return Fails("kill") ? -1 : 0;
}
int TLIBCExec(const char* szPath, const char* szArg1, const char* szArg2, const char* szArg3, const char* szArg4) {
    if (!gStage.blOn) {
        return Real("TLIBCExec", &TLIBCExec)(szPath, szArg1, szArg2, szArg3, szArg4);
    }
    const OwnMemory own;
    Told("exec ", szPath);
    if (Fails("exec")) {
        return -1;
    }
    if (!gStage.blStillborn) {
        gStage.alive.insert(std::filesystem::path(szPath).filename());
    }
    return 0;
}
int TLIBCSystem(const char* szCommand) {
    if (!gStage.blOn) {
        return Real("TLIBCSystem", &TLIBCSystem)(szCommand);
    }
    const OwnMemory own;
    Told("run ", szCommand);
    if (Fails("run")) {
        return -1;
    }
    if (gStage.fnRun) {
        gStage.fnRun(szCommand);
    }
    return 0;
}
int TAVOLogSet1(int nKind, int nLevel, unsigned nEvent, const char* szText1, const char* szText2, const char* szText3,
                const char* szText4) {
    return gStage.blOn ? Told("event ", nKind, " ", nLevel, " ", std::hex, nEvent, " ", szText1, "|", szText2, "|",
                              szText3, "|", szText4)
                       : Real("TAVOLogSet1", &TAVOLogSet1)(nKind, nLevel, nEvent, szText1, szText2, szText3, szText4);
}
int TLIBServiceIsRunning(const char* szName) {
    if (!gStage.blOn) {
        return Real("TLIBServiceIsRunning", &TLIBServiceIsRunning)(szName);
    }
    Told("ask ", szName, IsLockFree() ? "" : ", still locked");
    return gStage.blRelay ? 1 : 0;
}
int TLIBServiceReload(const char* szName) {
    return gStage.blOn ? Told("reload ", szName) : Real("TLIBServiceReload", &TLIBServiceReload)(szName);
}
}
