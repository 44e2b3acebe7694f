// Keeps the gateway's NAT-PMP mappings in line with the rules. Relies on the mapping core.
// Promises: see NatpmpMapper.h.
#include "programs/natpmpd/NatpmpMapper.h"

#include <string_view>
#include <utility>

#include "ground/SysLog.h"
#include "programs/natpmpd/NatpmpRouter.h"

namespace tavo {

namespace {

// Of words that both daemons use, what they mean here.
constexpr std::pair<std::string_view, const char*> kCommonWords[] = {
    {"nogateway", "no gateway"}, {"busy", "upnpd has not taken its mappings away yet"}};

constexpr size_t kMostRouters = 16;  // whose clocks are kept
constexpr int kYoungAgain = 10;      // seconds until a gateway that has just started is asked once more
// Anybody on the network can say that the router has begun anew. Its clock is asked each time; that all is asked for
// again whatever the clock says, and put on record, happens once in this time.
constexpr auto kDoubtPause = std::chrono::minutes(10);

RouterState StateOf(Reply enReply) {
    switch (enReply) {
        case Reply::kOk:
            return RouterState::kOk;
        case Reply::kUnreachable:
            return RouterState::kNoService;
        default:
            return RouterState::kSilent;
    }
}

}  // namespace

constexpr DaemonNames kNatpmpNames{"natpmpd",
                                   "NAT-PMP",
                                   "runnatpmpportmapping",
                                   "/var/run/natpmpd.pid",
                                   "/var/run/natpmpd.lock",
                                   "/var/tmp/natpmp_portmap.remap",
                                   "/var/lib/tavo/natpmp_made.conf"};

NatpmpMapper::NatpmpMapper() : RuleMapper(kNatpmpNames), mMade(kNatpmpNames.szMadeFile) {}

// What was made here before is as doubtful as what was read from the file.
void NatpmpMapper::NewGateway() {
    mPEpoch = nullptr;
    mHabit.mapElsewhere.clear();
    mSzOutside.clear();
    mBlDoubtful = true;
}

bool NatpmpMapper::OnWake() {
    bool blRestart = RuleMapper::OnWake();
    if (blRestart && BootClock::now() >= mNextDoubt) {  // its clock may not show it
        mBlDoubtful = true;
        mNextDoubt = BootClock::now() + kDoubtPause;
    }
    for (const GatewayAnnouncement& said : mAnnounced.Take(Gateway())) {
        blRestart = blRestart || (mPEpoch != nullptr && mPEpoch->IsRestart(said.nEpoch, BootClock::now()));
    }
    return blRestart;
}

bool NatpmpMapper::HasMade(const std::function<bool()>& fnStop) {
    mMade.Get().TurnTo(Front(fnStop));
    return !LeftOnRecord(mMade.Get(), {}, {.blLeases = true}, {}, BootSeconds()).empty();
}

PassResult NatpmpMapper::Map(const std::vector<RouterMapping>& rgWanted, bool blRequested,
                             const std::function<bool()>& fnStop) {
    Record& record = mMade.Get();
    const RouterName name = Front(fnStop);
    record.TurnTo(name);
    if (mMapEpochs.size() >= kMostRouters) {
        mMapEpochs.clear();
    }
    mPEpoch = &mMapEpochs[name.szHardware.empty() ? name.szGateway : name.szHardware];
    record.Prune(BootSeconds(), true);
    if (rgWanted.empty() && record.Here().empty()) {
        mMade.Save();
        return {};
    }
    NatpmpRouter router(Gateway(), Box(), *mPEpoch, fnStop);
    router.AskAddress(mSzOutside);
    const bool blRestarted = mPEpoch->TakeRestart();
    if (blRestarted) {
        SysLog(LOG_NOTICE, "the router has restarted; every mapping is asked for again");
    }
    mHabit.nLease = WishedLease();
    // The gateway cannot be asked what it has: a request has every mapping asked for again.
    Forget(record, mHabit, Box(), blRestarted, blRequested || mBlDoubtful, BootSeconds());
    Surroundings around = Around(Box(), fnStop, mMade);
    around.mapOthers = Others();
    around.fnHeard = [this] { Heard(); };
    const auto fnPass = [&] { return BringInLine(router, rgWanted, record, mHabit, around); };
    PassResult result = fnPass();
    if (mPEpoch->TakeRestart()) {  // it restarted while we spoke
        record.Lose(Box());
        result = fnPass();
    }
    const bool blYoung = result.transport.IsOk() && mPEpoch->IsYoung();
    mBlDoubtful = !result.transport.IsOk() || blYoung;
    if (blYoung && !rgWanted.empty()) {
        result.nNextSeconds = kYoungAgain;
    }
    result.enRouter = StateOf(result.transport.enReply);
    return result;
}

// What is wrong, for a user: whatever stands here makes a save fail, so nothing does when all is well.
std::string NatpmpMapper::ResultText(const OutcomeList& rgOutcomes) const {
    std::string szText;
    for (const Outcome& outcome : rgOutcomes) {
        const std::string& szWord = outcome.verdict.szWord;
        if (szWord == "1") {
            continue;
        }
        const bool blOpen = outcome.blLeftOver && outcome.verdict.enState != PortState::kWaiting;
        std::string szShown = (blOpen ? "still open: " : "") + szWord;
        for (const auto& [szCommon, szHere] : kCommonWords) {
            szShown = szWord == szCommon ? szHere : szShown;
        }
        szText += (szText.empty() ? "" : ", ") + outcome.szName + " (" + szShown + ")";
    }
    return szText;
}

// Each pass has asked for it already.
std::string NatpmpMapper::Outside(const std::function<bool()>& /*fnStop*/) {
    return mSzOutside;
}

}  // namespace tavo
