// Who keeps a port when the user's rules, a service's request and other hosts' mappings meet.
// Relies on the operation rules. Promises: pairs of ports are only ever taken away, whole rules only
// ever marked deleted; nothing is added and no number changes.
#pragma once

#include <array>
#include <climits>
#include <map>
#include <unordered_map>

#include "OperationRules.h"

namespace tavo::lib {

// Which rules a pass looks at; a null pointer to it: all of them.
struct RULE_FILTER {
    const char* szServiceName;  // null: any name
    bool blMatchServiceName;    // true: the rules of this service; false: those of the others
    bool blMatchEnabledRules;
    bool blMatchDisabledRules;
};

// 0, or -1 for a rule that passes the test of its name and meets a filter that wants neither enabled nor
// disabled rules.
int IsNeedToFilterOut(const MergeHost& host, bool* pblFilterOut, const OPERATION_RULE& rule,
                      const RULE_FILTER* pFilter);

enum class SearchStatus { Unknown, Found, NotFound, PartialMatched };

// Searches the pairs of one array, which must not change meanwhile. The first search puts down where
// every port stands first, so that a pass costs the sum of both sides' ports and not their product.
class OpRulesSearch {
public:
    OpRulesSearch(const MergeHost& host, const OPERATION_RULE* rgOpRules, int nOpRules, const RULE_FILTER* pFilter)
        : mHost(host), mRgRules(rgOpRules), mNRules(rgOpRules == nullptr ? 0 : nOpRules), mPFilter(pFilter) {}

    // What the first selected rule says that has either port: found where both stand first at the same
    // position, else partial matched. A "tcp" or "udp" pair is also looked for in rules for both protocols,
    // a pair for both only in rules for both. -1: a bad port, or a rule that cannot be judged comes first.
    // *ppDecider becomes the rule that decided, null where none did.
    int IsPortInOpRules(int nRouterPortNumber, int nBoxPortNumber, PORTMAP_PROTOCOL protocol, SearchStatus* pStatus,
                        const OPERATION_RULE** ppDecider);

private:
    static constexpr int kNoRule = INT_MAX;

    struct Place {
        int nRule = kNoRule;
        int nPosition = 0;
    };
    // The first place of each port. Ports come in ranges: one page holds the places of a block of them.
    class Places {
    public:
        void Add(const PortList& ports, int nRule);
        Place Find(int nPort) const;

    private:
        static constexpr unsigned kPageSize = 256;
        std::unordered_map<unsigned, std::array<Place, kPageSize>> mPages;
    };
    struct ProtocolIndex {
        Places router;
        Places box;
        int nBadFilter = kNoRule;  // the first rule that the filter cannot judge
    };

    void Index();
    static SearchStatus Judge(const Place& router, const Place& box);
    int Refuse(int nRule) const;

    const MergeHost& mHost;
    const OPERATION_RULE* mRgRules;
    int mNRules;
    const RULE_FILTER* mPFilter;
    bool mBlIndexed = false;
    int mNBroken = kNoRule;  // the first rule without its lists: nothing behind it is ever reached
    std::map<PORTMAP_PROTOCOL, ProtocolIndex> mProtocols;
};

// Takes the pairs out of rgOpRules1 (those that pFilter1 selects) that are found (blDeleteFound), or not
// found, in rgOpRules (pFilter2), which must be another array. A rule that lost every pair is marked
// deleted. A partial match is a failure; what was removed before a failure stays removed.
int DeletePortsFromRules1(const MergeHost& host, OPERATION_RULE* rgOpRules1, int nOpRules1,
                          const OPERATION_RULE* rgOpRules, int nOpRules, bool blDeleteFound,
                          const RULE_FILTER* pFilter1, const RULE_FILTER* pFilter2, MergeObserver* pObserver = nullptr);

// Marks the enabled rules of the service deleted: its new request replaces them.
int DeletePortsFromRuleConf(const MergeHost& host, OPERATION_RULE* rgRuleConfOpRules, int nRuleConfOpRules,
                            const char* szServiceName);

// Disabled rules of the service keep what it still requests; the request loses what others' enabled
// rules hold, then what the user switched off for the service.
int DeletePortsFromInputRules(const MergeHost& host, OPERATION_RULE* rgOpRules, int nOpRules,
                              OPERATION_RULE* rgRuleConfOpRules, int nRuleConfOpRules, const char* szServiceName,
                              MergeObserver* pObserver = nullptr);

}  // namespace tavo::lib
