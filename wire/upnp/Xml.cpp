// See Xml.h.
#include "wire/upnp/Xml.h"

#include <libxml/parser.h>
#include <libxml/tree.h>
#include <libxml/xmlstring.h>

#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr size_t kMaxText = 256;
constexpr size_t kMostBetweenTags = 65536;
constexpr int kOptions = XML_PARSE_RECOVER | XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING;

const char* Characters(const xmlChar* szText) {
    return reinterpret_cast<const char*>(szText);
}

const _xmlNode* FirstElement(const _xmlNode* pNode) {
    while (pNode != nullptr && pNode->type != XML_ELEMENT_NODE) {
        pNode = pNode->next;
    }
    return pNode;
}

// The parser's time for a tag is the square of its attributes; whatever else is so long is nothing of a router's.
bool HasEndlessTag(std::string_view szText) {
    size_t nAt = 0;
    while (szText.size() - nAt > kMostBetweenTags) {
        const size_t nNext = szText.find('<', nAt);
        if (nNext == std::string_view::npos || nNext - nAt > kMostBetweenTags) {
            return true;
        }
        nAt = nNext + 1;
    }
    return false;
}

// What is not the UTF-8 that it passes for is the Latin-1 that it mostly was; so is what nobody knows.
_xmlDoc* Parse(const std::string& szText) {
    if (HasEndlessTag(szText)) {
        return nullptr;
    }
    const auto fnRead = [&](const char* szEncoding, int nMore) {
        return xmlReadMemory(szText.data(), static_cast<int>(szText.size()), nullptr, szEncoding, kOptions | nMore);
    };
    const std::string_view szHead = std::string_view(szText).substr(0, szText.find("?>"));
    const bool blSays = szHead.starts_with("<?xml") && szHead.find("encoding") != std::string_view::npos &&
                        szHead.find("utf-8") == std::string_view::npos &&
                        szHead.find("UTF-8") == std::string_view::npos;
    if (blSays || xmlCheckUTF8(reinterpret_cast<const xmlChar*>(szText.c_str())) == 1) {
        _xmlDoc* pDocument = fnRead(nullptr, 0);
        if (!blSays || (pDocument != nullptr && xmlDocGetRootElement(pDocument) != nullptr)) {
            return pDocument;
        }
        xmlFreeDoc(pDocument);
    }
    return fnRead("ISO-8859-1", XML_PARSE_IGNORE_ENC);
}

}  // namespace

std::string_view XmlElement::Name() const {
    const std::string_view szName = mPNode == nullptr ? "" : Characters(mPNode->name);
    return szName.substr(szName.rfind(':') + 1);  // of a namespace that the router forgot to declare
}

XmlElement XmlElement::Child() const {
    return XmlElement(mPNode == nullptr ? nullptr : FirstElement(mPNode->children));
}

XmlElement XmlElement::Next() const {
    return XmlElement(mPNode == nullptr ? nullptr : FirstElement(mPNode->next));
}

XmlElement XmlElement::Child(std::string_view szName) const {
    return Find(szName, 1);
}

XmlElement XmlElement::Find(std::string_view szName, int nMostDepth) const {
    for (XmlElement child = nMostDepth > 0 ? Child() : XmlElement(); child; child = child.Next()) {
        if (child.Name() == szName) {
            return child;
        }
        if (const XmlElement found = child.Find(szName, nMostDepth - 1)) {
            return found;
        }
    }
    return {};
}

std::string XmlElement::Raw() const {
    std::string szText;
    for (const _xmlNode* pNode = mPNode == nullptr ? nullptr : mPNode->children; pNode != nullptr;
         pNode = pNode->next) {
        if ((pNode->type == XML_TEXT_NODE || pNode->type == XML_CDATA_SECTION_NODE) && pNode->content != nullptr) {
            szText += Characters(pNode->content);
        }
    }
    return szText;
}

std::string XmlElement::Text() const {
    return PrintableText(Trim(Raw()), kMaxText);
}

XmlDocument::XmlDocument(const std::string& szText) : mPDocument(Parse(szText), &xmlFreeDoc) {}

XmlElement XmlDocument::Root() const {
    return XmlElement(mPDocument == nullptr ? nullptr : xmlDocGetRootElement(mPDocument.get()));
}

std::string EscapedXml(std::string_view szText) {
    std::string szEscaped;
    for (const char c : szText) {
        szEscaped += c == '&' ? "&amp;" : c == '<' ? "&lt;" : c == '>' ? "&gt;" : std::string(1, c);
    }
    return szEscaped;
}

}  // namespace tavo
