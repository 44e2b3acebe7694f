// The record of what was made at routers, in a file that only root can read. Relies on StateFile and the kernel's name
// of this boot, and on the system log.
#pragma once

#include <functional>
#include <string>
#include <utility>

#include "ground/BootId.h"
#include "ground/SysLog.h"
#include "mapping/Pass.h"
#include "mapping/Record.h"
#include "programs/common/StateFile.h"

namespace tavo {

inline constexpr char kUpnpMadeFile[] = "/var/lib/tavo/upnp_made.conf";
inline constexpr char kPagesMadeFile[] = "/var/lib/tavo/pages_made.conf";
inline constexpr char kEarlierPagesFile[] = "/var/lib/tavo/manual_router.made";  // of an earlier version

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

// What the core needs to know of this box; what it does is logged. made outlives it.
inline Surroundings Around(std::string szBox, std::function<bool()> fnStop, MadeFile& made) {
    return {std::move(szBox), BootSeconds, std::move(fnStop), [&made] { return made.Save(); },
            [](const RouterMapping& mapping, const Step& step) {
                const bool blOpened = step.enAction == Action::kAdd;
                SysLog(LOG_INFO, "%s %s %s:%u: %s", MappingName(mapping).c_str(),
                       blOpened ? "is to lead to" : "no longer leads to", mapping.szClient.c_str(),
                       static_cast<unsigned>(mapping.nBoxPort), step.szWhy);
            }};
}

}  // namespace tavo
