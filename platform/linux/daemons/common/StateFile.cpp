// See StateFile.h.
#include "daemons/common/StateFile.h"

#include <sys/stat.h>

#include <utility>

#include "core/SysLog.h"

namespace tavo {

namespace {

constexpr char kStateDir[] = "/var/lib/tavo";

}  // namespace

const std::string& StateFile::Read() {
    mSzWritten = ReadFile(mSzPath, mNMost).value_or("");
    return mSzWritten;
}

void StateFile::Save(std::string szText) {
    if (szText == mSzWritten) {
        return;
    }
    mkdir(kStateDir, 0755);
    if (!WriteFileAtomic(mSzPath, szText, kPrivateMode, nullptr, mNMost)) {
        SysLog(LOG_ERR, "cannot write %s: %s", mSzPath.c_str(), mSzLoss);
        return;
    }
    mSzWritten = std::move(szText);
}

}  // namespace tavo
