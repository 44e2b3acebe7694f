// Keeps the list of AirPort base stations that avahi sees, as a sectioned file for the NAT-PMP detection.
// Relies on avahi's client library. Promises: the file holds only stations that are announced now and
// goes with the last one; avahi or D-Bus may come and go at any time.
#pragma once

#include <avahi-client/client.h>
#include <avahi-client/lookup.h>
#include <avahi-common/simple-watch.h>

#include <map>
#include <memory>
#include <string>
#include <utility>

#include "ground/Descriptor.h"

namespace tavo {

struct AvahiFree {
    void operator()(AvahiSimplePoll* pPoll) const { avahi_simple_poll_free(pPoll); }
    void operator()(AvahiClient* pClient) const { avahi_client_free(pClient); }
    void operator()(AvahiServiceBrowser* pBrowser) const { avahi_service_browser_free(pBrowser); }
    void operator()(AvahiServiceResolver* pResolver) const { avahi_service_resolver_free(pResolver); }
};

// One announcement on one interface; without an address until it has been resolved.
struct AirportStation {
    std::unique_ptr<AvahiServiceResolver, AvahiFree> pResolver;
    std::string szAddress;
};

class AirportPublisher {
public:
    explicit AirportPublisher(const char* szPath);
    ~AirportPublisher();
    AirportPublisher(const AirportPublisher&) = delete;
    AirportPublisher& operator=(const AirportPublisher&) = delete;

    // Runs until SIGTERM or SIGINT. False when the event loop could not be set up or failed.
    bool Run();

private:
    using StationKey = std::pair<AvahiIfIndex, std::string>;  // interface and announced name

    static void OnClient(AvahiClient* pClient, AvahiClientState enState, void* pUser);
    static void OnBrowse(AvahiServiceBrowser* pBrowser, AvahiIfIndex nInterface, AvahiProtocol nProtocol,
                         AvahiBrowserEvent enEvent, const char* szName, const char* szType, const char* szDomain,
                         AvahiLookupResultFlags nFlags, void* pUser);
    static void OnResolve(AvahiServiceResolver* pResolver, AvahiIfIndex nInterface, AvahiProtocol nProtocol,
                          AvahiResolverEvent enEvent, const char* szName, const char* szType, const char* szDomain,
                          const char* szHost, const AvahiAddress* pAddress, uint16_t nPort, AvahiStringList* pTexts,
                          AvahiLookupResultFlags nFlags, void* pUser);

    void Connect();
    void Forget();
    void Browse(AvahiClient* pClient);
    void Resolve(AvahiClient* pClient, const StationKey& key);
    void Changed();
    void Write() const;
    void SetTimer(AvahiTimeout*& pTimer, unsigned nMilliseconds, AvahiTimeoutCallback pfnElapsed);

    const std::string mSzPath;
    std::unique_ptr<AvahiSimplePoll, AvahiFree> mPPoll;
    Descriptor mFdSignals;
    AvahiTimeout* mPConnectTimer = nullptr;  // owned by the poll
    AvahiTimeout* mPWriteTimer = nullptr;
    bool mBlWritePending = false;
    // From here on in the order in which one needs the other: the client frees what hangs on it.
    std::unique_ptr<AvahiClient, AvahiFree> mPClient;
    std::unique_ptr<AvahiServiceBrowser, AvahiFree> mPBrowser;
    std::map<StationKey, AirportStation> mMapStations;
};

}  // namespace tavo
