// One notice, told everywhere. Relies on the event log's catalogue for its words. Promises: see Teller.h.
#include "programs/common/Teller.h"

#include <utility>

#include "ground/Catalogue.h"
#include "ground/SysLog.h"
#include "tavo/log.h"

namespace tavo {

namespace {

constexpr int kSystemEvents = 1;
constexpr int kInformation = 1;
constexpr int kWarning = 2;

struct Kind {
    Change enChange;
    const char* szName;  // as hooks know it
    unsigned nEvent;
    bool blWorse;
};
constexpr Kind kKinds[] = {{Change::kPortLost, "port-lost", TAVO_EVENT_PF_PORT_LOST, true},
                           {Change::kPortRefused, "port-refused", TAVO_EVENT_PF_PORT_REFUSED, true},
                           {Change::kPortBack, "port-back", TAVO_EVENT_PF_PORT_BACK, false},
                           {Change::kRouterGone, "router-gone", TAVO_EVENT_PF_ROUTER_GONE, true},
                           {Change::kRouterBack, "router-back", TAVO_EVENT_PF_ROUTER_BACK, false},
                           {Change::kRouterReplaced, "router-replaced", TAVO_EVENT_PF_ROUTER_REPLACED, false},
                           {Change::kAddressChanged, "address-changed", TAVO_EVENT_PF_ADDRESS_CHANGED, false},
                           {Change::kRenewed, "renewed", TAVO_EVENT_PF_RENEWED, false}};

const Kind& KindOf(Change enChange) {
    const Kind* pFound = kKinds;
    for (const Kind& kind : kKinds) {
        pFound = kind.enChange == enChange ? &kind : pFound;
    }
    return *pFound;
}

std::string SentenceOf(const Notice& notice) {
    return EventMessage(KindOf(notice.enChange).nEvent) + notice.szText;
}

}  // namespace

std::vector<std::string> HookFacts(const Notice& notice, const Published& state) {
    // A notice of several ports names none of them here; its text lists them.
    const Outcome port = notice.rgPorts.size() == 1 ? notice.rgPorts.front() : Outcome();
    const Holder holder = port.verdict.holder.value_or(Holder());
    const auto fnNumber = [](uint16_t nPort) { return nPort == 0 ? "" : std::to_string(nPort); };
    const std::string szWhy = notice.enChange == Change::kRouterGone ? state.szRouterWhy : WhyOf(port.verdict);
    const std::pair<const char*, std::string> rgFacts[] = {{"EVENT", KindOf(notice.enChange).szName},
                                                           {"TEXT", SentenceOf(notice)},
                                                           {"DAEMON", state.szDaemon},
                                                           {"GATEWAY", state.szGateway},
                                                           {"OUTSIDE", state.szOutside},
                                                           {"OUTSIDE_BEFORE", notice.szOutsideBefore},
                                                           {"PORT", fnNumber(port.nRouterPort)},
                                                           {"PROTOCOL", ProtocolWord(port)},
                                                           {"BOX_PORT", fnNumber(port.nBoxPort)},
                                                           {"RULE", port.szRule},
                                                           {"WHY", szWhy},
                                                           {"HOLDER", holder.szAddress},
                                                           {"HOLDER_DESCRIPTION", holder.szDescription}};
    std::vector<std::string> rgTexts;
    for (const auto& [szName, szValue] : rgFacts) {
        rgTexts.push_back(std::string("TAVO_") + szName + "=" + szValue);
    }
    return rgTexts;
}

void Teller::Tell(const Notice& notice, const Published& state) {
    const Kind& kind = KindOf(notice.enChange);
    SysLog(kind.blWorse ? LOG_WARNING : LOG_NOTICE, "%s", SentenceOf(notice).c_str());
    if (TAVOLogSet1(kSystemEvents, kind.blWorse ? kWarning : kInformation, kind.nEvent, notice.szText.c_str(), nullptr,
                    nullptr, nullptr) != 0) {
        SysLog(LOG_ERR, "the event log could not be written");
    }
    mHooks.Run(HookFacts(notice, state));
}

}  // namespace tavo
