// What a save came to on the router, by the word of the daemon that carried it out. Relies on Published.h.
// Promises: a router that did not answer is not one that refused; who has a port is named; a word on other rules, or
// none, is not taken for success.
#pragma once

#include <ctime>
#include <optional>

#include "Answer.h"
#include "Published.h"
#include "RuleStore.h"
#include "StoredRouter.h"

namespace tavo::cli {

// What the daemon that drives this router has published of these rules since then; nothing when it says nothing.
std::optional<Published> PublishedSince(const StoredRouter& router, const Rules& rules, time_t nSince);

// The answer where it says nothing although it lives; nothing when none lives, or the router is driven by its pages.
std::optional<Reply> Unsaid(const StoredRouter& router);

// A row for each port that is not open, with blAll for every one, and for what is left over; and as JSON.
void AddPorts(const Published& published, bool blAll, Reply& reply);

// What is so now that rules have been saved.
Reply OutcomeOf(const Published& published, const Rules& rules, const std::string& szGateway);

}  // namespace tavo::cli
