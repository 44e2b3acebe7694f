// Shows a situation. Relies on Table and Columns. Promises: see StatusView.h.
#include "StatusView.h"

#include <fmt/format.h>

#include <algorithm>
#include <numeric>

#include "Table.h"

namespace tavo::cli {

namespace {

// ---- words ----------------------------------------------------------------------------------------------------

std::string OutsideWords(const Situation& situation) {
    const std::string szOutside = Clean(situation.Outside());
    const Reach enReach = ReachOf(szOutside);
    const std::string szCaveat = ReachCaveat(enReach);
    return enReach == Reach::kUnknown ? "not known" : szOutside + (szCaveat.empty() ? "" : ", ") + szCaveat;
}

// How many address translations a connection from outside would have to pass.
std::string TranslationWords(const Situation& situation) {
    switch (ReachOf(situation.Outside())) {
        case Reach::kPublic:
            return "1, as it should be";
        case Reach::kPrivate:
        case Reach::kCarrier:
            return "2 or more; one is too many";
        default:
            return "";
    }
}

std::string SettingsWords(const Situation& situation) {
    const StoredRouter& settings = situation.settings;
    if (situation.blSettingsHidden) {
        return "(run it with sudo to see them)";
    }
    if (!settings.blAny) {
        return "none yet; 'sudo tavoportmap setup' finds out what the router is";
    }
    const std::string szName = settings.Name();
    return (szName.empty() ? "" : szName + ", ") + "driven by " + ToWords(settings.enWay);
}

std::string UnitWords(const Daemon& daemon) {
    if (!daemon.unit) {
        return daemon.blAlive ? "runs" : "does not run";
    }
    return fmt::format("{}, unit {}{}", daemon.blAlive ? "runs" : "does not run", daemon.unit->szActive,
                       daemon.unit->szEnabled.empty() ? "" : " and " + daemon.unit->szEnabled);
}

std::string KeeperWords(const Situation& situation) {
    const Daemon* pKeeper = situation.Keeper();
    if (situation.IsByPages()) {
        return "the router itself, as its pages were written";
    }
    return pKeeper == nullptr ? "nobody" : fmt::format("{} ({})", pKeeper->szName, UnitWords(*pKeeper));
}

std::string LookWords(const Situation& situation, bool blAges) {
    const Published* pWord = situation.Word();
    if (pWord == nullptr || pWord->nAt == 0) {
        return "";
    }
    const int64_t nAge = situation.nNow - pWord->nAt;
    return Moment(pWord->nAt, situation.nNow) + (blAges && nAge >= 0 ? fmt::format(", {} s ago", nAge) : "") +
           (pWord->nNextLook ? ", next " + Moment(*pWord->nNextLook, situation.nNow) : "");
}

std::string RuleWords(const Situation& situation) {
    const StoredRules& rules = situation.rules;
    if (rules.blHidden) {
        return "(run it with sudo to see them all)";
    }
    if (!rules.inForce) {
        return "unreadable";
    }
    const auto nOff =
        std::count_if(rules.inForce->begin(), rules.inForce->end(), [](const Rule& rule) { return !rule.blEnabled; });
    return fmt::format("{}{}", rules.inForce->size(), nOff == 0 ? "" : fmt::format(", {} of them switched off", nOff));
}

std::string LiveWords(const Situation& situation) {
    if (situation.live) {
        const size_t nEntries = situation.live->rgEntries.size();
        return fmt::format("{} {} in its table{}", nEntries, nEntries == 1 ? "entry" : "entries",
                           situation.live->blWhole ? "" : ", which it did not show to the end");
    }
    return situation.blAsked ? "does not answer by UPnP" : "";
}

std::string FactWords(const PortFact& fact, int64_t nNow) {
    std::string szWords = Clean(fact.szWhy) + WhoHas(fact.holder);
    const auto fnAdd = [&szWords](const std::string& szMore) { szWords += (szWords.empty() ? "" : ", ") + szMore; };
    if (fact.nSince) {
        fnAdd("since " + Moment(*fact.nSince, nNow));
    }
    if (fact.nUntil) {
        fnAdd("until " + Moment(*fact.nUntil, nNow));
    }
    return szWords;
}

std::string StateWord(Fate enFate) {
    return enFate == Fate::kNotKept ? "not kept" : ToWord(enFate);
}

// ---- rows -----------------------------------------------------------------------------------------------------

std::string NameOf(const Rule& rule) {
    return Clean(rule.szId + (rule.szId.empty() || rule.szName.empty() ? "" : " ") + rule.szName);
}

std::string WholePorts(const Rule& rule) {
    const std::string szPorts = rule.szRouterPorts + (rule.szProtocol.empty() ? "" : "/" + rule.szProtocol);
    return Clean(rule.szBoxPorts.empty() || rule.szBoxPorts == rule.szRouterPorts ? szPorts
                                                                                  : szPorts + " to " + rule.szBoxPorts);
}

std::string SomePorts(const std::vector<PortPair>& rgPairs) {
    std::string szText;
    for (const char* szProtocol : {"tcp", "udp"}) {
        std::vector<int> rgRouter, rgBox;
        for (const PortPair& pair : rgPairs) {
            if (pair.szProtocol == szProtocol) {
                rgRouter.push_back(pair.nRouter);
                rgBox.push_back(pair.nBox);
            }
        }
        if (!rgRouter.empty()) {
            szText += (szText.empty() ? "" : ", ") + PortsText(rgRouter) + "/" + szProtocol +
                      (rgRouter == rgBox ? "" : " to " + PortsText(rgBox));
        }
    }
    return szText;
}

// The ports of a rule that fare alike, in the order of their first ones.
std::vector<std::pair<PortFact, std::vector<PortPair>>> Groups(const RuleFact& fact) {
    std::vector<std::pair<PortFact, std::vector<PortPair>>> rgGroups;
    for (const PortFact& port : fact.rgPorts) {
        const auto pGroup =
            std::find_if(rgGroups.begin(), rgGroups.end(), [&](const auto& group) { return group.first.IsLike(port); });
        auto& group = pGroup == rgGroups.end() ? rgGroups.emplace_back(port, std::vector<PortPair>()) : *pGroup;
        group.second.push_back(port.pair);
    }
    return rgGroups;
}

// Name, ports, state and words of each group of ports.
std::vector<std::vector<std::string>> RowsOf(const RuleFact& fact, int64_t nNow) {
    const Rule& rule = fact.rule;
    const std::string szName = NameOf(rule);
    const auto rgGroups = Groups(fact);
    if (rgGroups.empty()) {
        return {{szName, WholePorts(rule), StateWord(fact.enFate), Clean(fact.szWhy)}};
    }
    std::vector<std::vector<std::string>> rgRows;
    for (const auto& [port, rgPairs] : rgGroups) {
        const bool blWhole = rgGroups.size() == 1 && !rule.szProtocol.empty();
        rgRows.push_back(
            {szName, blWhole ? WholePorts(rule) : SomePorts(rgPairs), StateWord(port.enFate), FactWords(port, nNow)});
    }
    return rgRows;
}

// What the next save would change.
std::string DraftText(const Situation& situation) {
    Table table({"not saved yet", "port", ""});
    if (!situation.rules.draft || !situation.rules.inForce) {
        return "";
    }
    const Rules& draft = *situation.rules.draft;
    const Rules& inForce = *situation.rules.inForce;
    const std::vector<size_t> rgBefore = Fellows(draft, inForce);
    const std::vector<size_t> rgAfter = Fellows(inForce, draft);
    for (size_t i = 0; i < draft.size(); ++i) {
        const bool blNew = rgBefore[i] == std::string::npos;
        if (blNew || ToJson(draft[i]) != ToJson(inForce[rgBefore[i]])) {
            const char* szWhat = blNew ? "new" : "changed";
            table.Add({NameOf(draft[i]), WholePorts(draft[i]),
                       fmt::format("{}{}", szWhat, draft[i].blEnabled ? "" : ", switched off")});
        }
    }
    for (size_t i = 0; i < inForce.size(); ++i) {
        if (rgAfter[i] == std::string::npos) {
            table.Add({NameOf(inForce[i]), WholePorts(inForce[i]), "removed"});
        }
    }
    return table.ToText();
}

std::string OthersText(const Judgement& judgement) {
    Table table({"also on the router for this box", "to port", "description"});
    for (const LiveEntry& entry : judgement.rgOthers) {
        table.Add({Clean(entry.Name()), std::to_string(entry.nClientPort), Clean(entry.szDescription)});
    }
    return table.ToText();
}

std::string LeftOverText(const Situation& situation) {
    Table table({"left over on the router", "for", "why"});
    for (const PublishedLeftOver& left : situation.LeftOver()) {
        table.Add({Clean(left.szName), Clean(left.szAddress),
                   Clean(left.szWhy) + (left.nUntil ? ", until " + Moment(*left.nUntil, situation.nNow) : "")});
    }
    return table.ToText();
}

// Blocks with an empty line between those that there are.
std::string Blocks(const std::vector<std::string>& rgszBlocks) {
    return std::accumulate(rgszBlocks.begin(), rgszBlocks.end(), std::string(),
                           [](const std::string& szAll, const std::string& szBlock) {
                               return szAll + (szAll.empty() || szBlock.empty() ? "" : "\n") + szBlock;
                           });
}

}  // namespace

std::string ToText(const Situation& situation, const Judgement& judgement, bool blAges) {
    Table table({"rule", "port", "state", ""});
    for (const RuleFact& fact : judgement.rgRules) {
        for (const auto& rgszCells : RowsOf(fact, situation.nNow)) {
            table.Add(rgszCells);
        }
    }
    const std::string szHead = Columns({
        {"gateway", situation.szGateway.value_or("none")},
        {"this box", situation.szBox},
        {"settings", SettingsWords(situation)},
        // Of a known router it is not what counts: a test may have found out since what no detection knew.
        {"last detection", situation.settings.blAny ? ""
                           : situation.detected     ? OneLine(*situation.detected)
                                                    : "none, or without a result"},
        {"outside address", OutsideWords(situation)},
        {"translations", TranslationWords(situation)},
        {"IPv6", situation.szIpv6.empty() ? "" : situation.szIpv6 + "; the rules are for IPv4 only"},
        {"kept by", KeeperWords(situation)},
        {"last look", LookWords(situation, blAges)},
        {"router now", LiveWords(situation)},
        {"rules", RuleWords(situation)},
        {"running now", situation.running.ToText()},
    });
    return Blocks({szHead, table.ToText(), DraftText(situation), LeftOverText(situation), OthersText(judgement)});
}

std::vector<std::string> ToLines(const Situation& situation, const Judgement& judgement) {
    std::vector<std::string> rgszLines;
    for (const RuleFact& fact : judgement.rgRules) {
        for (const auto& rgszCells : RowsOf(fact, situation.nNow)) {
            rgszLines.push_back(fmt::format("{} {}: {}{}{}", rgszCells[0], rgszCells[1], rgszCells[2],
                                            rgszCells[3].empty() ? "" : ", ", rgszCells[3]));
        }
    }
    rgszLines.push_back("outside address: " + OutsideWords(situation));
    rgszLines.push_back(judgement.szMessage);
    return rgszLines;
}

}  // namespace tavo::cli
