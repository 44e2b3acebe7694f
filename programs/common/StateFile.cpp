// See StateFile.h.
#include "programs/common/StateFile.h"

#include <sys/stat.h>

#include <utility>

#include "ground/Paths.h"
#include "ground/SysLog.h"

namespace tavo {

namespace {}  // namespace

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
