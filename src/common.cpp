// The gateway address, the names of router models and the accessors of a parsed rule section. Relies on the platform's
// files, network and port-forward library. Promises: outputs are untouched on failure unless stated, nothing is thrown.

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <utility>

#include "Border.h"
#include "Log.h"
#include "Paths.h"
#include "Text.h"
#include "Tool.h"
#include "libtavoportmap.h"
#include "tavo/core.h"
#include "tavo/net.h"
#include "tavo/portforward.h"

namespace {

using tavo::lib::kCommonFile;
using tavo::lib::LogError;
using tavo::lib::Refuse;

constexpr size_t kAddressSize = 16;
constexpr size_t kBrandSize = 512;
constexpr size_t kModelSize = 512;
constexpr size_t kVersionSize = 1024;
constexpr size_t kPathSize = 4096;
constexpr size_t kToolLineSize = 1024;
constexpr char kVersionCommand[] = "/usr/tavo/bin/tavoportforward --version";
constexpr std::string_view kVersionKey = "syntax version";

// The two refusals that every accessor of a rule section begins with.
bool HasHash(const TAVO_PF_CONF* pConf) {
    if (pConf == nullptr) {
        return Refuse("%s:%d pConf shall not be NULL", kCommonFile, __LINE__);
    }
    return pConf->pHash != nullptr || Refuse("%s:%d section shall not be empty", kCommonFile, __LINE__);
}

// Finds the version in what the tool prints; the last line that gives one wins.
class VersionLines {
public:
    void Take(std::string_view szBlock) {
        for (const char c : szBlock) {
            if (c == '\n') {
                EndLine();
            } else if (mNLength < sizeof(mSzLine) - 1) {
                mSzLine[mNLength++] = c;
            }
        }
    }
    void EndLine() {
        mSzLine[std::exchange(mNLength, 0)] = '\0';
        const bool blKey = std::string_view(mSzLine).starts_with(kVersionKey);
        const char* szNumber = blKey ? std::strchr(mSzLine + kVersionKey.size(), '=') : nullptr;
        if (szNumber != nullptr) {
            mNVersion = tavo::lib::ToInt(szNumber + 1);
        }
    }
    int Version() const { return mNVersion; }

private:
    char mSzLine[kToolLineSize] = {};
    size_t mNLength = 0;
    int mNVersion = -1;
};

struct RecordFields {
    std::string szServiceID;
    std::string szServiceName;
    std::string szRouterPort;
    std::string szSrcPort;
    std::string szProtocol;
    std::string szRuleID;
    bool blEnable = false;
};

// Reads one rule into the texts, which keep what the rule does not have.
bool ReadFields(RecordFields& fields, const TAVO_PF_CONF* pConf) {
    if (PF_CONF::IsRuleEnable(fields.blEnable, pConf) == 0) {
        return Refuse("%s:%d IsRuleEnable() failed", kCommonFile, __LINE__);
    }
    if (PF_CONF::GetRuleServiceID(fields.szServiceID, pConf) == 0) {
        return Refuse("%s:%d GetRuleServiceID() failed", kCommonFile, __LINE__);
    }
    PF_CONF::GetRuleServiceName(fields.szServiceName, pConf);
    if (PF_CONF::GetRulePort(fields.szRouterPort, fields.szSrcPort, pConf) == 0) {
        return Refuse("%s:%d GetRulePort() failed", kCommonFile, __LINE__);
    }
    if (PF_CONF::GetRuleProtocol(fields.szProtocol, pConf) == 0) {
        return Refuse("%s:%d GetRuleProtocol() failed", kCommonFile, __LINE__);
    }
    return PF_CONF::GetRuleID(fields.szRuleID, pConf) != 0 || Refuse("%s:%d GetRuleID() failed", kCommonFile, __LINE__);
}

void FillRecord(__tag_TAVO_ROUTER_RULE& rule, const RecordFields& fields) {
    using tavo::lib::FillText;
    FillText(rule.szRuleID, fields.szRuleID);
    rule.blEnable = fields.blEnable;
    FillText(rule.szProtocol, fields.szProtocol);
    FillText(rule.szRouterPort, fields.szRouterPort);
    FillText(rule.szSrcPort, fields.szSrcPort);
    FillText(rule.szServiceID, fields.szServiceID);
    FillText(rule.szServiceName, fields.szServiceName);
}

// The version that a model's generic description was written for. False: it has none.
bool ReadGenericVersion(const std::string& szBrand, const std::string& szModel, std::string& szVersion) {
    if (!tavo::lib::IsPathPart(szBrand) || !tavo::lib::IsPathPart(szModel)) {
        return false;
    }
    char szPath[kPathSize] = {};
    char szValue[kVersionSize] = {};
    std::snprintf(szPath, sizeof(szPath), "%s/%s/%s/%s", tavo::lib::kRouterDbDir, szBrand.c_str(), szModel.c_str(),
                  "generic");
    if (TLIBCFileGetKeyValue(szPath, "version", szValue, sizeof(szValue), 0) < 1) {
        return false;
    }
    szVersion = szValue;
    return true;
}

int ReadText(std::string& szValue, const char* szKey, const TAVO_PF_CONF* pConf) {
    const char* szStored = TLIBCSzHashGetValue(pConf->pHash, szKey);
    if (szStored == nullptr) {
        return 0;
    }
    szValue = szStored;
    return 1;
}

}  // namespace

using tavo::lib::AtBorder;

int GetGatewayIP(std::string& ip) {
    return AtBorder(0, [&] {
        char szGateway[kAddressSize] = {};
        if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) != 0) {
            LogError("%s:%d cannot get gateway router ip", kCommonFile, __LINE__);
            return 0;
        }
        if (BlTLIBIsIpAddr(szGateway) == 0 || std::strcmp(szGateway, "0.0.0.0") == 0) {
            LogError("%s:%d error gateway router ip: %s", kCommonFile, __LINE__, szGateway);
            return 0;
        }
        ip = szGateway;
        return 1;
    });
}

bool SplitRouterName(char* szName, std::string& brand, std::string& model, std::string& version) {
    return AtBorder(false, [&] {
        const std::string szWhole = szName == nullptr ? "" : szName;
        const size_t nSeparator = szWhole.find(": ");
        if (nSeparator == std::string::npos) {
            return Refuse("%s:%d incorrect information", kCommonFile, __LINE__);
        }
        std::string szBrand = szWhole.substr(0, std::min(nSeparator, kBrandSize - 1));
        const size_t nModel = nSeparator + 2;
        const size_t nOpen = szWhole.find('(', nSeparator);
        const size_t nModelLength = nOpen == std::string::npos ? nOpen : nOpen - nModel;
        std::string szModel = szWhole.substr(nModel, std::min(nModelLength, kModelSize - 1));
        std::string szVersion;
        if (nOpen != std::string::npos) {
            const std::string szRest = szWhole.substr(nOpen + 1);
            szVersion = szRest.substr(0, std::min(szRest.rfind(')'), kVersionSize - 1));
        } else if (!ReadGenericVersion(szBrand, szModel, szVersion)) {
            return Refuse("%s:%d incorrect information", kCommonFile, __LINE__);
        }
        brand.swap(szBrand);
        model.swap(szModel);
        version.swap(szVersion);
        return true;
    });
}

bool IsGenericRouterName(bool& isGeneric, char* szName) {
    return AtBorder(false, [&] {
        const char* szSeparator = szName == nullptr ? nullptr : std::strstr(szName, ": ");
        if (szSeparator == nullptr) {
            return Refuse("%s:%d incorrect information", kCommonFile, __LINE__);
        }
        isGeneric = std::strchr(szSeparator, '(') == nullptr;
        return true;
    });
}

int IGetCurrSyntaxVersion() {
    tavo::lib::Tool tool;
    if (!tool.Start(kVersionCommand)) {
        LogError("%s:%d popen tavoportforward error", kCommonFile, __LINE__);
        return -1;
    }
    VersionLines lines;
    char szBlock[kToolLineSize];
    for (ssize_t nRead = 0; (nRead = tool.Read(szBlock, sizeof(szBlock))) > 0;) {
        lines.Take({szBlock, static_cast<size_t>(nRead)});
    }
    lines.EndLine();
    return lines.Version();
}

namespace PF_CONF {

int IsRuleEnable(bool& blEnable, const _tag_tavo_pf_conf* pConf) {
    if (!HasHash(pConf)) {
        return 0;
    }
    const char* szEnabled = TLIBCSzHashGetValue(pConf->pHash, "enabled");
    if (szEnabled == nullptr) {
        LogError("%s:%d get rule enable failed", kCommonFile, __LINE__);
        return 0;
    }
    blEnable = std::strcmp(szEnabled, "1") == 0;
    return 1;
}

int GetRuleID(std::string& id, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (pConf == nullptr) {
            LogError("%s:%d pConf shall not be NULL", kCommonFile, __LINE__);
            return 0;
        }
        id = pConf->szSection;
        return 1;
    });
}

int GetRuleProtocol(std::string& protocol, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (!HasHash(pConf)) {
            return 0;
        }
        if (ReadText(protocol, "protocol name", pConf) == 0) {
            LogError("%s:%d get protocol failed", kCommonFile, __LINE__);
            return 0;
        }
        return 1;
    });
}

int GetRuleServiceID(std::string& serviceID, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (!HasHash(pConf)) {
            return 0;
        }
        if (ReadText(serviceID, "service_id", pConf) == 0) {
            serviceID.clear();
        }
        return 1;
    });
}

int GetRuleServiceName(std::string& serviceName, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (!HasHash(pConf)) {
            return 0;
        }
        ReadText(serviceName, "service", pConf);
        return 1;
    });
}

int GetRulePort(std::string& routerPort, std::string& srcPort, const _tag_tavo_pf_conf* pConf) {
    return AtBorder(0, [&] {
        if (!HasHash(pConf)) {
            return 0;
        }
        std::string szSrcPort;
        std::string szRouterPort;
        if (ReadText(szSrcPort, "s_port", pConf) == 0) {
            LogError("%s:%d get rule src port failed", kCommonFile, __LINE__);
            return 0;
        }
        if (ReadText(szRouterPort, "r_port", pConf) == 0) {
            LogError("%s:%d get rule router port failed", kCommonFile, __LINE__);
            return 0;
        }
        routerPort = szRouterPort;
        srcPort = szSrcPort;
        return 1;
    });
}

int GetRuleInfo(std::string& id, bool& blEnable, std::string& routerPort, std::string& srcPort, std::string& protocol,
                std::string& serviceID, [[maybe_unused]] std::string& extra, const _tag_tavo_pf_conf* pConf) {
    if (pConf == nullptr) {
        LogError("%s:%d pConf is NULL", kCommonFile, __LINE__);
        return 0;
    }
    if (GetRuleID(id, pConf) == 0) {
        LogError("%s:%d get rule id failed", kCommonFile, __LINE__);
        return 0;
    }
    if (IsRuleEnable(blEnable, pConf) == 0) {
        LogError("%s:%d get rule protocol failed", kCommonFile, __LINE__);
        return 0;
    }
    if (GetRuleProtocol(protocol, pConf) == 0) {
        LogError("%s:%d get rule protocol failed", kCommonFile, __LINE__);
        return 0;
    }
    if (GetRulePort(routerPort, srcPort, pConf) == 0) {
        LogError("%s:%d get rule port failed", kCommonFile, __LINE__);
        return 0;
    }
    GetRuleServiceID(serviceID, pConf);
    return 1;
}

int ToArray(int& nCount, __tag_TAVO_ROUTER_RULE** ppRules, const _tag_tavo_pf_conf* pHead) {
    return AtBorder(0, [&] {
        if (ppRules == nullptr || *ppRules != nullptr) {
            LogError("%s:%d pRgRules is NULL or *pRgRules is not NULL", kCommonFile, __LINE__);
            return 0;
        }
        if (pHead == nullptr) {
            nCount = 0;
            *ppRules = nullptr;
            return 1;
        }
        nCount = 0;
        for (const TAVO_PF_CONF* pConf = pHead; pConf != nullptr; pConf = pConf->pNext) {
            ++nCount;
        }
        const size_t nBytes = static_cast<size_t>(nCount) * sizeof(__tag_TAVO_ROUTER_RULE);
        std::unique_ptr<void, decltype(&std::free)> pBlock(std::malloc(nBytes), &std::free);
        if (!pBlock) {
            LogError("%s:%d pArr is NULL", kCommonFile, __LINE__);
            return 0;
        }
        std::memset(pBlock.get(), 0, nBytes);
        auto* rgRules = static_cast<__tag_TAVO_ROUTER_RULE*>(pBlock.get());

        // One set of texts for all rules: a rule without a service name gets the one of the rule before it.
        RecordFields fields;
        int i = 0;
        for (const TAVO_PF_CONF* pConf = pHead; pConf != nullptr; pConf = pConf->pNext, ++i) {
            if (!ReadFields(fields, pConf)) {
                return 0;
            }
            if (i >= nCount) {
                LogError("%s:%d critical error out of array=%d i=%d", kCommonFile, __LINE__, nCount, i);
                return 0;
            }
            FillRecord(rgRules[i], fields);
        }
        *ppRules = static_cast<__tag_TAVO_ROUTER_RULE*>(pBlock.release());
        return 1;
    });
}

int FreeArray(__tag_TAVO_ROUTER_RULE* pRules) {
    if (pRules == nullptr) {
        LogError("%s:%d pConfHead is NULL", kCommonFile, __LINE__);
    }
    std::free(pRules);
    return 0;
}

}  // namespace PF_CONF
