// Parsed sections as the list of nodes that the seam hands out.
#pragma once

#include <memory>
#include <vector>

#include "core/TextFile.h"
#include "tavo/portforward.h"

namespace tavo {

struct ConfListDeleter {
    void operator()(TAVO_PF_CONF* pHead) const { TAVOPFConfFree(pHead); }
};
using ConfList = std::unique_ptr<TAVO_PF_CONF, ConfListDeleter>;

// Null for no sections; throws std::bad_alloc.
ConfList MakeConfList(const std::vector<Section>& rgSections);
// All sections of a sectioned file. Null: missing or unparsable, or (last error none) no section in it.
ConfList LoadConfList(const char* szPath);

}  // namespace tavo
