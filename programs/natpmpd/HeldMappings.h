// The mappings that we may have at gateways, in memory and on disk: the protocol cannot list them.
// Relies on a sectioned file below /var/lib/tavo. Promises: what Save() wrote is there after a crash; a
// file that is missing or damaged is "nothing held".
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <tuple>

#include "programs/common/StateFile.h"

namespace tavo {

// A gateway knows a mapping by the box's address, the protocol and the box's port; so do we.
struct HeldKey {
    std::string szGateway;
    std::string szBox;
    std::string szProtocol;  // "TCP" or "UDP"
    uint16_t nBoxPort = 0;

    bool operator<(const HeldKey& other) const {
        return std::tie(szGateway, szBox, szProtocol, nBoxPort) <
               std::tie(other.szGateway, other.szBox, other.szProtocol, other.nBoxPort);
    }
};

struct Held {
    uint16_t nRouterPort = 0;
    uint32_t nLifetime = 0;  // seconds granted; 0: asked for, but whether it is there is not known
    int64_t nExpiry = 0;     // seconds of boot time
    uint32_t nLease = 0;     // seconds asked for or granted: it ends so long after the next boot at the latest
};

class HeldMappings {
public:
    HeldMappings() { Load(); }
    // Drops what has run out.
    void Prune();
    // Writes only what differs from what was written last.
    void Save();

    std::map<HeldKey, Held> mRows;

private:
    void Load();
    StateFile mFile{"/var/lib/tavo/natpmp_held.conf", "mappings may outlive a crash until they run out",
                    kMostMappingsText};
};

}  // namespace tavo
