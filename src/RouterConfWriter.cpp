// Builds the current gateway's section and replaces router.conf with it. Relies on the gateway address
// and the platform's port-forward library. Promises: nothing reaches the disk before Sync(), and a
// Sync() that fails leaves the file that was there.

#include <cstring>

#include "Border.h"
#include "Log.h"
#include "Paths.h"
#include "ReplaceFile.h"
#include "Sections.h"
#include "libtavoportmap.h"

namespace {

constexpr char kFile[] = "src/RouterConfWriter.cpp";

using tavo::lib::AtBorder;
using tavo::lib::LogError;
using tavo::lib::Refuse;

bool Store(const TAVO_PF_CONF* pSection, const char* szKey, const std::string& szValue) {
    return TLIBCSzHashSetValue(pSection->pHash, szKey, szValue.c_str()) >= 0;
}

// A section read from the file may be empty; it needs a hash before keys can be set.
bool EnsureHash(TAVO_PF_CONF* pSection) {
    if (pSection->pHash == nullptr) {
        pSection->pHash = TLIBCSzHashAlloc(tavo::lib::kHashSize);
    }
    return pSection->pHash != nullptr;
}

}  // namespace

RouterConfWriter::RouterConfWriter(bool blReload)
    : mBlReload(blReload), mBlInit(false), mPHead(nullptr), mPCurrent(nullptr) {}

RouterConfWriter::~RouterConfWriter() {
    TAVOPFConfFree(mPHead);
}

int RouterConfWriter::Init() {
    return AtBorder(0, [&] {
        if (mBlInit) {
            return 1;
        }
        std::string szGatewayIP;
        if (GetGatewayIP(szGatewayIP) == 0) {
            LogError("%s:%d can not get gateway ip", kFile, __LINE__);
            return 0;
        }
        bool blReady = false;
        if (mBlReload) {
            blReady = ReloadOldSection(szGatewayIP) != 0;
            if (!blReady) {
                LogError("%s:%d reload previous section failed, and try to create a new section.", kFile, __LINE__);
            }
        }
        if (!blReady && CreateNewSection(szGatewayIP) == 0) {
            LogError("%s:%d create a new section failed", kFile, __LINE__);
            return 0;
        }
        mBlInit = true;
        return 1;
    });
}

int RouterConfWriter::IsValid() {
    return mPHead != nullptr ? 1 : 0;
}

int RouterConfWriter::ReloadOldSection(const std::string& gatewayIP) {
    tavo::lib::ConfList pList(TAVOPFGwRouterConfGet());
    if (!pList) {
        LogError("%s:%d get router conf failed", kFile, __LINE__);
        return 0;
    }
    TAVO_PF_CONF* pSection = pList.get();
    while (pSection != nullptr && gatewayIP != pSection->szSection) {
        pSection = pSection->pNext;
    }
    if (pSection == nullptr) {
        LogError("%s:%d can not find gatway ip = %s session in router.conf", kFile, __LINE__, gatewayIP.c_str());
        return 0;
    }
    if (!EnsureHash(pSection)) {
        LogError("%s:%d hash malloc failed", kFile, __LINE__);
        return 0;
    }
    TAVOPFConfFree(mPHead);
    mPHead = pList.release();
    mPCurrent = pSection;
    return 1;
}

int RouterConfWriter::CreateNewSection(const std::string& gatewayIP) {
    tavo::lib::ConfList pNode = tavo::lib::NewSection(gatewayIP, "%s:%d malloc TAVO_PF_CONF failed",
                                                      "%s:%d hash malloc failed", kFile, __LINE__);
    if (!pNode) {
        return 0;
    }
    TAVOPFConfFree(mPHead);
    mPHead = pNode.release();
    mPCurrent = mPHead;
    return 1;
}

namespace {

// The first step of every setter.
bool IsReady(RouterConfWriter& writer, int nLine) {
    return writer.Init() != 0 || Refuse("%s:%d init failed", kFile, nLine);
}

tavo::lib::Holds HoldsOf(const TAVO_PF_CONF* pHead) {
    for (const TAVO_PF_CONF* pSection = pHead; pSection != nullptr; pSection = pSection->pNext) {
        const char* szPass = pSection->pHash == nullptr ? nullptr : TLIBCSzHashGetValue(pSection->pHash, "pass");
        if (szPass != nullptr && *szPass != '\0') {
            return tavo::lib::Holds::kSecret;
        }
    }
    return tavo::lib::Holds::kNoSecret;
}

}  // namespace

int RouterConfWriter::SetBrand(const std::string& brand) {
    return IsReady(*this, __LINE__) && Store(mPCurrent, "brand", brand) ? 1 : 0;
}

int RouterConfWriter::SetModel(const std::string& model) {
    return IsReady(*this, __LINE__) && Store(mPCurrent, "model", model) ? 1 : 0;
}

int RouterConfWriter::SetVersion(const std::string& version) {
    return IsReady(*this, __LINE__) && Store(mPCurrent, "version", version) ? 1 : 0;
}

int RouterConfWriter::SetBrandModelVersion(const std::string& brand, const std::string& model,
                                           const std::string& version) {
    const int nBrand = SetBrand(brand);
    const int nModel = SetModel(model);
    const int nVersion = SetVersion(version);
    return nBrand != 0 && nModel != 0 && nVersion != 0 ? 1 : 0;
}

int RouterConfWriter::SetUser(const std::string& user) {
    return IsReady(*this, __LINE__) && Store(mPCurrent, "user", user) ? 1 : 0;
}

int RouterConfWriter::SetPass(const std::string& pass) {
    return IsReady(*this, __LINE__) && Store(mPCurrent, "pass", pass) ? 1 : 0;
}

int RouterConfWriter::SetUserPass(const std::string& user, const std::string& pass) {
    if (!IsReady(*this, __LINE__)) {
        return 0;
    }
    // An account that could not be stored is not reported: callers go on with the rest of the settings.
    if (SetUser(user) == 0 || SetPass(pass) == 0 || user.empty()) {
        return 1;
    }
    return TLIBCSzHashSetValue(mPCurrent->pHash, "use_custom_account", "on") != 0 ? 1 : 0;
}

int RouterConfWriter::SetConnType(const std::string& connType) {
    return IsReady(*this, __LINE__) && Store(mPCurrent, "conn_type", connType) ? 1 : 0;
}

int RouterConfWriter::SetConnPort(const std::string& connPort) {
    return IsReady(*this, __LINE__) && Store(mPCurrent, "conn_port", connPort) ? 1 : 0;
}

int RouterConfWriter::SetMaxRule(int nMaxRule) {
    return AtBorder(
        0, [&] { return IsReady(*this, __LINE__) && Store(mPCurrent, "max", std::to_string(nMaxRule)) ? 1 : 0; });
}

int RouterConfWriter::SetSupportUpnp(const std::string& support) {
    if (!IsReady(*this, __LINE__)) {
        return 0;
    }
    const bool blStored = Store(mPCurrent, "support_router_upnp", support);
    if ((support == "yes" || support == "unknown") &&
        TLIBCSzHashSetValue(mPCurrent->pHash, "router_type", "upnp") < 0) {
        LogError("%s:%d set router type failed", kFile, __LINE__);
    }
    return blStored ? 1 : 0;
}

int RouterConfWriter::SetSupportNatpmp(const std::string& support) {
    if (!IsReady(*this, __LINE__)) {
        return 0;
    }
    const bool blStored = Store(mPCurrent, "support_router_natpmp", support);
    if (support == "yes" && TLIBCSzHashSetValue(mPCurrent->pHash, "router_type", "natpmp") < 0) {
        LogError("%s:%d set router type failed", kFile, __LINE__);
    }
    return blStored ? 1 : 0;
}

int RouterConfWriter::Sync() {
    return AtBorder(0, [&] {
        if (IsValid() == 0) {
            return 0;
        }
        const auto fnWrite = [&] { return TAVOGwRouterConfSet(mPHead) >= 0; };
        return tavo::lib::ReplaceFile(tavo::lib::kRouterConf, HoldsOf(mPHead), fnWrite) ? 1 : 0;
    });
}
