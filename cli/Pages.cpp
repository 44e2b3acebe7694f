// Asks the program that writes into a router's pages. Relies on Child. Promises: see Pages.h.
#include "Pages.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <ctime>
#include <filesystem>

#include "Box.h"
#include "Child.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr char kProgram[] = "/usr/tavo/bin/tavoportforward";
// Its other name, for what only reads: whoever asks what runs takes a process of the first one for a save.
constexpr char kReader[] = "/usr/tavo/bin/tavopages";
constexpr char kName[] = "tavoportforward";
// The second one is of an earlier version, and taken over by the program.
constexpr const char* kRecords[] = {"/var/lib/tavo/pages_made.conf", "/var/lib/tavo/manual_router.made"};
constexpr auto kLook = std::chrono::seconds(5);
constexpr auto kTakeAway = std::chrono::seconds(200);  // a run ends by itself before
constexpr size_t kMostBytes = 32 << 20;

// In the place of what nobody can tell now.
PublishedLeftOver Untold() {
    return {"what their record has", "",
            fmt::format("{} did not say what that is; is it there, and can it be run?", kReader), std::nullopt};
}

}  // namespace

bool HavePagesMade() {
    std::error_code error;
    for (const char* szRecord : kRecords) {
        const auto nSize = std::filesystem::file_size(szRecord, error);
        if (!error && nSize > 0) {
            return true;
        }
    }
    return false;
}

std::optional<Published> PagesWord(bool blInUse) {
    auto published = ReadPublished(kName);
    const auto szGateway = Gateway();
    const bool blCounts = published && szGateway && published->szGateway == *szGateway;
    return blCounts && published->blSwitchedOn == blInUse ? std::move(published) : std::nullopt;
}

std::optional<Published> LeftByPages() {
    if (geteuid() != 0) {
        return PagesWord(false);
    }
    if (!HavePagesMade()) {
        return std::nullopt;
    }
    auto left = PublishedIn(OutputOf({kReader, "--left"}, kLook, kMostBytes));
    if (!left) {
        left.emplace().rgLeftOver = {Untold()};
    }
    return left;
}

std::vector<PublishedLeftOver> TakeAwayByPages() {
    const time_t nStart = std::time(nullptr);
    OutputOf({kProgram, "--clear-unused"}, kTakeAway, kMostBytes, true);
    auto left = PagesWord(false);
    const bool blEnded = left && left->nAt >= nStart;
    if (!blEnded) {
        left = LeftByPages();
    }
    auto rgLeft = left ? std::move(left->rgLeftOver) : std::vector<PublishedLeftOver>();
    for (PublishedLeftOver& row : rgLeft) {
        row.szWhy = blEnded ? row.szWhy : fmt::format("{} could not be run, or did not come to its end", kProgram);
    }
    return rgLeft;
}

std::string NamesOf(const std::vector<PublishedLeftOver>& rgLeft) {
    std::vector<std::string> rgszNames;
    rgszNames.reserve(rgLeft.size());
    for (const PublishedLeftOver& left : rgLeft) {
        rgszNames.push_back(Clean(left.szName));
    }
    return fmt::format("{}", fmt::join(rgszNames, ", "));
}

void AddLeftByPages(const std::vector<PublishedLeftOver>& rgLeft, const Rules& rules, Reply& reply) {
    if (rgLeft.empty()) {
        return;
    }
    for (const PublishedLeftOver& left : rgLeft) {
        Json::Value js;
        js["name"] = left.szName;
        js["why"] = left.szWhy;
        reply.jsAnswer["left_over"].append(js);
    }
    const bool blAny = std::any_of(rules.begin(), rules.end(), [](const Rule& rule) { return rule.blEnabled; });
    // Of no rules a save has nothing to say but that the router has none of ours.
    const std::string szBefore = reply.enExit == kOk && !blAny ? "" : reply.szMessage + "\n";
    reply.enExit = reply.enExit == kOk ? kRefused : reply.enExit;
    reply.szMessage = fmt::format(
        "{}the router's own pages, which are not in use any more, still forward {} and did not take that away: {}\n"
        "'sudo tavoportmap {}' tries again; or take it away there by hand, and then call\n"
        "'sudo /usr/tavo/bin/tavoportforward --forget'",
        szBefore, NamesOf(rgLeft), Clean(rgLeft.front().szWhy), IsOff() || !LoadRules() ? "off" : "save");
}

}  // namespace tavo::cli
