// What the library's own files share: the log line, the fixed paths, file and lock helpers.
// Relies on the platform's seam headers and the public header.
// Promises nothing beyond this library: none of these names is exported.
#pragma once

#include <sys/stat.h>

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <functional>
#include <memory>
#include <new>
#include <string>
#include <string_view>

#include "libtavoportmap.h"
#include "tavo/core.h"
#include "tavo/portforward.h"

namespace NOS {
class Task;
}

namespace tavo::lib {

// The source path in the log lines of the entry points with C types, in whichever file they stand.
inline constexpr char kEntryFile[] = "src/libtavoportmap.cpp";
inline constexpr char kRouterLock[] = "/tmp/routerconf.lock";
inline constexpr char kProgressMarker[] = "/tmp/pfProgress";
inline constexpr char kRouterConf[] = "/etc/portforward/router.conf";
inline constexpr char kRuleConf[] = "/etc/portforward/rule.conf";
inline constexpr char kTestRuleConf[] = "/etc/portforward/testrule.conf";
inline constexpr char kRouterDbDir[] = "/etc.defaults/portforward/routerdb";
inline constexpr char kUpnpUserDb[] = "/etc/portforward/router_upnp.db.user";  // the user's own test
inline constexpr char kSystemConf[] = "/etc/tavoinfo.conf";
inline constexpr char kUpnpStatus[] = "/var/tmp/upnp_portmap.status";
inline constexpr char kTestProgress[] = "/tmp/upnp_test.progress";
inline constexpr char kPortTestMarker[] = "/tmp/pfStatusRule";
inline constexpr char kRouterLog[] = "/var/log/router.log";
inline constexpr char kUpnpRunKey[] = "runupnpportmapping";
inline constexpr char kNatpmpRunKey[] = "runnatpmpportmapping";
inline constexpr char kTaskOwner[] = "@system";
inline constexpr char kUpnpTestDaemon[] = "/usr/tavo/sbin/upnpd --debug -p";
inline constexpr char kUpnpd[] = "upnpd";
inline constexpr char kNatpmpd[] = "natpmpd";
inline constexpr char kForwardTool[] = "tavoportforward";
inline constexpr char kSbinDir[] = "/usr/tavo/sbin/";
inline constexpr char kBinDir[] = "/usr/tavo/bin/";
inline constexpr int kHashSize = 1024;
inline constexpr size_t kCommandSize = 4096;

// One line of the system log at priority error. Every format begins "%s:%d ": the source path relative
// to the tree, then the line. errno is kept, so "%m" works and callers may still look at it.
void LogError(const char* szFormat, ...) __attribute__((format(printf, 1, 2)));
void LogErrorV(const char* szFormat, va_list arguments);

struct FreeDeleter {
    void operator()(void* pBlock) const { std::free(pBlock); }
};

struct ConfListDeleter {
    void operator()(TAVO_PF_CONF* pHead) const { TAVOPFConfFree(pHead); }
};
using ConfList = std::unique_ptr<TAVO_PF_CONF, ConfListDeleter>;

struct HashDeleter {
    void operator()(TLIBCSzHash* pHash) const { TLIBCSzHashFree(pHash); }
};
using Hash = std::unique_ptr<TLIBCSzHash, HashDeleter>;

// Calls fnAnswer at the library's border: nothing that it throws (memory that ran out, or whatever a
// caller's callback throws) crosses.
template <typename Result, typename Function>
Result AtBorder(Result failure, Function fnAnswer) noexcept {
    try {
        return fnAnswer();
    } catch (...) {
        return failure;
    }
}

// A lock file for one call. Get() tries it without waiting; it is released with the object, also when it
// was held elsewhere and only a descriptor was opened.
class FileLock {
public:
    explicit FileLock(const char* szPath) : mSzPath(szPath) {}
    ~FileLock() { Release(); }
    FileLock(const FileLock&) = delete;
    FileLock& operator=(const FileLock&) = delete;

    bool Get() { return lock_file(mSzPath, mFd) != 0; }
    void Release() {
        unlock_file(mFd);
        mFd = -1;
    }
    // In a forked child: gives up this process's descriptor, and leaves the lock to the parent.
    void LeaveToParent();

private:
    const char* mSzPath;
    int mFd = -1;
};

class RouterLock : public FileLock {
public:
    RouterLock() : FileLock(kRouterLock) {}
};

// Owner and mode of the file at szPath. One that is made afresh in its place takes them: whoever may read the old one
// may read it too.
class OwnerAndMode {
public:
    explicit OwnerAndMode(const char* szPath);
    void GiveTo(const char* szPath) const;
    // For a file that gets a password, and may not have had one: one that anybody could read is its owner's alone then.
    void HideFromOthers();

private:
    struct stat mStatus = {};
    bool mBlKnown;
};

// What was renamed and deleted in the directory of the file at szPath is so after a power cut, too.
void FlushDirectoryOf(const char* szPath);

// Holds the file at szPath, under whatever name it gets meanwhile, as long as the object and the process live: readers
// bring back what a killed writer set aside, and leave alone what is held. By a read lock, so that nobody who may only
// read the file can be in its way.
class HeldFile {
public:
    explicit HeldFile(const char* szPath);
    ~HeldFile() { Release(); }
    HeldFile(const HeldFile&) = delete;
    HeldFile& operator=(const HeldFile&) = delete;

    // False: a reader could take it for what a killed writer left. Where there is no file, there is nothing to hold.
    bool IsHeld() const { return mBlHeld; }

private:
    void Release();

    int mFd = -1;
    bool mBlHeld = false;
};

// Whether a caller's gateway argument is an IP address; a refusal is logged.
bool IsGatewayAddress(const char* szGwRouterIP);

// The lock of an entry point that was asked to take it. False: held elsewhere, which is logged and, unless
// pErr is null, told as a conflict.
bool GetRouterLock(RouterLock& lock, __tag_TAVO_LIBTAVOPORTMAP_ERR* pErr);

// Adds a caller's rule to a rule file that is being built. False: it was refused, which is logged.
bool AddRule(RouterRuleConfWriter& rules, const __tag_TAVO_ROUTER_RULE& rule);

// Sets one of the two run keys of the system settings. False: it could not be written.
bool SetRunKey(const char* szKey, const char* szValue);

// One update of a task record: emptied and begun here, published by End(). Without End(), on the way of
// something thrown, it is published empty: half of a finding would be taken for a whole one.
class TaskUpdate {
public:
    explicit TaskUpdate(NOS::Task& task);
    ~TaskUpdate();
    TaskUpdate(const TaskUpdate&) = delete;
    TaskUpdate& operator=(const TaskUpdate&) = delete;

    // Throws when memory runs out.
    void Set(const char* szName, const char* szValue);
    // False, and logged: readers see what the last update published.
    bool End();

private:
    NOS::Task& mTask;
    bool mBlEnded = false;
};

// One text of a record of kTaskOwner's, read anew; empty when there is none.
std::string TaskText(const char* szId, const char* szName);

// One step down in a directory tree, and never up or sideways.
bool IsPathPart(std::string_view szPart);

// The text as it stands between single quotes of a shell command, which it cannot leave.
std::string InQuotes(std::string_view szText);

// Decimal number of a text as strtol reads it; values outside int are clamped.
int ToInt(const char* szText);

// Copies with "%s", cut at the field's size. False when the copy failed.
template <size_t N>
bool FillText(char (&szField)[N], const std::string& szText) {
    return std::snprintf(szField, N, "%s", szText.c_str()) >= 0;
}

// A node with an empty hash, named szName. Null when memory ran out: szNoNode or szNoHash is logged with
// szFile and nLine. Both formats take the file and the line.
ConfList NewSection(const std::string& szName, const char* szNoNode, const char* szNoHash, const char* szFile,
                    int nLine);

// A name beside szPath that nothing has yet: szPath and six letters and digits as nobody chooses them. The platform
// brings back what a killed writer left under such a name: for one that writes the file anew where it is missing, for a
// report (whose name has a digit first) whatever is there.
enum class AsideFor { kWriting, kReport };
std::string UniqueName(const char* szPath, AsideFor enFor);

// Whether a file has a secret in it, which anybody could read and is its owner's alone from then on.
enum class Holds { kNoSecret, kSecret };

// Replaces szPath safely: the live file is renamed to a unique name beside it, fnWrite writes the new
// one, and the old one is deleted after success (the new one takes its owner and mode) and renamed back
// after failure. True when fnWrite succeeded; every failure is logged, and what fnWrite throws is one.
bool ReplaceFile(const char* szPath, Holds enHolds, const std::function<bool()>& fnWrite);

// What distinguishes one port-mapping daemon from the other.
struct DaemonControl {
    const char* szFile;   // source path of the lines logged
    const char* szName;   // process and program name
    const char* szOther;  // the daemon that must stop mapping
    const char* szPidFile;
};

// Starts the daemon, or has a running one read its settings again; afterwards the progress marker
// stands until the daemon has finished. False, with the marker gone, when neither was possible.
bool StartDaemonOf(const DaemonControl& control);

}  // namespace tavo::lib
