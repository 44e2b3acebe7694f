// Rule and router files as lists of nodes, and the counts that the capacity checks use.
// Relies on TextFile and on the description of the router for the count of jobs.
// Promises: a list is whole or absent; a file is replaced whole or left alone.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>

#include "ground/Border.h"
#include "ground/ConfList.h"
#include "ground/Descriptor.h"
#include "ground/Fail.h"
#include "ground/PortText.h"
#include "ground/SysLog.h"
#include "portforward/Aside.h"

namespace {

constexpr char kRuleConf[] = "/etc/portforward/rule.conf";
constexpr char kTestRuleConf[] = "/etc/portforward/testrule.conf";
constexpr char kRouterConf[] = "/etc/portforward/router.conf";
constexpr int kMaxPort = 65535;
constexpr size_t kMostName = 60;  // of a rule, in a log line
constexpr int kLoadTries = 8;
constexpr useconds_t kOwnerMicroseconds = 20000;  // who holds a copy is about to write

using tavo::AtBorder;
using tavo::ConfList;
using tavo::Fail;
using tavo::SetError;
using tavo::Value;

// A file of blank lines and comments holds nothing, but whoever goes by its size takes it for a broken one: it
// is emptied. In place, so that a writer's newer file is never meant; one that cannot be changed stays.
void EmptyOut(const char* szPath) {
    const tavo::Descriptor fd(open(szPath, O_RDWR | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
    struct stat status = {};
    if (fd.Get() < 0 || fstat(fd.Get(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_size == 0) {
        return;
    }
    const auto szText = tavo::ReadFile("/proc/self/fd/" + std::to_string(fd.Get()));
    const auto rgSections = szText ? tavo::ParseSections(*szText) : std::nullopt;
    if (rgSections && rgSections->empty() && ftruncate(fd.Get(), 0) != 0) {
        tavo::SysLog(LOG_WARNING, "%s holds no section and cannot be emptied", szPath);
    }
}

TAVO_PF_CONF* Load(const char* szPath) {
    return AtBorder(static_cast<TAVO_PF_CONF*>(nullptr), [&] {
        tavo::DropLeftovers(tavo::DirectoryOf(szPath));
        tavo::BringBack(szPath);
        ConfList pList = tavo::LoadConfList(szPath);
        // A writer may be moving the file aside again and again, and a single look may find neither file nor
        // copy: "no rules" is said only when several find nothing.
        for (int i = 1; TLIBCErrGet() == TLIBC_ERR_NOT_FOUND && i < kLoadTries; ++i) {
            if (!tavo::BringBack(szPath)) {
                usleep(kOwnerMicroseconds);
            }
            pList = tavo::LoadConfList(szPath);
        }
        if (TLIBCErrGet() == TLIBC_ERR_NONE) {
            // Settings that say nothing make way for those of before, which must be there then; "no rules" is a wish.
            if (pList || std::string_view(szPath) != kRouterConf) {
                tavo::DropObsolete(szPath);
            }
            if (!pList) {
                EmptyOut(szPath);
                SetError(TLIBC_ERR_NONE);
            }
        }
        return pList.release();
    });
}

bool IsListed(std::string_view szName, std::string_view szIdList) {
    constexpr std::string_view kSeparators = ", \t";
    for (size_t nStart = 0; nStart < szIdList.size();) {
        const size_t nEnd = std::min(szIdList.find_first_of(kSeparators, nStart), szIdList.size());
        if (nEnd > nStart && szIdList.substr(nStart, nEnd - nStart) == szName) {
            return true;
        }
        nStart = nEnd + 1;
    }
    return false;
}

// Whether records hold what a rule says of its ports. A cut list may end within a number.
bool FitsRecords(const char* szPath, const TAVO_PF_CONF* pRule) {
    for (const char* szKey : {"r_port", "s_port"}) {
        if (Value(pRule, szKey).size() >= TAVO_PF_PORTS_SIZE) {
            tavo::SysLog(LOG_ERR,
                         "%s: the list of ports of rule %s is longer than %d bytes and would be cut: nothing "
                         "is read, write it as two rules",
                         szPath, tavo::PrintableText(pRule->szSection, kMostName).c_str(), TAVO_PF_PORTS_SIZE - 1);
            return Fail(TLIBC_ERR_FORMAT, false);
        }
    }
    return true;
}

TAVO_PF_CONF* LoadListed(const char* szPath, const char* szIdList) {
    ConfList pList(Load(szPath));
    if (szIdList == nullptr || std::strspn(szIdList, ", \t") == std::strlen(szIdList)) {
        return pList.release();
    }
    TAVO_PF_CONF* pHead = pList.release();
    for (TAVO_PF_CONF** ppNode = &pHead; *ppNode != nullptr;) {
        if (IsListed((*ppNode)->szSection, szIdList)) {
            ppNode = &(*ppNode)->pNext;
            continue;
        }
        ConfList pDropped(*ppNode);
        *ppNode = pDropped->pNext;
        pDropped->pNext = nullptr;
    }
    return pHead;
}

// All of them, or none where one does not fit.
TAVO_PF_CONF* LoadForRecords(const char* szPath, const char* szIdList) {
    return AtBorder(static_cast<TAVO_PF_CONF*>(nullptr), [&]() -> TAVO_PF_CONF* {
        ConfList pList(LoadListed(szPath, szIdList));
        for (const TAVO_PF_CONF* pRule = pList.get(); pRule != nullptr; pRule = pRule->pNext) {
            if (!FitsRecords(szPath, pRule)) {
                return nullptr;
            }
        }
        return pList.release();
    });
}

std::vector<tavo::Section> Sections(const TAVO_PF_CONF* pHead) {
    std::vector<tavo::Section> rgSections;
    for (const TAVO_PF_CONF* pConf = pHead; pConf != nullptr; pConf = pConf->pNext) {
        rgSections.push_back({pConf->szSection, {}});
        const char* szKey = nullptr;
        const char* szValue = nullptr;
        for (int i = 0; pConf->pHash != nullptr && TLIBCSzHashGetAt(pConf->pHash, i, &szKey, &szValue) == 1; ++i) {
            rgSections.back().rgPairs.push_back({szKey, szValue == nullptr ? "" : szValue});
        }
    }
    return rgSections;
}

// Whether every page of the router in front takes both protocols in one job. A router that nobody
// described is taken to do so.
bool TakesBothAtOnce(const char* szGwRouterIP) {
    const ConfList pRouters(Load(kRouterConf));
    for (const TAVO_PF_CONF* pRouter = pRouters.get(); pRouter != nullptr; pRouter = pRouter->pNext) {
        TAVO_PF_CONF* pDescRaw = nullptr;
        TAVO_ROUTER_SCRIPT* pOps = nullptr;
        if (std::strcmp(pRouter->szSection, szGwRouterIP) != 0 ||
            TAVOPFRouterDBLoadDescAndOpsByIp(pRouter, &pDescRaw, &pOps) < 0) {
            continue;
        }
        const ConfList pDesc(pDescRaw);
        TAVORouterScriptFree(pOps);
        for (const TAVO_PF_CONF* pPage = pDesc.get(); pPage != nullptr; pPage = pPage->pNext) {
            const bool blPage = std::strcmp(pPage->szSection, "PF port page") == 0 ||
                                std::strcmp(pPage->szSection, "PF range page") == 0;
            if (blPage && pPage->pHash != nullptr && TLIBCSzHashGetValue(pPage->pHash, "tcp_udp") == nullptr) {
                return false;
            }
        }
    }
    return true;
}

// Jobs of one kind that one rule needs; negative when its texts cannot be read.
int CountJobs(const TAVO_PF_CONF* pConf, bool blRange, bool blBothAtOnce) {
    const auto rgRanges = tavo::ParsePortRanges(Value(pConf, "r_port"));
    const auto protocols = tavo::ParseProtocol(Value(pConf, "protocol name"));
    if (!rgRanges || !protocols) {
        return Fail(TLIBC_ERR_FORMAT);
    }
    int nItems = 0;
    for (const tavo::PortRange& range : *rgRanges) {
        nItems += (range.nFirst != range.nLast) == blRange ? 1 : 0;
    }
    return protocols->blTcp && protocols->blUdp && !blBothAtOnce ? 2 * nItems : nItems;
}

}  // namespace

void TAVOPFConfFree(TAVO_PF_CONF* pHead) {
    while (pHead != nullptr) {
        TAVO_PF_CONF* pNext = pHead->pNext;
        TLIBCSzHashFree(pHead->pHash);
        std::free(pHead);
        pHead = pNext;
    }
}

TAVO_PF_CONF* TAVOPFRuleGet() {
    return Load(kRuleConf);
}

TAVO_PF_CONF* TAVOPFTestRuleGet() {
    return Load(kTestRuleConf);
}

TAVO_PF_CONF* TAVOPFRuleGetByIdList(const char* szIdList) {
    return LoadForRecords(kRuleConf, szIdList);
}

TAVO_PF_CONF* TAVOPFTestRuleGetByIdList(const char* szIdList) {
    return LoadForRecords(kTestRuleConf, szIdList);
}

int TAVOPFRuleBuildByPath(const TAVO_PF_CONF* pHead, const char* szPath) {
    return AtBorder(-1, [&] {
        if (szPath == nullptr || *szPath == '\0') {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const auto rgSections = Sections(pHead);
        if (rgSections.size() > TAVO_PF_MAX_SECTIONS) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        return tavo::WriteFileAtomic(szPath, tavo::FormatSections(rgSections)) ? 0 : -1;
    });
}

TAVO_PF_CONF* TAVOPFGwRouterConfGet() {
    return Load(kRouterConf);
}

int TAVOGwRouterConfSet(const TAVO_PF_CONF* pHead) {
    return TAVOPFRuleBuildByPath(pHead, kRouterConf);
}

int TLIBPFCountRuleConf(const TAVO_PF_CONF* pHead, int nEnabledOnly) {
    return AtBorder(-1, [&] {
        int nRules = 0;
        for (const TAVO_PF_CONF* pConf = pHead; pConf != nullptr; pConf = pConf->pNext) {
            if (nRules == INT_MAX) {
                return -1;
            }
            nRules += nEnabledOnly == 0 || Value(pConf, "enabled") == "1" ? 1 : 0;
        }
        return nRules;
    });
}

int TAVOPFCountJobNumber(const TAVO_PF_CONF* pHead, const char* szGwRouterIP, const char* szJob) {
    return AtBorder(-1, [&] {
        const bool blRange = szJob != nullptr && std::strcmp(szJob, "PF add range") == 0;
        if (szGwRouterIP == nullptr || szJob == nullptr || (!blRange && std::strcmp(szJob, "PF add port") != 0)) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const bool blBothAtOnce = TakesBothAtOnce(szGwRouterIP);
        int nJobs = 0;
        for (const TAVO_PF_CONF* pConf = pHead; pConf != nullptr; pConf = pConf->pNext) {
            if (Value(pConf, "enabled") != "1") {
                continue;
            }
            const int nOfRule = CountJobs(pConf, blRange, blBothAtOnce);
            if (nOfRule < 0) {
                return -1;
            }
            nJobs += nOfRule;
        }
        return nJobs;
    });
}

int TAVOPFIsValidPortNo(int nPort) {
    return nPort >= 1 && nPort <= kMaxPort ? 1 : 0;
}
