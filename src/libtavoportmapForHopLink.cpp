// The entry points of the relay service. Relies on the platform's test of a port number. Promises:
// arguments are checked before any work, and nothing is thrown.
#include <algorithm>
#include <climits>
#include <cstring>

#include "OperationRules.h"

namespace {

using tavo::lib::kHopLinkFile;
using tavo::lib::LogError;
using tavo::lib::PortList;

// sscanf leaves a value outside its type undefined; read wide and clamped, it is refused as a port.
void ReadRange(const char* szToken, int& nLow, int& nHigh) {
    long nFirst = 0;
    long nLast = 0;
    std::sscanf(szToken, "%ld-%ld", &nFirst, &nLast);
    nLow = static_cast<int>(std::clamp(nFirst, long{INT_MIN}, long{INT_MAX}));
    nHigh = static_cast<int>(std::clamp(nLast, long{INT_MIN}, long{INT_MAX}));
}

bool AppendRange(PortList& ports, const char* szToken) {
    int nLow = 0;
    int nHigh = 0;
    ReadRange(szToken, nLow, nHigh);
    if (TAVOPFIsValidPortNo(nLow) == 0 || TAVOPFIsValidPortNo(nHigh) == 0) {
        LogError("%s:%d invalid port range [%d-%d]", kHopLinkFile, __LINE__, nLow, nHigh);
        return false;
    }
    if (nLow > nHigh) {
        std::swap(nLow, nHigh);
    }
    for (int nPort = nLow; nPort <= nHigh; ++nPort) {
        ports.push_back(nPort);
    }
    return true;
}

bool AppendPort(PortList& ports, const char* szToken) {
    const int nPort = tavo::lib::ToInt(szToken);
    if (TAVOPFIsValidPortNo(nPort) == 0) {
        LogError("%s:%d invalid port no [%s]", kHopLinkFile, __LINE__, szToken);
        return false;
    }
    ports.push_back(nPort);
    return true;
}

int ParsePorts(PortList& ports, const char* szPort) {
    if (szPort == nullptr) {
        LogError("%s:%d Bad parameter, NULL == szPort", kHopLinkFile, __LINE__);
        return -1;
    }
    std::string szCopy = szPort;
    char* pRest = nullptr;
    const char* szToken = strtok_r(szCopy.data(), ",", &pRest);
    if (szToken == nullptr) {
        LogError("%s:%d invalid port format", kHopLinkFile, __LINE__);
        return -1;
    }
    for (; szToken != nullptr; szToken = strtok_r(nullptr, ",", &pRest)) {
        const bool blRange = std::strchr(szToken, '-') != nullptr;
        if (!(blRange ? AppendRange(ports, szToken) : AppendPort(ports, szToken))) {
            return -1;
        }
    }
    return 0;
}

}  // namespace

int TLibParsePorts(std::list<int>& ports, const char* szPort) {
    return tavo::lib::AtBorder(-1, [&] { return ParsePorts(ports, szPort); });
}
