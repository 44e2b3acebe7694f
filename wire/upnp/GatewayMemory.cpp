// Keeps what was learnt about each gateway. Relies on the platform's sectioned files.
// Promises: see GatewayMemory.h.
#include "wire/upnp/GatewayMemory.h"

#include <netinet/in.h>

#include <memory>

#include "ground/Paths.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "tavo/core.h"
#include "tavo/net.h"

namespace tavo {

namespace {

constexpr char kStateFile[] = "/var/lib/tavo/upnp_igd.conf";
constexpr int kUrlSize = 1024;

std::string StateOf(const std::string& szGateway, const char* szKey) {
    char szValue[kUrlSize];
    return TLIBCFileGetSectionValue(kStateFile, szGateway.c_str(), szKey, szValue, sizeof(szValue)) == 0 ? szValue : "";
}

}  // namespace

KnownRouter RecallRouter(const std::string& szGateway) {
    const auto fnValue = [&](const char* szKey) { return StateOf(szGateway, szKey); };
    return {{fnValue("location"), fnValue("line")},
            fnValue("hardware"),
            fnValue("permanent") == "yes",
            fnValue("names") == "no",
            fnValue("ranges") == "no"};
}

void KeepRouter(const std::string& szGateway, const KnownRouter& router) {
    if (RecallRouter(szGateway) == router) {
        return;
    }
    MakeDirectory(kStateDir);
    const std::unique_ptr<TLIBCSzHash, decltype(&TLIBCSzHashFree)> pHash(TLIBCSzHashAlloc(6), &TLIBCSzHashFree);
    TLIBCSzHashSetValue(pHash.get(), "location", router.place.szLocation.c_str());
    TLIBCSzHashSetValue(pHash.get(), "line", router.place.szLine.c_str());
    TLIBCSzHashSetValue(pHash.get(), "hardware", router.szHardware.c_str());
    TLIBCSzHashSetValue(pHash.get(), "permanent", router.blPermanentOnly ? "yes" : "no");
    TLIBCSzHashSetValue(pHash.get(), "names", router.blNoGet ? "no" : "yes");
    TLIBCSzHashSetValue(pHash.get(), "ranges", router.blNoRanges ? "no" : "yes");
    if (TLIBCFileAddSection(kStateFile, szGateway.c_str(), pHash.get(), 0) != 1) {
        SysLog(LOG_WARNING, "cannot write %s", kStateFile);
    }
}

std::unique_ptr<Igd> FindGatewayIgd(int nLimitMilliseconds, int nLocalPort, std::string* pSzLocal,
                                    const std::function<bool()>& fnStop) {
    char szGateway[INET_ADDRSTRLEN] = {};
    char szLocal[INET_ADDRSTRLEN] = {};
    if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) != 0 ||
        TAVONetLocalAddressGet(szGateway, szLocal, sizeof(szLocal), nullptr, 0) != 0) {
        return nullptr;
    }
    KnownRouter known = RecallRouter(szGateway);
    auto pIgd = Igd::Find(szGateway, szLocal, nLimitMilliseconds, &known.place, nLocalPort, fnStop);
    if (pSzLocal != nullptr) {
        *pSzLocal = szLocal;
    }
    if (pIgd != nullptr) {
        KeepRouter(szGateway, known);
    }
    return pIgd;
}

}  // namespace tavo
