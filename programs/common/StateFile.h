// A text below /var/lib/tavo that a daemon keeps for its next start. Relies on the platform's text files.
// Promises: what Save() wrote is there after a crash or a power cut; nothing is written that has not changed; a failure
// is logged when it begins, and again only after a success; a file that is missing or unreadable is an empty text.
#pragma once

#include <string>

#include "ground/TextFile.h"

namespace tavo {

class StateFile {
public:
    // szLoss: what it means that the file cannot be written, for the log. nMost: bytes that are read and written.
    StateFile(std::string szPath, const char* szLoss, size_t nMost = TLIBC_MAX_FILE)
        : mSzPath(std::move(szPath)), mSzLoss(szLoss), mNMost(nMost) {}
    const std::string& Read();
    // Whether the text is on the disk.
    bool Save(std::string szText);

private:
    std::string mSzPath;
    const char* mSzLoss;
    size_t mNMost;
    std::string mSzWritten;
    bool mBlFailed = false;  // nobody knows what the file holds
};

// Some 300 bytes for each port of both protocols, and room for long texts.
inline constexpr size_t kMostMappingsText = 128U << 20U;

}  // namespace tavo
