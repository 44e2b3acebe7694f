// What a run came to, told to everybody who asks: the system log, the event log and /run/tavo/tavoportforward.json.
// Relies on the published state that the daemons share. Promises: each forward that is not in place is named with
// the reason.
#pragma once

#include <string>
#include <vector>

#include "mapping/Outcome.h"
#include "programs/tavoportforward/Jobs.h"

namespace tavo {

struct RunResult {
    std::string szGateway = {};
    std::string szBox = {};
    RouterState enRouter = RouterState::kNotAsked;
    std::string szRouterWhy = {};  // of what concerns the router as a whole
    bool blRulesReadable = true;
    std::vector<Job> rgWanted = {};  // what the router was asked for
    std::vector<Refusal> rgRefusals = {};
    bool blInUse = true;  // else the pages were to take away all that they forward, whatever the rules ask for
};

void Tell(const RunResult& result);
// What would be published of it.
std::string TextOf(const RunResult& result);
// The same for a run that could not try anything: of each rule nobody knows what the router does.
void TellNotTried(RunResult result, const std::string& szWhy);

}  // namespace tavo
