// The stored settings of the router behind the current gateway, and what they let a service do. Relies on
// TLibGetRouterConf, the detection cache and the compatibility database. Promises: changes nothing.
#pragma once

#include <optional>
#include <string>

#include "Answer.h"
#include "libtavoportmap.h"

namespace tavo::cli {

using RouterConf = __tag_TAVO_ROUTER_CONF;

enum class Found { kYes, kNothing, kWithoutLimit, kBusy, kFailed };

struct Settings {
    std::string szGateway = {};
    RouterConf conf = {};
    Found enFound = Found::kFailed;
    std::optional<Reply> obstacle = {};  // what keeps a command from going on; nothing when nothing does
};
Settings ReadSettings();

// The router as a service's request meets it.
struct ServiceRouter {
    std::string szRefusal = {};  // why the library sets no ports on it; empty when it does
    bool blUpnp = false;         // it is asked what other hosts hold
    int nMaxRules = -1;
};
ServiceRouter ReadServiceRouter(const Settings& settings);

extern const char kNotDetected[];

}  // namespace tavo::cli
