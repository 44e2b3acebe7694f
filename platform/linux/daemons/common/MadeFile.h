// The record of what was made at routers, in a file below /var/lib/tavo that only root can read.
// Relies on the platform's text files and the kernel's name of this boot. Promises: what Save() wrote is there after a
// crash; a file that is missing or damaged is an empty record.
#pragma once

#include <string>

#include "mapping/Record.h"

namespace tavo {

class MadeFile {
public:
    explicit MadeFile(const char* szPath);
    Record& Get() { return mRecord; }
    // Writes only what differs from what was written last.
    void Save();

private:
    const char* mSzPath;
    std::string mSzWritten;
    Record mRecord;
};

}  // namespace tavo
