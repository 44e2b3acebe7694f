// Takes rules apart. Relies on ParsePorts. Promises: see PortPairs.h.
#include "PortPairs.h"

#include <algorithm>

namespace tavo::cli {

std::vector<std::string> ProtocolsOf(const std::string& szProtocol) {
    return szProtocol == "all" ? std::vector<std::string>{"tcp", "udp"} : std::vector{szProtocol};
}

std::optional<std::vector<PortPair>> PairsOf(const Rule& rule) {
    const auto rgRouter = ParsePorts(rule.szRouterPorts);
    const auto rgBox = ParsePorts(rule.szBoxPorts);
    if (!rgRouter || !rgBox || rgRouter->size() != rgBox->size()) {
        return std::nullopt;
    }
    std::vector<PortPair> rgPairs;
    for (const std::string& szProtocol : ProtocolsOf(rule.szProtocol)) {
        for (size_t i = 0; i < rgRouter->size(); ++i) {
            rgPairs.push_back({szProtocol, (*rgRouter)[i], (*rgBox)[i]});
        }
    }
    return rgPairs;
}

std::vector<PortPair> PairsOf(const Rules& rules) {
    std::vector<PortPair> rgAll;
    for (const Rule& rule : rules) {
        if (const auto rgPairs = rule.blEnabled ? PairsOf(rule) : std::nullopt) {
            rgAll.insert(rgAll.end(), rgPairs->begin(), rgPairs->end());
        }
    }
    return rgAll;
}

std::string PortsText(const std::vector<int>& rgPorts) {
    std::string szText;
    for (size_t i = 0; i < rgPorts.size();) {
        size_t nLast = i;
        while (nLast + 1 < rgPorts.size() && rgPorts[nLast + 1] == rgPorts[nLast] + 1) {
            ++nLast;
        }
        szText += (szText.empty() ? "" : ",") + std::to_string(rgPorts[i]);
        szText += nLast > i ? "-" + std::to_string(rgPorts[nLast]) : "";
        i = nLast + 1;
    }
    return szText;
}

}  // namespace tavo::cli
