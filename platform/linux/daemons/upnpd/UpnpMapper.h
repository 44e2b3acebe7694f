// The mapping side of upnpd: the gateway's IGD kept in line with the rules.
// Relies on the IGD client and Reconcile. Promises: the status file is removed when a request begins
// and complete when its pass has ended.
#pragma once

#include <memory>
#include <string>

#include "daemons/common/Daemon.h"
#include "daemons/common/Reconcile.h"
#include "daemons/common/Wanted.h"
#include "upnp/Igd.h"

namespace tavo {

class UpnpMapper : public Mapper {
public:
    UpnpMapper();
    int Run(bool blRequested, const std::function<bool()>& fnStop) override;
    bool IsSwitchedOn() const override;
    void Withdraw(const std::function<bool()>& fnStop) override;

private:
    bool FindRouter();
    void Forget();
    void Remember() const;
    PassResult Map(const std::function<bool()>& fnStop);
    void WriteStatus(const PassResult& result) const;
    int NextRun(const PassResult& result);

    int mNCheckSeconds;
    WantedSet mWanted;
    std::string mSzGateway;
    std::string mSzBox;
    std::string mSzLocation;
    std::unique_ptr<Igd> mPIgd;
    LeaseHabit mHabit;
    int mNFailures = 0;
    uint32_t mNLease = 0;  // seconds that the router grants
    std::chrono::steady_clock::time_point mRenewed;
};

}  // namespace tavo
