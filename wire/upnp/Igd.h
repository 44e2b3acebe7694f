// An Internet Gateway Device: its port-mapping service, found and spoken to.
// Relies on Search, Description and Soap.
// Promises: only the gateway is ever contacted; every answer is bounded; texts are printable.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "ground/Descriptor.h"
#include "wire/Answer.h"
#include "wire/http/Http.h"
#include "wire/upnp/Description.h"

namespace tavo {

class SoapAnswer;
struct SoapArgument;

// An entry of the router's table.
struct IgdEntry {
    std::string szProtocol;  // "TCP" or "UDP"
    uint16_t nRouterPort = 0;
    uint16_t nBoxPort = 0;
    std::string szClient;       // dotted address of the host behind the port
    std::string szDescription;  // printable, bounded
    uint32_t nLease = 0;        // seconds; 0: until the router restarts
    bool blEnabled = false;
};

// The protocol's own codes; they come beside those of WireCode.
enum IgdCode : int {
    kIgdInvalidAction = 401,
    kIgdInvalidArgs = 402,
    kIgdNoSuchIndex = 713,
    kIgdNoSuchEntry = 714,
    kIgdNoneInRange = 730,
    kIgdConflict = 718,
    kIgdOnlyPermanentLeases = 725
};

// Where a gateway's service was found; empty texts: nowhere yet.
struct IgdPlace {
    std::string szLocation;  // of the description
    std::string szLine;      // the service's name, where the description has several

    bool operator==(const IgdPlace& other) const = default;
};

// Every call answers a WireCode, or the protocol's own code. Outputs are set only with kWireOk; with kWireTooLong,
// List() has what was read.
class Igd {
public:
    // The IGD at the gateway, found within the limit or not at all. A description is waited for as long as
    // half of what is left of the limit, so that one that never comes does not keep the others from being
    // tried. pPlace (may be null) is tried first, and set to what worked. A search lasts as SearchGateway says.
    // fnStop is kept for the calls that follow; pFdLate is as SearchGateway has it.
    static std::unique_ptr<Igd> Find(const std::string& szGateway, const std::string& szLocal, int nLimitMilliseconds,
                                     IgdPlace* pPlace, int nLocalPort, const std::function<bool()>& fnStop = {},
                                     Descriptor* pFdLate = nullptr);
    // The IGD whose description is at a location; null when there is none, and szWhy says what there is. Of several
    // services the one that is connected, with a public address before any other and with one before none; szKnown,
    // the name of one of them, is that one for as long as no other is better and it is connected.
    static std::unique_ptr<Igd> At(const HttpUrl& location, std::shared_ptr<HttpTransport> pHttp, std::string& szWhy,
                                   const std::string& szKnown = "");

    // The most that one call may take from now on.
    void SetCallLimit(int nMilliseconds) { mPHttp->SetLimit(nMilliseconds); }
    // What ends calls early from now on, as HttpTransport says.
    void SetStop(const std::function<bool()>& fnStop) { mPHttp->SetStop(fnStop); }
    // The entry at an index. One that makes no sense comes back disabled and without a protocol.
    int GetAt(int nIndex, IgdEntry& mapping);
    // Whether its line is up, as far as the router says; nothing: it does not.
    std::optional<bool> IsConnected();
    // The router's address on its other side, as it says itself.
    int ExternalAddress(std::string& szAddress);
    int List(std::vector<IgdEntry>& rgMappings);
    // The box's own entries between two ports, where the router can show them at once: of the second generation only.
    // May leave some out: what it shows is there, what it does not show may be there too.
    int ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast, std::vector<IgdEntry>& rgMappings);
    int Get(const std::string& szProtocol, uint16_t nRouterPort, IgdEntry& mapping);
    int Add(const IgdEntry& mapping);
    // szSource: the address of the box's that asks, as many routers let nobody but the client itself; empty: any.
    int Remove(const std::string& szProtocol, uint16_t nRouterPort, const std::string& szSource = "");

    const IgdService& Service() const { return mService; }
    // The description has others beside it.
    bool IsOneOfSeveral() const { return !mRgBeside.empty(); }
    // That of them which has the name; null: none has.
    std::unique_ptr<Igd> Beside(const std::string& szLine) const;

private:
    Igd(IgdService service, std::shared_ptr<HttpTransport> pHttp)
        : mService(std::move(service)), mPHttp(std::move(pHttp)) {}
    int Rank(const std::string& szKnown);
    SoapAnswer Call(const char* szAction, const std::vector<SoapArgument>& rgArguments);

    IgdService mService;
    std::vector<IgdService> mRgBeside;
    std::shared_ptr<HttpTransport> mPHttp;
};

}  // namespace tavo
