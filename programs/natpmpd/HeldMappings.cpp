// Keeps the rows of HeldMappings in a file. Relies on StateFile.
// Promises: see HeldMappings.h.
#include "programs/natpmpd/HeldMappings.h"

#include <cstdlib>
#include <vector>

#include "ground/BootClock.h"
#include "ground/BootId.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

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
    bool blThisBoot = false;
    for (const Section& section : ParseSections(mFile.Read()).value_or(std::vector<Section>())) {
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
    mFile.Save(FormatSections(rgSections));
}

}  // namespace tavo
