// Keeps the record of made mappings. Relies on TextFile. Promises: see Made.h.
#include "programs/tavoportforward/Made.h"

#include <algorithm>
#include <charconv>

#include "ground/Paths.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "tavo/core.h"

namespace tavo {

namespace {

constexpr char kRecord[] = "/var/lib/tavo/manual_router.made";

std::string Get(const Section& section, const char* szKey) {
    const auto it = std::find_if(section.rgPairs.begin(), section.rgPairs.end(),
                                 [szKey](const Pair& pair) { return pair.szKey == szKey; });
    return it == section.rgPairs.end() ? "" : it->szValue;
}

uint16_t GetPort(const Section& section, const char* szKey) {
    const std::string szText = Get(section, szKey);
    uint16_t nPort = 0;
    std::from_chars(szText.data(), szText.data() + szText.size(), nPort);
    return nPort;
}

}  // namespace

MadeJobs::MadeJobs(std::string szGateway, std::string szBox)
    : mSzGateway(std::move(szGateway)), mSzBox(std::move(szBox)) {
    if (TLIBCFileExist(kRecord) != 1) {
        return;
    }
    const auto szText = ReadFile(kRecord);
    size_t nLost = 0;
    const std::vector<Section> rgSections = ReadableSections(szText.value_or(""), &nLost);
    if (!szText || nLost != 0) {
        SysLog(LOG_ERR, "%s cannot be read%s: mappings made earlier are not known by it", kRecord,
               szText ? " as a whole" : "");
    }
    for (const Section& section : rgSections) {
        Job job{Get(section, "protocol"), GetPort(section, "router_first"), GetPort(section, "router_last"),
                GetPort(section, "box_first"), Get(section, "name")};
        if (job.nRouterFirst != 0 && job.nRouterFirst <= job.nRouterLast) {
            mRgMade.push_back({Get(section, "gateway"), Get(section, "box"), std::move(job)});
        }
    }
}

std::vector<MadeJob> MadeJobs::Here() const {
    std::vector<MadeJob> rgHere;
    std::copy_if(mRgMade.begin(), mRgMade.end(), std::back_inserter(rgHere),
                 [this](const MadeJob& made) { return made.szGateway == mSzGateway; });
    return rgHere;
}

bool MadeJobs::Holds(const Job& job, const std::string& szClient) const {
    return std::any_of(mRgMade.begin(), mRgMade.end(), [&](const MadeJob& made) {
        return made.szGateway == mSzGateway && made.job.HasSamePlace(job) &&
               (szClient.empty() || made.szBox == szClient);
    });
}

bool MadeJobs::Add(const Job& job) {
    std::erase_if(mRgMade,
                  [&](const MadeJob& made) { return made.szGateway == mSzGateway && made.job.HasSamePlace(job); });
    mRgMade.push_back({mSzGateway, mSzBox, job});
    return Write();
}

bool MadeJobs::Remove(const Job& job) {
    const size_t nRemoved = std::erase_if(
        mRgMade, [&](const MadeJob& made) { return made.szGateway == mSzGateway && made.job.HasSamePlace(job); });
    return nRemoved == 0 || Write();
}

bool MadeJobs::Write() const {
    std::vector<Section> rgSections;
    for (const auto& [szGateway, szBox, job] : mRgMade) {
        rgSections.push_back({std::to_string(rgSections.size() + 1),
                              {{"gateway", szGateway},
                               {"box", szBox},
                               {"protocol", job.szProtocol},
                               {"router_first", std::to_string(job.nRouterFirst)},
                               {"router_last", std::to_string(job.nRouterLast)},
                               {"box_first", std::to_string(job.nBoxFirst)},
                               {"name", job.szName}}});
    }
    const bool blWritten = MakeDirectory(kStateDir) && WriteFileAtomic(kRecord, FormatSections(rgSections));
    if (!blWritten) {
        SysLog(LOG_ERR, "cannot write %s", kRecord);
    }
    return blWritten;
}

}  // namespace tavo
