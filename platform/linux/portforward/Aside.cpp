// Finds the copies that killed writers left. Relies on the names that writers choose and on the file times.
// Promises: see Aside.h.
#include "portforward/Aside.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <iterator>
#include <string>
#include <string_view>
#include <vector>

#include "ground/Descriptor.h"
#include "ground/Directory.h"
#include "ground/Rename.h"
#include "ground/Suffix.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr std::string_view kRouterName = "router.conf";
constexpr std::string_view kRouterConf = "/etc/portforward/router.conf";
constexpr time_t kStandInSeconds = 10;  // within which a report has put its own settings in the place of the user's

enum class Kind {
    kNone,      // none of ours
    kAside,     // what a writer moved aside, to the file's name and a suffix, before writing
    kReported,  // the router's settings that a report has set aside: the suffix begins with a digit
    kTried      // what new settings that are only tried stand in for: the name and ".bak", of the router file alone
};

struct AsideCopy {
    std::string szPath;
    struct stat status;
    Kind enKind;
};

Kind KindOf(std::string_view szSeen, std::string_view szName) {
    if (!szSeen.starts_with(szName)) {
        return Kind::kNone;
    }
    szSeen.remove_prefix(szName.size());
    if (szSeen == ".bak") {
        return szName == kRouterName ? Kind::kTried : Kind::kNone;
    }
    if (!IsSuffix(szSeen)) {
        return Kind::kNone;
    }
    return szName == kRouterName && szSeen.front() >= '0' && szSeen.front() <= '9' ? Kind::kReported : Kind::kAside;
}

std::vector<AsideCopy> AsideCopies(std::string_view szPath) {
    const size_t nName = szPath.rfind('/') + 1;
    const std::string szDir(szPath.substr(0, nName));
    std::vector<AsideCopy> rgCopies;
    const auto rgszSeen = NamesIn(szDir);
    for (const std::string& szSeen : rgszSeen ? *rgszSeen : std::vector<std::string>()) {
        AsideCopy copy{szDir + szSeen, {}, KindOf(szSeen, szPath.substr(nName))};
        if (copy.enKind != Kind::kNone && stat(copy.szPath.c_str(), &copy.status) == 0 &&
            S_ISREG(copy.status.st_mode)) {
            rgCopies.push_back(std::move(copy));
        }
    }
    return rgCopies;
}

bool IsOlder(const timespec& one, const timespec& other) {
    return one.tv_sec != other.tv_sec ? one.tv_sec < other.tv_sec : one.tv_nsec < other.tv_nsec;
}

// Whether the process lives that set the copy aside and wants it back itself: it has a lock on it. Those who only look
// are in nobody's way.
bool IsHeld(const AsideCopy& copy) {
    const Descriptor fd(open(copy.szPath.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
    struct flock other = {};
    other.l_type = F_WRLCK;
    return fd.Get() < 0 || fcntl(fd.Get(), F_OFD_GETLK, &other) != 0 || other.l_type != F_UNLCK;
}

bool WasWrittenBefore(const AsideCopy& one, const AsideCopy& other) {
    return IsOlder(one.status.st_mtim, other.status.st_mtim);
}

// Whether what is live now was written after a report had put its own settings there: by a person, by hand.
bool IsNewer(const struct stat& live, const AsideCopy& copy) {
    return copy.enKind == Kind::kReported && live.st_mtim.tv_sec > copy.status.st_ctim.tv_sec + kStandInSeconds;
}

// What a report that was killed has set aside takes the place again of what the report has put there. Were there
// two, the later one would be what the earlier report had made.
void BringBackReported(const char* szPath, const std::vector<AsideCopy>& rgCopies) {
    struct stat live = {};
    const bool blLive = lstat(szPath, &live) == 0;
    std::vector<AsideCopy> rgReported;
    std::copy_if(rgCopies.begin(), rgCopies.end(), std::back_inserter(rgReported), [&](const AsideCopy& copy) {
        return copy.enKind == Kind::kReported && !(blLive && IsNewer(live, copy)) && !IsHeld(copy);
    });
    std::sort(rgReported.begin(), rgReported.end(), [](const AsideCopy& one, const AsideCopy& other) {
        return IsOlder(one.status.st_ctim, other.status.st_ctim);
    });
    bool blBack = false;
    for (const AsideCopy& copy : rgReported) {
        if (blBack && unlink(copy.szPath.c_str()) == 0) {
            SysLog(LOG_WARNING, "%s, which another killed report set aside later, is deleted", copy.szPath.c_str());
        } else if (!blBack && rename(copy.szPath.c_str(), szPath) == 0) {
            blBack = true;
            SysLog(LOG_WARNING, "a report was killed; the settings that it had set aside as %s are %s again",
                   copy.szPath.c_str(), szPath);
        }
    }
}

// Whether nobody will want the copy back, once the live file is newer. A person may have made one that ends in ".bak":
// the next settings that are stored delete that.
bool IsLeft(const AsideCopy& copy, const struct stat& live) {
    return copy.enKind == Kind::kAside || (copy.enKind == Kind::kReported && IsNewer(live, copy) && !IsHeld(copy));
}

bool IsThere(const char* szPath) {
    struct stat live = {};
    return lstat(szPath, &live) == 0;
}

}  // namespace

bool BringBack(const char* szPath) {
    const bool blRouter = std::string_view(szPath).ends_with(std::string("/").append(kRouterName));
    if (!blRouter && IsThere(szPath)) {
        return true;
    }
    const std::vector<AsideCopy> rgCopies = AsideCopies(szPath);
    BringBackReported(szPath, rgCopies);
    if (IsThere(szPath)) {
        return true;
    }
    const auto newest = std::max_element(rgCopies.begin(), rgCopies.end(), &WasWrittenBefore);
    if (newest == rgCopies.end()) {
        return true;
    }
    if (blRouter && IsHeld(*newest)) {  // nobody sets rules aside for longer: who has a lock on them only reads
        return false;
    }
    if (Rename(newest->szPath.c_str(), szPath, RENAME_NOREPLACE)) {
        SysLog(LOG_WARNING, "%s was missing; its copy %s is back in place", szPath, newest->szPath.c_str());
    }
    return true;
}

void EndReport(const char* szPath) {
    if (szPath == kRouterConf) {
        BringBackReported(szPath, AsideCopies(szPath));
    }
}

// The copies are listed before the live file is looked at. So a writer whose copy is in the list has either
// written the live file, and deletes the copy itself, or fails while another one's newer file stands, and
// must not put the copy over it; one that starts later uses a name that is not in the list.
void DropObsolete(const char* szPath) {
    const std::vector<AsideCopy> rgCopies = AsideCopies(szPath);
    struct stat live = {};
    if (rgCopies.empty() || lstat(szPath, &live) != 0 || !S_ISREG(live.st_mode)) {
        return;
    }
    const time_t nNow = time(nullptr);
    for (const AsideCopy& copy : rgCopies) {
        struct stat link = {};
        const bool blPlain = lstat(copy.szPath.c_str(), &link) == 0 && S_ISREG(link.st_mode);
        const bool blObsolete = IsOlder(copy.status.st_mtim, live.st_mtim) && IsLeft(copy, live);
        if (blPlain && blObsolete && nNow - copy.status.st_ctim.tv_sec > kWriterSeconds &&
            unlink(copy.szPath.c_str()) == 0) {
            SysLog(LOG_WARNING, "%s, which a killed writer left beside %s, is deleted", copy.szPath.c_str(), szPath);
        }
    }
}

}  // namespace tavo
