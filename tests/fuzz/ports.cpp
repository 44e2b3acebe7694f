// Any text as a port list: what is read is valid and read alike in parts, and what is written for it
// opens no port that was not in it. Relies on libFuzzer. Promises: a failure is logged in one line.
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <set>
#include <string>

#include "HopLink.h"

namespace {

constexpr size_t kMaxText = 48;
constexpr size_t kMaxPorts = 4096;  // beyond, wide ranges only take time
constexpr int kRoom = 1 << 20;
int gNLines = 0;

void Require(bool blHolds) {
    if (!blHolds) {
        std::abort();
    }
}

void CheckWritten(const std::list<int>& read) {
    const tavo::lib::PortList ports(read.begin(), read.end());
    static char szWhole[kRoom];
    Require(tavo::lib::ToPorts(tavo::lib::Host(), szWhole, kRoom, ports) == 0);
    char szCut[8];
    Require(tavo::lib::ToPorts(tavo::lib::Host(), szCut, sizeof(szCut), ports) == 0);
    Require(std::strncmp(szCut, szWhole, sizeof(szCut) - 1) == 0 && std::strlen(szCut) < sizeof(szCut));
    std::list<int> again;
    Require(TLibParsePorts(again, szWhole) == 0);
    const std::set<int> wanted(ports.begin(), ports.end());
    for (const int nPort : again) {
        Require(wanted.count(nPort) == 1);
    }
}

}  // namespace

extern "C" void syslog(int /*nPriority*/, const char* /*szFormat*/, ...) {
    ++gNLines;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t nSize) {
    if (nSize > kMaxText || std::memchr(pData, '\0', nSize) != nullptr) {
        return -1;
    }
    const std::string szText(reinterpret_cast<const char*>(pData), nSize);
    std::list<int> ports;
    gNLines = 0;
    const int nResult = TLibParsePorts(ports, szText.c_str());
    Require(nResult == 0 ? gNLines == 0 && !ports.empty() : nResult == -1 && gNLines == 1);
    for (const int nPort : ports) {
        Require(nPort >= 1 && nPort <= 65535);
    }
    if (nResult != 0 || ports.size() > kMaxPorts) {
        return 0;
    }
    CheckWritten(ports);
    std::list<int> parts;
    for (size_t nStart = 0; nStart <= szText.size();) {
        const size_t nEnd = std::min(szText.find(',', nStart), szText.size());
        if (nEnd > nStart) {
            Require(TLibParsePorts(parts, szText.substr(nStart, nEnd - nStart).c_str()) == 0);
        }
        nStart = nEnd + 1;
    }
    Require(parts == ports);
    return 0;
}
