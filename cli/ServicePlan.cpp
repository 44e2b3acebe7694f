// Runs the merge of a service's request with the stored rules, and puts into words what it sees. Relies on the merge.
// Promises: see ServicePlan.h.
#include "ServicePlan.h"

#include <fmt/format.h>

#include <algorithm>
#include <map>
#include <new>

#include "src/merge/RuleConflicts.h"
#include "tavo/portforward.h"

namespace tavo::cli {

const std::vector<std::string> kProtocolWords = {"tcp", "udp", "all"};

namespace {

using lib::OPERATION_RULE;
using lib::PortList;
using Records = std::vector<__tag_TAVO_ROUTER_RULE>;

constexpr size_t kPorts = 65536;
constexpr char kNoLongerAsked[] = "the service no longer asks for it";
constexpr char kHeldByOther[] = "another host holds it on the router";

// What the library would log is said by the plan.
class QuietHost : public lib::MergeHost {
public:
    bool IsValidPortNo(int nPort) const override { return TAVOPFIsValidPortNo(nPort) != 0; }

private:
    void Log(const char* /*szFormat*/, va_list /*arguments*/) const override {}
};

std::string NameOf(const __tag_TAVO_ROUTER_RULE& record) {
    const std::string szName = record.szServiceName;
    return Clean(record.szRuleID) + (szName.empty() ? "" : fmt::format(" ({})", Clean(szName)));
}

// Ports of one rule that go for one reason.
struct Gone {
    PortList ports;
    std::string szWhy;
};

// One request, from the records to what would be in rule.conf.
class Merge : public lib::MergeObserver {
public:
    Merge(const std::string& szService, const Requests& rgRequests, const Records& rgStored)
        : mSzService(szService), mRgRequests(rgRequests), mRgStored(rgStored) {}

    ServicePlan Run(const std::optional<UsedPorts>& used);

    void OnRemoved(const OPERATION_RULE& rule, int nRouterPort, int nBoxPort, const OPERATION_RULE* pDecider) override;
    void OnTorn(const OPERATION_RULE& rule, int nRouterPort, int nBoxPort, const OPERATION_RULE& decider) override;
    void OnUneven(const OPERATION_RULE& rule) override;

private:
    ServicePlan Conclude() const;
    bool Build();
    bool RunPasses(const std::optional<UsedPorts>& used);
    bool Refuse(const std::string& szWhy);
    // The record that a rule was made from; null for a request.
    const __tag_TAVO_ROUTER_RULE* RecordOf(const OPERATION_RULE& rule) const;
    std::string WhyGone(const OPERATION_RULE* pDecider) const;
    std::vector<Gone> FatesOf(const OPERATION_RULE& rule, const PortList& before) const;
    std::string ToText(const PortList& ports) const { return lib::ToText(mHost, ports).value_or(""); }
    void DescribeRequest(int nRequest, ServicePlan& plan) const;
    void DescribeStored(int nRule, ServicePlan& plan) const;
    std::string WhyCut() const;
    void Append(ServicePlan& plan) const;

    const QuietHost mHost;
    const std::string mSzService;
    const Requests& mRgRequests;
    const Records& mRgStored;
    lib::OperationRules mStored;
    lib::OperationRules mRequested;
    std::vector<PortList> mRgStoredPorts;  // of the router, as they were
    std::vector<PortList> mRgRequestedPorts;
    const char* mSzUndecided = kNoLongerAsked;  // why a pair goes that no rule decides over
    std::map<const OPERATION_RULE*, std::vector<Gone>> mMapGone;
    const OPERATION_RULE* mPLastRule = nullptr;  // that of the last pair that went, and who decided over it
    const OPERATION_RULE* mPLastDecider = nullptr;
    std::string mSzRefusal;
};

bool Merge::Refuse(const std::string& szWhy) {
    mSzRefusal = szWhy;
    return false;
}

const __tag_TAVO_ROUTER_RULE* Merge::RecordOf(const OPERATION_RULE& rule) const {
    for (size_t i = 0; i < mRgStored.size(); ++i) {
        if (mStored.rgRules + i == &rule) {
            return &mRgStored[i];
        }
    }
    return nullptr;
}

// ---- the merge ------------------------------------------------------------------------------------------

// What cannot be read is looked for one by one.
bool Merge::Build() {
    if (CreateOperationRulesArray(mHost, &mStored.rgRules, &mStored.nRules, mRgStored.data(),
                                  static_cast<int>(mRgStored.size())) != 0) {
        for (const __tag_TAVO_ROUTER_RULE& record : mRgStored) {
            lib::OperationRules one;
            if (CreateOperationRulesArray(mHost, &one.rgRules, &one.nRules, &record, 1) != 0) {
                return Refuse(fmt::format("the protocol or the ports of rule {} cannot be read", NameOf(record)));
            }
        }
        throw std::bad_alloc();
    }
    if (CreateOperationRulesArray(mHost, &mRequested.rgRules, &mRequested.nRules, mSzService.c_str(),
                                  mRgRequests.data(), static_cast<int>(mRgRequests.size())) != 0) {
        for (const __tag_TAVO_PORTMAP_RULE& request : mRgRequests) {
            PortList ports;
            if (ParsePorts(mHost, ports, request.szPorts) != 0) {
                return Refuse(fmt::format("the ports '{}' cannot be read", Clean(request.szPorts)));
            }
        }
        throw std::bad_alloc();
    }
    for (int i = 0; i < mStored.nRules; ++i) {
        mRgStoredPorts.push_back(*mStored.rgRules[i].routerPortSet);
    }
    for (int i = 0; i < mRequested.nRules; ++i) {
        mRgRequestedPorts.push_back(*mRequested.rgRules[i].routerPortSet);
    }
    return true;
}

bool Merge::RunPasses(const std::optional<UsedPorts>& used) {
    if (DeletePortsFromRuleConf(mHost, mStored.rgRules, mStored.nRules, mSzService.c_str()) != 0 ||
        DeletePortsFromInputRules(mHost, mRequested.rgRules, mRequested.nRules, mStored.rgRules, mStored.nRules,
                                  mSzService.c_str(), this) != 0) {
        return false;
    }
    mSzUndecided = kHeldByOther;
    mPLastRule = nullptr;
    return !used || DeleteUsedPorts(mHost, mRequested.rgRules, mRequested.nRules, mStored.rgRules, mStored.nRules,
                                    mSzService.c_str(), *used, this) == 0;
}

std::string Merge::WhyGone(const OPERATION_RULE* pDecider) const {
    const __tag_TAVO_ROUTER_RULE* pRecord = pDecider == nullptr ? nullptr : RecordOf(*pDecider);
    if (pRecord == nullptr) {
        return mSzUndecided;
    }
    return "rule " + NameOf(*pRecord) + (pDecider->blEnable ? " has it already" : " switches it off for the service");
}

void Merge::OnRemoved(const OPERATION_RULE& rule, int nRouterPort, int /*nBoxPort*/, const OPERATION_RULE* pDecider) {
    std::vector<Gone>& rgGone = mMapGone[&rule];
    if (&rule != mPLastRule || pDecider != mPLastDecider) {
        rgGone.push_back({{}, WhyGone(pDecider)});
        mPLastRule = &rule;
        mPLastDecider = pDecider;
    }
    rgGone.back().ports.push_back(nRouterPort);
}

void Merge::OnTorn(const OPERATION_RULE& rule, int nRouterPort, int /*nBoxPort*/, const OPERATION_RULE& decider) {
    const std::string szPort = fmt::format("{}/{}", nRouterPort, ToProtocolString(mHost, rule.protocol));
    if (const __tag_TAVO_ROUTER_RULE* pAsked = RecordOf(rule)) {
        Refuse(
            fmt::format("rule {}, which is switched off, forwards {} to another port of the box, and the request "
                        "names one of the two",
                        NameOf(*pAsked), szPort));
    } else if (const __tag_TAVO_ROUTER_RULE* pOther = RecordOf(decider)) {
        Refuse(fmt::format("port {} is only half of what rule {} forwards ({} to {})", szPort, NameOf(*pOther),
                           Clean(pOther->szRouterPort), Clean(pOther->szSrcPort)));
    }
}

void Merge::OnUneven(const OPERATION_RULE& rule) {
    if (const __tag_TAVO_ROUTER_RULE* pRecord = RecordOf(rule)) {
        Refuse(fmt::format("rule {} has {} router ports but {} box ports", NameOf(*pRecord), rule.routerPortSet->size(),
                           rule.boxPortSet->size()));
    }
}

// ---- the outcome ----------------------------------------------------------------------------------------

// The ports as they were, in their order, neighbours of one fate together. A pair that stands twice has one fate.
std::vector<Gone> Merge::FatesOf(const OPERATION_RULE& rule, const PortList& before) const {
    static const std::string kStays;
    std::vector<const std::string*> rgpWhy(kPorts, &kStays);
    if (const auto it = mMapGone.find(&rule); it != mMapGone.end()) {
        for (const Gone& gone : it->second) {
            for (const int nPort : gone.ports) {
                rgpWhy[static_cast<size_t>(nPort)] = &gone.szWhy;
            }
        }
    }
    std::vector<Gone> rgFates;
    for (const int nPort : before) {
        const std::string& szWhy = *rgpWhy[static_cast<size_t>(nPort)];
        if (rgFates.empty() || rgFates.back().szWhy != szWhy) {
            rgFates.push_back({{}, szWhy});
        }
        rgFates.back().ports.push_back(nPort);
    }
    return rgFates;
}

void Merge::DescribeRequest(int nRequest, ServicePlan& plan) const {
    const OPERATION_RULE& rule = mRequested.rgRules[nRequest];
    for (const Gone& fate : FatesOf(rule, mRgRequestedPorts[static_cast<size_t>(nRequest)])) {
        plan.rgPorts.push_back({ToText(fate.ports), ToProtocolString(mHost, rule.protocol), fate.szWhy});
    }
}

void Merge::DescribeStored(int nRule, ServicePlan& plan) const {
    const OPERATION_RULE& rule = mStored.rgRules[nRule];
    const std::string szName = NameOf(mRgStored[static_cast<size_t>(nRule)]);
    if (rule.blDeleted) {
        plan.rgRules.push_back(
            {szName, rule.blEnable ? "goes; the request takes its place" : "goes; none of its ports is left"});
        return;
    }
    if (mMapGone.count(&rule) == 0) {
        return;
    }
    std::map<std::string, PortList> mapGone;
    for (const Gone& fate : FatesOf(rule, mRgStoredPorts[static_cast<size_t>(nRule)])) {
        for (const int nPort : fate.ports) {
            mapGone[fate.szWhy].push_back(nPort);
        }
    }
    mapGone.erase("");
    for (const auto& [szWhy, ports] : mapGone) {
        plan.rgRules.push_back({szName, fmt::format("loses {}: {}", ToText(ports), szWhy)});
    }
}

// A merge writes every list anew, with a blank behind each comma, and cuts what its rule does not hold.
std::string Merge::WhyCut() const {
    const auto fnIsCut = [this](const OPERATION_RULE& rule) { return !rule.blDeleted && !FitsRecord(mHost, rule); };
    const OPERATION_RULE* pEnd = mStored.rgRules + mStored.nRules;
    if (const OPERATION_RULE* pCut = std::find_if(mStored.rgRules, mStored.rgRules + mStored.nRules, fnIsCut);
        pCut != pEnd) {
        return fmt::format(
            "the list of ports of rule {} would get longer than a rule can hold, and lose its end, as it does when the "
            "service asks by itself: make it two rules with 'rules edit' and 'rules add'",
            NameOf(*RecordOf(*pCut)));
    }
    return std::any_of(mRequested.rgRules, mRequested.rgRules + mRequested.nRules, fnIsCut)
               ? "a list of ports of the request would get longer than a rule can hold, and lose its end: ask for "
                 "fewer pieces"
               : "";
}

void Merge::Append(ServicePlan& plan) const {
    lib::RouterRules after;
    if (CreateRulesArray(mHost, &after.rgRules, &after.nRules, mStored.rgRules, mStored.nRules, mRequested.rgRules,
                         mRequested.nRules) != 0) {
        throw std::bad_alloc();
    }
    for (int i = 0; i < after.nRules; ++i) {
        const __tag_TAVO_ROUTER_RULE& record = after.rgRules[i];
        plan.after.push_back({record.szRuleID, record.blEnable, record.szProtocol, record.szRouterPort,
                              record.szSrcPort, record.szServiceID, record.szServiceName});
    }
    plan.szCut = WhyCut();
}

ServicePlan Merge::Conclude() const {
    ServicePlan plan;
    for (int i = 0; i < mRequested.nRules; ++i) {
        DescribeRequest(i, plan);
    }
    for (int i = 0; i < mStored.nRules; ++i) {
        DescribeStored(i, plan);
    }
    Append(plan);
    return plan;
}

ServicePlan Merge::Run(const std::optional<UsedPorts>& used) {
    if (Build() && RunPasses(used)) {
        return Conclude();
    }
    return {.szRefusal = mSzRefusal.empty() ? "the rules cannot be merged" : mSzRefusal};
}

}  // namespace

ServicePlan MakePlan(const std::string& szService, const Requests& rgRequests,
                     const std::vector<__tag_TAVO_ROUTER_RULE>& rgStored, const std::optional<UsedPorts>& used) {
    return Merge(szService, rgRequests, rgStored).Run(used);
}

}  // namespace tavo::cli
