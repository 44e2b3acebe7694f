// What we made on manual routers, remembered across runs: the only way to know one's own on a router that
// shows no names, or shows nothing. Relies on a sectioned file below /var/lib/tavo.
// Promises: a mapping is on record before the router is asked for it, so that a run that is killed
// forgets none.
#pragma once

#include <string>
#include <vector>

#include "programs/tavoportforward/Jobs.h"

namespace tavo {

struct MadeJob {
    std::string szGateway;
    std::string szBox;  // the box's address at the time
    Job job;
};

class MadeJobs {
public:
    // Of a damaged record the rows that can be read count; that is logged.
    MadeJobs(std::string szGateway, std::string szBox);

    // Those at this gateway.
    std::vector<MadeJob> Here() const;
    // Whether we made the entry for these ports at this gateway, for the host szClient (empty: any).
    bool Holds(const Job& job, const std::string& szClient) const;
    // Both write the file; false when that failed.
    bool Add(const Job& job);
    bool Remove(const Job& job);

private:
    bool Write() const;

    std::string mSzGateway;
    std::string mSzBox;
    std::vector<MadeJob> mRgMade;
};

}  // namespace tavo
