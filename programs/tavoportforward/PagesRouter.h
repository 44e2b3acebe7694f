// A router that has pages and nothing else, as the mapping core sees a router: a form that shows its list, or nothing.
// Relies on a Session. Promises: what the list shows is never older than the last thing done to it; a router whose
// list cannot be read any more is asked for nothing more.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "mapping/Record.h"
#include "mapping/Router.h"
#include "programs/tavoportforward/Operations.h"
#include "programs/tavoportforward/Session.h"

namespace tavo {

// What a step came to, as an answer.
RouterReply ReplyOf(const StepResult& result);

class PagesRouter : public Router {
public:
    PagesRouter(Session& session, const Operations& operations) : mSession(session), mOperations(operations) {}

    Abilities What() const override;
    RouterReply List(std::vector<RouterMapping>& rgMappings) override;
    RouterReply Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) override;
    RouterReply Add(RouterMapping& mapping) override;
    RouterReply Remove(const RouterMapping& mapping) override;
    RouterReply Apply() override;

    // How the last listing, and the last applying of what was done, went.
    const StepResult& Listing() const { return mListing; }
    const StepResult& Applying() const { return mApplying; }

private:
    struct Entry {
        RouterMapping mapping;
        Captures rgCaptures;  // as the list gave it, for the deletion
    };

    RouterReply Read();
    Entry EntryOf(const Captures& captures) const;
    Values ValuesOf(const RouterMapping& mapping) const;
    const std::string& Word(const std::string& szProtocol) const;

    Session& mSession;
    const Operations& mOperations;
    bool mBlStale = true;  // the list is to be read anew
    bool mBlChanged = false;
    int mNDeletions = 0;
    std::vector<Entry> mRgEntries;
    std::map<MappingKey, RouterMapping> mMapInTheWay;  // of what was asked for and could not be made
    StepResult mListing{true};
    StepResult mApplying{true};
};

}  // namespace tavo
