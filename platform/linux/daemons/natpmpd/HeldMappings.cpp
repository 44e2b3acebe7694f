// Keeps the rows of HeldMappings in a file. Relies on the platform's text files.
// Promises: see HeldMappings.h.
#include "daemons/natpmpd/HeldMappings.h"

#include <sys/stat.h>
#include <syslog.h>

#include <cstdlib>
#include <vector>

#include "core/TextFile.h"

namespace tavo {

namespace {

constexpr char kStateDir[] = "/var/lib/tavo";
constexpr char kStateFile[] = "/var/lib/tavo/natpmp_held.conf";
constexpr long kMaxPort = 65535;

std::string SectionName(const HeldKey& key) {
    return key.szGateway + " " + key.szBox + " " + key.szProtocol + " " + std::to_string(key.nBoxPort);
}

long Number(const std::string& szText) {
    return std::strtol(szText.c_str(), nullptr, 10);
}

}  // namespace

void HeldMappings::Load() {
    mSzWritten = ReadFile(kStateFile).value_or("");
    for (const Section& section : ParseSections(mSzWritten).value_or(std::vector<Section>())) {
        std::map<std::string, std::string> mapValues;
        for (const Pair& pair : section.rgPairs) {
            mapValues[pair.szKey] = pair.szValue;
        }
        const std::string& szProtocol = mapValues["protocol"];
        const long nBoxPort = Number(mapValues["box_port"]);
        const long nRouterPort = Number(mapValues["router_port"]);
        if ((szProtocol == "TCP" || szProtocol == "UDP") && nBoxPort >= 1 && nBoxPort <= kMaxPort && nRouterPort >= 1 &&
            nRouterPort <= kMaxPort) {
            mRows[HeldKey{mapValues["gateway"], mapValues["box"], szProtocol, static_cast<uint16_t>(nBoxPort)}] =
                Held{static_cast<uint16_t>(nRouterPort), 0, Number(mapValues["expiry"])};
        }
    }
}

void HeldMappings::Prune() {
    const time_t now = std::time(nullptr);
    std::erase_if(mRows, [now](const auto& row) { return row.second.nExpiry < now; });
}

void HeldMappings::Save() {
    std::vector<Section> rgSections;
    for (const auto& [key, held] : mRows) {
        rgSections.push_back({SectionName(key),
                              {{"gateway", key.szGateway},
                               {"box", key.szBox},
                               {"protocol", key.szProtocol},
                               {"box_port", std::to_string(key.nBoxPort)},
                               {"router_port", std::to_string(held.nRouterPort)},
                               {"expiry", std::to_string(held.nExpiry)}}});
    }
    std::string szText = FormatSections(rgSections);
    if (szText == mSzWritten) {
        return;
    }
    mkdir(kStateDir, 0755);
    if (!WriteFileAtomic(kStateFile, szText)) {
        syslog(LOG_ERR, "cannot write %s: mappings may outlive a crash until they run out", kStateFile);
        return;
    }
    mSzWritten = std::move(szText);
}

}  // namespace tavo
