// The six letters and digits behind the name of a file that is there only while somebody writes: no two neighbours
// are of one kind (small letter, capital, digit), which no word, number or date is that a person puts behind a
// name. So what a killed writer left is told from a person's own copy. Relies on getrandom.
#pragma once

#include <sys/random.h>

#include <string>
#include <string_view>

namespace tavo {

inline constexpr size_t kSuffixSize = 6;

namespace suffix {

inline constexpr std::string_view kKinds[] = {"0123456789", "abcdefghijklmnopqrstuvwxyz", "ABCDEFGHIJKLMNOPQRSTUVWXYZ"};
inline constexpr size_t kKindCount = 3;

inline size_t KindOf(char c) {
    size_t nKind = 0;
    while (nKind < kKindCount && kKinds[nKind].find(c) == std::string_view::npos) {
        ++nKind;
    }
    return nKind;
}

}  // namespace suffix

inline bool IsSuffix(std::string_view szText) {
    size_t nBefore = suffix::kKindCount;
    for (const char c : szText) {
        const size_t nKind = suffix::KindOf(c);
        if (nKind == suffix::kKindCount || nKind == nBefore) {
            return false;
        }
        nBefore = nKind;
    }
    return szText.size() == kSuffixSize;
}

inline std::string MakeSuffix() {
    unsigned char rgRandom[2 * kSuffixSize] = {};
    // Without random numbers the names are the same each time, and the next that is free is looked for anyway.
    [[maybe_unused]] const ssize_t nRead = getrandom(rgRandom, sizeof(rgRandom), GRND_NONBLOCK);
    std::string szSuffix;
    size_t nKind = rgRandom[0] % suffix::kKindCount;
    for (size_t i = 0; i < kSuffixSize; ++i) {
        const std::string_view szKind = suffix::kKinds[nKind];
        szSuffix += szKind[rgRandom[2 * i] % szKind.size()];
        nKind = (nKind + 1 + rgRandom[2 * i + 1] % 2) % suffix::kKindCount;
    }
    return szSuffix;
}

}  // namespace tavo
