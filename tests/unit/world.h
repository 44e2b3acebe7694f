// What the tests share: the log lines of the system log, files at their fixed places, a fake gateway.
#pragma once

#include <dlfcn.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "libtavoportmap.h"

// Every line that went to syslog, without its "file:line " prefix.
extern std::vector<std::string> gLog;
// What the next rename of this source path does: fail, once.
extern std::string gSzFailRename;
// After so many changes of a name or a file's rights the process dies at the next one (never: negative).
extern int gNGoodChanges;
inline constexpr int kKilled = 77;
// Renames by renameat2 before one fails (never: negative), by the process's end or with an error, and whether the file
// system exchanges names.
extern int gNRenamesLeft;
extern bool gBlKilled;
extern bool gBlExchanges;
// The file that another user owns; it takes no such user.
extern std::string gSzForeign;
// Of the stand-ins: a name is about to change.
void ChangeName();
// The default gateway that the platform reports; empty: none.
extern std::string gSzGateway;
// Seconds slept; sleep() only counts.
extern int gNSlept;
// Called before each sleep is counted.
extern std::function<void()> gFnOnSleep;
// Answers in place of the platform's write of router.conf, when set.
extern std::function<int()> gFnOnConfSet;

// What the time of day is ahead of the real clock, in seconds; no other clock is.
extern time_t gNClockAhead;
// Seconds that the clock jumps ahead each time somebody looks at it.
extern int gNClockStep;
extern time_t gNClockJumped;  // in all; a timer of the kernel does not know of it

// Whoever lets the clock jump has one of these, so that it goes right for the tests that follow.
struct JumpingClock {
    JumpingClock() = default;
    ~JumpingClock() { gNClockStep = 0, gNClockJumped = 0; }
    JumpingClock(const JumpingClock&) = delete;
    JumpingClock& operator=(const JumpingClock&) = delete;
};

// Memory runs out after so many allocations (never: negative), for one of them or for good.
extern long gNGoodAllocations;
extern bool gBlOneFailure;
extern bool gBlAllocationFailed;
// While one of these lives, what is allocated is the test's own and always there.
class OwnMemory {
public:
    OwnMemory() { ++nDepth; }
    ~OwnMemory() { --nDepth; }
    OwnMemory(const OwnMemory&) = delete;
    OwnMemory& operator=(const OwnMemory&) = delete;

    static int nDepth;
};

// Calls fnCall with the n-th allocation failing, for every n, alone and with all that follow.
template <typename Call>
void RunOutOfMemory(Call fnCall) {
    for (const bool blOne : {true, false}) {
        bool blFailed = true;
        for (long n = 0; blFailed; ++n) {
            gBlOneFailure = blOne;
            gBlAllocationFailed = false;
            fnCall([n] { gNGoodAllocations = n; });
            gNGoodAllocations = -1;
            blFailed = gBlAllocationFailed;
            ASSERT_LT(n, 20000);
        }
    }
}

inline void Write(const std::string& szPath, const std::string& szText) {
    std::filesystem::create_directories(std::filesystem::path(szPath).parent_path());
    std::ofstream(szPath) << szText;
}

// A shell's lines.
inline void WriteProgram(const std::string& szPath, const std::string& szLines) {
    Write(szPath, "#!/bin/sh\n" + szLines);
    chmod(szPath.c_str(), 0755);
}

inline void MakeEmpty(std::initializer_list<const char*> rgszDirs) {
    for (const char* szDir : rgszDirs) {
        std::filesystem::remove_all(szDir);
        std::filesystem::create_directories(szDir);
    }
}

// Whether it becomes so within five seconds.
inline bool SoonTrue(const std::function<bool()>& fnTrue) {
    for (int i = 0; i < 500 && !fnTrue(); ++i) {
        usleep(10000);
    }
    return fnTrue();
}

// Settings of a router that a database may know.
inline std::unique_ptr<__tag_TAVO_ROUTER_CONF> NewSettings(const char* szUpnp, const char* szNatpmp, const char* szUser,
                                                           const char* szPass) {
    auto pConf = std::make_unique<__tag_TAVO_ROUTER_CONF>();
    for (const auto& [szField, szValue] : {std::pair{pConf->szBrand, "Acme"},
                                           {pConf->szModel, "R1"},
                                           {pConf->szVersion, "1.0"},
                                           {pConf->szSupportUpnp, szUpnp},
                                           {pConf->szSupportNatpmp, szNatpmp},
                                           {pConf->szUser, szUser},
                                           {pConf->szPass, szPass},
                                           {pConf->szConnType, "http"},
                                           {pConf->szConnPort, "80"}}) {
        snprintf(szField, TAVO_TEXT_SIZE, "%s", szValue);
    }
    return pConf;
}

// Plays the command that packs a report.
inline void PackNothing(const std::string& szCommand) {
    if (szCommand.starts_with("/bin/tar")) {
        const size_t nName = szCommand.find('\'') + 1;
        Write(szCommand.substr(nName, szCommand.find('\'', nName) - nName), "");
    }
}

inline std::string Read(const std::string& szPath) {
    std::ostringstream text;
    text << std::ifstream(szPath).rdbuf();
    return text.str();
}

// Another one after every write that replaces the file.
inline ino_t InodeOf(const std::string& szPath) {
    struct stat status = {};
    return stat(szPath.c_str(), &status) == 0 ? status.st_ino : 0;
}

inline bool Logged(const std::string& szLine) {
    return std::find(gLog.begin(), gLog.end(), szLine) != gLog.end();
}

// Whether a line begins so; numbers and places follow.
inline bool LoggedFrom(const std::string& szBegin) {
    return std::any_of(gLog.begin(), gLog.end(), [&](const auto& szSeen) { return szSeen.starts_with(szBegin); });
}

// As many of the last lines as the other text has, joined as there.
inline std::string LastLines(const std::string& szLike) {
    const auto nLines = static_cast<size_t>(std::count(szLike.begin(), szLike.end(), '\n')) + 1;
    std::string szLast;
    for (size_t i = gLog.size() - std::min(nLines, gLog.size()); i < gLog.size(); ++i) {
        szLast += (szLast.empty() ? "" : "\n") + gLog[i];
    }
    return szLast;
}

// The library's own function behind a stand-in.
template <typename Function>
Function* Real(const char* szName, Function*) {
    return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, szName));
}

// Whether another process could take the lock now.
inline bool IsLockFree(const char* szPath) {
    int fd = -1;
    const bool blFree = lock_file(szPath, fd) == 1;
    unlock_file(fd);
    return blFree;
}
