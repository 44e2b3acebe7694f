// The settings of the platform itself. Relies on /etc/tavo/platform.conf, which may be missing.
// Promises: every key has a default, so the caller always gets a value.
#include <cstdio>

#include "tavo/core.h"

namespace {

constexpr char kSettings[] = "/etc/tavo/platform.conf";

}  // namespace

void TLIBPlatformSettingGet(const char* szSection, const char* szKey, const char* szDefault, char* szValue, int nSize) {
    if (szValue == nullptr || nSize < 1) {
        return;
    }
    if (TLIBCFileGetSectionValue(kSettings, szSection, szKey, szValue, nSize) != 0) {
        std::snprintf(szValue, static_cast<size_t>(nSize), "%s", szDefault == nullptr ? "" : szDefault);
    }
}
