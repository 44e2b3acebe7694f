// Walks the router's table. Relies on the seam's UPnP client. Promises: see LiveTable.h.
#include "LiveTable.h"

#include <CLI/StringTools.hpp>
#include <algorithm>
#include <array>

#include "Box.h"
#include "tavo/upnp.h"

namespace tavo::cli {

namespace {

constexpr int kSearchSeconds = 6;
constexpr int kSearchPort = 55001;
constexpr int kMostEntries = 2 * 65536;
constexpr std::array<int, 3> kEndOfTable = {713, 714, 402};  // by the book, and what some routers say instead

LiveEntry EntryOf(const TAVO_UPNP_PORT_MAPPING& mapping) {
    return {mapping.nExternalPort,    CLI::detail::to_lower(mapping.szProtocol),
            mapping.szInternalClient, mapping.nInternalPort,
            mapping.szDescription,    mapping.nEnabled != 0,
            mapping.nLeaseSeconds};
}

}  // namespace

Json::Value ToJson(const LiveEntry& entry) {
    Json::Value js;
    js["router_port"] = entry.nRouterPort;
    js["protocol"] = entry.szProtocol;
    js["client"] = entry.szClient;
    js["client_port"] = entry.nClientPort;
    js["description"] = entry.szDescription;
    js["enabled"] = entry.blEnabled;
    js["lease"] = entry.nLeaseSeconds == 0 ? Json::Value() : Json::Value(entry.nLeaseSeconds);
    return js;
}

std::optional<LiveEntry> LiveTable::Find(int nRouterPort, const std::string& szProtocol) const {
    const auto pEntry = std::find_if(rgEntries.begin(), rgEntries.end(), [&](const LiveEntry& entry) {
        return entry.nRouterPort == nRouterPort && entry.szProtocol == szProtocol;
    });
    if (pEntry != rgEntries.end() || blWhole) {
        return pEntry != rgEntries.end() ? std::optional(*pEntry) : std::nullopt;
    }
    TAVO_UPNP_PORT_MAPPING mapping = {};
    const char* szUpper = szProtocol == "udp" ? "UDP" : "TCP";
    return TAVOUpnpPortMappingFind(nRouterPort, szUpper, &mapping) == 0 ? std::optional(EntryOf(mapping))
                                                                        : std::nullopt;
}

std::optional<LiveTable> ReadLiveTable() {
    if (TAVOUpnpInit(kSearchSeconds, kSearchPort) != 0) {
        return std::nullopt;
    }
    LiveTable table;
    TAVO_UPNP_GATEWAY_MODEL model = {};
    if (TAVOUpnpGatewayModelGet(&model) == 0) {
        table.szModel = RouterName(model.szBrand, model.szModel, model.szVersion);
    }
    int nAnswer = 0;
    for (int i = 0; i < kMostEntries; ++i) {
        TAVO_UPNP_PORT_MAPPING mapping = {};
        nAnswer = TAVOUpnpPortMappingGet(i, &mapping);
        if (nAnswer != 0) {
            break;
        }
        table.rgEntries.push_back(EntryOf(mapping));
    }
    table.blWhole = std::find(kEndOfTable.begin(), kEndOfTable.end(), nAnswer) != kEndOfTable.end();
    return table;
}

}  // namespace tavo::cli
