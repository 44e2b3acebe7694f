// See Description.h.
#include "wire/upnp/Description.h"

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <iterator>

#include "ground/TextFile.h"
#include "wire/upnp/Xml.h"

namespace tavo {

namespace {

// In any generation; the last two are those of the DSL Forum, older than the others.
constexpr const char* kTypes[] = {
    "urn:schemas-upnp-org:service:WANIPConnection:", "urn:schemas-upnp-org:service:WANPPPConnection:",
    "urn:dslforum-org:service:WANIPConnection:", "urn:dslforum-org:service:WANPPPConnection:"};
constexpr size_t kMostServices = 8;

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
std::string ModelText(const XmlElement& device, std::string_view szName) {
    std::string szText = device.Child(szName).Raw();
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

bool MapsPorts(const std::string& szType) {
    return std::any_of(std::begin(kTypes), std::end(kTypes),
                       [&](const char* szKind) { return szType.starts_with(szKind); });
}

// The services below an element that map ports.
void FindServices(const XmlElement& element, std::vector<XmlElement>& rgServices, int nDepth = 1) {
    for (XmlElement child = nDepth < kMaxXmlDepth ? element.Child() : XmlElement(); child; child = child.Next()) {
        if (child.Name() == "service" && MapsPorts(child.Child("serviceType").Text())) {
            rgServices.push_back(child);
        }
        FindServices(child, rgServices, nDepth + 1);
    }
}

IgdModel ReadModel(const XmlElement& root) {
    const XmlElement device = root.Name() == "device" ? root : root.Find("device");
    IgdModel model{ModelText(device, "manufacturer"), ModelText(device, "modelName"), ""};
    // The first two are no standard elements; the routers that have them keep the number for the model.
    for (const char* szName : {"firmwareVersion", "softwareVersion", "modelNumber"}) {
        if (model.szVersion.empty()) {
            model.szVersion = ModelText(device, szName);
        }
    }
    return model;
}

// An address of the service, whole or relative to the description. Of another host's it is the place on the gateway: a
// router may call itself by a name, or by another address of its own.
std::optional<HttpUrl> ResolveAddress(const std::string& szAddress, const std::string& szBase,
                                      const HttpUrl& location) {
    if (szAddress.starts_with("http://")) {
        auto url = ParseHttpUrl(szAddress);
        if (url) {
            url->szHost = location.szHost;
        }
        return url;
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

}  // namespace

std::vector<IgdService> ParseDescription(const std::string& szXml, const HttpUrl& location, std::string& szWhy) {
    const XmlDocument document(szXml);
    const XmlElement root = document.Root();
    std::vector<XmlElement> rgElements;
    FindServices(root, rgElements);
    const std::string szBase = root.Child("URLBase").Text();
    const IgdModel model = ReadModel(root);
    std::vector<IgdService> rgServices;
    for (const XmlElement& element : rgElements) {
        const auto fnResolve = [&](const char* szName) {
            return ResolveAddress(element.Child(szName).Text(), szBase, location);
        };
        const auto control = fnResolve("controlURL");
        if (!control || rgServices.size() >= kMostServices) {
            continue;
        }
        const IgdService service{element.Child("serviceType").Text(), *control, fnResolve("eventSubURL"), model};
        if (std::none_of(rgServices.begin(), rgServices.end(),
                         [&](const IgdService& other) { return other.Name() == service.Name(); })) {
            rgServices.push_back(service);
        }
    }
    szWhy = !rgServices.empty()  ? ""
            : !root              ? "it cannot be read"
            : rgElements.empty() ? "it has no service that maps ports"
                                 : "its service has no address";
    return rgServices;
}

}  // namespace tavo
