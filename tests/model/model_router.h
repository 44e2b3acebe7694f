// A model of a home router's table of port mappings: its habits and its faults are chosen by a seed, its time is moved
// by the test. It knows the truth that the code under test can only ask for.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "mapping/Record.h"
#include "mapping/Router.h"

namespace model {

using Reply = tavo::RouterReply;

// Thrown where our process is killed: before or after a request took effect.
struct Killed {};

struct Habits {
    bool blPermanentOnly = false;
    bool blForgetsLease = false;  // makes it with a lease, and lists none
    bool blListsWhatIsLeft = false;
    uint32_t nLongestLease = 0;  // 0: any
    int nText = 0;               // 0 kept, 1 rewritten, 2 dropped; everybody's
    bool blSecure = false;       // only the client may make, change and delete its entries
    bool blOverwrites = true;    // a client's own entry at its place; else 718 for any change
    size_t nCapacity = 1000;
    bool blSaysFull = true;                 // else it says yes and keeps nothing
    tavo::Reply enList = tavo::Reply::kOk;  // what a listing answers; kTooLong with the first entries
    bool blRanges = false;
    bool blRangesLie = false;    // a range leaves out the asker's own
    bool blSaysChanged = false;  // says yes to a change of its own entry, and keeps it as it was
    // Shows nothing, lends everything, gives another port where the wanted one is taken, and knows a mapping by its
    // client and the client's port.
    bool blBlind = false;
    bool blKeepsRemoved = false;  // says yes to a removal, and keeps the entry
    bool blSlowToHide = false;    // shows an entry for some seconds after it was taken away
    bool blSlowToShow = false;    // shows a new one only some seconds after it was made
    bool blSlow = false;          // each answer takes a second
    // The router's own pages: no leases, an entry is never changed in place, the box reads the list once and after each
    // change, and begins anew for each pass, with the record from the disk.
    bool blForm = false;
    bool blApply = false;        // of a form: what was done is lost unless it is applied
    bool blMute = false;         // of a form: it shows no list
    bool blHidesClient = false;  // of a form: the list does not show whom an entry is for

    std::string Text() const;  // those that it has
};

class Router : public tavo::Router {
public:
    Router(std::mt19937& random, int64_t& nNow) : mRandom(random), mNNow(nNow) {}

    struct Entry {
        tavo::RouterMapping mapping;
        int64_t nEnd = 0;       // 0: never
        bool blBox = false;     // made by the code under test
        bool blOrphan = false;  // was made by it, and nobody can know that any more
        int64_t nMade = 0;
    };

    tavo::Abilities What() const override {
        return {!habits.blBlind && !habits.blMute, habits.blBlind, habits.blBlind, "conflict", habits.blForm};
    }
    Reply List(std::vector<tavo::RouterMapping>& rgMappings) override;
    Reply ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                    std::vector<tavo::RouterMapping>& rgMappings) override;
    Reply Get(const std::string& szProtocol, uint16_t nRouterPort, tavo::RouterMapping& mapping) override;
    Reply Add(tavo::RouterMapping& mapping) override;
    Reply Remove(const tavo::RouterMapping& mapping) override;
    Reply Apply() override;
    // A question that changes nothing.
    Reply Ask(int& nLifeNow);

    // How the router keeps a description.
    std::string TextOf(const std::string& szText) const {
        return habits.nText == 0 ? szText : habits.nText == 1 ? "upnp mapping" : "";
    }

    // ---- the world's side -----------------------------------------------------------------------

    // Ends the leases that are over.
    void Expire();
    // What is there now, without asking.
    const Entry* At(const tavo::MappingKey& key);
    // Another process asks now.
    void NewRun() {
        mBlListed = mBlChanged = false;
        mApplied = {};
    }
    // It asks for nothing more.
    void EndRun();
    void Restart() {
        mMapTable.clear();
        mMapGone.clear();
        ++nLife;
    }

    Habits habits;
    std::string szBox;      // who asks
    bool blAway = false;    // answers nothing
    int nLosePerMille = 0;  // answers that are lost, after or before the request took effect
    int nKillPerMille = 0;  // requests at which our process dies
    int nSkipPerMille = 0;  // entries that a listing leaves out, because somebody else changes the table meanwhile
    std::map<tavo::MappingKey, Entry> mMapTable;
    int nLife = 0;  // since its last restart, as a blind one's clock tells it
    int nRequests = 0;
    std::function<void(std::string)> fnTell;  // each change that is asked for
    std::function<void(const tavo::RouterMapping&)> fnBeforeAdd;
    std::string szBroken;  // a promise that a request of ours has broken

private:
    bool Chance(int nPerMille) { return static_cast<int>(mRandom() % 1000) < nPerMille; }
    // What becomes of a request before it takes effect, and of its answer afterwards.
    template <typename Effect>
    Reply Answer(Effect fnEffect);
    tavo::RouterMapping Shown(const Entry& entry) const;
    Reply DoAdd(const tavo::RouterMapping& mapping);
    // As one that knows a mapping by its client and the client's port, and shows none.
    Reply DoGrant(tavo::RouterMapping& mapping);
    Reply DoRemove(const tavo::RouterMapping& mapping);
    // A form's list as the box has it, read where that is needed.
    Reply ReadForm();
    Reply FormGet(const tavo::MappingKey& key, tavo::RouterMapping& mapping);
    // What it shows, which may not be all that there is.
    std::map<tavo::MappingKey, tavo::RouterMapping> View() const;
    // What is there before a form is changed.
    void BeforeChange();
    const Entry* OfBoxPort(const tavo::RouterMapping& mapping) const;

    Reply mAsked;
    bool mBlListed = false;   // the box has a form's list, and it is not out of date
    bool mBlChanged = false;  // a form has done something that has not been applied
    Reply mApplied;
    std::map<tavo::MappingKey, tavo::RouterMapping> mMapListed;
    std::map<tavo::MappingKey, std::pair<int64_t, Entry>> mMapGone;  // with when it was taken away
    std::optional<std::map<tavo::MappingKey, Entry>> mMapBefore;     // a form's, without what was not applied
    std::mt19937& mRandom;
    int64_t& mNNow;
};

}  // namespace model
