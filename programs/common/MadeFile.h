// The record of what was made at routers, in a file that only root can read. Relies on StateFile and the kernel's name
// of this boot.
#pragma once

#include "ground/BootId.h"
#include "mapping/Record.h"
#include "programs/common/StateFile.h"

namespace tavo {

class MadeFile {
public:
    explicit MadeFile(const char* szPath)
        : mFile(szPath, "mappings may outlive a crash", kMostMappingsText), mRecord(mFile.Read(), BootId()) {}
    Record& Get() { return mRecord; }
    bool Save() { return mFile.Save(mRecord.Text()); }

private:
    StateFile mFile;
    Record mRecord;
};

}  // namespace tavo
