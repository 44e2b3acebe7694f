// SOAP calls to the gateway's port-mapping service. Relies on Http for bounds and on tinyxml2.
// Written here and not taken from a UPnP client library, because those read answers without a bound
// and open a connection for every call. Promises: see Igd.h.
#include "wire/upnp/Igd.h"

#include <arpa/inet.h>
#include <tinyxml2.h>

#include <charconv>
#include <chrono>
#include <cstring>
#include <map>

#include "ground/TextFile.h"
#include "wire/upnp/Search.h"

namespace tavo {

namespace {

using tinyxml2::XMLDocument;
using tinyxml2::XMLElement;

constexpr size_t kMaxText = 256;
constexpr int kMaxDepth = 12;
constexpr int kLeastErrorCode = 100;  // no protocol has less, and as a status "1" is success
constexpr int kMaxEntries = 65536;
constexpr auto kListLimit = std::chrono::seconds(8);  // then who asks goes on by name
constexpr char kEncoding[] = "http://schemas.xmlsoap.org/soap/encoding/";
constexpr char kEnvelope[] = "http://schemas.xmlsoap.org/soap/envelope/";

// A name without its namespace prefix, which every router spells its own way.
std::string_view LocalName(const XMLElement& element) {
    const std::string_view szName = element.Name();
    return szName.substr(szName.rfind(':') + 1);
}

// The first element of that name, in document order; null when there is none near the surface.
const XMLElement* FindElement(const XMLElement* pElement, std::string_view szName, int nDepth = 0) {
    for (; pElement != nullptr && nDepth < kMaxDepth; pElement = pElement->NextSiblingElement()) {
        if (LocalName(*pElement) == szName) {
            return pElement;
        }
        if (const XMLElement* pFound = FindElement(pElement->FirstChildElement(), szName, nDepth + 1)) {
            return pFound;
        }
    }
    return nullptr;
}

// A mark of a text that is too long to be kept (32-bit FNV-1a).
std::string MarkOf(std::string_view szText) {
    uint32_t nHash = 2166136261U;
    for (const char c : szText) {
        nHash = (nHash ^ static_cast<unsigned char>(c)) * 16777619U;
    }
    char szMark[16];
    std::snprintf(szMark, sizeof(szMark), "~%08x", nHash);
    return szMark;
}

bool IsInsideCharacter(char c) {
    return (static_cast<unsigned char>(c) & 0xC0U) == 0x80U;
}

// One text of what the router says it is.
std::string ModelText(const XMLElement* pDevice, std::string_view szName) {
    const XMLElement* pElement = pDevice->FirstChildElement();
    while (pElement != nullptr && LocalName(*pElement) != szName) {
        pElement = pElement->NextSiblingElement();
    }
    const char* szRaw = pElement == nullptr ? nullptr : pElement->GetText();
    std::string szText(szRaw == nullptr ? "" : szRaw);
    szText = Trim(PrintableText(szText, szText.size()));
    if (szText.size() > kMaxModelText) {
        const std::string szMark = MarkOf(szText);
        size_t nKeep = kMaxModelText - szMark.size();
        while (nKeep > 0 && IsInsideCharacter(szText[nKeep])) {
            --nKeep;
        }
        szText = szText.substr(0, nKeep) + szMark;
    }
    return szText;
}

std::string TextOf(const XMLElement* pElement) {
    const char* szText = pElement == nullptr ? nullptr : pElement->GetText();
    return szText == nullptr ? "" : PrintableText(Trim(szText), kMaxText);
}

template <typename Number>
std::optional<Number> ParseNumber(const std::string& szText) {
    Number nValue = 0;
    const auto [pEnd, error] = std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
    return error == std::errc() && pEnd == szText.data() + szText.size() ? std::optional<Number>(nValue) : std::nullopt;
}

bool MapsPorts(const std::string& szType) {
    return szType.starts_with("urn:schemas-upnp-org:service:WANIPConnection:") ||
           szType.starts_with("urn:schemas-upnp-org:service:WANPPPConnection:");
}

// The first service below pElement that maps ports.
const XMLElement* FindService(const XMLElement* pElement, int nDepth = 0) {
    for (; pElement != nullptr && nDepth < kMaxDepth; pElement = pElement->NextSiblingElement()) {
        if (LocalName(*pElement) == "service" && MapsPorts(TextOf(pElement->FirstChildElement("serviceType")))) {
            return pElement;
        }
        if (const XMLElement* pFound = FindService(pElement->FirstChildElement(), nDepth + 1)) {
            return pFound;
        }
    }
    return nullptr;
}

IgdModel ReadModel(const XMLElement* pRoot) {
    const XMLElement* pDevice = FindElement(pRoot, "device");
    if (pDevice == nullptr) {
        return {};
    }
    IgdModel model{ModelText(pDevice, "manufacturer"), ModelText(pDevice, "modelName"), ""};
    // The first two are no standard elements; the routers that have them keep the number for the model.
    for (const char* szName : {"firmwareVersion", "softwareVersion", "modelNumber"}) {
        if (model.szVersion.empty()) {
            model.szVersion = ModelText(pDevice, szName);
        }
    }
    return model;
}

// An address of the service, whole or relative to the description; never on another host.
std::optional<HttpUrl> ResolveAddress(const std::string& szAddress, const std::string& szBase,
                                      const HttpUrl& location) {
    if (szAddress.starts_with("http://")) {
        const auto url = ParseHttpUrl(szAddress);
        return url && url->szHost == location.szHost ? url : std::nullopt;
    }
    HttpUrl url = location;
    if (const auto base = ParseHttpUrl(szBase); base && base->szHost == location.szHost) {
        url = *base;
    }
    if (szAddress.empty()) {
        return std::nullopt;
    }
    url.szPath = szAddress.starts_with("/") ? szAddress : url.szPath.substr(0, url.szPath.rfind('/') + 1) + szAddress;
    return ParseHttpUrl(url.Text());
}

std::string EscapeXml(const std::string& szText) {
    std::string szOut;
    for (const char c : szText) {
        switch (c) {
            case '&':
                szOut += "&amp;";
                break;
            case '<':
                szOut += "&lt;";
                break;
            case '>':
                szOut += "&gt;";
                break;
            case '"':
                szOut += "&quot;";
                break;
            default:
                szOut += c;
        }
    }
    return szOut;
}

int CodeOf(const HttpAnswer& answer) {
    switch (answer.enEnd) {
        case HttpEnd::kAnswered:
            return SoapCode(answer.nCode, answer.szBody);
        case HttpEnd::kTimeout:
            return kWireTimeout;
        case HttpEnd::kUnreachable:
            return kWireUnreachable;
        case HttpEnd::kGarbage:
            break;
    }
    return kWireGarbage;
}

bool IsAddress(const std::string& szText) {
    in_addr address = {};
    return inet_pton(AF_INET, szText.c_str(), &address) == 1;
}

// What an entry's answer says beyond its key.
bool ReadEntry(const XMLElement* pRoot, IgdEntry& mapping) {
    const auto nBoxPort = ParseNumber<uint16_t>(TextOf(FindElement(pRoot, "NewInternalPort")));
    mapping.szClient = TextOf(FindElement(pRoot, "NewInternalClient"));
    if (!nBoxPort || !IsAddress(mapping.szClient)) {
        return false;
    }
    mapping.nBoxPort = *nBoxPort;
    mapping.szDescription = TextOf(FindElement(pRoot, "NewPortMappingDescription"));
    mapping.nLease = ParseNumber<uint32_t>(TextOf(FindElement(pRoot, "NewLeaseDuration"))).value_or(0);
    const std::string szEnabled = TextOf(FindElement(pRoot, "NewEnabled"));
    mapping.blEnabled = szEnabled != "0" && szEnabled != "false" && szEnabled != "no";
    return true;
}

bool ReadKey(const XMLElement* pRoot, IgdEntry& mapping) {
    const auto nRouterPort = ParseNumber<uint16_t>(TextOf(FindElement(pRoot, "NewExternalPort")));
    mapping.szProtocol = TextOf(FindElement(pRoot, "NewProtocol"));
    mapping.nRouterPort = nRouterPort.value_or(0);
    return nRouterPort.has_value() && (mapping.szProtocol == "TCP" || mapping.szProtocol == "UDP");
}

// The entries of a listing, which is a document inside the answer. Those that make no sense are left out.
std::vector<IgdEntry> ParseListing(const std::string& szAnswer) {
    XMLDocument document;
    document.Parse(szAnswer.data(), szAnswer.size());
    const XMLElement* pListing = FindElement(document.RootElement(), "NewPortListing");
    const char* szListing = pListing == nullptr ? nullptr : pListing->GetText();
    XMLDocument listing;
    std::vector<IgdEntry> rgMappings;
    if (szListing == nullptr || listing.Parse(szListing) != tinyxml2::XML_SUCCESS) {
        return rgMappings;
    }
    const XMLElement* pEntry = listing.RootElement() == nullptr ? nullptr : listing.RootElement()->FirstChildElement();
    for (; pEntry != nullptr; pEntry = pEntry->NextSiblingElement()) {
        IgdEntry mapping;
        const XMLElement* pFields = pEntry->FirstChildElement();
        if (ReadKey(pFields, mapping) && ReadEntry(pFields, mapping)) {
            rgMappings.push_back(std::move(mapping));
        }
    }
    return rgMappings;
}

}  // namespace

std::optional<IgdService> ParseDescription(const std::string& szXml, const HttpUrl& location) {
    XMLDocument document;
    if (document.Parse(szXml.data(), szXml.size()) != tinyxml2::XML_SUCCESS) {
        return std::nullopt;
    }
    const XMLElement* pService = FindService(document.RootElement());
    if (pService == nullptr) {
        return std::nullopt;
    }
    const std::string szBase =
        TextOf(FindElement(document.RootElement()->FirstChildElement(), "URLBase", kMaxDepth - 1));
    const auto fnResolve = [&](const char* szName) {
        return ResolveAddress(TextOf(pService->FirstChildElement(szName)), szBase, location);
    };
    const auto control = fnResolve("controlURL");
    if (!control) {
        return std::nullopt;
    }
    return IgdService{TextOf(pService->FirstChildElement("serviceType")), *control, fnResolve("eventSubURL"),
                      ReadModel(document.RootElement())};
}

int SoapCode(long nHttpCode, const std::string& szXml) {
    XMLDocument document;
    if (document.Parse(szXml.data(), szXml.size()) != tinyxml2::XML_SUCCESS || document.RootElement() == nullptr) {
        return kWireGarbage;
    }
    if (FindElement(document.RootElement(), "Fault") == nullptr) {
        return nHttpCode == 200 && FindElement(document.RootElement(), "Body") != nullptr ? kWireOk : kWireGarbage;
    }
    const auto nCode = ParseNumber<int>(TextOf(FindElement(document.RootElement(), "errorCode")));
    return nCode && *nCode >= kLeastErrorCode ? *nCode : kWireGarbage;
}

std::unique_ptr<Igd> Igd::At(const HttpUrl& location, std::shared_ptr<HttpTransport> pHttp) {
    const HttpAnswer answer = pHttp->Get(location);
    if (answer.enEnd != HttpEnd::kAnswered || answer.nCode != 200) {
        return nullptr;
    }
    auto service = ParseDescription(answer.szBody, location);
    return service ? std::unique_ptr<Igd>(new Igd(std::move(*service), std::move(pHttp))) : nullptr;
}

std::unique_ptr<Igd> Igd::Find(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds,
                               std::string* pSzLocation, int nLocalPort, const std::function<bool()>& fnStop) {
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
        pFound = At(location, pHttp);
        pHttp->SetLimit(kRequestMilliseconds);
        if (pFound != nullptr && pSzLocation != nullptr) {
            *pSzLocation = location.Text();
        }
        return pFound != nullptr;
    };
    if (pSzLocation != nullptr && !pSzLocation->empty()) {
        const auto known = ParseHttpUrl(*pSzLocation);
        if (known && known->szHost == szGateway && fnTry(*known, nLimitMilliseconds / 2)) {
            return pFound;
        }
    }
    SearchGateway(
        szGateway, szLocal, fnLeft(), nLocalPort,
        [&](const HttpUrl& location) { return fnTry(location, fnLeft() / 2); }, fnStop);
    return pFound;
}

int Igd::Call(const char* szAction, const std::vector<Argument>& rgArguments, std::string& szAnswer) {
    std::string szBody = std::string("<?xml version=\"1.0\"?>\r\n<s:Envelope xmlns:s=\"") + kEnvelope +
                         "\" s:encodingStyle=\"" + kEncoding + "\"><s:Body><u:" + szAction + " xmlns:u=\"" +
                         EscapeXml(mService.szType) + "\">";
    for (const Argument& argument : rgArguments) {
        szBody += std::string("<") + argument.szName + ">" + EscapeXml(argument.szValue) + "</" + argument.szName + ">";
    }
    szBody += std::string("</u:") + szAction + "></s:Body></s:Envelope>\r\n";
    HttpAnswer answer = mPHttp->Post(mService.control,
                                     {"Content-Type: text/xml; charset=\"utf-8\"",
                                      "Expect:", "SOAPAction: \"" + mService.szType + "#" + szAction + "\""},
                                     szBody);
    szAnswer = std::move(answer.szBody);
    answer.szBody = szAnswer;
    return CodeOf(answer);
}

int Igd::GetAt(int nIndex, IgdEntry& mapping) {
    std::string szAnswer;
    const int nCode = Call("GetGenericPortMappingEntry", {{"NewPortMappingIndex", std::to_string(nIndex)}}, szAnswer);
    if (nCode != kWireOk) {
        return nCode;
    }
    XMLDocument document;
    IgdEntry read;
    document.Parse(szAnswer.data(), szAnswer.size());
    if (!ReadKey(document.RootElement(), read) || !ReadEntry(document.RootElement(), read)) {
        read = {};
        read.blEnabled = false;
    }
    mapping = std::move(read);
    return kWireOk;
}

int Igd::ExternalAddress(std::string& szAddress) {
    std::string szAnswer;
    const int nCode = Call("GetExternalIPAddress", {}, szAnswer);
    if (nCode != kWireOk) {
        return nCode;
    }
    XMLDocument document;
    document.Parse(szAnswer.data(), szAnswer.size());
    const std::string szRead = TextOf(FindElement(document.RootElement(), "NewExternalIPAddress"));
    if (!IsAddress(szRead)) {
        return kWireGarbage;
    }
    szAddress = szRead;
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
        // The end of the table; some routers say so with the codes for bad arguments or no entry.
        if (nCode == kIgdNoSuchIndex || nCode == kIgdNoSuchEntry || (nCode == kIgdInvalidArgs && i > 0)) {
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
    if (!mBlRanges) {
        return kIgdInvalidAction;
    }
    std::string szAnswer;
    const int nCode = Call("GetListOfPortMappings",
                           {{"NewStartPort", std::to_string(nFirst)},
                            {"NewEndPort", std::to_string(nLast)},
                            {"NewProtocol", szProtocol},
                            {"NewManage", "0"},
                            {"NewNumberOfPorts", "0"}},
                           szAnswer);
    mBlRanges = nCode == kWireOk;
    if (nCode == kWireOk) {
        rgMappings = ParseListing(szAnswer);
    }
    return nCode;
}

int Igd::Get(const std::string& szProtocol, uint16_t nRouterPort, IgdEntry& mapping) {
    std::string szAnswer;
    const int nCode =
        Call("GetSpecificPortMappingEntry",
             {{"NewRemoteHost", ""}, {"NewExternalPort", std::to_string(nRouterPort)}, {"NewProtocol", szProtocol}},
             szAnswer);
    if (nCode != kWireOk) {
        return nCode;
    }
    XMLDocument document;
    document.Parse(szAnswer.data(), szAnswer.size());
    IgdEntry read;
    read.szProtocol = szProtocol;
    read.nRouterPort = nRouterPort;
    if (!ReadEntry(document.RootElement(), read)) {
        return kWireGarbage;
    }
    mapping = std::move(read);
    return kWireOk;
}

int Igd::Add(const IgdEntry& mapping) {
    std::string szAnswer;
    return Call("AddPortMapping",
                {{"NewRemoteHost", ""},
                 {"NewExternalPort", std::to_string(mapping.nRouterPort)},
                 {"NewProtocol", mapping.szProtocol},
                 {"NewInternalPort", std::to_string(mapping.nBoxPort)},
                 {"NewInternalClient", mapping.szClient},
                 {"NewEnabled", "1"},
                 {"NewPortMappingDescription", mapping.szDescription},
                 {"NewLeaseDuration", std::to_string(mapping.nLease)}},
                szAnswer);
}

int Igd::Remove(const std::string& szProtocol, uint16_t nRouterPort) {
    std::string szAnswer;
    return Call("DeletePortMapping",
                {{"NewRemoteHost", ""}, {"NewExternalPort", std::to_string(nRouterPort)}, {"NewProtocol", szProtocol}},
                szAnswer);
}

}  // namespace tavo
