// Performs the steps of an operations file against the router. Relies on WebClient and Operations.
// Promises: a step is done only when every request of it answered as the file says; the reason why it was
// not is a text for the user, without the password in it; a router that has fallen silent is asked no more.
#pragma once

#include <string>
#include <vector>

#include "programs/tavoportforward/Operations.h"
#include "programs/tavoportforward/WebClient.h"

namespace tavo {

struct StepResult {
    bool blDone = false;
    bool blAnswered = true;  // false: the router may or may not have done it
    bool blWasGone = false;  // a deletion that found nothing to delete
    std::string szWhy = {};  // of a step that was not done
    std::vector<Captures> rgEntries = {};
    WebEnd enEnd = WebEnd::kAnswered;  // of the request that failed
};

class Session {
public:
    Session(WebClient& client, const Operations& operations, Values values)
        : mClient(client), mOperations(operations), mValues(std::move(values)) {}

    // All requests of one step; done when the file has none of it. values join those of the session.
    StepResult Perform(const std::string& szStep, const Values& values = {});
    // How the last request that got no answer ended.
    WebEnd LastTrouble() const { return mEnTrouble; }

private:
    bool PerformOne(const Operation& operation, const Values& values, StepResult& result);
    bool Judge(const Operation& operation, const WebAnswer& answer, StepResult& result) const;
    bool Take(const Operation& operation, const WebAnswer& answer, StepResult& result);

    WebClient& mClient;
    const Operations& mOperations;
    int mNSilent = 0;  // requests in a row without an answer
    WebEnd mEnTrouble = WebEnd::kAnswered;
    Values mValues;  // account, addresses, and what earlier answers gave
};

}  // namespace tavo
