// The stored settings of the router behind the current gateway, and what they let a service do. Relies on
// TLibGetRouterConf, the detection cache and the compatibility database. Promises: changes nothing unless its
// name says so.
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
// blLocked: the caller holds the router lock.
Settings ReadSettings(bool blLocked = false);

// Whether there are settings that nobody can read; the library deletes such a file when it is asked.
bool AreUnreadable(const std::string& szGateway);
// Keeps it as router.conf.unreadable and makes room for new settings.
bool PutAside();
// The gateway that the stored settings are about when it is not this one; else empty.
std::string OtherGateway(const std::string& szGateway);

// The router as a service's request meets it.
struct ServiceRouter {
    std::string szRefusal = {};  // why the library sets no ports on it; empty when it does
    bool blUpnp = false;         // it is asked what other hosts hold
    int nMaxRules = -1;
};
ServiceRouter ReadServiceRouter(const Settings& settings);

extern const char kNotDetected[];

}  // namespace tavo::cli
