// Finds the copies that killed writers left. Relies on the names that mktemp makes and on the file times.
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

namespace tavo {

namespace {

constexpr size_t kSuffix = 6;
constexpr std::string_view kLetters = "0123456789abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ";
constexpr time_t kObsoleteSeconds = 600;  // since it was moved aside; a write takes a second

// A copy that a writer moved aside, to the file's name and six more letters and digits, before writing.
struct AsideCopy {
    std::string szPath;
    struct stat status;
};

bool IsAsideName(std::string_view szSeen, std::string_view szName) {
    return szSeen.size() == szName.size() + kSuffix && szSeen.starts_with(szName) &&
           szSeen.substr(szName.size()).find_first_not_of(kLetters) == std::string_view::npos;
}

std::vector<AsideCopy> AsideCopies(std::string_view szPath) {
    const size_t nName = szPath.rfind('/') + 1;
    const std::string szDir(szPath.substr(0, nName));
    std::vector<AsideCopy> rgCopies;
    const auto rgszSeen = NamesIn(szDir);
    for (const std::string& szSeen : rgszSeen ? *rgszSeen : std::vector<std::string>()) {
        AsideCopy copy{szDir + szSeen, {}};
        if (IsAsideName(szSeen, szPath.substr(nName)) && stat(copy.szPath.c_str(), &copy.status) == 0 &&
            S_ISREG(copy.status.st_mode)) {
            rgCopies.push_back(std::move(copy));
        }
    }
    return rgCopies;
}

bool IsOlder(const timespec& one, const timespec& other) {
    return one.tv_sec != other.tv_sec ? one.tv_sec < other.tv_sec : one.tv_nsec < other.tv_nsec;
}

// Six random letters and digits; a word or a number ("rule.confbackup") is a person's own copy.
bool IsRandomSuffix(std::string_view szSuffix) {
    int nKinds = 0;
    for (const std::string_view szKind : {kLetters.substr(0, 10), kLetters.substr(10, 26), kLetters.substr(36)}) {
        nKinds += szSuffix.find_first_of(szKind) != std::string_view::npos ? 1 : 0;
    }
    return nKinds > 1;
}

}  // namespace

void BringBack(const char* szPath) {
    const std::vector<AsideCopy> rgCopies = AsideCopies(szPath);
    const auto newest = std::max_element(
        rgCopies.begin(), rgCopies.end(),
        [](const AsideCopy& one, const AsideCopy& other) { return IsOlder(one.status.st_mtim, other.status.st_mtim); });
    if (newest != rgCopies.end() &&
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
        const std::string_view szSuffix = std::string_view(copy.szPath).substr(copy.szPath.size() - kSuffix);
        if (blPlain && IsRandomSuffix(szSuffix) && IsOlder(copy.status.st_mtim, live.st_mtim) &&
            nNow - copy.status.st_ctim.tv_sec > kObsoleteSeconds && unlink(copy.szPath.c_str()) == 0) {
            syslog(LOG_WARNING, "%s, which a killed writer left, is older than %s and deleted", copy.szPath.c_str(),
                   szPath);
        }
    }
}

}  // namespace tavo
