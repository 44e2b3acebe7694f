// What detection and the settings say of a router, in words and as JSON. Relies on the library's public
// header. Promises: one wording for "detect", "status" and "router".
#pragma once

#include <string>

#include "Answer.h"
#include "Box.h"

namespace tavo::cli {

using DetectResult = __tag_TAVO_ROUTER_DETECT_RESULT;

Way WayOf(const DetectResult& result);
// "no", "yes" or "unknown".
std::string SupportWord(int enSupport);
// "32 rules", "no limit known"; nMaxRules below 0: the word for not knowing at all.
std::string CapacityWords(int nMaxRules);
// How the router is driven and what it is, on one line.
std::string OneLine(const DetectResult& result);

// Adds what is wrong with the surroundings, and what to do about it, as warnings.
void AddEnvironment(const DetectResult& result, Reply& reply);
// Adds the whole verdict: body, JSON and warnings.
void DescribeVerdict(const DetectResult& result, Reply& reply);

// Stores the settings of the current gateway, and the limit where nMaxRules is not negative.
Reply StoreSettings(const std::string& szGateway, __tag_TAVO_ROUTER_CONF conf, int nMaxRules);

}  // namespace tavo::cli
