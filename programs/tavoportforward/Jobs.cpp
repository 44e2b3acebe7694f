// Takes the rules apart into jobs. Relies on PortText. Promises: see Jobs.h.
#include "programs/tavoportforward/Jobs.h"

#include <strings.h>

#include <algorithm>
#include <cstring>

#include "ground/ConfList.h"
#include "ground/PortText.h"
#include "programs/common/Wanted.h"

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

    void Add(const TAVO_PF_CONF* pRule);
    JobSet Take() { return std::move(mJobs); }

private:
    void AddJob(Job job, const ProtocolSet& protocols);
    void Keep(Job job, const char* szProtocol, bool blTaken);
    void Refuse(const Job& job, const char* szWhy) { mJobs.rgRefusals.push_back({job.Text(), szWhy, job}); }
    void RefuseRule(const TAVO_PF_CONF* pRule, const char* szWhy);

    Page mPort;
    Page mRange;
    JobSet mJobs;
};

void Splitter::RefuseRule(const TAVO_PF_CONF* pRule, const char* szWhy) {
    Job job;
    job.szRule = RuleTitle(pRule);
    mJobs.rgRefusals.push_back({RuleName(pRule), szWhy, job});
}

void Splitter::Add(const TAVO_PF_CONF* pRule) {
    if (MayBeCut(Value(pRule, "r_port")) || MayBeCut(Value(pRule, "s_port"))) {
        RefuseRule(pRule, "its list of ports is so long that it may have lost its end; write it as two rules");
        return;
    }
    const auto protocols = ParseProtocol(Value(pRule, "protocol name"));
    const auto rgRanges = ParsePortRanges(Value(pRule, "r_port"));
    // One protocol is enough to pair the ports.
    const auto rgPairs = ExpandRule("tcp", Value(pRule, "r_port"), Value(pRule, "s_port"));
    if (!protocols || !rgRanges || !rgPairs) {
        RefuseRule(pRule, "its ports cannot be paired");
        return;
    }
    size_t nPair = 0;
    for (const PortRange& range : *rgRanges) {
        const size_t nFirst = nPair;
        nPair += static_cast<size_t>(range.nLast - range.nFirst) + 1;
        const uint16_t nBoxFirst = (*rgPairs)[nFirst].nBoxPort;
        const Job job{"", range.nFirst, range.nLast, nBoxFirst, MappingDescription(pRule), RuleTitle(pRule)};
        if ((*rgPairs)[nPair - 1].nBoxPort - nBoxFirst != range.nLast - range.nFirst) {
            RefuseRule(pRule, "a range of router ports needs one range of the box's ports");
            continue;
        }
        AddJob(job, *protocols);
    }
}

void Splitter::AddJob(Job job, const ProtocolSet& protocols) {
    const Page& page = job.IsRange() ? mRange : mPort;
    const bool blBoth = protocols.blTcp && protocols.blUdp;
    if (!page.blThere) {
        job.szProtocol = blBoth ? "both" : (protocols.blTcp ? "tcp" : "udp");
        Refuse(job, "the router has no page for this kind of forward");
    } else if (blBoth && page.blBoth) {
        Keep(job, "both", true);
    } else {
        if (protocols.blTcp) {
            Keep(job, "tcp", page.blTcp);
        }
        if (protocols.blUdp) {
            Keep(job, "udp", page.blUdp);
        }
    }
}

void Splitter::Keep(Job job, const char* szProtocol, bool blTaken) {
    const Page& page = job.IsRange() ? mRange : mPort;
    job.szProtocol = szProtocol;
    if (!blTaken) {
        Refuse(job, "the router does not forward this protocol");
    } else if (!page.blChangePort && job.nRouterFirst != job.nBoxFirst) {
        Refuse(job, "the router cannot forward to another port number");
    } else if (std::none_of(mJobs.rgJobs.begin(), mJobs.rgJobs.end(),
                            [&](const Job& other) { return other.IsSame(job); })) {
        const bool blClash =
            std::any_of(mJobs.rgJobs.begin(), mJobs.rgJobs.end(), [&](const Job& other) { return other.Clashes(job); });
        if (blClash) {
            Refuse(job, "another rule has asked for this port already");
        } else {
            mJobs.rgJobs.push_back(std::move(job));
        }
    }
}

}  // namespace

std::string Job::Text() const {
    const std::string szLast = IsRange() ? "-" + std::to_string(nRouterLast) : "";
    return std::to_string(nRouterFirst) + szLast + "/" + szProtocol;
}

JobSet ReadJobs(const TAVO_PF_CONF* pDescription) {
    Splitter splitter(pDescription);
    const ConfList pRules(TAVOPFRuleGet());
    const bool blReadable =
        pRules != nullptr || TLIBCErrGet() == TLIBC_ERR_NONE || TLIBCFileExist("/etc/portforward/rule.conf") == 0;
    for (const TAVO_PF_CONF* pRule = pRules.get(); pRule != nullptr; pRule = pRule->pNext) {
        if (Value(pRule, "enabled") == "1") {
            splitter.Add(pRule);
        }
    }
    JobSet jobs = splitter.Take();
    jobs.blReadable = blReadable;
    return jobs;
}

}  // namespace tavo
