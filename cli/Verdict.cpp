// Verdicts in words, and settings into their place. Relies on the library's public header. Promises: see
// Verdict.h.
#include "Verdict.h"

#include <fmt/format.h>

#include "Account.h"
#include "Pages.h"
#include "RuleStore.h"

namespace tavo::cli {

namespace {

struct Warning {
    int nFlag;
    const char* szText;
};

constexpr Warning kWarnings[] = {
    {1, "the gateway setting of this box looks wrong; compare it with the router's address ('ip route' shows it)"},
    {2, "it could not be found out whether another router stands between this one and the public network"},
    {4,
     "another router stands between this one and the public network, so an open port here is not reachable from "
     "outside (double NAT). One of these helps:\n"
     "  - switch the outer router to bridge (modem) mode;\n"
     "  - forward the same ports on the outer router, too;\n"
     "  - where the outer router is the provider's, ask the provider for a public address of your own"},
};

constexpr char kCarrier[] =
    "the provider translates addresses, too (carrier NAT, 100.64.0.0/10), so an open port here cannot be reached from "
    "outside over IPv4. One of these helps:\n"
    "  - ask the provider for a public IPv4 address of your own; many give one on request;\n"
    "  - use IPv6, where the provider has it;\n"
    "  - rent a small host elsewhere that passes connections on, or use a VPN that does";
constexpr int kManyTranslations = 4;

constexpr char kDescribed[] =
    ". A router that is driven through its own pages must be described, under just this brand, model and version: "
    "'tavoportmap routers' shows those that are";

std::string NatWords(int nLevel) {
    if (nLevel < 0) {
        return "unknown";
    }
    return nLevel == 0 ? "none; this box has a public address"
                       : fmt::format("{}{}", nLevel, nLevel == 1 ? ", as it should be" : "; one is too many");
}

Json::Value TextOrNull(const char* szText) {
    return *szText == '\0' ? Json::Value() : Json::Value(szText);
}

Json::Value ToJson(const DetectResult& result) {
    constexpr const char* kWays[] = {"unknown", "natpmp", "upnp", "manual"};
    Json::Value js;
    js["kind"] = kWays[static_cast<int>(WayOf(result))];
    js["upnp"] = SupportWord(result.enSupportUpnp);
    js["natpmp"] = SupportWord(result.enSupportNatpmp);
    js["brand"] = TextOrNull(result.szBrand);
    js["model"] = TextOrNull(result.szModel);
    js["version"] = TextOrNull(result.szVersion);
    js["user_setting_name"] = TextOrNull(result.szUserSettingName);
    js["description"] = TextOrNull(result.szUpnpPfPath);
    js["max_rules"] = result.nMaxRule < 0 ? Json::Value() : Json::Value(result.nMaxRule);
    return js;
}

}  // namespace

Way WayOf(const DetectResult& result) {
    return WayOf(SupportWord(result.enSupportUpnp), SupportWord(result.enSupportNatpmp));
}

std::string SupportWord(int enSupport) {
    char szWord[16] = "unknown";
    TLibSupportEnumToString(szWord, sizeof(szWord), static_cast<__tag_TAVO_ROUTER_SUPPORT>(enSupport));
    return szWord;
}

std::string CapacityWords(int nMaxRules) {
    return nMaxRules < 0 ? "unknown" : nMaxRules == 0 ? "no limit known" : fmt::format("{} rules", nMaxRules);
}

std::string OneLine(const DetectResult& result) {
    const std::string szName = RouterName(result.szBrand, result.szModel, result.szVersion);
    return ToWords(WayOf(result)) + (szName.empty() ? "" : ", " + szName);
}

bool CanBeReported() {
    DetectResult detected = {};
    const bool blWhole = TLibGetRouterDetectResult(&detected) == 0;
    const Way enWay = WayOf(detected);
    return blWhole && (enWay == Way::kUpnp || enWay == Way::kNatpmp);
}

void AddEnvironment(const DetectResult& result, const TAVO_NET_GATEWAY_WORD& word, Reply& reply) {
    constexpr const char* kKinds[] = {"unknown", "public", "private", "carrier"};
    reply.jsAnswer["gateway"] = TextOrNull(result.szGateway);
    reply.jsAnswer["interface"] = TextOrNull(result.szInterface);
    reply.jsAnswer["error_code"] = result.errCode;
    reply.jsAnswer["environment_flags"] = result.nEnvFlags;
    reply.jsAnswer["outside"] = TextOrNull(word.szOutside);
    reply.jsAnswer["outside_kind"] = kKinds[word.enOutside];
    const bool blCarrier = word.enOutside == TAVO_NET_ADDRESS_CARRIER;
    for (const Warning& warning : kWarnings) {
        if ((result.nEnvFlags & warning.nFlag) != 0 && !(blCarrier && warning.nFlag == kManyTranslations)) {
            reply.rgszWarnings.emplace_back(warning.szText);
        }
    }
    if (blCarrier) {
        reply.rgszWarnings.emplace_back(kCarrier);
    }
}

void DescribeVerdict(const DetectResult& result, const TAVO_NET_GATEWAY_WORD& word, Reply& reply) {
    AddEnvironment(result, word, reply);
    // Only a detection fills these; a remembered verdict has no surroundings.
    const bool blFresh = result.nProgress > 0;
    reply.jsAnswer["public_ip_level"] =
        blFresh && result.nPublicIPLevel >= 0 ? Json::Value(result.nPublicIPLevel) : Json::Value();
    reply.jsAnswer["router"] = ToJson(result);
    const std::string szInterface = Clean(result.szInterface);
    reply.szBody += Columns({
        {"gateway", Clean(result.szGateway) + (szInterface.empty() ? "" : " through " + szInterface)},
        {"driven by", WayOf(result) == Way::kManual ? "its own pages at best" : ToWords(WayOf(result))},
        {"UPnP", SupportWord(result.enSupportUpnp)},
        {"NAT-PMP", SupportWord(result.enSupportNatpmp)},
        {"brand", Clean(result.szBrand)},
        {"model", Clean(result.szModel)},
        {"version", Clean(result.szVersion)},
        {"its name", Clean(result.szUserSettingName)},
        {"description", Clean(result.szUpnpPfPath)},
        {"holds", WayOf(result) == Way::kManual ? "" : CapacityWords(result.nMaxRule)},
        {"address outside", Clean(word.szOutside)},
        {"NATs on the way out", blFresh ? NatWords(result.nPublicIPLevel) : ""},
    });
}

Reply StoreSettings(const std::string& szGateway, __tag_TAVO_ROUTER_CONF conf, int nMaxRules, bool blLocked) {
    std::optional<Lock> lock;
    if (!blLocked && !lock.emplace().IsHeld()) {
        return Busy();
    }
    const Way enWay = WayOf(conf.szSupportUpnp, conf.szSupportNatpmp);
    const bool blDaemon = enWay == Way::kUpnp || enWay == Way::kNatpmp;
    if (blDaemon && !KeepAccount(szGateway)) {
        return Failure(
            "nothing was changed: the account of the router's pages could not be put aside in "
            "/etc/portforward/router_account.conf; is the disk full or read-only ('df /etc')?");
    }
    // The error is 1 also after success: only the result tells, and the cause that has a number.
    auto enError = TAVO_LIBTAVOPORTMAP_ERR_FAILED;
    if (TLibSetRouterConf(szGateway.c_str(), &conf, &enError, false) != 0) {
        return Failure(enError == TAVO_LIBTAVOPORTMAP_ERR_SYNTAX_VERSION
                           ? "the router's description is newer than the tool that carries it out; update the tool "
                             "(/usr/tavo/bin/tavoportforward). The old settings are still there"
                           : "the settings could not be stored; the old ones are still there, and the system log says "
                             "why" +
                                 std::string(blDaemon ? "" : kDescribed));
    }
    if (!blDaemon) {
        DropAccount();
    }
    // Without a record nothing can be saved, not even where no limit is known.
    int nKnown = -1;
    if (blDaemon && nMaxRules < 0 && !RouterUpnpDB(conf.szBrand, conf.szModel, conf.szVersion).GetMaxRule(nKnown)) {
        nMaxRules = 0;
    }
    if (nMaxRules >= 0) {
        if (const auto szFault = RecordMaxRules(conf, nMaxRules)) {
            return Failure("the settings are stored, but " + *szFault);
        }
    }
    Reply reply{.szMessage =
                    fmt::format("stored as the settings of the router {}; 'sudo tavoportmap {}' writes the rules to it",
                                szGateway, IsOff() ? "on" : "save")};
    const auto left = blDaemon ? LeftByPages() : std::nullopt;
    if (left && !left->rgLeftOver.empty()) {
        reply.rgszWarnings.push_back(
            fmt::format("until then the router's own pages go on forwarding {}; the save has them take it away first",
                        NamesOf(left->rgLeftOver)));
    }
    return reply;
}

}  // namespace tavo::cli
