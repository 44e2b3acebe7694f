// Reads and writes the stored rules and compares their ports. Relies on the library's public header.
// Promises: see RuleStore.h.
#include "RuleStore.h"

#include <fmt/format.h>

#include <CLI/StringTools.hpp>
#include <algorithm>
#include <array>
#include <charconv>
#include <set>

#include "Box.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr int kPorts = 65536;
constexpr int kMaxNumber = 1'000'000'000;  // ids beyond it are not ours, and need no successor

constexpr char kBlanks[] = " \t\r";  // as the daemons have it

// A protocol as the daemons read it, in the one way that it is written here; what is none stays as it is.
std::string ProtocolOf(const std::string& szText) {
    const std::string szWord = CLI::detail::to_lower(CLI::detail::trim_copy(szText, kBlanks));
    if (szWord == "both" || szWord == "tcp_udp") {
        return "all";
    }
    return szWord == "tcp" || szWord == "udp" || szWord == "all" ? szWord : szText;
}

bool ReadRule(RouterRuleConfReader& reader, Rule& rule) {
    reader.GetRuleServiceName(rule.szName);
    const bool blRead =
        reader.GetRuleID(rule.szId) != 0 &&
        reader.GetRuleInfo(rule.blEnabled, rule.szRouterPorts, rule.szBoxPorts, rule.szProtocol, rule.szServiceId) != 0;
    rule.szProtocol = ProtocolOf(rule.szProtocol);
    return blRead;
}

std::optional<int> ParsePort(const std::string& szPadded) {
    // The library writes lists as "80, 443"; a line end is no blank to the daemons.
    const std::string szText = CLI::detail::trim_copy(szPadded, kBlanks);
    int nPort = 0;
    const char* pEnd = szText.data() + szText.size();
    const auto [pRead, error] = std::from_chars(szText.data(), pEnd, nPort);
    return error == std::errc() && pRead == pEnd && nPort >= 1 && nPort < kPorts ? std::optional(nPort) : std::nullopt;
}

// The earlier rule of each port of one protocol, as the rules are walked.
class Owners {
public:
    // Books szId's ports; the first one that another rule has, with that rule.
    void Book(const Rule& rule, const std::vector<int>& rgPorts, const char* szProtocol,
              std::vector<Overlap>& rgFound) {
        std::set<std::string> setNamed;
        for (const int nPort : rgPorts) {
            const Rule*& pOwner = mRgOwners[static_cast<size_t>(nPort)];
            if (pOwner == nullptr) {
                pOwner = &rule;
            } else if (pOwner != &rule && setNamed.insert(pOwner->szId).second) {
                rgFound.push_back({rule.szId, pOwner->szId, std::to_string(nPort) + "/" + szProtocol});
            }
        }
    }

private:
    std::vector<const Rule*> mRgOwners = std::vector<const Rule*>(kPorts);
};

}  // namespace

const char kUnreadable[] =
    "/etc/portforward/rule.conf cannot be read as rules; it was left as it is (the system log says where)";

std::optional<Rules> LoadRules() {
    // The library's own array cuts long values and lends a nameless rule the name of the one before it.
    RouterRuleConfReader reader(false);
    Rules rules;
    for (int nMore = reader.StartNextRule(); nMore != 0; nMore = reader.NextRule()) {
        Rule rule;
        if (!ReadRule(reader, rule)) {
            return std::nullopt;
        }
        rules.push_back(rule);
    }
    // An absent file and an unreadable one look the same to the reader, but not to the library, which refuses a rule
    // that is too long for its records.
    return !rules.empty() || LoadRecords() ? std::optional(rules) : std::nullopt;
}

std::optional<std::vector<__tag_TAVO_ROUTER_RULE>> LoadRecords() {
    int nRules = 0;
    __tag_TAVO_ROUTER_RULE* pRules = nullptr;
    if (TLibGetRulesArrFromRuleConf(&nRules, &pRules, nullptr, false, nullptr) != 0) {
        return std::nullopt;
    }
    std::vector<__tag_TAVO_ROUTER_RULE> rgRecords(pRules, pRules + nRules);
    TLibFreeRulesArr(pRules);
    return rgRecords;
}

std::string TooLong(const Rules& rules) {
    for (const Rule& rule : rules) {
        const bool blPorts = std::max(rule.szRouterPorts.size(), rule.szBoxPorts.size()) > kMostPortText;
        const size_t nText =
            std::max({rule.szId.size(), rule.szProtocol.size(), rule.szServiceId.size(), rule.szName.size()});
        if (blPorts || nText >= TAVO_TEXT_SIZE) {
            return fmt::format(
                "{} of rule {} is longer than {} bytes and would be cut: 'sudo tavoportmap rules list' shows it, {}. "
                "Nothing was changed",
                blPorts ? "a port list" : "a name", Clean(rule.szId), blPorts ? kMostPortText : TAVO_TEXT_SIZE - 1,
                blPorts ? "'rules edit' makes it shorter and 'rules add' takes the rest" : "'rules edit' changes it");
        }
    }
    return "";
}

std::optional<std::vector<__tag_TAVO_ROUTER_RULE>> ToRecords(const Rules& rules) {
    if (!TooLong(rules).empty()) {
        return std::nullopt;
    }
    std::vector<__tag_TAVO_ROUTER_RULE> rgRecords(rules.size());
    for (size_t i = 0; i < rules.size(); ++i) {
        const Rule& rule = rules[i];
        __tag_TAVO_ROUTER_RULE& record = rgRecords[i];
        record.blEnable = rule.blEnabled;
        if (!Put(record.szRuleID, rule.szId) || !Put(record.szProtocol, rule.szProtocol) ||
            !Put(record.szRouterPort, rule.szRouterPorts) || !Put(record.szSrcPort, rule.szBoxPorts) ||
            !Put(record.szServiceID, rule.szServiceId) || !Put(record.szServiceName, rule.szName)) {
            return std::nullopt;
        }
    }
    return rgRecords;
}

std::optional<std::vector<int>> ParsePorts(const std::string& szText) {
    std::vector<int> rgPorts;
    for (const std::string& szItem : CLI::detail::split(szText, ',')) {
        const size_t nDash = szItem.find('-');
        const auto nOne = ParsePort(szItem.substr(0, nDash));
        const auto nOther = nDash == std::string::npos ? nOne : ParsePort(szItem.substr(nDash + 1));
        if (!nOne || !nOther || rgPorts.size() >= kPorts) {
            return std::nullopt;
        }
        for (int nPort = std::min(*nOne, *nOther); nPort <= std::max(*nOne, *nOther); ++nPort) {
            rgPorts.push_back(nPort);
        }
    }
    return rgPorts;
}

std::string FaultOfPorts(const std::string& szText) {
    if (!ParsePorts(szText)) {
        return fmt::format("'{}' is no port list: write ports from 1 to 65535, such as 443, 80,443 or 5000-5010",
                           Clean(szText));
    }
    for (const std::string& szItem : CLI::detail::split(szText, ',')) {
        const size_t nDash = szItem.find('-');
        const auto nFirst = ParsePort(szItem.substr(0, nDash));
        const auto nLast = nDash == std::string::npos ? nFirst : ParsePort(szItem.substr(nDash + 1));
        if (*nFirst > *nLast) {
            return fmt::format("'{}' is a range written backwards; if you mean it, write {}-{}", Clean(szItem), *nLast,
                               *nFirst);
        }
    }
    return "";
}

std::vector<Overlap> OverlapsOf(const Rules& rules) {
    std::vector<Overlap> rgFound;
    Owners tcp, udp;
    for (const Rule& rule : rules) {
        const auto rgPorts = ParsePorts(rule.szRouterPorts);
        if (!rule.blEnabled || !rgPorts) {
            continue;
        }
        if (rule.szProtocol != "udp") {
            tcp.Book(rule, *rgPorts, "tcp", rgFound);
        }
        if (rule.szProtocol != "tcp") {
            udp.Book(rule, *rgPorts, "udp", rgFound);
        }
    }
    return rgFound;
}

int NumberOf(const std::string& szId) {
    int nId = 0;
    std::from_chars(szId.data(), szId.data() + szId.size(), nId);
    return nId < kMaxNumber ? std::max(nId, 0) : 0;
}

std::string NextId(const Rules& rules) {
    int nLast = 0;
    for (const Rule& rule : rules) {
        nLast = std::max(nLast, NumberOf(rule.szId));
    }
    return std::to_string(nLast + 1);
}

Json::Value ToJson(const Rule& rule) {
    Json::Value js;
    js["id"] = rule.szId;
    js["enabled"] = rule.blEnabled;
    js["protocol"] = rule.szProtocol;
    js["router_ports"] = rule.szRouterPorts;
    js["box_ports"] = rule.szBoxPorts;
    js["name"] = rule.szName;
    js["service_id"] = rule.szServiceId;
    return js;
}

Reply NoSuchRule(const Rules& rules, const std::string& szId) {
    std::vector<std::string> rgszIds;
    for (const Rule& rule : rules) {
        rgszIds.push_back(Clean(rule.szId));
    }
    return {.enExit = kUsage,
            .szMessage = fmt::format("there is no rule {}; {}", Clean(szId),
                                     rgszIds.empty() ? "none is stored" : "the rules are " + Join(rgszIds))};
}

}  // namespace tavo::cli
