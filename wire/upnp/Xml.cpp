// See Xml.h.
#include "wire/upnp/Xml.h"

#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr size_t kMaxText = 256;

}  // namespace

std::string_view LocalName(const tinyxml2::XMLElement& element) {
    const std::string_view szName = element.Name();
    return szName.substr(szName.rfind(':') + 1);
}

const tinyxml2::XMLElement* FindElement(const tinyxml2::XMLElement* pElement, std::string_view szName, int nDepth) {
    for (; pElement != nullptr && nDepth < kMaxXmlDepth; pElement = pElement->NextSiblingElement()) {
        if (LocalName(*pElement) == szName) {
            return pElement;
        }
        if (const auto* pFound = FindElement(pElement->FirstChildElement(), szName, nDepth + 1)) {
            return pFound;
        }
    }
    return nullptr;
}

std::string TextOf(const tinyxml2::XMLElement* pElement) {
    const char* szText = pElement == nullptr ? nullptr : pElement->GetText();
    return szText == nullptr ? "" : PrintableText(Trim(szText), kMaxText);
}

}  // namespace tavo
