// The headers of a request or an answer. Relies on nothing. Promises: a line that two readers could take differently is
// none.
#pragma once

#include <strings.h>

#include <algorithm>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace tavo {

inline bool IsSameWord(std::string_view szOne, std::string_view szOther) {
    return szOne.size() == szOther.size() && strncasecmp(szOne.data(), szOther.data(), szOne.size()) == 0;
}

class HttpHeaders {
public:
    // One line, without its end. False: it is no header.
    bool Add(std::string_view szLine) {
        const size_t nColon = szLine.find(':');
        // A blank before the colon, or a line that goes on with the one before: two readers may differ on it.
        if (nColon == std::string_view::npos || nColon == 0 || szLine.find_first_of(kBlanks) < nColon) {
            return false;
        }
        const std::string_view szValue = szLine.substr(nColon + 1);
        const size_t nStart = std::min(szValue.find_first_not_of(kBlanks), szValue.size());
        const size_t nEnd = szValue.find_last_not_of(kBlanks) + 1;
        mRgHeaders.emplace_back(szLine.substr(0, nColon), szValue.substr(nStart, nEnd - std::min(nStart, nEnd)));
        return true;
    }
    size_t Size() const { return mRgHeaders.size(); }
    // The last of that name, whose case does not matter; nothing where there is none.
    std::optional<std::string> Find(std::string_view szName) const {
        const auto it = std::find_if(mRgHeaders.rbegin(), mRgHeaders.rend(),
                                     [&](const auto& header) { return IsSameWord(header.first, szName); });
        return it == mRgHeaders.rend() ? std::nullopt : std::optional(it->second);
    }

private:
    static constexpr std::string_view kBlanks = " \t";
    std::vector<std::pair<std::string, std::string>> mRgHeaders;
};

}  // namespace tavo
