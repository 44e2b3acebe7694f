// Parsed sections as the list of nodes that the seam hands out.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "ground/TextFile.h"
#include "tavo/portforward.h"

namespace tavo {

struct ConfListDeleter {
    void operator()(TAVO_PF_CONF* pHead) const { TAVOPFConfFree(pHead); }
};
using ConfList = std::unique_ptr<TAVO_PF_CONF, ConfListDeleter>;

// The value of a key; empty for a section without keys, a missing key or one without a value.
inline std::string Value(const TAVO_PF_CONF* pConf, const char* szKey) {
    const char* szValue = pConf->pHash == nullptr ? nullptr : TLIBCSzHashGetValue(pConf->pHash, szKey);
    return szValue == nullptr ? "" : szValue;
}

// Null for no sections; throws std::bad_alloc.
ConfList MakeConfList(const std::vector<Section>& rgSections);
// All sections of a sectioned file. Null: missing or unparsable, or (last error none) no section in it.
ConfList LoadConfList(const char* szPath);

}  // namespace tavo
