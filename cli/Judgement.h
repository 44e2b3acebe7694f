// What a situation means for each rule and for the whole. Relies on nothing but the situation. Promises: "in force" is
// said of a rule only when all of its ports were seen open; whoever has a port is named; each trouble comes with a
// command that leads out of it.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "PortPairs.h"
#include "Situation.h"

namespace tavo::cli {

// From the best to the worst; of a rule's ports the worst counts.
enum class Fate { kOff, kOpen, kUnknown, kWaiting, kRefused, kNotKept };
const char* ToWord(Fate enFate);

struct PortFact {
    PortPair pair;
    Fate enFate = Fate::kUnknown;
    std::string szWhy = {};
    std::optional<PublishedHolder> holder = {};
    std::optional<int64_t> nSince = {};
    std::optional<int64_t> nUntil = {};

    // In the same state for the same reason, at whatever port.
    bool IsLike(const PortFact& other) const;
};

struct RuleFact {
    Rule rule;  // for a user who may not read the rules, what the daemon says of it
    Fate enFate = Fate::kUnknown;
    std::string szWhy = {};              // where it does not lie at a port
    std::vector<PortFact> rgPorts = {};  // empty for a rule that is off, or whose ports make no sense
};

enum class Standing { kInForce, kOff, kNothingAsked, kPartly, kNotKept, kUntold };
const char* ToWord(Standing enStanding);

struct Judgement {
    Standing enStanding = Standing::kUntold;
    std::string szMessage = {};
    std::vector<RuleFact> rgRules = {};
    std::vector<LiveEntry> rgOthers = {};  // of other programs of this box, as the router's table shows them now
    std::vector<std::string> rgszWarnings = {};
    size_t nLeftOver = 0;  // of what no rule asks for and the router still has

    Exit ExitCode() const;
};

Judgement Judge(const Situation& situation);

// "12:40:00", with the day where it is another one than that of nNow.
std::string Moment(int64_t nTime, int64_t nNow);

}  // namespace tavo::cli
