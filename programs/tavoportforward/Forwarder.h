// Brings a manual router's forwards in line with the jobs, through its web pages: login, the mapping core, logout, and
// what came of it in words.
#pragma once

#include <string>
#include <vector>

#include "programs/common/MadeFile.h"
#include "programs/tavoportforward/Jobs.h"
#include "programs/tavoportforward/PagesRouter.h"
#include "programs/tavoportforward/Session.h"

namespace tavo {

class Forwarder {
public:
    Forwarder(Session& session, const Operations& operations, MadeFile& made, std::string szBox)
        : mSession(session), mMade(made), mSzBox(std::move(szBox)), mRouter(session, operations) {}

    // Login to logout. What is not as it should be afterwards, with the reasons; empty: all is in place.
    std::vector<Refusal> Run(const std::string& szGateway, const std::vector<Job>& rgWanted,
                             const Others& mapOthers = {});

private:
    void Bring(const std::vector<Job>& rgWanted, const Others& mapOthers);
    void Refuse(const Outcome& outcome, const Job& job, RefusalKind enKind);
    void RefuseAll(const std::vector<Job>& rgWanted, const StepResult& result);
    void RefuseRun(const char* szWhat, const StepResult& result);

    Session& mSession;
    MadeFile& mMade;
    std::string mSzBox;
    PagesRouter mRouter;
    std::vector<Refusal> mRgRefusals;
};

}  // namespace tavo
