// Detects the router under the lock and prints one line of JSON about it.
// Usage: detector [last | table | FILE]; last: what the last detection found; table: what the UPnP client reads
// of the router's table; FILE is made when the detectors begin, for tests that end this process in the middle.
#include <json/json.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <vector>

#include "libtavoportmap.h"
#include "tavo/upnp.h"

namespace {

struct Notes {
    std::vector<int> rgProgress;
    const char* szSignal;
};

void Note(const __tag_TAVO_ROUTER_DETECT_RESULT* pResult, void* pData) {
    auto* pNotes = static_cast<Notes*>(pData);
    pNotes->rgProgress.push_back(pResult->nProgress);
    if (pNotes->szSignal != nullptr && pResult->nProgress == 80) {
        std::fclose(std::fopen(pNotes->szSignal, "w"));
    }
}

int Print(const Json::Value& jsAnswer) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    std::printf("%s\n", Json::writeString(builder, jsAnswer).c_str());
    return jsAnswer["result"] == 0 ? 0 : 1;
}

// The entries by index, each asked for by its port as well: at once, and after the walk.
int PrintTable() {
    constexpr int kMostEntries = 100;
    Json::Value jsAnswer;
    jsAnswer["result"] = TAVOUpnpInit(5, 55002);
    jsAnswer["entries"] = Json::arrayValue;
    TAVO_UPNP_PORT_MAPPING rgMappings[kMostEntries];
    int nEntries = 0;
    int nCode = 0;
    int nFound = 0;
    for (TAVO_UPNP_PORT_MAPPING found; nEntries < kMostEntries; ++nEntries) {
        TAVO_UPNP_PORT_MAPPING& mapping = rgMappings[nEntries];
        if ((nCode = TAVOUpnpPortMappingGet(nEntries, &mapping)) != 0) {
            break;
        }
        Json::Value jsEntry;
        jsEntry.append(mapping.szProtocol);
        jsEntry.append(mapping.nExternalPort);
        jsEntry.append(mapping.szInternalClient);
        jsEntry.append(mapping.nInternalPort);
        jsAnswer["entries"].append(jsEntry);
        nFound += TAVOUpnpPortMappingFind(mapping.nExternalPort, mapping.szProtocol, &found) == 0 ? 1 : 0;
    }
    for (int i = 0; i < nEntries; ++i) {
        TAVO_UPNP_PORT_MAPPING found = rgMappings[i];
        const int nAsked = TAVOUpnpPortMappingFind(found.nExternalPort, found.szProtocol, &found);
        nFound += nAsked == 0 && found.nInternalPort == rgMappings[i].nInternalPort ? 1 : 0;
    }
    TAVO_UPNP_PORT_MAPPING none;
    jsAnswer["end"] = nCode;
    jsAnswer["by_port"] = nFound;
    jsAnswer["missing"] = TAVOUpnpPortMappingFind(4, "UDP", &none);
    return Print(jsAnswer);
}

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1 && std::strcmp(argv[1], "table") == 0) {
        return PrintTable();
    }
    const bool blLast = argc > 1 && std::strcmp(argv[1], "last") == 0;
    Notes notes{{}, argc > 1 ? argv[1] : nullptr};
    __tag_TAVO_ROUTER_DETECT_RESULT result = {};
    const pid_t pidSelf = getpid();
    const int nResult = blLast ? TLibGetRouterDetectResult(&result) : TLibDetectRouter(&result, &Note, &notes, true);
    if (getpid() != pidSelf) {
        _exit(1);
    }
    Json::Value jsAnswer;
    jsAnswer["result"] = nResult;
    jsAnswer["progress"] = Json::arrayValue;
    for (const int nProgress : notes.rgProgress) {
        jsAnswer["progress"].append(nProgress);
    }
    jsAnswer["end"] = result.nProgress;
    jsAnswer["err"] = result.errCode;
    jsAnswer["flags"] = result.nEnvFlags;
    jsAnswer["level"] = result.nPublicIPLevel;
    jsAnswer["gateway"] = result.szGateway;
    jsAnswer["interface"] = result.szInterface;
    jsAnswer["upnp"] = result.enSupportUpnp;
    jsAnswer["natpmp"] = result.enSupportNatpmp;
    jsAnswer["brand"] = result.szBrand;
    jsAnswer["model"] = result.szModel;
    jsAnswer["version"] = result.szVersion;
    jsAnswer["name"] = result.szUserSettingName;
    jsAnswer["max"] = result.nMaxRule;
    return Print(jsAnswer);
}
