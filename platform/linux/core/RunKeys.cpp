// The record of the run keys. Relies on TextFile, on the rule file's and the router file's readers (which bring
// back what a killed writer left aside) and on /proc. Promises: see runkeys.h; nothing of a record is believed
// that no Remember() could have written.
#include "core/RunKeys.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <optional>
#include <string>

#include "ground/BootId.h"
#include "ground/Border.h"
#include "ground/Descriptor.h"
#include "ground/FileLock.h"
#include "ground/Paths.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "tavo/core.h"
#include "tavo/portforward.h"
#include "tavo/runkeys.h"

namespace {

using tavo::AtBorder;
using tavo::Descriptor;
using tavo::kRouterLock;
using tavo::kStateDir;
using tavo::ReadFile;

constexpr char kRecord[] = "/var/lib/tavo/run_keys.conf";
constexpr off_t kMaxRecord = 4096;
constexpr char kSystemConf[] = "/etc/tavoinfo.conf";
constexpr char kRuleConf[] = "/etc/portforward/rule.conf";
constexpr char kRouterConf[] = "/etc/portforward/router.conf";
constexpr size_t kStartField = 20;  // of /proc/PID/stat, counted from the one after the name

struct Daemon {
    const char* szName;
    const char* szKey;
    const char* szSupport;  // of router.conf
    const char* szPidFile;
};
constexpr Daemon kNatpmp{"natpmpd", "runnatpmpportmapping", "support_router_natpmp", "/var/run/natpmpd.pid"};
constexpr Daemon kUpnp{"upnpd", "runupnpportmapping", "support_router_upnp", "/var/run/upnpd.pid"};

struct Keys {
    bool blNatpmp = false;
    bool blUpnp = false;
    bool operator==(const Keys&) const = default;
};

struct Record {
    std::string szPid, szStart, szBoot;  // the process, which no other one can be taken for
    Keys keys;
    std::string szRules, szRouter;  // the two files
    std::string szSystem;           // the file of the keys as the process left it, and as it was about to
    std::string szRest = {};        // what else stands in that file, from the process's first write on

    std::string Owner() const { return szPid + " " + szStart + " " + szBoot; }
    bool Left(const std::string& szIdentity) const {
        return (" " + szSystem + " ").find(" " + szIdentity + " ") != std::string::npos;
    }
    // Whether the file was written since by somebody who was at something else in it, and left alone that the process
    // had switched the daemons off.
    bool LeftIn(const std::string& szRestNow, const Keys& keysNow) const {
        return !szRest.empty() && szRest != szRestNow && keysNow == Keys();
    }
};

// The record in whose name this process, and every child that it forks, writes the keys; empty: in nobody's.
std::string& Operation() {
    static std::string szOwner;
    return szOwner;
}

// ---- processes and files -----------------------------------------------------------------------------------

std::string Line(const std::string& szPath) {
    char szText[512];
    const Descriptor fd(open(szPath.c_str(), O_RDONLY | O_CLOEXEC));
    const ssize_t nRead = fd.Get() < 0 ? -1 : read(fd.Get(), szText, sizeof(szText));
    const std::string szLine(szText, nRead < 0 ? 0 : static_cast<size_t>(nRead));
    return szLine.substr(0, szLine.find('\n'));
}

// When the process began, in the kernel's ticks since the boot; empty when there is none, or only its remains.
std::string StartOf(const std::string& szPid) {
    std::string szStat = Line("/proc/" + szPid + "/stat");
    const size_t nName = szStat.rfind(") ");
    if (nName == std::string::npos || szStat[nName + 2] == 'Z' || szStat[nName + 2] == 'X') {
        return "";
    }
    size_t nAt = nName + 1;
    for (size_t i = 1; i < kStartField && nAt != std::string::npos; ++i) {
        nAt = szStat.find(' ', nAt + 1);
    }
    return nAt == std::string::npos ? "" : szStat.substr(nAt + 1, szStat.find(' ', nAt + 1) - nAt - 1);
}

// Another text after every write of ours, the same after a writer that put the old file back.
std::string IdentityOf(const struct stat& status) {
    return std::to_string(status.st_ino) + "/" + std::to_string(status.st_size) + "/" +
           std::to_string(status.st_mtim.tv_sec) + "." + std::to_string(status.st_mtim.tv_nsec);
}

std::string IdentityOf(const char* szPath) {
    struct stat status = {};
    return stat(szPath, &status) == 0 ? IdentityOf(status) : errno == ENOENT ? "absent" : "unknown";
}

// Another text for other lines beside those of the run keys.
std::string RestOf(std::string_view szText) {
    uint64_t nHash = 0xcbf29ce484222325U;  // FNV-1a: whoever could mean harm by it can write the keys themselves
    for (const std::string_view szLine : tavo::SplitLines(szText)) {
        const auto pair = tavo::ParseKeyLine(szLine);
        if (pair && (pair->szKey == kNatpmp.szKey || pair->szKey == kUpnp.szKey)) {
            continue;
        }
        for (const char c : std::string(szLine) + "\n") {
            nHash = (nHash ^ static_cast<unsigned char>(c)) * 0x100000001b3U;
        }
    }
    return std::to_string(nHash);
}

bool IsOn(const Daemon& daemon) {
    char szValue[8] = {};
    return TLIBCFileGetKeyValue(kSystemConf, daemon.szKey, szValue, sizeof(szValue), 0) >= 1 &&
           std::string(szValue) == "yes";
}

Record Now() {
    TAVOPFConfFree(TAVOPFRuleGet());  // a reader brings back what a killed writer left aside
    TAVOPFConfFree(TAVOPFGwRouterConfGet());
    const std::string szPid = std::to_string(getpid());
    const std::string szSystem = IdentityOf(kSystemConf);
    return {szPid,
            StartOf(szPid),
            tavo::BootId(),
            {IsOn(kNatpmp), IsOn(kUpnp)},
            IdentityOf(kRuleConf),
            IdentityOf(kRouterConf),
            szSystem};
}

// ---- the record --------------------------------------------------------------------------------------------

std::string ToText(const Record& record) {
    tavo::Section section{"keys",
                          {{"pid", record.szPid},
                           {"start", record.szStart},
                           {"boot", record.szBoot},
                           {"natpmp", record.keys.blNatpmp ? "yes" : "no"},
                           {"upnp", record.keys.blUpnp ? "yes" : "no"},
                           {"rules", record.szRules},
                           {"router", record.szRouter},
                           {"system", record.szSystem}}};
    if (!record.szRest.empty()) {
        section.rgPairs.push_back({"rest", record.szRest});
    }
    return tavo::FormatSections({section});
}

// The text of a record file that is root's alone; nothing for any other.
std::optional<std::string> OwnText() {
    const Descriptor fd(open(kRecord, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat status = {};
    if (fd.Get() < 0 || fstat(fd.Get(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_uid != geteuid() ||
        status.st_nlink != 1 || (status.st_mode & (S_IWGRP | S_IWOTH)) != 0 || status.st_size > kMaxRecord) {
        return std::nullopt;
    }
    std::string szText(static_cast<size_t>(status.st_size), '\0');
    return read(fd.Get(), szText.data(), szText.size()) == status.st_size ? std::optional(szText) : std::nullopt;
}

bool IsNumber(const std::string& szText) {
    return !szText.empty() && szText.size() < 20 && szText.find_first_not_of("0123456789") == std::string::npos;
}

std::optional<Record> ReadRecord() {
    const auto szText = OwnText();
    const auto rgSections = szText ? tavo::ParseSections(*szText) : std::nullopt;
    if (!rgSections || rgSections->size() != 1) {
        return std::nullopt;
    }
    const auto fnGet = [&](const char* szKey) {
        const auto& rgPairs = rgSections->front().rgPairs;
        const auto it =
            std::find_if(rgPairs.begin(), rgPairs.end(), [&](const tavo::Pair& pair) { return pair.szKey == szKey; });
        return it == rgPairs.end() ? std::string() : it->szValue;
    };
    const Record record{
        fnGet("pid"),   fnGet("start"),  fnGet("boot"),   {fnGet("natpmp") == "yes", fnGet("upnp") == "yes"},
        fnGet("rules"), fnGet("router"), fnGet("system"), fnGet("rest")};
    // What it does not say word for word as it is written, it does not say.
    const bool blWhole = IsNumber(record.szPid) && IsNumber(record.szStart) && ToText(record) == *szText;
    return blWhole ? std::optional(record) : std::nullopt;
}

bool IsOurs(const Record& record) {
    const std::string szPid = std::to_string(getpid());
    return record.szPid == szPid && record.szStart == StartOf(szPid) && record.szBoot == tavo::BootId();
}

bool IsAlive(const Record& record) {
    return record.szBoot == tavo::BootId() && record.szStart == StartOf(record.szPid);
}

// ---- putting back ------------------------------------------------------------------------------------------

// The keys as saving would have set them, by the settings of the router.
Keys KeysBySettings() {
    TAVO_PF_CONF* pConf = TAVOPFGwRouterConfGet();
    const auto fnSays = [pConf](const Daemon& daemon) {
        const char* szWord =
            pConf == nullptr || pConf->pHash == nullptr ? nullptr : TLIBCSzHashGetValue(pConf->pHash, daemon.szSupport);
        return szWord != nullptr && std::string(szWord) == "yes";
    };
    const bool blNatpmp = fnSays(kNatpmp);
    const Keys keys{blNatpmp, !blNatpmp && fnSays(kUpnp)};
    TAVOPFConfFree(pConf);
    return keys;
}

// What the keys should be, by what has become of the files since the record was made.
Keys Wanted(const Record& record, const Record& now) {
    const std::string szRest = RestOf(ReadFile(kSystemConf).value_or(""));
    if (record.szRouter != now.szRouter || (!record.Left(now.szSystem) && !record.LeftIn(szRest, now.keys))) {
        // Another router, or another way to drive it, of which the next save switches on what it needs; or somebody
        // else has written the keys, and knows what he wants.
        return now.keys;
    }
    if (record.szRules == now.szRules) {
        return record.keys;
    }
    return now.keys == Keys() ? KeysBySettings() : now.keys;
}

// The daemon that runs with its pid in its file, and not one that only tests.
void Tell(const Daemon& daemon) {
    const pid_t pid = TLIBCReadPidFile(daemon.szPidFile);
    if (pid > 0 && Line("/proc/" + std::to_string(pid) + "/comm") == daemon.szName) {
        kill(pid, SIGHUP);
    }
}

bool SetKey(const Daemon& daemon, bool blNow, bool blWanted) {
    if (blNow == blWanted) {
        return true;
    }
    if (TLIBCFileSetKeyValue(kSystemConf, daemon.szKey, blWanted ? "yes" : "no", nullptr) != 1) {
        return false;
    }
    tavo::SysLog(LOG_NOTICE, "%s=\"%s\" again: what switched it came to nothing", daemon.szKey,
                 blWanted ? "yes" : "no");
    if (blWanted) {
        Tell(daemon);
    }
    return true;
}

int Forget() {
    return unlink(kRecord) == 0 || errno == ENOENT ? 0 : -1;
}

int PutBack(const Record& record) {
    const Record now = Now();
    const Keys keys = Wanted(record, now);
    Operation() = record.Owner();  // whoever is killed between two keys leaves the second one to the next
    const bool blSet = SetKey(kNatpmp, now.keys.blNatpmp, keys.blNatpmp) && SetKey(kUpnp, now.keys.blUpnp, keys.blUpnp);
    Operation().clear();
    return blSet ? Forget() : -1;
}

// What is missing, nobody has locked since the boot; and what somebody else has put into /tmp in its place, he could
// lock for ever.
bool IsRouterLockOurs() {
    struct stat status = {};
    return lstat(kRouterLock, &status) == 0 && S_ISREG(status.st_mode) && status.st_uid == geteuid();
}

// 0: nothing is left of a dead process; 1: the one that noted is alive; -1.
int MendLocked() {
    const auto record = ReadRecord();
    return !record ? 0 : IsAlive(*record) ? 1 : PutBack(*record);
}

}  // namespace

bool tavo::NoteWrite(std::string_view szPath, int fdNew) {
    auto record = szPath == kSystemConf && !Operation().empty() ? ReadRecord() : std::nullopt;
    if (!record || record->Owner() != Operation()) {
        return true;
    }
    struct stat status = {};
    const std::string szNow = IdentityOf(kSystemConf);
    const std::string szBefore = record->Left(szNow) ? szNow + " " : "";
    record->szSystem = fstat(fdNew, &status) == 0 ? szBefore + IdentityOf(status) : szBefore;
    record->szRest = RestOf(ReadFile("/proc/self/fd/" + std::to_string(fdNew)).value_or(""));
    return WriteFileAtomic(kRecord, ToText(*record));
}

int TAVORunKeysRemember() {
    return AtBorder(-1, [] {
        const auto before = ReadRecord();
        if (const int nMended = before && IsOurs(*before) ? 0 : MendLocked(); nMended != 0) {
            return nMended;
        }
        if (!tavo::MakeDirectory(kStateDir)) {
            return -1;
        }
        if (!OwnText()) {
            unlink(kRecord);  // a link, or somebody else's: it is not followed, and not written into
        }
        const Record record = Now();
        Operation() = record.Owner();
        return tavo::WriteFileAtomic(kRecord, ToText(record)) ? 0 : -1;
    });
}

int TAVORunKeysRestore() {
    return AtBorder(-1, [] {
        const auto record = ReadRecord();
        return record && IsOurs(*record) ? PutBack(*record) : 0;
    });
}

int TAVORunKeysForget() {
    return AtBorder(-1, [] {
        Operation().clear();
        const auto record = ReadRecord();
        return record && IsOurs(*record) ? Forget() : 0;
    });
}

int TAVORunKeysMend() {
    return AtBorder(-1, [] {
        // Not even for a moment is the lock taken from who holds it between two calls of his.
        const auto record = ReadRecord();
        if (!record || IsAlive(*record)) {
            return record ? 1 : 0;
        }
        const tavo::FileLock lock(kRouterLock, O_RDWR | O_NOFOLLOW);
        if (IsRouterLockOurs() && !lock.Try()) {
            return 1;
        }
        return MendLocked();
    });
}
