// Asks a gateway where its device description is. Relies on UDP sockets.
// Promises: nobody but the gateway is where an answer leads; ends within the limit; the reason of a refusal is logged.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "ground/Descriptor.h"
#include "wire/http/Http.h"

namespace tavo {

// Where one SSDP answer leads: always to szGateway. Of an answer of the gateway's own (blGateway) the place counts
// whatever host it names, as a router may go by a name or by another address of its own; anybody else's has to name the
// gateway. Nothing where there is no http, and szReason says why.
std::optional<HttpUrl> LocationOf(std::string_view szAnswer, const std::string& szGateway, bool blGateway,
                                  std::string& szReason);

// Asks by unicast and by multicast at once, first for what most routers answer to, then for the rest, and hands every
// new location to fnTry until it answers true. False when none did within nLimitMilliseconds, before that when the
// gateway has been silent for three seconds after its last word, and when it has said nothing at all within two and a
// half: a box without a UPnP router is not made to wait. What others than the gateway say is tried, two places of it,
// only where the gateway itself has said nothing. Then pFdLate, where it is given, still hears what comes late. Asks
// from the local port nLocalPort, from any other when that one is taken or 0. Ends soon after fnStop, where there is
// one, answers true.
bool SearchGateway(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds, int nLocalPort,
                   const std::function<bool(const HttpUrl&)>& fnTry, const std::function<bool()>& fnStop,
                   Descriptor* pFdLate = nullptr);

// The next place that came late from the gateway itself, where one did; never waits.
std::optional<HttpUrl> TakeLate(const Descriptor& fdLate, const std::string& szGateway);

}  // namespace tavo
