// The helpers that the library's files share, the two lock primitives, the gateway address, the names
// of router models and the accessors of a parsed rule section. Relies on the platform's files, network
// and port-forward library. Promises: outputs are untouched on failure unless stated, nothing is thrown.
#include "common.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <utility>

#include "Tool.h"
#include "tavo/net.h"
#include "tavo/task.h"

namespace {

constexpr char kFile[] = "src/common.cpp";

using tavo::lib::LogError;

constexpr char kKeyLineFormat[] = "%s=\"%s\"\n";
constexpr int kLockFileMode = 0600;
constexpr size_t kAddressSize = 16;
constexpr size_t kBrandSize = 512;
constexpr size_t kModelSize = 512;
constexpr size_t kVersionSize = 1024;
constexpr size_t kPathSize = 4096;
constexpr size_t kToolLineSize = 1024;
constexpr size_t kSuffixSize = 6;
constexpr int kNameTries = 100;
constexpr int kHoldTries = 100;
constexpr char kVersionCommand[] = "/usr/tavo/bin/tavoportforward --version";
constexpr std::string_view kVersionKey = "syntax version";

// The two refusals that every accessor of a rule section begins with.
bool HasHash(const TAVO_PF_CONF* pConf) {
    if (pConf == nullptr) {
        LogError("%s:%d pConf shall not be NULL", kFile, __LINE__);
        return false;
    }
    if (pConf->pHash == nullptr) {
        LogError("%s:%d section shall not be empty", kFile, __LINE__);
        return false;
    }
    return true;
}

// Finds the version in what the tool prints; the last line that gives one wins.
class VersionLines {
public:
    void Take(std::string_view szBlock) {
        for (const char c : szBlock) {
            if (c == '\n') {
                EndLine();
            } else if (mNLength < sizeof(mSzLine) - 1) {
                mSzLine[mNLength++] = c;
            }
        }
    }
    void EndLine() {
        mSzLine[std::exchange(mNLength, 0)] = '\0';
        const bool blKey = std::string_view(mSzLine).starts_with(kVersionKey);
        const char* szNumber = blKey ? std::strchr(mSzLine + kVersionKey.size(), '=') : nullptr;
        if (szNumber != nullptr) {
            mNVersion = tavo::lib::ToInt(szNumber + 1);
        }
    }
    int Version() const { return mNVersion; }

private:
    char mSzLine[kToolLineSize] = {};
    size_t mNLength = 0;
    int mNVersion = -1;
};

void RenameLogged(const char* szFrom, const char* szTo, int nLine) {
    if (rename(szFrom, szTo) != 0) {
        LogError("%s:%d rename(%s, %s) failed ", kFile, nLine, szFrom, szTo);
    }
}

// The end of a name as no person gives it to a copy: small letters, capitals and digits, no two neighbours of one kind,
// and the last one follows from the others. By that, and by a digit at the beginning, the platform knows what a killed
// process left.
std::string Unmistakable(std::string_view szRandom, bool blDigitFirst) {
    constexpr std::string_view kKinds[] = {"0123456789", "abcdefghijklmnopqrstuvwxyz", "ABCDEFGHIJKLMNOPQRSTUVWXYZ"};
    constexpr size_t kThree = std::size(kKinds);
    std::string szEnd;
    size_t nKind = 0;
    size_t nBefore = 0;
    size_t nSum = 5;
    for (size_t i = 0; i < szRandom.size(); ++i) {
        const auto nRandom = static_cast<unsigned char>(szRandom[i]);
        size_t nNext = (nKind + 1 + nRandom % 2) % kThree;
        if (i == 0) {
            nNext = blDigitFirst ? 0 : 1 + nRandom % 2;
        } else if (i == 2) {
            nNext = kThree - nKind - nBefore;  // the one that is missing yet
        }
        nBefore = nKind;
        nKind = nNext;
        const size_t nPlace = (i + 1 < szRandom.size() ? nRandom / 2 : nSum) % kKinds[nKind].size();
        szEnd += kKinds[nKind][nPlace];
        nSum += nPlace;
    }
    return szEnd;
}

struct RecordFields {
    std::string szServiceID;
    std::string szServiceName;
    std::string szRouterPort;
    std::string szSrcPort;
    std::string szProtocol;
    std::string szRuleID;
    bool blEnable = false;
};

// Reads one rule into the texts, which keep what the rule does not have.
bool ReadFields(RecordFields& fields, const TAVO_PF_CONF* pConf) {
    if (PF_CONF::IsRuleEnable(fields.blEnable, pConf) == 0) {
        LogError("%s:%d IsRuleEnable() failed", kFile, __LINE__);
        return false;
    }
    if (PF_CONF::GetRuleServiceID(fields.szServiceID, pConf) == 0) {
        LogError("%s:%d GetRuleServiceID() failed", kFile, __LINE__);
        return false;
    }
    PF_CONF::GetRuleServiceName(fields.szServiceName, pConf);
    if (PF_CONF::GetRulePort(fields.szRouterPort, fields.szSrcPort, pConf) == 0) {
        LogError("%s:%d GetRulePort() failed", kFile, __LINE__);
        return false;
    }
    if (PF_CONF::GetRuleProtocol(fields.szProtocol, pConf) == 0) {
        LogError("%s:%d GetRuleProtocol() failed", kFile, __LINE__);
        return false;
    }
    if (PF_CONF::GetRuleID(fields.szRuleID, pConf) == 0) {
        LogError("%s:%d GetRuleID() failed", kFile, __LINE__);
        return false;
    }
    return true;
}

void FillRecord(__tag_TAVO_ROUTER_RULE& rule, const RecordFields& fields) {
    using tavo::lib::FillText;
    FillText(rule.szRuleID, fields.szRuleID);
    rule.blEnable = fields.blEnable;
    FillText(rule.szProtocol, fields.szProtocol);
    FillText(rule.szRouterPort, fields.szRouterPort);
    FillText(rule.szSrcPort, fields.szSrcPort);
    FillText(rule.szServiceID, fields.szServiceID);
    FillText(rule.szServiceName, fields.szServiceName);
}

// Runs the daemon's program; it writes its own pid file.
bool ExecDaemon(const tavo::lib::DaemonControl& control) {
    unlink(control.szPidFile);
    char szCommand[tavo::lib::kCommandSize] = {};
    const int nLength = std::snprintf(szCommand, sizeof(szCommand), "%s%s", tavo::lib::kSbinDir, control.szName);
    if (nLength < 0 || TLIBCExec(szCommand, nullptr, nullptr, nullptr, nullptr) == -1) {
        LogError("%s:%d exec %s daemon failed", control.szFile, __LINE__, control.szName);
        return false;
    }
    return true;
}

bool HupDaemon(const tavo::lib::DaemonControl& control, pid_t pid) {
    if (kill(pid, SIGHUP) != -1) {
        return true;
    }
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat"  // "%m" is the C library's own
    LogError("%s:%d send SIGHUP to %s failed errno=%m", control.szFile, __LINE__, control.szName);
#pragma GCC diagnostic pop
    LogError("%s:%d HupDaemon() %s failed", control.szFile, __LINE__, control.szName);
    return false;
}

// A daemon whose pid is not known: signalled by name, and started anew.
bool RestartDaemon(const tavo::lib::DaemonControl& control) {
    TLIBCKill(control.szName, SIGHUP);
    if (ExecDaemon(control)) {
        return true;
    }
    LogError("%s:%d StartDaemon() failed", control.szFile, __LINE__);
    LogError("%s:%d RestartDaemon() %s failed", control.szFile, __LINE__, control.szName);
    return false;
}

bool StartFresh(const tavo::lib::DaemonControl& control) {
    if (ExecDaemon(control)) {
        return true;
    }
    LogError("%s:%d StartDaemon() %s failed", control.szFile, __LINE__, control.szName);
    return false;
}

// The version that a model's generic description was written for. False: it has none.
bool ReadGenericVersion(const std::string& szBrand, const std::string& szModel, std::string& szVersion) {
    if (!tavo::lib::IsPathPart(szBrand) || !tavo::lib::IsPathPart(szModel)) {
        return false;
    }
    char szPath[kPathSize] = {};
    char szValue[kVersionSize] = {};
    std::snprintf(szPath, sizeof(szPath), "%s/%s/%s/%s", tavo::lib::kRouterDbDir, szBrand.c_str(), szModel.c_str(),
                  "generic");
    if (TLIBCFileGetKeyValue(szPath, "version", szValue, sizeof(szValue), 0) < 1) {
        return false;
    }
    szVersion = szValue;
    return true;
}

int ReadText(std::string& szValue, const char* szKey, const TAVO_PF_CONF* pConf) {
    const char* szStored = TLIBCSzHashGetValue(pConf->pHash, szKey);
    if (szStored == nullptr) {
        return 0;
    }
    szValue = szStored;
    return 1;
}

}  // namespace

namespace tavo::lib {

void LogError(const char* szFormat, ...) {
    va_list arguments;
    va_start(arguments, szFormat);
    LogErrorV(szFormat, arguments);
    va_end(arguments);
}

void LogErrorV(const char* szFormat, va_list arguments) {
    const int nErrno = errno;
    char* szLine = nullptr;
    const int nLength = vasprintf(&szLine, szFormat, arguments);
    if (nLength >= 0) {
        syslog(LOG_ERR, "%s", szLine);
        std::free(szLine);
    }
    errno = nErrno;
}

void FileLock::LeaveToParent() {
    if (mFd >= 0) {
        close(mFd);
    }
    mFd = -1;
}

OwnerAndMode::OwnerAndMode(const char* szPath) : mBlKnown(stat(szPath, &mStatus) == 0) {}

void OwnerAndMode::HideFromOthers() {
    if ((mStatus.st_mode & S_IRWXO) != 0) {
        mStatus.st_mode &= ~static_cast<mode_t>(S_IRWXG | S_IRWXO);
    }
}

void OwnerAndMode::GiveTo(const char* szPath) const {
    struct stat own = {};
    if (!mBlKnown || stat(szPath, &own) != 0) {
        return;
    }
    const bool blSameOwner = own.st_uid == mStatus.st_uid && own.st_gid == mStatus.st_gid;
    if (blSameOwner || chown(szPath, mStatus.st_uid, mStatus.st_gid) == 0) {
        chmod(szPath, mStatus.st_mode & 07777U);
    }
}

void FlushDirectoryOf(const char* szPath) {
    const std::string szDir(szPath, std::string_view(szPath).rfind('/') + 1);
    const int fd = open(szDir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd >= 0) {
        fsync(fd);
        close(fd);
    }
}

// What stands there by now may be another file than the one that was opened. A file system may have no locks: readers
// take every copy for held there.
HeldFile::HeldFile(const char* szPath) {
    for (int i = 0; i < kHoldTries && !mBlHeld; ++i) {
        Release();
        struct stat own = {};
        struct stat there = {};
        if (TLIBCFileExist(szPath) != 1 || stat(szPath, &there) != 0) {
            mBlHeld = true;
            return;
        }
        mFd = open(szPath, O_RDONLY | O_CLOEXEC | O_NONBLOCK);
        struct flock whole = {};
        whole.l_type = F_RDLCK;
        const bool blLocked =
            mFd >= 0 && (fcntl(mFd, F_OFD_SETLK, &whole) == 0 || fcntl(mFd, F_OFD_GETLK, &whole) != 0);
        mBlHeld = blLocked && fstat(mFd, &own) == 0 && stat(szPath, &there) == 0 && own.st_ino == there.st_ino &&
                  own.st_dev == there.st_dev;
    }
}

void HeldFile::Release() {
    if (mFd >= 0) {
        close(mFd);
    }
    mFd = -1;
}

bool IsGatewayAddress(const char* szGwRouterIP) {
    if (szGwRouterIP == nullptr) {
        LogError("%s:%d szGwRouterIP is NULL", kEntryFile, __LINE__);
        return false;
    }
    if (BlTLIBIsIpAddr(szGwRouterIP) == 0) {
        LogError("%s:%d szGwRouterIP=%s is not IP format", kEntryFile, __LINE__, szGwRouterIP);
        return false;
    }
    return true;
}

bool GetRouterLock(RouterLock& lock, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr) {
    if (lock.Get()) {
        return true;
    }
    LogError("%s:%d PortForward conflict = %s", kEntryFile, __LINE__, kRouterLock);
    if (pErr != nullptr) {
        *pErr = TAVO_LIBTAVOPORTMAP_ERR_CONFLICT;
    }
    return false;
}

bool AddRule(RouterRuleConfWriter& rules, const __tag_TAVO_ROUTER_RULE& rule) {
    if (rules.AddRule(std::string(rule.szRuleID), rule.blEnable, rule.szRouterPort, rule.szSrcPort, rule.szProtocol,
                      rule.szServiceID, rule.szServiceName) == 0) {
        LogError("%s:%d add rule failed", kEntryFile, __LINE__);
        return false;
    }
    return true;
}

bool SetRunKey(const char* szKey, const char* szValue) {
    return TLIBCFileSetKeyValue(kSystemConf, szKey, szValue, kKeyLineFormat) >= 0;
}

TaskUpdate::TaskUpdate(NOS::Task& task) : mTask(task) {
    mTask.remove();
    mTask.beginUpdate();
}

TaskUpdate::~TaskUpdate() {
    if (!mBlEnded) {
        mTask.remove();
        End();
    }
}

void TaskUpdate::Set(const char* szName, const char* szValue) {
    if (mTask.setProperty(szName, szValue) == 0) {
        throw std::bad_alloc();
    }
}

bool TaskUpdate::End() {
    mBlEnded = true;
    if (mTask.endUpdate() == 0) {
        LogError("%s:%d the result of the detection could not be stored[0x%04X %s:%d]", kFile, __LINE__,
                 static_cast<unsigned>(TLIBCErrGet()), TLIBCErrorGetFile(), TLIBCErrorGetLine());
        return false;
    }
    return true;
}

std::string TaskText(const char* szId, const char* szName) {
    return AtBorder(std::string(), [&] {
        NOS::Task task(kTaskOwner, szId);
        task.reload();
        return task.getStringProperty(szName, "");
    });
}

bool IsPathPart(std::string_view szPart) {
    return !szPart.empty() && szPart != "." && szPart != ".." && szPart.find('/') == std::string_view::npos;
}

std::string InQuotes(std::string_view szText) {
    std::string szOut;
    for (const char c : szText) {
        szOut += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return szOut;
}

int ToInt(const char* szText) {
    return static_cast<int>(std::clamp(std::strtol(szText, nullptr, 10), long{INT_MIN}, long{INT_MAX}));
}

ConfList NewSection(const std::string& szName, const char* szNoNode, const char* szNoHash, const char* szFile,
                    int nLine) {
    ConfList pNode(static_cast<TAVO_PF_CONF*>(std::calloc(1, sizeof(TAVO_PF_CONF))));
    if (!pNode) {
        LogError(szNoNode, szFile, nLine);
        return nullptr;
    }
    pNode->pHash = TLIBCSzHashAlloc(kHashSize);
    if (pNode->pHash == nullptr) {
        LogError(szNoHash, szFile, nLine);
        return nullptr;
    }
    std::snprintf(pNode->szSection, sizeof(pNode->szSection), "%s", szName.c_str());
    return pNode;
}

std::string UniqueName(const char* szPath, AsideFor enFor) {
    std::string szName;
    struct stat status = {};
    for (int i = 0; i < kNameTries && (szName.empty() || lstat(szName.c_str(), &status) == 0); ++i) {
        std::string szRandom = std::string(szPath) + "XXXXXX";
        // The name is only ever renamed to, never opened, and its directory is root's own.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
        mktemp(szRandom.data());
#pragma GCC diagnostic pop
        szRandom.erase(0, szRandom.size() - kSuffixSize);
        szName = szPath + Unmistakable(szRandom, enFor == AsideFor::kReport);
    }
    return lstat(szName.c_str(), &status) == 0 ? "" : szName;  // none is free: the renaming fails
}

bool ReplaceFile(const char* szPath, Holds enHolds, const std::function<bool()>& fnWrite) {
    const std::string szAside = UniqueName(szPath, AsideFor::kWriting);
    if (TLIBCFileExist(szPath) == 1 && rename(szPath, szAside.c_str()) != 0) {
        LogError("%s:%d rename(%s, %s) failed ", kFile, __LINE__, szPath, szAside.c_str());
        if (TLIBCFileExist(szAside.c_str()) == 1) {
            RenameLogged(szAside.c_str(), szPath, __LINE__);
        }
        return false;
    }
    const bool blWritten = AtBorder(false, fnWrite);  // whatever happens in it, the old file comes back
    if (!blWritten) {
        LogError("%s:%d save config failed", kFile, __LINE__);
    }
    if (TLIBCFileExist(szAside.c_str()) == 1) {
        if (blWritten) {
            OwnerAndMode old(szAside.c_str());
            if (enHolds == Holds::kSecret) {
                old.HideFromOthers();
            }
            old.GiveTo(szPath);
            unlink(szAside.c_str());
        } else {
            RenameLogged(szAside.c_str(), szPath, __LINE__);
        }
    }
    return blWritten;
}

bool StartDaemonOf(const DaemonControl& control) {
    const bool blAlive = TLIBCIsProcAlive(control.szName) == 1;
    unlink(kProgressMarker);
    if (TLIBCIsProcAlive(control.szOther) > 0) {
        TLIBCKill(control.szOther, SIGHUP);
    }
    bool blStarted = false;
    if (!blAlive) {
        blStarted = StartFresh(control);
    } else if (const pid_t pid = TLIBCReadPidFile(control.szPidFile); pid >= 1) {
        blStarted = HupDaemon(control, pid);
    } else {
        blStarted = RestartDaemon(control);
    }
    if (blStarted) {
        TLIBCFileTouch(kProgressMarker);
    }
    return blStarted;
}

}  // namespace tavo::lib

using tavo::lib::AtBorder;

int lock_file(const char* szPath, int& fd) {
    fd = open(szPath, O_RDWR | O_CREAT | O_NONBLOCK, kLockFileMode);
    if (fd < 0) {
        return 0;
    }
    // A program that the caller starts with it open would hold the lock for as long as it lives.
    fcntl(fd, F_SETFD, FD_CLOEXEC);
    return flock(fd, LOCK_EX | LOCK_NB) == 0 ? 1 : 0;
}

void unlock_file(int fd) {
    if (fd < 0) {
        return;
    }
    flock(fd, LOCK_UN);
    close(fd);
}

int GetGatewayIP(std::string& ip) {
    return AtBorder(0, [&] {
        char szGateway[kAddressSize] = {};
        if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) != 0) {
            LogError("%s:%d cannot get gateway router ip", kFile, __LINE__);
            return 0;
        }
        if (BlTLIBIsIpAddr(szGateway) == 0 || std::strcmp(szGateway, "0.0.0.0") == 0) {
            LogError("%s:%d error gateway router ip: %s", kFile, __LINE__, szGateway);
            return 0;
        }
        ip = szGateway;
        return 1;
    });
}

bool SplitRouterName(char* szName, std::string& brand, std::string& model, std::string& version) {
    return AtBorder(false, [&] {
        const std::string szWhole = szName == nullptr ? "" : szName;
        const size_t nSeparator = szWhole.find(": ");
        if (nSeparator == std::string::npos) {
            LogError("%s:%d incorrect information", kFile, __LINE__);
            return false;
        }
        std::string szBrand = szWhole.substr(0, std::min(nSeparator, kBrandSize - 1));
        const size_t nModel = nSeparator + 2;
        const size_t nOpen = szWhole.find('(', nSeparator);
        const size_t nModelLength = nOpen == std::string::npos ? nOpen : nOpen - nModel;
        std::string szModel = szWhole.substr(nModel, std::min(nModelLength, kModelSize - 1));
        std::string szVersion;
        if (nOpen != std::string::npos) {
            const std::string szRest = szWhole.substr(nOpen + 1);
            szVersion = szRest.substr(0, std::min(szRest.rfind(')'), kVersionSize - 1));
        } else if (!ReadGenericVersion(szBrand, szModel, szVersion)) {
            LogError("%s:%d incorrect information", kFile, __LINE__);
            return false;
        }
        brand.swap(szBrand);
        model.swap(szModel);
        version.swap(szVersion);
        return true;
    });
}

bool IsGenericRouterName(bool& isGeneric, char* szName) {
    return AtBorder(false, [&] {
        const char* szSeparator = szName == nullptr ? nullptr : std::strstr(szName, ": ");
        if (szSeparator == nullptr) {
            LogError("%s:%d incorrect information", kFile, __LINE__);
            return false;
        }
        isGeneric = std::strchr(szSeparator, '(') == nullptr;
        return true;
    });
}

int IGetCurrSyntaxVersion() {
    tavo::lib::Tool tool;
    if (!tool.Start(kVersionCommand)) {
        LogError("%s:%d popen tavoportforward error", kFile, __LINE__);
        return -1;
    }
    VersionLines lines;
    char szBlock[kToolLineSize];
    for (ssize_t nRead = 0; (nRead = tool.Read(szBlock, sizeof(szBlock))) > 0;) {
        lines.Take({szBlock, static_cast<size_t>(nRead)});
    }
    lines.EndLine();
    return lines.Version();
}

namespace PF_CONF {

int IsRuleEnable(bool& blEnable, const _tag_tavo_pf_conf* pConf) {
    if (!HasHash(pConf)) {
        return 0;
    }
    const char* szEnabled = TLIBCSzHashGetValue(pConf->pHash, "enabled");
    if (szEnabled == nullptr) {
        LogError("%s:%d get rule enable failed", kFile, __LINE__);
        return 0;
    }
    blEnable = std::strcmp(szEnabled, "1") == 0;
    return 1;
}

int GetRuleID(std::string& id, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (pConf == nullptr) {
            LogError("%s:%d pConf shall not be NULL", kFile, __LINE__);
            return 0;
        }
        id = pConf->szSection;
        return 1;
    });
}

int GetRuleProtocol(std::string& protocol, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (!HasHash(pConf)) {
            return 0;
        }
        if (ReadText(protocol, "protocol name", pConf) == 0) {
            LogError("%s:%d get protocol failed", kFile, __LINE__);
            return 0;
        }
        return 1;
    });
}

int GetRuleServiceID(std::string& serviceID, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (!HasHash(pConf)) {
            return 0;
        }
        if (ReadText(serviceID, "service_id", pConf) == 0) {
            serviceID.clear();
        }
        return 1;
    });
}

int GetRuleServiceName(std::string& serviceName, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (!HasHash(pConf)) {
            return 0;
        }
        ReadText(serviceName, "service", pConf);
        return 1;
    });
}

int GetRulePort(std::string& routerPort, std::string& srcPort, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (!HasHash(pConf)) {
            return 0;
        }
        std::string szSrcPort;
        std::string szRouterPort;
        if (ReadText(szSrcPort, "s_port", pConf) == 0) {
            LogError("%s:%d get rule src port failed", kFile, __LINE__);
            return 0;
        }
        if (ReadText(szRouterPort, "r_port", pConf) == 0) {
            LogError("%s:%d get rule router port failed", kFile, __LINE__);
            return 0;
        }
        routerPort = szRouterPort;
        srcPort = szSrcPort;
        return 1;
    });
}

int GetRuleInfo(std::string& id, bool& blEnable, std::string& routerPort, std::string& srcPort, std::string& protocol,
                std::string& serviceID, [[maybe_unused]] std::string& extra, const _tag_tavo_pf_conf* pConf) {
    if (pConf == nullptr) {
        LogError("%s:%d pConf is NULL", kFile, __LINE__);
        return 0;
    }
    if (GetRuleID(id, pConf) == 0) {
        LogError("%s:%d get rule id failed", kFile, __LINE__);
        return 0;
    }
    if (IsRuleEnable(blEnable, pConf) == 0) {
        LogError("%s:%d get rule protocol failed", kFile, __LINE__);
        return 0;
    }
    if (GetRuleProtocol(protocol, pConf) == 0) {
        LogError("%s:%d get rule protocol failed", kFile, __LINE__);
        return 0;
    }
    if (GetRulePort(routerPort, srcPort, pConf) == 0) {
        LogError("%s:%d get rule port failed", kFile, __LINE__);
        return 0;
    }
    GetRuleServiceID(serviceID, pConf);
    return 1;
}

int ToArray(int& nCount, __tag_TAVO_ROUTER_RULE** ppRules, const _tag_tavo_pf_conf* pHead) {
    return AtBorder(0, [&] {
        if (ppRules == nullptr || *ppRules != nullptr) {
            LogError("%s:%d pRgRules is NULL or *pRgRules is not NULL", kFile, __LINE__);
            return 0;
        }
        if (pHead == nullptr) {
            nCount = 0;
            *ppRules = nullptr;
            return 1;
        }
        nCount = 0;
        for (const TAVO_PF_CONF* pConf = pHead; pConf != nullptr; pConf = pConf->pNext) {
            ++nCount;
        }
        const size_t nBytes = static_cast<size_t>(nCount) * sizeof(__tag_TAVO_ROUTER_RULE);
        std::unique_ptr<void, decltype(&std::free)> pBlock(std::malloc(nBytes), &std::free);
        if (!pBlock) {
            LogError("%s:%d pArr is NULL", kFile, __LINE__);
            return 0;
        }
        std::memset(pBlock.get(), 0, nBytes);
        auto* rgRules = static_cast<__tag_TAVO_ROUTER_RULE*>(pBlock.get());

        // One set of texts for all rules: a rule without a service name gets the one of the rule before it.
        RecordFields fields;
        int i = 0;
        for (const TAVO_PF_CONF* pConf = pHead; pConf != nullptr; pConf = pConf->pNext, ++i) {
            if (!ReadFields(fields, pConf)) {
                return 0;
            }
            if (i >= nCount) {
                LogError("%s:%d critical error out of array=%d i=%d", kFile, __LINE__, nCount, i);
                return 0;
            }
            FillRecord(rgRules[i], fields);
        }
        *ppRules = rgRules;
        pBlock.release();
        return 1;
    });
}

int FreeArray(__tag_TAVO_ROUTER_RULE* pRules) {
    if (pRules == nullptr) {
        LogError("%s:%d pConfHead is NULL", kFile, __LINE__);
    }
    std::free(pRules);
    return 0;
}

}  // namespace PF_CONF
