// Compares the rules in force with those to be, and with the router's table. Relies on the seam's UPnP client.
// Promises: see DryRun.h.
#include "DryRun.h"

#include <fmt/format.h>

#include <map>

#include "Box.h"
#include "LiveTable.h"
#include "PortPairs.h"
#include "Published.h"
#include "SaveRules.h"
#include "StoredRouter.h"
#include "Table.h"
#include "tavo/net.h"

namespace tavo::cli {

namespace {

constexpr size_t kAddressSize = 64;

// The router's table and this box's address in it; nothing where it cannot be read.
struct RouterTable {
    LiveTable live;
    std::string szBox;
};

std::optional<RouterTable> ReadTable(const StoredRouter& router, const std::string& szGateway) {
    char szBox[kAddressSize] = {};
    if (router.enWay != Way::kUpnp ||
        TAVONetLocalAddressGet(szGateway.c_str(), szBox, sizeof(szBox), nullptr, 0) != 0) {
        return std::nullopt;
    }
    auto live = ReadLiveTable();
    return live ? std::optional(RouterTable{std::move(*live), szBox}) : std::nullopt;
}

struct Fate {
    std::string szAction;  // "open", "close", "keep", "change", "refuse"
    std::string szWhat;    // to the box's port
    std::string szWhy;     // of a refusal

    bool operator==(const Fate&) const = default;
};

using Key = std::pair<std::string, int>;  // protocol and router port

// Each port with the box port that it leads to; of two rules that want one port the first has it.
struct Wanted {
    std::map<Key, int> mapPorts;
    std::vector<std::map<Key, Fate>> rgDoubles;  // what a later rule does not get, a rule each
};

std::string ToBox(int nRouter, int nBox) {
    return nRouter == nBox ? "" : fmt::format("to port {} of this box", nBox);
}

Wanted WantedBy(const Rules& rules) {
    Wanted wanted;
    std::map<Key, std::string> mapOwners;
    for (const Rule& rule : rules) {
        const auto rgPairs = rule.blEnabled ? PairsOf(rule) : std::nullopt;
        std::map<Key, Fate> mapDoubles;
        for (const PortPair& pair : rgPairs.value_or(std::vector<PortPair>())) {
            const Key key(pair.szProtocol, pair.nRouter);
            const auto [it, blNew] = wanted.mapPorts.try_emplace(key, pair.nBox);
            if (blNew) {
                mapOwners[key] = Clean(rule.szId);
            } else if (it->second != pair.nBox) {
                mapDoubles[key] = {"refuse", ToBox(pair.nRouter, pair.nBox),
                                   fmt::format("rule {} wants it too, for another port of this box; rule {} comes "
                                               "first",
                                               Clean(rule.szId), mapOwners[key])};
            }
        }
        wanted.rgDoubles.push_back(std::move(mapDoubles));
    }
    return wanted;
}

// Another device that the router's table gives this port to.
std::string Holder(const std::optional<RouterTable>& table, const Key& key) {
    const auto entry = table ? table->live.Find(key.second, key.first) : std::nullopt;
    return !entry || !entry->blEnabled || entry->szClient == table->szBox
               ? ""
               : "another device has it on the router" + WhoHas(PublishedHolder{entry->szClient, entry->szDescription});
}

Fate FateOf(const Key& key, const Wanted& before, const Wanted& after, const std::optional<RouterTable>& table) {
    const auto itBefore = before.mapPorts.find(key);
    const auto itAfter = after.mapPorts.find(key);
    if (itAfter == after.mapPorts.end()) {
        return {"close", "", ""};
    }
    const std::string szTo = ToBox(key.second, itAfter->second);
    if (const std::string szHolder = Holder(table, key); !szHolder.empty()) {
        return {"refuse", szTo, szHolder};
    }
    return {itBefore == before.mapPorts.end()     ? "open"
            : itBefore->second == itAfter->second ? "keep"
                                                  : "change",
            szTo, ""};
}

void AddLine(const std::string& szProtocol, int nFirst, int nLast, const Fate& fate, Table& text, Reply& reply) {
    const std::string szPorts = nFirst == nLast ? std::to_string(nFirst) : fmt::format("{}-{}", nFirst, nLast);
    const std::string szMore = fate.szWhat + (fate.szWhat.empty() || fate.szWhy.empty() ? "" : ": ") + fate.szWhy;
    text.Add({fate.szAction, szPorts + "/" + szProtocol, szMore});
    Json::Value js;
    js["action"] = fate.szAction;
    js["router_ports"] = szPorts;
    js["protocol"] = szProtocol;
    js["why"] = fate.szWhy.empty() ? Json::Value() : Json::Value(fate.szWhy);
    reply.jsAnswer["ports"].append(js);
}

// Neighbours with the same fate share a line; those that lead to other ports than their own are told one by one.
// Whether any stays out.
bool AddLines(const std::map<Key, Fate>& mapFates, Table& text, Reply& reply) {
    bool blRefused = false;
    for (auto it = mapFates.begin(); it != mapFates.end();) {
        const auto& [szProtocol, nFirst] = it->first;
        const Fate& fate = it->second;
        int nLast = nFirst;
        for (++it; it != mapFates.end() && it->first == Key(szProtocol, nLast + 1) && it->second == fate; ++it) {
            ++nLast;
        }
        AddLine(szProtocol, nFirst, nLast, fate, text, reply);
        blRefused = blRefused || fate.szAction == "refuse";
    }
    return blRefused;
}

bool AddPorts(const Wanted& before, const Wanted& after, const std::optional<RouterTable>& table, Reply& reply) {
    std::map<Key, Fate> mapFates;
    for (const auto* pWanted : {&before, &after}) {
        for (const auto& [key, nBox] : pWanted->mapPorts) {
            mapFates.try_emplace(key, FateOf(key, before, after, table));
        }
    }
    Table text({"would", "port", ""});
    bool blRefused = AddLines(mapFates, text, reply);
    for (const auto& mapDoubles : after.rgDoubles) {
        blRefused = AddLines(mapDoubles, text, reply) || blRefused;
    }
    reply.szBody += text.ToText();
    return blRefused;
}

}  // namespace

Reply DryRunOf(const Rules& inForce, const Rules& rules) {
    const auto szGateway = Gateway();
    if (!szGateway) {
        return NoGateway();
    }
    const StoredRouter router = ReadStoredRouter();
    if (const auto refused = WouldBeRefused(router, *szGateway, rules)) {
        return *refused;
    }
    Reply reply;
    reply.jsAnswer["ports"] = Json::arrayValue;
    const auto table = ReadTable(router, *szGateway);
    const bool blRefused = AddPorts(WantedBy(inForce), WantedBy(rules), table, reply);
    reply.jsAnswer["table_read"] = table.has_value();
    if (!table) {
        reply.rgszWarnings.emplace_back(
            router.enWay == Way::kUpnp
                ? "the router did not show its table, so whether another device has a port is not known"
                : "a router that is not driven by UPnP does not show who has a port before it is asked for it");
    }
    for (const Rule& rule : rules) {
        if (rule.blEnabled && !PairsOf(rule)) {
            reply.rgszWarnings.push_back(
                fmt::format("the ports of rule {} cannot be read or paired; it would be refused", Clean(rule.szId)));
        }
    }
    reply.enExit = blRefused ? kRefused : kOk;
    reply.szMessage = blRefused ? "some ports would stay out; nothing was changed"
                                : "this is what 'sudo tavoportmap save' would do; nothing was changed";
    return reply;
}

}  // namespace tavo::cli
