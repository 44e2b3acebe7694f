// The table of the router as it is now. Relies on the seam's UPnP client. Promises: changes nothing on the router; ends
// within a minute, whatever it does; texts are as the router has them, to be cleaned before they are shown.
#pragma once

#include <json/json.h>

#include <optional>
#include <string>
#include <vector>

namespace tavo::cli {

struct LiveEntry {
    int nRouterPort = 0;
    std::string szProtocol;  // "tcp" or "udp"
    std::string szClient;    // the device that it leads to
    int nClientPort = 0;
    std::string szDescription;
    bool blEnabled = true;
    unsigned nLeaseSeconds = 0;  // 0: for good

    std::string Name() const { return std::to_string(nRouterPort) + "/" + szProtocol; }
};
Json::Value ToJson(const LiveEntry& entry);

struct LiveTable {
    std::string szModel = {};  // what the router says it is, cleaned
    std::vector<LiveEntry> rgEntries = {};
    bool blWhole = true;  // false: the router does not show it, or stopped on the way

    // The entry for a port; asks the router for it where the table is not whole.
    std::optional<LiveEntry> Find(int nRouterPort, const std::string& szProtocol) const;
};

// Nothing when no router answers by UPnP.
std::optional<LiveTable> ReadLiveTable();

}  // namespace tavo::cli
