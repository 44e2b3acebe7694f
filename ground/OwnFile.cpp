// See OwnFile.h.
#include "ground/OwnFile.h"

#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <string>

#include "ground/Descriptor.h"
#include "ground/Rename.h"
#include "ground/SysLog.h"

namespace tavo {

namespace {

constexpr int kTries = 10;  // against somebody who makes and deletes what is looked at

bool IsOwn(const struct stat& status) {
    return S_ISREG(status.st_mode) && status.st_uid == geteuid() && status.st_nlink == 1 &&
           (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

}  // namespace

bool MakeOwnFile(const char* szPath) {
    for (int i = 0; i < kTries; ++i) {
        struct stat status = {};
        const bool blThere = lstat(szPath, &status) == 0;
        if (blThere && IsOwn(status)) {
            return true;
        }
        std::string szAside = std::string(szPath) + ".XXXXXX";
        if (Descriptor(mkostemp(szAside.data(), O_CLOEXEC)).Get() < 0) {
            return false;
        }
        const bool blDone = Rename(szAside.c_str(), szPath, blThere ? RENAME_EXCHANGE : RENAME_NOREPLACE);
        const int nErrno = errno;
        if (blDone && blThere) {
            SysLog(LOG_WARNING, "%s was not ours alone; another file stands there now", szPath);
        }
        if ((!blDone || blThere) && std::remove(szAside.c_str()) != 0 && errno == ENOTEMPTY) {
            SysLog(LOG_WARNING, "what stood in its place is %s now", szAside.c_str());
        }
        if (blDone) {
            return true;
        }
        if (nErrno != ENOENT && nErrno != EEXIST) {
            errno = nErrno;
            return false;
        }
    }
    return false;
}

}  // namespace tavo
