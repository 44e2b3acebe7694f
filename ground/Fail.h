// How a function of the platform fails: the last error is set, with the place in the tree that saw it.
#pragma once

#include <algorithm>
#include <string_view>

#include "tavo/core.h"

namespace tavo {

// The path from the top of the tree on: where the tree lay when it was built is nothing for a log.
inline const char* PathInTree(const char* szFile) {
    size_t nTop = 0;
    for (const std::string_view szFolder : {"platform/linux/", "ground/"}) {
        const size_t nAt = std::string_view(szFile).rfind(szFolder);
        nTop = nAt == std::string_view::npos ? nTop : std::max(nTop, nAt);
    }
    return szFile + nTop;
}

// Builtins, since the clang of Debian 12 has no std::source_location.
inline void SetError(int nErr, const char* szFile = __builtin_FILE(), int nLine = __builtin_LINE()) {
    TLIBCErrSet(nErr, PathInTree(szFile), nLine);
}

// The same, and the answer of whoever fails.
template <typename Answer = int>
Answer Fail(int nErr, Answer answer = -1, const char* szFile = __builtin_FILE(), int nLine = __builtin_LINE()) {
    SetError(nErr, szFile, nLine);
    return answer;
}

}  // namespace tavo
