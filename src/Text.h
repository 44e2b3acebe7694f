// Texts and numbers as the library's records and commands take them. Relies on nothing.
#pragma once

#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>

namespace tavo::lib {

// One step down in a directory tree, and never up or sideways.
inline bool IsPathPart(std::string_view szPart) {
    return !szPart.empty() && szPart != "." && szPart != ".." && szPart.find('/') == std::string_view::npos;
}

// The text as it stands between single quotes of a shell command, which it cannot leave.
inline std::string InQuotes(std::string_view szText) {
    std::string szOut;
    for (const char c : szText) {
        szOut += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return szOut;
}

// What a model's record is called in the compatibility databases. Two makers have one for all their models.
inline std::string RouterKey(const std::string& szBrand, const std::string& szModel, const std::string& szVersion) {
    const bool blWholeBrand = szBrand == "Tavo Inc." || szBrand == "AirPort";
    return blWholeBrand ? szBrand + "//" : szBrand + "/" + szModel + "/" + szVersion;
}

// Decimal number of a text as strtol reads it; values outside int are clamped.
inline int ToInt(const char* szText) {
    return static_cast<int>(std::clamp(std::strtol(szText, nullptr, 10), long{INT_MIN}, long{INT_MAX}));
}

// Copies with "%s", cut at the field's size. False when the copy failed.
template <size_t N>
bool FillText(char (&szField)[N], const std::string& szText) {
    return std::snprintf(szField, N, "%s", szText.c_str()) >= 0;
}

}  // namespace tavo::lib
