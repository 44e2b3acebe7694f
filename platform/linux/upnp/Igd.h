// An Internet Gateway Device: its port-mapping service, found and spoken to.
// Relies on Ssdp and Http; tinyxml2 reads what the router sends.
// Promises: only the gateway is ever contacted; every answer is bounded; texts are printable.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/Export.h"
#include "upnp/Http.h"
#include "upnp/Router.h"

namespace tavo {

// The service of a device description that maps ports.
struct IgdService {
    std::string szType;
    HttpUrl control;
};
// Nothing when the description is unreadable, offers none, or sends us to another host.
TAVO_PLATFORM_API std::optional<IgdService> ParseDescription(const std::string& szXml, const HttpUrl& location);

// The error code of a SOAP answer (0 for none), or kRouterGarbage.
TAVO_PLATFORM_API int SoapCode(long nHttpCode, const std::string& szXml);

class TAVO_PLATFORM_API Igd : public Router {
public:
    // The IGD at the gateway: pLocation (may be null) is tried first and set to what worked.
    static std::unique_ptr<Igd> Find(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds,
                                     std::string* pSzLocation);

    int List(std::vector<RouterMapping>& rgMappings) override;
    int Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) override;
    int Add(const RouterMapping& mapping) override;
    int Remove(const std::string& szProtocol, uint16_t nRouterPort) override;

    const IgdService& Service() const { return mService; }

private:
    struct Argument {
        const char* szName;
        std::string szValue;
    };
    explicit Igd(IgdService service) : mService(std::move(service)) {}
    int Call(const char* szAction, const std::vector<Argument>& rgArguments, std::string& szAnswer);

    IgdService mService;
    HttpClient mHttp;
};

}  // namespace tavo
