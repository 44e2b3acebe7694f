// The common mapping side of the daemons. Relies on Wanted, RouterTurn and the platform's addresses.
// Promises: see RuleMapper.h.
#include "programs/common/RuleMapper.h"

#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <utility>

#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "ground/net/Neighbour.h"
#include "tavo/core.h"
#include "tavo/net.h"
#include "tavo/runkeys.h"

namespace tavo {

namespace {

constexpr mode_t kResultMode = 0644;
constexpr int kRetrySeconds = 10;  // until a run key that could not be mended is tried again
constexpr int kWithdrawTries = 3;
constexpr auto kTurnLimit = std::chrono::seconds(60);     // the other daemon takes its mappings away meanwhile
constexpr auto kLastTurnLimit = std::chrono::seconds(5);  // at the end: the other daemon may be ending, too
constexpr auto kSilentLimit = std::chrono::seconds(10);   // at the end: the router has not answered for so long
constexpr size_t kAddressSize = 16;
constexpr int kPassesToOutside = 5;
constexpr char kNoAddress[] = "0.0.0.0";  // how a router says that it has none
constexpr char kNoLink[] = "the network cable is out, or the network is down";

int Setting(const char* szSection, const char* szKey, const char* szDefault, int nLeast, int nMost) {
    char szValue[16];
    TLIBPlatformSettingGet(szSection, szKey, szDefault, szValue, sizeof(szValue));
    return static_cast<int>(std::clamp<long>(std::strtol(szValue, nullptr, 10), nLeast, nMost));
}

// The gateway, the address that faces it, and whether the link is up: nothing else of the network concerns us, and a
// box with containers has much else.
std::string NetworkInSight() {
    char szGateway[kAddressSize] = {};
    char szBox[kAddressSize] = {};
    char szInterface[kAddressSize] = {};
    const bool blGateway = TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) == 0 &&
                           TAVONetLocalAddressGet(szGateway, szBox, sizeof(szBox), nullptr, 0) == 0;
    const bool blLink = checkGwIfEnable(szInterface, sizeof(szInterface)) == 0;
    return std::string(blGateway ? szGateway : "") + " " + (blGateway ? szBox : "") + (blLink ? " up" : " down");
}

}  // namespace

RuleMapper::RuleMapper(const DaemonNames& names) : mNames(names), mTold(names.szName) {
    ReadSettings();
}

void RuleMapper::ReadSettings() {
    mNCheckSeconds = Setting(mNames.szName, "check_interval", "120", 1, 3600);
    mNWishedLease = static_cast<uint32_t>(Setting(mNames.szName, "lease", "3600", 20, 604800));
}

// Whether the run key has come back: a save or a detection that was killed leaves it off.
bool RuleMapper::MendRunKeys() {
    const bool blWasOn = IsSwitchedOn();
    mBlMended = TAVORunKeysMend() == 0;
    return !blWasOn && IsSwitchedOn();
}

void RuleMapper::ReadRules() {
    unlink(mNames.szResultFile);  // what it says belongs to an older request
    WantedSet wanted = ReadWanted(mNames.szRunKey);
    if (wanted.blReadable) {
        mWanted = std::move(wanted);
        mBlRulesRead = true;
    } else {
        mWanted.blReadable = false;
        mWanted.blSwitchedOn = wanted.blSwitchedOn;
        SysLog(LOG_ERR, "the rule file cannot be read; the router's mappings stay as they are");
    }
}

// False: there is no gateway. A gateway or an own address that has changed makes all begin anew.
bool RuleMapper::FindGateway() {
    char szGateway[kAddressSize] = {};
    char szBox[kAddressSize] = {};
    const bool blFound = TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) == 0 &&
                         TAVONetLocalAddressGet(szGateway, szBox, sizeof(szBox), nullptr, 0) == 0;
    if (!blFound) {
        szGateway[0] = '\0';
    }
    if (mSzGateway != szGateway) {
        mSzHardware.clear();
    }
    if (mSzGateway != szGateway || mSzBox != szBox) {
        mSzGateway = szGateway;
        mSzBox = szBox;
        mNUntilOutside = 0;
        mSzOutside.clear();
        if (blFound) {
            mAnnouncements.Listen(mSzBox);
        }
        NewGateway();
    }
    return blFound;
}

// One that is switched off does not wait: it has its own taken away without the turn.
bool RuleMapper::TakeTurn(const std::function<bool()>& fnStop) {
    const auto end = BootClock::now() + kTurnLimit;
    return mTurn.Take([&] { return IsSwitchedOn() && !fnStop() && BootClock::now() < end; });
}

bool RuleMapper::OnNetworkChange() {
    std::string szNow = NetworkInSight();
    return std::exchange(mSzNetwork, szNow) != szNow;
}

RouterName RuleMapper::Front(const std::function<bool()>& fnStop) {
    std::string szHardware = HardwareAddress(mSzGateway);
    if (szHardware.empty() && IsNeighbourThere(mSzGateway, fnStop)) {
        szHardware = HardwareAddress(mSzGateway);
    }
    if (!szHardware.empty()) {
        mSzHardware = szHardware;
    }
    return {mSzGateway, mSzHardware};
}

PassResult RuleMapper::Failed(const std::vector<RouterMapping>& rgWanted, const char* szWord, RouterState enRouter) {
    const PortState enState = enRouter == RouterState::kBusy ? PortState::kWaiting : PortState::kUnknown;
    PassResult result;
    for (const RouterMapping& wanted : rgWanted) {
        result.rgOutcomes.push_back(OutcomeOf(wanted, {enState, szWord}));
    }
    result.transport = {Reply::kUnreachable, szWord};
    result.enRouter = enRouter;
    return result;
}

// What is ours goes also while the other daemon has the turn: it need not wait for a router that was away when the turn
// was ours, nor for us when we have crashed. But what the rules ask for is the other's by now, and may be one and the
// same mapping at the router: that one stays, on our record, for as long as a rule asks for it.
PassResult RuleMapper::TakeAwayBesides(const std::vector<RouterMapping>& rgOthers,
                                       const std::function<bool()>& fnStop) {
    for (const RouterMapping& other : rgOthers) {
        mMapOthers.emplace(KeyOf(other), other.nBoxPort);
    }
    PassResult result = Map({}, false, fnStop);
    mMapOthers.clear();
    return result;
}

PassResult RuleMapper::Pass(bool blRequested, const std::function<bool()>& fnStop) {
    if (!TakeTurn(fnStop)) {
        const bool blSwitchedOn = IsSwitchedOn();
        if (!blSwitchedOn && mWanted.rgOthers && FindGateway() && HasMade(fnStop)) {
            return TakeAwayBesides(*mWanted.rgOthers, fnStop);
        }
        PassResult result =
            Failed(mWanted.rgMappings, "busy", blSwitchedOn ? RouterState::kBusy : RouterState::kNotAsked);
        result.transport = {blSwitchedOn ? Reply::kTimeout : Reply::kOk};
        result.blStopped = fnStop();
        return result;
    }
    if (!mBlRulesRead) {
        return {};  // not knowing the rules is no reason to take anything away
    }
    if (!FindGateway()) {
        return Failed(mWanted.rgMappings, "nogateway", RouterState::kNoGateway);
    }
    return Map(mWanted.rgMappings, blRequested, fnStop);
}

int RuleMapper::Run(bool blRequested, const std::function<bool()>& fnStop) {
    blRequested = MendRunKeys() || blRequested;
    mSzNetwork = NetworkInSight();
    if (blRequested) {
        ReadSettings();
        ReadRules();
    }
    PassResult result = Pass(blRequested, fnStop);
    AddRules(result.rgOutcomes);
    if (!result.blStopped) {
        WriteResults(result.rgOutcomes);
        if (!IsSwitchedOn()) {
            mTurn.GiveBack();
        }
    }
    if (blRequested && !result.blStopped && mWanted.blSwitchedOn && !mSzGateway.empty()) {
        mPages.Clear({mSzGateway, mSzHardware});
    }
    const int nSeconds = SecondsToNext(result, blRequested);
    if (!result.blStopped) {
        PublishPass(std::move(result), blRequested, nSeconds, fnStop);
    }
    return nSeconds;
}

int RuleMapper::SecondsToNext(const PassResult& result, bool blRequested) {
    std::string szNow;
    for (const Outcome& outcome : result.rgOutcomes) {
        szNow += outcome.szName + "=" + outcome.verdict.szWord + (outcome.verdict.blAnew ? " anew\n" : "\n");
    }
    const bool blChange = std::exchange(mSzLast, std::move(szNow)) != mSzLast || blRequested;
    const NextLook next = mKeeper.After(result, blChange, mNCheckSeconds);
    if (next.blLost) {
        LostRouter();
    }
    return mBlMended ? next.nSeconds : std::min(next.nSeconds, kRetrySeconds);
}

// What the rules themselves say of the outcomes: whose they are, and what was not asked of the router at all.
void RuleMapper::AddRules(OutcomeList& rgOutcomes) const {
    for (size_t i = 0; i < std::min(rgOutcomes.size(), mWanted.rgszRules.size()); ++i) {
        rgOutcomes[i].szRule = mWanted.rgszRules[i];
    }
    rgOutcomes.insert(rgOutcomes.end(), mWanted.rgRefused.begin(), mWanted.rgRefused.end());
}

void RuleMapper::WriteResults(const OutcomeList& rgOutcomes) const {
    OutcomeList rgAll = rgOutcomes;
    if (!mWanted.blReadable) {
        rgAll.push_back({"rule.conf", {PortState::kUnknown, "unreadable"}});
    }
    const std::string szText = ResultText(rgAll);
    // A box that has nothing to do lets its disks sleep.
    if (ReadFile(mNames.szResultFile) != szText && !WriteFileAtomic(mNames.szResultFile, szText, kResultMode)) {
        SysLog(LOG_ERR, "cannot write %s", mNames.szResultFile);
    }
}

// Tells a router that is not there from one that does not do what it is asked for.
void RuleMapper::LookAtRouter(Published& state, const std::function<bool()>& fnStop) {
    const bool blLost = state.enRouter == RouterState::kNoService || state.enRouter == RouterState::kSilent;
    char szInterface[kAddressSize];
    const bool blLink = (!blLost && state.enRouter != RouterState::kNoGateway) ||
                        checkGwIfEnable(szInterface, sizeof(szInterface)) == 0;
    if (blLost && (!blLink || !IsNeighbourThere(mSzGateway, fnStop))) {
        state.enRouter = RouterState::kUnreachable;
    }
    state.szRouterWhy = blLink ? WhyOf(state.enRouter, mNames.szProtocol) : kNoLink;
    state.szHardware = HardwareAddress(mSzGateway);
}

// Every few passes, and as soon as the router is back.
void RuleMapper::AskOutside(const std::function<bool()>& fnStop) {
    if (--mNUntilOutside > 0) {
        return;
    }
    mNUntilOutside = kPassesToOutside;
    mSzOutside = Outside(fnStop);
    if (mSzOutside == kNoAddress) {
        mSzOutside.clear();
    }
}

void RuleMapper::PublishPass(PassResult result, bool blRequested, int nSecondsToNext,
                             const std::function<bool()>& fnStop) {
    Published state{mNames.szName, mNames.szProtocol};
    state.blSwitchedOn = IsSwitchedOn();
    state.blRulesReadable = mWanted.blReadable;
    state.szGateway = mSzGateway;
    state.szBox = mSzBox;
    state.enRouter = result.enRouter;
    state.rgOutcomes = std::move(result.rgOutcomes);
    LookAtRouter(state, fnStop);
    if (state.enRouter == RouterState::kOk) {
        AskOutside(fnStop);
    } else {
        mNUntilOutside = 0;
    }
    state.szOutside = mSzOutside;
    state.nAt = std::time(nullptr);
    state.nNextLook = state.nAt + nSecondsToNext;
    NoteSince(mTold.Get(), state);
    Publish(state);
    TellNews(state, blRequested);
}

void RuleMapper::TellNews(const Published& state, bool blRequested) {
    if (!mWanted.blSwitchedOn) {
        mTold.Get() = Told();         // whoever maps now tells what there is to tell
    } else if (state.blSwitchedOn) {  // a save switches it off for a moment
        for (const Notice& notice : Compare(mTold.Get(), state, blRequested)) {
            mTeller.Tell(notice, state);
        }
    }
    mTold.Save();
}

// Goes on for as long as the router answers, within the bound that fnEnd has.
bool RuleMapper::Withdraw(const std::function<bool()>& fnEnd) {
    Heard();
    const std::function<bool()> fnStop = [&] { return fnEnd() || BootClock::now() > mHeard + kSilentLimit; };
    Unpublish(mNames.szName);
    bool blTurn = mTurn.Take([] { return false; });
    if (!blTurn) {
        if (!FindGateway() || !HasMade(fnStop)) {
            return true;
        }
        const auto end = BootClock::now() + kLastTurnLimit;
        blTurn = mTurn.Take([&] { return !fnStop() && BootClock::now() < end; });
    }
    if (!blTurn && !mWanted.blSwitchedOn && !mWanted.rgOthers) {
        return false;  // nobody knows what is the other's
    }
    const std::vector<RouterMapping> rgOthers = mWanted.rgOthers.value_or(mWanted.rgMappings);
    Heard();  // what was waited for was not the router
    PassResult result;
    for (int i = 0; i < kWithdrawTries && !fnStop() && FindGateway(); ++i) {
        result = blTurn ? Map({}, false, fnStop) : TakeAwayBesides(rgOthers, fnStop);
        if (result.transport.IsOk() && result.rgOutcomes.empty()) {
            mTold.Get().blWithdrawn = true;
            mTold.Save();
            return true;
        }
    }
    PublishLeft(std::move(result));
    return false;
}

// The last word of a daemon that has ended, for whoever asks what is left.
void RuleMapper::PublishLeft(PassResult result) const {
    Published state{mNames.szName, mNames.szProtocol};
    state.szGateway = mSzGateway;
    state.szBox = mSzBox;
    state.enRouter = result.enRouter;
    state.szRouterWhy = WhyOf(state.enRouter, mNames.szProtocol);
    state.rgOutcomes = std::move(result.rgOutcomes);
    state.nAt = state.nNextLook = std::time(nullptr);
    Publish(state);
}

}  // namespace tavo
