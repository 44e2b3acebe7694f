// Rules into the router, by whoever asks for it. Relies on TLibSaveRules and on what the daemons publish. Promises:
// what the router would refuse as a whole is refused before anything is changed; success is said only of what the
// daemon says is so; each other end has its words and its exit code.
#pragma once

#include "Answer.h"
#include "RuleStore.h"
#include "StoredRouter.h"

namespace tavo::cli {

// The caller holds the router lock. "status" of the answer is the library's, "ports" tells each port's fate.
Reply SaveRules(const Rules& rules, bool blJson);

// What the router would refuse as a whole, as it would be said; nothing when it would not.
std::optional<Reply> WouldBeRefused(const StoredRouter& router, const std::string& szGateway, const Rules& rules);

// Waits, for a minute at most, until the daemon has carried out what it was told.
void AwaitDaemon();

// Whether these rules, and no others, are in rule.conf.
bool AreStored(const Rules& rules);

}  // namespace tavo::cli
