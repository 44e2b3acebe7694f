// What the NAT-PMP daemon could not map as asked. Relies on the text file that the daemon replaces
// after each pass. Promises: the whole text or a failure; the caller's block stays the caller's.
#include <cstdlib>
#include <cstring>

#include "ground/Border.h"
#include "ground/Fail.h"
#include "ground/TextFile.h"
#include "tavo/natpmp.h"

namespace {

using tavo::Fail;

constexpr char kRemapFile[] = "/var/tmp/natpmp_portmap.remap";

}  // namespace

int NetpmpRemapGet(char** ppszRemap, int* pnSize) {
    return tavo::AtBorder(-1, [&] {
        if (ppszRemap == nullptr || *ppszRemap == nullptr || pnSize == nullptr || *pnSize < 1) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const std::optional<std::string> szText = tavo::ReadFile(kRemapFile);
        if (!szText) {
            return -1;
        }
        const size_t nNeeded = szText->size() + 1;
        if (nNeeded > static_cast<size_t>(*pnSize)) {
            void* pGrown = std::realloc(*ppszRemap, nNeeded);
            if (pGrown == nullptr) {
                return Fail(TLIBC_ERR_NO_MEMORY);
            }
            *ppszRemap = static_cast<char*>(pGrown);
            *pnSize = static_cast<int>(nNeeded);
        }
        std::memcpy(*ppszRemap, szText->c_str(), nNeeded);
        return 0;
    });
}
