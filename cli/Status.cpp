// "status": the box, its router and what is running, at one look. Relies on the library's readers.
// Promises: takes no lock, changes no file, waits for nobody.
#include <fmt/format.h>

#include <algorithm>

#include "Box.h"
#include "Commands.h"
#include "RuleStore.h"
#include "Verdict.h"

namespace tavo::cli {

namespace {

struct Daemons {
    bool blUpnp = UpnpDaemon().IsAlive();
    bool blNatpmp = NatpmpDaemon().IsAlive();

    std::string ToText() const {
        return blUpnp && blNatpmp ? "upnpd and natpmpd run"
               : blUpnp           ? "upnpd runs and keeps the mappings"
               : blNatpmp         ? "natpmpd runs and keeps the mappings"
                                  : "none runs; nobody keeps mappings on the router";
    }
};

// What router.conf says of this gateway.
void AddSettings(const std::string& szGateway, Reply& reply,
                 std::vector<std::pair<std::string, std::string>>& rgLines) {
    RouterConfReader reader(szGateway);
    bool blExist = false;
    reply.jsAnswer["router"] = Json::Value();
    if (reader.IsSectionExist(blExist) == 0 || !blExist) {
        rgLines.emplace_back("settings", "none yet; 'tavoportmap setup' finds out what the router is");
        return;
    }
    std::string szBrand, szModel, szVersion, szUpnp, szNatpmp;
    reader.GetBrand(szBrand);
    reader.GetModel(szModel);
    reader.GetVersion(szVersion);
    reader.GetSupportUpnp(szUpnp);
    reader.GetSupportNatpmp(szNatpmp);
    Json::Value& js = reply.jsAnswer["router"];
    js["brand"] = szBrand;
    js["model"] = szModel;
    js["version"] = szVersion;
    js["upnp"] = szUpnp;
    js["natpmp"] = szNatpmp;
    const Way enWay = szUpnp != "yes" && szNatpmp != "yes" ? Way::kManual : WayOf(szUpnp, szNatpmp);
    const std::string szName = RouterName(szBrand, szModel, szVersion);
    rgLines.emplace_back("settings", (szName.empty() ? "" : szName + ", ") + "driven by " + ToWords(enWay));
}

std::string LastVerdict(Reply& reply) {
    DetectResult result = {};
    reply.jsAnswer["last_detection"] = Json::Value();
    const bool blComplete = TLibGetRouterDetectResult(&result) == 0;
    // A router whose limit is unknown fails the call; what was found is there all the same.
    const bool blFound = blComplete || WayOf(result) == Way::kUpnp || WayOf(result) == Way::kNatpmp;
    if (!blFound || (WayOf(result) == Way::kUnknown && *result.szBrand == '\0')) {
        return "none, or without a result";
    }
    reply.jsAnswer["last_detection"]["upnp"] = SupportWord(result.enSupportUpnp);
    reply.jsAnswer["last_detection"]["natpmp"] = SupportWord(result.enSupportNatpmp);
    reply.jsAnswer["last_detection"]["brand"] = result.szBrand;
    reply.jsAnswer["last_detection"]["model"] = result.szModel;
    reply.jsAnswer["last_detection"]["version"] = result.szVersion;
    return OneLine(result);
}

std::string RuleWords(Reply& reply) {
    const auto rules = LoadRules();
    reply.jsAnswer["rules"] = rules ? Json::Value(static_cast<Json::UInt>(rules->size())) : Json::Value();
    if (!rules) {
        reply.rgszWarnings.emplace_back(kUnreadable);
        return "unreadable";
    }
    const auto nOff = std::count_if(rules->begin(), rules->end(), [](const Rule& rule) { return !rule.blEnabled; });
    return fmt::format("{}{}", rules->size(), nOff == 0 ? "" : fmt::format(", {} of them switched off", nOff));
}

std::string RunningWords(Reply& reply) {
    constexpr const char* kTasks[] = {"nothing", "a UPnP compatibility test", "saving rules"};
    constexpr const char* kNames[] = {"idle", "testing", "saving"};
    auto enTask = TAVO_LIBTAVOPORTMAP_TASK_IDLE;
    TLibGetLibTavoPortMapRunningTask(&enTask);
    reply.jsAnswer["running"] = kNames[enTask];
    return kTasks[enTask];
}

Reply Status() {
    const auto szGateway = Gateway();
    Reply reply;
    std::vector<std::pair<std::string, std::string>> rgLines;
    reply.jsAnswer["gateway"] = szGateway ? Json::Value(*szGateway) : Json::Value();
    rgLines.emplace_back("gateway", szGateway.value_or("none"));
    AddSettings(szGateway.value_or(""), reply, rgLines);
    rgLines.emplace_back("last detection", LastVerdict(reply));
    rgLines.emplace_back("rules", RuleWords(reply));
    const Daemons daemons;
    reply.jsAnswer["upnpd"] = daemons.blUpnp;
    reply.jsAnswer["natpmpd"] = daemons.blNatpmp;
    rgLines.emplace_back("daemon", daemons.ToText());
    rgLines.emplace_back("running now", RunningWords(reply));
    reply.szBody = Columns(rgLines);
    if (!szGateway) {
        reply.enExit = kFailed;
        reply.szMessage = NoGateway().szMessage;
    }
    return reply;
}

}  // namespace

void OfferStatus(CLI::App& app, Request& request) {
    AddCommand(app, "status", "the gateway, what is known of it, what is running")->callback([&request] {
        request.fnCommand = &Status;
    });
}

}  // namespace tavo::cli
