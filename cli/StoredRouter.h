// The router that a save goes by: the first section of router.conf, its limit or its description. Relies on the
// library's readers and databases. Promises: changes nothing; what it refuses the library would refuse, after having
// switched the daemons off.
#pragma once

#include <optional>
#include <string>

#include "Box.h"
#include "RuleStore.h"

namespace tavo::cli {

using SaveResult = __tag_TAVO_ROUTER_SAVE_RULE_RESULT;

struct StoredRouter {
    bool blAny = false;
    std::string szSection = {};  // whose settings they are
    std::string szBrand = {}, szModel = {}, szVersion = {};
    Way enWay = Way::kUnknown;

    std::string Name() const { return RouterName(szBrand, szModel, szVersion); }
};
StoredRouter ReadStoredRouter();

// Why no rules can be saved at all with these settings at this gateway; nothing when they can.
std::optional<std::string> WhyUnsavable(const StoredRouter& router, const std::string& szGateway);

// Whether the rules fit the router; if not, the status and the limits in result are the library's.
bool Fits(const StoredRouter& router, const std::string& szGateway, const Rules& rules, SaveResult& result);

}  // namespace tavo::cli
