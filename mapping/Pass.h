// One pass over the wanted mappings: what it is given, what came of it, and when it has to end. Relies on nothing.
// Promises: a pass is over well before a save stops waiting for it, whatever the router does.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <set>
#include <string>
#include <utility>

#include "ground/BootClock.h"
#include "mapping/Outcome.h"
#include "mapping/Plan.h"
#include "mapping/Record.h"
#include "mapping/Router.h"

namespace tavo {

// What was learnt about one router, kept between passes.
struct Habits {
    uint32_t nLease = 3600;        // seconds to ask for
    bool blPermanentOnly = false;  // it refuses leases
    bool blTakesLease = false;     // it has taken one: what it refuses is something else
    int nTakenWithout = 0;         // mappings that it refused with a lease and took without one
    int nVain = 0;                 // and refused without one, too, in this pass
    bool blNoRanges = false;       // it could not show a range, and may have died of the question
    // Places that it gave another one instead of, each with its word. Each asking opens a wrong port for a moment: they
    // are not asked for again while they stand here.
    std::map<MappingKey, std::string> mapElsewhere = {};
    int64_t nElsewhereSince = 0;  // seconds of boot time: none of them is older
    MappingKey next = {};         // where to go on, after a pass that its time was too short for
    // Rows that were made of what the router showed, and could not be put where they survive us yet.
    std::set<MappingKey> setUnsaved = {};
    RouterName router = {};             // that gave them: another one at the same address may have the places free
    std::set<MappingKey> setLost = {};  // where it said yes at the last asking, and has shown nothing yet
};

// What another daemon of this box sees to, by place the port of the box: what leads there is not taken away.
using Others = std::map<MappingKey, uint16_t>;

struct Surroundings {
    std::string szBox;               // the box's own address
    std::function<int64_t()> fnNow;  // seconds of boot time
    std::function<bool()> fnStop;
    std::function<bool()> fnSave;  // puts the record where it survives us; whether it is there
    // Is told of each step that changes something at the router, and why.
    std::function<void(const RouterMapping&, const Step&)> fnTell = [](const RouterMapping&, const Step&) {};
    Others mapOthers = {};
    std::function<void()> fnHeard = {};  // may be empty; is told of each answer of the router
};

struct PassResult {
    OutcomeList rgOutcomes;  // those of the wanted mappings first, in their order
    RouterReply transport;   // not kOk: why the router could not be spoken to
    bool blStopped = false;
    bool blUnfinished = false;  // its time was up: the next one goes on where it ended
    int nNextSeconds = 0;       // until something has to be done again; 0: nothing has to
    RouterState enRouter = RouterState::kNotAsked;
};

class PassGuard {
public:
    PassGuard(PassResult& result, const std::function<bool()>& fnStop, std::function<int64_t()> fnNow = BootSeconds,
              std::function<void()> fnHeard = {})
        : mResult(result),
          mFnStop(fnStop),
          mFnNow(std::move(fnNow)),
          mFnHeard(std::move(fnHeard)),
          mNEnd(mFnNow() + kPassLimit) {}

    bool IsOver() {
        mResult.blStopped = mResult.blStopped || mFnStop();
        mResult.blUnfinished = mResult.blUnfinished || mFnNow() > mNEnd;
        return mResult.blStopped || mResult.blUnfinished || !mResult.transport.IsOk();
    }
    // Counts answers that did not come; after a few in a row the pass is over.
    RouterReply Note(RouterReply reply) {
        mNSilent = reply.IsSilence() ? mNSilent + 1 : 0;
        mBlSense =
            mBlSense || reply.IsOk() || reply.enReply == Reply::kNoSuchEntry || reply.enReply == Reply::kConflict;
        if (mFnHeard && !reply.IsSilence()) {
            mFnHeard();
        }
        if (mNSilent >= kTransportTries || reply.enReply == Reply::kUnreachable) {
            mResult.transport = reply;
        }
        return reply;
    }
    // Whether the router has answered at least one question with sense.
    bool HasSense() const { return mBlSense; }
    // What there is to say of what the router was not asked about any more.
    RouterReply Unasked() const {
        const bool blLate = mResult.transport.IsOk() && !mResult.blStopped;
        return blLate ? RouterReply{Reply::kTimeout, "timeout"} : mResult.transport;
    }

private:
    static constexpr int64_t kPassLimit = 150;  // seconds, well below the five minutes that a save waits
    static constexpr int kTransportTries = 2;   // silent answers in a row before a pass gives up

    PassResult& mResult;
    const std::function<bool()>& mFnStop;
    std::function<int64_t()> mFnNow;
    std::function<void()> mFnHeard;
    int64_t mNEnd;
    int mNSilent = 0;
    bool mBlSense = false;
};

}  // namespace tavo
