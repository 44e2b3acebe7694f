// Builds a whole rule file from rules. Relies on the platform's port-forward library for nodes, hashes
// and the write. Promises: a Sync() that fails leaves the rules that were there.
#include "Border.h"
#include "Log.h"
#include "Paths.h"
#include "ReplaceFile.h"
#include "Sections.h"
#include "libtavoportmap.h"

namespace {

constexpr char kFile[] = "src/RouterRuleConfWriter.cpp";
constexpr char kPortJob[] = "PF add port";
constexpr char kRangeJob[] = "PF add range";

using tavo::lib::AtBorder;
using tavo::lib::LogError;
using tavo::lib::Refuse;

// The keys of a rule in their fixed order, each with the line of its failure; the last three lines
// carry the value.
bool FillRule(TLIBCSzHash* pHash, bool blEnable, const std::string& szRouterPort, const std::string& szSrcPort,
              const std::string& szProtocol, const std::string& szServiceID, const std::string& szServiceName) {
    const auto fnStore = [pHash](const char* szKey, const std::string& szValue) {
        return TLIBCSzHashSetValue(pHash, szKey, szValue.c_str()) >= 0;
    };
    if (!fnStore("enabled", blEnable ? "1" : "0")) {
        return Refuse("%s:%d set enable failed", kFile, __LINE__);
    }
    if (!fnStore("s_port", szSrcPort)) {
        return Refuse("%s:%d set src port failed", kFile, __LINE__);
    }
    if (!fnStore("r_port", szRouterPort)) {
        return Refuse("%s:%d set router port failed", kFile, __LINE__);
    }
    if (!fnStore("protocol name", szProtocol)) {
        return Refuse("%s:%d set protocol=%s", kFile, __LINE__, szProtocol.c_str());
    }
    if (!fnStore("service_id", szServiceID)) {
        return Refuse("%s:%d set serviceid=%s", kFile, __LINE__, szServiceID.c_str());
    }
    return fnStore("service", szServiceName) ||
           Refuse("%s:%d set service name=%s", kFile, __LINE__, szServiceName.c_str());
}

}  // namespace

RouterRuleConfWriter::RouterRuleConfWriter() : mPHead(nullptr), mPTail(nullptr) {}

RouterRuleConfWriter::~RouterRuleConfWriter() {
    TAVOPFConfFree(mPHead);
}

int RouterRuleConfWriter::AddRule(const std::string& id, bool blEnable, const std::string& routerPort,
                                  const std::string& srcPort, const std::string& protocol, const std::string& serviceID,
                                  const std::string& serviceName) {
    return AtBorder(0, [&] {
        tavo::lib::ConfList pNode =
            tavo::lib::NewSection(id, "%s:%d malloc failed", "%s:%d hash malloc failed", kFile, __LINE__);
        if (!pNode || !FillRule(pNode->pHash, blEnable, routerPort, srcPort, protocol, serviceID, serviceName)) {
            return 0;
        }
        TAVO_PF_CONF*& pPlace = mPTail == nullptr ? mPHead : mPTail->pNext;
        pPlace = pNode.release();
        mPTail = pPlace;
        mPTail->pNext = nullptr;
        return 1;
    });
}

int RouterRuleConfWriter::AddRule(int nId, bool blEnable, const std::string& routerPort, const std::string& srcPort,
                                  const std::string& protocol, const std::string& serviceID,
                                  const std::string& serviceName) {
    return AtBorder(0, [&] {
        return AddRule(std::to_string(nId), blEnable, routerPort, srcPort, protocol, serviceID, serviceName);
    });
}

int RouterRuleConfWriter::Sync() {
    return AtBorder(0, [&] {
        const auto fnWrite = [&] { return Sync(tavo::lib::kRuleConf) != 0; };
        return tavo::lib::ReplaceFile(tavo::lib::kRuleConf, tavo::lib::Holds::kNoSecret, fnWrite) ? 1 : 0;
    });
}

int RouterRuleConfWriter::Sync(const std::string& path) {
    if (path.empty()) {
        return 0;
    }
    return TAVOPFRuleBuildByPath(mPHead, path.c_str()) >= 0 ? 1 : 0;
}

int RouterRuleConfWriter::GetRules(int& nRules) {
    nRules = TLIBPFCountRuleConf(mPHead, 0);
    if (nRules < 0) {
        nRules = 0;
        LogError("%s:%d TLIBPFCountRuleConf fail", kFile, __LINE__);
        return 0;
    }
    return 1;
}

int RouterRuleConfWriter::GetPorts(int& nPorts, const std::string& gatewayIP) {
    nPorts = TAVOPFCountJobNumber(mPHead, gatewayIP.c_str(), kPortJob);
    return nPorts >= 0 ? 1 : 0;
}

int RouterRuleConfWriter::GetRange(int& nRange, const std::string& gatewayIP) {
    nRange = TAVOPFCountJobNumber(mPHead, gatewayIP.c_str(), kRangeJob);
    return nRange >= 0 ? 1 : 0;
}

int RouterRuleConfWriter::GetRuleConf(_tag_tavo_pf_conf** pRuleConfHead) {
    if (pRuleConfHead == nullptr) {
        LogError("%s:%d pRuleConfHead is NULL", kFile, __LINE__);
        return 0;
    }
    *pRuleConfHead = mPHead;
    return 1;
}

int RouterRuleConfWriter::ToArray(int& nCount, __tag_TAVO_ROUTER_RULE** ppRules) {
    return PF_CONF::ToArray(nCount, ppRules, mPHead);
}
