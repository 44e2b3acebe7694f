// The stored rules. Relies on the library's readers and writer of rule.conf. Promises: rules that could
// not be read whole are never written back; a value is never cut, and a rule without a name stays so.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Answer.h"
#include "libtavoportmap.h"

namespace tavo::cli {

struct Rule {
    std::string szId;
    bool blEnabled = true;
    std::string szProtocol;
    std::string szRouterPorts;
    std::string szBoxPorts;
    std::string szServiceId;
    std::string szName;
};

using Rules = std::vector<Rule>;

// Nothing when rule.conf cannot be read.
std::optional<Rules> LoadRules();
// The same as the library's own array, with its cuts and lent names.
std::optional<std::vector<__tag_TAVO_ROUTER_RULE>> LoadRecords();
// False when they could not be written; the old ones are still there then.
bool StoreRules(const Rules& rules);
// As the library takes them; nothing when a value is too long for its record.
std::optional<std::vector<__tag_TAVO_ROUTER_RULE>> ToRecords(const Rules& rules);

extern const char kUnreadable[];

Json::Value ToJson(const Rule& rule);

// Says which rules there are.
Reply NoSuchRule(const Rules& rules, const std::string& szId);

// The ports of a text like "80,443,5000-5010", in its order; nothing when it cannot be read.
std::optional<std::vector<int>> ParsePorts(const std::string& szText);

// Two enabled rules that want the same router port; the one that comes later in the file is szLater.
struct Overlap {
    std::string szLater;
    std::string szEarlier;
    std::string szPort;  // the first one, such as "443/tcp"
};
std::vector<Overlap> OverlapsOf(const Rules& rules);

}  // namespace tavo::cli
