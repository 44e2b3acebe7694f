// Reads the section of one gateway in router.conf. Relies on the platform's port-forward library for
// the parsed list. Promises: one snapshot for the object's life; a missing key leaves the output alone.

#include <cstring>

#include "Border.h"
#include "Log.h"
#include "Text.h"
#include "libtavoportmap.h"
#include "tavo/core.h"
#include "tavo/portforward.h"

namespace {

constexpr char kFile[] = "src/RouterConfReader.cpp";

using tavo::lib::AtBorder;
using tavo::lib::LogError;

const char* Value(const TAVO_PF_CONF* pSection, const char* szKey) {
    return pSection->pHash == nullptr ? nullptr : TLIBCSzHashGetValue(pSection->pHash, szKey);
}

int GetText(const TAVO_PF_CONF* pSection, const char* szKey, std::string& szText) {
    return AtBorder(0, [&] {
        if (pSection == nullptr) {
            return 0;
        }
        if (const char* szValue = Value(pSection, szKey); szValue != nullptr) {
            szText = szValue;
        }
        return 1;
    });
}

}  // namespace

RouterConfReader::RouterConfReader(const std::string& gatewayIP) : mPHead(TAVOPFGwRouterConfGet()), mPCurrent(nullptr) {
    if (mPHead == nullptr) {
        LogError("%s:%d can not get router conf", kFile, __LINE__);
    }
    for (TAVO_PF_CONF* pSection = mPHead; pSection != nullptr && mPCurrent == nullptr; pSection = pSection->pNext) {
        if (gatewayIP == pSection->szSection) {
            mPCurrent = pSection;
        }
    }
    if (mPCurrent == nullptr) {
        LogError("%s:%d User router changed new gatway ip = %s", kFile, __LINE__, gatewayIP.c_str());
    }
}

RouterConfReader::RouterConfReader() : mPHead(TAVOPFGwRouterConfGet()), mPCurrent(mPHead) {}

RouterConfReader::~RouterConfReader() {
    TAVOPFConfFree(mPHead);
}

int RouterConfReader::IsSectionExist(bool& blExist) {
    if (mPHead == nullptr) {
        return 0;
    }
    blExist = mPCurrent != nullptr;
    return 1;
}

int RouterConfReader::GetSectionName(std::string& name) {
    return AtBorder(0, [&] {
        if (mPCurrent == nullptr) {
            return 0;
        }
        name = mPCurrent->szSection;
        return 1;
    });
}

int RouterConfReader::GetBrand(std::string& brand) {
    return GetText(mPCurrent, "brand", brand);
}

int RouterConfReader::GetModel(std::string& model) {
    return GetText(mPCurrent, "model", model);
}

int RouterConfReader::GetVersion(std::string& version) {
    return GetText(mPCurrent, "version", version);
}

int RouterConfReader::GetUser(std::string& user) {
    return GetText(mPCurrent, "user", user);
}

int RouterConfReader::GetPass(std::string& pass) {
    return GetText(mPCurrent, "pass", pass);
}

int RouterConfReader::GetConnType(std::string& connType) {
    return GetText(mPCurrent, "conn_type", connType);
}

int RouterConfReader::GetConnPort(std::string& connPort) {
    return GetText(mPCurrent, "conn_port", connPort);
}

int RouterConfReader::GetSupportUpnp(std::string& support) {
    return GetText(mPCurrent, "support_router_upnp", support);
}

int RouterConfReader::GetSupportNatpmp(std::string& support) {
    return GetText(mPCurrent, "support_router_natpmp", support);
}

int RouterConfReader::GetSupportUpnp(bool& blSupport) {
    std::string szSupport;
    if (GetSupportUpnp(szSupport) == 0) {
        LogError("%s:%d get support upnp fail", kFile, __LINE__);
        return 0;
    }
    blSupport = szSupport == "yes";
    return 1;
}

int RouterConfReader::GetSupportNatpmp(bool& blSupport) {
    std::string szSupport;
    if (GetSupportNatpmp(szSupport) == 0) {
        LogError("%s:%d get support natpmp fail", kFile, __LINE__);
        return 0;
    }
    blSupport = szSupport == "yes";
    return 1;
}

int RouterConfReader::GetMaxRule(int& nMaxRule) {
    const char* szMax = mPCurrent == nullptr ? nullptr : Value(mPCurrent, "max");
    if (szMax == nullptr) {
        return 0;
    }
    nMaxRule = tavo::lib::ToInt(szMax);
    return 1;
}
