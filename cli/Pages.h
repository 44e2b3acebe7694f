// What a router's own pages forward for this box although they are not in use any more, since UPnP or NAT-PMP drives
// the router by now: nobody else would ever take it away. Relies on tavoportforward, which keeps the record of it.
// Promises: bounded; costs nothing where nothing is on record.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "Answer.h"
#include "Published.h"
#include "RuleStore.h"

namespace tavo::cli {

// Whether something is on record, of whatever router; false for a user who may not look.
bool HavePagesMade();
// What the last run of the program came to at the router in front: one that wrote the rules (blInUse), or one that took
// away what it made. Nothing where that was another one, or of another router.
std::optional<Published> PagesWord(bool blInUse);
// What is on record of the router in front, without asking it; where nobody can say it, that. A user who may not read
// the record learns what the last attempt to take it away has left; nothing where there was none.
std::optional<Published> LeftByPages();
// Has the pages take it away. What they still forward then, each with the reason.
std::vector<PublishedLeftOver> TakeAwayByPages();

// "5001/tcp, 5002/udp"
std::string NamesOf(const std::vector<PublishedLeftOver>& rgLeft);
// Says in the reply to a save of these rules what they still forward: what was closed is not closed there.
void AddLeftByPages(const std::vector<PublishedLeftOver>& rgLeft, const Rules& rules, Reply& reply);

}  // namespace tavo::cli
