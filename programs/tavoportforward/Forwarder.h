// Brings a manual router's forwards in line with the jobs, through its web pages.
// Relies on a Session and on the record of what we made. Promises: forwards that we did not make are never
// touched; where the router can be listed, a forward counts as there only when the list shows it.
#pragma once

#include <string>
#include <vector>

#include "programs/tavoportforward/Jobs.h"
#include "programs/tavoportforward/Made.h"
#include "programs/tavoportforward/Operations.h"
#include "programs/tavoportforward/Session.h"

namespace tavo {

class Forwarder {
public:
    Forwarder(Session& session, const Operations& operations, MadeJobs& made, std::string szBox)
        : mSession(session), mOperations(operations), mMade(made), mSzBox(std::move(szBox)) {}

    // Login to logout. What is not as it should be afterwards, with the reasons; empty: all is in place.
    std::vector<Refusal> Run(const std::vector<Job>& rgWanted);

private:
    // An entry of the router's list.
    struct Entry {
        Job job;
        std::string szClient;  // empty: the list does not show it
        bool blNamed = false;  // the list shows names
        Captures rgCaptures;   // as the list gave it, for the deletion
    };

    void Apply(const std::vector<Job>& rgWanted);
    bool List(StepResult& list);
    Entry ReadEntry(const Captures& captures) const;
    bool IsOwn(const Entry& entry) const;
    bool Serves(const Entry& entry, const Job& job) const;
    void ForgetLost();
    void RemoveUnwanted(const std::vector<Job>& rgWanted);
    void RemoveAllMade();
    bool Delete(const Job& job, const Captures& captures);
    void AddMissing(const std::vector<Job>& rgWanted);
    void Add(const Job& job);
    void Verify(const std::vector<Job>& rgWanted);
    Values JobValues(const Job& job) const;
    std::string Word(const std::string& szProtocol) const;
    void Refuse(const Job& job, const StepResult& result);
    void RefuseAll(const std::vector<Job>& rgWanted, const StepResult& result);
    void RefuseRemoval(const Job& job, const StepResult& result);
    void RefuseRun(const char* szWhat, const StepResult& result);
    void RefuseOwn(const Job& job, const char* szWhy);
    bool IsRefused(const std::string& szWhat) const;

    Session& mSession;
    const Operations& mOperations;
    MadeJobs& mMade;
    std::string mSzBox;
    bool mBlListed = false;  // the router can be listed
    bool mBlChanged = false;
    std::vector<Entry> mRgEntries;
    std::vector<Refusal> mRgRefusals;
};

}  // namespace tavo
