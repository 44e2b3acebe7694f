// A list of ports, as runs. Relies on nothing. Promises: see PortList.h.
#include "PortList.h"

#include <algorithm>

namespace tavo::lib {

void PortList::push_back(int nPort) {
    const auto fnGoesOn = [nPort](const Run& run) {
        const long nNext = long{nPort} - run.nLast;
        return run.nFirst == run.nLast ? nNext == 1 || nNext == -1 : nNext == run.Step();
    };
    if (!mRgRuns.empty() && fnGoesOn(mRgRuns.back())) {
        mRgRuns.back().nLast = nPort;
    } else {
        mRgRuns.push_back({nPort, nPort});
    }
    ++mNSize;
}

void PortList::AppendRange(int nLow, int nHigh) {
    mRgRuns.push_back({nLow, nHigh});
    mNSize += static_cast<size_t>(long{nHigh} - nLow) + 1;
}

bool PortList::operator==(const PortList& other) const {
    return mNSize == other.mNSize && std::equal(begin(), end(), other.begin());
}

}  // namespace tavo::lib
