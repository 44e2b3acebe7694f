// Browses "_airport._tcp", resolves what it finds and writes the file. Relies on avahi's event loop, in
// which all of it runs. Promises: see Publisher.h; nothing thrown crosses avahi's callbacks.
#include "programs/tavoairportd/Publisher.h"

#include <avahi-common/address.h>
#include <avahi-common/error.h>
#include <avahi-common/timeval.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <set>
#include <vector>

#include "ground/Border.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr char kServiceType[] = "_airport._tcp";
constexpr char kDomain[] = "local";
constexpr mode_t kListMode = 0644;
constexpr size_t kMaxName = 63;                // of a DNS label
constexpr size_t kMaxStations = 256;           // a flood of announcements costs no more than this
constexpr unsigned kGatherMilliseconds = 200;  // several stations answer at about the same time
constexpr unsigned kRetryMilliseconds = 1000;

AirportPublisher& Self(void* pUser) {
    return *static_cast<AirportPublisher*>(pUser);
}

// Somebody else's file in /tmp would keep its owner when it is replaced; ours is made anew.
void RemoveForeign(const std::string& szPath) {
    struct stat status = {};
    if (lstat(szPath.c_str(), &status) == 0 && (!S_ISREG(status.st_mode) || status.st_uid != geteuid())) {
        unlink(szPath.c_str());
    }
}

void OnSignal(AvahiWatch*, int, AvahiWatchEvent, void* pUser) {
    avahi_simple_poll_quit(static_cast<AvahiSimplePoll*>(pUser));
}

Descriptor OpenSignals() {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGINT);
    sigprocmask(SIG_BLOCK, &signals, nullptr);
    return Descriptor(signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
}

}  // namespace

AirportPublisher::AirportPublisher(const char* szPath)
    : mSzPath(szPath), mPPoll(avahi_simple_poll_new()), mFdSignals(OpenSignals()) {}

// What nobody keeps up to date any more must not be read.
AirportPublisher::~AirportPublisher() {
    unlink(mSzPath.c_str());
}

bool AirportPublisher::Run() {
    if (!mPPoll || mFdSignals.Get() < 0) {
        return false;
    }
    const AvahiPoll* pPoll = avahi_simple_poll_get(mPPoll.get());
    if (pPoll->watch_new(pPoll, mFdSignals.Get(), AVAHI_WATCH_IN, &OnSignal, mPPoll.get()) == nullptr) {
        return false;
    }
    unlink(mSzPath.c_str());  // of an earlier run
    Connect();
    return avahi_simple_poll_loop(mPPoll.get()) >= 0;
}

// The client itself waits for an avahi that is not there yet; for a missing D-Bus we try again.
void AirportPublisher::Connect() {
    Forget();
    mPClient.reset();
    int nError = 0;
    const AvahiPoll* pPoll = avahi_simple_poll_get(mPPoll.get());
    mPClient.reset(avahi_client_new(pPoll, AVAHI_CLIENT_NO_FAIL, &OnClient, this, &nError));
    if (!mPClient) {
        SetTimer(mPConnectTimer, kRetryMilliseconds, [](AvahiTimeout*, void* pUser) { Self(pUser).Connect(); });
    }
}

void AirportPublisher::Forget() {
    mPBrowser.reset();
    if (!mMapStations.empty()) {
        mMapStations.clear();
        Changed();
    }
}

void AirportPublisher::OnClient(AvahiClient* pClient, AvahiClientState enState, void* pUser) {
    AirportPublisher& self = Self(pUser);
    switch (enState) {
        case AVAHI_CLIENT_S_RUNNING:
        case AVAHI_CLIENT_S_REGISTERING:
        case AVAHI_CLIENT_S_COLLISION:
            self.Browse(pClient);
            break;
        case AVAHI_CLIENT_CONNECTING:
            self.Forget();
            break;
        case AVAHI_CLIENT_FAILURE: {
            // A restarted avahi knows nothing of what we asked the old one. A new client cannot be made
            // within the old one's callback.
            const bool blRestarted = avahi_client_errno(pClient) == AVAHI_ERR_DISCONNECTED;
            SysLog(blRestarted ? LOG_INFO : LOG_ERR, "connection to avahi: %s",
                   avahi_strerror(avahi_client_errno(pClient)));
            self.SetTimer(self.mPConnectTimer, blRestarted ? 0 : kRetryMilliseconds,
                          [](AvahiTimeout*, void* pData) { Self(pData).Connect(); });
            break;
        }
    }
}

void AirportPublisher::Browse(AvahiClient* pClient) {
    if (mPBrowser) {
        return;
    }
    mPBrowser.reset(avahi_service_browser_new(pClient, AVAHI_IF_UNSPEC, AVAHI_PROTO_INET, kServiceType, kDomain,
                                              static_cast<AvahiLookupFlags>(0), &OnBrowse, this));
    if (!mPBrowser) {
        SysLog(LOG_ERR, "cannot browse %s: %s", kServiceType, avahi_strerror(avahi_client_errno(pClient)));
        SetTimer(mPConnectTimer, kRetryMilliseconds, [](AvahiTimeout*, void* pUser) { Self(pUser).Connect(); });
    }
}

void AirportPublisher::OnBrowse(AvahiServiceBrowser* pBrowser, AvahiIfIndex nInterface, AvahiProtocol,
                                AvahiBrowserEvent enEvent, const char* szName, const char*, const char*,
                                AvahiLookupResultFlags, void* pUser) {
    AirportPublisher& self = Self(pUser);
    AtBorder(0, [&] {
        if (enEvent == AVAHI_BROWSER_NEW && self.mMapStations.size() < kMaxStations) {
            self.Resolve(avahi_service_browser_get_client(pBrowser), {nInterface, szName});
        } else if (enEvent == AVAHI_BROWSER_REMOVE && self.mMapStations.erase({nInterface, szName}) > 0) {
            self.Changed();
        } else if (enEvent == AVAHI_BROWSER_FAILURE) {
            self.SetTimer(self.mPConnectTimer, kRetryMilliseconds,
                          [](AvahiTimeout*, void* pData) { Self(pData).Connect(); });
        }
        return 0;
    });
}

void AirportPublisher::Resolve(AvahiClient* pClient, const StationKey& key) {
    AirportStation& station = mMapStations[key];
    station.pResolver.reset(avahi_service_resolver_new(pClient, key.first, AVAHI_PROTO_INET, key.second.c_str(),
                                                       kServiceType, kDomain, AVAHI_PROTO_INET,
                                                       static_cast<AvahiLookupFlags>(0), &OnResolve, this));
    if (!station.pResolver) {
        mMapStations.erase(key);
    }
}

void AirportPublisher::OnResolve(AvahiServiceResolver* pResolver, AvahiIfIndex nInterface, AvahiProtocol,
                                 AvahiResolverEvent enEvent, const char* szName, const char*, const char*, const char*,
                                 const AvahiAddress* pAddress, uint16_t, AvahiStringList*, AvahiLookupResultFlags,
                                 void* pUser) {
    AirportPublisher& self = Self(pUser);
    AtBorder(0, [&] {
        const StationKey key{nInterface, szName};
        const auto it = self.mMapStations.find(key);
        if (it == self.mMapStations.end()) {
            return 0;
        }
        if (enEvent == AVAHI_RESOLVER_FOUND) {
            char szAddress[AVAHI_ADDRESS_STR_MAX] = {};
            avahi_address_snprint(szAddress, sizeof(szAddress), pAddress);
            it->second.szAddress = szAddress;
            self.Changed();
            return 0;
        }
        // Still announced, but its answer was lost: avahi gives up after some seconds, we do not.
        AvahiClient* pClient = avahi_service_resolver_get_client(pResolver);
        if (avahi_client_errno(pClient) == AVAHI_ERR_TIMEOUT) {
            self.Resolve(pClient, key);
        }
        return 0;
    });
}

void AirportPublisher::Changed() {
    if (mBlWritePending) {
        return;
    }
    mBlWritePending = true;
    SetTimer(mPWriteTimer, kGatherMilliseconds, [](AvahiTimeout*, void* pUser) {
        Self(pUser).mBlWritePending = false;
        AtBorder(0, [pUser] {
            Self(pUser).Write();
            return 0;
        });
    });
}

void AirportPublisher::Write() const {
    std::vector<Section> rgSections;
    std::set<std::string> setAddresses;
    for (const auto& [key, station] : mMapStations) {
        if (!station.szAddress.empty() && setAddresses.insert(station.szAddress).second) {
            rgSections.push_back({station.szAddress, {{"name", PrintableText(key.second, kMaxName)}}});
        }
    }
    if (rgSections.empty()) {
        unlink(mSzPath.c_str());
        return;
    }
    RemoveForeign(mSzPath);
    if (!WriteFileAtomic(mSzPath, FormatSections(rgSections), kListMode)) {
        SysLog(LOG_ERR, "cannot write %s: %s", mSzPath.c_str(), std::strerror(errno));
    }
}

void AirportPublisher::SetTimer(AvahiTimeout*& pTimer, unsigned nMilliseconds, AvahiTimeoutCallback pfnElapsed) {
    const AvahiPoll* pPoll = avahi_simple_poll_get(mPPoll.get());
    timeval when = {};
    avahi_elapse_time(&when, nMilliseconds, 0);
    if (pTimer != nullptr) {
        pPoll->timeout_update(pTimer, &when);
    } else {
        pTimer = pPoll->timeout_new(pPoll, &when, pfnElapsed, this);
    }
}

}  // namespace tavo
