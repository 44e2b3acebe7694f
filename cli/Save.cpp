// "save": the rules with their edits into the router. Relies on SaveRules and on the draft. Promises: the rules are
// read and written under one hold of the lock, so that none added meanwhile is lost; edits that did not come into
// force stay a draft.
#include <fmt/format.h>

#include "Box.h"
#include "Commands.h"
#include "DryRun.h"
#include "RuleStore.h"
#include "SaveRules.h"

namespace tavo::cli {

namespace {

Reply Save(bool blJson) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    const Lock lock;
    if (!lock.IsHeld()) {
        Reply reply = Busy();
        reply.jsAnswer["status"] = 2;
        return reply;
    }
    const auto rules = LoadDraft();
    if (!rules) {
        return Unreadable();
    }
    const bool blDraft = HasDraft();
    if (IsOff()) {
        return {
            .enExit = kFailed,
            .szMessage = fmt::format("every port is switched off, and nothing was saved{}; 'sudo tavoportmap on' opens "
                                     "them again",
                                     blDraft ? " (the edits stay noted)" : "")};
    }
    Reply reply = SaveRules(*rules, blJson);
    const bool blStored = AreStored(*rules);
    if (blStored) {
        DropDraft();
        DropOff();  // of ports that somebody has opened in another way
    } else if (blDraft && reply.enExit != kOk) {
        reply.szMessage += "\nThe edits stay noted: 'sudo tavoportmap rules list' shows them";
    }
    return reply;
}

Reply DryRun() {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    const auto inForce = LoadRules();
    const auto rules = LoadDraft();
    return inForce && rules ? DryRunOf(*inForce, *rules) : Unreadable();
}

}  // namespace

void OfferSave(CLI::App& app, Request& request) {
    const auto pDry = std::make_shared<bool>(false);
    CLI::App* pSave = AddCommand(app, "save", "write the rules to the router and wait for its answer");
    pSave->add_flag("--dry-run", *pDry, "only show, port by port, what that would do");
    pSave->footer(
        "The rules become the router's whole set of ours: what the rules no longer ask for is taken away, mappings of "
        "other devices stay. It can take minutes on a slow router; Ctrl-C ends the waiting, not the save.\n");
    pSave->callback(
        [pDry, &request] { request.fnCommand = [pDry, &request] { return *pDry ? DryRun() : Save(request.blJson); }; });
}

}  // namespace tavo::cli
