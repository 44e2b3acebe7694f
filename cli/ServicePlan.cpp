// Plays the merge of a service's request with the stored rules. Relies on TLibParsePorts. Promises: see
// ServicePlan.h. A set is searched in rule order, and the first rule that has either port of a pair decides.
#include "ServicePlan.h"

#include <fmt/format.h>

#include <algorithm>
#include <climits>
#include <functional>
#include <list>
#include <map>
#include <optional>

namespace tavo::cli {

const std::vector<std::string> kProtocolWords = {"tcp", "udp", "all"};

namespace {

constexpr int kAll = 2;
constexpr size_t kPorts = 65536;
constexpr char kHopLink[] = "hoplink";

using Ports = std::vector<int>;

// A rule with its ports taken apart; the n-th router port goes with the n-th box port.
struct OpenRule {
    Rule rule;
    int enProtocol = 0;
    Ports rgRouter = {};
    Ports rgBox = {};
    std::vector<std::string> rgszGone = {};  // why a pair is out; empty: it is still in
    bool blDeleted = false;

    bool IsIn(size_t nPair) const { return nPair >= rgszGone.size() || rgszGone[nPair].empty(); }
    bool IsPaired() const { return rgRouter.size() == rgBox.size(); }
    bool IsEmpty() const {
        return std::none_of(rgszGone.begin(), rgszGone.end(), [](const std::string& szWhy) { return szWhy.empty(); });
    }
};

using OpenRules = std::vector<OpenRule>;
using Filter = std::function<bool(const OpenRule&)>;

std::optional<Ports> TakeApart(const char* szPorts) {
    std::list<int> ports;
    return TLibParsePorts(ports, szPorts) == 0 ? std::optional(Ports(ports.begin(), ports.end())) : std::nullopt;
}

std::string NameOf(const Rule& rule) {
    return Clean(rule.szId) + (rule.szName.empty() ? "" : fmt::format(" ({})", Clean(rule.szName)));
}

// As the library writes a list: runs of neighbours, rising or falling, are shortened.
std::string ToText(const Ports& rgPorts) {
    std::string szText;
    for (size_t i = 0; i < rgPorts.size();) {
        size_t nLast = i;
        while (nLast + 1 < rgPorts.size() && std::abs(rgPorts[nLast + 1] - rgPorts[nLast]) == 1) {
            ++nLast;
        }
        szText += fmt::format("{}{}", szText.empty() ? "" : ", ", rgPorts[i]);
        szText += nLast > i ? fmt::format("-{}", rgPorts[nLast]) : "";
        i = nLast + 1;
    }
    return szText;
}

// A list in its field of a rule; true when it was cut.
bool Cut(std::string& szPorts) {
    const bool blCut = szPorts.size() >= TAVO_TEXT_SIZE;
    szPorts.resize(std::min<size_t>(szPorts.size(), TAVO_TEXT_SIZE - 1));
    return blCut;
}

// ---- the search -----------------------------------------------------------------------------------------

// Where a set first has each port, for the pairs of one protocol.
class Places {
public:
    Places(const OpenRules& rules, int enProtocol, const Filter& fnSelect) {
        for (size_t nRule = 0; nRule < rules.size(); ++nRule) {
            const OpenRule& rule = rules[nRule];
            // One-sided: a pair of both protocols meets only rules of both.
            if (!rule.blDeleted && (rule.enProtocol == enProtocol || rule.enProtocol == kAll) && fnSelect(rule)) {
                Book(mRgRouter, rule, rule.rgRouter, nRule);
                Book(mRgBox, rule, rule.rgBox, nRule);
            }
        }
    }

    // The rule that decides over a pair, and whether it has it as a pair; nothing when none has either port.
    std::optional<std::pair<size_t, bool>> Find(int nRouterPort, int nBoxPort) const {
        const Place& router = mRgRouter[static_cast<size_t>(nRouterPort)];
        const Place& box = mRgBox[static_cast<size_t>(nBoxPort)];
        if (router.nRule == kNone && box.nRule == kNone) {
            return std::nullopt;
        }
        return std::pair(std::min(router.nRule, box.nRule), router.nRule == box.nRule && router.nPair == box.nPair);
    }

private:
    static constexpr size_t kNone = SIZE_MAX;
    struct Place {
        size_t nRule = kNone;
        size_t nPair = 0;
    };

    static void Book(std::vector<Place>& rgPlaces, const OpenRule& rule, const Ports& rgPorts, size_t nRule) {
        for (size_t nPair = 0; nPair < rgPorts.size(); ++nPair) {
            Place& place = rgPlaces[static_cast<size_t>(rgPorts[nPair])];
            if (place.nRule == kNone && rule.IsIn(nPair)) {
                place = {nRule, nPair};
            }
        }
    }

    std::vector<Place> mRgRouter = std::vector<Place>(kPorts);
    std::vector<Place> mRgBox = std::vector<Place>(kPorts);
};

// ---- the merge ------------------------------------------------------------------------------------------

class Merge {
public:
    explicit Merge(const std::string& szService) : mSzService(szService) {}

    // Each step answers whether to go on.
    bool TakeStored(const std::vector<__tag_TAVO_ROUTER_RULE>& rgStored);
    bool TakeRequests(const Requests& rgRequests);
    void DropOwn();
    bool RunPasses();
    bool YieldToOthers(const UsedPorts& used);
    ServicePlan Conclude() const;

private:
    // One pass: which pairs of which rules go, by what is found of them where.
    struct Pass {
        OpenRules& rules;
        Filter fnSelect;
        const OpenRules& others;
        Filter fnSelectOthers;
        bool blGoesWhenFound;
        std::function<std::string(const OpenRule&)> fnWhy;  // of the rule that it was found in
    };

    bool IsOwn(const OpenRule& rule) const { return rule.rule.szName == mSzService; }
    bool Run(const Pass& pass);
    bool RunRule(const Pass& pass, OpenRule& rule, const Places& places);
    bool Refuse(const std::string& szWhy);
    bool YieldRules(OpenRules& rules, const UsedPorts& used);
    void DescribeRequest(const OpenRule& rule, ServicePlan& plan) const;
    void DescribeStored(const OpenRule& rule, ServicePlan& plan) const;
    static void Append(const OpenRules& rules, ServicePlan& plan);

    std::string mSzService;
    OpenRules mStored;
    OpenRules mRequested;
    std::string mSzRefusal;
};

bool Merge::Refuse(const std::string& szWhy) {
    mSzRefusal = szWhy;
    return false;
}

bool Merge::TakeStored(const std::vector<__tag_TAVO_ROUTER_RULE>& rgStored) {
    for (const __tag_TAVO_ROUTER_RULE& record : rgStored) {
        OpenRule open{.rule = {record.szRuleID, record.blEnable, record.szProtocol, record.szRouterPort,
                               record.szSrcPort, record.szServiceID, record.szServiceName}};
        const auto pWord = std::find(kProtocolWords.begin(), kProtocolWords.end(), record.szProtocol);
        const auto rgRouter = TakeApart(record.szRouterPort);
        const auto rgBox = TakeApart(record.szSrcPort);
        if (pWord == kProtocolWords.end() || !rgRouter || !rgBox) {
            return Refuse(fmt::format("the protocol or the ports of rule {} cannot be read", NameOf(open.rule)));
        }
        open.enProtocol = static_cast<int>(pWord - kProtocolWords.begin());
        open.rgRouter = *rgRouter;
        open.rgBox = *rgBox;
        open.rgszGone.resize(open.rgRouter.size());
        mStored.push_back(std::move(open));
    }
    return true;
}

bool Merge::TakeRequests(const Requests& rgRequests) {
    for (const __tag_TAVO_PORTMAP_RULE& request : rgRequests) {
        const auto rgPorts = TakeApart(request.szPorts);
        if (!rgPorts) {
            return Refuse(fmt::format("the ports '{}' cannot be read", Clean(request.szPorts)));
        }
        mRequested.push_back({.rule = {"", true, kProtocolWords[static_cast<size_t>(request.enProtocol)], "", "",
                                       mSzService == kHopLink ? "HopLink" : "", mSzService},
                              .enProtocol = request.enProtocol,
                              .rgRouter = *rgPorts,
                              .rgBox = *rgPorts,
                              .rgszGone = std::vector<std::string>(rgPorts->size())});
    }
    return true;
}

void Merge::DropOwn() {
    for (OpenRule& rule : mStored) {
        rule.blDeleted = rule.rule.blEnabled && IsOwn(rule);
    }
}

bool Merge::RunRule(const Pass& pass, OpenRule& rule, const Places& places) {
    for (size_t i = rule.rgRouter.size(); i-- > 0;) {
        if (!rule.IsIn(i)) {
            continue;
        }
        const auto found = places.Find(rule.rgRouter[i], rule.rgBox[i]);
        if (found && !found->second) {
            const Rule& asked = rule.rule;
            const Rule& other = pass.others[found->first].rule;
            const std::string szPort = fmt::format("{}/{}", rule.rgRouter[i], asked.szProtocol);
            return Refuse(
                asked.szId.empty()
                    ? fmt::format("port {} is only half of what rule {} forwards ({} to {})", szPort, NameOf(other),
                                  Clean(other.szRouterPorts), Clean(other.szBoxPorts))
                    : fmt::format("rule {}, which is switched off, forwards {} to another port of the box, and the "
                                  "request names one of the two",
                                  NameOf(asked), szPort));
        }
        if (found.has_value() == pass.blGoesWhenFound) {
            rule.rgszGone[i] = pass.fnWhy(found ? pass.others[found->first] : rule);
        }
    }
    rule.blDeleted = rule.IsEmpty();
    return true;
}

bool Merge::Run(const Pass& pass) {
    std::map<int, Places> mapPlaces;
    for (OpenRule& rule : pass.rules) {
        if (rule.blDeleted || !pass.fnSelect(rule)) {
            continue;
        }
        if (!rule.IsPaired()) {
            return Refuse(fmt::format("rule {} has {} router ports but {} box ports", NameOf(rule.rule),
                                      rule.rgRouter.size(), rule.rgBox.size()));
        }
        auto it = mapPlaces.find(rule.enProtocol);
        if (it == mapPlaces.end()) {
            it = mapPlaces.emplace(rule.enProtocol, Places(pass.others, rule.enProtocol, pass.fnSelectOthers)).first;
        }
        if (!RunRule(pass, rule, it->second)) {
            return false;
        }
    }
    return true;
}

bool Merge::RunPasses() {
    const Filter fnEvery = [](const OpenRule&) { return true; };
    const Filter fnOthersOn = [this](const OpenRule& rule) { return !IsOwn(rule) && rule.rule.blEnabled; };
    const Filter fnOwnOff = [this](const OpenRule& rule) { return IsOwn(rule) && !rule.rule.blEnabled; };
    return Run({mStored, fnOwnOff, mRequested, fnEvery, false,
                [](const OpenRule&) { return "the service no longer asks for it"; }}) &&
           Run({mRequested, fnEvery, mStored, fnOthersOn, true,
                [](const OpenRule& rule) { return fmt::format("rule {} has it already", NameOf(rule.rule)); }}) &&
           Run({mRequested, fnEvery, mStored, fnOwnOff, true, [](const OpenRule& rule) {
                    return fmt::format("rule {} switches it off for the service", NameOf(rule.rule));
                }});
}

bool Merge::YieldRules(OpenRules& rules, const UsedPorts& used) {
    for (OpenRule& rule : rules) {
        if (!IsOwn(rule)) {
            continue;
        }
        if (!rule.IsPaired()) {
            return Refuse(fmt::format("rule {} has {} router ports but {} box ports", NameOf(rule.rule),
                                      rule.rgRouter.size(), rule.rgBox.size()));
        }
        // Of both protocols, the library looks at TCP alone.
        const std::set<int>& setUsed =
            kProtocolWords[static_cast<size_t>(rule.enProtocol)] == "udp" ? used.setUdp : used.setTcp;
        for (size_t i = 0; i < rule.rgRouter.size(); ++i) {
            if (rule.IsIn(i) && setUsed.count(rule.rgRouter[i]) != 0) {
                rule.rgszGone[i] = "another host holds it on the router";
            }
        }
        rule.blDeleted = rule.blDeleted || rule.IsEmpty();
    }
    return true;
}

bool Merge::YieldToOthers(const UsedPorts& used) {
    return YieldRules(mRequested, used) && YieldRules(mStored, used);
}

// ---- the outcome ----------------------------------------------------------------------------------------

void Merge::DescribeRequest(const OpenRule& rule, ServicePlan& plan) const {
    for (size_t i = 0; i < rule.rgRouter.size();) {
        Ports rgSame;
        const std::string& szWhy = rule.rgszGone[i];
        for (; i < rule.rgRouter.size() && rule.rgszGone[i] == szWhy; ++i) {
            rgSame.push_back(rule.rgRouter[i]);
        }
        plan.rgPorts.push_back({ToText(rgSame), rule.rule.szProtocol, szWhy});
    }
}

void Merge::DescribeStored(const OpenRule& rule, ServicePlan& plan) const {
    if (rule.blDeleted) {
        plan.rgRules.push_back({NameOf(rule.rule), rule.rule.blEnabled ? "goes; the request takes its place"
                                                                       : "goes; none of its ports is left"});
        return;
    }
    std::map<std::string, Ports> mapGone;
    for (size_t i = 0; i < rule.rgszGone.size(); ++i) {
        if (!rule.IsIn(i)) {
            mapGone[rule.rgszGone[i]].push_back(rule.rgRouter[i]);
        }
    }
    for (const auto& [szWhy, rgPorts] : mapGone) {
        plan.rgRules.push_back({NameOf(rule.rule), fmt::format("loses {}: {}", ToText(rgPorts), szWhy)});
    }
}

void Merge::Append(const OpenRules& rules, ServicePlan& plan) {
    for (const OpenRule& open : rules) {
        if (open.blDeleted) {
            continue;
        }
        Rule rule = open.rule;
        Ports rgRouter, rgBox;
        for (size_t i = 0; i < std::max(open.rgRouter.size(), open.rgBox.size()); ++i) {
            if (open.IsIn(i) && i < open.rgRouter.size()) {
                rgRouter.push_back(open.rgRouter[i]);
            }
            if (open.IsIn(i) && i < open.rgBox.size()) {
                rgBox.push_back(open.rgBox[i]);
            }
        }
        rule.szId = std::to_string(plan.after.size() + 1);
        rule.szRouterPorts = ToText(rgRouter);
        rule.szBoxPorts = ToText(rgBox);
        plan.blCut = Cut(rule.szRouterPorts) || plan.blCut;
        plan.blCut = Cut(rule.szBoxPorts) || plan.blCut;
        plan.after.push_back(rule);
    }
}

ServicePlan Merge::Conclude() const {
    ServicePlan plan{.szRefusal = mSzRefusal};
    if (!mSzRefusal.empty()) {
        return plan;
    }
    for (const OpenRule& rule : mRequested) {
        DescribeRequest(rule, plan);
    }
    for (const OpenRule& rule : mStored) {
        DescribeStored(rule, plan);
    }
    Append(mStored, plan);
    Append(mRequested, plan);
    return plan;
}

}  // namespace

ServicePlan MakePlan(const std::string& szService, const Requests& rgRequests,
                     const std::vector<__tag_TAVO_ROUTER_RULE>& rgStored, const std::optional<UsedPorts>& used) {
    Merge merge(szService);
    if (merge.TakeStored(rgStored) && merge.TakeRequests(rgRequests)) {
        merge.DropOwn();
        if (merge.RunPasses() && used) {
            merge.YieldToOthers(*used);
        }
    }
    return merge.Conclude();
}

}  // namespace tavo::cli
