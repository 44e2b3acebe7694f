// Reads rules that somebody else wrote, and words that name rules. Relies on jsoncpp. Promises: see RuleImport.h.
#include "RuleImport.h"

#include <fmt/format.h>

#include <algorithm>
#include <functional>

#include "JsonText.h"
#include "PortNames.h"
#include "PortPairs.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

// ---- import ------------------------------------------------------------------------------------------------

const std::vector<std::string> kMembers = {"id",        "enabled", "protocol",   "router_ports",
                                           "box_ports", "name",    "service_id", "change"};

std::string ReadMember(const Json::Value& js, const char* szMember, std::string& szText) {
    const Json::Value& jsMember = js[szMember];
    if (jsMember.isUInt()) {  // 443 as well as "443"
        szText = std::to_string(jsMember.asUInt());
    } else if (jsMember.isString()) {
        szText = jsMember.asString();
    } else if (!jsMember.isNull()) {
        return fmt::format("\"{}\" is neither a text nor a number", szMember);
    }
    return "";
}

std::string ReadRule(const Json::Value& js, Rule& rule) {
    if (!js.isObject()) {
        return "it is no object in braces";
    }
    for (const std::string& szMember : js.getMemberNames()) {
        if (std::find(kMembers.begin(), kMembers.end(), szMember) == kMembers.end()) {
            const std::string szNearest = Nearest(szMember, kMembers);
            return fmt::format("\"{}\" means nothing{}", Clean(szMember),
                               szNearest.empty() ? "" : fmt::format("; did you mean \"{}\"?", szNearest));
        }
    }
    rule.szProtocol = "tcp";
    for (const auto& [szMember, pSzField] :
         std::initializer_list<std::pair<const char*, std::string*>>{{"router_ports", &rule.szRouterPorts},
                                                                     {"box_ports", &rule.szBoxPorts},
                                                                     {"protocol", &rule.szProtocol},
                                                                     {"name", &rule.szName},
                                                                     {"service_id", &rule.szServiceId}}) {
        if (const std::string szFault = ReadMember(js, szMember, *pSzField); !szFault.empty()) {
            return szFault;
        }
    }
    if (js.isMember("enabled") && !js["enabled"].isBool()) {
        return "\"enabled\" is neither true nor false";
    }
    rule.blEnabled = js.get("enabled", true).asBool();
    rule.szBoxPorts = rule.szBoxPorts.empty() ? rule.szRouterPorts : rule.szBoxPorts;
    return rule.szRouterPorts.empty() ? "\"router_ports\" is missing" : FaultOf(rule);
}

// ---- choosing ----------------------------------------------------------------------------------------------

std::vector<size_t> Matching(const Rules& rules, const std::function<bool(const Rule&)>& fnMatches) {
    std::vector<size_t> rgFound;
    for (size_t i = 0; i < rules.size(); ++i) {
        if (fnMatches(rules[i])) {
            rgFound.push_back(i);
        }
    }
    return rgFound;
}

bool Forwards(const Rule& rule, const std::vector<PortPair>& rgWished) {
    const auto rgPairs = PairsOf(rule);
    return rgPairs && std::any_of(rgPairs->begin(), rgPairs->end(), [&](const PortPair& pair) {
               return std::any_of(rgWished.begin(), rgWished.end(),
                                  [&](const PortPair& wished) { return pair.Name() == wished.Name(); });
           });
}

std::string Ids(const Rules& rules, const std::vector<size_t>& rgFound) {
    std::vector<std::string> rgszIds;
    for (const size_t nRule : rgFound) {
        rgszIds.push_back(Clean(rules[nRule].szId));
    }
    return Join(rgszIds);
}

}  // namespace

std::string FaultOf(const Rule& rule) {
    for (const std::string& szPorts : {rule.szRouterPorts, rule.szBoxPorts}) {
        if (const std::string szFault = FaultOfPorts(szPorts); !szFault.empty()) {
            return szFault;
        }
    }
    std::vector<int> rgRouter = *ParsePorts(rule.szRouterPorts);
    const size_t nBox = ParsePorts(rule.szBoxPorts)->size();
    if (rgRouter.size() != nBox) {
        return fmt::format("{} router ports but {} box ports: each router port needs one box port", rgRouter.size(),
                           nBox);
    }
    std::sort(rgRouter.begin(), rgRouter.end());
    if (const auto pTwice = std::adjacent_find(rgRouter.begin(), rgRouter.end()); pTwice != rgRouter.end()) {
        return fmt::format("router port {} is named twice, and can lead to one port only", *pTwice);
    }
    if (rule.szProtocol != "tcp" && rule.szProtocol != "udp" && rule.szProtocol != "all") {
        return fmt::format("'{}' is none of tcp, udp, all", Clean(rule.szProtocol));
    }
    if (rule.szName.find('\0') != std::string::npos || rule.szServiceId.find('\0') != std::string::npos) {
        return "a name cannot hold a NUL character";
    }
    const size_t nPorts = std::max(rule.szRouterPorts.size(), rule.szBoxPorts.size());
    const size_t nNames = std::max(rule.szName.size(), rule.szServiceId.size());
    return nPorts > kMostPortText
               ? fmt::format("a port list is {} bytes long; {} is the most that a rule can hold", nPorts, kMostPortText)
           : nNames >= TAVO_TEXT_SIZE
               ? fmt::format("a name is {} bytes long; {} is the most that a rule can hold", nNames, TAVO_TEXT_SIZE - 1)
               : "";
}

std::optional<Rules> ReadImport(const std::string& szText, std::string& szFault) {
    std::string szErrors;
    const auto js = ReadJson(szText, &szErrors);
    if (!js) {
        szFault = "this is no JSON document that can be taken: " + Clean(szErrors);
        return std::nullopt;
    }
    const Json::Value& jsRules = js->isObject() ? (*js)["rules"] : *js;
    if (!jsRules.isArray()) {
        szFault = "there is no list of rules in this document, neither by itself nor under \"rules\"";
        return std::nullopt;
    }
    Rules rules;
    for (const Json::Value& jsRule : jsRules) {
        rules.emplace_back();
        if (const std::string szWhy = ReadRule(jsRule, rules.back()); !szWhy.empty()) {
            szFault = fmt::format("rule {} of the document: {}", rules.size(), szWhy);
            return std::nullopt;
        }
    }
    return rules;
}

Choice Choose(const Rules& rules, const std::string& szWhich) {
    auto rgFound = Matching(rules, [&](const Rule& rule) { return rule.szId == szWhich; });
    if (!rgFound.empty()) {
        return {rgFound.front()};
    }
    rgFound = Matching(rules, [&](const Rule& rule) { return rule.szName == szWhich; });
    if (rgFound.size() > 1) {
        return {.szFault = fmt::format("several rules are called '{}': say which by its id ({})", Clean(szWhich),
                                       Ids(rules, rgFound))};
    }
    const auto wish = rgFound.empty() ? ReadPortWish(szWhich) : std::nullopt;
    if (wish) {
        const auto rgPairs = PairsOf(
            {"", true, wish->szProtocol.empty() ? "all" : wish->szProtocol, wish->szPorts, wish->szPorts, "", ""});
        rgFound = Matching(rules, [&](const Rule& rule) { return Forwards(rule, *rgPairs); });
        if (rgFound.size() > 1) {
            return {.szFault = fmt::format("several rules forward '{}': say which by its id ({})", Clean(szWhich),
                                           Ids(rules, rgFound))};
        }
        if (!rgFound.empty() &&
            ParsePorts(rules[rgFound.front()].szRouterPorts)->size() > ParsePorts(wish->szPorts)->size()) {
            return {.szFault = fmt::format("rule {} forwards more than '{}': name it by its id to change all of it, or "
                                           "'sudo tavoportmap close {}' closes that port alone",
                                           Clean(rules[rgFound.front()].szId), Clean(szWhich), Clean(szWhich))};
        }
    }
    return rgFound.empty() ? Choice{.szFault = NoSuchRule(rules, szWhich).szMessage} : Choice{rgFound.front()};
}

}  // namespace tavo::cli
