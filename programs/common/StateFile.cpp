// See StateFile.h.
#include "programs/common/StateFile.h"

#include <utility>

#include "ground/Paths.h"
#include "ground/SysLog.h"

namespace tavo {

const std::string& StateFile::Read() {
    DropLeftovers(DirectoryOf(mSzPath));
    mSzWritten = ReadFile(mSzPath, mNMost).value_or("");
    return mSzWritten;
}

bool StateFile::Save(std::string szText) {
    if (szText == mSzWritten && !mBlFailed) {
        return true;
    }
    const bool blWritten = MakeDirectory(kStateDir) && WriteFileAtomic(mSzPath, szText, kPrivateMode, nullptr, mNMost);
    if (!blWritten && !mBlFailed) {
        SysLog(LOG_ERR, "cannot write %s: %s", mSzPath.c_str(), mSzLoss);
    } else if (blWritten && mBlFailed) {
        SysLog(LOG_NOTICE, "%s can be written again", mSzPath.c_str());
    }
    mBlFailed = !blWritten;
    if (blWritten) {
        mSzWritten = std::move(szText);
    }
    return blWritten;
}

}  // namespace tavo
