// Sections of a file that is being built. Promises: see Sections.h.
#include "Sections.h"

#include <cstdio>

#include "Log.h"

namespace tavo::lib {

ConfList NewSection(const std::string& szName, const char* szNoNode, const char* szNoHash, const char* szFile,
                    int nLine) {
    ConfList pNode(static_cast<TAVO_PF_CONF*>(std::calloc(1, sizeof(TAVO_PF_CONF))));
    if (!pNode) {
        LogError(szNoNode, szFile, nLine);
        return nullptr;
    }
    pNode->pHash = TLIBCSzHashAlloc(kHashSize);
    if (pNode->pHash == nullptr) {
        LogError(szNoHash, szFile, nLine);
        return nullptr;
    }
    std::snprintf(pNode->szSection, sizeof(pNode->szSection), "%s", szName.c_str());
    return pNode;
}

}  // namespace tavo::lib
