// "save": the stored rules into the router. Relies on TLibSaveRules. Promises: the rules are read and
// written under one hold of the lock, so that none added meanwhile is lost; every status is explained,
// and what the user can do about it.
#include <fmt/format.h>

#include <algorithm>

#include "Box.h"
#include "Commands.h"
#include "KeysGuard.h"
#include "Progress.h"
#include "RuleStore.h"
#include "StoredRouter.h"

namespace tavo::cli {

namespace {

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

// Why a save without a status failed, although nothing was in its way beforehand.
std::string WhyFailed(const StoredRouter& router) {
    return router.enWay == Way::kManual
               ? "the script that drives this router failed; the system log has the reason"
               : "the port-mapping daemon could not be started or did not answer; the system log says which:"
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

Reply Explain(const SaveResult& result, const StoredRouter& router, size_t nRules) {
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
            Reply reply{.enExit = kRefused, .szMessage = WhyRefused(result, router.enWay)};
            reply.jsAnswer["ports"] = result.szPortList;
            return reply;
        }
        default:
            return Failure("the rules were not saved: " + WhyFailed(router));
    }
}

Reply Saved(const std::string& szGateway, const StoredRouter& router, const Rules& rules) {
    const auto nOn = std::count_if(rules.begin(), rules.end(), [](const Rule& rule) { return rule.blEnabled; });
    const std::string szCount = nOn == 1 ? "1 rule" : fmt::format("{} rules", nOn);
    if (nOn == 0) {
        return {.szMessage = fmt::format("no rule is switched on; the router {} keeps none of ours", szGateway)};
    }
    if (router.enWay != Way::kManual) {
        return {.szMessage = fmt::format("{} in force on the router {}", szCount, szGateway)};
    }
    return {.szMessage = fmt::format("{} handed to the router {}", szCount, szGateway),
            .rgszWarnings = {"a router that is driven through its own pages does not say what it took: look at them, "
                             "or try a connection from outside"}};
}

// What the library is not asked for, since it would switch the daemons off before it refuses.
std::optional<Reply> Refused(const StoredRouter& router, const std::string& szGateway, const Rules& rules,
                             SaveResult& result) {
    if (const auto szWhy = WhyUnsavable(router, szGateway)) {
        return Failure("the rules were not saved: " + *szWhy);
    }
    return Fits(router, szGateway, rules, result) ? std::nullopt : std::optional(Explain(result, router, rules.size()));
}

int CallLibrary(const std::string& szGateway, std::vector<__tag_TAVO_ROUTER_RULE>& rgRecords, bool blJson,
                SaveResult& result) {
    Progress progress(blJson);
    return TLibSaveRules(
        szGateway.c_str(), static_cast<int>(rgRecords.size()), rgRecords.data(), false, &result,
        [](const SaveResult* pResult, void* pData) {
            static_cast<Progress*>(pData)->Show(pResult->nProgress, StepAt(pResult->nProgress));
        },
        &progress);
}

Reply SaveRecords(const std::string& szGateway, const Rules& rules, std::vector<__tag_TAVO_ROUTER_RULE>& rgRecords,
                  bool blJson) {
    SaveResult result = {};
    const StoredRouter router = ReadStoredRouter();
    Reply reply;
    if (const auto refused = Refused(router, szGateway, rules, result)) {
        reply = *refused;
    } else {
        KeysGuard keys;
        if (keys.Obstacle()) {
            return *keys.Obstacle();
        }
        const int nResult = CallLibrary(szGateway, rgRecords, blJson, result);
        if (nResult == 0) {
            keys.Keep();
        }
        reply = nResult == 0 ? Saved(szGateway, router, rules) : Explain(result, router, rules.size());
    }
    reply.jsAnswer["status"] = result.nStatus;
    return reply;
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
    Reply reply = SaveRecords(*szGateway, *rules, *rgRecords, blJson);
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
