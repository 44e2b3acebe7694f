// Sorts verdicts and writes them out. Relies on the verdicts of tavo/porttest.h. Promises: see RuleVerdict.h.
#include "porttest/RuleVerdict.h"

#include <algorithm>
#include <iterator>

#include "tavo/porttest.h"

namespace tavo {

namespace {

constexpr size_t kMaxNamedPorts = 6;  // with the same reason, before the others are only counted

// The ports that share the reason of the first, from it on; it becomes the first of the next.
template <typename Iterator>
std::string TakeGroup(Iterator& it, Iterator end) {
    const Iterator first = it;
    it = std::find_if(first, end, [&](const NamedVerdict& other) {
        return other.verdict.enStatus != first->verdict.enStatus || other.verdict.szReason != first->verdict.szReason;
    });
    const auto nPorts = static_cast<size_t>(it - first);
    std::string szText;
    for (size_t i = 0; i < std::min(nPorts, kMaxNamedPorts); ++i) {
        szText += (i == 0 ? "" : ", ") + first[static_cast<std::ptrdiff_t>(i)].szPort;
    }
    if (nPorts > kMaxNamedPorts) {
        szText += " and " + std::to_string(nPorts - kMaxNamedPorts) + " more";
    }
    return szText + ": " + first->verdict.szReason;
}

}  // namespace

bool IsWorse(int enStatus, int enThan) {
    static constexpr int kFromWorst[] = {TAVO_PORT_TIMEOUT, TAVO_PORT_REFUSED, TAVO_PORT_NOLISTEN,
                                         TAVO_PORT_UNKNOWN, TAVO_PORT_OPEN,    TAVO_PORT_DISABLED};
    return std::find(std::begin(kFromWorst), std::end(kFromWorst), enStatus) <
           std::find(std::begin(kFromWorst), std::end(kFromWorst), enThan);
}

PortVerdict MergeVerdicts(std::vector<NamedVerdict> rgVerdicts, size_t nLeftOut) {
    std::stable_sort(rgVerdicts.begin(), rgVerdicts.end(), [](const NamedVerdict& one, const NamedVerdict& other) {
        const int enOne = one.verdict.enStatus;
        const int enOther = other.verdict.enStatus;
        return IsWorse(enOne, enOther) || (enOne == enOther && one.verdict.szReason < other.verdict.szReason);
    });
    PortVerdict merged{rgVerdicts.empty() ? TAVO_PORT_UNKNOWN : rgVerdicts.front().verdict.enStatus, ""};
    for (auto it = rgVerdicts.cbegin(); it != rgVerdicts.cend();) {
        merged.szReason += (merged.szReason.empty() ? "" : "; ") + TakeGroup(it, rgVerdicts.cend());
    }
    if (nLeftOut > 0) {
        merged.szReason += (merged.szReason.empty() ? "" : "; ") + std::to_string(nLeftOut) + " more ports: not tested";
        merged.enStatus = IsWorse(TAVO_PORT_UNKNOWN, merged.enStatus) ? +TAVO_PORT_UNKNOWN : merged.enStatus;
    }
    return merged;
}

}  // namespace tavo
