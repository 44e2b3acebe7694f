// Compares what the router shows with what is wanted, deletes and adds. Relies on a Session.
// Promises: see Forwarder.h.
#include "programs/tavoportforward/Forwarder.h"

#include <strings.h>

#include <algorithm>
#include <charconv>

#include "ground/Marks.h"
#include "ground/TextFile.h"
#include "programs/common/Wanted.h"

namespace tavo {

namespace {

constexpr size_t kMaxDeletions = 256;  // of one run; each costs a listing
constexpr size_t kMaxHolderText = 64;

uint16_t Port(const Captures& captures, const char* szName, uint16_t nDefault) {
    const auto it = captures.find(szName);
    uint16_t nPort = 0;
    if (it != captures.end()) {
        std::from_chars(it->second.data(), it->second.data() + it->second.size(), nPort);
    }
    return nPort != 0 ? nPort : nDefault;
}

std::string Text(const Captures& captures, const char* szName) {
    const auto it = captures.find(szName);
    return it == captures.end() ? "" : it->second;
}

}  // namespace

std::vector<Refusal> Forwarder::Run(const std::vector<Job>& rgWanted) {
    const StepResult login = mSession.Perform(kStepLogin);
    if (login.blDone) {
        Apply(rgWanted);
        mSession.Perform(kStepLogout);  // a router that does not let go of a session ends it by itself
        return mRgRefusals;
    }
    RefuseAll(rgWanted, login);
    for (const MadeJob& made : mMade.Here()) {
        if (std::none_of(rgWanted.begin(), rgWanted.end(), [&](const Job& job) { return made.job.IsSame(job); })) {
            RefuseRemoval(made.job, login);
        }
    }
    return mRgRefusals;
}

void Forwarder::Apply(const std::vector<Job>& rgWanted) {
    StepResult list;
    mBlListed = mOperations.Has(kStepList);
    if (mBlListed && !List(list)) {
        RefuseRun("list of forwards", list);
        RefuseAll(rgWanted, list);
        return;
    }
    if (mBlListed) {
        ForgetLost();
        RemoveUnwanted(rgWanted);
    } else {
        RemoveAllMade();
    }
    AddMissing(rgWanted);
    if (!mBlChanged) {
        return;
    }
    const StepResult apply = mSession.Perform(kStepApply);
    for (const Job& job : rgWanted) {
        if (!apply.blDone && !IsRefused(job.Text())) {
            Refuse(job, apply);
        }
    }
    if (!apply.blDone && rgWanted.empty()) {
        RefuseRun("earlier forwards", apply);
    }
    if (mBlListed) {
        Verify(rgWanted);
    }
}

bool Forwarder::List(StepResult& list) {
    list = mSession.Perform(kStepList);
    mRgEntries.clear();
    for (const Captures& captures : list.rgEntries) {
        mRgEntries.push_back(ReadEntry(captures));
    }
    return list.blDone;
}

Forwarder::Entry Forwarder::ReadEntry(const Captures& captures) const {
    Entry entry;
    const std::string szWord = Text(captures, "protocol");
    for (const char* szProtocol : {"tcp", "udp", "both"}) {
        if (strcasecmp(szWord.c_str(), Word(szProtocol).c_str()) == 0) {
            entry.job.szProtocol = szProtocol;
        }
    }
    entry.job.nRouterFirst = Port(captures, "router_first", 0);
    entry.job.nRouterLast = std::max(entry.job.nRouterFirst, Port(captures, "router_last", 0));
    entry.job.nBoxFirst = Port(captures, "box_first", entry.job.nRouterFirst);
    entry.job.szName = PrintableText(Text(captures, "name"), mOperations.nNameLength);
    entry.szClient = Text(captures, "box");
    entry.blNamed = captures.contains("name");
    entry.rgCaptures = captures;
    return entry;
}

// By our mark and our address; what is on record as ours, also after the box moved to another address.
bool Forwarder::IsOwn(const Entry& entry) const {
    const bool blMarked = entry.blNamed && entry.job.szName.starts_with(mOperations.szPrefix);
    return (blMarked && entry.szClient == mSzBox) ||
           ((blMarked || !entry.blNamed) && mMade.Holds(entry.job, entry.szClient));
}

bool Forwarder::Serves(const Entry& entry, const Job& job) const {
    return entry.job.IsSame(job) && (entry.szClient.empty() ? IsOwn(entry) : entry.szClient == mSzBox);
}

// What the router lost since, or never had, is nothing of ours any more: another host may take its place.
void Forwarder::ForgetLost() {
    for (const MadeJob& made : mMade.Here()) {
        if (std::none_of(mRgEntries.begin(), mRgEntries.end(),
                         [&](const Entry& entry) { return entry.job.HasSamePlace(made.job); })) {
            mMade.Remove(made.job);
        }
    }
}

// One after the other with a new listing between: on many routers a deletion renumbers the entries.
void Forwarder::RemoveUnwanted(const std::vector<Job>& rgWanted) {
    StepResult list;
    for (size_t i = 0; i < kMaxDeletions; ++i) {
        const auto it = std::find_if(mRgEntries.begin(), mRgEntries.end(), [&](const Entry& entry) {
            const bool blWanted =
                std::any_of(rgWanted.begin(), rgWanted.end(), [&](const Job& job) { return Serves(entry, job); });
            return IsOwn(entry) && !blWanted && !IsRefused("removal of " + entry.job.Text());
        });
        if (it == mRgEntries.end()) {
            return;
        }
        const Entry entry = *it;
        Delete(entry.job, entry.rgCaptures);
        if (!List(list)) {
            RefuseRun("list of forwards", list);
            return;
        }
    }
}

// A router that shows nothing: what was made is made anew, so that what is said of it is true now.
void Forwarder::RemoveAllMade() {
    for (const MadeJob& made : mMade.Here()) {
        Delete(made.job, {});
    }
}

bool Forwarder::Delete(const Job& job, const Captures& captures) {
    const bool blRange = job.IsRange() && mOperations.Has(kStepDeleteRange);
    Values values = JobValues(job);
    for (const auto& [szName, szValue] : captures) {
        values.insert_or_assign(szName, szValue);  // the router's own words for its entry
    }
    const StepResult result = mSession.Perform(blRange ? kStepDeleteRange : kStepDeletePort, values);
    if (!result.blDone) {
        RefuseRemoval(job, result);
        return false;
    }
    mBlChanged = true;
    mMade.Remove(job);
    return true;
}

void Forwarder::AddMissing(const std::vector<Job>& rgWanted) {
    for (const Job& job : rgWanted) {
        const auto fnServes = [&](const Entry& entry) { return Serves(entry, job); };
        const auto fnClashes = [&](const Entry& entry) { return entry.job.Clashes(job); };
        if (std::any_of(mRgEntries.begin(), mRgEntries.end(), fnServes)) {
            continue;
        }
        const auto clash = std::find_if(mRgEntries.begin(), mRgEntries.end(), fnClashes);
        if (clash != mRgEntries.end()) {
            RefuseOwn(job, "the router already forwards this port for something else");
            mRgRefusals.back().holder =
                Holder{HarmlessText(clash->szClient, kMaxHolderText), HarmlessText(clash->job.szName, kMaxHolderText)};
            continue;
        }
        Add(job);
    }
}

void Forwarder::Add(const Job& job) {
    // Without a record a router that shows no names could not be cleared of it again. One that was on record
    // before stays so whatever the router says: its deletion may have failed.
    const bool blKnown = mMade.Holds(job, "");
    if (!mMade.Add(job)) {
        RefuseOwn(job, "the record of what was made cannot be written");
        return;
    }
    const StepResult result = mSession.Perform(job.IsRange() ? kStepAddRange : kStepAddPort, JobValues(job));
    if (result.blDone) {
        mBlChanged = true;
        return;
    }
    Refuse(job, result);
    if (result.blAnswered && !blKnown) {
        mMade.Remove(job);
    }
}

// A router's yes is not enough. A forward that could not be added or deleted has been named already.
void Forwarder::Verify(const std::vector<Job>& rgWanted) {
    StepResult list;
    if (!List(list)) {
        RefuseRun("list of forwards", list);
        return;
    }
    for (const Job& job : rgWanted) {
        const bool blThere =
            std::any_of(mRgEntries.begin(), mRgEntries.end(), [&](const Entry& entry) { return Serves(entry, job); });
        if (!blThere && !IsRefused(job.Text())) {
            RefuseOwn(job, "the router said yes but does not list it");
        }
    }
}

Values Forwarder::JobValues(const Job& job) const {
    const std::string szRest =
        job.szName.starts_with(kOwnPrefix) ? job.szName.substr(sizeof(kOwnPrefix) - 1) : job.szName;
    return {{"protocol", Word(job.szProtocol)},
            {"router_first", std::to_string(job.nRouterFirst)},
            {"router_last", std::to_string(job.nRouterLast)},
            {"box_first", std::to_string(job.nBoxFirst)},
            {"box_last", std::to_string(job.BoxLast())},
            {"name", (mOperations.szPrefix + szRest).substr(0, mOperations.nNameLength)}};
}

std::string Forwarder::Word(const std::string& szProtocol) const {
    return szProtocol == "tcp" ? mOperations.szTcp : (szProtocol == "udp" ? mOperations.szUdp : mOperations.szBoth);
}

void Forwarder::Refuse(const Job& job, const StepResult& result) {
    mRgRefusals.push_back({job.Text(), result.szWhy, job, RefusalKind::kForward, result.enEnd == WebEnd::kAnswered});
}

// Before anything was changed: what an earlier run made may be there still.
void Forwarder::RefuseAll(const std::vector<Job>& rgWanted, const StepResult& result) {
    const std::vector<MadeJob> rgMade = mMade.Here();
    for (const Job& job : rgWanted) {
        Refuse(job, result);
        if (std::any_of(rgMade.begin(), rgMade.end(), [&](const MadeJob& made) { return made.job.IsSame(job); })) {
            mRgRefusals.back().blAnswered = false;
        }
    }
}

void Forwarder::RefuseRemoval(const Job& job, const StepResult& result) {
    mRgRefusals.push_back(
        {"removal of " + job.Text(), result.szWhy, job, RefusalKind::kRemoval, result.enEnd == WebEnd::kAnswered});
}

void Forwarder::RefuseRun(const char* szWhat, const StepResult& result) {
    mRgRefusals.push_back({szWhat, result.szWhy, {}, RefusalKind::kRun, result.enEnd == WebEnd::kAnswered});
}

void Forwarder::RefuseOwn(const Job& job, const char* szWhy) {
    mRgRefusals.push_back({job.Text(), szWhy, job});
}

bool Forwarder::IsRefused(const std::string& szWhat) const {
    return std::any_of(mRgRefusals.begin(), mRgRefusals.end(),
                       [&](const Refusal& refusal) { return refusal.szWhat == szWhat; });
}

}  // namespace tavo
