// What a user has been told, kept over restarts of a daemon and of the box. Relies on a sectioned file below
// /var/lib/tavo. Promises: a file that is missing or damaged is "nothing told yet"; nothing is written that has not
// changed.
#pragma once

#include <string>

#include "daemons/common/Notices.h"

namespace tavo {

std::string FormatTold(const Told& told);
Told ParseTold(const std::string& szText);

class ToldFile {
public:
    // szDaemon: "upnpd", "natpmpd".
    explicit ToldFile(const std::string& szDaemon) : mSzPath("/var/lib/tavo/" + szDaemon + ".told") { Load(); }
    void Save();

    Told mTold;

private:
    void Load();

    std::string mSzPath;
    std::string mSzWritten;
};

}  // namespace tavo
