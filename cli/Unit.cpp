// Asks the system about programs. Relies on systemctl, on the library for saving and testing, and on /proc/locks for
// the locks, which are looked at there and never taken. Promises: see Unit.h.
#include "Unit.h"

#include <fmt/format.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "Answer.h"
#include "Child.h"
#include "libtavoportmap.h"

namespace tavo::cli {

namespace {

constexpr char kSystemdRuns[] = "/run/systemd/system";
constexpr char kSystemctl[] = "/usr/bin/systemctl";
constexpr auto kSystemctlLimit = std::chrono::seconds(4);
constexpr size_t kMostOutput = 4096;
constexpr char kRouterLock[] = "/tmp/routerconf.lock";
constexpr const char* kDetectorLocks[] = {"/tmp/upnp_detector.lock", "/tmp/natpmp_detector.lock"};

// Whether /proc/locks may name this file by another device than stat does: a file system that spans devices has a
// number for itself and others for its files. A tmpfs has but one; where /tmp and /run are such, the small numbers of
// their files are often the same, and the device alone tells them apart.
bool HasOtherDevice(const char* szPath, const struct stat& info) {
    struct statfs about = {};
    return major(info.st_dev) == 0 && statfs(szPath, &about) == 0 && about.f_type != TMPFS_MAGIC;
}

// Who holds a lock on this file; nothing when nobody does, 0 for a process that cannot be seen from here.
std::optional<pid_t> HolderOf(const char* szPath) {
    struct stat info = {};
    if (lstat(szPath, &info) != 0 || !S_ISREG(info.st_mode)) {
        return std::nullopt;
    }
    const bool blOtherDevice = HasOtherDevice(szPath, info);
    std::ifstream stream("/proc/locks");
    for (std::string szLine; std::getline(stream, szLine);) {
        // "7: FLOCK  ADVISORY  WRITE 812 00:2d:1304 0 EOF"; who waits for a lock has "->" in front of the kind.
        char szKind[16] = {};
        int nPid = 0;
        unsigned nMajor = 0, nMinor = 0;
        unsigned long nInode = 0;
        if (std::sscanf(szLine.c_str(), "%*d: %15s %*s %*s %d %x:%x:%lu", szKind, &nPid, &nMajor, &nMinor, &nInode) !=
                5 ||
            std::string_view(szKind) != "FLOCK" || nInode != info.st_ino) {
            continue;
        }
        if (blOtherDevice ? nMajor == 0 : major(info.st_dev) == nMajor && minor(info.st_dev) == nMinor) {
            return std::max(nPid, 0);
        }
    }
    return std::nullopt;
}

std::string ProgramOf(pid_t nPid) {
    std::ifstream stream(fmt::format("/proc/{}/comm", nPid));
    std::string szName;
    std::getline(stream, szName);
    return Clean(szName);
}

}  // namespace

std::optional<UnitState> ReadUnit(const std::string& szDaemon) {
    std::error_code error;
    if (!std::filesystem::exists(kSystemdRuns, error)) {
        return std::nullopt;
    }
    std::istringstream lines(
        OutputOf({kSystemctl, "show", "--property=LoadState,ActiveState,UnitFileState,Result", szDaemon + ".service"},
                 kSystemctlLimit, kMostOutput));
    UnitState unit;
    bool blLoaded = false;
    for (std::string szLine; std::getline(lines, szLine);) {
        const size_t nEqual = std::min(szLine.find('='), szLine.size());
        const std::string szKey = szLine.substr(0, nEqual);
        const std::string szValue = Clean(szLine.substr(std::min(nEqual + 1, szLine.size())));
        blLoaded = blLoaded || (szKey == "LoadState" && szValue == "loaded");
        std::string* pField = szKey == "ActiveState"     ? &unit.szActive
                              : szKey == "UnitFileState" ? &unit.szEnabled
                              : szKey == "Result"        ? &unit.szResult
                                                         : nullptr;
        if (pField != nullptr) {
            *pField = szValue;
        }
    }
    return blLoaded ? std::optional(unit) : std::nullopt;
}

Running WhatRuns() {
    auto enTask = TAVO_LIBTAVOPORTMAP_TASK_IDLE;
    TLibGetLibTavoPortMapRunningTask(&enTask);
    const auto nHolder = HolderOf(kRouterLock);
    Running running{.szProgram = nHolder && *nHolder > 0 ? ProgramOf(*nHolder) : ""};
    const bool blDetecting = HolderOf(kDetectorLocks[0]) || HolderOf(kDetectorLocks[1]);
    running.szWord = enTask == TAVO_LIBTAVOPORTMAP_TASK_TESTING  ? "testing"
                     : enTask == TAVO_LIBTAVOPORTMAP_TASK_SAVING ? "saving"
                     : blDetecting                               ? "detecting"
                     : nHolder                                   ? "busy"
                                                                 : "idle";
    return running;
}

std::string Running::ToText() const {
    return szWord == "testing"     ? "a UPnP compatibility test"
           : szWord == "saving"    ? "saving rules"
           : szWord == "detecting" ? "a detection of the router"
           : szWord == "busy"
               ? "an operation that holds the router lock" + (szProgram.empty() ? "" : " (" + szProgram + ")")
               : "nothing";
}

}  // namespace tavo::cli
