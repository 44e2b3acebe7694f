// What became of each mapping that was asked for: the one list from which the result file, the published state
// and the notices are made. Relies on nothing.
// Promises: texts that come from the router are printable and bounded.
#pragma once

#include <cstdint>
#include <ctime>
#include <optional>
#include <string>
#include <vector>

#include "mapping/Router.h"

namespace tavo {

// What is known of a port at the router.
enum class PortState {
    kOpen,
    kRefused,
    kWaiting,  // for something that the daemon itself is waiting for
    kUnknown   // the router could not be asked
};

// What a pass found of the router as a whole.
enum class RouterState {
    kNotAsked,
    kOk,
    kUnreachable,  // no link, or nobody at its address
    kNoService,    // somebody is at its address and does not map ports
    kSilent,
    kNoGateway,
    kBusy  // the other daemon has its turn
};

// The other device, or other program of this box, that has a port.
struct Holder {
    std::string szAddress;
    std::string szDescription;

    bool operator==(const Holder&) const = default;
};

struct Verdict {
    PortState enState = PortState::kUnknown;
    std::string szWord = {};            // as the result file has it; "1" is success
    std::optional<Holder> holder = {};  // of a port that was refused for it
    uint32_t nLease = 0;                // seconds left; 0: permanent, or not known
    bool blAnew = false;                // open, and was not there before this pass
    std::string szWhy = {};             // the plan's reason, or another where the word alone does not say it
};

struct Outcome {
    std::string szName;  // "5000/tcp", as a user reads it
    Verdict verdict;
    // What it is about; empty and 0 where a rule's ports cannot be taken apart.
    std::string szProtocol = {};  // "TCP" or "UDP"
    uint16_t nRouterPort = 0;
    uint16_t nBoxPort = 0;
    std::string szRule = {};
    time_t nSince = 0;          // how long it has been so, in the box's own time of day
    bool blLeftOver = false;    // no rule asks for it, and the router did not take it away
    std::string szClient = {};  // the address that it leads to; empty: this box's
};
using OutcomeList = std::vector<Outcome>;

// The word for what was not asked for, because the box could not have remembered it.
inline constexpr char kUnrecorded[] = "unrecorded";

// "5000/tcp", or "5000-5010/both", as a user reads it.
std::string MappingName(const RouterMapping& mapping);
// Of a mapping that is not there, as the router has it. kOk: it was not asked for.
Verdict RefusedBy(const RouterReply& reply);
// What became of a mapping.
Outcome OutcomeOf(const RouterMapping& mapping, Verdict verdict);

// Why a port is not open, or by whose doing it is, as a user reads it; empty for an own open one.
std::string WhyOf(const Verdict& verdict);
// The same for the router; empty when all is well.
std::string WhyOf(RouterState enRouter, const std::string& szProtocol);

// A text from the network as valid UTF-8 without control characters, cut at nMax bytes and never inside a character.
std::string HarmlessText(const std::string& szText, size_t nMax);

}  // namespace tavo
