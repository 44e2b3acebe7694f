// Judges a situation. Relies on fmt. Promises: see Judgement.h.
#include "Judgement.h"

#include <fmt/format.h>

#include <algorithm>
#include <ctime>
#include <map>
#include <set>
#include <tuple>

namespace tavo::cli {

namespace {

constexpr char kSave[] = "'sudo tavoportmap save' writes the rules to the router again";

// ---- the rules ----------------------------------------------------------------------------------------------

Fate FateOf(PortState enState) {
    switch (enState) {
        case PortState::kOpen:
            return Fate::kOpen;
        case PortState::kRefused:
            return Fate::kRefused;
        case PortState::kWaiting:
            return Fate::kWaiting;
        default:
            return Fate::kUnknown;
    }
}

PortFact FactOf(const PortPair& pair, const PublishedRule& told) {
    PortFact fact{pair, FateOf(told.enState), told.szWhy, told.holder, told.nSince, told.nUntil};
    if (fact.enFate == Fate::kOpen) {
        fact.nUntil.reset();  // the end of a lease that is renewed long before
    }
    return fact;
}

// What was published of each port, to be found by it.
class Told {
public:
    explicit Told(const Published* pPublished) {
        for (const PublishedRule& rule : pPublished != nullptr ? pPublished->rgRules : std::vector<PublishedRule>()) {
            mMap.emplace(std::tuple(rule.szProtocol, rule.nRouterPort, rule.nBoxPort), rule);
        }
    }
    const PublishedRule* Find(const PortPair& pair) const {
        const auto it = mMap.find({pair.szProtocol, pair.nRouter, pair.nBox});
        return it == mMap.end() ? nullptr : &it->second;
    }

private:
    std::map<std::tuple<std::string, int, int>, PublishedRule> mMap;
};

// What the router itself says of a port; told: what was known of it before.
PortFact LiveFact(const Situation& situation, PortFact told) {
    const auto entry = situation.live->Find(told.pair.nRouter, told.pair.szProtocol);
    if (!entry) {
        if (told.enFate != Fate::kRefused) {
            told.enFate = Fate::kWaiting;
            told.szWhy = "it is not in the router's table now";
        }
        return told;
    }
    const bool blHere = entry->szClient == situation.szBox;
    if (blHere && entry->nClientPort == told.pair.nBox && entry->blEnabled) {
        const bool blKnown = told.enFate == Fate::kOpen;
        return {told.pair, Fate::kOpen, blKnown ? told.szWhy : "", {}, blKnown ? told.nSince : std::nullopt, {}};
    }
    told.enFate = Fate::kRefused;
    told.nUntil.reset();
    told.holder.reset();
    if (!blHere) {
        told.szWhy = "another device has this port on the router";
        told.holder = {entry->szClient, entry->szDescription};
    } else {
        told.szWhy = entry->blEnabled ? fmt::format("the router leads it to port {} of this box", entry->nClientPort)
                                      : "the router has it switched off";
    }
    return told;
}

// What is to be said of a port of which the keeper says nothing.
PortFact Silent(const Situation& situation, const PortPair& pair) {
    const Daemon* pKeeper = situation.Keeper();
    if (situation.IsByPages()) {
        return {pair, Fate::kUnknown, "the router's pages were not written since this box was started"};
    }
    if (pKeeper == nullptr) {
        return {pair, Fate::kNotKept, "mapping is switched off"};
    }
    return pKeeper->blAlive
               ? PortFact{pair, Fate::kUnknown, fmt::format("{} has not said anything of it yet", pKeeper->szName)}
               : PortFact{pair, Fate::kNotKept, fmt::format("{} does not run", pKeeper->szName)};
}

RuleFact JudgeRule(const Situation& situation, const Rule& rule, const Told& told) {
    RuleFact fact{rule};
    const auto rgPairs = PairsOf(rule);
    if (!rule.blEnabled || !rgPairs) {
        fact.enFate = rule.blEnabled ? Fate::kRefused : Fate::kOff;
        fact.szWhy = rule.blEnabled ? "its router and box ports cannot be paired" : "";
        return fact;
    }
    fact.enFate = Fate::kOpen;
    for (const PortPair& pair : *rgPairs) {
        const PublishedRule* pTold = told.Find(pair);
        PortFact port = pTold != nullptr ? FactOf(pair, *pTold) : Silent(situation, pair);
        port = situation.live ? LiveFact(situation, port) : port;
        fact.enFate = std::max(fact.enFate, port.enFate);
        fact.rgPorts.push_back(port);
    }
    return fact;
}

// The rules as the daemon speaks of them, for a user who may not read them.
std::vector<RuleFact> RulesOf(const Situation& situation, const Published& published) {
    std::vector<RuleFact> rgFacts;
    for (const PublishedRule& told : published.rgRules) {
        const auto pSame = std::find_if(rgFacts.begin(), rgFacts.end(),
                                        [&](const RuleFact& fact) { return fact.rule.szName == told.szRule; });
        const bool blNew = pSame == rgFacts.end();  // asked here: a new one leaves the iterator invalid
        RuleFact& fact = blNew ? rgFacts.emplace_back() : *pSame;
        if (blNew) {
            fact.rule.szName = told.szRule;
            fact.enFate = Fate::kOpen;
        }
        PortFact port = FactOf({told.szProtocol, told.nRouterPort, told.nBoxPort}, told);
        port = situation.live && told.nRouterPort != 0 ? LiveFact(situation, port) : port;
        fact.enFate = std::max(fact.enFate, port.enFate);
        if (told.nRouterPort != 0) {
            fact.rgPorts.push_back(port);
        } else {
            fact.rule.szRouterPorts = told.szName;
            fact.szWhy = told.szWhy;
        }
    }
    return rgFacts;
}

std::vector<LiveEntry> OthersOf(const Situation& situation, const std::vector<RuleFact>& rgRules) {
    std::set<std::string> setWanted;
    for (const RuleFact& fact : rgRules) {
        for (const PortFact& port : fact.rgPorts) {
            setWanted.insert(port.pair.Name());
        }
    }
    std::vector<LiveEntry> rgOthers = situation.live ? situation.live->rgEntries : std::vector<LiveEntry>();
    std::erase_if(rgOthers, [&](const LiveEntry& entry) {
        return entry.szClient != situation.szBox || setWanted.count(entry.Name()) != 0;
    });
    return rgOthers;
}

// ---- the whole ----------------------------------------------------------------------------------------------

// What is so, and how it is said.
using Outcome = std::pair<Standing, std::string>;

// Nobody may map although rules wait for it.
std::string WhySwitchedOff(const Situation& situation) {
    if (situation.running.szWord != "idle") {
        return fmt::format("nothing is kept while {} goes on; look again when it has ended",
                           situation.running.ToText());
    }
    if (!situation.blSettingsHidden && !situation.settings.blAny) {
        return "nothing is kept: nobody knows the router yet, so that the rules were never written to it; 'sudo "
               "tavoportmap setup' finds out what it is";
    }
    return fmt::format(
        "nothing is kept: neither daemon may map. The keys runupnpportmapping and runnatpmpportmapping in "
        "/etc/tavoinfo.conf are switched off, as a save or a detection that failed may leave them, or another way to "
        "the router until its first save; {}",
        kSave);
}

std::string WhyDead(const Daemon& daemon) {
    if (!daemon.unit) {
        return fmt::format("nothing is kept: {} does not run; 'sudo tavoportmap save' starts it", daemon.szName);
    }
    const std::string szResult =
        daemon.unit->szResult.empty() || daemon.unit->szResult == "success" ? "" : ", " + daemon.unit->szResult;
    return fmt::format(
        "nothing is kept: {0} does not run (its unit is {1}{2}); 'sudo journalctl -u {0}' says why, 'sudo systemctl "
        "restart {0}' starts it",
        daemon.szName, daemon.unit->szActive, szResult);
}

// The keeper runs; what it says of the router. Nothing when all is well with it.
std::optional<Outcome> JudgeKeeper(const Situation& situation, const Daemon& daemon) {
    if (!daemon.published) {
        return Outcome{Standing::kUntold,
                       fmt::format("{} runs and has not said yet what became of the rules; look again "
                                   "in a few seconds",
                                   daemon.szName)};
    }
    const Published& published = *daemon.published;
    if (daemon.IsLate(situation.nNow)) {
        return Outcome{Standing::kUntold,
                       fmt::format("{} has not looked at the router since {}; 'sudo {}' has it look anew",
                                   daemon.szName, Moment(published.nAt, situation.nNow),
                                   daemon.unit ? fmt::format("systemctl restart {}", daemon.szName)
                                               : fmt::format("kill {}; sudo tavoportmap save", published.nPid))};
    }
    if (situation.live || published.szRouter.empty() || published.szRouter == "ok" || published.szRouter == "busy") {
        return std::nullopt;
    }
    const std::string szWhy = published.szRouterWhy.empty() ? published.szRouter : Clean(published.szRouterWhy);
    const std::string szSince =
        published.nRouterSince ? ", since " + Moment(*published.nRouterSince, situation.nNow) : "";
    const std::string szNext = published.nNextLook ? " at " + Moment(*published.nNextLook, situation.nNow) : "";
    const bool blOtherWay = published.szRouter.starts_with("no_u") || published.szRouter.starts_with("no_n");
    return Outcome{Standing::kNotKept,
                   fmt::format("nothing is kept: {}{}. {} looks again{}{}", szWhy, szSince, daemon.szName, szNext,
                               blOtherWay ? "; 'sudo tavoportmap setup' looks for another way" : "")};
}

// What keeps every rule from being in force at once; nothing when each speaks for itself.
std::optional<Outcome> JudgeSurroundings(const Situation& situation) {
    const Daemon* pKeeper = situation.Keeper();
    if (!situation.szGateway) {
        return Outcome{Standing::kNotKept, "nothing is kept: " + NoGateway().szMessage};
    }
    if (situation.IsByPages()) {
        return situation.pages
                   ? std::nullopt
                   : std::optional(
                         Outcome{Standing::kUntold, fmt::format("whether the router's own pages still have the rules "
                                                                "is not known: they were not written since this box "
                                                                "was started, or since they are in use again; {}",
                                                                kSave)});
    }
    if (pKeeper == nullptr) {
        return Outcome{Standing::kNotKept, WhySwitchedOff(situation)};
    }
    if (!pKeeper->blAlive) {
        return Outcome{Standing::kNotKept, WhyDead(*pKeeper)};
    }
    if (situation.blAsked && !situation.live) {
        return Outcome{Standing::kNotKept,
                       fmt::format("nothing is kept: no router answers by UPnP now; {} looks for it "
                                   "again and again",
                                   pKeeper->szName)};
    }
    return JudgeKeeper(situation, *pKeeper);
}

// There is nothing that could be in force; nothing when there is.
std::optional<Outcome> JudgeWish(const Situation& situation, size_t nWanted) {
    if (situation.rules.blHidden) {
        const Daemon* pKeeper = situation.Keeper();
        if (situation.Word() == nullptr) {
            return pKeeper != nullptr && !pKeeper->blAlive
                       ? Outcome{Standing::kNotKept, WhyDead(*pKeeper)}
                       : Outcome{Standing::kUntold, "this user may not read the rules; run it with sudo"};
        }
        return nWanted != 0 ? std::nullopt
                            : std::optional(Outcome{Standing::kNothingAsked, "nothing is asked of the router"});
    }
    if (!situation.rules.inForce) {
        return Outcome{Standing::kUntold, kUnreadable};
    }
    if (nWanted != 0) {
        return std::nullopt;
    }
    if (situation.rules.off) {
        return Outcome{Standing::kOff, fmt::format("switched off: {} {} for 'sudo tavoportmap on'",
                                                   Count(situation.rules.off->size(), "rule"),
                                                   situation.rules.off->size() == 1 ? "waits" : "wait")};
    }
    return Outcome{Standing::kNothingAsked,
                   situation.rules.inForce->empty()
                       ? "no rules are in force; 'sudo tavoportmap open 443 --to 8443' would open a port"
                       : "no rule is switched on, so that nothing is asked of the router"};
}

Outcome JudgeRules(const Situation& situation, const std::vector<RuleFact>& rgRules, size_t nWanted) {
    const auto fnCount = [&](Fate enFate) {
        return std::count_if(rgRules.begin(), rgRules.end(),
                             [=](const RuleFact& fact) { return fact.enFate == enFate; });
    };
    const auto nOpen = fnCount(Fate::kOpen);
    const auto nUnknown = fnCount(Fate::kUnknown);
    const auto nWrong = static_cast<int64_t>(nWanted) - nOpen - nUnknown;
    const std::string szAsOf = situation.IsByPages() && situation.pages
                                   ? fmt::format(", as the router's pages took them at {}; nobody looks at them again",
                                                 Moment(situation.pages->nAt, situation.nNow))
                                   : "";
    if (nWrong > 0) {
        const char* szRest = nWrong == 1 ? "is not in force; its row says" : "are not in force; their rows say";
        return {Standing::kPartly, nWanted == 1
                                       ? "the rule is not in force; its row says why" + szAsOf
                                       : fmt::format("{} of {} rules {} why{}", nWrong, nWanted, szRest, szAsOf)};
    }
    if (nUnknown > 0) {
        return {Standing::kUntold, situation.IsByPages()
                                       ? fmt::format("{} of {} cannot be told: the router's pages did not answer as "
                                                     "they should, and nobody looks at them again; {}",
                                                     nUnknown, Count(nWanted, "rule"), kSave)
                                       : fmt::format("{} of {} cannot be told yet", nUnknown, Count(nWanted, "rule"))};
    }
    return {Standing::kInForce, nWanted == 1 ? "the rule is in force" + szAsOf
                                             : fmt::format("all {} rules are in force{}", nWanted, szAsOf)};
}

// ---- what else should be known ------------------------------------------------------------------------------

void AddUnitWarnings(const Daemon& daemon, std::vector<std::string>& rgszWarnings) {
    if (!daemon.unit || !daemon.blAlive) {
        return;
    }
    if (!daemon.unit->IsActive()) {
        rgszWarnings.push_back(fmt::format(
            "{0} runs outside of its unit, so that nobody starts it again when it fails; 'sudo systemctl restart {0}' "
            "hands it over",
            daemon.szName));
    }
    if (!daemon.unit->StartsAtBoot()) {
        rgszWarnings.push_back(fmt::format(
            "{0} will not be started with this box; 'sudo systemctl enable {0}' sees to that", daemon.szName));
    }
}

std::vector<std::string> WarningsOf(const Situation& situation) {
    std::vector<std::string> rgszWarnings;
    const StoredRouter& settings = situation.settings;
    if (settings.blAny && situation.szGateway && settings.szSection != *situation.szGateway) {
        rgszWarnings.push_back(fmt::format(
            "the stored settings are those of the router {}, and the gateway is {}; 'sudo tavoportmap setup' "
            "looks at this one",
            Clean(settings.szSection), *situation.szGateway));
    }
    if (situation.Keeper() != nullptr) {
        AddUnitWarnings(*situation.Keeper(), rgszWarnings);
    }
    if (!situation.szNotAsked.empty()) {
        rgszWarnings.push_back(situation.szNotAsked);
    }
    if (situation.pagesLeft && !situation.pagesLeft->szRouterWhy.empty()) {
        rgszWarnings.push_back(Clean(situation.pagesLeft->szRouterWhy));
    }
    const Published* pWord = situation.Word();
    if (pWord != nullptr && !pWord->blRulesReadable) {
        rgszWarnings.emplace_back(kUnreadable);
    }
    if (situation.rules.blOffUnreadable) {
        rgszWarnings.emplace_back(kOffUnreadable);
    }
    if (situation.rules.blDraft) {
        rgszWarnings.push_back(situation.rules.draft
                                   ? "the changes below 'not saved yet' open and close nothing until 'sudo tavoportmap "
                                     "save' puts them in force; 'sudo tavoportmap rules discard' forgets them"
                                   : Unreadable().szMessage);
    }
    if (situation.blSettingsHidden || situation.rules.blHidden) {
        rgszWarnings.emplace_back(
            "not all of it may be read by this user: run it with sudo to see the router's "
            "settings, every rule, and what is not saved yet");
    }
    return rgszWarnings;
}

}  // namespace

const char* ToWord(Fate enFate) {
    constexpr const char* kWords[] = {"off", "open", "unknown", "waiting", "refused", "not_kept"};
    return kWords[static_cast<size_t>(enFate)];
}

const char* ToWord(Standing enStanding) {
    constexpr const char* kWords[] = {"in_force", "off", "nothing_asked", "partly", "not_kept", "unknown"};
    return kWords[static_cast<size_t>(enStanding)];
}

bool PortFact::IsLike(const PortFact& other) const {
    const bool blHolders = holder.has_value() == other.holder.has_value() &&
                           (!holder || (holder->szAddress == other.holder->szAddress &&
                                        holder->szDescription == other.holder->szDescription));
    return enFate == other.enFate && szWhy == other.szWhy && blHolders && nSince == other.nSince &&
           nUntil == other.nUntil;
}

Exit Judgement::ExitCode() const {
    switch (enStanding) {
        case Standing::kPartly:
            return kRefused;
        case Standing::kNotKept:
            return kAway;
        case Standing::kUntold:
            return kFailed;
        default:
            return nLeftOver > 0 ? kRefused : kOk;
    }
}

Judgement Judge(const Situation& situation) {
    Judgement judgement{.rgszWarnings = WarningsOf(situation)};
    const Published* pWord = situation.Word();
    const Told told(pWord);
    if (situation.rules.inForce) {
        for (const Rule& rule : *situation.rules.inForce) {
            judgement.rgRules.push_back(JudgeRule(situation, rule, told));
        }
    } else if (pWord != nullptr) {
        judgement.rgRules = RulesOf(situation, *pWord);
    }
    judgement.rgOthers = OthersOf(situation, judgement.rgRules);
    const auto nWanted =
        static_cast<size_t>(std::count_if(judgement.rgRules.begin(), judgement.rgRules.end(),
                                          [](const RuleFact& fact) { return fact.enFate != Fate::kOff; }));
    auto outcome = JudgeWish(situation, nWanted);
    outcome = outcome ? outcome : JudgeSurroundings(situation);
    std::tie(judgement.enStanding, judgement.szMessage) =
        outcome ? *outcome : JudgeRules(situation, judgement.rgRules, nWanted);
    const bool blAsAsked = judgement.ExitCode() == kOk;
    judgement.nLeftOver = situation.LeftOver().size();
    if (blAsAsked && judgement.nLeftOver > 0) {
        judgement.szMessage += fmt::format(
            "; but the router may still have what no rule asks for: {} under 'left over on the "
            "router'",
            Count(judgement.nLeftOver, "row"));
    }
    return judgement;
}

std::string Moment(int64_t nTime, int64_t nNow) {
    constexpr size_t kSize = 32;
    const time_t nWhen = nTime, nToday = nNow;
    tm when = {}, today = {};
    localtime_r(&nWhen, &when);
    localtime_r(&nToday, &today);
    const bool blSameDay = when.tm_year == today.tm_year && when.tm_yday == today.tm_yday;
    char szText[kSize] = {};
    strftime(szText, sizeof(szText), blSameDay ? "%H:%M:%S" : "%Y-%m-%d %H:%M:%S", &when);
    return szText;
}

}  // namespace tavo::cli
