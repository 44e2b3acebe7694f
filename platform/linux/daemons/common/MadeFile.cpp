// See MadeFile.h.
#include "daemons/common/MadeFile.h"

#include <sys/stat.h>

#include "core/SysLog.h"
#include "core/TextFile.h"
#include "daemons/common/BootClock.h"

namespace tavo {

namespace {

constexpr char kStateDir[] = "/var/lib/tavo";

}  // namespace

MadeFile::MadeFile(const char* szPath)
    : mSzPath(szPath), mSzWritten(ReadFile(szPath, kMostRecordText).value_or("")), mRecord(mSzWritten, BootId()) {}

void MadeFile::Save() {
    std::string szText = mRecord.Text();
    if (szText == mSzWritten) {
        return;
    }
    mkdir(kStateDir, 0755);
    if (!WriteFileAtomic(mSzPath, szText, kPrivateMode, nullptr, kMostRecordText)) {
        SysLog(LOG_ERR, "cannot write %s: mappings may outlive a crash", mSzPath);
        return;
    }
    mSzWritten = std::move(szText);
}

}  // namespace tavo
