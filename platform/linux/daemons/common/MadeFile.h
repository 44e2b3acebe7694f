// The record of what was made at routers, in a file below /var/lib/tavo that only root can read.
// Relies on the platform's text files and the kernel's name of this boot. Promises: what Save() wrote is there after a
// crash, however many mappings it is about; a file that is missing is an empty record.
#pragma once

#include <cstddef>
#include <string>

#include "mapping/Record.h"

namespace tavo {

// Some 300 bytes for each port of both protocols, and room for long texts.
inline constexpr size_t kMostRecordText = 128U << 20U;

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
