// Asks a gateway where its device description is. Relies on UDP sockets.
// Promises: only an answer from the gateway itself that names the gateway itself counts; ends within
// the limit; the reason of a refusal is logged.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "wire/http/Http.h"

namespace tavo {

// The LOCATION of one SSDP answer, when it is http on szGateway; otherwise nothing, and szReason says why.
std::optional<HttpUrl> LocationOf(std::string_view szAnswer, const std::string& szGateway, std::string& szReason);

// Asks by unicast and by multicast at once, and hands every new location to fnTry until it answers
// true. False when none did within nLimitMilliseconds, and before that when the gateway has been silent
// for three seconds after the last question: it had three times what the question allows for the answer,
// and a box without a UPnP router is not made to wait. Asks from the local port nLocalPort, from any
// other when that one is taken or 0. Ends soon after fnStop, where there is one, answers true.
bool SearchGateway(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds, int nLocalPort,
                   const std::function<bool(const HttpUrl&)>& fnTry, const std::function<bool()>& fnStop);

}  // namespace tavo
