// What is read of a router's XML. Relies on tinyxml2. Promises: names count without their namespace's prefix, which
// every router spells its own way; texts are printable and bounded, and nothing is looked for in the depths.
#pragma once

#include <tinyxml2.h>

#include <charconv>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

namespace tavo {

inline constexpr int kMaxXmlDepth = 12;

std::string_view LocalName(const tinyxml2::XMLElement& element);
// The first element of that name among pElement, what follows it and what stands below them, in document order; null
// when there is none near the surface.
const tinyxml2::XMLElement* FindElement(const tinyxml2::XMLElement* pElement, std::string_view szName, int nDepth = 0);
// The text of an element, which may be null.
std::string TextOf(const tinyxml2::XMLElement* pElement);

template <typename Number>
std::optional<Number> ParseNumber(const std::string& szText) {
    Number nValue = 0;
    const auto [pEnd, error] = std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
    return error == std::errc() && pEnd == szText.data() + szText.size() ? std::optional<Number>(nValue) : std::nullopt;
}

}  // namespace tavo
