// What a user has been told, kept over restarts of a daemon and of the box. Relies on a sectioned file below
// /var/lib/tavo. Promises: what is missing or damaged is "not told yet"; nothing is written that has not changed.
#pragma once

#include <string>

#include "programs/common/Notices.h"
#include "programs/common/StateFile.h"

namespace tavo {

std::string FormatTold(const Told& told);
Told ParseTold(const std::string& szText);

class ToldFile {
public:
    // szDaemon: "upnpd", "natpmpd".
    explicit ToldFile(const std::string& szDaemon)
        : mFile("/var/lib/tavo/" + szDaemon + ".told", "what was told may be told again"),
          mTold(ParseTold(mFile.Read())) {}
    Told& Get() { return mTold; }
    void Save() { mFile.Save(FormatTold(mTold)); }

private:
    StateFile mFile;
    Told mTold;
};

}  // namespace tavo
