// The safe replacement of a file, and the parts that other writers take from it. Relies on rename, locks and the
// platform's files. Promises: nothing is thrown by ReplaceFile; every failure of it is logged.
#include "ReplaceFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <string_view>

#include "Border.h"
#include "Log.h"
#include "tavo/core.h"

namespace tavo::lib {

namespace {

constexpr size_t kSuffixSize = 6;
constexpr int kNameTries = 100;
constexpr int kHoldTries = 100;

void RenameLogged(const char* szFrom, const char* szTo, int nLine) {
    if (rename(szFrom, szTo) != 0) {
        LogError("%s:%d rename(%s, %s) failed ", kCommonFile, nLine, szFrom, szTo);
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

}  // namespace

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

std::string UniqueName(const char* szPath, AsideFor enFor) {
    std::string szName;
    struct stat status = {};
    for (int i = 0; i < kNameTries && (szName.empty() || lstat(szName.c_str(), &status) == 0); ++i) {
        std::string szRandom = std::string(szPath) + "XXXXXX";
        // The name is only ever renamed to, never opened, and its directory is root's own.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
        mktemp(szRandom.data());  // NOLINT(clang-analyzer-security.insecureAPI.mktemp)
#pragma GCC diagnostic pop
        szRandom.erase(0, szRandom.size() - kSuffixSize);
        szName = szPath + Unmistakable(szRandom, enFor == AsideFor::kReport);
    }
    return lstat(szName.c_str(), &status) == 0 ? "" : szName;  // none is free: the renaming fails
}

bool ReplaceFile(const char* szPath, Holds enHolds, const std::function<bool()>& fnWrite) {
    const std::string szAside = UniqueName(szPath, AsideFor::kWriting);
    if (TLIBCFileExist(szPath) == 1 && rename(szPath, szAside.c_str()) != 0) {
        LogError("%s:%d rename(%s, %s) failed ", kCommonFile, __LINE__, szPath, szAside.c_str());
        if (TLIBCFileExist(szAside.c_str()) == 1) {
            RenameLogged(szAside.c_str(), szPath, __LINE__);
        }
        return false;
    }
    const bool blWritten = AtBorder(false, fnWrite);  // whatever happens in it, the old file comes back
    if (!blWritten) {
        LogError("%s:%d save config failed", kCommonFile, __LINE__);
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

}  // namespace tavo::lib
