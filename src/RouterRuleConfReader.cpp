// Walks the rules of rule.conf or testrule.conf. Relies on the platform's port-forward library and the
// accessors of a parsed section. Promises: one snapshot, loaded by the first StartNextRule().
#include "Log.h"
#include "libtavoportmap.h"
#include "tavo/portforward.h"

namespace {

constexpr char kFile[] = "src/RouterRuleConfReader.cpp";

using tavo::lib::LogError;

}  // namespace

RouterRuleConfReader::RouterRuleConfReader(bool blTestRule)
    : mPHead(nullptr), mPCurrent(nullptr), mBlTestRule(blTestRule) {}

RouterRuleConfReader::~RouterRuleConfReader() {
    TAVOPFConfFree(mPHead);
}

int RouterRuleConfReader::StartNextRule() {
    if (mPHead == nullptr) {
        mPHead = mBlTestRule ? TAVOPFTestRuleGet() : TAVOPFRuleGet();
    }
    mPCurrent = mPHead;
    return mPHead != nullptr ? 1 : 0;
}

int RouterRuleConfReader::NextRule() {
    if (mPCurrent == nullptr) {
        LogError("%s:%d next rule failed", kFile, __LINE__);
        return 0;
    }
    mPCurrent = mPCurrent->pNext;
    return mPCurrent != nullptr ? 1 : 0;
}

int RouterRuleConfReader::GetRulesNumber(int& nRules) {
    nRules = 0;
    for (const TAVO_PF_CONF* pConf = mPHead; pConf != nullptr; pConf = pConf->pNext) {
        ++nRules;
    }
    return 1;
}

int RouterRuleConfReader::IsRuleEnable(bool& blEnable) {
    return PF_CONF::IsRuleEnable(blEnable, mPCurrent);
}

int RouterRuleConfReader::GetRuleID(std::string& id) {
    return PF_CONF::GetRuleID(id, mPCurrent);
}

int RouterRuleConfReader::GetRuleProtocol(std::string& protocol) {
    return PF_CONF::GetRuleProtocol(protocol, mPCurrent);
}

int RouterRuleConfReader::GetRulePort(std::string& routerPort, std::string& srcPort) {
    return PF_CONF::GetRulePort(routerPort, srcPort, mPCurrent);
}

int RouterRuleConfReader::GetRuleServiceID(std::string& serviceID) {
    return PF_CONF::GetRuleServiceID(serviceID, mPCurrent);
}

int RouterRuleConfReader::GetRuleServiceName(std::string& serviceName) {
    return PF_CONF::GetRuleServiceName(serviceName, mPCurrent);
}

int RouterRuleConfReader::GetRuleInfo(bool& blEnable, std::string& routerPort, std::string& srcPort,
                                      std::string& protocol, std::string& serviceID) {
    if (IsRuleEnable(blEnable) == 0 || GetRuleProtocol(protocol) == 0) {
        LogError("%s:%d get rule protocol failed", kFile, __LINE__);
        return 0;
    }
    if (GetRulePort(routerPort, srcPort) == 0) {
        LogError("%s:%d get rule port failed", kFile, __LINE__);
        return 0;
    }
    GetRuleServiceID(serviceID);
    return 1;
}
