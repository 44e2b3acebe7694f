// The six letters and digits behind the name of a file that is there only while somebody writes: small letters,
// capitals and digits, no two neighbours of one kind, and the last one follows from the others. No word, number, date
// or version that a person puts behind a name is so, which tells what a killed writer left from a person's own copy.
// The library has its own maker of such names. Relies on getrandom.
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

// The last character, of a given kind, behind the five others.
inline char Last(std::string_view szFive, size_t nKind) {
    size_t nSum = 5;
    for (const char c : szFive) {
        nSum += kKinds[KindOf(c)].find(c);
    }
    return kKinds[nKind][nSum % kKinds[nKind].size()];
}

}  // namespace suffix

inline bool IsSuffix(std::string_view szText) {
    if (szText.size() != kSuffixSize) {
        return false;
    }
    size_t nBefore = suffix::kKindCount;
    bool rgSeen[suffix::kKindCount] = {};
    for (const char c : szText) {
        const size_t nKind = suffix::KindOf(c);
        if (nKind == suffix::kKindCount || nKind == nBefore) {
            return false;
        }
        rgSeen[nKind] = true;
        nBefore = nKind;
    }
    return rgSeen[0] && rgSeen[1] && rgSeen[2] &&
           szText.back() == suffix::Last(szText.substr(0, kSuffixSize - 1), nBefore);
}

inline std::string MakeSuffix() {
    std::string szSuffix;
    while (!IsSuffix(szSuffix)) {
        unsigned char rgRandom[2 * kSuffixSize] = {};
        // Without random numbers the names are the same each time, and the next that is free is looked for anyway.
        [[maybe_unused]] const ssize_t nRead = getrandom(rgRandom, sizeof(rgRandom), GRND_NONBLOCK);
        szSuffix.clear();
        size_t nKind = rgRandom[0] % suffix::kKindCount;
        for (size_t i = 0; i + 1 < kSuffixSize; ++i) {
            const std::string_view szKind = suffix::kKinds[nKind];
            szSuffix += szKind[rgRandom[2 * i] % szKind.size()];
            nKind = (nKind + 1 + rgRandom[2 * i + 1] % 2) % suffix::kKindCount;
        }
        szSuffix += suffix::Last(szSuffix, nKind);
    }
    return szSuffix;
}

}  // namespace tavo
