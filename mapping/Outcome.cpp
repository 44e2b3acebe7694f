// The words for what became of a mapping. Relies on nothing. Promises: see Outcome.h.
#include "mapping/Outcome.h"

#include <algorithm>
#include <string_view>
#include <utility>

namespace tavo {

namespace {

constexpr std::pair<std::string_view, const char*> kWhy[] = {
    {"718", "another device has this port on the router"},
    {"402", "the router does not accept this port, or not with a lease"},
    {"501", "the router failed to open it"},
    {"606", "the router does not allow it"},
    {"716", "the router does not accept this port"},
    {"724", "the router wants the same port on both sides"},
    {"728", "the router's table of ports is full"},
    {"729", "the router uses this port itself, or forwards it by a setting of its own"},
    {"lost", "the router said yes and does not keep it; its table may be full"},
    {"kept", "the router says yes to its removal, and keeps it"},
    {"invalid", "the rule's router and box ports cannot be paired"},
    {"cut",
     "the list of ports is so long that it may have lost its end, and the last of them are not asked for; write it as "
     "two rules"},
    {"duplicate", "an earlier rule sends this port to another port of the box"},
    {kUnrecorded, "this box cannot note down what it opens, and opens nothing new; is its disk full ('df /var/lib')?"},
    {"noigd", "the gateway offers no UPnP port mapping"},
    {"nogateway", "there is no gateway"},
    {"busy", "the other daemon has not taken its mappings away yet"},
    {"timeout", "the router did not answer"},
    {"unreachable", "the router cannot be reached"},
    {"garbage", "the router answers without sense"},
    {"stopped", "the router has not been asked yet"}};

bool IsNumber(const std::string& szText) {
    return !szText.empty() && std::all_of(szText.begin(), szText.end(), [](char c) { return c >= '0' && c <= '9'; });
}

// The bytes of the character that begins a text, as UTF-8 has them; 0: it is none, or a control character.
size_t CharacterSize(std::string_view szText) {
    const auto nFirst = static_cast<unsigned char>(szText.front());
    if (nFirst < 0x80) {
        return nFirst >= 0x20 && nFirst != 0x7F ? 1 : 0;
    }
    const size_t nSize = nFirst >= 0xF0 ? 4 : nFirst >= 0xE0 ? 3 : 2;
    if (nFirst < 0xC2 || nFirst > 0xF4 || szText.size() < nSize) {
        return 0;
    }
    const bool blWhole = std::all_of(szText.begin() + 1, szText.begin() + static_cast<std::ptrdiff_t>(nSize),
                                     [](char c) { return (static_cast<unsigned char>(c) & 0xC0U) == 0x80U; });
    const auto nSecond = static_cast<unsigned char>(szText[1]);
    const bool blOverlong = (nFirst == 0xE0 && nSecond < 0xA0) || (nFirst == 0xF0 && nSecond < 0x90);
    const bool blOutside = (nFirst == 0xED && nSecond >= 0xA0) || (nFirst == 0xF4 && nSecond >= 0x90);
    const bool blControl = nFirst == 0xC2 && nSecond < 0xA0;
    return blWhole && !blOverlong && !blOutside && !blControl ? nSize : 0;
}

}  // namespace

std::string MappingName(const RouterMapping& mapping) {
    const std::string szLast = mapping.nMore == 0 ? "" : "-" + std::to_string(mapping.nRouterPort + mapping.nMore);
    const char* szProtocol = mapping.szProtocol == "UDP" ? "/udp" : mapping.szProtocol == "BOTH" ? "/both" : "/tcp";
    return std::to_string(mapping.nRouterPort) + szLast + szProtocol;
}

Verdict RefusedBy(const RouterReply& reply) {
    const PortState enState = reply.IsRefusal() ? PortState::kRefused
                              : reply.IsOk()    ? PortState::kWaiting
                                                : PortState::kUnknown;
    return {enState, reply.IsOk() ? "stopped" : reply.szWord};
}

Outcome OutcomeOf(const RouterMapping& mapping, Verdict verdict) {
    Outcome outcome{MappingName(mapping), std::move(verdict), mapping.szProtocol, mapping.nRouterPort,
                    mapping.nBoxPort};
    outcome.szClient = mapping.szClient;
    return outcome;
}

std::string WhyOf(const Verdict& verdict) {
    if (!verdict.szWhy.empty() || verdict.enState == PortState::kOpen) {
        return verdict.szWhy;
    }
    for (const auto& [szWord, szWhy] : kWhy) {
        if (szWord == verdict.szWord) {
            return szWhy;
        }
    }
    return IsNumber(verdict.szWord) ? "the router refuses it with error " + verdict.szWord : verdict.szWord;
}

std::string WhyOf(RouterState enRouter, const std::string& szProtocol) {
    switch (enRouter) {
        case RouterState::kUnreachable:
            return "nobody answers at the router's address";
        case RouterState::kNoService:
            return "the router does not map ports by " + szProtocol + "; it may be switched off in its settings";
        case RouterState::kSilent:
            return "the router does not answer by " + szProtocol;
        case RouterState::kNoGateway:
            return "this box has no default gateway";
        case RouterState::kBusy:
            return "the other daemon has not taken its mappings away yet";
        default:
            return "";
    }
}

std::string HarmlessText(const std::string& szText, size_t nMax) {
    std::string szOut;
    for (size_t i = 0; i < szText.size() && szOut.size() < nMax;) {
        const size_t nSize = CharacterSize(std::string_view(szText).substr(i));
        const bool blForeign = nSize == 0 && static_cast<unsigned char>(szText[i]) >= 0x80;
        if (szOut.size() + nSize > nMax) {
            break;
        }
        szOut += blForeign ? "?" : szText.substr(i, nSize);
        i += std::max<size_t>(nSize, 1);
    }
    return szOut;
}

}  // namespace tavo
