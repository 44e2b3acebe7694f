// Detects the router under the lock and prints one line of JSON about it.
// Usage: detector [last | FILE]; last: what the last detection found; FILE is made when the detectors begin,
// for tests that end this process in the middle.
#include <json/json.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <vector>

#include "libtavoportmap.h"

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

}  // namespace

int main(int argc, char** argv) {
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
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    std::printf("%s\n", Json::writeString(builder, jsAnswer).c_str());
    return nResult == 0 ? 0 : 1;
}
