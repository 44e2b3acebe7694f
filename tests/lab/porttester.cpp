// Tests the stored rules from outside and prints one line of JSON: [[status, text], ...].
// Usage: porttester [own PROTOCOL ROUTER_PORT BOX_PORT]; own: one port, with a listener of the tester's own.
#include <json/json.h>

#include <cstdio>
#include <cstdlib>
#include <vector>

#include "portforward/ConfList.h"
#include "porttest/PortTest.h"
#include "tavo/porttest.h"

namespace {

void Append(Json::Value& jsAnswer, int enStatus, const char* szText) {
    Json::Value jsEntry;
    jsEntry.append(enStatus);
    jsEntry.append(szText);
    jsAnswer.append(jsEntry);
}

}  // namespace

int main(int argc, char** argv) {
    Json::Value jsAnswer = Json::arrayValue;
    if (argc == 5) {
        const auto fnPort = [](const char* szPort) { return static_cast<uint16_t>(std::atoi(szPort)); };
        for (const tavo::PortVerdict& verdict :
             tavo::TestPorts({{{argv[2], fnPort(argv[3]), fnPort(argv[4])}, true}})) {
            Append(jsAnswer, verdict.enStatus, verdict.szReason.c_str());
        }
    } else {
        const tavo::ConfList pRules(TAVOPFRuleGet());
        std::vector<TAVO_PORT_STATUS> rgStatus(static_cast<size_t>(TLIBPFCountRuleConf(pRules.get(), 0)));
        if (TavoPortConnTestInit() != 0 ||
            TavoPortConnTest(pRules.get(), 1, rgStatus.data(), static_cast<int>(rgStatus.size())) != 0) {
            return 1;
        }
        for (const TAVO_PORT_STATUS& status : rgStatus) {
            Append(jsAnswer, status.enStatus, status.szText);
        }
    }
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    std::printf("%s\n", Json::writeString(builder, jsAnswer).c_str());
    return 0;
}
