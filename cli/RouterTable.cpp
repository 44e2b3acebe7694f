// "router table": every mapping on the router, whoever made it. Relies on the seam's UPnP client and on what the
// daemons publish. Promises: changes nothing; where a router shows no table, says what can be seen instead.
#include "RouterTable.h"

#include <fmt/format.h>

#include "Situation.h"
#include "Table.h"

namespace tavo::cli {

namespace {

// "ours" for what a rule has, "this box" for what another of its programs has made; empty for other devices.
std::string OwnerWord(const Situation& situation, const LiveEntry& entry) {
    if (entry.szClient != situation.szBox) {
        return "";
    }
    const Published* pWord = situation.Word();
    for (const PublishedRule& rule : pWord != nullptr ? pWord->rgRules : std::vector<PublishedRule>()) {
        if (rule.enState == PortState::kOpen && rule.nRouterPort == entry.nRouterPort &&
            rule.szProtocol == entry.szProtocol && rule.nBoxPort == entry.nClientPort && rule.szWhy.empty()) {
            return "ours";
        }
    }
    return "this box";
}

std::string LeaseWords(const LiveEntry& entry) {
    constexpr unsigned kMinute = 60, kHour = 3600, kDay = 86400;
    const unsigned nLeft = entry.nLeaseSeconds;
    const std::string szLease = nLeft == 0          ? "for good"
                                : nLeft < kMinute   ? fmt::format("{} s left", nLeft)
                                : nLeft < 2 * kHour ? fmt::format("{} min left", nLeft / kMinute)
                                : nLeft < 2 * kDay  ? fmt::format("{} h left", nLeft / kHour)
                                                    : fmt::format("{} days left", nLeft / kDay);
    return entry.blEnabled ? szLease : "switched off, " + szLease;
}

Reply NoTable(const Situation& situation) {
    const std::string szPages = fmt::format("http://{}/", *situation.szGateway);
    if (situation.Keeper() == &situation.natpmpd) {
        return {
            .enExit = kFailed,
            .szMessage = fmt::format("this router is driven by NAT-PMP, which has no way to ask what it holds, and it "
                                     "does not answer by UPnP. 'tavoportmap status' shows what it granted to this "
                                     "box; what other devices hold stands in its own pages, mostly at {}",
                                     szPages)};
    }
    if (situation.IsByPages()) {
        return {
            .enExit = kFailed,
            .szMessage = fmt::format("this router is driven through its own pages, and does not answer by UPnP: its "
                                     "table stands there, mostly at {}. 'tavoportmap status' shows what was written",
                                     szPages)};
    }
    return {
        .enExit = kAway,
        .szMessage = fmt::format("no router answers by UPnP at {}; is it switched on in the router's settings, mostly "
                                 "at {}? 'sudo tavoportmap setup' looks for every way to it",
                                 *situation.szGateway, szPages)};
}

Reply RouterTable() {
    const Situation situation = LookAround(false);
    if (!situation.szGateway) {
        return NoGateway();
    }
    const auto live = ReadLiveTable();
    if (!live) {
        return NoTable(situation);
    }
    Reply reply;
    Table table({"port", "leads to", "", "lease", "description"});
    reply.jsAnswer["gateway"] = *situation.szGateway;
    reply.jsAnswer["box"] = situation.szBox;
    reply.jsAnswer["model"] = live->szModel;
    reply.jsAnswer["whole"] = live->blWhole;
    reply.jsAnswer["entries"] = Json::arrayValue;
    for (const LiveEntry& entry : live->rgEntries) {
        const std::string szOwner = OwnerWord(situation, entry);
        table.Add({entry.Name(), fmt::format("{}:{}", entry.szClient, entry.nClientPort), szOwner, LeaseWords(entry),
                   entry.szDescription});
        Json::Value js = ToJson(entry);
        js["ours"] = szOwner == "ours";
        js["this_box"] = !szOwner.empty();
        reply.jsAnswer["entries"].append(js);
    }
    reply.szBody = table.ToText();
    if (!live->blWhole) {
        reply.rgszWarnings.emplace_back("the router did not show its table to the end: there may be more than this");
    }
    reply.szMessage = live->rgEntries.empty() && live->blWhole ? "the router's table is empty" : "";
    return reply;
}

}  // namespace

void OfferRouterTable(CLI::App& router, Request& request) {
    CLI::App* pTable = AddCommand(router, "table", "every mapping on the router now, whoever made it (UPnP)");
    pTable->footer(
        "ours: a rule of this box has it. this box: another of its programs made it, or the daemon has not looked "
        "since. A NAT-PMP router and a router's own pages cannot be asked.\n");
    pTable->callback([&request] { request.fnCommand = &RouterTable; });
}

}  // namespace tavo::cli
