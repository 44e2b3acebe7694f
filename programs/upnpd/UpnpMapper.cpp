// Keeps the gateway's UPnP mappings in line with the rules. Relies on the IGD client and the mapping core.
// Promises: see RuleMapper.h.
#include "programs/upnpd/UpnpMapper.h"

#include <algorithm>
#include <chrono>
#include <iterator>
#include <utility>

#include "ground/SysLog.h"
#include "programs/common/IgdRouter.h"
#include "wire/upnp/GatewayMemory.h"
#include "wire/upnp/Search.h"

namespace tavo {

namespace {

constexpr char kNoIgd[] = "noigd";
constexpr char kNoLine[] = "noline";  // the line that it was made at is gone
constexpr int kDiscoveryMilliseconds = 8000;
constexpr int kOutsideMilliseconds = 2000;
constexpr auto kEcho = std::chrono::seconds(3);  // until what we have changed has been told to us

}  // namespace

constexpr DaemonNames kUpnpNames{"upnpd",
                                 "UPnP",
                                 "runupnpportmapping",
                                 "/var/run/upnpd.pid",
                                 "/var/run/upnpd.lock",
                                 "/var/tmp/upnp_portmap.status",
                                 kUpnpMadeFile};

UpnpMapper::UpnpMapper() : RuleMapper(kUpnpNames), mMade(kUpnpNames.szMadeFile) {}

void UpnpMapper::NewGateway() {
    mPIgd.reset();
    mEvents.TurnTo(std::nullopt, "");
    KnownRouter known = RecallRouter(Gateway());
    mKept = known;
    mPlace = std::move(known.place);
    mHabit.blPermanentOnly = known.blPermanentOnly;
    mBlNoGet = known.blNoGet;
    mHabit.blNoRanges = known.blNoRanges;
    mSzKnownHardware = std::move(known.szHardware);
}

void UpnpMapper::LostRouter() {
    mPIgd.reset();
    mPlace.szLocation.clear();
}

// Where does the router's service live. False: there is none that we can use.
bool UpnpMapper::FindRouter(const std::function<bool()>& fnStop) {
    if (mPIgd == nullptr) {
        mPIgd = Igd::Find(Gateway(), Box(), kDiscoveryMilliseconds, &mPlace, 0, fnStop, &mFdLate);
        if (mPIgd != nullptr) {
            mFdLate.Reset();
            mEvents.TurnTo(mPIgd->Service().events, Box());
        }
    }
    return mPIgd != nullptr;
}

// A router with several lines may have gone over to another one.
void UpnpMapper::ChooseLine(const std::function<bool()>& fnStop) {
    if (mPIgd != nullptr && mPIgd->IsOneOfSeveral()) {
        mPIgd->SetStop(fnStop);
        if (mPIgd->IsConnected() == false) {
            mPIgd.reset();
        }
    }
}

// What stands at lines that are not in use, until the router says that it is gone. What is left there.
OutcomeList UpnpMapper::ClearOtherLines(const RouterName& router, const Surroundings& around) {
    OutcomeList rgLeft;
    for (const std::string& szLine : mMade.Get().OtherLines()) {
        mMade.Get().TurnTo({router.szGateway, router.szHardware, szLine});
        PassResult result;
        if (const auto pIgd = mPIgd->Beside(szLine)) {
            IgdRouter line(*pIgd, Box(), mBlNoGet);
            Habits habit{.nLease = WishedLease()};
            result = BringInLine(line, {}, mMade.Get(), habit, around);
        } else {
            result.rgOutcomes = LeftOnRecord(mMade.Get(), {}, {}, {Reply::kUnreachable, kNoLine}, BootSeconds());
        }
        std::move(result.rgOutcomes.begin(), result.rgOutcomes.end(), std::back_inserter(rgLeft));
    }
    mMade.Get().TurnTo(router);
    return rgLeft;
}

// What worked is tried first the next time, also after a restart.
void UpnpMapper::Remember() {
    if (const std::string& szHardware = mMade.Get().Router().szHardware; !szHardware.empty()) {
        mSzKnownHardware = szHardware;
    }
    KnownRouter known{mPlace, mSzKnownHardware, mHabit.blPermanentOnly, mBlNoGet, mHabit.blNoRanges};
    if (mKept != known) {  // each look at the file reads it
        KeepRouter(Gateway(), known);
        mKept = std::move(known);
    }
}

RouterName UpnpMapper::Name(const std::function<bool()>& fnStop) {
    RouterName name = Front(fnStop);
    name.szLine = mPlace.szLine;
    return name;
}

// Another device at the address of the one before has habits of its own.
void UpnpMapper::TurnTo(const RouterName& router) {
    mMade.Get().TurnTo(router);
    if (!router.IsSame({Gateway(), mSzKnownHardware, router.szLine})) {
        mHabit = {};
        mBlNoGet = false;
    }
}

// Before the table is read: what changes after that is told.
void UpnpMapper::KeepEvents(const std::vector<RouterMapping>& rgWanted, const std::function<bool()>& fnStop) {
    if (rgWanted.empty()) {
        mEvents.End();
    } else {
        mEvents.Keep(BootClock::now(), fnStop);
    }
}

std::vector<int> UpnpMapper::WakeFds() const {
    std::vector<int> rgFds = RuleMapper::WakeFds();
    for (const int fd : mEvents.Fds()) {
        rgFds.push_back(fd);
    }
    if (mFdLate.Get() >= 0) {
        rgFds.push_back(mFdLate.Get());
    }
    return rgFds;
}

bool UpnpMapper::OnWake() {
    bool blRouter = RuleMapper::OnWake();
    if (const auto late = TakeLate(mFdLate, Gateway())) {
        mPlace.szLocation = late->Text();
        blRouter = true;
    }
    return (mEvents.TakeNews() && BootClock::now() >= mQuietUntil) || blRouter;
}

bool UpnpMapper::HasMade(const std::function<bool()>& fnStop) {
    mMade.Get().TurnTo(Name(fnStop));
    return !LeftOnRecord(mMade.Get(), {}, {}, {}, BootSeconds()).empty() || !mMade.Get().OtherLines().empty();
}

PassResult UpnpMapper::MapOnce(const std::vector<RouterMapping>& rgWanted, const std::function<bool()>& fnStop) {
    ChooseLine(fnStop);
    if (!FindRouter(fnStop)) {
        mMade.Get().TurnTo(Name([] { return true; }));  // nobody is there to be asked
        PassResult result = Failed(rgWanted, kNoIgd, RouterState::kNoService);
        result.blStopped = fnStop();
        // A router that maps no ports any more may still forward those that we made.
        for (Outcome& left : LeftOnRecord(mMade.Get(), rgWanted, {}, result.transport, BootSeconds())) {
            const auto it = Others().find({left.szProtocol, left.nRouterPort});
            if (it == Others().end() || it->second != left.nBoxPort) {
                result.rgOutcomes.push_back(std::move(left));
            }
        }
        return result;
    }
    const RouterName name = Name(fnStop);
    TurnTo(name);
    mMade.Get().Prune(BootSeconds());
    mPIgd->SetStop(fnStop);
    mHabit.nLease = WishedLease();
    KeepEvents(rgWanted, fnStop);
    IgdRouter router(*mPIgd, Box(), mBlNoGet);
    bool blChanged = false;
    Surroundings around = Around(Box(), fnStop, mMade);
    around.mapOthers = Others();
    around.fnHeard = [this] { Heard(); };
    around.fnTell = [&blChanged, fnLog = around.fnTell](const RouterMapping& mapping, const Step& step) {
        blChanged = true;
        fnLog(mapping, step);
    };
    OutcomeList rgLeft = ClearOtherLines(name, around);
    PassResult result = BringInLine(router, rgWanted, mMade.Get(), mHabit, around);
    mBlNoGet = router.HasNoGet();
    std::move(rgLeft.begin(), rgLeft.end(), std::back_inserter(result.rgOutcomes));
    mQuietUntil = blChanged ? BootClock::now() + kEcho : mQuietUntil;
    result.enRouter = result.transport.IsOk() ? RouterState::kOk : RouterState::kSilent;
    Remember();
    return result;
}

// The record knows what is due.
PassResult UpnpMapper::Map(const std::vector<RouterMapping>& rgWanted, bool /*blRequested*/,
                           const std::function<bool()>& fnStop) {
    PassResult result = MapOnce(rgWanted, fnStop);
    // A router that restarted often has its service at another port: look for it at once.
    if (result.transport.enReply == Reply::kUnreachable && mPIgd != nullptr && !result.blStopped) {
        LostRouter();
        result = MapOnce(rgWanted, fnStop);
    }
    if (const auto due = mEvents.Due()) {
        const auto left = std::chrono::ceil<std::chrono::seconds>(*due - BootClock::now()).count();
        const int nLeft = static_cast<int>(std::clamp<int64_t>(left, 1, INT32_MAX));
        result.nNextSeconds = result.nNextSeconds == 0 ? nLeft : std::min(result.nNextSeconds, nLeft);
    }
    return result;
}

std::string UpnpMapper::ResultText(const OutcomeList& rgOutcomes) const {
    std::string szText;
    for (const Outcome& outcome : rgOutcomes) {
        szText += outcome.szName + (outcome.blLeftOver ? " (left over)=" : "=") + outcome.verdict.szWord + "\n";
    }
    return szText;
}

std::string UpnpMapper::Outside(const std::function<bool()>& fnStop) {
    std::string szAddress;
    if (mPIgd != nullptr) {
        mPIgd->SetStop(fnStop);
        mPIgd->SetCallLimit(kOutsideMilliseconds);
        mPIgd->ExternalAddress(szAddress);
        mPIgd->SetCallLimit(kRequestMilliseconds);
    }
    return szAddress;
}

}  // namespace tavo
