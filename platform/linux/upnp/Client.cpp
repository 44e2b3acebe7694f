// The UPnP client through C types: one gateway, found anew by each initialisation.
// Relies on Igd and on what Known remembers of the gateway.
// Promises: see tavo/upnp.h. A child that was forked meanwhile has a client of its own, uninitialised:
// it never speaks on its parent's connection.
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <optional>
#include <set>

#include "ground/Border.h"
#include "ground/Fail.h"
#include "tavo/upnp.h"
#include "wire/upnp/GatewayMemory.h"

namespace {

using tavo::Fail;

using Clock = std::chrono::steady_clock;

constexpr int kFound = 0;
constexpr int kNotFound = 1;
constexpr int kMostLimitSeconds = 3600;
constexpr int kMostPort = 65535;
// A caller asks for one entry after the other until there is none. A router that never says so must
// not hold it for longer than this.
constexpr auto kTableLimit = std::chrono::seconds(30);

struct Client {
    pid_t nOwner = getpid();
    std::unique_ptr<tavo::Igd> pIgd;
    std::optional<Clock::time_point> walkStart;
    std::set<std::pair<std::string, uint16_t>> setRead;  // since the walk began
    tavo::IgdEntry last;
    bool blLast = false;
};

std::unique_ptr<Client> gPClient;

// The client of this process; null when it has none.
Client* Own() {
    return gPClient != nullptr && gPClient->nOwner == getpid() ? gPClient.get() : nullptr;
}

// The entry at an index, told once: a router that ignores the index has no second entry.
int ReadEntry(Client& client, int nIndex, tavo::IgdEntry& mapping) {
    if (nIndex == 0 || !client.walkStart) {
        client.walkStart = Clock::now();
        client.setRead.clear();
    }
    client.blLast = false;
    if (Clock::now() - *client.walkStart > kTableLimit) {
        return tavo::kWireTimeout;
    }
    const int nCode = client.pIgd->GetAt(nIndex, mapping);
    if (nCode != tavo::kWireOk) {
        return nCode;
    }
    if (!mapping.szProtocol.empty() && !client.setRead.emplace(mapping.szProtocol, mapping.nRouterPort).second) {
        return tavo::kIgdNoSuchIndex;
    }
    client.last = mapping;
    client.blLast = true;
    return tavo::kWireOk;
}

// What was read by its index a moment ago is complete and needs no second question.
int FindEntry(Client& client, const std::string& szProtocol, uint16_t nPort, tavo::IgdEntry& mapping) {
    if (client.blLast && client.last.szProtocol == szProtocol && client.last.nRouterPort == nPort) {
        client.blLast = false;
        mapping = client.last;
        return tavo::kWireOk;
    }
    return client.pIgd->Get(szProtocol, nPort, mapping);
}

template <size_t N>
void Fill(char (&szField)[N], const std::string& szText) {
    std::snprintf(szField, N, "%s", szText.c_str());
}

// The router's answer as the caller gets it: its own code, or -1 when there was none.
int Answer(int nCode, const tavo::IgdEntry& mapping, TAVO_UPNP_PORT_MAPPING* pMapping) {
    if (nCode != tavo::kWireOk) {
        return nCode < 0 ? Fail(TLIBC_ERR_READ) : nCode;
    }
    *pMapping = {};
    pMapping->nExternalPort = mapping.nRouterPort;
    pMapping->nInternalPort = mapping.nBoxPort;
    Fill(pMapping->szProtocol, mapping.szProtocol);
    Fill(pMapping->szInternalClient, mapping.szClient);
    Fill(pMapping->szDescription, mapping.szDescription);
    pMapping->nEnabled = mapping.blEnabled ? 1 : 0;
    pMapping->nLeaseSeconds = mapping.nLease;
    return 0;
}

}  // namespace

int TAVOUpnpInit(int nLimitSeconds, int nLocalPort) {
    TAVOUpnpCleanup();
    return tavo::AtBorder(kNotFound, [&] {
        auto pClient = std::make_unique<Client>();
        pClient->pIgd = tavo::FindGatewayIgd(std::clamp(nLimitSeconds, 0, kMostLimitSeconds) * 1000,
                                             std::clamp(nLocalPort, 0, kMostPort));
        if (pClient->pIgd == nullptr) {
            return Fail(TLIBC_ERR_NOT_FOUND, kNotFound);
        }
        gPClient = std::move(pClient);
        return kFound;
    });
}

int TAVOUpnpCleanup() {
    gPClient.reset();
    return 0;
}

int TAVOUpnpGatewayModelGet(TAVO_UPNP_GATEWAY_MODEL* pModel) {
    const Client* pClient = Own();
    if (pClient == nullptr || pModel == nullptr) {
        return Fail(TLIBC_ERR_BAD_PARAMETER);
    }
    const tavo::IgdModel& model = pClient->pIgd->Service().model;
    *pModel = {};
    Fill(pModel->szBrand, model.szBrand);
    Fill(pModel->szModel, model.szModel);
    Fill(pModel->szVersion, model.szVersion);
    return 0;
}

int TAVOUpnpPortMappingGet(int nIndex, TAVO_UPNP_PORT_MAPPING* pMapping) {
    return tavo::AtBorder(-1, [&] {
        Client* pClient = Own();
        if (pClient == nullptr || pMapping == nullptr || nIndex < 0) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        tavo::IgdEntry mapping;
        const int nCode = ReadEntry(*pClient, nIndex, mapping);
        return Answer(nCode, mapping, pMapping);
    });
}

int TAVOUpnpPortMappingFind(int nExternalPort, const char* szProtocol, TAVO_UPNP_PORT_MAPPING* pMapping) {
    return tavo::AtBorder(-1, [&] {
        Client* pClient = Own();
        const std::string szWanted = szProtocol == nullptr ? "" : szProtocol;
        if (pClient == nullptr || pMapping == nullptr || nExternalPort < 0 || nExternalPort > kMostPort ||
            (szWanted != "TCP" && szWanted != "UDP")) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        tavo::IgdEntry mapping;
        const int nCode = FindEntry(*pClient, szWanted, static_cast<uint16_t>(nExternalPort), mapping);
        return Answer(nCode, mapping, pMapping);
    });
}
