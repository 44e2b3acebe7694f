// Takes the rules apart into jobs. Relies on PortText. Promises: see Jobs.h.
#include "programs/tavoportforward/Jobs.h"

#include <strings.h>

#include <algorithm>
#include <cstring>

#include "ground/ConfList.h"
#include "ground/PortText.h"
#include "mapping/Record.h"
#include "programs/common/RuleFile.h"

namespace tavo {

namespace {

// What a page of the router takes.
struct Page {
    bool blThere = false;
    bool blTcp = false;
    bool blUdp = false;
    bool blBoth = false;
    bool blChangePort = false;
};

Page ReadPage(const TAVO_PF_CONF* pDescription, const char* szName) {
    Page page;
    for (const TAVO_PF_CONF* pSection = pDescription; pSection != nullptr; pSection = pSection->pNext) {
        if (pSection->pHash == nullptr || std::strcmp(pSection->szSection, szName) != 0) {
            continue;
        }
        page.blThere = true;
        page.blTcp = TLIBCSzHashGetValue(pSection->pHash, "tcp") != nullptr;
        page.blUdp = TLIBCSzHashGetValue(pSection->pHash, "udp") != nullptr;
        page.blBoth = TLIBCSzHashGetValue(pSection->pHash, "tcp_udp") != nullptr;
        page.blChangePort = strcasecmp(Value(pSection, "change router port").c_str(), "yes") == 0;
    }
    return page;
}

class Splitter {
public:
    explicit Splitter(const TAVO_PF_CONF* pDescription)
        : mPort(ReadPage(pDescription, "PF port page")), mRange(ReadPage(pDescription, "PF range page")) {}

    void Add(const RuleText& rule);
    JobSet Take() { return std::move(mJobs); }

private:
    void AddJob(Job job, const ProtocolSet& protocols);
    void Keep(Job job, const char* szProtocol, bool blTaken);
    void Refuse(const Job& job, const char* szWhy) {
        mJobs.rgRefusals.push_back({MappingName(job.mapping), szWhy, job});
    }
    void RefuseRule(const RuleText& rule, const char* szWhy);

    Page mPort;
    Page mRange;
    JobSet mJobs;
};

void Splitter::RefuseRule(const RuleText& rule, const char* szWhy) {
    mJobs.rgRefusals.push_back({RuleName(rule), szWhy, {{}, RuleTitle(rule)}});
}

void Splitter::Add(const RuleText& rule) {
    if (MayBeCut(rule.szRouterPorts) || MayBeCut(rule.szBoxPorts)) {
        RefuseRule(rule, "its list of ports is so long that it may have lost its end; write it as two rules");
        return;
    }
    const auto protocols = ParseProtocol(rule.szProtocol);
    const auto rgRanges = ParsePortRanges(rule.szRouterPorts);
    // One protocol is enough to pair the ports.
    const auto rgPairs = ExpandRule("tcp", rule.szRouterPorts, rule.szBoxPorts);
    if (!protocols || !rgRanges || !rgPairs) {
        RefuseRule(rule, "its ports cannot be paired");
        return;
    }
    size_t nPair = 0;
    for (const PortRange& range : *rgRanges) {
        const auto nMore = static_cast<uint16_t>(range.nLast - range.nFirst);
        const uint16_t nBoxFirst = (*rgPairs)[nPair].nBoxPort;
        nPair += size_t{nMore} + 1;
        if ((*rgPairs)[nPair - 1].nBoxPort - nBoxFirst != nMore) {
            RefuseRule(rule, "a range of router ports needs one range of the box's ports");
            continue;
        }
        AddJob({{"", range.nFirst, nBoxFirst, "", MappingDescription(rule), 0, true, nMore}, RuleTitle(rule)},
               *protocols);
    }
}

void Splitter::AddJob(Job job, const ProtocolSet& protocols) {
    const Page& page = job.mapping.nMore != 0 ? mRange : mPort;
    const bool blBoth = protocols.blTcp && protocols.blUdp;
    if (!page.blThere) {
        job.mapping.szProtocol = blBoth ? "BOTH" : protocols.blTcp ? "TCP" : "UDP";
        Refuse(job, "the router has no page for this kind of forward");
    } else if (blBoth && page.blBoth) {
        Keep(job, "BOTH", true);
    } else {
        if (protocols.blTcp) {
            Keep(job, "TCP", page.blTcp);
        }
        if (protocols.blUdp) {
            Keep(job, "UDP", page.blUdp);
        }
    }
}

void Splitter::Keep(Job job, const char* szProtocol, bool blTaken) {
    const Page& page = job.mapping.nMore != 0 ? mRange : mPort;
    const auto fnAny = [&](bool (*fnIs)(const RouterMapping&, const RouterMapping&)) {
        return std::any_of(mJobs.rgJobs.begin(), mJobs.rgJobs.end(),
                           [&](const Job& other) { return fnIs(other.mapping, job.mapping); });
    };
    job.mapping.szProtocol = szProtocol;
    if (!blTaken) {
        Refuse(job, "the router does not forward this protocol");
    } else if (!page.blChangePort && job.mapping.nRouterPort != job.mapping.nBoxPort) {
        Refuse(job, "the router cannot forward to another port number");
    } else if (!fnAny(IsSame) && fnAny(Clash)) {
        Refuse(job, "another rule has asked for this port already");
    } else if (!fnAny(IsSame)) {
        mJobs.rgJobs.push_back(std::move(job));
    }
}

}  // namespace

bool IsSame(const RouterMapping& one, const RouterMapping& other) {
    return KeyOf(one) == KeyOf(other) && one.nMore == other.nMore && one.nBoxPort == other.nBoxPort;
}

bool Clash(const RouterMapping& one, const RouterMapping& other) {
    return one.nRouterPort <= other.nRouterPort + other.nMore && other.nRouterPort <= one.nRouterPort + one.nMore &&
           (one.szProtocol == other.szProtocol || one.szProtocol == "BOTH" || other.szProtocol == "BOTH");
}

JobSet ReadJobs(const TAVO_PF_CONF* pDescription) {
    Splitter splitter(pDescription);
    const ConfList pRules(TAVOPFRuleGet());
    const bool blReadable =
        pRules != nullptr || TLIBCErrGet() == TLIBC_ERR_NONE || TLIBCFileExist("/etc/portforward/rule.conf") == 0;
    for (const TAVO_PF_CONF* pRule = pRules.get(); pRule != nullptr; pRule = pRule->pNext) {
        if (Value(pRule, "enabled") == "1") {
            splitter.Add(RuleTextOf(pRule));
        }
    }
    JobSet jobs = splitter.Take();
    jobs.blReadable = blReadable;
    return jobs;
}

}  // namespace tavo
