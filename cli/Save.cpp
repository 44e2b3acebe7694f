// "save": the stored rules into the router. Relies on TLibSaveRules. Promises: the rules are read and
// written under one hold of the lock, so that none added meanwhile is lost; every status is explained,
// and what the user can do about it.
#include <fmt/format.h>

#include <algorithm>

#include "Box.h"
#include "Commands.h"
#include "Progress.h"
#include "RuleStore.h"

namespace tavo::cli {

namespace {

using SaveResult = __tag_TAVO_ROUTER_SAVE_RULE_RESULT;

std::string StepAt(int nPercent) {
    switch (nPercent) {
        case 20:
            return "checking the rules";
        case 40:
            return "collecting the rules";
        case 60:
            return "checking what the router holds";
        case 80:
            return "writing the rules to the router and waiting for it";
        case 90:
            return "reading back what the router refused";
        default:
            return "done";
    }
}

// The router as it is stored: what it is and how it is driven.
struct Stored {
    bool blAny = false;
    bool blThisGateway = false;
    std::string szBrand, szModel, szVersion;
    Way enWay = Way::kUnknown;
};

Stored ReadStored(const std::string& szGateway) {
    RouterConfReader reader;  // the section that saving goes by, whatever gateway it names
    Stored stored;
    std::string szSection, szUpnp, szNatpmp;
    stored.blAny = reader.GetSectionName(szSection) != 0 && !szSection.empty();
    stored.blThisGateway = stored.blAny && szSection == szGateway;
    reader.GetBrand(stored.szBrand);
    reader.GetModel(stored.szModel);
    reader.GetVersion(stored.szVersion);
    reader.GetSupportUpnp(szUpnp);
    reader.GetSupportNatpmp(szNatpmp);
    stored.enWay = szUpnp != "yes" && szNatpmp != "yes" ? Way::kManual : WayOf(szUpnp, szNatpmp);
    return stored;
}

constexpr char kDetect[] =
    "\n  tavoportmap detect --save                  asks the router and remembers the answer"
    "\n  tavoportmap router set --brand Acme --model R1 --version 1 --upnp yes"
    "\n                                             says it yourself, when detection cannot";

// Why a save without a status failed, as far as what is stored tells.
std::string WhyFailed(const Stored& stored, const std::string& szGateway) {
    const std::string szName = RouterName(stored.szBrand, stored.szModel, stored.szVersion);
    if (!stored.blAny) {
        return fmt::format("nothing is known of the router {} yet:{}", szGateway, kDetect);
    }
    if (!stored.blThisGateway) {
        return fmt::format("what is stored is about another router than {}:{}", szGateway, kDetect);
    }
    int nMaxRules = -1;
    if (stored.enWay == Way::kManual) {
        return RouterDB(szGateway).GetRouterDesc()
                   ? "the script that drives this router failed; the system log has the reason"
                   : fmt::format(
                         "there is no description of the router {}, which is driven through its own pages:"
                         "\n  tavoportmap routers                        shows the models that are known"
                         "\n  tavoportmap routers --update               fetches the newest descriptions"
                         "\n  tavoportmap router set --brand ... --model ... --version ..."
                         "\n                                             names one of them",
                         szName);
    }
    if (!RouterUpnpDB(stored.szBrand, stored.szModel, stored.szVersion).GetMaxRule(nMaxRules)) {
        return fmt::format(
            "nobody has recorded how many rules the router {} holds:"
            "\n  tavoportmap router set --max-rules 32      records it; 0 when no limit is known",
            szName);
    }
    return "the port-mapping daemon could not be started or did not answer; the system log says which:"
           "\n  journalctl -t tavoportmap -t upnpd -t natpmpd";
}

// Which ports the router refused, and what became of the others.
std::string WhyRefused(const SaveResult& result, Way enWay) {
    const std::string szPorts = Clean(result.szPortList);
    if (result.nStatus == 9) {
        return fmt::format(
            "the router refused these ports: {}\nThe other rules are in force. The reasons stand in "
            "/var/tmp/upnp_portmap.status",
            szPorts);
    }
    if (enWay == Way::kNatpmp) {
        return fmt::format(
            "the router would not give these ports as they were asked for: {}\nThe other rules are in "
            "force; choose other router ports for these",
            szPorts);
    }
    return fmt::format(
        "another device, or another program, already holds these ports on the router: {}\nThe other "
        "rules are in force; choose other router ports for these, or free them there",
        szPorts);
}

// Why the rules do not fit the router. Nothing has been changed then.
std::string WhyTooMany(const SaveResult& result, size_t nRules) {
    const std::string szHint = "\nNothing was changed; remove some rules";
    switch (result.nStatus) {
        case 7:
            return fmt::format("the router holds {} rules and there are {}", result.nLimit, nRules) + szHint;
        case 11:
            return fmt::format("the router holds {} entries, each one port or one range", result.nLimit) + szHint;
        case 12:
            return fmt::format("the router holds {} single ports and {} ranges", result.nLimit, result.nLimit2) +
                   szHint;
        default:
            return result.nLimit < 0 ? "the rules do not fit this router, whose description is contradictory" + szHint
                                     : fmt::format("the router holds {} single ports and no ranges", result.nLimit) +
                                           szHint + ", or write ranges as single ports";
    }
}

Reply Explain(const SaveResult& result, const std::string& szGateway, size_t nRules) {
    switch (result.nStatus) {
        case 2:
            return Busy();
        case 7:
        case 10:
        case 11:
        case 12: {
            Reply reply{.enExit = kTooMany, .szMessage = WhyTooMany(result, nRules)};
            reply.jsAnswer["limit"] = result.nLimit;
            if (result.nStatus == 12) {
                reply.jsAnswer["range_limit"] = result.nLimit2;
            }
            return reply;
        }
        case 8:
        case 9: {
            Reply reply{.enExit = kRefused, .szMessage = WhyRefused(result, ReadStored(szGateway).enWay)};
            reply.jsAnswer["ports"] = result.szPortList;
            return reply;
        }
        default:
            return Failure("the rules were not saved: " + WhyFailed(ReadStored(szGateway), szGateway));
    }
}

Reply Saved(const std::string& szGateway, const Rules& rules) {
    const auto nOn = std::count_if(rules.begin(), rules.end(), [](const Rule& rule) { return rule.blEnabled; });
    const std::string szCount = nOn == 1 ? "1 rule" : fmt::format("{} rules", nOn);
    if (nOn == 0) {
        return {.szMessage = fmt::format("no rule is switched on; the router {} keeps none of ours", szGateway)};
    }
    if (ReadStored(szGateway).enWay != Way::kManual) {
        return {.szMessage = fmt::format("{} in force on the router {}", szCount, szGateway)};
    }
    return {.szMessage = fmt::format("{} handed to the router {}", szCount, szGateway),
            .rgszWarnings = {"a router that is driven through its own pages does not say what it took: look at them, "
                             "or try a connection from outside"}};
}

Reply Save(bool blJson) {
    const auto szGateway = Gateway();
    if (!szGateway) {
        return NoGateway();
    }
    const Lock lock;
    if (!lock.IsHeld()) {
        Reply reply = Busy();
        reply.jsAnswer["status"] = 2;
        return reply;
    }
    const auto rules = LoadRules();
    auto rgRecords = rules ? ToRecords(*rules) : std::nullopt;
    if (!rgRecords) {
        return Failure(rules ? "a value in /etc/portforward/rule.conf is longer than the library takes" : kUnreadable);
    }
    SaveResult result = {};
    Progress progress(blJson);
    const int nResult = TLibSaveRules(
        szGateway->c_str(), static_cast<int>(rgRecords->size()), rgRecords->data(), false, &result,
        [](const SaveResult* pResult, void* pData) {
            static_cast<Progress*>(pData)->Show(pResult->nProgress, StepAt(pResult->nProgress));
        },
        &progress);
    progress.End();
    Reply reply = nResult == 0 ? Saved(*szGateway, *rules) : Explain(result, *szGateway, rules->size());
    reply.jsAnswer["status"] = result.nStatus;
    reply.jsAnswer["rules"] = static_cast<Json::UInt>(rules->size());
    return reply;
}

}  // namespace

void OfferSave(CLI::App& app, Request& request) {
    CLI::App* pSave = AddCommand(app, "save", "write the rules to the router and wait for its answer");
    pSave->footer(
        "The rules become the router's whole set of ours: what the rules no longer ask for is\n"
        "taken away, mappings of other devices stay. It can take minutes on a slow router.\n");
    pSave->callback([&request] { request.fnCommand = [&request] { return Save(request.blJson); }; });
}

}  // namespace tavo::cli
