// Any text as a service's request: what a plain reading calls well-formed gets as far as the gateway, and
// nothing else does. Relies on libFuzzer; the gateway is one that is not there.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "libtavoportmap.h"

namespace {

constexpr size_t kMaxText = 160;
constexpr size_t kMaxPairs = 9;
bool gBlAskedGateway = false;

std::vector<std::string> Fields(const std::string& szText) {
    std::vector<std::string> rgFields;
    for (size_t nStart = 0; nStart < szText.size();) {
        const size_t nEnd = std::min(szText.find(';', nStart), szText.size());
        if (nEnd > nStart) {
            rgFields.push_back(szText.substr(nStart, nEnd - nStart));
        }
        nStart = nEnd + 1;
    }
    return rgFields;
}

bool IsWellFormed(const std::vector<std::string>& rgFields) {
    if (rgFields.size() % 2 == 0 || rgFields.size() / 2 > kMaxPairs) {
        return false;
    }
    for (size_t i = 1; i < rgFields.size(); i += 2) {
        std::list<int> ports;
        const std::string& szProtocol = rgFields[i + 1];
        if ((szProtocol != "tcp" && szProtocol != "udp" && szProtocol != "all") ||
            TLibParsePorts(ports, rgFields[i].c_str()) != 0) {
            return false;
        }
    }
    return true;
}

}  // namespace

extern "C" void syslog(int /*nPriority*/, const char* /*szFormat*/, ...) {}

extern "C" int TAVONetDefaultGatewayGet(char* /*szGateway*/, int /*nSize*/) {
    gBlAskedGateway = true;
    return -1;
}

extern "C" int LLVMFuzzerInitialize(int* /*pnArguments*/, char*** /*prgArguments*/) {
    return std::freopen("/dev/null", "w", stdout) == nullptr ? 1 : 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t nSize) {
    if (nSize > kMaxText || std::memchr(pData, '\0', nSize) != nullptr) {
        return -1;
    }
    const std::string szText(reinterpret_cast<const char*>(pData), nSize);
    const std::vector<std::string> rgFields = Fields(szText);
    const bool blWellFormed = IsWellFormed(rgFields);
    const bool blPorts = rgFields.size() > 1;
    gBlAskedGateway = false;
    const int nResult = TestFuncDeleteConflictPortsForUPnPRouter(szText.c_str());
    if (gBlAskedGateway != (blWellFormed && blPorts) || nResult != (blWellFormed && !blPorts ? 0 : -1)) {
        std::abort();
    }
    return 0;
}
