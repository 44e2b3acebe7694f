// An Internet Gateway Device: its port-mapping service, found and spoken to.
// Relies on Ssdp and Http; tinyxml2 reads what the router sends.
// Promises: only the gateway is ever contacted; every answer is bounded; texts are printable.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "mapping/Router.h"
#include "wire/http/Http.h"

namespace tavo {

// What a router says it is, in its root device. A text that is too long keeps its beginning and gets a
// mark of the whole at its end, so that two routers never become one.
struct IgdModel {
    std::string szBrand;
    std::string szModel;
    std::string szVersion;  // the firmware's where the router gives one, else the model number
};
inline constexpr size_t kMaxModelText = 63;

// The service of a device description that maps ports.
struct IgdService {
    std::string szType;
    HttpUrl control;
    IgdModel model;
};
// Nothing when the description is unreadable, offers none, or sends us to another host.
std::optional<IgdService> ParseDescription(const std::string& szXml, const HttpUrl& location);

// The error code of a SOAP answer (0 for none), or kRouterGarbage.
int SoapCode(long nHttpCode, const std::string& szXml);

class Igd : public Router {
public:
    // The IGD at the gateway, found within the limit or not at all. A description is waited for as long as
    // half of what is left of the limit, so that one that never comes does not keep the others from being
    // tried. pSzLocation (may be null) is tried first, and set to what worked. A search lasts as SearchGateway says.
    // fnStop is kept for the calls that follow.
    static std::unique_ptr<Igd> Find(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds,
                                     std::string* pSzLocation, int nLocalPort = 0,
                                     const std::function<bool()>& fnStop = {});
    // The IGD whose description is at a location; null when there is none.
    static std::unique_ptr<Igd> At(const HttpUrl& location, std::shared_ptr<HttpTransport> pHttp);

    // The most that one call may take from now on.
    void SetCallLimit(int nMilliseconds) { mPHttp->SetLimit(nMilliseconds); }
    // What ends calls early from now on, as HttpTransport says.
    void SetStop(const std::function<bool()>& fnStop) { mPHttp->SetStop(fnStop); }
    // The entry at an index. One that makes no sense comes back disabled and without a protocol.
    int GetAt(int nIndex, RouterMapping& mapping);
    // The router's address on its other side, as it says itself.
    int ExternalAddress(std::string& szAddress);
    int List(std::vector<RouterMapping>& rgMappings) override;
    int ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                  std::vector<RouterMapping>& rgMappings) override;
    int Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) override;
    int Add(const RouterMapping& mapping) override;
    int Remove(const std::string& szProtocol, uint16_t nRouterPort) override;

    const IgdService& Service() const { return mService; }

private:
    struct Argument {
        const char* szName;
        std::string szValue;
    };
    Igd(IgdService service, std::shared_ptr<HttpTransport> pHttp)
        : mService(std::move(service)), mBlRanges(!mService.szType.ends_with(":1")), mPHttp(std::move(pHttp)) {}
    int Call(const char* szAction, const std::vector<Argument>& rgArguments, std::string& szAnswer);

    IgdService mService;
    bool mBlRanges;  // services of the second generation show ranges, unless they once could not
    std::shared_ptr<HttpTransport> mPHttp;
};

}  // namespace tavo
