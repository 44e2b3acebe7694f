// Tests the stored rules from outside and prints one line of JSON: [[status, text], ...].
// Usage: porttester [library | own PROTOCOL ROUTER_PORT BOX_PORT]; library: by its entry points, which give no
// text; own: one port, with a listener of the tester's own.
#include <json/json.h>

#include <cstdio>
#include <cstdlib>
#include <vector>

#include "ground/ConfList.h"
#include "libtavoportmap.h"
#include "porttest/PortTest.h"
#include "tavo/porttest.h"

namespace {

void Append(Json::Value& jsAnswer, int enStatus, const char* szText) {
    Json::Value jsEntry;
    jsEntry.append(enStatus);
    jsEntry.append(szText);
    jsAnswer.append(jsEntry);
}

bool TestByLibrary(Json::Value& jsAnswer) {
    int nRules = 0;
    __tag_TAVO_ROUTER_RULE* rgRules = nullptr;
    if (TLibGetRulesArrFromRuleConf(&nRules, &rgRules, nullptr, true, nullptr) != 0 || TLibTestRulesInit() != 0 ||
        TLibTestRules(nRules, rgRules, nullptr, true) != 0) {
        return false;
    }
    for (int i = 0; i < nRules; ++i) {
        Append(jsAnswer, rgRules[i].enTestStatus, "");
    }
    return TLibFreeRulesArr(rgRules) == 0;
}

bool TestByPlatform(Json::Value& jsAnswer) {
    const tavo::ConfList pRules(TAVOPFRuleGet());
    std::vector<TAVO_PORT_STATUS> rgStatus(static_cast<size_t>(TLIBPFCountRuleConf(pRules.get(), 0)));
    if (TavoPortConnTestInit() != 0 ||
        TavoPortConnTest(pRules.get(), 1, rgStatus.data(), static_cast<int>(rgStatus.size())) != 0) {
        return false;
    }
    for (const TAVO_PORT_STATUS& status : rgStatus) {
        Append(jsAnswer, status.enStatus, status.szText);
    }
    return true;
}

bool TestOwn(char** pszPort, Json::Value& jsAnswer) {
    const auto fnPort = [](const char* szPort) { return static_cast<uint16_t>(std::atoi(szPort)); };
    for (const tavo::PortVerdict& verdict :
         tavo::TestPorts({{{pszPort[0], fnPort(pszPort[1]), fnPort(pszPort[2])}, true}})) {
        Append(jsAnswer, verdict.enStatus, verdict.szReason.c_str());
    }
    return true;
}

}  // namespace

int main(int argc, char** argv) {
    Json::Value jsAnswer = Json::arrayValue;
    const bool blDone = argc == 5   ? TestOwn(argv + 2, jsAnswer)
                        : argc == 2 ? TestByLibrary(jsAnswer)
                                    : TestByPlatform(jsAnswer);
    if (!blDone) {
        return 1;
    }
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    std::printf("%s\n", Json::writeString(builder, jsAnswer).c_str());
    return 0;
}
