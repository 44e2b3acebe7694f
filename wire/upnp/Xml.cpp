// See Xml.h.
#include "wire/upnp/Xml.h"

#include <libxml/parser.h>
#include <libxml/tree.h>
#include <libxml/xmlstring.h>

#include <algorithm>
#include <cctype>
#include <iterator>

#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr size_t kMaxText = 256;
constexpr size_t kMostTag = 16384;  // bytes
constexpr size_t kMostHead = 200;
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

// The end of a tag, past the ">" that is in no value.
size_t EndOfTag(std::string_view szText, size_t nAt) {
    char cQuote = '\0';
    for (; nAt < szText.size(); ++nAt) {
        const char c = szText[nAt];
        if (cQuote != '\0') {
            cQuote = c == cQuote ? '\0' : cQuote;
        } else if (c == '>') {
            return nAt + 1;
        } else if (c == '"' || c == '\'') {
            cQuote = c;
        }
    }
    return szText.size();
}

// Without what costs the parser the square of its length and a router has no need of: declarations, comments, tags of
// thousands of attributes. Nothing: it cannot be had without.
std::optional<std::string> Plain(const std::string& szAll) {
    const std::string_view szText = szAll;
    std::string szPlain;
    for (size_t nAt = 0; nAt < szText.size();) {
        const size_t nTag = std::min(szText.find('<', nAt), szText.size());
        szPlain += szText.substr(nAt, nTag - nAt);
        const std::string_view szRest = szText.substr(nTag);
        const bool blData = szRest.starts_with("<![CDATA[");
        const bool blComment = szRest.starts_with("<!--");
        const char* szEnd = blData ? "]]>" : blComment ? "-->" : nullptr;
        size_t nEnd = szEnd == nullptr ? EndOfTag(szText, nTag) : szText.find(szEnd, nTag);
        if (nEnd == std::string_view::npos) {
            nEnd = szText.size();  // cut
        } else {
            nEnd += szEnd == nullptr ? 0 : 3;
        }
        const std::string_view szTag = szText.substr(nTag, nEnd - nTag);
        const bool blDeclaration = szTag.starts_with("<!") && !blData && !blComment;
        if ((blDeclaration && szTag.find('[') != std::string_view::npos) ||
            (!blData && !blComment && szTag.size() > kMostTag)) {
            return std::nullopt;
        }
        if (!blDeclaration && !blComment) {
            szPlain += szTag;
        }
        nAt = nEnd;
    }
    return szPlain;
}

// Whether it says that it is in an encoding that routers really use; anything else is the UTF-8 or the Latin-1 that it
// mostly is, whatever it says.
bool SaysEncoding(std::string_view szText) {
    std::string szHead(szText.substr(0, std::min(szText.find("?>"), kMostHead)));
    std::transform(szHead.begin(), szHead.end(), szHead.begin(), [](unsigned char c) { return std::tolower(c); });
    const size_t nAt = szHead.find("encoding");
    constexpr std::string_view kKnown[] = {"iso-8859-", "windows-125", "gb", "big5", "shift_jis", "euc-"};
    return nAt != std::string::npos && std::any_of(std::begin(kKnown), std::end(kKnown), [&](std::string_view szKnown) {
               return szHead.find(szKnown, nAt) != std::string::npos;
           });
}

_xmlDoc* Parse(const std::string& szAll) {
    const std::optional<std::string> szText = Plain(szAll);
    if (!szText) {
        return nullptr;
    }
    const auto fnRead = [&](const char* szEncoding, int nMore) {
        return xmlReadMemory(szText->data(), static_cast<int>(szText->size()), nullptr, szEncoding, kOptions | nMore);
    };
    if (SaysEncoding(*szText)) {
        return fnRead(nullptr, 0);
    }
    const bool blUtf8 = xmlCheckUTF8(reinterpret_cast<const xmlChar*>(szText->c_str())) == 1;
    return fnRead(blUtf8 ? "UTF-8" : "ISO-8859-1", XML_PARSE_IGNORE_ENC);
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
