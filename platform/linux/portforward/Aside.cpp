// Finds the copies that killed writers left. Relies on the names that writers choose and on the file times.
// Promises: see Aside.h.
#include "portforward/Aside.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <string>
#include <string_view>
#include <vector>

#include "core/Directory.h"
#include "core/Suffix.h"

namespace tavo {

namespace {

constexpr time_t kObsoleteSeconds = 600;  // since it was moved aside; a write takes a second

enum class Kind {
    kNone,   // none of ours
    kAside,  // what a writer moved aside, to the file's name and a suffix, before writing
    kNew     // what a writer had begun to write: the name, "." and a suffix
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
    if (szSeen.starts_with('.')) {
        return IsSuffix(szSeen.substr(1)) ? Kind::kNew : Kind::kNone;
    }
    return IsSuffix(szSeen) ? Kind::kAside : Kind::kNone;
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

// Whether one copy has less to say than the other; what is half written has nothing.
bool IsWorse(const AsideCopy& one, const AsideCopy& other) {
    return one.enKind != other.enKind ? one.enKind == Kind::kNew : IsOlder(one.status.st_mtim, other.status.st_mtim);
}

}  // namespace

void BringBack(const char* szPath) {
    const std::vector<AsideCopy> rgCopies = AsideCopies(szPath);
    const auto newest = std::max_element(rgCopies.begin(), rgCopies.end(), &IsWorse);
    if (newest != rgCopies.end() && newest->enKind != Kind::kNew &&
        renameat2(AT_FDCWD, newest->szPath.c_str(), AT_FDCWD, szPath, RENAME_NOREPLACE) == 0) {
        syslog(LOG_WARNING, "%s was missing; its copy %s is back in place", szPath, newest->szPath.c_str());
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
        const bool blObsolete = copy.enKind == Kind::kNew || IsOlder(copy.status.st_mtim, live.st_mtim);
        if (blPlain && blObsolete && nNow - copy.status.st_ctim.tv_sec > kObsoleteSeconds &&
            unlink(copy.szPath.c_str()) == 0) {
            syslog(LOG_WARNING, "%s, which a killed writer left beside %s, is deleted", copy.szPath.c_str(), szPath);
        }
    }
}

}  // namespace tavo
