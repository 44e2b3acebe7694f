// What the mapping side of both daemons does alike: rules, results, the gateway and the box's address, the
// clock of checks, renewals and retries. Relies on the settings, the rule file and the platform's addresses;
// the protocol is spoken by the class derived from it.
// Promises: the result file is removed when a request begins and complete when its pass has ended; what is known
// is published after each pass, and what has changed is told; the router is spoken to only while the other daemon does
// not.
#pragma once

#include <functional>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "ground/BootClock.h"
#include "mapping/Carry.h"
#include "mapping/Keeper.h"
#include "mapping/Pass.h"
#include "programs/common/Daemon.h"
#include "programs/common/MadeFile.h"
#include "programs/common/Published.h"
#include "programs/common/RouterTurn.h"
#include "programs/common/RuleFile.h"
#include "programs/common/Teller.h"
#include "programs/common/ToldFile.h"
#include "programs/common/UnusedPages.h"
#include "wire/upnp/Notify.h"

namespace tavo {

class RuleMapper : public Mapper {
public:
    int Run(bool blRequested, const std::function<bool()>& fnStop) final;
    bool IsSwitchedOn() const final { return IsRunKeyOn(mNames.szRunKey); }
    bool Withdraw(const std::function<bool()>& fnEnd) final;
    bool OnNetworkChange() final;
    std::vector<int> WakeFds() const override { return {mAnnouncements.Fd(), mPages.Fd()}; }
    // The gateway has begun anew, by what it announces as a UPnP device, which most are whatever maps ports there; or
    // its own pages have taken away what they forwarded.
    bool OnWake() override {
        const bool blFree = mPages.TakeEnd();
        return mAnnouncements.TakeNews(mSzGateway) || blFree;
    }

protected:
    explicit RuleMapper(const DaemonNames& names);

    // Brings the router in line. blRequested: somebody asked for it, and the clock did not.
    virtual PassResult Map(const std::vector<RouterMapping>& rgWanted, bool blRequested,
                           const std::function<bool()>& fnStop) = 0;
    // The result file's text, of names and words of all that was asked for; "1" is success.
    virtual std::string ResultText(const OutcomeList& rgOutcomes) const = 0;
    // The router's address on its other side; empty when it does not say.
    virtual std::string Outside(const std::function<bool()>& fnStop) = 0;
    // The gateway or the box's own address is another one: nothing of what was known holds.
    virtual void NewGateway() = 0;
    // Whether something of ours may be at the gateway, by the record.
    virtual bool HasMade(const std::function<bool()>& fnStop) = 0;
    // Several passes in a row have failed.
    virtual void LostRouter() {}

    // What a pass that failed as a whole says of each mapping.
    static PassResult Failed(const std::vector<RouterMapping>& rgWanted, const char* szWord, RouterState enRouter);

    const std::string& Gateway() const { return mSzGateway; }
    const std::string& Box() const { return mSzBox; }
    // The router in front. The kernel forgets hardware, as when the cable was out; at one address it is asked for it,
    // or else the same as before.
    RouterName Front(const std::function<bool()>& fnStop);
    // The router has answered: a stop goes on.
    void Heard() { mHeard = BootClock::now(); }
    uint32_t WishedLease() const { return mNWishedLease; }
    // What a pass leaves alone, as the other daemon has the turn: by place, the port of the box.
    const tavo::Others& Others() const { return mMapOthers; }

private:
    bool MendRunKeys();
    void ReadSettings();
    void ReadRules();
    bool FindGateway();
    bool TakeTurn(const std::function<bool()>& fnStop);
    PassResult Pass(bool blRequested, const std::function<bool()>& fnStop);
    PassResult TakeAwayBesides(const std::vector<RouterMapping>& rgOthers, const std::function<bool()>& fnStop);
    void AddRules(OutcomeList& rgOutcomes) const;
    void WriteResults(const OutcomeList& rgOutcomes) const;
    int SecondsToNext(const PassResult& result, bool blRequested);
    void LookAtRouter(Published& state, const std::function<bool()>& fnStop);
    void AskOutside(const std::function<bool()>& fnStop);
    void PublishPass(PassResult result, bool blRequested, int nSecondsToNext, const std::function<bool()>& fnStop);
    void PublishLeft(PassResult result) const;
    void TellNews(const Published& state, bool blRequested);

    const DaemonNames& mNames;
    int mNCheckSeconds = 0;
    uint32_t mNWishedLease = 0;
    WantedSet mWanted;
    bool mBlRulesRead = false;
    bool mBlMended = false;  // no killed save or detection has left our run key off
    Announcements mAnnouncements;
    UnusedPages mPages;
    std::string mSzNetwork;  // what the last pass, or the last look since, saw of it
    RouterTurn mTurn;
    tavo::Others mMapOthers;
    std::string mSzGateway;
    std::string mSzBox;
    std::string mSzHardware;  // of the gateway, as it was last seen
    Keeper mKeeper;
    std::string mSzLast;           // what the last pass had to say
    BootClock::time_point mHeard;  // when the router last answered
    std::string mSzOutside;
    int mNUntilOutside = 0;  // passes until the router is asked for it again
    ToldFile mTold;
    Teller mTeller;
};

}  // namespace tavo
