// What a daemon knows of its ports and its router, for whoever asks: one JSON file below /run/tavo for each daemon.
// Relies on jsoncpp. Promises: replaced whole; everybody may read it and only root writes it; what is not known is
// null.
#pragma once

#include <ctime>
#include <string>

#include "mapping/Outcome.h"

namespace tavo {

struct Published {
    std::string szDaemon;    // its file's name
    std::string szProtocol;  // as a user reads it
    time_t nAt = 0;          // when the pass ended
    bool blSwitchedOn = false;
    bool blRulesReadable = true;
    std::string szGateway = {};
    std::string szHardware = {};  // the gateway's hardware address
    std::string szBox = {};
    std::string szOutside = {};
    RouterState enRouter = RouterState::kNotAsked;
    std::string szRouterWhy = {};
    time_t nRouterSince = 0;
    time_t nNextLook = 0;
    OutcomeList rgOutcomes = {};
};

// "ok", "silent" and so on; empty when the router was not asked.
std::string RouterWord(const Published& state);
std::string PortWord(PortState enState);
// "tcp", "udp"; empty where a rule has no single one.
std::string ProtocolWord(const Outcome& outcome);

std::string ToJson(const Published& state);
// A failure is logged.
void Publish(const Published& state);
void Unpublish(const std::string& szDaemon);

}  // namespace tavo
