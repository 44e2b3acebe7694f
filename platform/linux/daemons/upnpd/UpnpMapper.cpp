// Keeps the gateway's UPnP mappings in line with the rules. Relies on the IGD client, Reconcile and
// the platform's addresses. Promises: see UpnpMapper.h.
#include "daemons/upnpd/UpnpMapper.h"

#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>

#include "core/TextFile.h"
#include "tavo/core.h"
#include "tavo/net.h"
#include "upnp/Known.h"

namespace tavo {

namespace {

constexpr char kRunKey[] = "runupnpportmapping";
constexpr char kStatusFile[] = "/var/tmp/upnp_portmap.status";
constexpr mode_t kStatusMode = 0644;
constexpr int kDiscoveryMilliseconds = 5000;
constexpr int kFailuresToRediscover = 3;
constexpr int kRetrySeconds = 10;
constexpr size_t kAddressSize = 16;

int Setting(const char* szKey, const char* szDefault, int nLeast, int nMost) {
    char szValue[16];
    TLIBPlatformSettingGet("upnpd", szKey, szDefault, szValue, sizeof(szValue));
    return static_cast<int>(std::clamp<long>(std::strtol(szValue, nullptr, 10), nLeast, nMost));
}

}  // namespace

UpnpMapper::UpnpMapper() : mNCheckSeconds(Setting("check_interval", "120", 1, 3600)) {
    mHabit.nLease = static_cast<uint32_t>(Setting("lease", "3600", 20, 604800));
}

// Who is the router, and where does its service live. False: there is none that we can use.
bool UpnpMapper::FindRouter() {
    char szGateway[kAddressSize] = {};
    char szBox[kAddressSize] = {};
    if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) != 0 ||
        TAVONetLocalAddressGet(szGateway, szBox, sizeof(szBox), nullptr, 0) != 0) {
        Forget();
        mSzGateway.clear();
        return false;
    }
    if (mSzGateway != szGateway) {
        Forget();
        mSzGateway = szGateway;
        KnownRouter known = RecallRouter(mSzGateway);
        mSzLocation = std::move(known.szLocation);
        mHabit.blPermanentOnly = known.blPermanentOnly;
    }
    mSzBox = szBox;
    if (mPIgd == nullptr) {
        mPIgd = Igd::Find(mSzGateway, mSzBox, kDiscoveryMilliseconds, &mSzLocation);
        if (mPIgd != nullptr) {
            Remember();
        }
    }
    return mPIgd != nullptr;
}

void UpnpMapper::Forget() {
    mPIgd.reset();
    mNLease = 0;
}

// What worked is tried first the next time, also after a restart.
void UpnpMapper::Remember() const {
    KeepRouter(mSzGateway, {mSzLocation, mHabit.blPermanentOnly});
}

PassResult UpnpMapper::Map(const std::function<bool()>& fnStop) {
    const auto fnFailed = [this](const char* szWord) {
        PassResult result;
        for (const RouterMapping& wanted : mWanted.rgMappings) {
            result.rgStatus.emplace_back(MappingName(wanted), szWord);
        }
        result.nTransport = kRouterUnreachable;
        return result;
    };
    if (!FindRouter()) {
        return fnFailed(mSzGateway.empty() ? "nogateway" : "noigd");
    }
    const auto now = std::chrono::steady_clock::now();
    const bool blRenew = mNLease != 0 && now - mRenewed >= std::chrono::seconds(mNLease / 2);
    const bool blPermanentOnly = mHabit.blPermanentOnly;
    const PassResult result = Reconcile(*mPIgd, mWanted.rgMappings, mSzBox, mHabit, blRenew, fnStop);
    if (blPermanentOnly != mHabit.blPermanentOnly) {
        Remember();
    }
    if (result.nTransport == kRouterOk && !result.blStopped) {
        mRenewed = blRenew || mNLease == 0 ? now : mRenewed;
        mNLease = result.nShortestLease;
    }
    return result;
}

int UpnpMapper::Run(bool blRequested, const std::function<bool()>& fnStop) {
    if (blRequested) {
        unlink(kStatusFile);  // what it says belongs to an older request
        WantedSet wanted = ReadWanted(kRunKey);
        if (wanted.blReadable) {
            mWanted = std::move(wanted);
        } else {
            mWanted.blReadable = false;
            syslog(LOG_ERR, "the rule file cannot be read; the router's mappings stay as they are");
        }
    }
    PassResult result = Map(fnStop);
    // A router that restarted often has its service at another port: look for it at once.
    if (result.nTransport == kRouterUnreachable && mPIgd != nullptr && !result.blStopped) {
        Forget();
        mSzLocation.clear();
        result = Map(fnStop);
    }
    if (!result.blStopped) {
        WriteStatus(result);
    }
    return NextRun(result);
}

int UpnpMapper::NextRun(const PassResult& result) {
    if (result.nTransport == kRouterOk) {
        mNFailures = 0;
        // Half the lease from the last renewal; a margin keeps the clock ahead of the router's.
        const int nHalfLease = mNLease == 0 ? mNCheckSeconds : std::max(1, static_cast<int>(mNLease / 2));
        return std::min(mNCheckSeconds, nHalfLease);
    }
    if (++mNFailures >= kFailuresToRediscover) {
        mNFailures = 0;
        Forget();
        mSzLocation.clear();
    }
    return std::min(mNCheckSeconds, kRetrySeconds);
}

void UpnpMapper::WriteStatus(const PassResult& result) const {
    std::string szText;
    for (const auto& [szName, szCode] : result.rgStatus) {
        szText += szName + "=" + szCode + "\n";
    }
    for (const std::string& szRule : mWanted.rgszInvalid) {
        szText += szRule + "=invalid\n";
    }
    if (!mWanted.blReadable) {
        szText += "rule.conf=unreadable\n";
    }
    if (!WriteFileAtomic(kStatusFile, szText, kStatusMode)) {
        syslog(LOG_ERR, "cannot write %s", kStatusFile);
    }
}

bool UpnpMapper::IsSwitchedOn() const {
    return IsRunKeyOn(kRunKey);
}

void UpnpMapper::Withdraw(const std::function<bool()>& fnStop) {
    if (!mSzGateway.empty() && FindRouter()) {
        Reconcile(*mPIgd, {}, mSzBox, mHabit, false, fnStop);
    }
}

}  // namespace tavo
