// What detection and the settings say of a router, in words and as JSON. Relies on the library's public
// header. Promises: one wording for "detect", "status" and "router".
#pragma once

#include <string>

#include "Answer.h"
#include "Box.h"
#include "tavo/net.h"

namespace tavo::cli {

using DetectResult = __tag_TAVO_ROUTER_DETECT_RESULT;

Way WayOf(const DetectResult& result);
// "no", "yes" or "unknown".
std::string SupportWord(int enSupport);
// "32 rules", "no limit known"; nMaxRules below 0: the word for not knowing at all.
std::string CapacityWords(int nMaxRules);
// How the router is driven and what it is, on one line.
std::string OneLine(const DetectResult& result);

// Whether a report about the detected router can be made: its settings go into it.
bool CanBeReported();

// Adds what is wrong with the surroundings, and what to do about it, as warnings. word: what the gateway says itself.
void AddEnvironment(const DetectResult& result, const TAVO_NET_GATEWAY_WORD& word, Reply& reply);
// Adds the whole verdict: body, JSON and warnings.
void DescribeVerdict(const DetectResult& result, const TAVO_NET_GATEWAY_WORD& word, Reply& reply);

// Stores the settings of the current gateway, and how many rules it holds; below 0: what is recorded, else that no
// limit is known. An account of the router's pages is kept. blLocked: the caller holds the router lock.
Reply StoreSettings(const std::string& szGateway, __tag_TAVO_ROUTER_CONF conf, int nMaxRules, bool blLocked = false);

}  // namespace tavo::cli
