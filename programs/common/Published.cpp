// Writes the state of a daemon as JSON. Relies on jsoncpp. Promises: see Published.h.
#include "programs/common/Published.h"

#include <json/json.h>
#include <unistd.h>

#include "ground/SysLog.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr char kDirectory[] = "/run/tavo";
constexpr mode_t kFileMode = 0644;

std::string PathOf(const std::string& szDaemon) {
    return std::string(kDirectory) + "/" + szDaemon + ".json";
}

Json::Value TextOrNull(const std::string& szText) {
    return szText.empty() ? Json::Value() : Json::Value(szText);
}

Json::Value NumberOrNull(int64_t nNumber) {
    return nNumber == 0 ? Json::Value() : Json::Value(Json::Int64{nNumber});
}

Json::Value Until(const Verdict& verdict, time_t nAt) {
    return verdict.nLease == 0 ? Json::Value() : NumberOrNull(nAt + time_t{verdict.nLease});
}

Json::Value HolderOf(const Verdict& verdict) {
    Json::Value js;
    if (verdict.holder) {
        js["address"] = verdict.holder->szAddress;
        js["description"] = verdict.holder->szDescription;
    }
    return js;
}

Json::Value RuleRow(const Outcome& outcome, time_t nAt) {
    Json::Value js;
    js["name"] = outcome.szName;
    js["router_port"] = NumberOrNull(outcome.nRouterPort);
    js["box_port"] = NumberOrNull(outcome.nBoxPort);
    js["protocol"] = TextOrNull(ProtocolWord(outcome));
    js["rule"] = TextOrNull(outcome.szRule);
    js["state"] = PortWord(outcome.verdict.enState);
    js["word"] = outcome.verdict.szWord;
    js["why"] = TextOrNull(WhyOf(outcome.verdict));
    js["holder"] = HolderOf(outcome.verdict);
    js["since"] = NumberOrNull(outcome.nSince);
    js["until"] = Until(outcome.verdict, nAt);
    return js;
}

Json::Value LeftOverRow(const Outcome& outcome, const Published& state) {
    Json::Value js;
    js["name"] = outcome.szName;
    js["address"] = TextOrNull(outcome.szClient.empty() ? state.szBox : outcome.szClient);
    js["why"] = WhyOf(outcome.verdict);
    js["until"] = Until(outcome.verdict, state.nAt);
    return js;
}

}  // namespace

std::string PortWord(PortState enState) {
    switch (enState) {
        case PortState::kOpen:
            return "open";
        case PortState::kRefused:
            return "refused";
        case PortState::kWaiting:
            return "waiting";
        default:
            return "unknown";
    }
}

std::string ProtocolWord(const Outcome& outcome) {
    return outcome.szProtocol == "TCP" ? "tcp" : outcome.szProtocol == "UDP" ? "udp" : "";
}

std::string RouterWord(const Published& state) {
    switch (state.enRouter) {
        case RouterState::kOk:
            return "ok";
        case RouterState::kUnreachable:
            return "unreachable";
        case RouterState::kNoService:
            return state.szProtocol == "UPnP" ? "no_upnp" : "no_natpmp";
        case RouterState::kSilent:
            return "silent";
        case RouterState::kNoGateway:
            return "no_gateway";
        case RouterState::kBusy:
            return "busy";
        default:
            return "";
    }
}

std::string ToJson(const Published& state) {
    Json::Value js;
    js["protocol"] = state.szProtocol;
    js["pid"] = getpid();
    js["at"] = Json::Int64{state.nAt};
    js["switched_on"] = state.blSwitchedOn;
    js["rules_readable"] = state.blRulesReadable;
    js["gateway"] = TextOrNull(state.szGateway);
    js["gateway_hardware"] = TextOrNull(state.szHardware);
    js["box"] = TextOrNull(state.szBox);
    js["outside"] = TextOrNull(state.szOutside);
    js["router"] = TextOrNull(RouterWord(state));
    js["router_why"] = TextOrNull(state.szRouterWhy);
    js["router_since"] = NumberOrNull(state.nRouterSince);
    js["next_look"] = NumberOrNull(state.nNextLook);
    js["rules"] = js["left_over"] = Json::Value(Json::arrayValue);
    for (const Outcome& outcome : state.rgOutcomes) {
        if (outcome.blLeftOver) {
            js["left_over"].append(LeftOverRow(outcome, state));
        } else {
            js["rules"].append(RuleRow(outcome, state.nAt));
        }
    }
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    return Json::writeString(builder, js) + "\n";
}

void Publish(const Published& state) {
    if (!MakeDirectory(kDirectory) || !WriteFileAtomic(PathOf(state.szDaemon), ToJson(state), kFileMode)) {
        SysLog(LOG_ERR, "cannot write %s", PathOf(state.szDaemon).c_str());
    }
}

void Unpublish(const std::string& szDaemon) {
    unlink(PathOf(szDaemon).c_str());
}

}  // namespace tavo
