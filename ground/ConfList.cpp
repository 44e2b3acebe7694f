// See ConfList.h.
#include "ground/ConfList.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <new>
#include <optional>

#include "ground/Fail.h"
#include "ground/SysLog.h"

namespace tavo {

ConfList MakeConfList(const std::vector<Section>& rgSections) {
    ConfList pHead;
    TAVO_PF_CONF** ppTail = nullptr;
    for (const Section& section : rgSections) {
        ConfList pNode(static_cast<TAVO_PF_CONF*>(std::calloc(1, sizeof(TAVO_PF_CONF))));
        if (!pNode) {
            throw std::bad_alloc();
        }
        std::snprintf(pNode->szSection, sizeof(pNode->szSection), "%s", section.szName.c_str());
        if (!section.rgPairs.empty()) {
            pNode->pHash = TLIBCSzHashAlloc(static_cast<int>(section.rgPairs.size()));
        }
        for (const Pair& pair : section.rgPairs) {
            if (TLIBCSzHashSetValue(pNode->pHash, pair.szKey.c_str(), pair.szValue.c_str()) < 0) {
                throw std::bad_alloc();
            }
        }
        TAVO_PF_CONF* pRaw = pNode.release();
        if (ppTail == nullptr) {
            pHead.reset(pRaw);
        } else {
            *ppTail = pRaw;
        }
        ppTail = &pRaw->pNext;
    }
    return pHead;
}

ConfList LoadConfList(const char* szPath) {
    const std::optional<std::vector<Section>> rgSections = LoadSections(szPath);
    if (!rgSections) {
        return nullptr;
    }
    // A name that was cut could be taken for another one.
    const bool blFits = rgSections->size() <= TAVO_PF_MAX_SECTIONS &&
                        std::all_of(rgSections->begin(), rgSections->end(),
                                    [](const Section& section) { return section.szName.size() < TAVO_PF_NAME_SIZE; });
    if (!blFits) {
        SysLog(LOG_ERR, "%s: too many sections, or a name over %d bytes; the file is left alone and not used", szPath,
               TAVO_PF_NAME_SIZE - 1);
        return Fail(TLIBC_ERR_FORMAT, nullptr);
    }
    ConfList pList = MakeConfList(*rgSections);
    SetError(TLIBC_ERR_NONE);
    return pList;
}

}  // namespace tavo
