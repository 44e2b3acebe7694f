// See PagesRouter.h.
#include "programs/tavoportforward/PagesRouter.h"

#include <strings.h>

#include <algorithm>
#include <charconv>

#include "ground/Marks.h"
#include "ground/TextFile.h"
#include "mapping/Outcome.h"
#include "programs/tavoportforward/Jobs.h"

namespace tavo {

namespace {

constexpr int kMaxDeletions = 256;  // of one run; each costs a listing
constexpr size_t kMaxClient = 64;

std::string Text(const Captures& captures, const char* szName) {
    const auto it = captures.find(szName);
    return it == captures.end() ? "" : it->second;
}

uint16_t Port(const Captures& captures, const char* szName, uint16_t nDefault) {
    const std::string szText = Text(captures, szName);
    uint16_t nPort = 0;
    std::from_chars(szText.data(), szText.data() + szText.size(), nPort);
    return nPort != 0 ? nPort : nDefault;
}

}  // namespace

RouterReply ReplyOf(const StepResult& result) {
    const Reply enReply = result.enEnd == WebEnd::kAnswered      ? Reply::kRefused
                          : result.enEnd == WebEnd::kTimeout     ? Reply::kTimeout
                          : result.enEnd == WebEnd::kUnreachable ? Reply::kUnreachable
                                                                 : Reply::kGarbage;
    return result.blDone ? RouterReply{} : RouterReply{enReply, result.szWhy};
}

Abilities PagesRouter::What() const {
    return {.blShows = mOperations.Has(kStepList),
            .szConflict = "the router already forwards this port for something else",
            .blForm = true};
}

// A page that refuses to show the list, or is not the one that we know, says nothing of what is there.
RouterReply PagesRouter::Read() {
    if (std::exchange(mBlStale, false)) {
        mListing = mSession.Perform(kStepList);
        mRgEntries.clear();
        for (const Captures& captures : mListing.rgEntries) {
            mRgEntries.push_back(EntryOf(captures));
        }
    }
    RouterReply reply = ReplyOf(mListing);
    return reply.IsRefusal() ? RouterReply{Reply::kGarbage, reply.szWord} : reply;
}

RouterReply PagesRouter::List(std::vector<RouterMapping>& rgMappings) {
    RouterReply reply = Read();
    for (const Entry& entry : mRgEntries) {
        rgMappings.push_back(entry.mapping);
    }
    return reply;
}

RouterReply PagesRouter::Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) {
    const MappingKey key{szProtocol, nRouterPort};
    const RouterReply reply = Read();
    const auto it = std::find_if(mRgEntries.rbegin(), mRgEntries.rend(),
                                 [&](const Entry& entry) { return KeyOf(entry.mapping) == key; });
    if (!reply.IsOk() || (it == mRgEntries.rend() && !mMapInTheWay.contains(key))) {
        return reply.IsOk() ? RouterReply{Reply::kNoSuchEntry, "not listed"} : reply;
    }
    mapping = it != mRgEntries.rend() ? it->mapping : mMapInTheWay.at(key);
    return {};
}

// What else was added since the list was read clashes with nothing that is wanted.
RouterReply PagesRouter::Add(RouterMapping& mapping) {
    if (!mListing.blDone) {
        return Read();
    }
    mMapInTheWay.erase(KeyOf(mapping));
    for (const Entry& entry : mRgEntries) {
        if (Clash(entry.mapping, mapping)) {
            mMapInTheWay[KeyOf(mapping)] = entry.mapping;
            return {Reply::kConflict, What().szConflict};
        }
    }
    const StepResult result = mSession.Perform(mapping.nMore != 0 ? kStepAddRange : kStepAddPort, ValuesOf(mapping));
    mBlStale = true;
    mBlChanged = mBlChanged || result.blDone;
    return ReplyOf(result);
}

// On many routers a deletion renumbers the entries: the list is read anew after each.
RouterReply PagesRouter::Remove(const RouterMapping& mapping) {
    if (RouterReply reply = Read(); !reply.IsOk()) {
        return reply;
    }
    Values values = ValuesOf(mapping);
    if (What().blShows) {
        const auto it = std::find_if(mRgEntries.begin(), mRgEntries.end(), [&](const Entry& entry) {
            return IsSame(entry.mapping, mapping) &&
                   (entry.mapping.szClient.empty() || entry.mapping.szClient == mapping.szClient);
        });
        if (it == mRgEntries.end()) {
            return {Reply::kNoSuchEntry, "not listed"};
        }
        for (const auto& [szName, szValue] : it->rgCaptures) {
            values.insert_or_assign(szName, szValue);  // the router's own words for its entry
        }
    }
    if (mNDeletions++ >= kMaxDeletions) {
        return {Reply::kRefused, "one run deletes no more than " + std::to_string(kMaxDeletions)};
    }
    const bool blRange = mapping.nMore != 0 && mOperations.Has(kStepDeleteRange);
    const StepResult result = mSession.Perform(blRange ? kStepDeleteRange : kStepDeletePort, values);
    mBlStale = true;
    mBlChanged = mBlChanged || result.blDone;
    Read();
    return result.blDone && result.blWasGone && !What().blShows ? RouterReply{Reply::kNoSuchEntry, "gone"}
                                                                : ReplyOf(result);
}

RouterReply PagesRouter::Apply() {
    if (std::exchange(mBlChanged, false)) {
        mApplying = mSession.Perform(kStepApply);
        mBlStale = true;
    }
    return ReplyOf(mApplying);
}

PagesRouter::Entry PagesRouter::EntryOf(const Captures& captures) const {
    Entry entry{{}, captures};
    RouterMapping& mapping = entry.mapping;
    for (const char* szProtocol : {"TCP", "UDP", "BOTH"}) {
        if (strcasecmp(Text(captures, "protocol").c_str(), Word(szProtocol).c_str()) == 0) {
            mapping.szProtocol = szProtocol;
        }
    }
    mapping.nRouterPort = Port(captures, "router_first", 0);
    mapping.nMore =
        static_cast<uint16_t>(std::max(mapping.nRouterPort, Port(captures, "router_last", 0)) - mapping.nRouterPort);
    mapping.nBoxPort = Port(captures, "box_first", mapping.nRouterPort);
    mapping.szClient = HarmlessText(Text(captures, "box"), kMaxClient);
    mapping.szDescription = PrintableText(Text(captures, "name"), mOperations.nNameLength);
    if (mapping.szDescription.starts_with(mOperations.szPrefix)) {
        mapping.szDescription.replace(0, mOperations.szPrefix.size(), kOwnPrefix);
    }
    return entry;
}

Values PagesRouter::ValuesOf(const RouterMapping& mapping) const {
    const std::string& szText = mapping.szDescription;
    const std::string szName =
        mOperations.szPrefix + szText.substr(szText.starts_with(kOwnPrefix) ? sizeof(kOwnPrefix) - 1 : 0);
    return {{"protocol", Word(mapping.szProtocol)},
            {"router_first", std::to_string(mapping.nRouterPort)},
            {"router_last", std::to_string(mapping.nRouterPort + mapping.nMore)},
            {"box_first", std::to_string(mapping.nBoxPort)},
            {"box_last", std::to_string(mapping.nBoxPort + mapping.nMore)},
            {"name", szName.substr(0, mOperations.nNameLength)}};
}

const std::string& PagesRouter::Word(const std::string& szProtocol) const {
    return szProtocol == "TCP" ? mOperations.szTcp : szProtocol == "UDP" ? mOperations.szUdp : mOperations.szBoth;
}

}  // namespace tavo
