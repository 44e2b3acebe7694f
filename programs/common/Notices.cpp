// Compares what is remembered with what is known now. Relies on nothing. Promises: see Notices.h.
#include "programs/common/Notices.h"

#include <algorithm>
#include <set>
#include <utility>

namespace tavo {

namespace {

constexpr int kPassesToGone = 2;  // a router may be slow once
constexpr size_t kMostTold = 4;   // times a subject is told of within kTellingTime
constexpr time_t kTellingTime = 3600;
constexpr size_t kMostSingly = 8;    // ports with one and the same fate that are told of one by one
constexpr size_t kMostListed = 512;  // bytes of a list of ports
constexpr char kOften[] = " (it changes often, and is not told again for a while)";
constexpr char kRouter[] = "router";
constexpr char kReplaced[] = "replaced";
constexpr char kOutside[] = "outside";
constexpr char kRenewed[] = "renewed";

bool IsLost(RouterState enRouter) {
    return enRouter != RouterState::kNotAsked && enRouter != RouterState::kOk && enRouter != RouterState::kBusy;
}

std::string NameOf(const Outcome& outcome) {
    return outcome.szName + (outcome.szRule.empty() ? "" : " (" + outcome.szRule + ")");
}

// Whose doing it is, as part of a sentence.
std::string Reason(const Outcome& outcome) {
    std::string szText = WhyOf(outcome.verdict);
    if (outcome.verdict.holder) {
        const Holder& holder = *outcome.verdict.holder;
        szText += ", " + holder.szAddress + (holder.szDescription.empty() ? "" : " (" + holder.szDescription + ")");
    }
    return szText;
}

std::string ListOf(const OutcomeList& rgPorts) {
    std::string szText;
    for (size_t i = 0; i < rgPorts.size(); ++i) {
        if (szText.size() > kMostListed) {
            return szText + " and " + std::to_string(rgPorts.size() - i) + " more";
        }
        szText += (i == 0 ? "" : ", ") + NameOf(rgPorts[i]);
    }
    return szText;
}

class Comparison {
public:
    Comparison(Told& told, const Published& now, bool blRequested)
        : mTold(told), mNow(now), mBlRequested(blRequested), mBlOk(now.enRouter == RouterState::kOk) {}

    std::vector<Notice> Run() {
        ForgetOldTimes();
        if (mBlOk) {
            LookForAnother();
        }
        LookAtRouter();
        LookAtOutside();
        ForgetOldPorts();
        for (const Outcome& outcome : mNow.rgOutcomes) {
            if (!outcome.blLeftOver) {
                LookAtPort(outcome);
            }
        }
        TellPorts();
        mTold.enRouter = mNow.enRouter;
        mTold.nRouterSince = mNow.nRouterSince;
        mTold.blWithdrawn = mTold.blWithdrawn && !mBlOk;
        return std::move(mRgNotices);
    }

private:
    void ForgetOldTimes();
    bool Tell(const std::string& szSubject, Change enChange, std::string szText);
    void LookForAnother();
    void LookAtRouter();
    void LookAtOutside();
    void ForgetOldPorts();
    void LookAtPort(const Outcome& outcome);
    Told::Word NewsOf(const Told::Port& before, const Outcome& outcome);
    void TellPorts();

    Told& mTold;
    const Published& mNow;
    bool mBlRequested;
    bool mBlOk;
    std::vector<Notice> mRgNotices;
    std::map<Change, OutcomeList> mMapPorts;  // what is to be told of ports
};

void Comparison::ForgetOldTimes() {
    for (auto& [szSubject, rgTimes] : mTold.mapTimes) {
        std::erase_if(rgTimes, [this](time_t n) { return n <= mNow.nAt - kTellingTime || n > mNow.nAt; });
    }
    std::erase_if(mTold.mapTimes, [](const auto& row) { return row.second.empty(); });
}

// False: this has been told of too often. Then what was told before stays what was told, so that a later pass
// tells of what is left of the change.
bool Comparison::Tell(const std::string& szSubject, Change enChange, std::string szText) {
    std::vector<time_t>& rgTimes = mTold.mapTimes[szSubject];
    if (rgTimes.size() >= kMostTold) {
        return false;
    }
    rgTimes.push_back(mNow.nAt);
    mRgNotices.push_back({enChange, std::move(szText) + (rgTimes.size() == kMostTold ? kOften : "")});
    return true;
}

// A router that answers may be another one than that which answered before.
void Comparison::LookForAnother() {
    const bool blAddress = !mTold.szGateway.empty() && mTold.szGateway != mNow.szGateway;
    const bool blDevice = !mTold.szHardware.empty() && !mNow.szHardware.empty() && mTold.szHardware != mNow.szHardware;
    const std::string szText = blAddress
                                   ? "its address is " + mNow.szGateway + ", before " + mTold.szGateway
                                   : "another device answers at " + mNow.szGateway + ", with the hardware address " +
                                         mNow.szHardware + ", before " + mTold.szHardware;
    if ((blAddress || blDevice) && !Tell(kReplaced, Change::kRouterReplaced, szText)) {
        return;
    }
    mTold.szGateway = mNow.szGateway;
    mTold.szHardware = mNow.szHardware.empty() && !blAddress ? mTold.szHardware : mNow.szHardware;
}

void Comparison::LookAtRouter() {
    if (mBlOk) {
        mTold.nFailing = 0;
        if (mTold.blGone && Tell(kRouter, Change::kRouterBack, mNow.szGateway + " answers by " + mNow.szProtocol)) {
            mTold.blGone = false;
        }
    } else if (IsLost(mNow.enRouter)) {
        mTold.nFailing = std::min(mTold.nFailing + 1, kPassesToGone);
        const std::string szWhere = mNow.szGateway.empty() ? "" : mNow.szGateway + ": ";
        if (!mTold.blGone && mTold.nFailing >= kPassesToGone &&
            Tell(kRouter, Change::kRouterGone, szWhere + mNow.szRouterWhy)) {
            mTold.blGone = true;
        }
    }
}

// A router that has no outside address for a while, and then the same again, is no news.
void Comparison::LookAtOutside() {
    if (mNow.szOutside.empty() || mNow.szOutside == mTold.szOutside) {
        return;
    }
    if (!mTold.szOutside.empty()) {
        if (!Tell(kOutside, Change::kAddressChanged, mNow.szOutside + ", before " + mTold.szOutside)) {
            return;
        }
        mRgNotices.back().szOutsideBefore = mTold.szOutside;
    }
    mTold.szOutside = mNow.szOutside;
}

// What no rule asks for any more is no news when it is gone.
void Comparison::ForgetOldPorts() {
    std::set<std::string> setNames;
    for (const Outcome& outcome : mNow.rgOutcomes) {
        if (!outcome.blLeftOver) {
            setNames.insert(outcome.szName);
        }
    }
    if (mNow.blRulesReadable) {
        std::erase_if(mTold.mapPorts, [&](const auto& row) { return !setNames.contains(row.first); });
    }
}

void Comparison::LookAtPort(const Outcome& outcome) {
    Told::Port& port = mTold.mapPorts[outcome.szName];
    if (port.nBoxPort != outcome.nBoxPort) {
        port = {outcome.nBoxPort};
    }
    port.enTold = NewsOf(port, outcome);
    port.enSeen = outcome.verdict.enState;
    port.szWord = outcome.verdict.szWord;
    port.nSince = outcome.nSince;
}

// Notes what is to be told of a port; what its user knows then.
Told::Word Comparison::NewsOf(const Told::Port& before, const Outcome& outcome) {
    const bool blOpen = outcome.verdict.enState == PortState::kOpen;
    if (!blOpen && outcome.verdict.enState != PortState::kRefused) {
        return before.enTold;  // nobody knows what became of it
    }
    const bool blKnownBefore = before.nSince != 0;
    const Told::Word enNow = blOpen ? Told::Word::kOpen : Told::Word::kRefused;
    if (before.enTold == enNow) {
        if (blOpen && outcome.verdict.blAnew && !mTold.blWithdrawn && before.enSeen != PortState::kRefused) {
            mMapPorts[Change::kRenewed].push_back(outcome);
        }
        return enNow;
    }
    if (before.enTold == Told::Word::kNothing && (mBlRequested || (blOpen && !blKnownBefore))) {
        return enNow;  // as it was asked for, or as the save has said
    }
    const auto it = mTold.mapTimes.find(outcome.szName);
    if (it != mTold.mapTimes.end() && it->second.size() >= kMostTold) {
        return before.enTold;
    }
    mMapPorts[blOpen                                  ? Change::kPortBack
              : before.enTold == Told::Word::kNothing ? Change::kPortRefused
                                                      : Change::kPortLost]
        .push_back(outcome);
    return enNow;
}

void Comparison::TellPorts() {
    for (const auto& [enChange, rgPorts] : mMapPorts) {
        if (enChange == Change::kRenewed) {
            if (Tell(kRenewed, enChange, ListOf(rgPorts))) {
                mRgNotices.back().rgPorts = rgPorts;
            }
            continue;
        }
        const bool blSingly = rgPorts.size() <= kMostSingly;
        for (const Outcome& outcome : rgPorts) {
            const std::string szReason = Reason(outcome);
            if (!Tell(outcome.szName, enChange, NameOf(outcome) + (szReason.empty() ? "" : ": " + szReason))) {
                continue;
            }
            mRgNotices.back().rgPorts = {outcome};
            if (!blSingly) {
                mRgNotices.pop_back();
            }
        }
        if (!blSingly) {
            const std::string szReason = Reason(rgPorts.front());
            mRgNotices.push_back(
                {enChange, ListOf(rgPorts) + (szReason.empty() ? "" : "; the first: " + szReason), rgPorts});
        }
    }
}

}  // namespace

void NoteSince(const Told& told, Published& now) {
    const bool blSame = told.enRouter == now.enRouter && told.nRouterSince != 0 &&
                        (now.enRouter != RouterState::kOk || told.szGateway == now.szGateway);
    now.nRouterSince = blSame ? told.nRouterSince : now.nAt;
    for (Outcome& outcome : now.rgOutcomes) {
        const auto it = told.mapPorts.find(outcome.szName);
        const bool blSamePort = it != told.mapPorts.end() && it->second.nBoxPort == outcome.nBoxPort &&
                                it->second.enSeen == outcome.verdict.enState &&
                                it->second.szWord == outcome.verdict.szWord;
        outcome.nSince = blSamePort && !outcome.blLeftOver ? it->second.nSince : now.nAt;
    }
}

std::vector<Notice> Compare(Told& told, const Published& now, bool blRequested) {
    return Comparison(told, now, blRequested).Run();
}

}  // namespace tavo
