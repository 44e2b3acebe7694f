// Looks before a save. Relies on the library's readers and databases. Promises: see StoredRouter.h.
#include "StoredRouter.h"

#include <fmt/format.h>

#include "tavo/portforward.h"

namespace tavo::cli {

namespace {

constexpr char kFindOut[] =
    "\n  sudo tavoportmap setup                     asks the router, tests it and remembers the answer"
    "\n  sudo tavoportmap router set --brand BRAND --model MODEL --upnp yes"
    "\n                                             says it yourself, when it cannot be found out";

constexpr char kFetch[] = "\n  sudo tavoportmap routers --update          fetches the newest descriptions";

// Which limit of the pages is in the way, as the library reports it: by the limits alone.
void ReportPages(RouterDB& db, int nMaxPort, int nMaxRange, SaveResult& result) {
    bool blRangePage = false;
    db.IsSupportPageRange(blRangePage);
    result.nLimit = nMaxPort;
    if (nMaxRange != 0 && nMaxPort > 0 && nMaxRange > 0) {
        result.nStatus = TAVO_ROUTER_STATUS_RANGE_LIMIT;
        result.nLimit2 = nMaxRange;
    } else if (nMaxRange != 0) {
        result.nStatus = TAVO_ROUTER_STATUS_PORT_LIMIT;
        result.nLimit = -1;
    } else {
        result.nStatus = blRangePage ? TAVO_ROUTER_STATUS_NO_RANGE_PAGE : TAVO_ROUTER_STATUS_PORT_LIMIT;
    }
}

// A router that is driven through its pages holds so many single ports and so many ranges.
bool FitsPages(const std::string& szGateway, const Rules& rules, SaveResult& result) {
    RouterDB db(szGateway);
    RouterRuleConfWriter writer;
    for (const Rule& rule : rules) {
        writer.AddRule(rule.szId, rule.blEnabled, rule.szRouterPorts, rule.szBoxPorts, rule.szProtocol,
                       rule.szServiceId, rule.szName);
    }
    int nMaxPort = 0, nMaxRange = 0, nPorts = 0, nRanges = 0;
    if (!db.GetMaxPorts(nMaxPort) || !db.GetMaxRange(nMaxRange) || writer.GetPorts(nPorts, szGateway) == 0 ||
        writer.GetRange(nRanges, szGateway) == 0 || (nMaxPort >= nPorts && nMaxRange >= nRanges)) {
        return true;  // what cannot be counted is not what is in the way
    }
    ReportPages(db, nMaxPort, nMaxRange, result);
    return false;
}

}  // namespace

StoredRouter ReadStoredRouter() {
    RouterConfReader reader;  // the section that saving goes by, whatever gateway it names
    StoredRouter stored;
    std::string szUpnp, szNatpmp;
    stored.blAny = reader.GetSectionName(stored.szSection) != 0 && !stored.szSection.empty();
    reader.GetBrand(stored.szBrand);
    reader.GetModel(stored.szModel);
    reader.GetVersion(stored.szVersion);
    reader.GetSupportUpnp(szUpnp);
    reader.GetSupportNatpmp(szNatpmp);
    stored.enWay = szUpnp != "yes" && szNatpmp != "yes" ? Way::kManual : WayOf(szUpnp, szNatpmp);
    return stored;
}

std::optional<std::string> WhyUnsavable(const StoredRouter& router, const std::string& szGateway) {
    if (!router.blAny) {
        return fmt::format("nothing is known of the router {} yet:{}", szGateway, kFindOut);
    }
    if (router.szSection != szGateway) {
        return fmt::format("what is stored is about another router ({}) than {}:{}", Clean(router.szSection), szGateway,
                           kFindOut);
    }
    int nMaxRules = -1;
    if (router.enWay == Way::kManual) {
        return RouterDB(szGateway).GetRouterDesc()
                   ? std::nullopt
                   : std::optional(
                         fmt::format("there is no description of the router {}, which is driven through its own pages:"
                                     "\n  tavoportmap routers                        shows the models that are known{}"
                                     "\n  sudo tavoportmap router set --brand ... --model ... --version ..."
                                     "\n                                             names one of them",
                                     router.Name(), *GetRouterDBPath() == '\0' ? "" : kFetch));
    }
    if (!RouterUpnpDB(router.szBrand, router.szModel, router.szVersion).GetMaxRule(nMaxRules)) {
        return fmt::format(
            "nobody has recorded how many rules the router {} holds:"
            "\n  sudo tavoportmap router set --max-rules 32  records it; 0 when no limit is known",
            router.Name());
    }
    return std::nullopt;
}

bool Fits(const StoredRouter& router, const std::string& szGateway, const Rules& rules, SaveResult& result) {
    if (router.enWay == Way::kManual) {
        return FitsPages(szGateway, rules, result);
    }
    int nMaxRules = 0;
    const bool blKnown = RouterUpnpDB(router.szBrand, router.szModel, router.szVersion).GetMaxRule(nMaxRules);
    if (!blKnown || nMaxRules < 1 || rules.size() <= static_cast<size_t>(nMaxRules)) {
        return true;
    }
    result.nStatus = TAVO_ROUTER_STATUS_TOO_MANY_RULES;
    result.nLimit = nMaxRules;
    return false;
}

}  // namespace tavo::cli
