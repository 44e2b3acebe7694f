// Reads port lists and protocols. Relies on std::from_chars. Promises: see PortText.h.
#include "ground/PortText.h"

#include <strings.h>

#include <algorithm>
#include <charconv>

#include "ground/TextFile.h"
#include "tavo/portforward.h"

namespace tavo {

namespace {

std::optional<uint16_t> ParsePort(std::string_view szText) {
    const std::string_view szPort = Trim(szText);
    int nPort = 0;
    const auto [pEnd, error] = std::from_chars(szPort.data(), szPort.data() + szPort.size(), nPort);
    if (error != std::errc() || pEnd != szPort.data() + szPort.size() || TAVOPFIsValidPortNo(nPort) == 0) {
        return std::nullopt;
    }
    return static_cast<uint16_t>(nPort);
}

std::vector<uint16_t> Flatten(const std::vector<PortRange>& rgRanges) {
    std::vector<uint16_t> rgPorts;
    for (const PortRange& range : rgRanges) {
        for (int nPort = range.nFirst; nPort <= range.nLast; ++nPort) {
            rgPorts.push_back(static_cast<uint16_t>(nPort));
        }
    }
    return rgPorts;
}

// Without the item that a cut may have gone through.
std::string_view SurePart(std::string_view szPorts) {
    return MayBeCut(szPorts) ? szPorts.substr(0, std::min(szPorts.rfind(','), szPorts.size())) : szPorts;
}

bool IsWord(std::string_view szText, const char* szWord) {
    return strcasecmp(std::string(szText).c_str(), szWord) == 0;
}

}  // namespace

std::string PortName(std::string_view szProtocol, uint16_t nPort) {
    return std::to_string(nPort) + (szProtocol == "TCP" ? "/tcp" : "/udp");
}

std::optional<std::vector<PortRange>> ParsePortRanges(std::string_view szText) {
    std::vector<PortRange> rgRanges;
    for (size_t nStart = 0; nStart <= szText.size();) {
        const size_t nEnd = std::min(szText.find(',', nStart), szText.size());
        const std::string_view szItem = szText.substr(nStart, nEnd - nStart);
        nStart = nEnd + 1;
        const size_t nDash = szItem.find('-');
        const std::optional<uint16_t> nFirst = ParsePort(szItem.substr(0, nDash));
        const std::optional<uint16_t> nLast =
            nDash == std::string_view::npos ? nFirst : ParsePort(szItem.substr(nDash + 1));
        if (!nFirst || !nLast) {
            return std::nullopt;
        }
        rgRanges.push_back({std::min(*nFirst, *nLast), std::max(*nFirst, *nLast)});
    }
    return rgRanges;
}

std::optional<ProtocolSet> ParseProtocol(std::string_view szText) {
    const std::string_view szWord = Trim(szText);
    if (IsWord(szWord, "tcp")) {
        return ProtocolSet{true, false};
    }
    if (IsWord(szWord, "udp")) {
        return ProtocolSet{false, true};
    }
    if (IsWord(szWord, "all") || IsWord(szWord, "both") || IsWord(szWord, "tcp_udp")) {
        return ProtocolSet{true, true};
    }
    return std::nullopt;
}

bool MayBeCut(std::string_view szPorts) {
    return szPorts.size() == TAVO_PF_PORTS_SIZE - 1;
}

std::optional<std::vector<SingleMapping>> ExpandRule(std::string_view szProtocol, std::string_view szRouterPorts,
                                                     std::string_view szBoxPorts) {
    const auto protocols = ParseProtocol(szProtocol);
    const auto rgRouterRanges = ParsePortRanges(SurePart(szRouterPorts));
    const auto rgBoxRanges = ParsePortRanges(SurePart(szBoxPorts));
    if (!protocols || !rgRouterRanges || !rgBoxRanges) {
        return std::nullopt;
    }
    std::vector<uint16_t> rgRouterPorts = Flatten(*rgRouterRanges);
    std::vector<uint16_t> rgBoxPorts = Flatten(*rgBoxRanges);
    if (MayBeCut(szRouterPorts) || MayBeCut(szBoxPorts)) {
        const size_t nPairs = std::min(rgRouterPorts.size(), rgBoxPorts.size());
        rgRouterPorts.resize(nPairs);
        rgBoxPorts.resize(nPairs);
    }
    if (rgRouterPorts.size() != rgBoxPorts.size()) {
        return std::nullopt;
    }
    std::vector<SingleMapping> rgMappings;
    for (size_t i = 0; i < rgRouterPorts.size(); ++i) {
        if (protocols->blTcp) {
            rgMappings.push_back({"TCP", rgRouterPorts[i], rgBoxPorts[i]});
        }
        if (protocols->blUdp) {
            rgMappings.push_back({"UDP", rgRouterPorts[i], rgBoxPorts[i]});
        }
    }
    return rgMappings;
}

}  // namespace tavo
