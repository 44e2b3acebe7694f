// What is read of a router's XML, of which much is broken: unclosed, cut, in another encoding than it says. Relies on
// libxml2, which goes on where others give up. Promises: names count without their namespace's prefix, which every
// router spells its own way; texts are UTF-8, printable and bounded; nothing is looked for in the depths, nothing is
// fetched, and no entity is expanded.
#pragma once

#include <charconv>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

struct _xmlDoc;
struct _xmlNode;

namespace tavo {

inline constexpr int kMaxXmlDepth = 12;

// An element of a document, or none: then there is nothing in it. Valid while the document is.
class XmlElement {
public:
    XmlElement() = default;
    explicit XmlElement(const _xmlNode* pNode) : mPNode(pNode) {}
    explicit operator bool() const { return mPNode != nullptr; }

    std::string_view Name() const;
    XmlElement Child() const;                         // the first one
    XmlElement Child(std::string_view szName) const;  // the first one of that name
    XmlElement Next() const;                          // beside it
    // The first element of that name among those below it, in document order, near the surface.
    XmlElement Find(std::string_view szName, int nMostDepth = kMaxXmlDepth) const;
    // What stands directly in it, as it is.
    std::string Raw() const;
    // The same as a value: printable, bounded, without the spaces around it.
    std::string Text() const;

private:
    const _xmlNode* mPNode = nullptr;
};

class XmlDocument {
public:
    explicit XmlDocument(const std::string& szText);
    // None: nothing could be made out. Where what follows is broken, what stands before it counts.
    XmlElement Root() const;

private:
    std::unique_ptr<_xmlDoc, void (*)(_xmlDoc*)> mPDocument;
};

// The text with what XML makes of it.
std::string EscapedXml(std::string_view szText);

template <typename Number>
std::optional<Number> ParseNumber(const std::string& szText) {
    Number nValue = 0;
    const auto [pEnd, error] = std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
    return error == std::errc() && pEnd == szText.data() + szText.size() ? std::optional<Number>(nValue) : std::nullopt;
}

}  // namespace tavo
