// Keeps the rows of HeldMappings in a file. Relies on the platform's text files.
// Promises: see HeldMappings.h.
#include "daemons/natpmpd/HeldMappings.h"

#include <sys/stat.h>

#include <cstdlib>
#include <vector>

#include "core/SysLog.h"
#include "core/TextFile.h"
#include "daemons/common/BootClock.h"
#include "daemons/common/MadeFile.h"
#include "mapping/Pass.h"

namespace tavo {

namespace {

constexpr char kStateDir[] = "/var/lib/tavo";
constexpr char kStateFile[] = "/var/lib/tavo/natpmp_held.conf";
constexpr char kBootSection[] = "boot";
constexpr long kMaxPort = 65535;

std::string SectionName(const HeldKey& key) {
    return key.szGateway + " " + key.szBox + " " + key.szProtocol + " " + std::to_string(key.nBoxPort);
}

long Number(const std::string& szText) {
    return std::strtol(szText.c_str(), nullptr, 10);
}

}  // namespace

void HeldMappings::Load() {
    mSzWritten = ReadFile(kStateFile, kMostRecordText).value_or("");
    bool blThisBoot = false;
    for (const Section& section : ParseSections(mSzWritten).value_or(std::vector<Section>())) {
        std::map<std::string, std::string> mapValues;
        for (const Pair& pair : section.rgPairs) {
            mapValues[pair.szKey] = pair.szValue;
        }
        blThisBoot = blThisBoot || (section.szName == kBootSection && mapValues["id"] == BootId());
        const std::string& szProtocol = mapValues["protocol"];
        const long nBoxPort = Number(mapValues["box_port"]);
        const long nRouterPort = Number(mapValues["router_port"]);
        if ((szProtocol == "TCP" || szProtocol == "UDP") && nBoxPort >= 1 && nBoxPort <= kMaxPort && nRouterPort >= 1 &&
            nRouterPort <= kMaxPort) {
            mRows[HeldKey{mapValues["gateway"], mapValues["box"], szProtocol, static_cast<uint16_t>(nBoxPort)}] =
                Held{static_cast<uint16_t>(nRouterPort), 0,
                     blThisBoot ? Number(mapValues["expiry"]) : BootSeconds() + Number(mapValues["lease"]),
                     static_cast<uint32_t>(Number(mapValues["lease"]))};
        }
    }
}

void HeldMappings::Prune() {
    const int64_t now = BootSeconds();
    std::erase_if(mRows, [now](const auto& row) { return row.second.nExpiry < now; });
}

void HeldMappings::Save() {
    std::vector<Section> rgSections;
    if (!mRows.empty()) {
        rgSections.push_back({kBootSection, {{"id", BootId()}}});
    }
    for (const auto& [key, held] : mRows) {
        rgSections.push_back({SectionName(key),
                              {{"gateway", key.szGateway},
                               {"box", key.szBox},
                               {"protocol", key.szProtocol},
                               {"box_port", std::to_string(key.nBoxPort)},
                               {"router_port", std::to_string(held.nRouterPort)},
                               {"expiry", std::to_string(held.nExpiry)},
                               {"lease", std::to_string(held.nLease)}}});
    }
    std::string szText = FormatSections(rgSections);
    if (szText == mSzWritten) {
        return;
    }
    mkdir(kStateDir, 0755);
    if (!WriteFileAtomic(kStateFile, szText, kPrivateMode, nullptr, kMostRecordText)) {
        SysLog(LOG_ERR, "cannot write %s: mappings may outlive a crash until they run out", kStateFile);
        return;
    }
    mSzWritten = std::move(szText);
}

}  // namespace tavo
