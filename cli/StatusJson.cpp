// A situation for scripts. Relies on jsoncpp. Promises: see StatusView.h.
#include "StatusView.h"

namespace tavo::cli {

namespace {

Json::Value TextOrNull(const std::string& szText) {
    return szText.empty() ? Json::Value() : Json::Value(szText);
}

Json::Value NumberOrNull(const std::optional<int64_t>& nNumber) {
    return nNumber ? Json::Value(Json::Int64{*nNumber}) : Json::Value();
}

Json::Value HolderJson(const std::optional<PublishedHolder>& holder) {
    Json::Value js;
    if (holder) {
        js["address"] = holder->szAddress;
        js["description"] = holder->szDescription;
    }
    return js;
}

Json::Value FactJson(const PortFact& fact) {
    Json::Value js;
    js["router_port"] = fact.pair.nRouter;
    js["box_port"] = fact.pair.nBox;
    js["protocol"] = fact.pair.szProtocol;
    js["state"] = ToWord(fact.enFate);
    js["why"] = TextOrNull(fact.szWhy);
    js["holder"] = HolderJson(fact.holder);
    js["since"] = NumberOrNull(fact.nSince);
    js["until"] = NumberOrNull(fact.nUntil);
    return js;
}

Json::Value RuleJson(const RuleFact& fact) {
    Json::Value js = ToJson(fact.rule);
    js["state"] = ToWord(fact.enFate);
    js["why"] = TextOrNull(fact.szWhy);
    js["ports"] = Json::arrayValue;
    for (const PortFact& port : fact.rgPorts) {
        js["ports"].append(FactJson(port));
    }
    return js;
}

Json::Value RulesJson(const Rules& rules) {
    Json::Value js = Json::arrayValue;
    for (const Rule& rule : rules) {
        js.append(ToJson(rule));
    }
    return js;
}

Json::Value DaemonJson(const Daemon& daemon) {
    Json::Value js;
    js["switched_on"] = daemon.blSwitchedOn;
    js["running"] = daemon.blAlive;
    js["unit"] = Json::Value();
    if (daemon.unit) {
        js["unit"]["active"] = daemon.unit->szActive;
        js["unit"]["enabled"] = TextOrNull(daemon.unit->szEnabled);
        js["unit"]["result"] = TextOrNull(daemon.unit->szResult);
    }
    return js;
}

Json::Value LookJson(const Situation& situation) {
    const Published* pWord = situation.Word();
    if (pWord == nullptr) {
        return {};
    }
    const Daemon* pKeeper = situation.Keeper();
    Json::Value js;
    js["at"] = Json::Int64{pWord->nAt};
    js["next"] = NumberOrNull(pWord->nNextLook);
    js["late"] = pKeeper != nullptr && pKeeper->IsLate(situation.nNow);
    js["router"] = TextOrNull(pWord->szRouter);
    js["router_why"] = TextOrNull(pWord->szRouterWhy);
    js["router_since"] = NumberOrNull(pWord->nRouterSince);
    return js;
}

Json::Value SettingsJson(const Situation& situation) {
    constexpr const char* kWays[] = {"unknown", "natpmp", "upnp", "manual"};
    const StoredRouter& settings = situation.settings;
    if (!settings.blAny) {
        return {};
    }
    Json::Value js;
    js["gateway"] = settings.szSection;
    js["brand"] = settings.szBrand;
    js["model"] = settings.szModel;
    js["version"] = settings.szVersion;
    js["driven_by"] = kWays[static_cast<int>(settings.enWay)];
    return js;
}

Json::Value DetectedJson(const Situation& situation) {
    if (!situation.detected) {
        return {};
    }
    const DetectResult& result = *situation.detected;
    Json::Value js;
    js["upnp"] = SupportWord(result.enSupportUpnp);
    js["natpmp"] = SupportWord(result.enSupportNatpmp);
    js["brand"] = result.szBrand;
    js["model"] = result.szModel;
    js["version"] = result.szVersion;
    return js;
}

Json::Value OutsideJson(const Situation& situation) {
    Json::Value js;
    js["address"] = TextOrNull(situation.Outside());
    js["kind"] = ToWord(ReachOf(situation.Outside()));
    return js;
}

Json::Value LeftOverJson(const Situation& situation) {
    Json::Value js = Json::arrayValue;
    for (const PublishedLeftOver& left : situation.LeftOver()) {
        Json::Value jsLeft;
        jsLeft["name"] = left.szName;
        jsLeft["address"] = TextOrNull(left.szAddress);
        jsLeft["why"] = TextOrNull(left.szWhy);
        jsLeft["until"] = NumberOrNull(left.nUntil);
        js.append(jsLeft);
    }
    return js;
}

// Null where the router was not asked.
Json::Value OthersJson(const Situation& situation, const Judgement& judgement) {
    if (!situation.live) {
        return {};
    }
    Json::Value js = Json::arrayValue;
    for (const LiveEntry& entry : judgement.rgOthers) {
        js.append(ToJson(entry));
    }
    return js;
}

}  // namespace

Json::Value ToJson(const Situation& situation, const Judgement& judgement) {
    const StoredRules& rules = situation.rules;
    const Daemon* pKeeper = situation.Keeper();
    Json::Value js;
    js["standing"] = ToWord(judgement.enStanding);
    js["at"] = Json::Int64{situation.nNow};
    js["gateway"] = TextOrNull(situation.szGateway.value_or(""));
    js["box"] = TextOrNull(situation.szBox);
    js["ipv6"] = TextOrNull(situation.szIpv6);
    js["settings"] = SettingsJson(situation);
    js["last_detection"] = DetectedJson(situation);
    js["outside"] = OutsideJson(situation);
    js["kept_by"] = pKeeper != nullptr ? Json::Value(pKeeper->szName)
                                       : (situation.IsByPages() ? Json::Value("pages") : Json::Value());
    js["upnpd"] = DaemonJson(situation.upnpd);
    js["natpmpd"] = DaemonJson(situation.natpmpd);
    js["last_look"] = LookJson(situation);
    js["asked_now"] = situation.blAsked ? Json::Value(situation.live.has_value()) : Json::Value();
    js["rules"] = Json::arrayValue;
    for (const RuleFact& fact : judgement.rgRules) {
        js["rules"].append(RuleJson(fact));
    }
    js["rules_readable"] = !rules.blHidden && rules.inForce.has_value();
    js["draft"] = rules.draft ? RulesJson(*rules.draft) : Json::Value();
    js["off"] = rules.off ? RulesJson(*rules.off) : Json::Value();
    js["left_over"] = LeftOverJson(situation);
    js["others"] = OthersJson(situation, judgement);
    js["running"] = situation.running.szWord;
    js["running_program"] = TextOrNull(situation.running.szProgram);
    return js;
}

}  // namespace tavo::cli
