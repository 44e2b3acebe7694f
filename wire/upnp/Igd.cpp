// The calls of the gateway's port-mapping service. Relies on Search, Description and Soap. Promises: see Igd.h.
#include "wire/upnp/Igd.h"

#include <arpa/inet.h>

#include <algorithm>
#include <chrono>
#include <iterator>
#include <map>

#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "ground/net/Level.h"
#include "wire/upnp/Search.h"
#include "wire/upnp/Soap.h"

namespace tavo {

namespace {

constexpr int kMaxEntries = 65536;
constexpr auto kListLimit = std::chrono::seconds(8);  // then who asks goes on by name

constexpr int kRanksOfAddress = 3;
constexpr int kBestRank = 3 * kRanksOfAddress;  // of one that is known

bool IsAddress(const std::string& szText) {
    in_addr address = {};
    return inet_pton(AF_INET, szText.c_str(), &address) == 1;
}

// The address of a host as a router writes it, some with zeros before each number; empty where it is none: a name may
// be anybody's.
std::string AddressIn(const std::string& szText) {
    std::string szAddress;
    for (const char c : szText) {
        const bool blZero = szAddress.ends_with("0") && (szAddress.size() == 1 || szAddress.ends_with(".0"));
        if (blZero && c != '.') {
            szAddress.pop_back();
        }
        szAddress += c;
    }
    return IsAddress(szAddress) ? szAddress : "";
}

// What an entry's answer says beyond its key.
bool ReadEntry(const XmlElement& root, IgdEntry& mapping) {
    const auto nBoxPort = ParseNumber<uint16_t>(root.Find("NewInternalPort").Text());
    mapping.szClient = AddressIn(root.Find("NewInternalClient").Text());
    if (!nBoxPort || mapping.szClient.empty()) {
        return false;
    }
    mapping.nBoxPort = *nBoxPort;
    mapping.szDescription = root.Find("NewPortMappingDescription").Text();
    mapping.nLease = ParseNumber<uint32_t>(root.Find("NewLeaseDuration").Text()).value_or(0);
    const std::string szEnabled = root.Find("NewEnabled").Text();
    mapping.blEnabled = szEnabled != "0" && !IsSameWord(szEnabled, "false") && !IsSameWord(szEnabled, "no");
    return true;
}

bool ReadKey(const XmlElement& root, IgdEntry& mapping) {
    const auto nRouterPort = ParseNumber<uint16_t>(root.Find("NewExternalPort").Text());
    const std::string szProtocol = root.Find("NewProtocol").Text();
    mapping.szProtocol = IsSameWord(szProtocol, "TCP") ? "TCP" : IsSameWord(szProtocol, "UDP") ? "UDP" : "";
    if (!nRouterPort || mapping.szProtocol.empty()) {
        return false;
    }
    mapping.nRouterPort = *nRouterPort;
    return true;
}

// The entries of a listing, which is a document inside the answer. Those that make no sense are left out.
std::vector<IgdEntry> ReadListing(const SoapAnswer& answer) {
    const XmlDocument listing(answer.Root().Find("NewPortListing").Raw());
    std::vector<IgdEntry> rgMappings;
    for (XmlElement entry = listing.Root().Child(); entry; entry = entry.Next()) {
        IgdEntry mapping;
        if (ReadKey(entry, mapping) && ReadEntry(entry, mapping)) {
            rgMappings.push_back(std::move(mapping));
        }
    }
    return rgMappings;
}

// What names an entry.
std::vector<SoapArgument> Key(const std::string& szProtocol, uint16_t nRouterPort) {
    return {{"NewRemoteHost", ""}, {"NewExternalPort", std::to_string(nRouterPort)}, {"NewProtocol", szProtocol}};
}

}  // namespace

std::unique_ptr<Igd> Igd::At(const HttpUrl& location, std::shared_ptr<HttpTransport> pHttp, std::string& szWhy,
                             const std::string& szKnown) {
    const HttpAnswer answer = pHttp->Get(location);
    if (answer.enEnd != HttpEnd::kAnswered || answer.nCode != 200) {
        szWhy = answer.enEnd == HttpEnd::kAnswered  ? "HTTP status " + std::to_string(answer.nCode)
                : answer.enEnd == HttpEnd::kTimeout ? "no answer in time"
                                                    : "no answer that makes sense";
        return nullptr;
    }
    const std::vector<IgdService> rgServices = ParseDescription(answer.szBody, location, szWhy);
    std::unique_ptr<Igd> pBest;
    int nBest = -1;
    for (size_t i = 0; i < rgServices.size() && nBest < kBestRank; ++i) {
        std::unique_ptr<Igd> pIgd(new Igd(rgServices[i], pHttp));
        std::copy_if(rgServices.begin(), rgServices.end(), std::back_inserter(pIgd->mRgBeside),
                     [&](const IgdService& service) { return &service != &rgServices[i]; });
        const int nRank = pIgd->IsOneOfSeveral() ? pIgd->Rank(szKnown) : kBestRank;
        if (nRank > nBest || (nRank == nBest && pIgd->Service().Name() == szKnown)) {
            nBest = nRank;
            pBest = std::move(pIgd);
        }
    }
    return pBest;
}

std::unique_ptr<Igd> Igd::Beside(const std::string& szLine) const {
    const auto it = std::find_if(mRgBeside.begin(), mRgBeside.end(),
                                 [&](const IgdService& service) { return service.Name() == szLine; });
    return it == mRgBeside.end() ? nullptr : std::unique_ptr<Igd>(new Igd(*it, mPHttp));
}

std::unique_ptr<Igd> Igd::Find(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds,
                               IgdPlace* pPlace, int nLocalPort, const std::function<bool()>& fnStop,
                               Descriptor* pFdLate) {
    std::unique_ptr<Igd> pFound;
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(nLimitMilliseconds);
    const auto fnLeft = [&] {
        return static_cast<int>(
            std::chrono::duration_cast<std::chrono::milliseconds>(end - std::chrono::steady_clock::now()).count());
    };
    const auto fnTry = [&](const HttpUrl& location, int nLimit) {
        const auto pHttp = std::make_shared<HttpClient>();
        pHttp->SetStop(fnStop);
        pHttp->SetLimit(nLimit);
        std::string szWhy;
        pFound = At(location, pHttp, szWhy, pPlace == nullptr ? "" : pPlace->szLine);
        pHttp->SetLimit(kRequestMilliseconds);
        if (pFound == nullptr) {
            SysLog(LOG_WARNING, "router's description at %s is of no use: %s", location.Text().c_str(), szWhy.c_str());
        } else if (pPlace != nullptr) {
            *pPlace = {location.Text(), pFound->IsOneOfSeveral() ? pFound->Service().Name() : ""};
        }
        return pFound != nullptr;
    };
    if (pPlace != nullptr && !pPlace->szLocation.empty()) {
        const auto known = ParseHttpUrl(pPlace->szLocation);
        if (known && known->szHost == szGateway && fnTry(*known, nLimitMilliseconds / 2)) {
            return pFound;
        }
    }
    SearchGateway(
        szGateway, szLocal, fnLeft(), nLocalPort,
        [&](const HttpUrl& location) { return fnTry(location, fnLeft() / 2); }, fnStop, pFdLate);
    return pFound;
}

SoapAnswer Igd::Call(const char* szAction, const std::vector<SoapArgument>& rgArguments) {
    return CallService(*mPHttp, mService.control, mService.szType, szAction, rgArguments);
}

int Igd::GetAt(int nIndex, IgdEntry& mapping) {
    const SoapAnswer answer = Call("GetGenericPortMappingEntry", {{"NewPortMappingIndex", std::to_string(nIndex)}});
    if (!answer.IsOk()) {
        return answer.Code();
    }
    IgdEntry read;
    if (!ReadKey(answer.Root(), read) || !ReadEntry(answer.Root(), read)) {
        read = {};
    }
    mapping = std::move(read);
    return kWireOk;
}

std::optional<bool> Igd::IsConnected() {
    const SoapAnswer answer = Call("GetStatusInfo", {});
    const std::string szStatus = answer.Text("NewConnectionStatus");
    return answer.IsOk() && !szStatus.empty() ? std::optional(szStatus == "Connected") : std::nullopt;
}

// The line first, then the address. The one that is known stays for as long as its line is up: a change of it closes
// what is open.
int Igd::Rank(const std::string& szKnown) {
    const std::optional<bool> blConnected = IsConnected();
    if (blConnected == true && mService.Name() == szKnown) {
        return kBestRank;
    }
    std::string szAddress;
    in_addr address = {};
    const bool blAddress =
        ExternalAddress(szAddress) == kWireOk && inet_pton(AF_INET, szAddress.c_str(), &address) == 1;
    const AddressKind enKind = blAddress ? KindOf(address) : AddressKind::kNone;
    const int nAddress = enKind == AddressKind::kPublic ? 2 : enKind == AddressKind::kNone ? 0 : 1;
    return (!blConnected ? 1 : *blConnected ? 2 : 0) * kRanksOfAddress + nAddress;
}

int Igd::ExternalAddress(std::string& szAddress) {
    const SoapAnswer answer = Call("GetExternalIPAddress", {});
    if (!answer.IsOk()) {
        return answer.Code();
    }
    std::string szRead = answer.Text("NewExternalIPAddress");
    if (!IsAddress(szRead)) {
        return kWireGarbage;
    }
    szAddress = std::move(szRead);
    return kWireOk;
}

int Igd::List(std::vector<IgdEntry>& rgMappings) {
    const auto end = std::chrono::steady_clock::now() + kListLimit;
    std::vector<IgdEntry> rgRead;
    std::map<std::pair<std::string, uint16_t>, size_t> mapSeen;
    for (int i = 0; i < kMaxEntries; ++i) {
        if (std::chrono::steady_clock::now() > end) {
            rgMappings = std::move(rgRead);
            return kWireTooLong;
        }
        IgdEntry mapping;
        const int nCode = GetAt(i, mapping);
        // The end of the table, which some routers tell by whatever code they have.
        if (nCode == kIgdNoSuchIndex || nCode == kIgdNoSuchEntry || (nCode > kWireOk && i > 0)) {
            break;
        }
        if (nCode != kWireOk) {
            return nCode;
        }
        if (mapping.szProtocol.empty()) {
            continue;
        }
        const auto [it, blNew] = mapSeen.try_emplace({mapping.szProtocol, mapping.nRouterPort}, rgRead.size());
        if (!blNew) {
            // A router that ignores the index would go on for ever, and one whose table has grown meanwhile shows the
            // same once more: either way this is not the whole table. Another entry of the port is for one host
            // outside.
            const IgdEntry& seen = rgRead[it->second];
            if (seen.szClient == mapping.szClient && seen.nBoxPort == mapping.nBoxPort) {
                rgMappings = std::move(rgRead);
                return kWireTooLong;
            }
            continue;
        }
        rgRead.push_back(std::move(mapping));
    }
    rgMappings = std::move(rgRead);
    return kWireOk;
}

int Igd::ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast, std::vector<IgdEntry>& rgMappings) {
    if (mService.szType.ends_with(":1")) {
        return kIgdInvalidAction;
    }
    const SoapAnswer answer = Call("GetListOfPortMappings", {{"NewStartPort", std::to_string(nFirst)},
                                                             {"NewEndPort", std::to_string(nLast)},
                                                             {"NewProtocol", szProtocol},
                                                             {"NewManage", "0"},
                                                             {"NewNumberOfPorts", "0"}});
    if (answer.IsOk()) {
        rgMappings = ReadListing(answer);
    }
    return answer.Code() == kIgdNoneInRange ? int{kWireOk} : answer.Code();
}

int Igd::Get(const std::string& szProtocol, uint16_t nRouterPort, IgdEntry& mapping) {
    const SoapAnswer answer = Call("GetSpecificPortMappingEntry", Key(szProtocol, nRouterPort));
    if (!answer.IsOk()) {
        return answer.Code();
    }
    IgdEntry read;
    read.szProtocol = szProtocol;
    read.nRouterPort = nRouterPort;
    if (!ReadEntry(answer.Root(), read)) {
        return kWireGarbage;
    }
    mapping = std::move(read);
    return kWireOk;
}

int Igd::Add(const IgdEntry& mapping) {
    return Call("AddPortMapping", {{"NewRemoteHost", ""},
                                   {"NewExternalPort", std::to_string(mapping.nRouterPort)},
                                   {"NewProtocol", mapping.szProtocol},
                                   {"NewInternalPort", std::to_string(mapping.nBoxPort)},
                                   {"NewInternalClient", mapping.szClient},
                                   {"NewEnabled", "1"},
                                   {"NewPortMappingDescription", mapping.szDescription},
                                   {"NewLeaseDuration", std::to_string(mapping.nLease)}})
        .Code();
}

int Igd::Remove(const std::string& szProtocol, uint16_t nRouterPort, const std::string& szSource) {
    mPHttp->SetSource(szSource);
    const int nCode = Call("DeletePortMapping", Key(szProtocol, nRouterPort)).Code();
    mPHttp->SetSource("");
    return nCode;
}

}  // namespace tavo
