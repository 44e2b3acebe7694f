// See Forwarder.h.
#include "programs/tavoportforward/Forwarder.h"

#include "ground/BootClock.h"
#include "ground/net/Neighbour.h"
#include "mapping/Carry.h"

namespace tavo {

namespace {

// The core's own words, and the router's. Nobody but the next save goes on with what there was no time for.
std::string WhyNot(const Verdict& verdict) {
    return verdict.szWord == "timeout" ? "the time of one run was up; the next save goes on with it" : WhyOf(verdict);
}

std::vector<RouterMapping> MappingsOf(const std::vector<Job>& rgJobs) {
    std::vector<RouterMapping> rgMappings;
    rgMappings.reserve(rgJobs.size());
    for (const Job& job : rgJobs) {
        rgMappings.push_back(job.mapping);
    }
    return rgMappings;
}

}  // namespace

std::vector<Refusal> Forwarder::Run(const std::string& szGateway, const std::vector<Job>& rgWanted,
                                    const Others& mapOthers) {
    const StepResult login = mSession.Perform(kStepLogin);
    Record& record = mMade.Get();
    record.TurnTo({szGateway, HardwareAddress(szGateway)});
    record.Prune(BootSeconds());
    if (login.blDone) {
        Bring(rgWanted, mapOthers);
        mSession.Perform(kStepLogout);  // a router that does not let go of a session ends it by itself
        return mRgRefusals;
    }
    RefuseAll(rgWanted, login);
    return mRgRefusals;
}

void Forwarder::Bring(const std::vector<Job>& rgWanted, const Others& mapOthers) {
    std::vector<RouterMapping> rgListed;
    if (!mRouter.List(rgListed).IsOk()) {
        RefuseRun("list of forwards", mRouter.Listing());
        RefuseAll(rgWanted, mRouter.Listing());
        return;
    }
    Habits habit{.nLease = 0, .blPermanentOnly = true};
    Surroundings around = Around(
        mSzBox, [] { return false; }, mMade);
    around.mapOthers = mapOthers;
    const PassResult result = BringInLine(mRouter, MappingsOf(rgWanted), mMade.Get(), habit, around);
    for (size_t i = rgWanted.size(); i < result.rgOutcomes.size(); ++i) {  // what is left over
        Refuse(result.rgOutcomes[i], {}, RefusalKind::kRemoval);
    }
    for (size_t i = 0; i < rgWanted.size(); ++i) {
        if (result.rgOutcomes[i].verdict.enState != PortState::kOpen) {
            Refuse(result.rgOutcomes[i], rgWanted[i], RefusalKind::kForward);
        }
    }
    if (!mRouter.Applying().blDone && rgWanted.empty()) {
        RefuseRun("earlier forwards", mRouter.Applying());
    }
    if (!mRouter.Listing().blDone) {
        RefuseRun("list of forwards", mRouter.Listing());
    }
}

void Forwarder::Refuse(const Outcome& outcome, const Job& job, RefusalKind enKind) {
    const bool blAnswered = outcome.verdict.enState != PortState::kUnknown;
    mRgRefusals.push_back({outcome.szName, WhyNot(outcome.verdict), job, enKind, blAnswered, outcome.verdict.holder});
}

// Before anything was changed: what an earlier run made may be there still.
void Forwarder::RefuseAll(const std::vector<Job>& rgWanted, const StepResult& result) {
    const Record::Rows& rows = mMade.Get().Here();
    for (const Job& job : rgWanted) {
        const auto it = rows.find(KeyOf(job.mapping));
        const bool blMade = it != rows.end() && it->second.nBoxPort == job.mapping.nBoxPort;
        mRgRefusals.push_back({MappingName(job.mapping), result.szWhy, job, RefusalKind::kForward,
                               result.enEnd == WebEnd::kAnswered && !blMade});
    }
    for (const Outcome& left :
         LeftOnRecord(mMade.Get(), MappingsOf(rgWanted), mRouter.What(), ReplyOf(result), BootSeconds())) {
        Refuse(left, {}, RefusalKind::kRemoval);
    }
}

void Forwarder::RefuseRun(const char* szWhat, const StepResult& result) {
    mRgRefusals.push_back({szWhat, result.szWhy, {}, RefusalKind::kRun, result.enEnd == WebEnd::kAnswered});
}

}  // namespace tavo
